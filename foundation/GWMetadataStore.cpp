#include "GWMetadataStore.h"

#include <linux/limits.h>
#include <sys/stat.h>
#include <sys/xattr.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstring>

#include "GWAppleDouble.h"
#include "GWLog.h"

namespace {

std::atomic<std::size_t> gAttributeSizeLimit{SIZE_MAX};

// The errors with which a file system turns an attribute away for its size
// or because it keeps none; everything else is a real failure.
bool isRefusal(int number) {
    return number == ENOSPC || number == E2BIG || number == ERANGE || number == ENOTSUP;
}

bool isAbsence(int number) {
    return number == ENODATA || number == ENOTSUP;
}

bool readsAs(std::span<const std::uint8_t> bytes, const char (&code)[5]) {
    return std::equal(bytes.begin(), bytes.end(), code) ||
           std::all_of(bytes.begin(), bytes.end(), [](auto b) { return b == 0; });
}

// Zeros say nothing, and "fold"/"MACS" only that a folder is a folder.
bool carriesNothing(std::span<const std::uint8_t> finderInfo, bool isDirectory) {
    if (finderInfo.size() != kGWFinderInfoLength) {
        return false;
    }
    const auto rest = finderInfo.subspan(8);
    if (!std::all_of(rest.begin(), rest.end(), [](auto b) { return b == 0; })) {
        return false;
    }
    if (isDirectory) {
        return readsAs(finderInfo.first(4), "fold") && readsAs(finderInfo.subspan(4, 4), "MACS");
    }
    return std::all_of(finderInfo.begin(), finderInfo.end(), [](auto b) { return b == 0; });
}

}  // namespace

GWMetadataStore::GWMetadataStore(std::string path) : path_(std::move(path)), sideFile_(path_) {}

GWMetadataStore::GWMetadataStore(int fd, std::string path)
    : fd_(fd), path_(std::move(path)), sideFile_(path_) {}

void GWMetadataStore::setAttributeSizeLimitForTesting(std::optional<std::size_t> limit) {
    gAttributeSizeLimit = limit.value_or(SIZE_MAX);
}

GWErrorPtr GWMetadataStore::attributeError(int number, const char* doing,
                                           const std::string& name) const {
    return GWGenerateError(kGWPOSIXErrorDomain, number, std::nullopt, nullptr, {},
                           "%s extended attribute \"%s\" of %s failed: %s", doing, name.c_str(),
                           path_.c_str(), std::strerror(number));
}

bool GWMetadataStore::isDirectory() const {
    struct stat info {};
    const int result = fd_ >= 0 ? ::fstat(fd_, &info) : ::lstat(path_.c_str(), &info);
    return result == 0 && S_ISDIR(info.st_mode);
}

bool GWMetadataStore::dropValue(const std::string& linuxName, const GWErrorPtr& why) {
    GWLog("the extended attribute \"%s\" of %s is not kept: %s", linuxName.c_str(), path_.c_str(),
          why->localizedDescription().c_str());
    // An older value, or the part of a fork written so far, must not pass for the new one.
    removeRaw(linuxName);
    return true;
}

int GWMetadataStore::getRaw(const std::string& linuxName, GWData& value) const {
    // The value may change size between the two calls; ERANGE then asks again.
    for (;;) {
        const ssize_t size = fd_ >= 0 ? fgetxattr(fd_, linuxName.c_str(), nullptr, 0)
                                      : lgetxattr(path_.c_str(), linuxName.c_str(), nullptr, 0);
        if (size < 0) {
            return errno;
        }
        value.resize(std::size_t(size));
        const ssize_t got =
            fd_ >= 0 ? fgetxattr(fd_, linuxName.c_str(), value.data(), value.size())
                     : lgetxattr(path_.c_str(), linuxName.c_str(), value.data(), value.size());
        if (got >= 0) {
            value.resize(std::size_t(got));
            return 0;
        }
        if (errno != ERANGE) {
            return errno;
        }
    }
}

int GWMetadataStore::setRaw(const std::string& linuxName,
                            std::span<const std::uint8_t> value) const {
    // The kernel takes no value over XATTR_SIZE_MAX on any file system.
    if (value.size() > gAttributeSizeLimit.load() || value.size() > XATTR_SIZE_MAX) {
        return E2BIG;
    }
    const int result =
        fd_ >= 0 ? fsetxattr(fd_, linuxName.c_str(), value.data(), value.size(), 0)
                 : lsetxattr(path_.c_str(), linuxName.c_str(), value.data(), value.size(), 0);
    return result == 0 ? 0 : errno;
}

int GWMetadataStore::removeRaw(const std::string& linuxName) const {
    const int result = fd_ >= 0 ? fremovexattr(fd_, linuxName.c_str())
                                : lremovexattr(path_.c_str(), linuxName.c_str());
    return result == 0 || isAbsence(errno) ? 0 : errno;
}

std::optional<GWData> GWMetadataStore::attribute(std::string_view name, GWErrorPtr* error) const {
    const std::string linuxName = GWLinuxAttributeName(name);
    GWData value;
    const int result = getRaw(linuxName, value);
    if (result == 0) {
        return value;
    }
    if (!isAbsence(result)) {
        GWFail(error, attributeError(result, "reading", linuxName));
        return std::nullopt;
    }
    return sideFile_.value(GWMacAttributeName(linuxName), error);
}

bool GWMetadataStore::moveToSideFile(const std::string& macName, const std::string& linuxName,
                                     std::span<const std::uint8_t> value, GWErrorPtr* error) {
    if (auto why = sideFile_.unavailability()) {
        forkDropped_ = forkDropped_ || macName == kGWResourceForkAttributeName;
        return dropValue(linuxName, why);
    }
    if (!sideFile_.setValue(macName, value, error)) {
        return false;
    }
    const int result = removeRaw(linuxName);
    return result == 0 || GWFail(error, attributeError(result, "removing", linuxName));
}

