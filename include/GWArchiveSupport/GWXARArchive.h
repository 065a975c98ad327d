#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <span>
#include <string>
#include <unordered_map>
#include <vector>

#include "GWCoder.h"
#include "GWError.h"
#include "GWExport.h"
#include "GWExtractOptions.h"
#include "GWOperationQueue.h"
#include "GWRef.h"
#include "GWURL.h"
#include "GWXARFile.h"
#include "GWXARLoadOperation.h"
#include "GWXARSignature.h"

class GWXARArchive;
struct GWXARStreamContext;
class GWXARExtractOperation;
using GWXARArchivePtr = std::shared_ptr<GWXARArchive>;

// A XAR archive: its entry tree, subdocuments and the verdicts on its table
// of contents' checksum and signatures. Filled once by one of the two
// initialisers; reading the archive's file again is left to extraction.
//
// The properties are atomic: a reader on another thread sees the old or the
// new value whole. Getters therefore hand out copies.
class GW_EXPORT GWXARArchive : public GWCoding, public std::enable_shared_from_this<GWXARArchive> {
public:
    static constexpr const char* kClassName = "GWXARArchive";

    // (signature is invalid, error): error is none when the archive loaded.
    using CompletionHandler = std::function<void(bool signatureIsInvalid, const GWErrorPtr& error)>;

    // --- Opening (GWXARArchive.cpp) -------------------------------------------

    // True when the file begins with the XAR magic; no error is reported.
    static bool isXARArchiveAtURL(const GWURL& url);
    // An empty archive with its own operation queue.
    static GWXARArchivePtr init();
    // Loads the archive on the calling thread. None, with the load's error,
    // when it fails; none without an error when the URL cannot be referenced.
    // With `failOnInvalidSignature`, a missing or wrong checksum and a
    // signature that does not verify fail the open; without, they only show
    // in checksumIsValid and signatureIsValid.
    static GWXARArchivePtr initWithURL(const GWURL& url, bool failOnInvalidSignature,
                                       GWErrorPtr* error);
    // The same with the trust anchors signing chains must reach (the
    // system's when none; see GWXARTrust).
    static GWXARArchivePtr initWithURL(const GWURL& url, bool failOnInvalidSignature,
                                       const GWXARTrustPtr& trust, GWErrorPtr* error);
    // Returns the archive at once and loads it on `loadingQueue` (the
    // archive's own queue when none); `loadOperation` receives the operation
    // for cancelling. The handler runs on the thread that finished the load,
    // after the archive was filled; read the archive only from then on. For a
    // URL that cannot be referenced, returns none and still calls the handler
    // (false, none) on the queue.
    static GWXARArchivePtr initWithURL(const GWURL& url, bool failOnInvalidSignature,
                                       const GWOperationQueuePtr& loadingQueue,
                                       GWXARLoadOperationPtr* loadOperation,
                                       CompletionHandler completionHandler,
                                       const GWXARTrustPtr& trust = nullptr);

    // Use init(): a plain archive has no operation queue (decoded ones start so).
    GWXARArchive() = default;
    GWXARArchive(const GWXARArchive&) = delete;
    GWXARArchive& operator=(const GWXARArchive&) = delete;

    // --- Properties (GWXARArchive.cpp) ----------------------------------------

    GWRefPtr ref() const;
    // The location the archive was opened from; empty without a reference.
    GWURL URL() const;

    // Top-level entries of the table of contents.
    GWXARFileArray files() const;
    void setFiles(GWXARFileArray files);
    GWXARSubdocuments subdocuments() const;
    void setSubdocuments(GWXARSubdocuments subdocuments);
    // The digest of the stored table of contents, as the load computed it.
    GWData tocChecksum() const;
    void setTOCChecksum(GWData checksum);
    bool checksumIsValid() const { return checksumIsValid_.load(); }
    void setChecksumIsValid(bool valid) { checksumIsValid_.store(valid); }
    GWErrorPtr checksumValidationError() const;
    void setChecksumValidationError(GWErrorPtr error);
    // The signatures the table of contents carries, verified or not.
    GWXARSignatureArray signatures() const;
    void setSignatures(GWXARSignatureArray signatures);
    bool privateSignatureIsValid() const { return privateSignatureIsValid_.load(); }
    void setPrivateSignatureIsValid(bool valid) { privateSignatureIsValid_.store(valid); }
    GWErrorPtr privateSignatureValidationError() const;
    void setPrivateSignatureValidationError(GWErrorPtr error);

    // A signature counts only over a table of contents whose checksum holds.
    bool signatureIsValid() const { return privateSignatureIsValid() && checksumIsValid(); }
    void setSignatureIsValid(bool valid) { setPrivateSignatureIsValid(valid); }
    // Valid only when every signature is valid and the checksum holds;
    // untrusted when all check out but a chain reaches no anchor; none
    // without signatures. A signature's own verdict says which failed.
    GWXARSignatureVerdict signatureVerdict() const;
    // Why the verdict is not valid, in a few words; empty when it is.
    std::string signatureVerdictReason() const;

    // The signature's error, else the checksum's.
    GWErrorPtr signatureValidationError() const;
    void setSignatureValidationError(GWErrorPtr error) {
        setPrivateSignatureValidationError(std::move(error));
    }

    // Where asynchronous work runs unless a queue is given; none for an
    // archive made by decoding.
    GWOperationQueuePtr operationQueue() const;
    // Archive-wide cancellation of extraction.
    bool isCancelled() const { return isCancelled_.load(); }
    void setIsCancelled(bool cancelled) { isCancelled_.store(cancelled); }

    // --- Lookup (GWXARArchiveLookup.cpp) --------------------------------------

