#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <span>
#include <string>

#include "GWError.h"
#include "GWExport.h"
#include "GWExtractOptions.h"
#include "GWFileDescriptor.h"
#include "GWURL.h"
#include "GWValue.h"
#include "GWZipFile.h"
#include "GWZipWorkOperation.h"

class GWZipArchive;
class GWRemoteFileHandle;
class GWSemaphore;
class GWReplacementFolder;
class GWDirectoryCache;
class GWRemoteFileHandlePool;
class GWStreamDecryptor;
class GWZipExtractOperation;
using GWZipExtractOperationPtr = std::shared_ptr<GWZipExtractOperation>;
using GWRemoteFileHandlePtr = std::shared_ptr<GWRemoteFileHandle>;

// Extracts one entry of a ZIP archive, either to a location on disk (a file,
// a directory or a symbolic link, with its Mac metadata and attributes) or,
// piece by piece, to a data handler. An asynchronous operation: it finishes
// when its pipeline has ended, which may be on another thread (MacBinary
// decoding runs on the global queue).
//
// Data is streamed: each decoded piece is written or handed on as it comes,
// so memory stays bounded whatever the entry's size (only a link's target
// text is collected).
class GW_EXPORT GWZipExtractOperation : public GWZipWorkOperation {
public:
    // (decoded piece or none, is the last call, error) -> go on? The last
    // call carries is-done; after a failure it carries no data and the error.
    using DataHandler = std::function<bool(std::optional<std::span<const std::uint8_t>> data,
                                           bool isDone, const GWErrorPtr& error)>;
    // The byte count of one decoded piece (a delta); false stops.
    using ProgressHandler = std::function<bool(std::uint64_t count)>;
    // Between the steps of the pipeline: (piece, is-done, error out) -> go on?
    using ChunkHandler =
        std::function<bool(std::span<const std::uint8_t> data, bool isDone, GWErrorPtr* error)>;
    using Completion = std::function<void(const GWErrorPtr& error)>;

    // Destination mode: every decoded piece is also reported to the progress
    // handler. Fails (Cocoa 512) without an entry or an archive.
    static GWZipExtractOperationPtr initForExtractingFile(
        const GWZipFilePtr& file, const std::shared_ptr<GWZipArchive>& archive, const GWURL& toURL,
        bool atomically, ProgressHandler progressHandler, GWErrorPtr* error);
    // Data-handler mode.
    static GWZipExtractOperationPtr initForExtractingFile(
        const GWZipFilePtr& file, const std::shared_ptr<GWZipArchive>& archive,
        DataHandler dataHandler, GWErrorPtr* error);
    // The same with the archive's location and the offset of its ZIP data
    // given directly.
    static GWZipExtractOperationPtr initForExtractingFile(
        const GWZipFilePtr& file, const GWURL& archiveURL, std::uint64_t startOffset,
        const GWURL& toURL, bool atomically, ProgressHandler progressHandler, GWErrorPtr* error);
    static GWZipExtractOperationPtr initForExtractingFile(const GWZipFilePtr& file,
                                                          const GWURL& archiveURL,
                                                          std::uint64_t startOffset,
                                                          DataHandler dataHandler,
                                                          GWErrorPtr* error);

