#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "GWCoder.h"
#include "GWError.h"
#include "GWExport.h"
#include "GWOperationQueue.h"
#include "GWRef.h"
#include "GWURL.h"
#include "GWZipExtractOperation.h"
#include "GWZipFile.h"
#include "GWZipLoadOperation.h"

class GWZipArchive;
using GWZipArchivePtr = std::shared_ptr<GWZipArchive>;

// One ZIP file: opened synchronously or asynchronously by a
// GWZipLoadOperation, it holds the tree of entries, answers path lookups and
// can be archived and copied.
class GW_EXPORT GWZipArchive : public GWCoding, public std::enable_shared_from_this<GWZipArchive> {
public:
    static constexpr const char* kClassName = "GWZipArchive";

    // Called with the error, or with none once `files` is set.
    using CompletionHandler = std::function<void(const GWErrorPtr& error)>;

    // --- Recognising archives -----------------------------------------------------

    static bool isZipArchiveAtURL(const GWURL& url);
    static bool isSelfExtractingZipArchiveAtURL(const GWURL& url);

    // --- Opening ------------------------------------------------------------------

    // The common first step: an archive that has loaded nothing yet, and the
    // operation that would load it. None, with GWFileReadUnsupportedSchemeError,
    // for a URL that cannot be referenced.
    static GWZipArchivePtr initWithURL(const GWURL& url, GWZipLoadOperationPtr* loadOperation,
                                       GWErrorPtr* error);
    // Loads on the calling thread; none with the load's error, or
    // GWUserCancelledError when the load was cancelled.
    static GWZipArchivePtr initWithURL(const GWURL& url, GWErrorPtr* error);
    // The same, reading names without the UTF-8 flag in the encoding iconv
    // calls `filenameEncoding` (empty: guessed from the host system).
    static GWZipArchivePtr initWithURL(const GWURL& url, const std::string& filenameEncoding,
                                       GWErrorPtr* error);
    // Returns at once with an archive whose `files` stay empty until the
    // handler runs. The load runs on `loadingQueue` (a new queue when none is
    // given), the operation is handed back for cancelling, and the handler
    // always runs on the loading queue.
    static GWZipArchivePtr initWithURL(const GWURL& url, const GWOperationQueuePtr& loadingQueue,
                                       GWZipLoadOperationPtr* loadOperation,
                                       CompletionHandler completionHandler);

    GWZipArchive(const GWZipArchive&) = delete;
    GWZipArchive& operator=(const GWZipArchive&) = delete;

    // --- Properties -----------------------------------------------------------------

    const GWRefPtr& ref() const { return ref_; }
    GWURL URL() const;
    // The roots; empty until loading has succeeded. Safe to read while the
    // loading queue sets them.
    GWZipFileArray files() const;
    void setFiles(GWZipFileArray files);
    // Where the ZIP data begins in the file; every offset is relative to it.
    std::uint64_t startOffset() const { return startOffset_; }
    void setStartOffset(std::uint64_t offset) { startOffset_ = offset; }
    // How many entries were recovered from local headers because the end
    // record or the central directory could not be read; 0 for a whole archive.
    std::uint64_t recoveredEntryCount() const { return recoveredEntryCount_; }
    // What opens encrypted entries for every extraction and stream from this
    // archive, unless a batch's options give another. Set it before
    // extracting; it is neither archived nor copied.
    const std::optional<std::string>& password() const { return password_; }
    void setPassword(std::optional<std::string> password) { password_ = std::move(password); }
    // Never set by loading, so 0; neither archived nor copied.
    std::uint64_t compressedSize() const { return compressedSize_; }
    void setCompressedSize(std::uint64_t size) { compressedSize_ = size; }

    // --- Lookup ---------------------------------------------------------------------

    // The nodes the paths name, in the order of the paths; paths that name
    // nothing are left out. Components are matched one after another from the
    // roots; one that matches nothing is passed over ("x/a/b" finds "a/b"
    // when there is no root "x"). A leading "/" is a component of its own;
    // "." and ".." are names like any other.
    GWZipFileArray filesWithPaths(const std::vector<std::string>& paths) const;
    GWZipFilePtr fileWithPath(const std::string& path) const;

