#include "GWFreeSpace.h"

#include <sys/statvfs.h>

#include <cerrno>
#include <string>

namespace {

// Room the file system keeps for its own blocks and for each file's last,
// partly filled one; a small margin rather than a promise.
constexpr std::uint64_t kMargin = 64 * 1024;

}  // namespace

bool GWCheckFreeSpace(const GWURL& directory, std::uint64_t bytesNeeded, GWErrorPtr* error) {
    if (!directory.isFileURL()) {
        return true;
    }
    std::string path = directory.path();
    struct statvfs info;
    while (statvfs(path.c_str(), &info) != 0) {
        if (errno != ENOENT && errno != ENOTDIR) {
            return true;  // a destination that cannot be asked fails later, when written
        }
        const auto slash = path.find_last_of('/');
        if (slash == std::string::npos || path == "/") {
            return true;
        }
        path = slash == 0 ? "/" : path.substr(0, slash);
    }
    const std::uint64_t available = std::uint64_t(info.f_bavail) * info.f_frsize;
    const std::uint64_t needed =
        bytesNeeded > UINT64_MAX - kMargin ? UINT64_MAX : bytesNeeded + kMargin;
    if (needed <= available) {
        return true;
    }
    return GWFail(error, GWGenerateError(kGWPOSIXErrorDomain, ENOSPC, directory, nullptr, {},
                                         "Not enough free space in %s: %llu bytes are needed and "
                                         "%llu are free.",
                                         path.c_str(), (unsigned long long)bytesNeeded,
                                         (unsigned long long)available));
}
