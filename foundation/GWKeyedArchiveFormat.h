#pragma once

#include <string>
#include <string_view>

// Names shared by GWKeyedArchiver and GWKeyedUnarchiver.
namespace GWKeyedArchiveFormat {

inline constexpr std::string_view kArchiverKey = "$archiver";
inline constexpr std::string_view kArchiverName = "GWKeyedArchiver";
inline constexpr std::string_view kVersionKey = "$version";
inline constexpr long kVersion = 1;
inline constexpr std::string_view kTopKey = "$top";
inline constexpr std::string_view kClassKey = "$class";
inline constexpr std::string_view kRootKey = "root";

// Keys beginning with "$" are the archive's own; a caller's key that begins
// with "$" is stored with one more, so no caller's dictionary is ever taken
// for an object.
inline std::string escapedKey(const std::string& key) {
    return !key.empty() && key[0] == '$' ? "$" + key : key;
}

inline std::string unescapedKey(const std::string& key) {
    return key.size() > 1 && key[0] == '$' && key[1] == '$' ? key.substr(1) : key;
}

}  // namespace GWKeyedArchiveFormat