    const GWZipFilePtr& file() const { return file_; }
    const GWURL& srcURL() const { return srcURL_; }
    // None in data-handler mode.
    const std::optional<GWURL>& destURL() const { return destURL_; }
    const DataHandler& dataHandler() const { return dataHandler_; }
    bool isAtomic() const { return isAtomic_; }
    // Added to every local header offset.
    std::uint64_t startOffset() const { return startOffset_; }
    // The directory nothing may be written beneath except through plain
    // names and real directories; by default the destination's own directory.
    const std::optional<GWURL>& containmentRoot() const { return containmentRoot_; }
    void setContainmentRoot(const GWURL& root) { containmentRoot_ = root; }
    // Where an atomic extraction builds its item; one is made for the
    // operation when none is given, and a batch gives all its operations one.
    void setReplacementFolder(std::shared_ptr<GWReplacementFolder> folder) {
        replacementFolder_ = std::move(folder);
    }
    // Whether an item already at the destination may be replaced; none: only
    // when writing in place. An existing directory is merged into either way.
    void setReplacesExistingItems(std::optional<bool> replaces) { replacesExisting_ = replaces; }
    bool replacesExistingItems() const { return replacesExisting_.value_or(!isAtomic_); }
    // What opens encrypted entries; without one they fail with
    // GWZipArchivePasswordRequiredError. Set before the operation starts.
    void setPassword(std::optional<std::string> password) { password_ = std::move(password); }
    // A batch applies directory metadata itself once their contents are written.
    void setDefersDirectoryInfo(bool defers) { defersDirectoryInfo_ = defers; }
    // What the operations of a batch share so that an entry costs a few system
    // calls: open handles on the archive, and the directories walked to below
    // the containment root. Without them each operation opens and walks its own.
    void setArchiveHandles(std::shared_ptr<GWRemoteFileHandlePool> handles) {
        archiveHandles_ = std::move(handles);
    }
    void setDirectoryCache(std::shared_ptr<GWDirectoryCache> directories) {
        directories_ = std::move(directories);
    }
    // What the archive may grant on disk (set-ID bits, attributes); shared
    // by a batch. None: the defaults, which grant nothing.
    void setExtractOptions(std::shared_ptr<const GWExtractOptions> options) {
        options_ = std::move(options);
    }
    const GWExtractOptions& extractOptions() const;

    // Why `file` may not be extracted at `destination` below `root`, or none:
    // the destination leaves `root` by name, an item between the two is a
    // symbolic link (or no directory), or an entry of the archive between
    // them is a link, which would be written through once it exists. The
    // error is GWZipArchiveEntryOutsideDestinationError naming the entry.
    // `onDisk` false leaves out the look at the items on disk, for a
    // destination whose directory was walked to without following links.
    static GWErrorPtr containmentErrorForFile(const GWZipFilePtr& file, const GWURL& root,
                                              const GWURL& destination, bool onDisk = true);
    // The error the operation ended with; none while running and on success.
    GWErrorPtr error() const;
    bool started() const { return started_.load(); }
    bool done() const { return done_.load(); }

    bool isAsynchronous() const override { return true; }
    // Runs main() on the calling thread; a cancelled operation finishes there.
    void start() override;
    void main() override;

    // --- The pipeline, outermost first --------------------------------------

    void unpackWithHandler(ChunkHandler handler, Completion completion);
    // Writes the entry at `target` (none: only the handler sees the data)
    // and applies the Mac companion that belongs to it.
    void unpackFile(const GWZipFilePtr& file, const GWRemoteFileHandlePtr& handle,
                    const std::optional<GWURL>& target, ChunkHandler handler,
                    Completion completion);
    // Streams the entry's decoded data to `handler` after its local header.
    void unpackFile(const GWZipFilePtr& file, const GWRemoteFileHandlePtr& handle,
                    ChunkHandler handler, Completion completion);
    // Decodes [offset, offset + length) of the archive, or `data` when given,
    // decrypting it first when there is a decryptor.
    void extractFile(const GWZipFilePtr& file, std::uint64_t offset, std::uint64_t length,
                     const std::optional<GWData>& data, std::uint16_t compressionMethod,
                     const GWRemoteFileHandlePtr& handle, ChunkHandler handler,
                     Completion completion, std::unique_ptr<GWStreamDecryptor> decryptor = nullptr);
    // Takes sizes and checksum from a header without a data descriptor, and
    // the name and extra info the local header gives.
    bool loadExtraInfoFromLocalHeader(const GWZipLocalFileHeader& header, const GWZipFilePtr& file,
                                      const GWRemoteFileHandlePtr& handle, GWErrorPtr* error);
    // Relative targets stay relative.
    bool createSymbolicLinkAtURL(const GWURL& url, const std::string& destinationPath,
                                 GWErrorPtr* error);

