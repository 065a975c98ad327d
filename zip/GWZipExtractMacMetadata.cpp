#include <cerrno>

#include "GWZipExtractOperation.h"
#include "applefile/GWAppleFileDecoder.h"
#include "foundation/GWExtractPolicy.h"
#include "foundation/GWFileDescriptor.h"
#include "foundation/GWFileInfo.h"
#include "foundation/GWFileManager.h"
#include "foundation/GWLog.h"
#include "foundation/GWMetadataNames.h"
#include "foundation/GWMetadataStore.h"
#include "foundation/GWRemoteFileHandle.h"

const GWExtractOptions& GWZipExtractOperation::extractOptions() const {
    static const GWExtractOptions kDefaults;
    return options_ ? *options_ : kDefaults;
}

bool GWZipExtractOperation::setInfoForFile(const GWZipFilePtr& file, const GWURL& url,
                                           GWErrorPtr* error, int fd) {
    auto info = fd >= 0 && !file->isDirectory() ? GWFileInfo::initWithDescriptor(fd, url, error)
                                                : GWFileInfo::initWithURL(url, error);
    if (!info) {
        return false;
    }
    if (auto date = file->creationDate()) {
        info->setCreationDate(*date);
    }
    if (auto date = file->modificationDate()) {
        info->setModificationDate(*date);
    }
    if (auto date = file->backupDate()) {
        info->setBackupDate(*date);
    }
    if (auto date = file->accessDate()) {
        info->setAccessDate(*date);
    }
    // Only what the entry knows: its zeros would wipe the Finder information
    // an AppleDouble companion or a MacBinary header has just given the file.
    if (const std::uint32_t code = file->typeCode()) {
        info->setTypeCode(code);
    }
    if (const std::uint32_t code = file->creatorCode()) {
        info->setCreatorCode(code);
    }
    const std::uint32_t location = std::uint32_t(std::uint16_t(file->iconLocationV())) |
                                   std::uint32_t(std::uint16_t(file->iconLocationH())) << 16;
    if (location) {
        info->setLocation(location);
    }
    if (const std::uint16_t flags = file->finderFlags()) {
        info->setFinderFlags(flags);
    }
    if (const std::uint16_t flags = file->extendedFinderFlags()) {
        info->setExtendedFinderFlags(flags);
    }
    if (const std::uint16_t folder = file->putAwayFolderID()) {
        info->setPutAwayFolderID(folder);
    }
    auto apply = [&](GWErrorPtr* applyError) {
        return fd >= 0 ? info->applyToDescriptor(fd, url, applyError)
                       : info->applyToURL(url, applyError);
    };
    if (!apply(error)) {
        return false;
    }
    const std::uint32_t mode = GWExtractedPermissions(file->permissionsMode(), extractOptions());
    if (file->owner() != info->ownerID() || file->groupOwner() != info->groupID() ||
        mode != info->permissionsMode()) {
        info->setOwnerID(file->owner());
        info->setGroupID(file->groupOwner());
        info->setPermissionsMode(mode);
        // Another user's ownership is often refused; the file is still good.
        apply(nullptr);
    }
    if (auto comment = file->comment(); comment && !comment->empty()) {
        const auto* bytes = reinterpret_cast<const std::uint8_t*>(comment->data());
        GWMetadataStore store =
            fd >= 0 ? GWMetadataStore(fd, url.path()) : GWMetadataStore(url.path());
        store.setAttribute(kGWCommentAttributeName, std::span(bytes, comment->size()), nullptr);
    }
    return true;
}

void GWZipExtractOperation::writeResourceForkForFile(const GWZipFilePtr& file,
                                                     const GWRemoteFileHandlePtr& handle,
                                                     const GWURL& url, Completion completion) {
    const std::string path = url.path();
    auto descriptor =
        std::make_shared<GWFileDescriptor>(GWFileDescriptor::open(path.c_str(), O_RDWR));
    if (!descriptor->isValid()) {
        completion(GWPOSIXError(errno, url));
        return;
    }
    auto store = std::make_shared<GWMetadataStore>(descriptor->get(), path);
    // Each piece lands where the one before it ended.
    auto position = std::make_shared<std::uint64_t>(0);
    ChunkHandler write = [store, position](std::span<const std::uint8_t> data, bool,
                                           GWErrorPtr* error) {
        if (*position + data.size() > UINT32_MAX) {
            return GWFail(error, GWPOSIXError(EFBIG));
        }
        if (!store->writeResourceFork(data, std::uint32_t(*position), error)) {
            return false;
        }
        *position += data.size();
        return true;
    };
    unpackFile(file->resourceFork(), handle, std::move(write),
               [descriptor, store, completion](const GWErrorPtr& error) {
                   descriptor->reset();
                   completion(error);
               });
}

void GWZipExtractOperation::applyAppleDoubleMetadataForFile(const GWZipFilePtr& file,
                                                            const GWRemoteFileHandlePtr& handle,
                                                            const GWURL& url,
                                                            Completion completion) {
    const GWURL temporary = GWZipExtractTemporaryURL(url);
    GWErrorPtr error;
    if (!GWCreateEmptyFileAtomicallyAtURL(temporary, &error)) {
        completion(error);
        return;
    }
    auto writer = GWRemoteFileHandle::initForWritingToURL(temporary, &error);
    if (!writer) {
        GWRemoveItemAtURL(temporary, nullptr);
        completion(error);
        return;
    }
    ChunkHandler write = [writer](std::span<const std::uint8_t> data, bool, GWErrorPtr* error) {
        return writer->writeData(data, error);
    };
    unpackFile(file->appleDoubleFile(), handle, std::move(write),
               [this, writer, temporary, url, file, completion](const GWErrorPtr& error) {
                   writer->closeFileAndReturnError(nullptr);
                   if (error) {
                       GWRemoveItemAtURL(temporary, nullptr);
                       completion(error);
                       return;
                   }
                   // A companion that does not merge is no reason to fail the
                   // entry. The copy lives beside the file, so it goes either way.
                   GWErrorPtr mergeError;
                   if (!GWAppleFileDecoder::sharedInstance()->mergeAppleDoubleFileAtURL(
                           temporary, url, &mergeError, file->path(), extractOptions())) {
                       GWLog("the AppleDouble companion of %s was not applied: %s",
                             url.path().c_str(), mergeError->localizedDescription().c_str());
                   }
                   GWRemoveItemAtURL(temporary, nullptr);
                   completion(nullptr);
               });
}

void GWZipExtractOperation::decodeMacBinaryFileAtURL(const GWURL& url, Completion completion) {
    GWDispatchQueue::globalQueue()->async([url, completion = std::move(completion)] {
        const GWURL temporary = GWZipExtractTemporaryURL(url);
        GWErrorPtr error;
        if (!GWAppleFileDecoder::sharedInstance()->decodeMacBinaryFileAtURL(url, temporary,
                                                                            &error)) {
            if (GWItemExistsAtURL(temporary)) {
                GWRemoveItemAtURL(temporary, nullptr);
            }
            completion(error);
            return;
        }
        if (!GWRemoveItemAtURL(url, &error) || !GWMoveItemAtURL(temporary, url, &error)) {
            completion(error);
            return;
        }
        completion(nullptr);
    });
}
