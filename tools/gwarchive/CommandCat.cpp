#include <cerrno>
#include <cstdio>

#include "Command.h"
#include "Diagnostics.h"
#include "Locations.h"
#include "ToolArchive.h"

namespace gwarchive {

namespace {

// Writes one entry's data to standard output; false, said on standard
// error, when it cannot.
bool catEntry(ToolArchive& archive, const std::string& operand, std::size_t index) {
    const std::string path(archive.entryPath(index));
    GWErrorPtr error;
    bool written = true;
    bool checksumFailed = false;
    bool streamed = archive.stream(
        index,
        [&](const std::uint8_t* bytes, std::size_t length) {
            written = std::fwrite(bytes, 1, length, stdout) == length;
            return written;
        },
        &error, &checksumFailed);
    if (std::fflush(stdout) != 0)
        written = false;
    if (!written) {
        reportError(operand, path, GWPOSIXError(errno ? errno : EIO));
        return false;
    }
    if (!streamed) {
        reportError(operand, path, error);
        return false;
    }
    if (checksumFailed) {
        reportFailure(operand, path, "checksum mismatch (data damaged)");
        return false;
    }
    return true;
}

int runCat(const ParsedArguments& arguments) {
    if (int status = useOpeningOptions(arguments); status != kExitSuccess)
        return status;
    const std::string& operand = arguments.operands[0];
    auto archive = openArchiveOperand(operand);
    if (!archive)
        return kExitFailure;
    bool allGood = true;
    Selection selection = Selection::fromArguments(arguments, 1);
    // Each PATH in the order given, even when one repeats another.
    std::vector<std::size_t> order;
    for (std::size_t at = 1; at < arguments.operands.size(); ++at) {
        selection.paths = {arguments.operands[at]};
        std::vector<std::size_t> selected = selectEntries(*archive, operand, selection, &allGood);
        const bool any = !selected.empty();
        std::erase_if(selected, [&](std::size_t index) {
            return archive->entryType(index) == EntryType::directory;
        });
        if (any && selected.empty()) {
            reportError(operand, selection.paths[0], GWPOSIXError(EISDIR));
            allGood = false;
        }
        order.insert(order.end(), selected.begin(), selected.end());
    }
    if (!usePasswordOptions(arguments, *archive, operand, order))
        return kExitFailure;
    for (std::size_t index : order)
        allGood &= catEntry(*archive, operand, index);
    return allGood ? kExitSuccess : kExitFailure;
}

}  // namespace

const Command kCatCommand = {
    "cat",
    "write the decoded data of entries to standard output",
    "NAME\n"
    "    gwarchive cat - write entries' data to standard output\n"
    "\n"
    "SYNOPSIS\n"
    "    gwarchive cat [--include GLOB] [--exclude GLOB] [--encoding NAME]\n"
    "                  [--password PW|--password-file FILE] [-v] ARCHIVE PATH...\n"
    "\n"
    "DESCRIPTION\n"
    "    Decodes the data fork of each file a PATH matches, PATH by PATH in the\n"
    "    order given and each folder's files in listing order, and writes it to\n"
    "    standard output as it is decoded, without a temporary file. For a\n"
    "    symbolic link the link text is written. Metadata (resource forks,\n"
    "    Finder information, extended attributes) is not part of the output.\n"
    "    A PATH is an entry's name or a shell pattern: * and ? stay within one\n"
    "    component, ** crosses \"/\", [...] as for fnmatch; a folder brings what\n"
    "    lies below it. A PATH that matches nothing is an error, said once the\n"
    "    rest is done.\n"
    "    ARCHIVE may be a path or an http(s) URL; from a server only the\n"
    "    directory and the entry's own bytes are fetched.\n"
    "    Encrypted ZIP entries (traditional or AES) need a password: without\n"
    "    --password or --password-file it is asked for, without echo, when\n"
    "    standard input is a terminal; an entry then fails with \"password\n"
    "    required\" or \"wrong password\" (GWZipArchiveErrorDomain 8, 9) and\n"
    "    nothing of it is written.\n"
    "\n"
    "OPTIONS\n"
    "    --include GLOB       only files GLOB matches; repeatable.\n"
    "    --exclude GLOB       not the files GLOB matches; repeatable.\n"
    "    --encoding NAME      read ZIP names that do not say they are UTF-8 in the\n"
    "                         encoding iconv calls NAME (e.g. CP437, CP866).\n"
    "    --password PW        the password of encrypted ZIP entries (other users\n"
    "                         may see it in the process list).\n"
    "    --password-file FILE the password is FILE's first line.\n"
    "    -v, --verbose        errors carry their domain and code; the library's\n"
    "                         log goes to standard error.\n"
    "\n"
    "EXIT STATUS\n"
    "    0 when all the data was written; 1 when ARCHIVE cannot be opened, a PATH\n"
    "    matches nothing or only folders, data is corrupt or standard output\n"
    "    fails (the other PATHs are still written); 2 on\n"
    "    wrong usage. For a XAR entry whose stored checksum does not match, the\n"
    "    data is written and the status is 1.\n"
    "\n"
    "EXAMPLES\n"
    "    gwarchive cat Archive.zip docs/README.txt | less\n"
    "    gwarchive cat Archive.zip head.html 'pages/*.html' foot.html > all.html\n"
    "    gwarchive cat --include '*.log' --exclude 'old' Logs.zip logs\n"
    "    gwarchive cat --encoding CP437 Old.zip README.TXT\n"
    "    gwarchive cat --password-file pw.txt Secret.zip plan.txt\n"
    "    gwarchive cat --password 'open sesame' Secret.zip plan.txt\n"
    "    gwarchive cat -v Archive.zip missing.txt\n",
    {{0, "encoding", true},
     {0, "password", true},
     {0, "password-file", true},
     {0, "include", true},
     {0, "exclude", true}},
    2,
    kAnyNumber,
    runCat,
};

}  // namespace gwarchive
