#include "GWItemReplacement.h"

#include <fcntl.h>
#include <ftw.h>
#include <linux/fs.h>
#include <stdio.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <mutex>
#include <vector>

#include "GWFileDescriptor.h"
#include "GWFileManager.h"

namespace {

GWErrorPtr posixError(int number, const std::string& path) {
    return GWPOSIXError(number, GWURL::fileURLWithPath(path));
}

std::string parentPath(const std::string& path) {
    const auto slash = path.find_last_of('/');
    if (slash == std::string::npos) {
        return ".";
    }
    return slash == 0 ? "/" : path.substr(0, slash);
}

std::string makeTemporaryDirectory(std::string pattern) {
    std::vector<char> buffer(pattern.begin(), pattern.end());
    buffer.push_back('\0');
    if (!::mkdtemp(buffer.data())) {
        return {};
    }
    return buffer.data();
}

// Clears the flags that make an item unremovable; devices and FIFOs are
// never opened.
void clearPinningFlags(const std::string& path) {
    struct stat info;
    if (::lstat(path.c_str(), &info) != 0 || !(S_ISREG(info.st_mode) || S_ISDIR(info.st_mode))) {
        return;
    }
    auto fd = GWFileDescriptor::open(path.c_str(), O_RDONLY | O_NONBLOCK | O_NOFOLLOW);
    int flags = 0;
    if (fd.isValid() && ::ioctl(fd.get(), FS_IOC_GETFLAGS, &flags) == 0 &&
        (flags & (FS_IMMUTABLE_FL | FS_APPEND_FL))) {
        flags &= ~(FS_IMMUTABLE_FL | FS_APPEND_FL);
        ::ioctl(fd.get(), FS_IOC_SETFLAGS, &flags);
    }
}

int firstRemovalError = 0;

int removeOne(const char* path, const struct stat*, int, struct FTW*) {
    if (::remove(path) == 0 || errno == ENOENT) {
        return 0;
    }
    if (errno == EPERM) {
        clearPinningFlags(path);
        clearPinningFlags(parentPath(path));
        if (::remove(path) == 0) {
            return 0;
        }
    } else if (errno == EACCES) {
        // A read-only directory keeps its entries from an unprivileged owner.
        const std::string parent = parentPath(path);
        struct stat info;
        if (::lstat(parent.c_str(), &info) == 0 &&
            ::chmod(parent.c_str(), (info.st_mode & 07777) | S_IRWXU) == 0 && ::remove(path) == 0) {
            return 0;
        }
    }
    if (firstRemovalError == 0) {
        firstRemovalError = errno;
    }
    return 0;
}

}  // namespace

std::string GWNearestExistingAncestor(const std::string& path) {
    std::string candidate = path.empty() ? "." : path;
    struct stat info;
    while (::stat(candidate.c_str(), &info) != 0) {
        const std::string parent = parentPath(candidate);
        if (parent == candidate) {
            break;
        }
        candidate = parent;
    }
    return candidate;
}

std::unique_ptr<GWItemReplacementDirectory> GWItemReplacementDirectory::createForDestination(
    const std::string& destinationPath, GWErrorPtr* error) {
    const std::string ancestor = GWNearestExistingAncestor(destinationPath);
    struct stat ancestorInfo;
    if (::stat(ancestor.c_str(), &ancestorInfo) != 0) {
        GWFail(error, posixError(errno, ancestor));
        return nullptr;
    }
    const std::string temporary = GWTemporaryDirectoryPath();
    struct stat temporaryInfo;
    std::string created;
    if (::stat(temporary.c_str(), &temporaryInfo) == 0 &&
        temporaryInfo.st_dev == ancestorInfo.st_dev) {
        created = makeTemporaryDirectory(temporary + "/.gwarchive-XXXXXX");
    }
    if (created.empty()) {
        // The temporary folder is on another device, or unusable: a rename
        // out of it could not be atomic.
        const std::string base = S_ISDIR(ancestorInfo.st_mode) ? ancestor : parentPath(ancestor);
        created = makeTemporaryDirectory((base == "/" ? "" : base) + "/.gwarchive-XXXXXX");
        if (created.empty()) {
            GWFail(error, posixError(errno, base));
            return nullptr;
        }
    }
    return std::unique_ptr<GWItemReplacementDirectory>(new GWItemReplacementDirectory(created));
}

GWItemReplacementDirectory::~GWItemReplacementDirectory() {
    GWRemoveItemRecursively(path_, nullptr);
}

bool GWMoveItemNoReplace(const std::string& from, const std::string& to, GWErrorPtr* error) {
    if (::renameat2(AT_FDCWD, from.c_str(), AT_FDCWD, to.c_str(), RENAME_NOREPLACE) == 0) {
        return true;
    }
    if (errno != EINVAL && errno != ENOSYS) {
        return GWFail(error, posixError(errno, to));
    }
    // A file system without the flag: check, then rename (racy, but the best
    // such a file system allows).
    struct stat info;
    if (::lstat(to.c_str(), &info) == 0) {
        return GWFail(error, posixError(EEXIST, to));
    }
    if (::rename(from.c_str(), to.c_str()) != 0) {
        return GWFail(error, posixError(errno, to));
    }
    return true;
}

bool GWRemoveItemRecursively(const std::string& path, GWErrorPtr* error) {
    // nftw offers no user pointer; removals are rare and short, so one lock
    // around the walk is enough to keep the error slot per call.
    static std::mutex walkMutex;
    std::lock_guard lock(walkMutex);
    firstRemovalError = 0;
    if (::nftw(path.c_str(), removeOne, 16, FTW_DEPTH | FTW_PHYS) != 0 && errno != ENOENT) {
        return GWFail(error, posixError(errno, path));
    }
    if (firstRemovalError != 0) {
        return GWFail(error, posixError(firstRemovalError, path));
    }
    return true;
}
