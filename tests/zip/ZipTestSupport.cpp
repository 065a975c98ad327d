#include "ZipTestSupport.h"

#include <cstdio>
#include <ctime>

#include "support/TestSupport.h"

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

std::string zipTreeShape(const GWZipFileArray& files, const GWZipFilePtr& parent) {
    std::string text;
    for (const auto& file : files) {
        text += (text.empty() ? "" : " ") + file->name() + (file->parent() != parent ? "!" : "");
        if (file->isDirectory()) {
            char mode[8];
            std::snprintf(mode, sizeof mode, "/%o", file->permissionsMode() & 0777);
            text += mode;
        }
        if (auto companion = file->appleDoubleFile()) {
            text += "[" + companion->name() + "]";
        }
        if (auto fork = file->resourceFork()) {
            text += "{" + fork->name() + "}";
        }
        if (auto children = file->children()) {
            text += "(" + zipTreeShape(*children, file) + ")";
        }
    }
    return text;
}

ZipBuilder zipOfNames(const std::vector<std::string>& names) {
    ZipBuilder zip;
    for (const std::string& name : names) {
        if (name.back() == '/') {
            zip.addDirectory(name).externalAttributes = 040700u << 16;
        } else {
            zip.addFile(name, bytesOf("x"));
        }
    }
    return zip;
}

}  // namespace gwtest
