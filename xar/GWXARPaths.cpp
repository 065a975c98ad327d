#include "GWXARPaths.h"

#include <cwctype>

std::vector<std::string> GWXARPathComponents(std::string_view path) {
    std::vector<std::string> components;
    if (path.starts_with('/')) {
        components.emplace_back("/");
    }
    std::size_t start = 0;
    while (start < path.size()) {
        std::size_t end = path.find('/', start);
        if (end == std::string_view::npos) {
            end = path.size();
        }
        if (end > start) {
            components.emplace_back(path.substr(start, end - start));
        }
        start = end + 1;
    }
    return components;
}

std::string GWXARAppendingPathComponent(std::string_view base, std::string_view component) {
    while (component.starts_with('/')) {
        component.remove_prefix(1);
    }
    if (component.empty()) {
        return std::string(base);
    }
    if (base.empty()) {
        return std::string(component);
    }
    std::string result(base);
    if (!result.ends_with('/')) {
        result += '/';
    }
    result += component;
    return result;
}

namespace {

bool isDigit(char c) {
    return c >= '0' && c <= '9';
}

// The code point at `at`, advancing past it. A byte that does not start a
// well-formed sequence stands for itself in the surrogate range, so every
// byte string has its place in the order.
char32_t nextCodePoint(std::string_view text, std::size_t& at) {
    const auto lead = static_cast<unsigned char>(text[at]);
    std::size_t length = lead < 0x80           ? 1
                         : (lead >> 5) == 0x6  ? 2
                         : (lead >> 4) == 0xE  ? 3
                         : (lead >> 3) == 0x1E ? 4
                                               : 0;
    if (length == 1) {
        ++at;
        return lead;
    }
    if (length == 0 || at + length > text.size()) {
        ++at;
        return 0xDC00 + lead;
    }
    char32_t value = lead & (0x7F >> length);
    for (std::size_t i = 1; i < length; ++i) {
        const auto next = static_cast<unsigned char>(text[at + i]);
        if ((next & 0xC0) != 0x80) {
            ++at;
            return 0xDC00 + lead;
        }
        value = (value << 6) | (next & 0x3F);
    }
    at += length;
    return value;
}

char32_t folded(char32_t c) {
    return static_cast<char32_t>(std::towlower(static_cast<wint_t>(c)));
}

// Compares the digit runs starting at `i` and `j` by value and moves past them.
int compareNumbers(std::string_view a, std::size_t& i, std::string_view b, std::size_t& j) {
    auto run = [](std::string_view text, std::size_t& at) {
        while (at < text.size() && text[at] == '0' && at + 1 < text.size() &&
               isDigit(text[at + 1])) {
            ++at;
        }
        const std::size_t start = at;
        while (at < text.size() && isDigit(text[at])) {
            ++at;
        }
        return text.substr(start, at - start);
    };
    const std::string_view x = run(a, i);
    const std::string_view y = run(b, j);
    if (x.size() != y.size()) {
        return x.size() < y.size() ? -1 : 1;
    }
    return x.compare(y) < 0 ? -1 : x.compare(y) > 0 ? 1 : 0;
}

}  // namespace

int GWXARCompareNames(std::string_view a, std::string_view b) {
    std::size_t i = 0, j = 0;
    while (i < a.size() && j < b.size()) {
        if (isDigit(a[i]) && isDigit(b[j])) {
            if (int order = compareNumbers(a, i, b, j)) {
                return order;
            }
            continue;
        }
        const char32_t x = folded(nextCodePoint(a, i));
        const char32_t y = folded(nextCodePoint(b, j));
        if (x != y) {
            return x < y ? -1 : 1;
        }
    }
    if (i < a.size()) {
        return 1;
    }
    return j < b.size() ? -1 : 0;
}
