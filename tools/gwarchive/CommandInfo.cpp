#include <cstdio>

#include "Command.h"
#include "Diagnostics.h"
#include "Locations.h"
#include "ToolArchive.h"
#include "foundation/GWHTTPRangeReader.h"

namespace gwarchive {

namespace {

int runInfo(const ParsedArguments& arguments) {
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
    std::printf("archive: %s\n", GWRedactedURLString(operand).c_str());
    std::printf("format: %s\n", archive->formatName());
    for (const std::string& line : archive->infoLines())
        std::printf("%s\n", line.c_str());
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
    "    gwarchive info [-v] ARCHIVE\n"
    "\n"
    "DESCRIPTION\n"
    "    Prints one \"key: value\" line each for: the format; for ZIP the offset at\n"
    "    which the ZIP data starts (not 0 for self-extractors); for XAR whether the\n"
    "    table-of-contents checksum is valid (\"none\" when the archive has no\n"
    "    checksums at all), whether the archive carries a valid signature, each\n"
    "    signature's kind and its certificates' common names, and the names of\n"
    "    the sub-documents; then the number of entries and the total of their\n"
    "    sizes, decoded and stored. ARCHIVE may be a path or an http(s) URL.\n"
    "\n"
    "EXIT STATUS\n"
    "    0 on success, 1 when ARCHIVE cannot be opened, 2 on wrong usage. An\n"
    "    invalid checksum or signature is reported, not a failure.\n"
    "\n"
    "EXAMPLE\n"
    "    gwarchive info Installer.pkg\n",
    {},
    1,
    1,
    runInfo,
};

}  // namespace gwarchive
