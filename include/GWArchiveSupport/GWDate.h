#pragma once

#include <compare>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "GWExport.h"

// A time zone given as a fixed offset from UTC. Where an interface takes an
// optional zone, none means the system's current zone (with its daylight
// saving rules).
struct GW_EXPORT GWTimeZone {
    std::int32_t secondsFromGMT = 0;

    static GWTimeZone UTC() { return GWTimeZone{0}; }
};

// A point in time: seconds since 1970-01-01 00:00:00 UTC.
class GW_EXPORT GWDate {
public:
    constexpr GWDate() = default;
    constexpr explicit GWDate(double secondsSince1970) : seconds_(secondsSince1970) {}

    static GWDate now();
    static GWDate dateWithTimeIntervalSince1970(double seconds) { return GWDate(seconds); }
    // 100-nanosecond ticks since 1601-01-01 00:00:00 UTC.
    static GWDate dateWithNTFSTicks(std::uint64_t ticks);

    // Calendar fields in the Gregorian calendar; fields out of their usual
    // range roll over into the next larger one (second 61 is a minute and 1).
    static GWDate gregorianDateWithYear(int year, int month, int day, int hour, int minute,
                                        int second,
                                        const std::optional<GWTimeZone>& timeZone = std::nullopt);

    // "yyyy-MM-dd'T'HH:mm:ss" in UTC; the whole text must match.
    static std::optional<GWDate> dateWithISO8601String(std::string_view text);
    // The same pattern with a trailing "Z".
    std::string ISO8601String() const;

    double timeIntervalSince1970() const { return seconds_; }
    GWDate dateByAddingTimeInterval(double seconds) const { return GWDate(seconds_ + seconds); }

    // Whole seconds and nanoseconds, rounded towards the past, for timespec.
    std::int64_t wholeSeconds() const;
    std::int64_t nanoseconds() const;

    friend auto operator<=>(const GWDate&, const GWDate&) = default;

private:
    double seconds_ = 0;
};
