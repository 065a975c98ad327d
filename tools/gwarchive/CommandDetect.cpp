#include <sys/stat.h>

#include <cerrno>
#include <cstdio>

#include "Command.h"
#include "Diagnostics.h"
#include "Locations.h"
#include "foundation/GWHTTPRangeReader.h"

namespace gwarchive {

namespace {

int runDetect(const ParsedArguments& arguments) {
    int status = kExitSuccess;
    for (const std::string& operand : arguments.operands) {
        GWURL url = archiveURL(operand);
        // The detectors answer only yes or no; a file that is not there is an error, not "unknown".
        struct stat info;
        if (url.isFileURL() && ::stat(url.path().c_str(), &info) != 0) {
            reportError(operand, std::nullopt, GWPOSIXError(errno, url));
            status = kExitFailure;
            continue;
        }
        std::printf("%s: %s\n", GWRedactedURLString(operand).c_str(),
                    GWArchiveFormatName(GWArchiveFormatAtURL(url)));
    }
    return status;
}

}  // namespace

const Command kDetectCommand = {
    "detect",
    "tell whether files are ZIP, self-extracting ZIP or XAR archives",
    "NAME\n"
    "    gwarchive detect - tell the archive format of files\n"
    "\n"
    "SYNOPSIS\n"
    "    gwarchive detect [-v] FILE...\n"
    "\n"
    "DESCRIPTION\n"
    "    Prints one line per FILE: the name, a colon and one of \"zip\",\n"
    "    \"zip (self-extracting)\" (a Windows executable carrying a ZIP archive),\n"
    "    \"xar\" or \"unknown\". Only the first bytes and a few structures are looked\n"
    "    at; opening the archive is the real test.\n"
    "\n"
    "EXIT STATUS\n"
    "    0 when every FILE could be examined, 1 when one could not be read, 2 on\n"
    "    wrong usage. An unknown format is not a failure.\n"
    "\n"
    "EXAMPLE\n"
    "    gwarchive detect Setup.exe Archive.zip Package.pkg\n",
    {},
    1,
    kAnyNumber,
    runDetect,
};

}  // namespace gwarchive
