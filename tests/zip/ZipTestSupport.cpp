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

}  // namespace gwtest
