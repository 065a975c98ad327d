#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <optional>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "GWZipExtractDestination.h"
#include "GWZipExtractOperation.h"
#include "foundation/GWContainment.h"
#include "foundation/GWConversions.h"
#include "foundation/GWFileManager.h"
#include "foundation/GWFileSystem.h"
#include "foundation/GWMetadataStore.h"

namespace {

// The process-wide creation semaphore, held for one scope and released on
// every way out of it.
class CreationLock {
public:
    explicit CreationLock(GWSemaphore& semaphore) : semaphore_(semaphore) { semaphore_.wait(); }
    ~CreationLock() { semaphore_.signal(); }
    CreationLock(const CreationLock&) = delete;
    CreationLock& operator=(const CreationLock&) = delete;

private:
    GWSemaphore& semaphore_;
};

GWErrorPtr existsError(const GWURL& url) {
    return GWGenerateError(kGWPOSIXErrorDomain, EEXIST, url, nullptr, {}, "%s already exists",
                           url.path().c_str());
}

// Removes what is at `name` in `parent`, a directory with all it holds.
bool removeExisting(int parent, const std::string& name, bool isDirectory, const GWURL& url,
                    GWErrorPtr* error) {
    if (isDirectory) {
        return GWRemoveItemRecursively(url.path(), error);
    }
    return ::unlinkat(parent, name.c_str(), 0) == 0 || errno == ENOENT ||
           GWFail(error, GWPOSIXError(errno, url));
}

}  // namespace

GWURL GWZipExtractOperation::containmentRootOrParent() const {
    return containmentRoot_ ? *containmentRoot_ : destURL_->URLByDeletingLastPathComponent();
}

std::shared_ptr<const GWFileDescriptor> GWZipExtractOperation::openParent(
    const GWURL& root, const std::string& parentRelative, GWErrorPtr* error) {
    // The caller's own directory may be made; below it, only real directories
    // are walked, so no link the archive placed can lead the entry elsewhere.
    if (!GWItemExistsAtURL(root) && !GWCreateDirectoryAtURL(root, true, error)) {
        return nullptr;
    }
    if (directories_ && directories_->root() == root.path()) {
        return directories_->open(parentRelative, error);
    }
    GWFileDescriptor parent = GWOpenDirectoryBelow(root.path(), parentRelative, true, error);
    if (!parent.isValid()) {
        return nullptr;
    }
    return std::make_shared<const GWFileDescriptor>(std::move(parent));
}

std::optional<GWURL> GWZipExtractOperation::prepareTarget(bool isDirectory, bool isSymbolicLink,
                                                          GWErrorPtr* error) {
    const GWURL root = containmentRootOrParent();
    const std::string relative = GWRelativePathBelow(root, *destURL_).value_or("");
    const auto slash = relative.find_last_of('/');
    const std::string name = slash == std::string::npos ? relative : relative.substr(slash + 1);
    const std::string parentRelative = slash == std::string::npos ? "" : relative.substr(0, slash);
    // A new item that may replace nothing needs no look at what is there: its
    // creation (or the move into place) fails if anything is.
    const bool createsOnly = !isDirectory && !replacesExistingItems();
    std::shared_ptr<const GWFileDescriptor> parent;
    if (createsOnly && directories_ && directories_->root() == root.path()) {
        parent = directories_->find(parentRelative);
    }
    // Concurrent operations would otherwise race while making the same parent
    // directories or replacing the same item.
    std::optional<CreationLock> lock;
    if (parent) {
        if (auto refusal = containmentErrorForFile(file_, root, *destURL_, false)) {
            GWFail(error, std::move(refusal));
            return std::nullopt;
        }
    } else {
        lock.emplace(creationSemaphore());
        if (auto refusal = containmentErrorForFile(file_, root, *destURL_)) {
            GWFail(error, std::move(refusal));
            return std::nullopt;
        }
        if (!(parent = openParent(root, parentRelative, error))) {
            return std::nullopt;
        }
    }
    bool exists = false;
    bool existingIsDirectory = false;
    if (!createsOnly) {
        struct stat existing;
        exists = ::fstatat(parent->get(), name.c_str(), &existing, AT_SYMLINK_NOFOLLOW) == 0;
        existingIsDirectory = exists && S_ISDIR(existing.st_mode);
        if (isDirectory && existingIsDirectory) {
            return *destURL_;  // merged into: what the user has there stays
        }
        if (exists && !replacesExistingItems()) {
            GWFail(error, existsError(*destURL_));
            return std::nullopt;
        }
    }
    if (isDirectory || !isAtomic_) {
        if (exists) {
            if (existingIsDirectory && directories_) {
                directories_->forget();
            }
            if (!removeExisting(parent->get(), name, existingIsDirectory, *destURL_, error)) {
                return std::nullopt;
            }
        }
        int made = 0;
        if (isDirectory) {
            made = ::mkdirat(parent->get(), name.c_str(), 0777);
        } else if (!isSymbolicLink) {
            targetFile_.reset(::openat(parent->get(), name.c_str(),
                                       O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0666));
            made = targetFile_.isValid() ? 0 : -1;
        }
        if (made != 0 && !(isDirectory && errno == EEXIST)) {
            GWFail(error,
                   errno == EEXIST ? existsError(*destURL_) : GWPOSIXError(errno, *destURL_));
            return std::nullopt;
        }
        return *destURL_;
    }
    if (!replacementFolder_) {
        replacementFolder_ = GWReplacementFolder::createForDestination(destURL_->path(), error);
        if (!replacementFolder_) {
            return std::nullopt;
        }
    }
    const GWURL target = GWURL::fileURLWithPath(replacementFolder_->uniquePath());
    if (!isSymbolicLink) {
        targetFile_ = GWFileDescriptor::open(target.path().c_str(),
                                             O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW, 0666);
        if (!targetFile_.isValid()) {
            GWFail(error, GWPOSIXError(errno, target));
            return std::nullopt;
        }
    }
    return target;
}

