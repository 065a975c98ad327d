#include "GWConversions.h"

#include <sys/random.h>

#include <cstdio>
#include <random>

#include "GWStringEncoding.h"

std::uint32_t GWFourCharCode(std::string_view text) {
    const auto bytes = GWBytesFromString(text, GWStringEncoding::MacOSRoman);
    if (!bytes || bytes->size() != 4) {
        return 0;
    }
    std::uint32_t code = 0;
    for (unsigned char c : *bytes) {
        code = (code << 8) | c;
    }
    return code;
}

std::string GWStringWithFourCharCode(std::uint32_t code) {
    const char bytes[4] = {char(code >> 24), char(code >> 16), char(code >> 8), char(code)};
    return GWStringFromBytes(std::string_view(bytes, 4), GWStringEncoding::MacOSRoman)
        .value_or(std::string());
}

std::optional<std::uint64_t> GWNumberWithLittleEndianIntegerData(
    std::span<const std::uint8_t> bytes) {
    if (bytes.empty() || bytes.size() > 8) {
        return std::nullopt;
    }
    std::uint64_t value = 0;
    for (std::size_t i = bytes.size(); i-- > 0;) {
        value = (value << 8) | bytes[i];
    }
    return value;
}

std::string GWUniqueID() {
    std::uint8_t bytes[16];
    if (getrandom(bytes, sizeof bytes, 0) != ssize_t(sizeof bytes)) {
        std::random_device device;
        for (auto& b : bytes) {
            b = std::uint8_t(device());
        }
    }
    bytes[6] = std::uint8_t((bytes[6] & 0x0F) | 0x40);  // version 4
    bytes[8] = std::uint8_t((bytes[8] & 0x3F) | 0x80);  // RFC 4122 variant
    char text[37];
    std::snprintf(text, sizeof text,
                  "%02X%02X%02X%02X-%02X%02X-%02X%02X-%02X%02X-%02X%02X%02X%02X%02X%02X", bytes[0],
                  bytes[1], bytes[2], bytes[3], bytes[4], bytes[5], bytes[6], bytes[7], bytes[8],
                  bytes[9], bytes[10], bytes[11], bytes[12], bytes[13], bytes[14], bytes[15]);
    return text;
}
