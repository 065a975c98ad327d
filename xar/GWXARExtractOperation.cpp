#include "GWXARExtractOperation.h"

#include <sys/stat.h>
#include <unistd.h>

#include <exception>
#include <unordered_set>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "foundation/GWExtractPolicy.h"
#include "foundation/GWFileSystem.h"
#include "foundation/GWFreeSpace.h"
#include "foundation/GWLog.h"
#include "foundation/GWMetadataStore.h"

GWXARExtractOperation::GWXARExtractOperation(GWXARFilePtr file, GWURL destinationURL,
                                             const std::shared_ptr<GWXARArchive>& archive)
    : file_(std::move(file)), destURL_(std::move(destinationURL)), archive_(archive) {}

GWXARExtractOperationPtr GWXARExtractOperation::initWithFile(
    GWXARFilePtr file, GWURL destinationURL, const std::shared_ptr<GWXARArchive>& archive) {
    return GWXARExtractOperationPtr(
        new GWXARExtractOperation(std::move(file), std::move(destinationURL), archive));
}

namespace {

// The data bytes extracting `item` writes by the sizes the archive states:
// every regular file once, a hard link only when its file is not otherwise
// written (it may become a copy).
std::uint64_t declaredDataSize(const GWXARFilePtr& item) {
    std::uint64_t total = 0;
    std::unordered_set<const GWXARFile*> counted;
    std::vector<GWXARFilePtr> pending{item};
    while (!pending.empty()) {
        GWXARFilePtr file = std::move(pending.back());
        pending.pop_back();
        for (const auto& child : file->children()) {
            pending.push_back(child);
        }
        GWXARFilePtr holder = file;
        for (int hops = 0; holder && holder->type() == GWXARFileTypeHardLink && hops < 64; ++hops) {
            holder = holder->hardlinkDestination();
        }
        if (!holder || holder->type() != GWXARFileTypeRegular || !holder->dataFork() ||
            !counted.insert(holder.get()).second) {
            continue;
        }
        const std::uint64_t size = holder->dataFork()->uncompressedSize();
        total = size > UINT64_MAX - total ? UINT64_MAX : total + size;
    }
    return total;
}

bool isDevice(const GWXARFile& file) {
    return file.type() == GWXARFileTypeCharacterSpecial || file.type() == GWXARFileTypeBlockSpecial;
}

}  // namespace

GWErrorPtr GWXARExtractOperation::error() const {
    std::lock_guard lock(errorMutex_);
    // Cancelled on its queue before it ran: the body that says so never came.
    if (!error_ && !ran_.load() && isCancelled()) {
        return cancelledError();
    }
    return error_;
}

void GWXARExtractOperation::setError(GWErrorPtr error) {
    std::lock_guard lock(errorMutex_);
    error_ = std::move(error);
}

GWErrorPtr GWXARExtractOperation::cancelledError() const {
    return GWCocoaError(GWUserCancelledError, destURL_);
}

GWURL GWXARExtractOperation::finalURL(const GWURL& url) const {
    if (!temporaryItemURL_) {
        return url;
    }
    const std::string root = temporaryItemURL_->path();
    const std::string path = url.path();
    if (path == root) {
        return destURL_;
    }
    if (path.size() > root.size() && path.compare(0, root.size(), root) == 0 &&
        path[root.size()] == '/') {
        return GWURL::fileURLWithPath(destURL_.path() + path.substr(root.size()));
    }
    return url;
}

void GWXARExtractOperation::recordFailure(std::size_t order, const GWXARFilePtr& file,
                                          const GWURL& url, GWErrorPtr error) {
    // The private directory is gone by the time anyone reads this.
    const GWURL where = finalURL(url);
    if (!error) {
        error = GWCocoaError(GWFileWriteUnknownError, where);
    } else if (error->URL() != std::optional<GWURL>(where)) {
        error = GWGenerateError(error->domain(), error->code(), where, error, error->userInfo(),
                                "%s", error->localizedDescription().c_str());
    }
    std::lock_guard lock(failuresMutex_);
    failures_.emplace(order, EntryFailure{file, std::move(error)});
}

