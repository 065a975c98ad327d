// Applying an entry's metadata to what was created for it: dates, extended
// attributes and the resource fork, owner, group, mode, ACL and BSD flags.

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/acl.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cstdint>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "GWXARArchive.h"
#include "GWXARExtractOperation.h"
#include "foundation/GWDispatch.h"
#include "foundation/GWExtractPolicy.h"
#include "foundation/GWFileDescriptor.h"
#include "foundation/GWMetadataStore.h"

namespace {

constexpr const char* kResourceForkName = "com.apple.ResourceFork";
// The archived (0x10000), immutable (0x20000) and append-only (0x40000)
// system flags are never restored.
constexpr std::uint32_t kRestorableFlagsMask = 0xFFF8FFFF;
constexpr std::uint32_t kUserNoDump = 0x1;
constexpr std::uint32_t kUserImmutable = 0x2;
constexpr std::uint32_t kUserAppend = 0x4;

timespec timespecFromDate(const std::optional<GWDate>& date, const GWDate& now) {
    const GWDate value = date.value_or(now);
    return timespec{static_cast<time_t>(value.wholeSeconds()),
                    static_cast<long>(value.nanoseconds())};
}

// The store names neither the item's URL nor always the item; callers want both.
GWErrorPtr attributeError(const GWErrorPtr& storeError, const GWURL& url) {
    return GWGenerateError(kGWPOSIXErrorDomain, storeError ? storeError->code() : EIO, url,
                           storeError, {}, "%s",
                           storeError ? storeError->localizedDescription().c_str()
                                      : "setting an extended attribute failed");
}

int linuxInodeFlags(std::uint32_t posixFlags) {
    int flags = 0;
    if (posixFlags & kUserNoDump) {
        flags |= FS_NODUMP_FL;
    }
    if (posixFlags & kUserImmutable) {
        flags |= FS_IMMUTABLE_FL;
    }
    if (posixFlags & kUserAppend) {
        flags |= FS_APPEND_FL;
    }
    return flags;
}

}  // namespace

bool GWXARExtractOperation::applyMetadataToFile(const GWXARFilePtr& file, const GWURL& url,
                                                GWErrorPtr* error) {
    const std::string path = url.path();
    // A directory is finished long after it was made, so it is reached by a
    // walk that no link placed meanwhile can redirect, and changed through
    // the descriptor the walk ends with.
    GWFileDescriptor directory;
    if (file->type() == GWXARFileTypeDirectory) {
        directory = openBuiltDirectory(url, error);
        if (!directory.isValid()) {
            return false;
        }
    }
    const int fd = directory.get();
    const GWDate now = GWDate::now();
    // Each step is tried whatever became of the one before: an attribute the
    // file system refuses must not cost the item its mode or owner.
    GWErrorPtr firstFailure;
    // Creation and status-change dates cannot be set on Linux.
    const timespec times[2] = {timespecFromDate(file->accessDate(), now),
                               timespecFromDate(file->modificationDate(), now)};
    if ((fd >= 0 ? ::futimens(fd, times)
                 : ::utimensat(AT_FDCWD, path.c_str(), times, AT_SYMLINK_NOFOLLOW)) != 0) {
        firstFailure = GWPOSIXError(errno, url);
    }
    GWErrorPtr attributesError;
    if (!applyExtendedAttributesForFile(file, url, &attributesError, fd) && !firstFailure) {
        firstFailure = attributesError ? attributesError : cancelledError();
    }

    // Owner, group, mode and ACL are best effort, as a file-security object is:
    // an unprivileged user cannot give files away, and that is no failure.
    [[maybe_unused]] int ignored =
        fd >= 0 ? ::fchown(fd, file->ownerID(), file->groupOwnerID())
                : ::lchown(path.c_str(), file->ownerID(), file->groupOwnerID());
    if (file->type() != GWXARFileTypeSymbolicLink) {
        // The access ACL is what Linux enforces; an extended one in POSIX form
        // stands in for a missing one. Setting an ACL rewrites the group bits
        // from its mask, so the mode comes after it and both end as archived.
        const GWACL* acl = file->accessACL();
        if (!acl || acl->isMacExtended()) {
            acl = file->extendedACL();
        }
        if (acl && !acl->isMacExtended()) {
            ignored = fd >= 0 ? ::acl_set_fd(fd, acl->handle())
                              : ::acl_set_file(path.c_str(), ACL_TYPE_ACCESS, acl->handle());
        }
        // The default ACL has no descriptor call; the descriptor's own entry
        // in /proc names the directory the walk reached.
        const GWACL* inherited = file->defaultACL();
        if (fd >= 0 && inherited && !inherited->isMacExtended()) {
            ignored = ::acl_set_file(("/proc/self/fd/" + std::to_string(fd)).c_str(),
                                     ACL_TYPE_DEFAULT, inherited->handle());
        }
        const mode_t mode = GWExtractedPermissions(file->permissionsMode(), options_);
        ignored = fd >= 0 ? ::fchmod(fd, mode) : ::chmod(path.c_str(), mode);
    }
    applyFlags(*file, url, fd);
    return !firstFailure || GWFail(error, firstFailure);
}

