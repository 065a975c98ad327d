#include "GWMetadataNames.h"

#include <array>

namespace {

constexpr std::string_view kUserNamespace = "user.";

bool hasLinuxNamespace(std::string_view name) {
    static constexpr std::array<std::string_view, 4> kNamespaces = {"user.", "trusted.",
                                                                    "security.", "system."};
    for (const auto prefix : kNamespaces) {
        if (name.starts_with(prefix)) {
            return true;
        }
    }
    return false;
}

}  // namespace

std::string GWLinuxAttributeName(std::string_view name) {
    if (hasLinuxNamespace(name)) {
        return std::string(name);
    }
    return std::string(kUserNamespace) + std::string(name);
}

std::string GWMacAttributeName(std::string_view linuxName) {
    if (linuxName.starts_with(kUserNamespace)) {
        return std::string(linuxName.substr(kUserNamespace.size()));
    }
    return std::string(linuxName);
}
