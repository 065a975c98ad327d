#include <cstdio>

#include "Command.h"
#include "Diagnostics.h"
#include "JsonWriter.h"
#include "Locations.h"
#include "ToolArchive.h"
#include "foundation/GWHTTPRangeReader.h"

namespace gwarchive {

namespace {

void writeError(JsonWriter& json, const std::string& domain, long code, const std::string& text) {
    json.beginObject();
    json.key("domain");
    json.value(domain);
    json.key("code");
    json.value(static_cast<std::int64_t>(code));
    json.key("message");
    json.value(text);
    json.endObject();
}

// The whole verdict as one object; `failure` is what stopped the test before its entries.
void printJSON(const std::string& operand, const ToolArchive& archive, std::size_t entries,
               const std::vector<EntryProblem>& problems, const GWErrorPtr& failure) {
    JsonWriter json;
    json.beginObject();
    json.key("archive");
    json.value(operand);
    json.key("format");
    json.value(archive.formatName());
    archive.writeArchiveFields(json);
    json.key("entries");
    json.value(static_cast<std::uint64_t>(entries));
    json.key("unverified");
    json.value(static_cast<std::uint64_t>(archive.unverifiedCount()));
    json.key("bad");
    json.beginArray();
    for (const EntryProblem& problem : problems) {
        json.beginObject();
        json.key("path");
        json.value(problem.path);
        json.key("error");
        writeError(json, problem.domain, problem.code, problem.message);
        json.endObject();
    }
    json.endArray();
    json.key("error");
    if (failure) {
        writeError(json, failure->domain(), failure->code(), describeError(failure));
    } else {
        json.null();
    }
    json.key("passed");
    json.value(!failure && problems.empty());
    json.endObject();
    std::printf("%s\n", json.text().c_str());
}

int runTest(const ParsedArguments& arguments) {
    if (int status = useOpeningOptions(arguments); status != kExitSuccess)
        return status;
    const std::string& operand = arguments.operands[0];
    auto archive = openArchiveOperand(operand);
    if (!archive)
        return kExitFailure;
    const bool json = arguments.has("json");
    if (GWErrorPtr refusal = signatureRefusal(*archive, arguments)) {
        reportError(operand, std::nullopt, refusal);
        if (json)
            printJSON(operand, *archive, 0, {}, refusal);
        return kExitFailure;
    }
    // Digests listed in a table of contents that fails its own check prove nothing.
    if (GWErrorPtr integrity = archive->integrityError()) {
        reportError(operand, std::nullopt, integrity);
        if (json)
            printJSON(operand, *archive, 0, {}, integrity);
        return kExitFailure;
    }
    bool allFound = true;
    const std::vector<std::size_t> selected =
        selectEntries(*archive, operand, Selection::fromArguments(arguments, 1), &allFound);
    if (!usePasswordOptions(arguments, *archive, operand, selected))
        return kExitFailure;
    std::vector<EntryProblem> problems = archive->test(selected);
    const int status = problems.empty() && allFound ? kExitSuccess : kExitFailure;
    if (json) {
        printJSON(operand, *archive, selected.size(), problems, nullptr);
        return status;
    }
    for (const EntryProblem& problem : problems) {
        std::printf("%s: %s\n", printable(problem.path).c_str(),
                    printable(problem.message).c_str());
    }
    if (arguments.has("quiet"))
        return status;
    std::printf("%s: %zu entries, %zu bad", GWRedactedURLString(operand).c_str(), selected.size(),
                problems.size());
    if (std::size_t unverified = archive->unverifiedCount())
        std::printf(", %zu not verified (no stored checksum)", unverified);
    std::printf("\n");
    return status;
}

}  // namespace

const Command kTestCommand = {
    "test",
    "decode every entry and check the stored checksums",
    "NAME\n"
    "    gwarchive test - check an archive's data without writing anything\n"
    "\n"
    "SYNOPSIS\n"
    "    gwarchive test [--json] [-q] [--include GLOB] [--exclude GLOB]\n"
    "                   [--encoding NAME] [--trust FILE] [--require-signature]\n"
    "                   [--password PW|--password-file FILE] [-v] ARCHIVE [PATH...]\n"
    "\n"
    "DESCRIPTION\n"
    "    Decodes every entry of ARCHIVE, or those the PATHs match, companions\n"
    "    included, and compares what\n"
    "    comes out with what the archive stored: the CRC-32 and size of ZIP\n"
    "    entries, the archived and extracted digests of XAR entries. Prints one\n"
    "    line \"PATH: problem\" per bad entry on standard output, then a summary\n"
    "    line with the number of entries and of bad ones, and of XAR streams that\n"
    "    could not be verified because the archive stores no checksum for them.\n"
    "    A XAR whose table of contents does not match its checksum fails at once.\n"
    "    ARCHIVE may be a path or an http(s) URL.\n"
    "    A PATH is an entry's name or a shell pattern: * and ? stay within one\n"
    "    component, ** crosses \"/\", [...] as for fnmatch; a folder brings what\n"
    "    lies below it. A PATH that matches nothing is an error, said once the\n"
    "    rest is done.\n"
    "    Encrypted ZIP entries (traditional or AES) need a password: without\n"
    "    --password or --password-file it is asked for, without echo, when\n"
    "    standard input is a terminal; an entry then fails with \"password\n"
    "    required\" or \"wrong password\" (GWZipArchiveErrorDomain 8, 9) and\n"
    "    counts as bad.\n"
    "\n"
    "OPTIONS\n"
    "    --json               one JSON object instead: format, archive fields as\n"
    "                         for list --json, entries, unverified, bad (each with\n"
    "                         path and error {domain, code, message}), error (what\n"
    "                         stopped the test, or null) and passed.\n"
    "    -q, --quiet          only the bad entries, no summary line.\n"
    "    --include GLOB       only what GLOB matches; repeatable.\n"
    "    --exclude GLOB       not what GLOB matches; repeatable.\n"
    "    --encoding NAME      read ZIP names that do not say they are UTF-8 in the\n"
    "                         encoding iconv calls NAME (e.g. CP437, CP866).\n"
    "    --trust FILE         PEM certificates that XAR signing chains may end at,\n"
    "                         besides the system's trusted roots.\n"
    "    --require-signature  fail unless the archive's signature is valid.\n"
    "    --password PW        the password of encrypted ZIP entries (other users\n"
    "                         may see it in the process list).\n"
    "    --password-file FILE the password is FILE's first line.\n"
    "    -v, --verbose        problems carry their domain and code; the library's\n"
    "                         log goes to standard error.\n"
    "\n"
    "EXIT STATUS\n"
    "    0 when no entry is bad (unverified ones included); 1 when ARCHIVE cannot\n"
    "    be opened, its table of contents is damaged, its signature is required\n"
    "    and not valid, a PATH matches nothing or any entry is bad; 2 on wrong\n"
    "    usage.\n"
    "\n"
    "EXAMPLES\n"
    "    gwarchive test Backup.zip\n"
    "    gwarchive test --quiet Backup.zip 'photos/**.jpg' || echo damaged\n"
    "    gwarchive test --exclude '*.tmp' --include 'src' Backup.zip\n"
    "    gwarchive test --json Installer.pkg | python3 -m json.tool\n"
    "    gwarchive test --require-signature --trust ca.pem Installer.pkg\n"
    "    gwarchive test --encoding CP866 Russian.zip\n"
    "    gwarchive test --password-file pw.txt Secret.zip\n"
    "    gwarchive test --password 'open sesame' -v Secret.zip\n",
    {{0, "json", false},
     {0, "encoding", true},
     {0, "trust", true},
     {0, "require-signature", false},
     {0, "password", true},
     {0, "password-file", true},
     {'q', "quiet", false},
     {0, "include", true},
     {0, "exclude", true}},
    1,
    kAnyNumber,
    runTest,
};

}  // namespace gwarchive
