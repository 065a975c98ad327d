#include <cstdio>

#include "Command.h"
#include "Diagnostics.h"
#include "JsonWriter.h"
#include "Locations.h"
#include "ToolArchive.h"
#include "foundation/GWHTTPRangeReader.h"

namespace gwarchive {

namespace {

int runInfo(const ParsedArguments& arguments) {
    if (int status = useOpeningOptions(arguments); status != kExitSuccess)
        return status;
    const std::string& operand = arguments.operands[0];
    auto archive = openArchiveOperand(operand);
    if (!archive)
        return kExitFailure;
    std::uint64_t bytes = 0;
    std::uint64_t compressed = 0;
    std::size_t files = 0;
    std::size_t directories = 0;
    for (std::size_t index = 0; index < archive->entryCount(); ++index) {
        const EntryRecord entry = archive->entry(index);
        bytes += entry.size;
        compressed += entry.compressedSize;
        if (entry.type == EntryType::directory) {
            ++directories;
        } else {
            ++files;
        }
    }
    if (arguments.has("json")) {
        JsonWriter json;
        json.beginObject();
        json.key("archive");
        json.value(GWRedactedURLString(operand));
        json.key("format");
        json.value(archive->formatName());
        archive->writeArchiveFields(json);
        for (const auto& [key, count] :
             {std::pair{"entries", archive->entryCount()}, std::pair{"directories", directories},
              std::pair{"others", files}}) {
            json.key(key);
            json.value(static_cast<std::uint64_t>(count));
        }
        json.key("bytes");
        json.value(bytes);
        json.key("compressedBytes");
        json.value(compressed);
        json.endObject();
        std::printf("%s\n", json.text().c_str());
        return kExitSuccess;
    }
    std::printf("archive: %s\n", GWRedactedURLString(operand).c_str());
    std::printf("format: %s\n", archive->formatName());
    for (const std::string& line : archive->infoLines())
        std::printf("%s\n", printable(line).c_str());
    std::printf("entries: %zu (%zu directories, %zu others)\n", archive->entryCount(), directories,
                files);
    std::printf("bytes: %llu (%llu compressed)\n", static_cast<unsigned long long>(bytes),
                static_cast<unsigned long long>(compressed));
    return kExitSuccess;
}

}  // namespace

const Command kInfoCommand = {
    "info",
    "summarise an archive: format, counts, checksum and signature verdicts",
    "NAME\n"
    "    gwarchive info - summarise an archive\n"
    "\n"
    "SYNOPSIS\n"
    "    gwarchive info [--json] [--trust FILE] [-v] ARCHIVE\n"
    "\n"
    "DESCRIPTION\n"
    "    Prints one \"key: value\" line each for: the format; for ZIP the offset\n"
    "    its directory counts from (not 0 for self-extractors whose offsets were\n"
    "    not adjusted) and where the first entry begins, which is how many bytes\n"
    "    precede the ZIP data (a self-extractor's program); for XAR whether the\n"
    "    table-of-contents checksum is valid (\"none\" when the archive has no\n"
    "    checksums at all), the signature verdict, each signature's kind, verdict\n"
    "    and certificates' common names, and the names of the sub-documents;\n"
    "    then the number of entries and the total of their sizes, decoded and\n"
    "    stored. ARCHIVE may be a path or an http(s) URL.\n"
    "\n"
    "    The signature verdict is one of: none; valid (leaf, anchor): it signs the\n"
    "    checksum and its chain reaches a trusted root; untrusted (why, chain up\n"
    "    to where it stopped): it signs the checksum but the chain reaches no\n"
    "    trusted root, is expired or runs through a certificate that is not a CA;\n"
    "    INVALID (why): it does not sign this table of contents.\n"
    "\n"
    "OPTIONS\n"
    "    --json        one JSON object instead: archive, format, the archive fields\n"
    "                  of list --json, entries, directories, others, bytes and\n"
    "                  compressedBytes.\n"
    "    --trust FILE  PEM certificates that signing chains may end at, besides\n"
    "                  the system's trusted roots (SSL_CERT_FILE, SSL_CERT_DIR).\n"
    "    -v, --verbose errors carry their domain and code; the library's log\n"
    "                  goes to standard error.\n"
    "\n"
    "EXIT STATUS\n"
    "    0 on success, 1 when ARCHIVE cannot be opened, 2 on wrong usage. An\n"
    "    invalid checksum or signature is reported, not a failure.\n"
    "\n"
    "EXAMPLES\n"
    "    gwarchive info Installer.pkg\n"
    "    gwarchive info --json setup.exe\n"
    "    gwarchive info -v --trust ca.pem Installer.pkg\n",
    {{0, "json", false}, {0, "trust", true}},
    1,
    1,
    runInfo,
};

}  // namespace gwarchive
