#pragma once

#include <atomic>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <span>
#include <utility>
#include <vector>

#include "GWError.h"
#include "GWExport.h"
#include "GWExtractOptions.h"
#include "GWFileDescriptor.h"
#include "GWOperation.h"
#include "GWURL.h"
#include "GWXARFile.h"

class GWXARArchive;
class GWXARExtractOperation;
using GWXARExtractOperationPtr = std::shared_ptr<GWXARExtractOperation>;

// Recreates one archive item, and for a directory its whole subtree, on disk
// with its metadata. The item is built in a private directory on the
// destination's file system and moved into place once the walk is over, never
// over an existing item. An entry that cannot be created is left out while
// the rest is extracted, and the first such failure in tree order is the
// result; a cancelled extraction leaves nothing at the destination.
//
// Data comes through the archive's streaming read path; this operation only
// creates file-system objects and writes bytes. Results are published in
// error() and checksumIsInvalid() before the operation finishes.
class GW_EXPORT GWXARExtractOperation : public GWOperation {
public:
    static GWXARExtractOperationPtr initWithFile(GWXARFilePtr file, GWURL destinationURL,
                                                 const std::shared_ptr<GWXARArchive>& archive);

    const GWXARFilePtr& file() const { return file_; }
    const GWURL& destURL() const { return destURL_; }
    std::shared_ptr<GWXARArchive> archive() const { return archive_.lock(); }
    // None on success.
    GWErrorPtr error() const;
    // Set when a stream's digests did not match, and also when metadata could
    // not be applied: the item is there, but not exactly as archived.
    bool checksumIsInvalid() const { return checksumIsInvalid_.load(); }

    // With replaceExisting, an item at the destination that is not a
    // directory gives way to the extracted one; a directory never does.
    // entryFailed hears of every entry left out, in tree order, once the
    // walk is over, each error naming where the entry was to appear. Entries
    // always go on after one fails: only cancelling the operation stops them.
    void setOptions(GWExtractOptions options) { options_ = std::move(options); }

    void main() override;

    // The private-directory wrapper around extractFile.
    bool performExtractionOperationWithFile(const GWXARFilePtr& file, const GWURL& destinationURL,
                                            GWErrorPtr* error);
    // Creates one item by its type, then applies its metadata.
    bool extractFile(const GWXARFilePtr& file, const GWURL& url, GWErrorPtr* error);

    // --- One per kind (GWXARExtractItems.cpp) ---------------------------------
    bool extractRegularFile(const GWXARFilePtr& file, const GWURL& url, GWErrorPtr* error);
    bool extractDirectory(const GWXARFilePtr& file, const GWURL& url, GWErrorPtr* error);
    bool extractSymbolicLink(const GWXARFilePtr& file, const GWURL& url, GWErrorPtr* error);
    bool extractHardLink(const GWXARFilePtr& file, const GWURL& url, GWErrorPtr* error);
    bool extractDevice(const GWXARFilePtr& file, const GWURL& url, GWErrorPtr* error);
    bool extractFIFO(const GWXARFilePtr& file, const GWURL& url, GWErrorPtr* error);

    // A hard link waiting for the rest of its directory.
    struct DeferredHardLink {
        GWXARFilePtr file;
        GWURL url;
        std::size_t order = 0;
    };
    // Extracts the children in order; hard links are only recorded, to be
    // made once everything else in the directory exists.
    bool extractChildrenOfDirectory(const GWXARFilePtr& directory, const GWURL& url,
                                    std::vector<DeferredHardLink>& hardLinks, GWErrorPtr* error);
    // Streams the data fork into an open file.
    bool writeDataForkOfFile(const GWXARFilePtr& file, int fd, const GWURL& url, GWErrorPtr* error);

    // --- Metadata (GWXARExtractMetadata.cpp) ----------------------------------
    // Dates, extended attributes, owner, group, mode, ACL, then BSD flags.
    bool applyMetadataToFile(const GWXARFilePtr& file, const GWURL& url, GWErrorPtr* error);
    // With `fd`, an open directory, attributes are set through it.
    bool applyExtendedAttributesForFile(const GWXARFilePtr& file, const GWURL& url,
                                        GWErrorPtr* error, int fd = -1);
    // Writes a piece of the resource fork at `position` and advances it;
    // a fork may not pass 4 GiB.
    bool appendDataToResourceFork(std::span<const std::uint8_t> data, const GWURL& url,
                                  std::uint32_t& position, GWErrorPtr* error, int fd = -1);

