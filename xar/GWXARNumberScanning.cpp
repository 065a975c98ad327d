#include "GWXARNumberScanning.h"

#include <limits>

namespace {

bool isSpace(char c) {
    return c == ' ' || c == '\t' || c == '\n' || c == '\r' || c == '\v' || c == '\f';
}

std::string_view skipSpace(std::string_view text) {
    while (!text.empty() && isSpace(text.front())) {
        text.remove_prefix(1);
    }
    return text;
}

// Digits of `base` (at most 10) from the front of `text`; none without one,
// and `overflowed` set when the value passes `limit`.
std::optional<std::uint64_t> scanMagnitude(std::string_view text, unsigned base,
                                           std::uint64_t limit, bool* overflowed) {
    std::uint64_t value = 0;
    std::size_t digits = 0;
    bool tooLarge = false;
    for (char c : text) {
        if (c < '0' || c >= char('0' + base)) {
            break;
        }
        const unsigned digit = unsigned(c - '0');
        if (value > (limit - digit) / base) {
            tooLarge = true;
        } else {
            value = value * base + digit;
        }
        ++digits;
    }
    if (overflowed) {
        *overflowed = digits > 0 && tooLarge;
    }
    if (digits == 0 || tooLarge) {
        return std::nullopt;
    }
    return value;
}

}  // namespace

std::optional<std::uint64_t> GWXARScanUnsigned(std::string_view text) {
    return scanMagnitude(skipSpace(text), 10, std::numeric_limits<std::uint64_t>::max(), nullptr);
}

std::optional<std::uint64_t> GWXARScanOctal(std::string_view text) {
    return scanMagnitude(skipSpace(text), 8, std::numeric_limits<std::uint64_t>::max(), nullptr);
}

std::optional<std::int64_t> GWXARScanSigned(std::string_view text, bool* overflowed) {
    text = skipSpace(text);
    bool negative = false;
    if (!text.empty() && (text.front() == '-' || text.front() == '+')) {
        negative = text.front() == '-';
        text.remove_prefix(1);
    }
    // The magnitude of INT64_MIN is one more than INT64_MAX.
    const std::uint64_t limit = std::uint64_t(std::numeric_limits<std::int64_t>::max()) + negative;
    auto magnitude = scanMagnitude(text, 10, limit, overflowed);
    if (!magnitude) {
        return std::nullopt;
    }
    if (negative) {
        return *magnitude == limit ? std::numeric_limits<std::int64_t>::min()
                                   : -std::int64_t(*magnitude);
    }
    return std::int64_t(*magnitude);
}
