#include <cstdio>

#include "Command.h"
#include "Diagnostics.h"
#include "Locations.h"
#include "ToolArchive.h"
#include "foundation/GWHTTPRangeReader.h"

namespace gwarchive {

namespace {

int runTest(const ParsedArguments& arguments) {
    const std::string& operand = arguments.operands[0];
    auto archive = openArchiveOperand(operand);
    if (!archive)
        return kExitFailure;
    // Digests listed in a table of contents that fails its own check prove nothing.
    if (GWErrorPtr integrity = archive->integrityError()) {
        reportError(operand, std::nullopt, integrity);
        return kExitFailure;
    }
    std::vector<EntryProblem> problems = archive->test();
    for (const EntryProblem& problem : problems) {
        std::printf("%s: %s\n", problem.path.c_str(), problem.message.c_str());
    }
    std::printf("%s: %zu entries, %zu bad", GWRedactedURLString(operand).c_str(),
                archive->entryCount(), problems.size());
    if (std::size_t unverified = archive->unverifiedCount())
        std::printf(", %zu not verified (no stored checksum)", unverified);
    std::printf("\n");
    return problems.empty() ? kExitSuccess : kExitFailure;
}

}  // namespace

const Command kTestCommand = {
    "test",
    "decode every entry and check the stored checksums",
    "NAME\n"
    "    gwarchive test - check an archive's data without writing anything\n"
    "\n"
    "SYNOPSIS\n"
    "    gwarchive test [-v] ARCHIVE\n"
    "\n"
    "DESCRIPTION\n"
    "    Decodes every entry of ARCHIVE, companions included, and compares what\n"
    "    comes out with what the archive stored: the CRC-32 and size of ZIP\n"
    "    entries, the archived and extracted digests of XAR entries. Prints one\n"
    "    line \"PATH: problem\" per bad entry on standard output, then a summary\n"
    "    line with the number of entries and of bad ones, and of XAR streams that\n"
    "    could not be verified because the archive stores no checksum for them.\n"
    "    A XAR whose table of contents does not match its checksum fails at once.\n"
    "    ARCHIVE may be a path or an http(s) URL.\n"
    "\n"
    "EXIT STATUS\n"
    "    0 when no entry is bad (unverified ones included); 1 when ARCHIVE cannot\n"
    "    be opened, its table of contents is damaged or any entry is bad; 2 on\n"
    "    wrong usage.\n"
    "\n"
    "EXAMPLE\n"
    "    gwarchive test Backup.zip\n",
    {},
    1,
    1,
    runTest,
};

}  // namespace gwarchive