bool GWXARExtractOperation::extractEntry(const GWXARFilePtr& file, const GWURL& url,
                                         std::size_t order) {
    GWErrorPtr failure;
    if (extractFile(file, url, &failure)) {
        return true;
    }
    if (isCancelled()) {
        return false;  // the whole extraction ends as cancelled
    }
    // A directory fails only at its own creation; anything else may have
    // left a partial file that must not pass for the entry.
    if (file->type() != GWXARFileTypeDirectory) {
        ::unlink(url.path().c_str());
    }
    recordFailure(order, file, url, std::move(failure));
    return false;
}

void GWXARExtractOperation::main() {
    ran_.store(true);
    try {
        GWErrorPtr failure;
        if (performExtractionOperationWithFile(file_, destURL_, &failure)) {
            setError(nullptr);
        } else {
            setError(failure ? failure : GWCocoaError(GWFileWriteUnknownError, destURL_));
        }
    } catch (const std::exception& exception) {
        setError(GWGenerateError(kGWCocoaErrorDomain, GWFileWriteUnknownError, destURL_, nullptr,
                                 {}, "%s", exception.what()));
    }
}

bool GWXARExtractOperation::performExtractionOperationWithFile(const GWXARFilePtr& file,
                                                               const GWURL& destinationURL,
                                                               GWErrorPtr* error) {
    if (isCancelled()) {
        return GWFail(error, cancelledError());
    }
    if (!destinationURL.isFileURL()) {
        return GWFail(error, GWCocoaError(GWFileWriteUnsupportedSchemeError, destinationURL));
    }
    if (!file) {
        return GWFail(error, GWCocoaError(GWFileWriteUnknownError, destinationURL));
    }
    if (isDevice(*file) && !GWMayExtractDevice(file->path(), options_)) {
        return true;
    }
    // Refusing before the first byte beats filling the disk and undoing it.
    if (!GWCheckFreeSpace(destinationURL.URLByDeletingLastPathComponent(), declaredDataSize(file),
                          error)) {
        return false;
    }
    const std::string destinationPath = destinationURL.path();
    auto temporary = GWReplacementFolder::createForDestination(destinationPath, error);
    if (!temporary) {
        return false;
    }
    // Hard links find their targets by archive path, so the item keeps its
    // archive name in the private directory; a name that is no single path
    // component ("/", "..") only costs those links their sharing.
    const GWURL temporaryURL = GWURL::fileURLWithPath(temporary->path());
    const GWURL itemURL = childURL(temporaryURL, *file, nullptr)
                              .value_or(temporaryURL.URLByAppendingPathComponent("item"));
    temporaryItemURL_ = itemURL;
    deferTopLevelFlags_ = false;
    nextOrder_ = 0;
    {
        std::lock_guard lock(failuresMutex_);
        failures_.clear();
    }
    walking_ = true;
    const bool created = extractEntry(file, itemURL, nextOrder_++);
    walking_ = false;
    finishWorkers();
    if (isCancelled()) {
        return GWFail(error, cancelledError());
    }
    for (const auto& [directory, directoryURL] : pendingDirectories_) {
        applyMetadataOrNote(directory, directoryURL);
    }
    pendingDirectories_.clear();
    GWErrorPtr firstFailure;
    std::map<std::size_t, EntryFailure> failures;
    {
        std::lock_guard lock(failuresMutex_);
        failures = failures_;
    }
    for (const auto& [order, failure] : failures) {
        firstFailure = firstFailure ? firstFailure : failure.error;
        if (options_.entryFailed) {
            options_.entryFailed(failure.file->path(), failure.error);
        }
    }
    if (!created) {
        return GWFail(error, firstFailure);
    }
    // Moving a directory updates its "..", which needs write permission on
    // it; without privileges a read-only one gets that for the move only.
    struct stat itemInfo = {};
    const bool isDirectory =
        ::lstat(itemURL.path().c_str(), &itemInfo) == 0 && S_ISDIR(itemInfo.st_mode);
    const bool lendWrite = isDirectory && !(itemInfo.st_mode & S_IWUSR) && ::geteuid() != 0;
    if (lendWrite) {
        ::chmod(itemURL.path().c_str(), (itemInfo.st_mode & 07777) | S_IWUSR);
    }
    if (!moveIntoPlace(itemURL.path(), destinationPath, isDirectory, error)) {
        return false;
    }
    if (lendWrite) {
        ::chmod(destinationPath.c_str(), itemInfo.st_mode & 07777);
    }
    // A side file holding a refused resource fork follows its item; failing
    // to move it loses only that metadata.
    const std::string sideFile = GWMetadataSideFile::pathForItem(itemURL.path());
    GWErrorPtr sideFileError;
    if (::access(sideFile.c_str(), F_OK) == 0 &&
        !GWMetadataStore::moveMetadata(itemURL.path(), destinationPath,
                                       options_.replaceExisting.value_or(false), &sideFileError)) {
        GWLog("Failed to apply metadata for %s: %s", destinationPath.c_str(),
              sideFileError->localizedDescription().c_str());
        markChecksumInvalid();
    }
    if (deferTopLevelFlags_) {
        applyFlags(*file, destinationURL);
    }
    return !firstFailure || GWFail(error, firstFailure);
}

