#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "CommandLine.h"
#include "GWArchiveSupport/GWArchiveSupport.h"

namespace gwarchive {

class JsonWriter;
class ToolArchive;

enum class EntryType : std::uint8_t {
    file,
    directory,
    symlink,
    hardlink,
    charDevice,
    blockDevice,
    fifo,
    socket,
    whiteout,
    unknown
};
const char* entryTypeName(EntryType type);
EntryType entryTypeFromMode(std::uint32_t mode);

// What the tool shows of one entry, the same for both formats.
struct EntryRecord {
    std::string path;
    EntryType type = EntryType::unknown;
    std::uint32_t mode = 0;  // type bits included
    std::uint64_t size = 0;  // the entry's own bytes, without companions
    std::uint64_t compressedSize = 0;
    std::optional<GWDate> modificationDate;
    bool madeUp = false;  // implied by other entries, not stored
    std::uint32_t uid = 0;
    std::uint32_t gid = 0;
    std::optional<std::string> linkTarget;
    std::optional<std::string> typeCode;
    std::optional<std::string> creatorCode;
    std::optional<std::uint64_t> resourceForkSize;
    bool appleDouble = false;
    bool macBinary = false;
    bool encrypted = false;
    std::vector<std::string> xattrs;
    std::optional<std::string> compression;
};

// Receives an entry's decoded data piece by piece; false stops the stream.
using DataSink = std::function<bool(const std::uint8_t* bytes, std::size_t length)>;
// Told the byte length of every decoded piece while extracting; false stops.
using ProgressSink = std::function<bool(std::uint64_t bytes)>;

struct ExtractOptions {
    GWURL directory;
    bool overwrite = false;
    bool quiet = false;  // no warnings, only errors
    std::size_t stripComponents = 0;
    // Told of each item once written, with its path in the archive.
    std::function<void(const std::string& path)> written;
    ProgressSink progress;
    // The switches for what an archive may grant (set-ID bits, devices,
    // attributes outside "user.", pinning flags).
    GWExtractOptions grants;
};
// The library's options for an extraction: the grants, --overwrite, and one
// warning line on standard error for each device or attribute left out.
GWExtractOptions libraryExtractOptions(const ExtractOptions& options,
                                       const std::string& archiveName);

// `path` without its first `count` components; none when it has no more.
std::optional<std::string_view> strippedPath(std::string_view path, std::size_t count);

// The entries to name to extract(): of those selected, the tops of the
// subtrees that are to be written whole. An entry that --strip-components
// leaves nothing of is not written, nor with --skip-existing one whose place
// is taken (counted in `skipped`); a folder they are missing from is not
// named either, and is made, if need be, as a plain folder.
std::vector<std::size_t> extractionRoots(const ToolArchive& archive,
                                         const std::vector<std::size_t>& selected,
                                         const ExtractOptions& options, bool skipExisting,
                                         std::size_t* skipped);

// The verdict on one entry of `gwarchive test`.
struct EntryProblem {
    std::string path;
    std::string message;
    std::string domain;
    long code = 0;
};

// One opened archive of either format, as the subcommands need it. Entries
// are addressed by their index.
class ToolArchive {
public:
    virtual ~ToolArchive() = default;

    // Opens a ZIP (self-extracting ones included) or XAR archive.
    static std::unique_ptr<ToolArchive> open(const GWURL& url, GWErrorPtr* error);

    virtual const char* formatName() const = 0;
    // Entries are numbered depth-first in tree order, parents before children.
    virtual std::size_t entryCount() const = 0;
    virtual std::string_view entryPath(std::size_t index) const = 0;
    virtual EntryType entryType(std::size_t index) const = 0;
    // Everything else is gathered when asked: listing 200,000 names should
    // not first build 200,000 full records.
    virtual EntryRecord entry(std::size_t index) const = 0;
    // A link target that only the entry's data can tell; none for others.
    virtual std::optional<std::string> readLinkTarget(std::size_t) { return std::nullopt; }

