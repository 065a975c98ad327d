#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <utility>
#include <vector>

#include "GWError.h"
#include "GWExport.h"
#include "GWOperation.h"
#include "GWXARDataReference.h"
#include "GWXARFile.h"
#include "GWXARSignature.h"
#include "GWXARTrust.h"

class GWRemoteFileHandle;
namespace pugi {
class xml_attribute;
class xml_document;
class xml_node;
}  // namespace pugi

class GWXARArchive;
class GWXARLoadOperation;
using GWXARLoadOperationPtr = std::shared_ptr<GWXARLoadOperation>;

// Documents embedded in a table of contents ("subdoc" elements), by name.
using GWXARSubdocuments = std::map<std::string, std::shared_ptr<pugi::xml_document>>;

// Loads a XAR archive: reads the header, inflates and checks the table of
// contents, and turns its "file" elements into GWXARFile trees with their
// data forks and extended attributes. Runs once, synchronously through
// start() or on a queue; the archive copies the results out afterwards.
//
// Every fallible call returns none or false and fills `error`. A few failures
// leave no error object on purpose (an empty "id", a date that does not
// parse); the load reports those as a general read error.
class GW_EXPORT GWXARLoadOperation : public GWOperation {
public:
    // Options to parse a table of contents with: an element whose only
    // content is white space keeps it as its text (a name of " " is a name).
    // (The XML parser's parse_default | parse_ws_pcdata_single, spelled out so
    // that this header does not need the parser's.)
    static constexpr unsigned int kTOCParseOptions = 0x0474;
    // "file" elements nest at most this deep; deeper ones are a corrupt file.
    // Real trees are far shallower, and the limit bounds the recursion.
    static constexpr std::size_t kMaxFileNestingDepth = 256;

    static GWXARLoadOperationPtr initWithArchive(const std::shared_ptr<GWXARArchive>& archive,
                                                 bool failOnInvalidSignature);

    const std::shared_ptr<GWXARArchive>& archive() const { return archive_; }
    bool failOnInvalidSignature() const { return failOnInvalidSignature_; }
    // The anchors signing chains must reach; the system's when none is set.
    const GWXARTrustPtr& trust() const { return trust_; }
    void setTrust(GWXARTrustPtr trust) { trust_ = std::move(trust); }
    // The archive's location, named by the errors of the load.
    const std::optional<GWURL>& archiveURL() const { return archiveURL_; }
    void setArchiveURL(std::optional<GWURL> url) { archiveURL_ = std::move(url); }
    // Open while the load runs; checksums stored in the heap are read through it.
    const std::shared_ptr<GWRemoteFileHandle>& fileHandle() const { return fileHandle_; }
    void setFileHandle(std::shared_ptr<GWRemoteFileHandle> handle) {
        fileHandle_ = std::move(handle);
    }
    // Where the heap begins: every offset in the table of contents counts from here.
    std::uint64_t heapStart() const { return heapStart_; }
    void setHeapStart(std::uint64_t heapStart) { heapStart_ = heapStart; }

    // --- Opening (GWXARLoadOperationHeader.cpp) --------------------------------

    // Largest table of contents accepted, stored or inflated, whatever the
    // header claims. Installer packages hold a few megabytes; 64 MiB is some
    // 90,000 fully described files.
    static constexpr std::uint64_t kMaxTOCLength = 64ull * 1024 * 1024;
    // What the parsed table of contents may cost besides its text: the XML
    // tree as allocated, plus a charge per entry, stored stream, path byte
    // and certificate. With the text this keeps a load below 512 MiB.
    static constexpr std::uint64_t kMaxTOCMemory = 384ull * 1024 * 1024;
    static constexpr std::uint64_t kEntryMemoryCharge = 1536;
    static constexpr std::uint64_t kReferenceMemoryCharge = 384;