bool GWXARExtractOperation::moveIntoPlace(const std::string& item, const std::string& destination,
                                          bool isDirectory, GWErrorPtr* error) {
    struct stat existing;
    if (!options_.replaceExisting.value_or(false) || ::lstat(destination.c_str(), &existing) != 0) {
        return GWMoveItemNoReplace(item, destination, error);
    }
    if (S_ISDIR(existing.st_mode)) {
        return GWFail(error, GWPOSIXError(EEXIST, GWURL::fileURLWithPath(destination)));
    }
    // A rename cannot put a directory where a file is, so the file goes first.
    if (isDirectory) {
        if (::unlink(destination.c_str()) != 0) {
            return GWFail(error, GWPOSIXError(errno, GWURL::fileURLWithPath(destination)));
        }
        return GWMoveItemNoReplace(item, destination, error);
    }
    return GWMoveItemReplacing(item, destination, error);
}

GWFileDescriptor GWXARExtractOperation::openBuiltDirectory(const GWURL& url,
                                                           GWErrorPtr* error) const {
    const std::string folder = temporaryItemURL_
                                   ? temporaryItemURL_->URLByDeletingLastPathComponent().path()
                                   : std::string();
    const std::string path = url.path();
    if (folder.empty() || path.compare(0, folder.size() + 1, folder + "/") != 0) {
        GWFail(error, GWPOSIXError(EINVAL, url));
        return GWFileDescriptor();
    }
    return GWOpenDirectoryBelow(folder, std::string_view(path).substr(folder.size() + 1), false,
                                error);
}

bool GWXARExtractOperation::extractFile(const GWXARFilePtr& file, const GWURL& url,
                                        GWErrorPtr* error) {
    bool created = false;
    switch (file->type()) {
        case GWXARFileTypeRegular: created = extractRegularFile(file, url, error); break;
        case GWXARFileTypeDirectory: created = extractDirectory(file, url, error); break;
        case GWXARFileTypeSymbolicLink: created = extractSymbolicLink(file, url, error); break;
        case GWXARFileTypeHardLink: created = extractHardLink(file, url, error); break;
        case GWXARFileTypeCharacterSpecial:
        case GWXARFileTypeBlockSpecial:
            // Left out with a note; the rest of the tree goes on.
            if (!GWMayExtractDevice(file->path(), options_)) {
                return true;
            }
            created = extractDevice(file, url, error);
            break;
        case GWXARFileTypeFIFO: created = extractFIFO(file, url, error); break;
        default:
            return GWFail(error, GWGenerateError(
                                     kGWXARArchiveErrorDomain, GWXARArchiveUnsupportedFileTypeError,
                                     url, nullptr, {}, "%s is a %s, which cannot be extracted.",
                                     file->path().c_str(),
                                     GWXARFile::stringFromFileType(file->type()).c_str()));
    }
    if (!created) {
        return false;
    }
    if (file->type() == GWXARFileTypeDirectory) {
        if (walking_) {
            // Applied once the workers have written everything below it.
            pendingDirectories_.emplace_back(file, url);
            return true;
        }
        finishWorkers();
    }
    applyMetadataOrNote(file, url);
    return true;
}

void GWXARExtractOperation::applyMetadataOrNote(const GWXARFilePtr& file, const GWURL& url) {
    GWErrorPtr metadataError;
    if (!applyMetadataToFile(file, url, &metadataError)) {
        GWLog("Failed to apply metadata for %s: %s", url.path().c_str(),
              metadataError ? metadataError->localizedDescription().c_str() : "(null)");
        markChecksumInvalid();
    }
}
