#include <algorithm>
#include <cstdio>
#include <ctime>

#include "Command.h"
#include "Diagnostics.h"
#include "JsonWriter.h"
#include "Locations.h"
#include "ToolArchive.h"

namespace gwarchive {

namespace {

void writeEntry(JsonWriter& json, const EntryRecord& entry) {
    json.beginObject();
    json.key("path");
    json.value(entry.path);
    json.key("type");
    json.value(entryTypeName(entry.type));
    json.key("mode");
    json.value(static_cast<std::uint64_t>(entry.mode));
    json.key("size");
    json.value(entry.size);
    json.key("compressedSize");
    json.value(entry.compressedSize);
    json.key("mtime");
    if (entry.modificationDate && !entry.madeUp) {
        json.value(entry.modificationDate->ISO8601String());
    } else {
        json.null();
    }
    json.key("uid");
    json.value(static_cast<std::uint64_t>(entry.uid));
    json.key("gid");
    json.value(static_cast<std::uint64_t>(entry.gid));
    auto optionalText = [&](const char* key, const std::optional<std::string>& text) {
        if (!text)
            return;
        json.key(key);
        json.value(*text);
    };
    optionalText("linkTarget", entry.linkTarget);
    optionalText("typeCode", entry.typeCode);
    optionalText("creatorCode", entry.creatorCode);
    if (entry.resourceForkSize) {
        json.key("resourceForkSize");
        json.value(*entry.resourceForkSize);
    }
    json.key("appleDouble");
    json.value(entry.appleDouble);
    json.key("macBinary");
    json.value(entry.macBinary);
    json.key("encrypted");
    json.value(entry.encrypted);
    json.key("xattrs");
    json.beginArray();
    for (const std::string& name : entry.xattrs)
        json.value(name);
    json.endArray();
    optionalText("compression", entry.compression);
    json.endObject();
}

std::string modeString(const EntryRecord& entry) {
    static const char kTypeLetters[] = "-dlhcbpsw?";
    std::string text(1, kTypeLetters[static_cast<int>(entry.type)]);
    const char* letters = "rwxrwxrwx";
    for (int bit = 0; bit < 9; ++bit)
        text += (entry.mode & (0400 >> bit)) ? letters[bit] : '-';
    if (entry.mode & 04000)
        text[3] = (entry.mode & 0100) ? 's' : 'S';
    if (entry.mode & 02000)
        text[6] = (entry.mode & 0010) ? 's' : 'S';
    if (entry.mode & 01000)
        text[9] = (entry.mode & 0001) ? 't' : 'T';
    return text;
}

std::string shortDate(const std::optional<GWDate>& date) {
    if (!date)
        return "                ";
    std::time_t seconds = static_cast<std::time_t>(date->wholeSeconds());
    std::tm fields{};
    gmtime_r(&seconds, &fields);
    char text[32];
    std::strftime(text, sizeof text, "%Y-%m-%d %H:%M", &fields);
    return text;
}

std::string macNotes(const EntryRecord& entry) {
    std::string notes;
    auto add = [&](const std::string& note) { notes += (notes.empty() ? "  [" : ", ") + note; };
    if (entry.typeCode || entry.creatorCode) {
        add(entry.typeCode.value_or("    ") + "/" + entry.creatorCode.value_or("    "));
    }
    if (entry.resourceForkSize)
        add("resource fork " + std::to_string(*entry.resourceForkSize));
    if (entry.appleDouble)
        add("AppleDouble");
    if (entry.macBinary)
        add("MacBinary");
    if (entry.encrypted)
        add("encrypted");
    if (!entry.xattrs.empty())
        add(std::to_string(entry.xattrs.size()) + " xattrs");
    return notes.empty() ? notes : notes + "]";
}

std::string displayName(const std::string& path, EntryType type) {
    return type == EntryType::directory ? path + "/" : path;
}

// Standard output stays locked while the names go out: 200,000 lines would
// otherwise take and release the lock twice each.
void printName(std::string_view path, EntryType type) {
    // Most names need no escaping; only those that might are copied.
    const bool plain = std::none_of(path.begin(), path.end(), [](char c) {
        const auto byte = static_cast<unsigned char>(c);
        return byte < 0x20 || byte == 0x7F || byte == 0xC2;
    });
    const std::string escaped = plain ? std::string() : printable(path);
    const std::string_view shown = plain ? path : std::string_view(escaped);
    fwrite_unlocked(shown.data(), 1, shown.size(), stdout);
    if (type == EntryType::directory)
        putchar_unlocked('/');
    putchar_unlocked('\n');
}

void printLongEntry(const EntryRecord& entry) {
    std::string link = entry.linkTarget ? " -> " + *entry.linkTarget : "";
    std::printf("%s %5u/%-5u %12llu %s %s%s%s\n", modeString(entry).c_str(), entry.uid, entry.gid,
                static_cast<unsigned long long>(entry.size),
                shortDate(entry.modificationDate).c_str(),
                printable(displayName(entry.path, entry.type)).c_str(), printable(link).c_str(),
                printable(macNotes(entry)).c_str());
}

// The closing line of a long listing, as column-listing archivers end theirs.
void printTotals(std::uint64_t entries, std::uint64_t bytes, std::uint64_t compressed) {
    const double saved =
        bytes == 0 || compressed >= bytes ? 0.0 : 100.0 * (bytes - compressed) / bytes;
    std::printf("%llu entries, %llu bytes, %llu compressed, %.0f%% saved\n",
                static_cast<unsigned long long>(entries), static_cast<unsigned long long>(bytes),
                static_cast<unsigned long long>(compressed), saved);
}

int runList(const ParsedArguments& arguments) {
    if (int status = useOpeningOptions(arguments); status != kExitSuccess)
        return status;
    const std::string& operand = arguments.operands[0];
    auto archive = openArchiveOperand(operand);
    if (!archive)
        return kExitFailure;
    bool allFound = true;
    const Selection selection = Selection::fromArguments(arguments, 1);
    std::vector<std::size_t> selected;
    if (!selection.choosesAll())
        selected = selectEntries(*archive, operand, selection, &allFound);
    // Without PATHs every entry, without an index array as long as the archive.
    auto forEachSelected = [&](auto&& visit) {
        if (selection.choosesAll()) {
            for (std::size_t index = 0; index < archive->entryCount(); ++index)
                visit(index);
        } else {
            for (std::size_t index : selected)
                visit(index);
        }
    };
    auto describe = [&](std::size_t index) {
        EntryRecord entry = archive->entry(index);
        if (entry.type == EntryType::symlink && !entry.linkTarget)
            entry.linkTarget = archive->readLinkTarget(index);
        return entry;
    };
    if (arguments.has("json")) {
        JsonWriter json;
        json.beginObject();
        json.key("format");
        json.value(archive->formatName());
        archive->writeArchiveFields(json);
        json.key("entries");
        json.beginArray();
        forEachSelected([&](std::size_t index) { writeEntry(json, describe(index)); });
        json.endArray();
        json.endObject();
        std::printf("%s\n", json.text().c_str());
    } else if (arguments.has("long")) {
        std::uint64_t entries = 0, bytes = 0, compressed = 0;
        forEachSelected([&](std::size_t index) {
            const EntryRecord entry = describe(index);
            printLongEntry(entry);
            ++entries;
            bytes += entry.size;
            compressed += entry.compressedSize;
        });
        printTotals(entries, bytes, compressed);
    } else {
        flockfile(stdout);
        forEachSelected([&](std::size_t index) {
            printName(archive->entryPath(index), archive->entryType(index));
        });
        funlockfile(stdout);
    }
    keepUntilExit(std::move(archive));
    return allFound ? kExitSuccess : kExitFailure;
}

}  // namespace

const Command kListCommand = {
    "list",
    "list the entries of an archive",
    "NAME\n"
    "    gwarchive list - list the entries of a ZIP or XAR archive\n"
    "\n"
    "SYNOPSIS\n"
    "    gwarchive list [-l|--long] [--json] [--include GLOB] [--exclude GLOB]\n"
    "                   [--encoding NAME] [--trust FILE] [-v] ARCHIVE [PATH...]\n"
    "\n"
    "DESCRIPTION\n"
    "    Lists the entries of ARCHIVE depth-first in tree order, each directory\n"
    "    before its contents, or only the entries the PATHs match and what lies\n"
    "    below them. A PATH is a name or a shell pattern: * and ? do not cross\n"
    "    \"/\", ** does (\"docs/**.txt\"), [...] as for fnmatch. A PATH that\n"
    "    matches nothing is an error, said after the rest is listed. A folder\n"
    "    made up for entries stored without it dates from the newest of what it\n"
    "    holds (mtime null in JSON).\n"
    "    AppleDouble companions (\"__MACOSX/._name\"), resource-fork members and\n"
    "    MacBinary wrappers are not listed as entries of their own: they belong to\n"
    "    the entry they describe, and the long and JSON forms say so. ARCHIVE may\n"
    "    be a path or an http(s) URL.\n"
    "\n"
    "OPTIONS\n"
    "    -l, --long  one line per entry like ls -l: mode, owner/group ids, size,\n"
    "                modification time (UTC), path, link target, and in brackets\n"
    "                the Mac type/creator, resource fork size, AppleDouble,\n"
    "                MacBinary, the number of extended attributes and encrypted;\n"
    "                then a totals line: entries, bytes, compressed bytes and the\n"
    "                share saved.\n"
    "    --include GLOB  only what GLOB matches; repeatable.\n"
    "    --exclude GLOB  not what GLOB matches; repeatable, before --include.\n"
    "    --json      one JSON object {\"format\": \"zip\"|\"xar\", ..., \"entries\": [...]}.\n"
    "                Each entry has path, type (file, directory, symlink, hardlink,\n"
    "                char, block, fifo, socket, whiteout, unknown), mode (with the\n"
    "                type bits), size, compressedSize, mtime (RFC 3339, UTC), uid, gid,\n"
    "                appleDouble, macBinary, encrypted, xattrs, and where known\n"
    "                linkTarget, typeCode, creatorCode, resourceForkSize and\n"
    "                compression (under the encryption, for a ZIP AES entry). ZIP\n"
    "                archives add startOffset and dataOffset (where the first\n"
    "                entry begins; null when there is none); XAR archives add checksum,\n"
    "                checksumIsValid, signatureIsValid, signature, signatureReason,\n"
    "                signatures and subdocuments (see the README).\n"
    "    --encoding NAME  read ZIP names that do not say they are UTF-8 in the\n"
    "                encoding iconv calls NAME (e.g. CP437, CP866).\n"
    "    --trust FILE  PEM certificates that XAR signing chains may end at.\n"
    "    -v, --verbose  errors carry their domain and code; the library's log goes\n"
    "                to standard error.\n"
    "\n"
    "EXIT STATUS\n"
    "    0 on success; 1 when ARCHIVE cannot be opened or a PATH matches nothing; 2 on\n"
    "    wrong usage.\n"
    "\n"
    "EXAMPLES\n"
    "    gwarchive list -l Photos.zip\n"
    "    gwarchive list --json Installer.pkg | python3 -m json.tool\n"
    "    gwarchive list Site.zip 'docs/**.html' images\n"
    "    gwarchive list --include '*.txt' --exclude 'old' Notes.zip\n"
    "    gwarchive list --encoding CP437 Old.zip\n"
    "    gwarchive list -v --trust ca.pem Installer.pkg\n",
    {{'l', "long", false},
     {0, "json", false},
     {0, "encoding", true},
     {0, "trust", true},
     {0, "include", true},
     {0, "exclude", true}},
    1,
    kAnyNumber,
    runList,
};

}  // namespace gwarchive
