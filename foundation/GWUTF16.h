#pragma once

#include <string>
#include <string_view>

// Conversions between the library's UTF-8 strings and UTF-16 code units, for
// formats that store text as UTF-16. Malformed input never fails: each byte of
// a malformed UTF-8 sequence, and each unpaired surrogate, becomes U+FFFD.
std::u16string GWUTF16FromUTF8(std::string_view text);
std::string GWUTF8FromUTF16(std::u16string_view units);

// Whether every byte is below 0x80.
bool GWIsASCII(std::string_view text);
