#include "Diagnostics.h"

#include <cstdio>

namespace gwarchive {

namespace {

std::string prefix(const std::string& archive, const std::optional<std::string>& path) {
    std::string line = "gwarchive: " + archive;
    if (path)
        line += ": " + *path;
    return line;
}

}  // namespace

void reportError(const std::string& archive, const std::optional<std::string>& path,
                 const GWErrorPtr& error) {
    if (!error) {
        reportFailure(archive, path, "unknown error");
        return;
    }
    std::fprintf(stderr, "%s: %s (%s %ld)\n", prefix(archive, path).c_str(),
                 error->localizedDescription().c_str(), error->domain().c_str(), error->code());
}

void reportFailure(const std::string& archive, const std::optional<std::string>& path,
                   const std::string& message) {
    std::fprintf(stderr, "%s: %s\n", prefix(archive, path).c_str(), message.c_str());
}

namespace {
bool damaged = false;
}

void reportDamage(const std::string& archive, const std::string& message) {
    reportFailure(archive, std::nullopt, message);
    damaged = true;
}

int exitStatusAfterDamage(int status) {
    return status == kExitSuccess && damaged ? kExitFailure : status;
}

void setVerbose(bool verbose) {
    if (verbose) {
        GWSetLogSink(nullptr);
    } else {
        GWSetLogSink([](const std::string&) {});
    }
}

}  // namespace gwarchive
