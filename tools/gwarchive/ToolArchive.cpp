#include "ToolArchive.h"

#include <cerrno>
#include <cstdlib>
#include <numeric>
#include <set>

#include "Diagnostics.h"
#include "FormatAdapters.h"
#include "Locations.h"
#include "foundation/GWHTTPRangeReader.h"
#include "foundation/GWRecentHTTPResources.h"
#include "foundation/GWRemoteFileHandle.h"
#include "foundation/GWStringEncoding.h"

namespace gwarchive {

const char* entryTypeName(EntryType type) {
    switch (type) {
        case EntryType::file: return "file";
        case EntryType::directory: return "directory";
        case EntryType::symlink: return "symlink";
        case EntryType::hardlink: return "hardlink";
        case EntryType::charDevice: return "char";
        case EntryType::blockDevice: return "block";
        case EntryType::fifo: return "fifo";
        case EntryType::socket: return "socket";
        case EntryType::whiteout: return "whiteout";
        case EntryType::unknown: break;
    }
    return "unknown";
}

EntryType entryTypeFromMode(std::uint32_t mode) {
    switch (mode & 0xF000) {
        case 0x8000: return EntryType::file;
        case 0x4000: return EntryType::directory;
        case 0xA000: return EntryType::symlink;
        case 0x2000: return EntryType::charDevice;
        case 0x6000: return EntryType::blockDevice;
        case 0x1000: return EntryType::fifo;
        case 0xC000: return EntryType::socket;
        case 0xE000: return EntryType::whiteout;
        default: return EntryType::unknown;
    }
}

std::unique_ptr<ToolArchive> ToolArchive::open(const GWURL& url, GWErrorPtr* error) {
    if (!url.isFileURL()) {
        // One request opens the URL, whatever the format turns out to be, and
        // every later handle of the run reads the version it saw.
        static std::shared_ptr<void> pin;
        pin = GWRecentHTTPResources::shared().pin(url.absoluteString());
        if (const char* timeouts = std::getenv("GWARCHIVE_HTTP_TIMEOUTS")) {
            GWHTTPTimeouts parsed = GWCurrentHTTPTimeouts();
            if (GWParseHTTPTimeouts(timeouts, parsed))
                GWSetHTTPTimeouts(parsed);
        }
        auto handle = GWRemoteFileHandle::initForReadingFromURL(url, error);
        if (!handle)
            return nullptr;
        handle->closeFileAndReturnError(nullptr);
    }
    if (GWXARArchive::isXARArchiveAtURL(url))
        return openXARArchive(url, error);
    return openZipArchive(url, error);
}

std::vector<std::size_t> ToolArchive::subtree(std::size_t index) const {
    std::vector<std::size_t> indexes{index};
    // Depth-first order keeps a subtree contiguous right after its root.
    const std::string prefix = std::string(entryPath(index)) + "/";
    for (std::size_t next = index + 1;
         next < entryCount() && entryPath(next).compare(0, prefix.size(), prefix) == 0; ++next) {
        indexes.push_back(next);
    }
    return indexes;
}

std::optional<std::vector<std::size_t>> ToolArchive::selectPath(const std::string& path) const {
    std::string wanted = path;
    while (wanted.size() > 1 && wanted.back() == '/')
        wanted.pop_back();
    for (std::size_t index = 0; index < entryCount(); ++index) {
        if (entryPath(index) == wanted)
            return subtree(index);
    }
    return std::nullopt;
}

GWExtractOptions libraryExtractOptions(const ExtractOptions& options,
                                       const std::string& archiveName) {
    GWExtractOptions library = options.grants;
    library.replaceExisting = options.overwrite;
    library.withheld = [archiveName](const std::string& path, const std::string& what) {
        reportFailure(archiveName, path, "warning: " + what);
    };
    return library;
}

void keepUntilExit(std::unique_ptr<ToolArchive> archive) {
    // In static storage the archive stays reachable, so leak checkers are quiet.
    static ToolArchive* kept = nullptr;
    delete std::exchange(kept, archive.release());
}

namespace {
GWXARTrustPtr gTrustAnchors;
std::string gNamesEncoding;
}  // namespace

int useOpeningOptions(const ParsedArguments& arguments) {
    if (auto encoding = arguments.value("encoding")) {
        if (!GWIsKnownEncodingName(*encoding)) {
            reportFailure("--encoding " + *encoding, std::nullopt,
                          "not an encoding iconv knows (see iconv -l)");
            return kExitUsage;
        }
        gNamesEncoding = *encoding;
    }
    const auto file = arguments.value("trust");
    if (!file)
        return kExitSuccess;
    GWErrorPtr error;
    gTrustAnchors = GWXARTrust::trustWithAnchorsFile(*file, &error);
    if (!gTrustAnchors)
        reportError(*file, std::nullopt, error);
    return gTrustAnchors ? kExitSuccess : kExitFailure;
}

const std::string& namesEncoding() {
    return gNamesEncoding;
}

GWXARTrustPtr trustAnchors() {
    return gTrustAnchors;
}

GWErrorPtr signatureRefusal(const ToolArchive& archive, const ParsedArguments& arguments) {
    const std::string verdict = archive.signatureVerdict();
    if (!arguments.has("require-signature") || verdict == "valid")
        return nullptr;
    return GWGenerateError(kGWXARArchiveErrorDomain,
                           verdict == "untrusted" ? GWXARArchiveUntrustedCertificateError
                                                  : GWXARArchiveInvalidSignatureError,
                           std::nullopt, nullptr, {}, "Refused: the signature is %s",
                           archive.signatureSummary().c_str());
}

std::unique_ptr<ToolArchive> openArchiveOperand(const std::string& operand) {
    GWErrorPtr error;
    auto archive = ToolArchive::open(archiveURL(operand), &error);
    if (!archive)
        reportError(operand, std::nullopt, error);
    else if (auto note = archive->damageNote())
        reportDamage(operand, *note);
    return archive;
}

std::vector<std::size_t> selectEntries(const ToolArchive& archive, const std::string& operand,
                                       const std::vector<std::string>& paths, bool* allFound) {
    std::vector<std::size_t> selected;
    if (paths.empty()) {
        selected.resize(archive.entryCount());
        std::iota(selected.begin(), selected.end(), std::size_t(0));
        return selected;
    }
    std::set<std::size_t> seen;
    for (const std::string& path : paths) {
        auto indexes = archive.selectPath(path);
        if (!indexes) {
            reportError(operand, path, GWPOSIXError(ENOENT));
            *allFound = false;
            continue;
        }
        for (std::size_t index : *indexes) {
            if (seen.insert(index).second)
                selected.push_back(index);
        }
    }
    return selected;
}

}  // namespace gwarchive