    // Opens the archive's file, loads it, and leaves either files() or error() set.
    void main() override;
    // The top-level entries, with the validity flags and subdocuments set.
    std::optional<GWXARFileArray> readArchiveContents(bool failOnInvalidSignature,
                                                      GWErrorPtr* error);
    // Reads the header at the handle's position (the file's start). Each
    // output only when asked for; the checksum algorithm is a GWChecksum
    // number, -1 for header numbers that name none.
    bool getHeaderLength(std::uint64_t* headerLength, std::uint64_t* compressedTOCLength,
                         std::uint64_t* uncompressedTOCLength, int* checksumAlgorithm,
                         GWErrorPtr* error);
    // Reads the table of contents right after the header, inflates it and
    // parses it; `checksum` (when given) receives the digest of the stored bytes.
    std::shared_ptr<pugi::xml_document> readTOC(std::uint64_t compressedLength,
                                                std::uint64_t decompressedLength,
                                                int checksumAlgorithm, GWData* checksum,
                                                GWErrorPtr* error);
    // XAR header checksum number -> GWChecksum number: 0 none, 1 SHA-1, 2 MD5, else -1.
    static int checksumTypeFromXARTypeNumber(std::uint32_t number);

    // --- Table of contents (GWXARLoadOperationTOC.cpp) ------------------------

    // Checks the checksum, splits off subdocuments, checks signatures and
    // builds the entries. With `failOnInvalidSignature` a bad checksum or
    // signature ends the parse; without, they are only recorded.
    std::optional<GWXARFileArray> parseTOC(pugi::xml_document& document, int checksumAlgorithm,
                                           bool failOnInvalidSignature, GWErrorPtr* error);
    // True when the one "checksum" element names the header's algorithm and
    // its bytes in the heap equal the computed checksum (none is needed for
    // algorithm 0). Every failure is code 5 with the TOC element.
    bool verifyTOCChecksum(int algorithm, const pugi::xml_node& toc, GWErrorPtr* error);
    // Moves each "subdoc" child of the root into a document of its own. Never fails.
    bool extractSubdocumentsFromRoot(pugi::xml_node root, GWErrorPtr* error);

    // Results, read once the operation finished.
    const std::optional<GWXARFileArray>& files() const { return files_; }
    const GWXARSubdocuments& subdocuments() const { return subdocuments_; }
    bool checksumIsValid() const { return checksumIsValid_; }
    const GWErrorPtr& checksumError() const { return checksumError_; }
    // Never set: an archive learns that its checksum failed from checksumIsValid alone.
    GWErrorPtr checksumValidationError() const { return nullptr; }
    bool signatureIsValid() const { return signatureIsValid_; }
    const GWErrorPtr& signatureError() const { return signatureError_; }
    const GWErrorPtr& error() const { return error_; }
    // The digest of the stored table of contents, computed by readTOC.
    const GWData& computedTOCChecksum() const { return computedTOCChecksum_; }

    // Counts `bytes` against kMaxTOCMemory; past it, a corrupt-file error
    // naming the bound.
    bool chargeTOCMemory(std::uint64_t bytes, GWErrorPtr* error);
    std::uint64_t tocMemoryUsed() const { return tocMemoryUsed_; }

    // --- Entries (GWXARTOCEntryParser.cpp) ------------------------------------

    // The top-level entries, sorted by name, with hard links resolved. Entries
    // named "." (or without a usable name) at the top give their children to
    // the top level instead.
    std::optional<GWXARFileArray> filesFromTOCElement(const pugi::xml_node& toc, GWErrorPtr* error);
    // One entry and its subtree. Code -1 in the XAR domain means "skip it".
    GWXARFilePtr fileWithXMLElement(const pugi::xml_node& element, const GWXARFilePtr& parent,
                                    GWErrorPtr* error);
    // Keeps only the last component of a multi-component name; drops "." and
    // ".." below the top (code -1) and names them "." at the top.
    bool fileIsValid(GWXARFile& file, const pugi::xml_node& element, GWErrorPtr* error);
    bool applyAttribute(const pugi::xml_attribute& attribute, const GWXARFilePtr& file,
                        GWErrorPtr* error);
    bool applyProperty(const pugi::xml_node& property, const GWXARFilePtr& file, GWErrorPtr* error);
    // Replaces the file-type bits of the mode by those the type text names.
    bool setType(std::string_view type, GWXARFile& file, const pugi::xml_node& node,
                 GWErrorPtr* error);

