#include "ZipTestSupport.h"

#include <ctime>

namespace gwtest {

ZipLogCapture::ZipLogCapture() {
    previous_ = GWSetLogSink([this](const std::string& line) { lines_.push_back(line); });
}

ZipLogCapture::~ZipLogCapture() {
    GWSetLogSink(previous_);
}

bool ZipLogCapture::contains(const std::string& line) const {
    for (const auto& logged : lines_) {
        if (logged == line) {
            return true;
        }
    }
    return false;
}

ScopedTimeZone::ScopedTimeZone(const char* zone) {
    if (const char* current = std::getenv("TZ")) {
        previous_ = current;
    }
    setenv("TZ", zone, 1);
    tzset();
}

ScopedTimeZone::~ScopedTimeZone() {
    if (previous_) {
        setenv("TZ", previous_->c_str(), 1);
    } else {
        unsetenv("TZ");
    }
    tzset();
}

std::optional<std::uint64_t> unsignedInfo(const GWDictionary& info, const char* key) {
    const GWValue* value = GWDictionaryValue(info, key);
    if (!value || !value->isInteger()) {
        return std::nullopt;
    }
    return value->unsignedValue();
}

std::optional<std::int64_t> signedInfo(const GWDictionary& info, const char* key) {
    const GWValue* value = GWDictionaryValue(info, key);
    if (!value || !value->isInteger()) {
        return std::nullopt;
    }
    return value->integerValue();
}

std::optional<std::string> stringInfo(const GWDictionary& info, const char* key) {
    const GWValue* value = GWDictionaryValue(info, key);
    if (!value || !value->string()) {
        return std::nullopt;
    }
    return *value->string();
}

std::optional<double> dateInfo(const GWDictionary& info, const char* key) {
    const GWValue* value = GWDictionaryValue(info, key);
    if (!value || !value->date()) {
        return std::nullopt;
    }
    return value->date()->timeIntervalSince1970();
}

std::optional<bool> boolInfo(const GWDictionary& info, const char* key) {
    const GWValue* value = GWDictionaryValue(info, key);
    if (!value || !value->isBool()) {
        return std::nullopt;
    }
    return value->boolValue();
}

double utcSeconds(int year, int month, int day, int hour, int minute, int second) {
    std::tm fields{};
    fields.tm_year = year - 1900;
    fields.tm_mon = month - 1;
    fields.tm_mday = day;
    fields.tm_hour = hour;
    fields.tm_min = minute;
    fields.tm_sec = second;
    return double(timegm(&fields));
}

std::uint64_t ntfsTicks(double secondsSince1970) {
    return std::uint64_t((secondsSince1970 + 11644473600.0) * 1e7);
}

}  // namespace gwtest