    // The entry at a "/"-separated path, or none.
    GWXARFilePtr fileWithPath(const std::string& path) const;
    // The entries at the paths, in order, leaving out any whose ancestor (or
    // itself) is already listed. Components that match nothing are skipped,
    // so "a/missing/b" finds a/b; only the last one must match.
    GWXARFileArray filesWithPaths(const std::vector<std::string>& paths) const;

    // Points every entry of the trees, at every level, at `archive`.
    static void setArchiveReferencesInFiles(const GWXARFileArray& files,
                                            const GWXARArchivePtr& archive);
    // Resolves each hard link to the entry anywhere in the trees that carries
    // its target's itemID; unknown targets are left unresolved.
    static void fixHardLinksInFiles(const GWXARFileArray& files);
    using IDDictionary = std::unordered_map<std::string, GWXARFilePtr>;
    // itemID -> entry, depth first, parents before children; a later entry
    // with the same itemID wins. Entries without an itemID are left out.
    static void populateIDDictionary(IDDictionary& dictionary, const GWXARFileArray& files);
    // An entry that is a hard link is not descended into.
    static void fixHardLinksInFiles(const GWXARFileArray& files, const IDDictionary& dictionary);

    // --- Text, persistence and copying (GWXARArchiveCoding.cpp) ---------------

    // "<GWXARArchive 0x... files={" and each top-level entry indented, then "}>".
    std::string description() const;

    std::string className() const override { return kClassName; }
    // Writes nothing to a non-keyed coder.
    void encodeWithCoder(GWCoder& coder) const override;
    // None from a non-keyed coder. The archive has no operation queue; its
    // entries point at it and its hard links are resolved again.
    static GWXARArchivePtr initWithCoder(GWCoder& coder);
    // A deep copy with a fresh operation queue, whose entries point at the
    // copy and resolve hard links within the copied tree.
    GWXARArchivePtr copy() const;

    // --- Extraction (GWXARArchiveExtraction.cpp) ------------------------------
    //
    // Stored streams reach a data handler piece by piece, decoded and checked
    // against their stored digests; the handler runs on the reading thread,
    // whatever `queue` says. Items are extracted to disk by a
    // GWXARExtractOperation.

    using ExtractionCompletionHandler =
        std::function<void(bool checksumIsInvalid, const GWErrorPtr& error)>;

    // The item's data fork; a symbolic link yields its link text, and a hard
    // link the data of the item it ends at.
    void extractDataForkOfFile(const GWXARFilePtr& file, const GWOperationQueuePtr& queue,
                               const GWXARDataHandler& handler);
    // The first extended attribute called `name`; code 4 when there is none.
    void extractExtendedAttribute(const std::string& name, const GWXARFilePtr& file,
                                  const GWOperationQueuePtr& queue,
                                  const GWXARDataHandler& handler);
    // One stored stream of `file`. A missing reference stands for the data
    // fork of the item the file resolves to; none at all is an empty stream.
    // Returns after the handler's last call. A stream that finds the archive
    // cancelled by another extraction stops without a last call.
    void extractDataReference(const GWXARDataReferencePtr& reference, const GWXARFilePtr& file,
                              const GWOperationQueuePtr& queue, const GWXARDataHandler& handler);
    // The same for one extraction: it stops when `isCancelled` says so, and a
    // refusal or a damaged stream ends this stream alone, leaving the
    // archive's cancellation and every other stream alone. A reference given
    // is read as the file's own, whatever kind of item the file is.
    void extractDataReference(const GWXARDataReferencePtr& reference, const GWXARFilePtr& file,
                              const GWXARDataHandler& handler, std::function<bool()> isCancelled);
    // The single place a data handler is called: a refusal cancels the
    // archive and earns one last call with the user-cancelled error.
    void invokeDataHandler(const GWXARDataHandler& handler, const GWOperationQueuePtr& queue,
                           std::optional<std::span<const std::uint8_t>> data, bool isDone,
                           bool checksumFailed, const GWErrorPtr& error);

    // Extracts `file` (and its subtree) to `url` on the calling thread. True
    // when the item is there; `checksumIsInvalid` then says whether a digest
    // failed or metadata could not be applied.
    // `options` as GWXARExtractOperation::setOptions takes them.
    bool extractFile(const GWXARFilePtr& file, const GWURL& url, bool* checksumIsInvalid,
                     GWErrorPtr* error, const GWExtractOptions& options = {});
    // The same on `queue` (the archive's own when none); `operation` receives
    // the operation for cancelling before it is queued.
    void extractFile(const GWXARFilePtr& file, const GWURL& url, const GWOperationQueuePtr& queue,
                     std::shared_ptr<GWXARExtractOperation>* operation,
                     ExtractionCompletionHandler completionHandler,
                     const GWExtractOptions& options = {});

private:
    // Without `resolveItem` the stream is read as `file`'s own, as the
    // attributes of a folder or a link must be when they are extracted.
    void streamDataReference(const GWXARDataReferencePtr& reference, const GWXARFilePtr& file,
                             const GWXARDataHandler& handler, GWXARStreamContext context,
                             bool resolveItem);
    // Copies a finished load's results in.
    void takeResultsOfLoad(const GWXARLoadOperation& operation);

    mutable std::mutex mutex_;
    GWRefPtr ref_;
    GWXARFileArray files_;
    GWXARSubdocuments subdocuments_;
    GWData tocChecksum_;
    std::atomic<bool> checksumIsValid_{false};
    GWErrorPtr checksumValidationError_;
    GWXARSignatureArray signatures_;
    std::atomic<bool> privateSignatureIsValid_{false};
    GWErrorPtr privateSignatureValidationError_;
    GWOperationQueuePtr operationQueue_;
    std::atomic<bool> isCancelled_{false};
};
