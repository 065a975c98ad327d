#pragma once

#include <cstdlib>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "foundation/GWLog.h"
#include "support/ZipBuilder.h"
#include "zip/GWZipArchive.h"
#include "zip/GWZipWorkOperation.h"

namespace gwtest {

// Collects the library's log lines while it lives.
class ZipLogCapture {
public:
    ZipLogCapture();
    ~ZipLogCapture();
    ZipLogCapture(const ZipLogCapture&) = delete;
    ZipLogCapture& operator=(const ZipLogCapture&) = delete;

    const std::vector<std::string>& lines() const { return lines_; }
    bool contains(const std::string& line) const;

private:
    std::vector<std::string> lines_;
    GWLogSink previous_;
};

// Sets TZ (a POSIX zone string such as "XXX-2", two hours east) while it lives.
class ScopedTimeZone {
public:
    explicit ScopedTimeZone(const char* zone);
    ~ScopedTimeZone();
    ScopedTimeZone(const ScopedTimeZone&) = delete;
    ScopedTimeZone& operator=(const ScopedTimeZone&) = delete;

private:
    std::optional<std::string> previous_;
};

// The tree as "name" for files and "name/mode" for directories (octal
// permission bits), then "[._name]" for an AppleDouble companion, "{name}"
// for a resource fork and the children in parentheses; "!" marks a node
// whose parent link is wrong.
std::string zipTreeShape(const GWZipFileArray& files, const GWZipFilePtr& parent = nullptr);

// Names ending in "/" become directories of mode 700, the rest files.
ZipBuilder zipOfNames(const std::vector<std::string>& names);

}  // namespace gwtest