    // Archive-wide fields of `list --json` and `info --json`.
    virtual void writeArchiveFields(JsonWriter& json) const = 0;
    // The format-specific lines of `info`.
    virtual std::vector<std::string> infoLines() const = 0;
    // "valid", "untrusted", "invalid" or "none" (unsigned; every ZIP), then
    // in brackets the certificates' names or why it is not valid.
    virtual std::string signatureVerdict() const { return "none"; }
    virtual std::string signatureSummary() const { return "none"; }

    // What opens encrypted entries from now on; formats without encryption
    // ignore it.
    virtual void setPassword(const std::string&) {}
    // The decoded data fork of one entry (a link's text for a symbolic link).
    // All data reaches the sink before a stored checksum is found wrong.
    virtual bool stream(std::size_t index, const DataSink& sink, GWErrorPtr* error,
                        bool* checksumFailed) = 0;
    // Decodes the given regular entries and checks their stored checksums.
    virtual std::vector<EntryProblem> test(const std::vector<std::size_t>& indexes) = 0;
    // How many streams the last test() read without a stored checksum to check.
    virtual std::size_t unverifiedCount() const { return 0; }
    // What makes every entry untrustworthy, such as a XAR table of contents
    // that does not match its checksum; none when there is nothing.
    virtual GWErrorPtr integrityError() const { return nullptr; }
    // What was lost before the archive could be read, such as a missing
    // central directory whose entries were recovered; none for a whole archive.
    virtual std::optional<std::string> damageNote() const { return std::nullopt; }
    // Extracts the given entries, each with everything below it; each failure
    // is reported on standard error as it happens. Returns whether all succeeded.
    virtual bool extract(const std::vector<std::size_t>& indexes, const ExtractOptions& options,
                         const std::string& archiveName) = 0;

protected:
    std::vector<std::size_t> subtree(std::size_t index) const;

public:
    // One past the last index of the subtree at `index`.
    std::size_t subtreeEnd(std::size_t index) const;
};

// Keeps the archive until the process ends, which is right after a command:
// freeing a tree of 200,000 entries node by node costs a tenth of a listing.
void keepUntilExit(std::unique_ptr<ToolArchive> archive);

// Takes the options that shape how archives open: the certificates of
// --trust FILE as anchors for XAR signatures besides the system's, and
// --encoding NAME for ZIP names without the UTF-8 flag. The exit status to
// end with, said on standard error, when one cannot serve; kExitSuccess otherwise.
int useOpeningOptions(const ParsedArguments& arguments);
GWXARTrustPtr trustAnchors();
// The iconv name given with --encoding; empty when none was.
const std::string& namesEncoding();
// With --require-signature, why an archive whose signature is anything but
// valid is refused (XAR code 7 when untrusted, else 6); none otherwise.
GWErrorPtr signatureRefusal(const ToolArchive& archive, const ParsedArguments& arguments);

// Gives the archive the password of --password or --password-file; without
// either, asks for one on the terminal (without echo) when standard input is
// a terminal and one of `entries` is encrypted. False, said on standard
// error, when the password file cannot be read.
bool usePasswordOptions(const ParsedArguments& arguments, ToolArchive& archive,
                        const std::string& operand, const std::vector<std::size_t>& entries);

// Opens an ARCHIVE operand, or says why not on standard error and returns none.
std::unique_ptr<ToolArchive> openArchiveOperand(const std::string& operand);

// Whether `path` matches the shell pattern: "*" and "?" stay within one
// component, "**" crosses "/" (and "**/" also matches no folder at all),
// "[...]" and "\\" as for fnmatch.
bool globMatches(std::string_view pattern, std::string_view path);

// What the PATH operands and --include/--exclude ask for. A pattern that
// matches a folder selects everything below it.
struct Selection {
    std::vector<std::string> paths;  // none: every entry
    std::vector<std::string> includes;
    std::vector<std::string> excludes;

    static Selection fromArguments(const ParsedArguments& arguments, std::size_t firstPath);
    bool choosesAll() const { return paths.empty() && includes.empty() && excludes.empty(); }
};

// The entries chosen, in listing order without repeats. A PATH that matches
// nothing is reported on standard error and clears `allFound`.
std::vector<std::size_t> selectEntries(const ToolArchive& archive, const std::string& operand,
                                       const Selection& selection, bool* allFound);

}  // namespace gwarchive
