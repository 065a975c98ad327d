#include "GWContainment.h"

#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>

namespace {

// -1: ask the process; 0 or 1: the answer a test set.
std::atomic<int> gDeviceNodeOverride{-1};

}  // namespace

bool GWIsPlainPathComponent(std::string_view name) {
    return !name.empty() && name != "." && name != ".." &&
           name.find_first_of(std::string_view("/\0", 2)) == std::string_view::npos;
}

std::optional<std::string> GWRelativePathBelow(const GWURL& root, const GWURL& destination) {
    if (!root.isFileURL() || !destination.isFileURL()) {
        return std::nullopt;
    }
    const std::string base = root.path();
    const std::string path = destination.path();
    const std::size_t prefix = base == "/" ? 1 : base.size() + 1;
    if (path.size() <= prefix || path.compare(0, base.size(), base) != 0 ||
        path[prefix - 1] != '/') {
        return std::nullopt;
    }
    std::string relative = path.substr(prefix);
    std::size_t start = 0;
    while (start <= relative.size()) {
        std::size_t end = relative.find('/', start);
        if (end == std::string::npos) {
            end = relative.size();
        }
        if (!GWIsPlainPathComponent(std::string_view(relative).substr(start, end - start))) {
            return std::nullopt;
        }
        start = end + 1;
    }
    return relative;
}

bool GWIsContainedDestination(const GWURL& root, const GWURL& destination) {
    const auto relative = GWRelativePathBelow(root, destination);
    if (!relative) {
        return false;
    }
    std::string path = root.path();
    std::size_t start = 0;
    for (std::size_t end = relative->find('/'); end != std::string::npos;
         start = end + 1, end = relative->find('/', start)) {
        if (path.back() != '/') {
            path += '/';
        }
        path.append(*relative, start, end - start);
        struct stat info;
        if (::lstat(path.c_str(), &info) != 0) {
            // Nothing below a missing directory exists yet either.
            return errno == ENOENT;
        }
        if (!S_ISDIR(info.st_mode)) {
            return false;
        }
    }
    return true;
}

bool GWMayCreateDeviceNodes() {
    const int override = gDeviceNodeOverride.load();
    return override >= 0 ? override == 1 : ::geteuid() == 0;
}

void GWOverrideMayCreateDeviceNodes(std::optional<bool> allowed) {
    gDeviceNodeOverride.store(allowed ? int(*allowed) : -1);
}