bool GWMetadataStore::setAttribute(std::string_view name, std::span<const std::uint8_t> value,
                                   GWErrorPtr* error) {
    const std::string linuxName = GWLinuxAttributeName(name);
    const std::string macName = GWMacAttributeName(linuxName);
    if (macName == kGWFinderInfoAttributeName && carriesNothing(value, isDirectory())) {
        return true;
    }
    const int result = setRaw(linuxName, value);
    if (result == 0) {
        // An older copy in the side file would otherwise survive beside the
        // new value. Reads take the attribute first, so a side file that
        // cannot be read does not make this write fail.
        bool stale = false;
        GWErrorPtr ignored;
        if (sideFile_.contains(macName, stale, &ignored) && stale) {
            return sideFile_.setValue(macName, std::nullopt, error);
        }
        return true;
    }
    if (!isRefusal(result)) {
        return GWFail(error, attributeError(result, "setting", linuxName));
    }
    return moveToSideFile(macName, linuxName, value, error);
}

bool GWMetadataStore::removeAttribute(std::string_view name, GWErrorPtr* error) {
    const std::string linuxName = GWLinuxAttributeName(name);
    const int result = removeRaw(linuxName);
    if (result != 0) {
        return GWFail(error, attributeError(result, "removing", linuxName));
    }
    return sideFile_.setValue(GWMacAttributeName(linuxName), std::nullopt, error);
}

std::optional<std::vector<std::string>> GWMetadataStore::attributeNames(GWErrorPtr* error) const {
    std::vector<std::string> names;
    std::string list;
    for (;;) {
        const ssize_t size =
            fd_ >= 0 ? flistxattr(fd_, nullptr, 0) : llistxattr(path_.c_str(), nullptr, 0);
        if (size < 0 && errno != ENOTSUP) {
            GWFail(error, attributeError(errno, "listing", "*"));
            return std::nullopt;
        }
        list.resize(size < 0 ? 0 : std::size_t(size));
        if (list.empty()) {
            break;
        }
        const ssize_t got = fd_ >= 0 ? flistxattr(fd_, list.data(), list.size())
                                     : llistxattr(path_.c_str(), list.data(), list.size());
        if (got >= 0) {
            list.resize(std::size_t(got));
            break;
        }
        if (errno != ERANGE) {
            GWFail(error, attributeError(errno, "listing", "*"));
            return std::nullopt;
        }
    }
    for (std::size_t start = 0; start < list.size();) {
        const std::size_t end = std::min(list.find('\0', start), list.size());
        if (end > start) {
            names.push_back(GWMacAttributeName(std::string_view(list).substr(start, end - start)));
        }
        start = end + 1;
    }
    const auto sideNames = sideFile_.names(error);
    if (!sideNames) {
        return std::nullopt;
    }
    for (const auto& name : *sideNames) {
        if (std::find(names.begin(), names.end(), name) == names.end()) {
            names.push_back(name);
        }
    }
    return names;
}

bool GWMetadataStore::writeResourceFork(std::span<const std::uint8_t> bytes, std::uint32_t position,
                                        GWErrorPtr* error) {
    if (forkDropped_) {
        return true;
    }
    const std::string macName(kGWResourceForkAttributeName);
    const std::string linuxName = GWLinuxAttributeName(macName);
    bool inSideFile = false;
    if (!sideFile_.contains(macName, inSideFile, error)) {
        return false;
    }
    if (inSideFile) {
        return sideFile_.writeResourceFork(bytes, position, error);
    }
    GWData fork;
    const int found = getRaw(linuxName, fork);
    if (found != 0 && !isAbsence(found)) {
        return GWFail(error, attributeError(found, "reading", linuxName));
    }
    const std::uint64_t end = std::uint64_t(position) + bytes.size();
    const std::uint64_t newLength =
        bytes.empty() ? fork.size() : std::max<std::uint64_t>(fork.size(), end);
    if (newLength > XATTR_SIZE_MAX || newLength > gAttributeSizeLimit.load()) {
        // Too long for any attribute: the fork moves to the side file as it
        // is, and the new bytes are written there in place, never assembled
        // in memory.
        if (auto why = sideFile_.unavailability()) {
            forkDropped_ = true;
            return dropValue(linuxName, why);
        }
        if (!fork.empty() && !sideFile_.setValue(macName, fork, error)) {
            return false;
        }
        if (!sideFile_.writeResourceFork(bytes, position, error)) {
            return false;
        }
        const int removed = removeRaw(linuxName);
        return removed == 0 || GWFail(error, attributeError(removed, "removing", linuxName));
    }
    fork.resize(std::size_t(newLength));
    std::copy(bytes.begin(), bytes.end(), fork.begin() + position);
    const int result = setRaw(linuxName, fork);
    if (result == 0) {
        return true;
    }
    if (!isRefusal(result)) {
        return GWFail(error, attributeError(result, "setting", linuxName));
    }
    return moveToSideFile(macName, linuxName, fork, error);
}

bool GWMetadataStore::moveMetadata(const std::string& fromItem, const std::string& toItem,
                                   bool replaceExisting, GWErrorPtr* error) {
    return GWMetadataSideFile::moveWithItem(fromItem, toItem, replaceExisting, error);
}

bool GWMetadataStore::removeMetadata(const std::string& item, GWErrorPtr* error) {
    return GWMetadataSideFile::removeForItem(item, error);
}
