#include "MetadataTestSupport.h"

#include <sys/stat.h>
#include <sys/xattr.h>

#include <fstream>

namespace gwtest {

std::optional<GWData> rawAttribute(const std::string& path, const std::string& linuxName) {
    const ssize_t size = lgetxattr(path.c_str(), linuxName.c_str(), nullptr, 0);
    if (size < 0) {
        return std::nullopt;
    }
    GWData value(static_cast<std::size_t>(size));
    const ssize_t got = lgetxattr(path.c_str(), linuxName.c_str(), value.data(), value.size());
    if (got < 0) {
        return std::nullopt;
    }
    value.resize(std::size_t(got));
    return value;
}

bool userAttributesSupported(const std::string& directory) {
    const std::string probe = directory + "/.xattr-probe";
    std::ofstream(probe).put('x');
    const bool supported = lsetxattr(probe.c_str(), "user.probe", "1", 1, 0) == 0;
    ::unlink(probe.c_str());
    return supported;
}

bool fileExists(const std::string& path) {
    struct stat info {};
    return ::lstat(path.c_str(), &info) == 0;
}

}  // namespace gwtest
