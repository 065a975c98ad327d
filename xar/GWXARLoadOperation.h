#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <utility>
#include <vector>

#include <pugixml.hpp>

#include "GWXARDataReference.h"
#include "GWXARFile.h"
#include "foundation/GWError.h"
#include "foundation/GWOperation.h"
#include "foundation/GWRemoteFileHandle.h"

class GWXARArchive;
class GWXARLoadOperation;
using GWXARLoadOperationPtr = std::shared_ptr<GWXARLoadOperation>;

// Loads a XAR archive's table of contents into entries. This part holds the
// entry parser: the table of contents' "file" elements become GWXARFile trees
// with their data forks and extended attributes, and the value parsers
// (text, numbers, hex, checksums, dates) serve the rest of the load.
//
// Every fallible call returns none or false and fills `error`. A few failures
// leave no error object on purpose (an empty "id", a date that does not
// parse); the load reports those as a general read error.
class GWXARLoadOperation : public GWOperation {
public:
    // Options to parse a table of contents with: an element whose only
    // content is white space keeps it as its text (a name of " " is a name).
    static constexpr unsigned int kTOCParseOptions =
        pugi::parse_default | pugi::parse_ws_pcdata_single;
    // "file" elements nest at most this deep; deeper ones are a corrupt file.
    // Real trees are far shallower, and the limit bounds the recursion.
    static constexpr std::size_t kMaxFileNestingDepth = 256;

    static GWXARLoadOperationPtr initWithArchive(const std::shared_ptr<GWXARArchive>& archive,
                                                 bool failOnInvalidSignature);

    const std::shared_ptr<GWXARArchive>& archive() const { return archive_; }
    bool failOnInvalidSignature() const { return failOnInvalidSignature_; }
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
    // Inline hex, or (with "offset" and "size" children) bytes read from the heap.
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

    std::shared_ptr<GWXARArchive> archive_;
    bool failOnInvalidSignature_ = false;
    std::optional<GWURL> archiveURL_;
    std::shared_ptr<GWRemoteFileHandle> fileHandle_;
    std::uint64_t heapStart_ = 0;

    // Item id -> entry, for hard links; dropped entries stay here and may be targets.
    std::unordered_map<std::string, GWXARFilePtr> identifiers_;
    // Hard links in the order they were met; a link recorded twice keeps its place.
    std::vector<std::pair<std::weak_ptr<GWXARFile>, std::string>> hardLinks_;
    std::unordered_map<const GWXARFile*, std::size_t> hardLinkIndex_;
};
