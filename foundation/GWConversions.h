#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

// A four-character string (Mac OS Roman) to its code, first character in the
// high byte; 0 for anything that is not exactly four such characters.
std::uint32_t GWFourCharCode(std::string_view text);
// The inverse: the four bytes read as Mac OS Roman.
std::string GWStringWithFourCharCode(std::uint32_t code);

// 1 to 8 little-endian bytes as a number; none for other lengths.
std::optional<std::uint64_t> GWNumberWithLittleEndianIntegerData(
    std::span<const std::uint8_t> bytes);

// A fresh unique string (a random UUID in upper-case hex).
std::string GWUniqueID();
