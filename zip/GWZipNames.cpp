#include "GWZipNames.h"

#include <algorithm>

#include "foundation/GWContainment.h"

std::string GWZipFilenameFromMacName(std::string_view name) {
    std::string converted(name);
    std::replace(converted.begin(), converted.end(), '/', ':');
    return converted;
}

std::string_view GWZipLastPOSIXPathComponent(std::string_view path) {
    while (!path.empty() && path.back() == '/') {
        path.remove_suffix(1);
    }
    const auto slash = path.rfind('/');
    return slash == std::string_view::npos ? path : path.substr(slash + 1);
}

std::string GWZipLastHFSPathComponent(std::string_view path) {
    while (!path.empty() && path.back() == ':') {
        path.remove_suffix(1);
    }
    const auto colon = path.rfind(':');
    return GWZipFilenameFromMacName(colon == std::string_view::npos ? path
                                                                    : path.substr(colon + 1));
}

bool GWZipIsSafeFilename(std::string_view name) {
    return GWIsPlainPathComponent(name);
}
