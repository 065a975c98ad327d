#pragma once

#include <cstdlib>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "foundation/GWLog.h"
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

}  // namespace gwtest
