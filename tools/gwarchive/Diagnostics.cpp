#include "Diagnostics.h"
#include "foundation/GWHTTPRangeReader.h"
#include "foundation/GWLog.h"

#include <cstdio>

namespace gwarchive {

std::string printable(std::string_view text) {
    auto isControl = [&](std::size_t at) {
        const auto byte = static_cast<unsigned char>(text[at]);
        if (byte < 0x20 || byte == 0x7F)
            return 1;
        // U+0080 to U+009F, which some terminals obey as controls.
        if (byte == 0xC2 && at + 1 < text.size() &&
            (static_cast<unsigned char>(text[at + 1]) & 0xE0) == 0x80)
            return 2;
        return 0;
    };
    std::string out;
    out.reserve(text.size());
    for (std::size_t at = 0; at < text.size();) {
        const int length = isControl(at);
        if (length == 0) {
            out += text[at++];
            continue;
        }
        for (int i = 0; i < length; ++i, ++at) {
            char escaped[5];
            std::snprintf(escaped, sizeof escaped, "\\%03o", static_cast<unsigned char>(text[at]));
            out += escaped;
        }
    }
    return out;
}

namespace {

std::string prefix(const std::string& archive, const std::optional<std::string>& path) {
    std::string line = "gwarchive: " + printable(GWRedactedURLString(archive));
    if (path)
        line += ": " + printable(*path);
    return line;
}

}  // namespace

void reportError(const std::string& archive, const std::optional<std::string>& path,
                 const GWErrorPtr& error) {
    if (!error) {
        reportFailure(archive, path, "unknown error");
        return;
    }
    // Descriptions name entries too.
    std::fprintf(stderr, "%s: %s (%s %ld)\n", prefix(archive, path).c_str(),
                 printable(error->localizedDescription()).c_str(), error->domain().c_str(),
                 error->code());
}

void reportFailure(const std::string& archive, const std::optional<std::string>& path,
                   const std::string& message) {
    std::fprintf(stderr, "%s: %s\n", prefix(archive, path).c_str(), printable(message).c_str());
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
        // Log lines name entries too.
        GWSetLogSink(
            [](const std::string& line) { std::fprintf(stderr, "%s\n", printable(line).c_str()); });
    } else {
        GWSetLogSink([](const std::string&) {});
    }
}

}  // namespace gwarchive
