#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <memory>

#include "Command.h"
#include "Diagnostics.h"
#include "Locations.h"
#include "ProgressBar.h"
#include "ToolArchive.h"
#include "foundation/GWFreeSpace.h"
#include "foundation/GWHTTPRangeReader.h"

namespace gwarchive {

namespace {

bool wantsProgressBar(const ParsedArguments& arguments) {
    if (arguments.has("no-progress"))
        return false;
    if (arguments.has("progress"))
        return true;
    return isatty(STDERR_FILENO) == 1;
}

// What the entries will write: the data of each regular file and its
// resource fork; hard links share their target's.
std::uint64_t declaredSize(const ToolArchive& archive, const std::vector<std::size_t>& entries) {
    std::uint64_t total = 0;
    auto add = [&total](std::uint64_t size) {
        total = size > UINT64_MAX - total ? UINT64_MAX : total + size;
    };
    for (std::size_t index : entries) {
        if (archive.entryType(index) != EntryType::file)
            continue;
        const EntryRecord record = archive.entry(index);
        add(record.size);
        add(record.resourceForkSize.value_or(0));
    }
    return total;
}

int runExtract(const ParsedArguments& arguments) {
    if (int status = useOpeningOptions(arguments); status != kExitSuccess)
        return status;
    if (arguments.has("overwrite") && arguments.has("skip-existing")) {
        reportFailure("extract", std::nullopt,
                      "--overwrite and --skip-existing exclude each other");
        return kExitUsage;
    }
    ExtractOptions options;
    options.directory = localURL(arguments.value("directory").value_or("."));
    options.overwrite = arguments.has("overwrite");
    options.quiet = arguments.has("quiet");
    if (auto strip = arguments.value("strip-components")) {
        char* end = nullptr;
        const unsigned long long count = std::strtoull(strip->c_str(), &end, 10);
        if (strip->empty() || *end != '\0' || (*strip)[0] == '-' || count > 4096) {
            reportFailure("--strip-components " + *strip, std::nullopt,
                          "not a number of components");
            return kExitUsage;
        }
        options.stripComponents = static_cast<std::size_t>(count);
    }
    const std::string& operand = arguments.operands[0];
    auto archive = openArchiveOperand(operand);
    if (!archive)
        return kExitFailure;
    if (GWErrorPtr refusal = signatureRefusal(*archive, arguments)) {
        reportError(operand, std::nullopt, refusal);
        return kExitFailure;
    }
    if (GWErrorPtr integrity = archive->integrityError();
        integrity && !arguments.has("ignore-checksum")) {
        reportError(operand, std::nullopt, integrity);
        return kExitFailure;
    }
    bool allFound = true;
    std::vector<std::size_t> selected =
        selectEntries(*archive, operand, Selection::fromArguments(arguments, 1), &allFound);
    std::size_t skipped = 0;
    const std::vector<std::size_t> roots =
        extractionRoots(*archive, selected, options, arguments.has("skip-existing"), &skipped);
    std::vector<std::size_t> entries;
    for (std::size_t root : roots) {
        for (std::size_t index = root, end = archive->subtreeEnd(root); index < end; ++index)
            entries.push_back(index);
    }
    if (!usePasswordOptions(arguments, *archive, operand, entries))
        return kExitFailure;
    std::atomic<std::size_t> written{0};
    if (isVerbose()) {
        options.written = [&](const std::string& path) {
            ++written;
            const auto shown = strippedPath(path, options.stripComponents);
            std::printf("%s\n", printable(shown ? *shown : path).c_str());
        };
    }
    options.grants.keepSetIDBits = arguments.has("keep-setuid");
    options.grants.createDevices = arguments.has("devices");
    options.grants.privilegedAttributes = arguments.has("privileged-xattrs");
    options.grants.keepPinningFlags = arguments.has("keep-flags");
    // Refused before anything is written: a hostile archive fills no disk.
    GWErrorPtr spaceError;
    if (!GWCheckFreeSpace(options.directory, declaredSize(*archive, entries), &spaceError)) {
        reportError(operand, std::nullopt, spaceError);
        return kExitFailure;
    }
    std::unique_ptr<ProgressBar> bar;
    if (!options.quiet && wantsProgressBar(arguments)) {
        std::uint64_t total = 0;
        for (std::size_t index : entries)
            total += archive->entry(index).size;
        bar = std::make_unique<ProgressBar>(stderr, total);
        options.progress = [&bar](std::uint64_t bytes) {
            bar->advance(bytes);
            return true;
        };
    }
    bool extracted = archive->extract(roots, options, operand);
    if (bar)
        bar->finish();
    if (isVerbose()) {
        std::printf("%s: %zu written, %zu skipped (already there)\n",
                    GWRedactedURLString(operand).c_str(), written.load(), skipped);
    }
    return extracted && allFound ? kExitSuccess : kExitFailure;
}

}  // namespace

const Command kExtractCommand = {
    "extract",
    "extract entries with their metadata",
    "NAME\n"
    "    gwarchive extract - extract entries of a ZIP or XAR archive\n"
    "\n"
    "SYNOPSIS\n"
    "    gwarchive extract [-C DIR] [--overwrite|--skip-existing]\n"
    "                      [--strip-components N] [--include GLOB] [--exclude GLOB]\n"
    "                      [-q] [--ignore-checksum]\n"
    "                      [--encoding NAME] [--trust FILE] [--require-signature]\n"
    "                      [--keep-setuid] [--devices] [--privileged-xattrs]\n"
    "                      [--keep-flags] [--progress|--no-progress]\n"
    "                      [--password PW|--password-file FILE] [-v]\n"
    "                      ARCHIVE [PATH...]\n"
    "\n"
    "DESCRIPTION\n"
    "    Extracts every entry of ARCHIVE, or the named PATHs and everything below\n"
    "    them, beneath DIR (default: the current directory), at their full paths\n"
    "    in the archive. Each file is written to a temporary name on the same file\n"
    "    system and moved into place when complete, so a failure never leaves a\n"
    "    partial file. An item that already exists is an error for that entry and\n"
    "    the other entries go on; existing directories are merged into. ARCHIVE\n"
    "    may be a path or an http(s) URL.\n"
    "    A PATH is an entry's name or a shell pattern: * and ? stay within one\n"
    "    component, ** crosses \"/\", [...] as for fnmatch; a folder brings what\n"
    "    lies below it. A PATH that matches nothing is an error, said once the\n"
    "    rest is done.\n"
    "    A folder only part of which is written (some of its entries left out\n"
    "    by a pattern, --strip-components or --skip-existing) is made as a\n"
    "    plain folder, without its stored mode and date.\n"
    "\n"
    "    Encrypted ZIP entries (traditional or AES) need a password: without\n"
    "    --password or --password-file it is asked for, without echo, when\n"
    "    standard input is a terminal; an entry then fails with \"password\n"
    "    required\" or \"wrong password\" (GWZipArchiveErrorDomain 8, 9) and\n"
    "    nothing of it is written.\n"
    "\n"
    "    Mac metadata comes back as extended attributes: resource forks in\n"
    "    user.com.apple.ResourceFork, Finder information in user.com.apple.FinderInfo\n"
    "    (or an AppleDouble file ._name beside the file where the file system\n"
    "    refuses large attributes), comments in user.xdg.comment. AppleDouble\n"
    "    companions and MacBinary members are merged into the file they describe.\n"
    "    XAR modes, flags, ACLs, extended attributes, hard links and FIFOs are\n"
    "    restored as far as the system and the user's rights allow. Owners and\n"
    "    groups are restored only when running as root.\n"
    "\n"
    "    Nothing that grants privilege comes from an archive unless asked for,\n"
    "    since archives from strangers are often unpacked as root: set-ID and\n"
    "    sticky bits are dropped; device entries are not created and extended\n"
    "    attributes outside user. are not written, each with a warning line on\n"
    "    standard error (the extraction still succeeds); immutable and\n"
    "    append-only flags are not set. The options below restore each.\n"
    "\n"
    "OPTIONS\n"
    "    -C, --directory DIR  extract beneath DIR.\n"
    "    --overwrite          replace existing items instead of failing.\n"
    "    --skip-existing      keep existing items and write nothing in their\n"
    "                         place, without an error (-v counts them).\n"
    "    --strip-components N leave the first N components off every path; an\n"
    "                         entry with no more than N is not written.\n"
    "    --include GLOB       only what GLOB matches; repeatable.\n"
    "    --exclude GLOB       not what GLOB matches; repeatable, before --include.\n"
    "    -q, --quiet          print nothing but errors: no warnings, no progress.\n"
    "    --ignore-checksum    extract a XAR whose table of contents does not match\n"
    "                         its checksum; without it nothing is written.\n"
    "    --encoding NAME      read ZIP names that do not say they are UTF-8 in the\n"
    "                         encoding iconv calls NAME (e.g. CP437, CP866).\n"
    "    --trust FILE         PEM certificates that XAR signing chains may end at,\n"
    "                         besides the system's trusted roots.\n"
    "    --require-signature  write nothing unless the archive's signature is\n"
    "                         valid (see gwarchive info --help).\n"
    "    --progress           always show the progress bar on standard error.\n"
    "    --password PW        the password of encrypted ZIP entries (other users\n"
    "                         may see it in the process list).\n"
    "    --password-file FILE the password is FILE's first line.\n"
    "    --no-progress        never show it. By default it is shown when standard\n"
    "                         error is a terminal: bytes done and total, rate and\n"
    "                         time left.\n"
    "    --keep-setuid        keep set-user-ID, set-group-ID and sticky bits; off\n"
    "                         because a set-user-ID file unpacked as root runs as\n"
    "                         root for whoever starts it.\n"
    "    --devices            create character and block devices; off because a\n"
    "                         device node opens whatever disk or memory it names,\n"
    "                         whatever mode the archive gave it.\n"
    "    --privileged-xattrs  write trusted., security. and system. attributes;\n"
    "                         off because they carry integrity labels,\n"
    "                         capabilities and ACLs that no stranger should set.\n"
    "    --keep-flags         set immutable and append-only flags; off because\n"
    "                         they make items that even root cannot remove or\n"
    "                         replace without clearing them first.\n"
    "    -v, --verbose        print each item's path as it is written and a count\n"
    "                         at the end; errors carry their domain and code,\n"
    "                         and the library's log goes to standard error.\n"
    "\n"
    "EXIT STATUS\n"
    "    0 when every entry was extracted; 1 when ARCHIVE cannot be opened, its\n"
    "    table of contents is damaged, its signature is required and not valid, a\n"
    "    PATH is not in it or any entry failed; 2 on wrong usage.\n"
    "\n"
    "EXAMPLES\n"
    "    gwarchive extract -C ~/Restored Photos.zip\n"
    "    gwarchive extract --overwrite Installer.pkg Payload\n"
    "    gwarchive extract --skip-existing -v Photos.zip       # resume\n"
    "    gwarchive extract --strip-components 1 project-1.2.zip\n"
    "    gwarchive extract Site.zip 'docs/**.html' --exclude 'docs/old'\n"
    "    gwarchive extract --include '*.txt' Notes.zip\n"
    "    gwarchive extract --quiet --directory /srv/www Site.zip\n"
    "    gwarchive extract -q --no-progress Big.zip\n"
    "    gwarchive extract --progress Big.zip 2>progress.log\n"
    "    gwarchive extract --ignore-checksum Damaged.xar\n"
    "    gwarchive extract --encoding CP866 Russian.zip\n"
    "    gwarchive extract --require-signature --trust ca.pem Installer.pkg\n"
    "    gwarchive extract --password-file pw.txt Secret.zip\n"
    "    gwarchive extract --password 'open sesame' Secret.zip\n"
    "    sudo gwarchive extract -C / --keep-setuid --keep-flags System.xar\n"
    "    sudo gwarchive extract -C /mnt --devices --privileged-xattrs Root.xar\n",
    {{'C', "directory", true},
     {0, "overwrite", false},
     {0, "skip-existing", false},
     {0, "strip-components", true},
     {'q', "quiet", false},
     {0, "include", true},
     {0, "exclude", true},
     {0, "ignore-checksum", false},
     {0, "encoding", true},
     {0, "trust", true},
     {0, "require-signature", false},
     {0, "progress", false},
     {0, "no-progress", false},
     {0, "keep-setuid", false},
     {0, "devices", false},
     {0, "privileged-xattrs", false},
     {0, "keep-flags", false},
     {0, "password", true},
     {0, "password-file", true}},
    1,
    kAnyNumber,
    runExtract,
};

}  // namespace gwarchive
