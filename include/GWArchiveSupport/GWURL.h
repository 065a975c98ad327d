#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "GWExport.h"

// A location: a file URL ("file:///abs/path") or a remote one ("https://host/x").
// A string without a scheme makes a relative URL, which is neither.
class GW_EXPORT GWURL {
public:
    GWURL() = default;

    // A relative path is taken relative to the current directory.
    static GWURL fileURLWithPath(std::string_view path, bool isDirectory = false);
    // None when the text is not a well-formed URL (a bad scheme, a bad escape,
    // a file URL naming another host).
    static std::optional<GWURL> URLWithString(std::string_view text);

    bool isEmpty() const { return scheme_.empty() && path_.empty() && authority_.empty(); }
    bool isFileURL() const { return scheme_ == "file"; }
    // Lower-case scheme; empty for a relative URL.
    const std::string& scheme() const { return scheme_; }
    const std::string& host() const { return authority_; }
    // The decoded path, without a trailing slash (except "/" itself).
    std::string path() const;
    bool hasDirectoryPath() const { return directory_; }

    std::string lastPathComponent() const;
    std::string pathExtension() const;
    GWURL URLByAppendingPathComponent(std::string_view component, bool isDirectory = false) const;
    GWURL URLByDeletingLastPathComponent() const;
    std::string absoluteString() const;

    friend bool operator==(const GWURL&, const GWURL&) = default;

private:
    std::string scheme_;
    std::string authority_;
    std::string path_;    // decoded; may end in "/" only when it is "/"
    std::string suffix_;  // "?query#fragment" as given
    bool directory_ = false;
};

// Percent-decodes a URL component; none for a malformed escape.
GW_EXPORT std::optional<std::string> GWPercentDecode(std::string_view text);
