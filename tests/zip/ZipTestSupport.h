#pragma once

#include <cstdlib>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "foundation/GWLog.h"
#include "foundation/GWValue.h"
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

// The value under `key`, for assertions: none when absent.
std::optional<std::uint64_t> unsignedInfo(const GWDictionary& info, const char* key);
std::optional<std::int64_t> signedInfo(const GWDictionary& info, const char* key);
std::optional<std::string> stringInfo(const GWDictionary& info, const char* key);
std::optional<double> dateInfo(const GWDictionary& info, const char* key);  // seconds since 1970
std::optional<bool> boolInfo(const GWDictionary& info, const char* key);

// Seconds since 1970 for a UTC calendar time.
double utcSeconds(int year, int month, int day, int hour, int minute, int second);
// NTFS ticks for seconds since 1970.
std::uint64_t ntfsTicks(double secondsSince1970);

}  // namespace gwtest