    // --- Persistence and copying ----------------------------------------------------

    std::string className() const override { return kClassName; }
    // Writes nothing to a non-keyed coder.
    void encodeWithCoder(GWCoder& coder) const override;
    static GWZipArchivePtr initWithCoder(GWCoder& coder);
    // A copy of `ref`, the same `startOffset` and deep copies of the roots.
    GWZipArchivePtr copy() const;

private:
    GWZipArchive() = default;
    static GWZipArchivePtr make();

    GWZipFilePtr fileWithPathComponents(const std::vector<std::string>& components) const;

    GWRefPtr ref_;
    std::uint64_t startOffset_ = 0;
    std::uint64_t recoveredEntryCount_ = 0;
    std::uint64_t compressedSize_ = 0;
    std::optional<std::string> password_;

    // `files` is set from the loading queue while callers read it.
    mutable std::mutex filesMutex_;
    GWZipFileArray files_;
    // Name -> first root of that name, built on the first lookup.
    mutable std::unordered_map<std::string, std::size_t> rootIndex_;
    mutable bool rootIndexValid_ = false;

    // --- Extraction (zip/GWZipArchiveExtraction.cpp) ----------------------------------
    //
    // Every entry is extracted by its own GWZipExtractOperation, at its full
    // archive path below the directory; a directory brings its whole subtree,
    // its children starting only after it finished. The progress handler
    // (byte count of each decoded piece; false stops) is shared by the whole
    // batch and may be called from several threads at once.
public:
    using ProgressHandler = GWZipExtractOperation::ProgressHandler;
    using DataHandler = GWZipExtractOperation::DataHandler;

    // Synchronous: waits for the batch and reports its first error. Must not
    // be called from a thread the extraction queue needs.
    bool extractFile(const GWZipFilePtr& file, const GWURL& directory, bool atomically,
                     ProgressHandler progressHandler, GWErrorPtr* error);
    bool extractFiles(const GWZipFileArray& files, const GWURL& directory, bool atomically,
                      ProgressHandler progressHandler, GWErrorPtr* error,
                      const GWExtractOptions& options = {});
    // On `queue` (none: a new queue twice as wide as the processor count).
    // Unless the options say to go on, the first error cancels the rest of
    // the batch; the completion handler runs on the queue with the first
    // error, or with none, whatever happened. An atomic batch builds its
    // files in one replacement folder, removed when the batch ends; the
    // metadata of directories is applied last, deepest first, through
    // descriptors that no link can redirect.
    void extractFile(const GWZipFilePtr& file, const GWURL& directory, bool atomically,
                     const GWOperationQueuePtr& queue, ProgressHandler progressHandler,
                     CompletionHandler completionHandler);
    void extractFiles(const GWZipFileArray& files, const GWURL& directory, bool atomically,
                      const GWOperationQueuePtr& queue, ProgressHandler progressHandler,
                      CompletionHandler completionHandler, const GWExtractOptions& options = {});
    // The operations of a batch, each entry's directory operation before
    // its descendants, which depend on it.
    std::optional<std::vector<GWZipExtractOperationPtr>> operationsToExtractFiles(
        const GWZipFileArray& files, const GWURL& directory, bool atomically,
        ProgressHandler progressHandler, GWErrorPtr* error, const GWExtractOptions& options = {});
    // `destination` is the entry's own location, not its parent directory.
    std::optional<std::vector<GWZipExtractOperationPtr>> operationsToExtractFile(
        const GWZipFilePtr& file, const GWURL& destination, bool atomically,
        ProgressHandler progressHandler, GWErrorPtr* error, const GWExtractOptions& options = {});
    // Streams the entry's data fork to the handler from an operation on
    // `queue` (none: a new queue).
    void extractDataForkOfFile(const GWZipFilePtr& file, const GWOperationQueuePtr& queue,
                               DataHandler handler);
};