    // --- Stored streams (GWXARTOCReferenceParser.cpp) -------------------------

    std::optional<GWXARDataReferenceArray> extendedAttributesFromElement(
        const pugi::xml_node& element, GWErrorPtr* error);
    GWXARDataReferencePtr fileReferenceFromElement(const pugi::xml_node& element,
                                                   GWErrorPtr* error);
    bool addACLsFromElement(const pugi::xml_node& element, GWXARFile& file, GWErrorPtr* error);
    // The GWChecksum number of a style name ("sha1", "md5", ...), -1 if unknown.
    static int checksumTypeFromName(std::string_view name);
    bool getCompressionType(std::uint64_t* compressionType, const pugi::xml_node& element,
                            GWErrorPtr* error);
    // Longest digest a checksum element may point at (SHA-512's).
    static constexpr std::uint64_t kMaxDigestLength = 64;
    // Longest signature read from the heap; CMS ones with their chains are a few KiB.
    static constexpr std::uint64_t kMaxSignatureLength = 16 * 1024;
    // The heap bytes at `offset` (from the heap's start), at most `size` of
    // them when the file ends first. Each distinct range is read and charged
    // once per load; repeats share it.
    std::shared_ptr<const GWData> heapBytes(std::uint64_t offset, std::uint64_t size,
                                            GWErrorPtr* error);
    // Inline hex, or (with "offset" and "size" children) bytes read from the
    // heap; more than kMaxDigestLength of them is a malformed size.
    std::optional<GWData> checksumFromElement(const pugi::xml_node& element, int* checksumType,
                                              GWErrorPtr* error);
    std::optional<GWData> decodeHexString(std::string_view text, const pugi::xml_node& node,
                                          GWErrorPtr* error);

    // --- Values (GWXARTOCValueParser.cpp) -------------------------------------

    bool getPOSIXFlags(std::uint32_t* flags, const pugi::xml_node& element, GWErrorPtr* error);
    bool parseDeviceProperty(const pugi::xml_node& element, std::uint64_t* major,
                             std::uint64_t* minor, GWErrorPtr* error);
    std::optional<GWDate> creationDateFromProperty(const pugi::xml_node& element,
                                                   GWErrorPtr* error);
    // "yyyy-MM-dd'T'HH:mm:ss" in UTC, one trailing "Z" allowed. None, without
    // an error, for anything else.
    std::optional<GWDate> dateFromTimeString(std::string_view text, GWErrorPtr* error);
    // The element's own text (not its descendants'), decoded when its
    // "enctype" is "base64".
    std::optional<std::string> textContentOfElement(const pugi::xml_node& element,
                                                    GWErrorPtr* error);

    // --- Signatures (GWXARLoadOperationSignatures.cpp) ------------------------

    // The digest of the stored table of contents, which every signature signs:
    // the bytes computedTOCChecksum() returns.
    const GWData& tocChecksum() const { return computedTOCChecksum_; }
    void setTOCChecksum(GWData checksum) { computedTOCChecksum_ = std::move(checksum); }
    // None until the signatures were loaded; empty for an unsigned archive.
    const std::optional<GWXARSignatureArray>& signatures() const { return signatures_; }

    // Loads the TOC's "signature" elements, then its "x-signature" elements,
    // with their bytes from the heap. On failure `signatures` keeps its value.
    bool loadSignaturesWithTOC(const pugi::xml_node& toc, GWErrorPtr* error);
    // The certificates of a "KeyInfo" element's "X509Data" children, in order.
    std::optional<GWCertificateArray> certificatesFromKeyInfo(const pugi::xml_node& keyInfo,
                                                              GWErrorPtr* error);
    // Loads the signatures and checks every one over `tocChecksum`, giving
    // each its verdict; true when all are valid, and when there are none.
    // Otherwise the error is that of the first signature with the worst
    // verdict. `checksumAlgorithm` is the header's GWChecksum number: with
    // none, a signed archive is false without an error object.
    bool verifySignaturesWithTOC(const pugi::xml_node& toc, int checksumAlgorithm,
                                 GWErrorPtr* error);
    // Whether the certificates (leaf first) lead to a trust anchor.
    bool canTrustSignature(const GWXARSignature& signature, GWErrorPtr* error);
    // Whether the signature checks out over `data` (CMS: over `tocChecksum`)
    // and, for CMS, every signer's chain reaches a trust anchor.
    bool validateData(const GWData& data, const GWXARSignature& signature, GWErrorPtr* error);

