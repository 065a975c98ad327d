#include "GWFileInfo.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>

#include "GWLog.h"
#include "GWMetadataStore.h"

namespace {

GWDate dateOf(const struct statx_timestamp& time) {
    return GWDate(double(time.tv_sec) + double(time.tv_nsec) / 1e9);
}

struct timespec timespecOf(const GWDate& date) {
    struct timespec time {};
    time.tv_sec = time_t(date.wholeSeconds());
    time.tv_nsec = long(date.nanoseconds());
    return time;
}

}  // namespace

std::shared_ptr<GWFileInfo> GWFileInfo::initWithDescriptor(int fd, const GWURL& url,
                                                           GWErrorPtr* error) {
    struct statx info {};
    if (statx(fd, "", AT_EMPTY_PATH, STATX_BASIC_STATS | STATX_BTIME, &info) != 0) {
        GWFail(error, GWPOSIXError(errno, url));
        return nullptr;
    }
    auto fileInfo = std::shared_ptr<GWFileInfo>(new GWFileInfo());
    fileInfo->setStatus(info);
    return fileInfo;
}

void GWFileInfo::setStatus(const struct statx& info) {
    if (info.stx_mask & STATX_BTIME) {
        creationDate_ = dateOf(info.stx_btime);
    }
    modificationDate_ = dateOf(info.stx_mtime);
    accessDate_ = dateOf(info.stx_atime);
    ownerID_ = info.stx_uid;
    groupID_ = info.stx_gid;
    permissionsMode_ = info.stx_mode & 07777;
}

std::shared_ptr<GWFileInfo> GWFileInfo::initWithURL(const GWURL& url, GWErrorPtr* error) {
    if (!url.isFileURL()) {
        GWFail(error, GWCocoaError(GWFileReadUnsupportedSchemeError, url));
        return nullptr;
    }
    const std::string path = url.path();
    struct statx info {};
    const unsigned mask = STATX_BASIC_STATS | STATX_BTIME;
    if (statx(AT_FDCWD, path.c_str(), AT_SYMLINK_NOFOLLOW, mask, &info) != 0) {
        GWFail(error, GWPOSIXError(errno, url));
        return nullptr;
    }
    auto fileInfo = std::shared_ptr<GWFileInfo>(new GWFileInfo());
    fileInfo->setStatus(info);
    GWErrorPtr readError;
    const auto finderInfo = GWMetadataStore(path).attribute(kGWFinderInfoAttributeName, &readError);
    if (readError) {
        GWFail(error, readError);
        return nullptr;
    }
    if (finderInfo) {
        std::copy_n(finderInfo->begin(), std::min(finderInfo->size(), fileInfo->finderInfo_.size()),
                    fileInfo->finderInfo_.begin());
    }
    return fileInfo;
}

void GWFileInfo::setModificationDate(const GWDate& date) {
    modificationDate_ = date;
    modificationDateSet_ = true;
}

void GWFileInfo::setAccessDate(const GWDate& date) {
    accessDate_ = date;
    accessDateSet_ = true;
}

void GWFileInfo::setOwnerID(std::uint32_t owner) {
    ownerID_ = owner;
    ownerSet_ = true;
}

void GWFileInfo::setGroupID(std::uint32_t group) {
    groupID_ = group;
    groupSet_ = true;
}

void GWFileInfo::setPermissionsMode(std::uint32_t mode) {
    permissionsMode_ = mode & 07777;
    modeSet_ = true;
}

std::uint32_t GWFileInfo::finderField(std::size_t offset, std::size_t width) const {
    std::uint32_t value = 0;
    for (std::size_t i = 0; i < width; ++i) {
        value = (value << 8) | finderInfo_[offset + i];
    }
    return value;
}

void GWFileInfo::setFinderField(std::size_t offset, std::size_t width, std::uint32_t value) {
    for (std::size_t i = 0; i < width; ++i) {
        finderInfo_[offset + i] = std::uint8_t(value >> (8 * (width - 1 - i)));
        finderInfoSet_[offset + i] = true;
    }
}

std::uint32_t GWFileInfo::location() const {
    return (finderField(kHorizontalOffset, 2) << 16) | finderField(kVerticalOffset, 2);
}

void GWFileInfo::setLocation(std::uint32_t location) {
    setFinderField(kVerticalOffset, 2, location & 0xFFFF);
    setFinderField(kHorizontalOffset, 2, location >> 16);
}

