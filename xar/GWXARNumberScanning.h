#pragma once

#include <cstdint>
#include <optional>
#include <string_view>

// Numbers in table-of-contents text: leading white space is skipped, then as
// many digits as follow are taken and anything after them is ignored. No
// digit, or a value too large for 64 bits, gives none.

std::optional<std::uint64_t> GWXARScanUnsigned(std::string_view text);
std::optional<std::uint64_t> GWXARScanOctal(std::string_view text);
// An optional sign before the digits. `overflowed` tells a value too large
// (or too small) from text without digits.
std::optional<std::int64_t> GWXARScanSigned(std::string_view text, bool* overflowed = nullptr);