bool GWZipExtractOperation::moveIntoPlace(const GWURL& built, GWErrorPtr* error) {
    const std::string destination = destURL_->path();
    bool moved;
    if (replacesExistingItems()) {
        // A file over a directory replaces it only because the caller asked.
        struct stat existing;
        if (::lstat(destination.c_str(), &existing) == 0 && S_ISDIR(existing.st_mode)) {
            if (directories_) {
                directories_->forget();
            }
            if (!GWRemoveItemRecursively(destination, error)) {
                return false;
            }
        }
        moved = GWMoveItemReplacing(built.path(), destination, error);
    } else {
        moved = GWMoveItemNoReplace(built.path(), destination, error);
    }
    return moved &&
           GWMetadataStore::moveMetadata(built.path(), destination, replacesExistingItems(), error);
}

bool GWZipExtractOperation::setInfoForDirectory(const GWZipFilePtr& file, const GWURL& root,
                                                const GWURL& url, GWErrorPtr* error) {
    GWFileDescriptor directory = GWOpenDirectoryBelow(
        root.path(), GWRelativePathBelow(root, url).value_or(""), false, error);
    return directory.isValid() && setInfoForFile(file, url, error, directory.get());
}

GWURL GWZipExtractTemporaryURL(const GWURL& target) {
    return target.URLByDeletingLastPathComponent().URLByAppendingPathComponent(
        std::string(".") + GWZipExtractOperation::kBundleIdentifier + ".temp." + GWUniqueID());
}

GWURL GWZipEntryDestinationURL(const GWURL& base, std::string_view relativePath) {
    GWURL destination = base;
    std::size_t start = 0;
    while (start <= relativePath.size()) {
        std::size_t end = relativePath.find('/', start);
        if (end == std::string_view::npos) {
            end = relativePath.size();
        }
        if (end > start) {
            destination =
                destination.URLByAppendingPathComponent(relativePath.substr(start, end - start));
        }
        start = end + 1;
    }
    return destination;
}

GWErrorPtr GWZipExtractOperation::containmentErrorForFile(const GWZipFilePtr& file,
                                                          const GWURL& root,
                                                          const GWURL& destination, bool onDisk) {
    const auto relative = GWRelativePathBelow(root, destination);
    bool contained = relative && (!onDisk || GWIsContainedDestination(root, destination));
    if (contained && file) {
        // The entry's own ancestors down to `root`: one per separator.
        auto levels = std::count(relative->begin(), relative->end(), '/');
        for (auto ancestor = file->parent(); contained && ancestor && levels > 0;
             ancestor = ancestor->parent(), --levels) {
            contained = !ancestor->isSymbolicLink();
        }
    }
    if (contained) {
        return nullptr;
    }
    const std::string path = file ? file->path() : destination.path();
    return GWGenerateError(
        kGWZipArchiveErrorDomain, GWZipArchiveEntryOutsideDestinationError, destination, nullptr,
        {{kGWZipArchiveUnknownEntityErrorKey, GWValue(path)}},
        "entry %s would be written outside %s", path.c_str(), root.path().c_str());
}
