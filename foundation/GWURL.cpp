#include "GWURL.h"

#include <unistd.h>

#include <cctype>
#include <climits>

namespace {

bool isSchemeCharacter(char c, bool first) {
    if (std::isalpha(static_cast<unsigned char>(c))) {
        return true;
    }
    return !first &&
           (std::isdigit(static_cast<unsigned char>(c)) || c == '+' || c == '-' || c == '.');
}

std::string percentEncodePath(const std::string& path) {
    static const char kHex[] = "0123456789ABCDEF";
    std::string out;
    for (unsigned char c : path) {
        if (std::isalnum(c) ||
            std::string_view("/-._~!$&'()*+,;=:@").find(c) != std::string_view::npos) {
            out += char(c);
        } else {
            out += '%';
            out += kHex[c >> 4];
            out += kHex[c & 15];
        }
    }
    return out;
}

std::string currentDirectory() {
    char buffer[PATH_MAX];
    return getcwd(buffer, sizeof buffer) ? std::string(buffer) : std::string("/");
}

}  // namespace

std::optional<std::string> GWPercentDecode(std::string_view text) {
    std::string out;
    out.reserve(text.size());
    for (std::size_t i = 0; i < text.size(); ++i) {
        if (text[i] != '%') {
            out += text[i];
            continue;
        }
        if (i + 2 >= text.size() || !std::isxdigit(static_cast<unsigned char>(text[i + 1])) ||
            !std::isxdigit(static_cast<unsigned char>(text[i + 2]))) {
            return std::nullopt;
        }
        out += char(std::stoi(std::string(text.substr(i + 1, 2)), nullptr, 16));
        i += 2;
    }
    return out;
}

GWURL GWURL::fileURLWithPath(std::string_view path, bool isDirectory) {
    GWURL url;
    url.scheme_ = "file";
    std::string full(path);
    if (full.empty() || full[0] != '/') {
        const std::string base = currentDirectory();
        full = base + (base.back() == '/' ? "" : "/") + full;
    }
    while (full.size() > 1 && full.back() == '/') {
        full.pop_back();
        isDirectory = true;
    }
    url.path_ = full;
    url.directory_ = isDirectory || full == "/";
    return url;
}

std::optional<GWURL> GWURL::URLWithString(std::string_view text) {
    GWURL url;
    std::size_t colon = text.find(':');
    std::string_view rest = text;
    if (colon != std::string_view::npos && colon > 0) {
        bool valid = true;
        for (std::size_t i = 0; i < colon; ++i) {
            valid = valid && isSchemeCharacter(text[i], i == 0);
        }
        if (valid) {
            for (char c : text.substr(0, colon)) {
                url.scheme_ += char(std::tolower(static_cast<unsigned char>(c)));
            }
            rest = text.substr(colon + 1);
        }
    }
    for (char c : text) {
        if (static_cast<unsigned char>(c) <= ' ') {
            return std::nullopt;
        }
    }
    if (!url.scheme_.empty() && rest.substr(0, 2) == "//") {
        rest.remove_prefix(2);
        const std::size_t slash = rest.find_first_of("/?#");
        url.authority_ = std::string(rest.substr(0, slash));
        rest = slash == std::string_view::npos ? std::string_view() : rest.substr(slash);
    }
    const std::size_t suffixStart = rest.find_first_of("?#");
    if (suffixStart != std::string_view::npos) {
        url.suffix_ = std::string(rest.substr(suffixStart));
        rest = rest.substr(0, suffixStart);
    }
    auto decoded = GWPercentDecode(rest);
    if (!decoded) {
        return std::nullopt;
    }
    url.path_ = *decoded;
    if (url.isFileURL()) {
        if (!url.authority_.empty() && url.authority_ != "localhost") {
            return std::nullopt;
        }
        url.authority_.clear();
        if (url.path_.empty() || url.path_[0] != '/') {
            return std::nullopt;
        }
    }
    while (url.path_.size() > 1 && url.path_.back() == '/') {
        url.path_.pop_back();
        url.directory_ = true;
    }
    url.directory_ = url.directory_ || url.path_ == "/";
    if (url.isEmpty()) {
        return std::nullopt;
    }
    return url;
}

std::string GWURL::path() const {
    return path_;
}

std::string GWURL::lastPathComponent() const {
    if (path_ == "/") {
        return "/";
    }
    const std::size_t slash = path_.rfind('/');
    return slash == std::string::npos ? path_ : path_.substr(slash + 1);
}

std::string GWURL::pathExtension() const {
    const std::string last = lastPathComponent();
    const std::size_t dot = last.rfind('.');
    if (dot == std::string::npos || dot == 0 || dot + 1 == last.size()) {
        return "";
    }
    return last.substr(dot + 1);
}

GWURL GWURL::URLByAppendingPathComponent(std::string_view component, bool isDirectory) const {
    GWURL url = *this;
    std::string piece(component);
    while (piece.size() > 1 && piece.back() == '/') {
        piece.pop_back();
        isDirectory = true;
    }
    if (url.path_.empty() || url.path_.back() != '/') {
        url.path_ += '/';
    }
    url.path_ += piece;
    while (url.path_.size() > 1 && url.path_.back() == '/') {
        url.path_.pop_back();
    }
    url.directory_ = isDirectory;
    return url;
}

GWURL GWURL::URLByDeletingLastPathComponent() const {
    GWURL url = *this;
    const std::size_t slash = path_.rfind('/');
    if (slash == std::string::npos) {
        url.path_ = "";
    } else {
        url.path_ = slash == 0 ? "/" : path_.substr(0, slash);
    }
    url.directory_ = true;
    return url;
}

std::string GWURL::absoluteString() const {
    std::string text;
    if (!scheme_.empty()) {
        text = scheme_ + ":";
        if (isFileURL() || !authority_.empty()) {
            text += "//" + authority_;
        }
    }
    text += percentEncodePath(path_);
    if (directory_ && !path_.empty() && path_.back() != '/') {
        text += '/';
    }
    return text + suffix_;
}
