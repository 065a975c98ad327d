#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

// The text encodings archive names and classic Mac fields come in.
enum class GWStringEncoding {
    UTF8,
    WindowsCP1250,
    WindowsCP1251,
    WindowsCP1252,
    WindowsCP1253,
    WindowsCP1254,
    ShiftJIS,
    MacOSRoman,
    ISOLatin1,
};

// The bytes as UTF-8 text; none when they are not valid in the encoding
// (UTF-8 must be well formed: no overlong forms, surrogates or values past U+10FFFF).
std::optional<std::string> GWStringFromBytes(std::span<const std::uint8_t> bytes,
                                             GWStringEncoding encoding);
std::optional<std::string> GWStringFromBytes(std::string_view bytes, GWStringEncoding encoding);
// The bytes as UTF-8 text from the encoding iconv calls `iconvName` (such as
// "CP437"); none when iconv does not know the name or the bytes are not valid in it.
std::optional<std::string> GWStringFromBytesInNamedEncoding(std::string_view bytes,
                                                            const std::string& iconvName);
bool GWIsKnownEncodingName(const std::string& iconvName);
// UTF-8 text in the encoding; none when a character has no place in it.
std::optional<std::string> GWBytesFromString(std::string_view text, GWStringEncoding encoding);

bool GWIsValidUTF8(std::span<const std::uint8_t> bytes);
