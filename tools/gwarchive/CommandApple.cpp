#include "Command.h"
#include "Diagnostics.h"
#include "Locations.h"

namespace gwarchive {

namespace {

int runMacBinary(const ParsedArguments& arguments) {
    const std::string& input = arguments.operands[0];
    const std::string& output = arguments.operands[1];
    GWErrorPtr error;
    if (!GWAppleFileDecoder::sharedInstance()->decodeMacBinaryFileAtURL(localURL(input),
                                                                        localURL(output), &error)) {
        reportError(input, std::nullopt, error);
        return kExitFailure;
    }
    return kExitSuccess;
}

int runAppleDouble(const ParsedArguments& arguments) {
    const std::string& appleDouble = arguments.operands[0];
    const std::string& dataFile = arguments.operands[1];
    GWErrorPtr error;
    if (!GWAppleFileDecoder::sharedInstance()->mergeAppleDoubleFileAtURL(
            localURL(appleDouble), localURL(dataFile), &error)) {
        reportError(appleDouble, std::nullopt, error);
        return kExitFailure;
    }
    return kExitSuccess;
}

}  // namespace

const Command kMacBinaryCommand = {
    "macbinary",
    "decode a MacBinary file into a file with its forks",
    "NAME\n"
    "    gwarchive macbinary - decode a MacBinary file\n"
    "\n"
    "SYNOPSIS\n"
    "    gwarchive macbinary [-v] IN OUT\n"
    "\n"
    "DESCRIPTION\n"
    "    Decodes the MacBinary I, II or III file IN and writes its data fork to OUT.\n"
    "    The resource fork goes to the extended attribute user.com.apple.ResourceFork\n"
    "    and the Finder information (type, creator, flags) to user.com.apple.FinderInfo;\n"
    "    where the file system refuses attributes that large, to an AppleDouble file\n"
    "    ._OUT beside OUT. The modification date and the comment are applied too.\n"
    "\n"
    "EXIT STATUS\n"
    "    0 when OUT was written, 1 when IN is not MacBinary or cannot be read or OUT\n"
    "    cannot be written, 2 on wrong usage.\n"
    "\n"
    "EXAMPLE\n"
    "    gwarchive macbinary Installer.bin Installer\n",
    {},
    2,
    2,
    runMacBinary,
};

const Command kAppleDoubleCommand = {
    "appledouble",
    "apply an AppleDouble file's metadata to its data file",
    "NAME\n"
    "    gwarchive appledouble - merge an AppleDouble file into its data file\n"
    "\n"
    "SYNOPSIS\n"
    "    gwarchive appledouble [-v] APPLEDOUBLE DATAFILE\n"
    "\n"
    "DESCRIPTION\n"
    "    Reads the AppleDouble file APPLEDOUBLE (for example a ._name file from a\n"
    "    __MACOSX folder) and gives DATAFILE its Finder information, resource fork,\n"
    "    extended attributes and comment. DATAFILE's contents stay as they are and\n"
    "    APPLEDOUBLE is left alone.\n"
    "\n"
    "EXIT STATUS\n"
    "    0 on success, 1 when APPLEDOUBLE is malformed or a file cannot be read or\n"
    "    changed, 2 on wrong usage.\n"
    "\n"
    "EXAMPLE\n"
    "    gwarchive appledouble __MACOSX/._Read\\ Me Read\\ Me\n",
    {},
    2,
    2,
    runAppleDouble,
};

}  // namespace gwarchive