void GWXARExtractOperation::applyFlags(const GWXARFile& file, const GWURL& url, int fd) {
    const int wanted =
        GWExtractedInodeFlags(linuxInodeFlags(file.posixFlags() & kRestorableFlagsMask), options_);
    if (wanted == 0) {
        return;
    }
    // An immutable or append-only item could not be moved out of the private
    // directory; the top-level one gets its flags once it is in place.
    const bool pinning = wanted & (FS_IMMUTABLE_FL | FS_APPEND_FL);
    if (pinning && temporaryItemURL_ && url == *temporaryItemURL_) {
        deferTopLevelFlags_ = true;
        return;
    }
    const int type = file.permissionsMode() & S_IFMT;
    if (type != S_IFREG && type != S_IFDIR) {
        return;  // devices, FIFOs and links carry no inode flags we may open them for
    }
    GWFileDescriptor opened;
    if (fd < 0) {
        opened = GWFileDescriptor::open(url.path().c_str(), O_RDONLY | O_NONBLOCK | O_NOFOLLOW);
        fd = opened.get();
    }
    int flags = 0;
    if (fd >= 0 && ::ioctl(fd, FS_IOC_GETFLAGS, &flags) == 0) {
        flags |= wanted;
        ::ioctl(fd, FS_IOC_SETFLAGS, &flags);
    }
}