    // One signature's outcome and the error the load reports for it.
    struct SignatureCheck {
        GWXARSignatureVerdict verdict = GWXARSignatureVerdictInvalid;
        std::string reason;
        std::vector<std::string> chain;
        GWErrorPtr error;
    };
    SignatureCheck checkSignature(const GWXARSignature& signature);
    // RSA, DSA and ECDSA: `data` is the signed digest itself. Valid or invalid.
    SignatureCheck checkTypicalSignature(const GWData& data, const GWXARSignature& signature);
    // Every signer must sign `tocChecksum`, and its chain reach an anchor.
    SignatureCheck checkCMSSignature(const GWXARSignature& signature);

    // --- Errors (GWXARLoadOperation.cpp) --------------------------------------

    // An error for the archive's URL with the entity and the node (as its XML
    // text) in the details, each only when present.
    GWErrorPtr errorWithDomain(std::string_view domain, long code,
                               const std::optional<std::string>& unknownEntity,
                               const pugi::xml_node& node) const;
    GWErrorPtr errorWithCode(long code, const std::optional<std::string>& unknownEntity,
                             const pugi::xml_node& node) const;
    GWErrorPtr cancelledError() const;

private:
    GWXARFilePtr fileWithXMLElement(const pugi::xml_node& element, const GWXARFilePtr& parent,
                                    std::size_t depth, GWErrorPtr* error);
    bool applyTypeProperty(const pugi::xml_node& property, const std::string& text,
                           const GWXARFilePtr& file, GWErrorPtr* error);
    // Remembers that `file` is a hard link to the entry with `targetID`.
    void recordHardLink(const GWXARFilePtr& file, std::string targetID);
    bool resolveHardLinks(GWErrorPtr* error);

    // Trust of the certificates the table of contents lists for `signature`.
    GWXARTrustResult evaluateKeyInfo(const GWXARSignature& signature, GWErrorPtr* error);
    const GWXARTrust* effectiveTrust(GWErrorPtr* error);

    std::shared_ptr<GWXARArchive> archive_;
    bool failOnInvalidSignature_ = false;
    GWXARTrustPtr trust_;
    std::optional<GWURL> archiveURL_;
    std::shared_ptr<GWRemoteFileHandle> fileHandle_;
    std::uint64_t heapStart_ = 0;
    std::uint64_t tocMemoryUsed_ = 0;
    // Certificates already made, by their base64 text.
    std::unordered_map<std::string, GWCertificatePtr> certificatesByText_;
    // Trust already evaluated, by the certificates (shared through their text):
    // archives sign many times with one chain.
    std::map<std::vector<const GWCertificate*>, GWXARTrustResult> trustByChain_;
    // Heap bytes already read, by (offset, size): repeated references are free.
    std::map<std::pair<std::uint64_t, std::uint64_t>, std::shared_ptr<const GWData>> heapRanges_;
    std::optional<GWXARSignatureArray> signatures_;

    std::optional<GWXARFileArray> files_;
    GWXARSubdocuments subdocuments_;
    GWData computedTOCChecksum_;
    bool checksumIsValid_ = false;
    GWErrorPtr checksumError_;
    bool signatureIsValid_ = false;
    GWErrorPtr signatureError_;
    GWErrorPtr error_;

    // Item id -> entry, for hard links; dropped entries stay here and may be targets.
    std::unordered_map<std::string, GWXARFilePtr> identifiers_;
    // Hard links in the order they were met; a link recorded twice keeps its place.
    std::vector<std::pair<std::weak_ptr<GWXARFile>, std::string>> hardLinks_;
    std::unordered_map<const GWXARFile*, std::size_t> hardLinkIndex_;
};