    // --- Mac metadata --------------------------------------------------------

    // Dates, Finder information, then owner, group and mode (a refused
    // ownership change is not a failure), then the comment.
    // With `fd`, through that descriptor of the item instead of its path.
    bool setInfoForFile(const GWZipFilePtr& file, const GWURL& url, GWErrorPtr* error, int fd = -1);
    // The directory at `url` below `root`, reached without following links.
    bool setInfoForDirectory(const GWZipFilePtr& file, const GWURL& root, const GWURL& url,
                             GWErrorPtr* error);
    void writeResourceForkForFile(const GWZipFilePtr& file, const GWRemoteFileHandlePtr& handle,
                                  const GWURL& url, Completion completion);
    void applyAppleDoubleMetadataForFile(const GWZipFilePtr& file,
                                         const GWRemoteFileHandlePtr& handle, const GWURL& url,
                                         Completion completion);
    // Replaces the MacBinary file at `url` by its decoded data fork with its
    // forks and Finder information; runs on the global queue.
    void decodeMacBinaryFileAtURL(const GWURL& url, Completion completion);

    // Serialises the preparation of destinations across the whole process.
    static GWSemaphore& creationSemaphore();

    // Temporary names are this, ".temp." and a unique string.
    static constexpr const char* kBundleIdentifier = "org.gwarchive.GWArchiveSupport";

private:
    GWZipExtractOperation() = default;
    static GWZipExtractOperationPtr make(const GWZipFilePtr& file, const GWURL& archiveURL,
                                         std::uint64_t startOffset, GWErrorPtr* error);

    // Where the data is written: the destination or a fresh place in the
    // replacement folder, left open in targetFile_ for a regular file. Holds
    // the creation semaphore meanwhile unless the destination's directory is
    // known and nothing there is to be replaced.
    std::optional<GWURL> prepareTarget(bool isDirectory, bool isSymbolicLink, GWErrorPtr* error);
    // The directory that will hold the destination, `parentRelative` below `root`.
    std::shared_ptr<const GWFileDescriptor> openParent(const GWURL& root,
                                                       const std::string& parentRelative,
                                                       GWErrorPtr* error);
    // Moves a finished item from the replacement folder to the destination.
    bool moveIntoPlace(const GWURL& built, GWErrorPtr* error);
    GWURL containmentRootOrParent() const;
    void setError(GWErrorPtr error);
    void markDone();

    GWZipFilePtr file_;
    GWURL srcURL_;
    std::optional<GWURL> destURL_;
    DataHandler dataHandler_;
    bool isAtomic_ = false;
    std::uint64_t startOffset_ = 0;
    std::optional<GWURL> containmentRoot_;
    std::shared_ptr<GWReplacementFolder> replacementFolder_;
    std::optional<bool> replacesExisting_;
    bool defersDirectoryInfo_ = false;
    std::shared_ptr<GWRemoteFileHandlePool> archiveHandles_;
    std::shared_ptr<GWDirectoryCache> directories_;
    // The regular file being written, open from its creation until the
    // operation ends, so that it is opened once and its metadata is set
    // through it.
    GWFileDescriptor targetFile_;
    std::shared_ptr<const GWExtractOptions> options_;
    std::optional<std::string> password_;

    mutable std::mutex errorMutex_;
    GWErrorPtr error_;
    std::atomic<bool> started_{false};
    std::atomic<bool> done_{false};
};

// A temporary location beside `target`, named after the library's bundle
// identifier: inside the extraction's replacement folder when it has one, and
// on the destination's file system in any case, never loose in $TMPDIR.
GW_EXPORT GWURL GWZipExtractTemporaryURL(const GWURL& target);
