#include <cerrno>
#include <cstdio>

#include "Command.h"
#include "Diagnostics.h"
#include "Locations.h"
#include "ToolArchive.h"

namespace gwarchive {

namespace {

int runCat(const ParsedArguments& arguments) {
    if (int status = useOpeningOptions(arguments); status != kExitSuccess)
        return status;
    const std::string& operand = arguments.operands[0];
    const std::string& path = arguments.operands[1];
    auto archive = openArchiveOperand(operand);
    if (!archive)
        return kExitFailure;
    GWErrorPtr error;
    auto selected = archive->selectPath(path);
    if (!selected) {
        reportError(operand, path, GWPOSIXError(ENOENT));
        return kExitFailure;
    }
    std::size_t index = selected->front();
    if (!usePasswordOptions(arguments, *archive, operand, {index}))
        return kExitFailure;
    if (archive->entryType(index) == EntryType::directory) {
        reportError(operand, path, GWPOSIXError(EISDIR));
        return kExitFailure;
    }
    bool written = true;
    bool checksumFailed = false;
    bool streamed = archive->stream(
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
        return kExitFailure;
    }
    if (!streamed) {
        reportError(operand, path, error);
        return kExitFailure;
    }
    if (checksumFailed) {
        reportFailure(operand, path, "the data does not match its stored checksum");
        return kExitFailure;
    }
    return kExitSuccess;
}

}  // namespace

const Command kCatCommand = {
    "cat",
    "write the decoded data of one entry to standard output",
    "NAME\n"
    "    gwarchive cat - write one entry's data to standard output\n"
    "\n"
    "SYNOPSIS\n"
    "    gwarchive cat [--encoding NAME] [--password PW|--password-file FILE] [-v]\n"
    "                  ARCHIVE PATH\n"
    "\n"
    "DESCRIPTION\n"
    "    Decodes the data fork of the entry PATH of ARCHIVE and writes it to\n"
    "    standard output as it is decoded, without a temporary file. For a\n"
    "    symbolic link the link text is written. Metadata (resource forks,\n"
    "    Finder information, extended attributes) is not part of the output.\n"
    "    ARCHIVE may be a path or an http(s) URL; from a server only the\n"
    "    directory and the entry's own bytes are fetched.\n"
    "    Encrypted ZIP entries (traditional or AES) need a password: without\n"
    "    --password or --password-file it is asked for, without echo, when\n"
    "    standard input is a terminal; an entry then fails with \"password\n"
    "    required\" or \"wrong password\" (GWZipArchiveErrorDomain 8, 9) and\n"
    "    nothing of it is written.\n"
    "\n"
    "OPTIONS\n"
    "    --encoding NAME      read ZIP names that do not say they are UTF-8 in the\n"
    "                         encoding iconv calls NAME (e.g. CP437, CP866).\n"
    "    --password PW        the password of encrypted ZIP entries (other users\n"
    "                         may see it in the process list).\n"
    "    --password-file FILE the password is FILE's first line.\n"
    "    -v, --verbose        show the library's log on standard error.\n"
    "\n"
    "EXIT STATUS\n"
    "    0 when all the data was written; 1 when ARCHIVE cannot be opened, PATH is\n"
    "    not a file in it, the data is corrupt or standard output fails; 2 on\n"
    "    wrong usage. For a XAR entry whose stored checksum does not match, the\n"
    "    data is written and the status is 1.\n"
    "\n"
    "EXAMPLE\n"
    "    gwarchive cat Archive.zip docs/README.txt | less\n",
    {{0, "encoding", true}, {0, "password", true}, {0, "password-file", true}},
    2,
    2,
    runCat,
};

}  // namespace gwarchive
