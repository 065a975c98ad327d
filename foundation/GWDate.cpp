#include "GWDate.h"

#include <chrono>
#include <cmath>
#include <cstdio>
#include <ctime>

namespace {

constexpr double kSecondsFrom1601To1970 = 11644473600.0;

// Days from 1970-01-01 to the given proleptic Gregorian date; the month may be
// any integer and rolls into the year.
std::int64_t daysFromCivil(std::int64_t year, std::int64_t month, std::int64_t day) {
    year += (month - 1) >= 0 ? (month - 1) / 12 : -((12 - month) / 12);
    month = ((month - 1) % 12 + 12) % 12 + 1;
    year -= month <= 2;
    const std::int64_t era = (year >= 0 ? year : year - 399) / 400;
    const std::int64_t yoe = year - era * 400;
    const std::int64_t doy = (153 * (month + (month > 2 ? -3 : 9)) + 2) / 5 + day - 1;
    const std::int64_t doe = yoe * 365 + yoe / 4 - yoe / 100 + doy;
    return era * 146097 + doe - 719468;
}

std::int64_t utcSeconds(int year, int month, int day, int hour, int minute, int second) {
    return daysFromCivil(year, month, day) * 86400 + std::int64_t(hour) * 3600 +
           std::int64_t(minute) * 60 + second;
}

}  // namespace

GWDate GWDate::now() {
    const auto since = std::chrono::system_clock::now().time_since_epoch();
    return GWDate(std::chrono::duration<double>(since).count());
}

GWDate GWDate::dateWithNTFSTicks(std::uint64_t ticks) {
    // Whole seconds and the remainder separately keep sub-second precision.
    const double whole = double(ticks / 10000000) - kSecondsFrom1601To1970;
    return GWDate(whole + double(ticks % 10000000) / 1e7);
}

GWDate GWDate::gregorianDateWithYear(int year, int month, int day, int hour, int minute, int second,
                                     const std::optional<GWTimeZone>& timeZone) {
    if (timeZone) {
        return GWDate(
            double(utcSeconds(year, month, day, hour, minute, second) - timeZone->secondsFromGMT));
    }
    // The local zone's offset depends on the date itself (daylight saving,
    // historic offsets), which mktime knows.
    std::tm fields{};
    fields.tm_year = year - 1900;
    fields.tm_mon = month - 1;
    fields.tm_mday = day;
    fields.tm_hour = hour;
    fields.tm_min = minute;
    fields.tm_sec = second;
    fields.tm_isdst = -1;
    const std::time_t t = std::mktime(&fields);
    if (t == std::time_t(-1)) {
        return GWDate(double(utcSeconds(year, month, day, hour, minute, second)));
    }
    return GWDate(double(t));
}

std::optional<GWDate> GWDate::dateWithISO8601String(std::string_view text) {
    // Exactly yyyy-MM-dd'T'HH:mm:ss: 19 characters, digits where digits belong.
    static constexpr std::string_view kShape = "dddd-dd-ddTdd:dd:dd";
    if (text.size() != kShape.size()) {
        return std::nullopt;
    }
    for (std::size_t i = 0; i < kShape.size(); ++i) {
        const bool digit = text[i] >= '0' && text[i] <= '9';
        if (kShape[i] == 'd' ? !digit : text[i] != kShape[i]) {
            return std::nullopt;
        }
    }
    auto number = [&](std::size_t at, std::size_t length) {
        int value = 0;
        for (std::size_t i = at; i < at + length; ++i) {
            value = value * 10 + (text[i] - '0');
        }
        return value;
    };
    const int month = number(5, 2), day = number(8, 2);
    const int hour = number(11, 2), minute = number(14, 2), second = number(17, 2);
    if (month < 1 || month > 12 || day < 1 || day > 31 || hour > 23 || minute > 59 || second > 59) {
        return std::nullopt;
    }
    return gregorianDateWithYear(number(0, 4), month, day, hour, minute, second, GWTimeZone::UTC());
}

std::string GWDate::ISO8601String() const {
    const std::time_t t = std::time_t(wholeSeconds());
    std::tm fields{};
    gmtime_r(&t, &fields);
    char text[64];
    std::snprintf(text, sizeof text, "%04d-%02d-%02dT%02d:%02d:%02dZ", fields.tm_year + 1900,
                  fields.tm_mon + 1, fields.tm_mday, fields.tm_hour, fields.tm_min, fields.tm_sec);
    return text;
}

std::int64_t GWDate::wholeSeconds() const {
    return std::int64_t(std::floor(seconds_));
}

std::int64_t GWDate::nanoseconds() const {
    const auto ns = std::int64_t(std::llround((seconds_ - std::floor(seconds_)) * 1e9));
    return ns >= 1000000000 ? 999999999 : ns;
}
