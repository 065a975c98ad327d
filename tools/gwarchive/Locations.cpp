#include "Locations.h"

#include <filesystem>

namespace gwarchive {

GWURL localURL(const std::string& path) {
    std::error_code ignored;
    std::filesystem::path absolute = std::filesystem::absolute(path, ignored);
    return GWURL::fileURLWithPath(absolute.empty() ? path : absolute.string());
}

GWURL archiveURL(const std::string& operand) {
    for (const char* scheme : {"http://", "https://", "file://"}) {
        if (operand.rfind(scheme, 0) == 0) {
            if (auto url = GWURL::URLWithString(operand))
                return *url;
        }
    }
    return localURL(operand);
}

}  // namespace gwarchive