bool GWXARExtractOperation::applyExtendedAttributesForFile(const GWXARFilePtr& file,
                                                           const GWURL& url, GWErrorPtr* error,
                                                           int fd) {
    if (file->extendedAttributes().empty()) {
        return true;
    }
    auto archive = archive_.lock();
    if (!archive) {
        return false;
    }
    auto group = std::make_shared<GWGroup>();
    auto setxattrQueue = GWDispatchQueue::serialQueue("GWXARArchive setxattr queue");
    // Each attribute stops alone: one the file system refuses leaves the
    // others to be set.
    struct Shared {
        std::mutex mutex;
        GWErrorPtr error;
    };
    auto shared = std::make_shared<Shared>();
    auto keepFirst = [shared](GWErrorPtr failure) {
        std::lock_guard lock(shared->mutex);
        if (!shared->error) {
            shared->error = std::move(failure);
        }
    };
    auto weakSelf = std::weak_ptr<GWXARExtractOperation>(
        std::static_pointer_cast<GWXARExtractOperation>(shared_from_this()));
    const std::string path = url.path();

    for (const auto& attribute : file->extendedAttributes()) {
        if (isCancelled()) {
            // Attributes already requested are not waited for, and the caller
            // gets no error object: the item counts as extracted.
            keepFirst(cancelledError());
            return false;
        }
        const std::string name = attribute->name().value_or("");
        if (!GWMayExtractAttribute(GWLinuxAttributeName(name), file->path(), options_)) {
            continue;
        }
        const bool isResourceFork = name == kResourceForkName;
        auto buffer = std::make_shared<GWData>();
        auto position = std::make_shared<std::uint32_t>(0);
        auto left = std::make_shared<std::atomic<bool>>(false);
        auto stop = std::make_shared<std::atomic<bool>>(false);
        auto leave = [group, left] {
            if (!left->exchange(true)) {
                group->leave();
            }
        };
        group->enter();
        archive->extractDataReference(
            attribute, file,
            [=](std::optional<std::span<const std::uint8_t>> data, bool isDone, bool checksumFailed,
                const GWErrorPtr& streamError) {
                if (stop->load()) {
                    return false;
                }
                auto self = weakSelf.lock();
                if (checksumFailed && self) {
                    self->markChecksumInvalid();
                }
                GWErrorPtr failure = streamError;
                if (!failure && self && self->isCancelled()) {
                    failure = self->cancelledError();
                }
                const auto piece = data.value_or(std::span<const std::uint8_t>());
                if (!failure && isResourceFork) {
                    if (!self) {
                        failure = GWCocoaError(GWFileWriteUnknownError, url);
                    } else {
                        self->appendDataToResourceFork(piece, url, *position, &failure, fd);
                    }
                } else if (!failure) {
                    if (buffer->size() + piece.size() > kMaxBufferedAttributeSize) {
                        failure =
                            GWGenerateError(kGWPOSIXErrorDomain, E2BIG, url, nullptr,
                                            {{kGWXARArchiveUnknownEntityErrorKey, GWValue(name)}},
                                            "The extended attribute %s of %s is too large.",
                                            name.c_str(), path.c_str());
                    } else {
                        buffer->insert(buffer->end(), piece.begin(), piece.end());
                    }
                    if (!failure && !isDone) {
                        return true;
                    }
                    if (!failure) {
                        setxattrQueue->sync([&] {
                            GWMetadataStore store =
                                fd >= 0 ? GWMetadataStore(fd, path) : GWMetadataStore(path);
                            GWErrorPtr storeError;
                            if (!store.setAttribute(name, *buffer, &storeError)) {
                                failure = attributeError(storeError, url);
                            }
                        });
                    }
                }
                if (!failure) {
                    if (isDone) {
                        leave();
                    }
                    return true;
                }
                stop->store(true);
                keepFirst(failure);
                leave();
                return false;
            },
            [weakSelf] {
                auto self = weakSelf.lock();
                return !self || self->isCancelled();
            });
        // A stream stopped without its last call (this extraction was
        // cancelled) has ended all the same.
        if (!left->load()) {
            keepFirst(cancelledError());
            leave();
        }
    }
    group->wait();
    std::lock_guard lock(shared->mutex);
    if (shared->error) {
        return GWFail(error, shared->error);
    }
    return true;
}

bool GWXARExtractOperation::appendDataToResourceFork(std::span<const std::uint8_t> data,
                                                     const GWURL& url, std::uint32_t& position,
                                                     GWErrorPtr* error, int fd) {
    if (std::uint64_t(position) + data.size() > 0xFFFFFFFFull) {
        auto archive = archive_.lock();
        return GWFail(
            error,
            GWGenerateError(kGWPOSIXErrorDomain, EFBIG,
                            archive ? std::optional<GWURL>(archive->URL()) : std::nullopt, nullptr,
                            {{kGWXARArchiveUnknownEntityErrorKey, GWValue(kResourceForkName)}},
                            "The resource fork of %s would pass 4 GiB.", url.path().c_str()));
    }
    if (data.empty()) {
        return true;
    }
    GWMetadataStore store = fd >= 0 ? GWMetadataStore(fd, url.path()) : GWMetadataStore(url.path());
    GWErrorPtr storeError;
    if (!store.writeResourceFork(data, position, &storeError)) {
        return GWFail(error, attributeError(storeError, url));
    }
    position += std::uint32_t(data.size());
    return true;
}
