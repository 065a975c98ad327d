#include "ToolArchive.h"

#include <fnmatch.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <numeric>

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

std::size_t ToolArchive::subtreeEnd(std::size_t index) const {
    // Depth-first order keeps a subtree contiguous right after its root.
    const std::string prefix = std::string(entryPath(index)) + "/";
    std::size_t next = index + 1;
    while (next < entryCount() && entryPath(next).compare(0, prefix.size(), prefix) == 0)
        ++next;
    return next;
}

std::vector<std::size_t> ToolArchive::subtree(std::size_t index) const {
    std::vector<std::size_t> indexes(subtreeEnd(index) - index);
    std::iota(indexes.begin(), indexes.end(), index);
    return indexes;
}

GWExtractOptions libraryExtractOptions(const ExtractOptions& options,
                                       const std::string& archiveName) {
    GWExtractOptions library = options.grants;
    library.replaceExisting = options.overwrite;
    library.strippedComponents = options.stripComponents;
    library.withheld = [archiveName, quiet = options.quiet](const std::string& path,
                                                            const std::string& what) {
        if (!quiet)
            reportFailure(archiveName, path, "warning: " + what);
    };
    return library;
}

std::optional<std::string_view> strippedPath(std::string_view path, std::size_t count) {
    for (; count > 0; --count) {
        const std::size_t slash = path.find('/');
        if (slash == std::string_view::npos)
            return std::nullopt;
        path.remove_prefix(slash + 1);
    }
    return path;
}

std::vector<std::size_t> extractionRoots(const ToolArchive& archive,
                                         const std::vector<std::size_t>& selected,
                                         const ExtractOptions& options, bool skipExisting,
                                         std::size_t* skipped) {
    std::vector<bool> kept(archive.entryCount(), false);
    for (std::size_t index : selected) {
        const auto path = strippedPath(archive.entryPath(index), options.stripComponents);
        if (!path)
            continue;
        struct stat status;
        if (skipExisting && archive.entryType(index) != EntryType::directory &&
            lstat((options.directory.path() + "/" + std::string(*path)).c_str(), &status) == 0) {
            ++*skipped;
            continue;
        }
        kept[index] = true;
    }
    std::vector<std::size_t> roots;
    for (std::size_t index = 0; index < kept.size(); ++index) {
        if (!kept[index])
            continue;
        const std::size_t end = archive.subtreeEnd(index);
        if (std::all_of(kept.begin() + index, kept.begin() + end, [](bool keep) { return keep; })) {
            roots.push_back(index);
            index = end - 1;
        }
    }
    return roots;
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

namespace {

// The length of the bracket expression at the start of `pattern`, or 0 when
// it has no closing bracket (the "[" is then literal).
std::size_t bracketLength(std::string_view pattern) {
    std::size_t at = 1;
    if (at < pattern.size() && (pattern[at] == '!' || pattern[at] == '^'))
        ++at;
    if (at < pattern.size() && pattern[at] == ']')
        ++at;
    const std::size_t close = pattern.find(']', at);
    return close == std::string_view::npos ? 0 : close + 1;
}

// Every (pattern, path) position pair is tried at most once, so no pattern
// is slow however many stars it has.
bool globMatchesFrom(std::string_view pattern, std::string_view path, std::size_t p, std::size_t t,
                     std::vector<signed char>& memo) {
    signed char& known = memo[p * (path.size() + 1) + t];
    if (known >= 0)
        return known;
    bool result = false;
    if (p == pattern.size()) {
        result = t == path.size();
    } else if (pattern.compare(p, 2, "**") == 0) {
        const std::size_t rest = p + 2;
        // "a/**/b" also matches "a/b".
        result = rest < pattern.size() && pattern[rest] == '/' &&
                 globMatchesFrom(pattern, path, rest + 1, t, memo);
        for (std::size_t end = t; !result && end <= path.size(); ++end)
            result = globMatchesFrom(pattern, path, rest, end, memo);
    } else if (pattern[p] == '*') {
        for (std::size_t end = t; !result && end <= path.size(); ++end) {
            result = globMatchesFrom(pattern, path, p + 1, end, memo);
            if (end < path.size() && path[end] == '/')
                break;
        }
    } else if (t < path.size()) {
        const char c = path[t];
        std::size_t length = pattern[p] == '[' ? bracketLength(pattern.substr(p)) : 0;
        bool one = false;
        if (length != 0) {
            const std::string bracket(pattern.substr(p, length));
            one = c != '/' && fnmatch(bracket.c_str(), std::string(1, c).c_str(), 0) == 0;
        } else if (pattern[p] == '\\' && p + 1 < pattern.size()) {
            one = pattern[p + 1] == c;
            length = 2;
        } else {
            one = pattern[p] == '?' ? c != '/' : pattern[p] == c;
            length = 1;
        }
        result = one && globMatchesFrom(pattern, path, p + length, t + 1, memo);
    }
    known = result;
    return result;
}

// Whether the pattern matches `path` or one of the folders it lies in.
bool selects(std::string_view pattern, std::string_view path) {
    while (pattern.size() > 1 && pattern.back() == '/')
        pattern.remove_suffix(1);
    // A name is itself first, whatever glob characters it holds.
    if (path.compare(0, pattern.size(), pattern) == 0 &&
        (path.size() == pattern.size() || path[pattern.size()] == '/'))
        return true;
    if (pattern.find_first_of("*?[\\") == std::string_view::npos)
        return false;
    for (;;) {
        if (globMatches(pattern, path))
            return true;
        const std::size_t slash = path.rfind('/');
        if (slash == std::string_view::npos)
            return false;
        path = path.substr(0, slash);
    }
}

bool selectsAny(const std::vector<std::string>& patterns, std::string_view path) {
    return std::any_of(patterns.begin(), patterns.end(),
                       [&](const std::string& pattern) { return selects(pattern, path); });
}

}  // namespace

bool globMatches(std::string_view pattern, std::string_view path) {
    std::vector<signed char> memo((pattern.size() + 1) * (path.size() + 1), -1);
    return globMatchesFrom(pattern, path, 0, 0, memo);
}

Selection Selection::fromArguments(const ParsedArguments& arguments, std::size_t firstPath) {
    Selection selection;
    if (arguments.operands.size() > firstPath)
        selection.paths.assign(arguments.operands.begin() + firstPath, arguments.operands.end());
    selection.includes = arguments.values("include");
    selection.excludes = arguments.values("exclude");
    return selection;
}

std::vector<std::size_t> selectEntries(const ToolArchive& archive, const std::string& operand,
                                       const Selection& selection, bool* allFound) {
    std::vector<std::size_t> selected;
    if (selection.choosesAll()) {
        selected.resize(archive.entryCount());
        std::iota(selected.begin(), selected.end(), std::size_t(0));
        return selected;
    }
    std::vector<bool> matched(selection.paths.size(), false);
    for (std::size_t index = 0; index < archive.entryCount(); ++index) {
        const std::string_view path = archive.entryPath(index);
        bool named = selection.paths.empty();
        for (std::size_t which = 0; which < selection.paths.size(); ++which) {
            if (selects(selection.paths[which], path)) {
                matched[which] = true;
                named = true;
            }
        }
        if (named && (selection.includes.empty() || selectsAny(selection.includes, path)) &&
            !selectsAny(selection.excludes, path))
            selected.push_back(index);
    }
    for (std::size_t which = 0; which < selection.paths.size(); ++which) {
        if (!matched[which]) {
            reportFailure(operand, selection.paths[which], "no entry matches");
            *allFound = false;
        }
    }
    return selected;
}

}  // namespace gwarchive
