#include "GWPropertyListSerialization.h"

namespace {

int sextet(char c) {
    if (c >= 'A' && c <= 'Z')
        return c - 'A';
    if (c >= 'a' && c <= 'z')
        return c - 'a' + 26;
    if (c >= '0' && c <= '9')
        return c - '0' + 52;
    if (c == '+')
        return 62;
    if (c == '/')
        return 63;
    return -1;
}

bool isSpace(char c) {
    return c == ' ' || c == '\n' || c == '\r' || c == '\t';
}

std::nullopt_t invalid(GWErrorPtr* error, std::size_t at, const char* why) {
    GWFail(error, GWGenerateError(kGWCocoaErrorDomain, GWFileReadCorruptFileError, std::nullopt,
                                  nullptr, {}, "Invalid base64 text at offset %zu: %s", at, why));
    return std::nullopt;
}

}  // namespace

std::optional<GWData> GWPropertyListSerialization::dataWithBase64String(std::string_view text,
                                                                        GWErrorPtr* error) {
    GWData bytes;
    bytes.reserve(text.size() / 4 * 3);
    std::uint32_t group = 0;
    int inGroup = 0;
    int padding = 0;
    for (std::size_t i = 0; i < text.size(); ++i) {
        const char c = text[i];
        if (isSpace(c)) {
            continue;
        }
        if (c == '=') {
            // Padding completes a group of two or three characters.
            if (inGroup + padding < 2) {
                return invalid(error, i, "padding in the wrong place");
            }
            if (++padding + inGroup > 4) {
                return invalid(error, i, "too much padding");
            }
            continue;
        }
        const int value = sextet(c);
        if (value < 0) {
            return invalid(error, i, "not a base64 character");
        }
        if (padding > 0) {
            return invalid(error, i, "text after the padding");
        }
        group = (group << 6) | std::uint32_t(value);
        if (++inGroup == 4) {
            bytes.push_back(std::uint8_t(group >> 16));
            bytes.push_back(std::uint8_t(group >> 8));
            bytes.push_back(std::uint8_t(group));
            group = 0;
            inGroup = 0;
        }
    }
    if (inGroup == 1) {
        return invalid(error, text.size(), "a lone character at the end");
    }
    if (padding > 0 && inGroup + padding != 4) {
        return invalid(error, text.size(), "incomplete padding");
    }
    if (inGroup == 2) {
        bytes.push_back(std::uint8_t(group >> 4));
    } else if (inGroup == 3) {
        bytes.push_back(std::uint8_t(group >> 10));
        bytes.push_back(std::uint8_t(group >> 2));
    }
    return bytes;
}
