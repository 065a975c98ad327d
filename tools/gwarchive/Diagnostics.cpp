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

bool gVerbose = false;

// The library's descriptions are written for a Mac user's alert; on a
// command line the entry and archive are named already and what counts is
// what failed and why, so the common causes get a phrase of their own.
std::string plainDescription(const GWError& error) {
    static const char* const kSizeMismatch = "size differs from the one stored (data damaged)";
    static const char* const kOutside = "refused: it would be written outside the destination";
    const std::string& domain = error.domain();
    const long code = error.code();
    if (domain == kGWPOSIXErrorDomain) {
        switch (code) {
            case ENOENT: return "not found";
            case EEXIST: return "already exists (use --overwrite or --skip-existing)";
            case EISDIR: return "is a directory";
            default: break;
        }
    }
    if (domain == kGWZipArchiveErrorDomain) {
        switch (code) {
            case GWZipArchiveChecksumMismatchError: return "checksum mismatch (data damaged)";
            case GWZipArchiveSizeMismatchError: return kSizeMismatch;
            case GWZipArchiveEntryOutsideDestinationError: return kOutside;
            case GWZipArchivePasswordRequiredError:
                return "encrypted: password required (--password or --password-file)";
            case GWZipArchiveWrongPasswordError: return "wrong password";
            default: break;
        }
    }
    if (domain == kGWXARArchiveErrorDomain) {
        switch (code) {
            case GWXARArchiveSizeMismatchError: return kSizeMismatch;
            case GWXARArchiveEntryOutsideDestinationError: return kOutside;
            case GWXARArchiveInvalidTOCChecksumError:
                return "table of contents does not match its checksum (archive damaged)";
            default: break;
        }
    }
    return error.localizedDescription();
}

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
    std::fprintf(stderr, "%s: %s\n", prefix(archive, path).c_str(),
                 printable(describeError(error)).c_str());
}

std::string describeError(const GWErrorPtr& error) {
    if (!error)
        return "unknown error";
    std::string text = plainDescription(*error);
    if (gVerbose)
        text += " (" + error->domain() + " " + std::to_string(error->code()) + ")";
    return text;
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

bool isVerbose() {
    return gVerbose;
}

void setVerbose(bool verbose) {
    gVerbose = verbose;
    if (verbose) {
        // Log lines name entries too.
        GWSetLogSink(
            [](const std::string& line) { std::fprintf(stderr, "%s\n", printable(line).c_str()); });
    } else {
        GWSetLogSink([](const std::string&) {});
    }
}

}  // namespace gwarchive