    GWErrorPtr cancelledError() const;

    // --- Workers (GWXARExtractWorkers.cpp) -----------------------------------
    // The regular files of a directory are written by workers, twice the
    // processor count of them, while the tree is walked; directories get
    // their metadata once everything below them is written. `order` is the
    // entry's place in the walk.
    void extractFileOnWorker(const GWXARFilePtr& file, const GWURL& url, std::size_t order);
    void finishWorkers();
    // A metadata failure leaves the item in place: logged, and reported
    // through checksumIsInvalid().
    void applyMetadataOrNote(const GWXARFilePtr& file, const GWURL& url);

    // Whole attributes other than the resource fork are gathered in memory
    // before they are set; one larger than this is refused (E2BIG).
    static constexpr std::size_t kMaxBufferedAttributeSize = 16 * 1024 * 1024;

private:
    GWXARExtractOperation(GWXARFilePtr file, GWURL destinationURL,
                          const std::shared_ptr<GWXARArchive>& archive);

    void setError(GWErrorPtr error);
    // extractFile for one entry of the walk: a failure removes what was made
    // for the entry and is recorded under `order`, and the walk goes on.
    bool extractEntry(const GWXARFilePtr& file, const GWURL& url, std::size_t order);
    void recordFailure(std::size_t order, const GWXARFilePtr& file, const GWURL& url,
                       GWErrorPtr error);
    bool moveIntoPlace(const std::string& item, const std::string& destination, bool isDirectory,
                       GWErrorPtr* error);
    // Where `url` in the private directory is to appear.
    GWURL finalURL(const GWURL& url) const;
    void markChecksumInvalid() { checksumIsInvalid_.store(true); }
    // Where a child of the directory at `directory` goes; refuses names that
    // would leave the directory.
    std::optional<GWURL> childURL(const GWURL& directory, const GWXARFile& child,
                                  GWErrorPtr* error) const;
    // The existing regular file a hard link at `linkURL` may share, found by
    // the link's relative archive path; none when it is missing or lies
    // outside the item being extracted. A path that stays inside by name but
    // leads elsewhere through a symbolic link also fills `refusal`.
    std::optional<std::string> hardLinkTargetPath(const GWXARFile& link, const GWURL& linkURL,
                                                  GWErrorPtr* refusal) const;
    // BSD flags as Linux inode flags; those that would pin the item where it
    // is are held back for the top-level item until it has been moved.
    void applyFlags(const GWXARFile& file, const GWURL& url, int fd = -1);
    // A directory of the item being built, opened by a walk from the private
    // folder that no symbolic link can lead elsewhere.
    GWFileDescriptor openBuiltDirectory(const GWURL& url, GWErrorPtr* error) const;

    GWXARFilePtr file_;
    GWURL destURL_;
    std::weak_ptr<GWXARArchive> archive_;
    mutable std::mutex errorMutex_;
    GWErrorPtr error_;
    std::atomic<bool> checksumIsInvalid_{false};
    std::atomic<bool> ran_{false};
    // The top-level item in the private directory, and whether its flags
    // wait for the move.
    std::optional<GWURL> temporaryItemURL_;
    bool deferTopLevelFlags_ = false;
    GWExtractOptions options_;

    struct Workers;
    std::shared_ptr<Workers> workers_;
    // While the private-directory wrapper walks the item's tree.
    bool walking_ = false;
    std::size_t nextOrder_ = 0;
    struct EntryFailure {
        GWXARFilePtr file;
        GWErrorPtr error;
    };
    mutable std::mutex failuresMutex_;
    std::map<std::size_t, EntryFailure> failures_;
    // Directories whose metadata waits for their files, deepest first.
    std::vector<std::pair<GWXARFilePtr, GWURL>> pendingDirectories_;
};