bool GWFileInfo::applyFinderInfo(int fd, const std::string& path, GWErrorPtr* error) const {
    if (std::none_of(finderInfoSet_.begin(), finderInfoSet_.end(), [](bool set) { return set; })) {
        return true;
    }
    // Read the current value at the moment of writing, so that fields set by
    // someone else since this object was loaded are kept too.
    GWMetadataStore store = fd >= 0 ? GWMetadataStore(fd, path) : GWMetadataStore(path);
    GWErrorPtr readError;
    const auto current = store.attribute(kGWFinderInfoAttributeName, &readError);
    if (readError) {
        return GWFail(error, readError);
    }
    GWData merged(finderInfo_.size(), 0);
    if (current) {
        std::copy_n(current->begin(), std::min(current->size(), merged.size()), merged.begin());
    }
    for (std::size_t i = 0; i < merged.size(); ++i) {
        if (finderInfoSet_[i]) {
            merged[i] = finderInfo_[i];
        }
    }
    // No attribute is made just to hold zeros, nor rewritten unchanged.
    const bool allZero = std::all_of(merged.begin(), merged.end(), [](auto b) { return b == 0; });
    if ((!current && allZero) || (current && *current == merged)) {
        return true;
    }
    return store.setAttribute(kGWFinderInfoAttributeName, merged, error);
}

bool GWFileInfo::applyToURL(const GWURL& url, GWErrorPtr* error) const {
    return apply(-1, url, error);
}

bool GWFileInfo::applyToDescriptor(int fd, const GWURL& url, GWErrorPtr* error) const {
    return apply(fd, url, error);
}

bool GWFileInfo::apply(int fd, const GWURL& url, GWErrorPtr* error) const {
    if (!url.isFileURL()) {
        return GWFail(error, GWCocoaError(GWFileWriteUnsupportedSchemeError, url));
    }
    const std::string path = url.path();
    GWErrorPtr first;
    auto note = [&](GWErrorPtr failure) {
        if (!first) {
            first = std::move(failure);
        }
    };

    // Attributes before the mode, which may take away the right to write them.
    GWErrorPtr finderError;
    struct stat item {};
    if (!applyFinderInfo(fd, path, &finderError)) {
        // Linux keeps no user attributes on symbolic links: the link is still good.
        if (fd < 0 && finderError && finderError->is(kGWPOSIXErrorDomain, EPERM) &&
            lstat(path.c_str(), &item) == 0 && S_ISLNK(item.st_mode)) {
            GWLog("the Finder information of the symbolic link %s is not kept: %s", path.c_str(),
                  finderError->localizedDescription().c_str());
        } else {
            note(finderError);
        }
    }
    const uid_t owner = ownerSet_ ? uid_t(ownerID_) : uid_t(-1);
    const gid_t group = groupSet_ ? gid_t(groupID_) : gid_t(-1);
    if ((ownerSet_ || groupSet_) &&
        (fd >= 0 ? fchown(fd, owner, group) : lchown(path.c_str(), owner, group)) != 0) {
        note(GWPOSIXError(errno, url));
    }
    // After chown, which may clear the set-id bits.
    if (modeSet_) {
        struct stat info {};
        if ((fd >= 0 ? fstat(fd, &info) : lstat(path.c_str(), &info)) != 0) {
            note(GWPOSIXError(errno, url));
        } else if (!S_ISLNK(info.st_mode) &&
                   (fd >= 0 ? fchmod(fd, mode_t(permissionsMode_))
                            : chmod(path.c_str(), mode_t(permissionsMode_))) != 0) {
            note(GWPOSIXError(errno, url));
        }
    }
    // Dates last: nothing above changes them, but writing the data would.
    if (modificationDateSet_ || accessDateSet_) {
        struct timespec times[2];
        times[0] = accessDateSet_ ? timespecOf(accessDate_) : timespec{0, UTIME_OMIT};
        times[1] = modificationDateSet_ ? timespecOf(modificationDate_) : timespec{0, UTIME_OMIT};
        if ((fd >= 0 ? futimens(fd, times)
                     : utimensat(AT_FDCWD, path.c_str(), times, AT_SYMLINK_NOFOLLOW)) != 0) {
            note(GWPOSIXError(errno, url));
        }
    }
    return !first || GWFail(error, first);
}

bool GWSetSpotlightComments(const std::string& comment, const GWURL& url, GWErrorPtr* error) {
    if (!url.isFileURL()) {
        return GWFail(error, GWCocoaError(GWFileWriteUnsupportedSchemeError, url));
    }
    GWMetadataStore store(url.path());
    if (comment.empty()) {
        return store.removeAttribute(kGWCommentAttributeName, error);
    }
    const auto* bytes = reinterpret_cast<const std::uint8_t*>(comment.data());
    return store.setAttribute(kGWCommentAttributeName, std::span(bytes, comment.size()), error);
}
