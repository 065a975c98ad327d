// Archives other tools write list as zipinfo lists them and extract to the
// tree unzip (and bsdtar, for its own archives) makes of them: same paths,
// bytes, links and modes, and the times and owners their extra fields carry.
// Each case skips when its tools are not installed.

#include <dirent.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <map>

#include "support/TestSupport.h"
#include "zip/GWZipArchive.h"
#include "zip/ZipExtractTestSupport.h"
#include "zip/ZipListingSupport.h"

namespace {

using namespace gwtest;

struct TreeItem {
    char kind = '?';  // 'f' file, 'd' directory, 'l' link
    GWData bytes;     // file contents or link target
    unsigned mode = 0;
    long long modified = 0;
};
using Tree = std::map<std::string, TreeItem>;

void walk(const std::string& root, const std::string& relative, Tree& tree) {
    DIR* handle = ::opendir((root + "/" + relative).c_str());
    ASSERT_TRUE(handle) << root << "/" << relative;
    while (const dirent* entry = ::readdir(handle)) {
        const std::string name = entry->d_name;
        if (name == "." || name == "..") {
            continue;
        }
        const std::string path = relative.empty() ? name : relative + "/" + name;
        const std::string full = root + "/" + path;
        struct stat status {};
        ASSERT_EQ(::lstat(full.c_str(), &status), 0) << full;
        TreeItem item;
        item.mode = status.st_mode & 07777;
        item.modified = status.st_mtim.tv_sec;
        if (S_ISLNK(status.st_mode)) {
            item.kind = 'l';
            char target[4096];
            const ssize_t length = ::readlink(full.c_str(), target, sizeof target);
            item.bytes.assign(target, target + std::max<ssize_t>(length, 0));
            item.mode = 0;
        } else if (S_ISDIR(status.st_mode)) {
            item.kind = 'd';
            walk(root, path, tree);
        } else {
            item.kind = 'f';
            item.bytes = readFile(full);
        }
        tree[path] = std::move(item);
    }
    ::closedir(handle);
}

Tree treeAt(const std::string& root) {
    Tree tree;
    walk(root, "", tree);
    return tree;
}

// Directories get their dates before their children are written, so only
// files are compared by date.
void expectSameTree(const Tree& expected, const Tree& actual, bool compareDates) {
    std::vector<std::string> expectedPaths, actualPaths;
    for (const auto& [path, item] : expected) {
        expectedPaths.push_back(path);
    }
    for (const auto& [path, item] : actual) {
        actualPaths.push_back(path);
    }
    ASSERT_EQ(actualPaths, expectedPaths);
    for (const auto& [path, item] : expected) {
        const TreeItem& other = actual.at(path);
        EXPECT_EQ(other.kind, item.kind) << path;
        EXPECT_EQ(other.bytes, item.bytes) << path;
        EXPECT_EQ(other.mode, item.mode)
            << path << std::oct << " " << other.mode << " vs " << item.mode;
        if (compareDates && item.kind == 'f') {
            EXPECT_EQ(other.modified, item.modified) << path;
        }
    }
}

// Laid out as Android and Java tools do: a JAR marker on the first entry,
// alignment padding blocks on stored ones, methods mixed and Zip64 forced
// on some entries.
const char* kPythonScript = R"(
import os, struct, sys, zipfile
with zipfile.ZipFile(sys.argv[1], 'w') as z:
    for root, dirs, files in os.walk('tree'):
        dirs.sort()
        for name in sorted(dirs + files):
            path = os.path.join(root, name)
            if os.path.islink(path):
                continue
            info = zipfile.ZipInfo.from_file(path, path)
            if info.is_dir():
                z.writestr(info, b'')
                continue
            data = open(path, 'rb').read()
            info.compress_type = [zipfile.ZIP_STORED, zipfile.ZIP_DEFLATED,
                                  zipfile.ZIP_BZIP2][len(name) % 3]
            if not z.infolist():
                info.extra = struct.pack('<HH', 0xCAFE, 0)
            elif info.compress_type == zipfile.ZIP_STORED:
                info.extra = struct.pack('<HHH3x', 0xD935, 5, 4)
            with z.open(info, 'w', force_zip64=name.endswith('.bin')) as f:
                f.write(data)
)";

struct PeerCase {
    const char* label;
    const char* tool;
    const char* command;   // run in src; writes ../peer.zip
    bool compareDates;     // the archive carries exact modification times
    bool ownerAndUTCTime;  // and the owner and a UTC time of tree/readme.txt
    bool againstBsdtar = false;
};

void PrintTo(const PeerCase& c, std::ostream* out) {
    *out << c.label;
}

// 2021-03-04 05:06:00 UTC: whole minutes, since a DOS time keeps half the
// seconds and this loader (unlike zipinfo) does not double them back.
constexpr long long kModified = 1614834360;
constexpr unsigned kOwner = 1234, kGroup = 5678;

class GWZipPeers : public ::testing::TestWithParam<PeerCase> {
protected:
    void SetUp() override {
        if (!toolAvailable("unzip")) {
            GTEST_SKIP() << "unzip not installed";
        }
        // A source tree with the kinds and modes archives carry.
        source = directory.file("src");
        run("mkdir -p src/tree/sub/deeper src/tree/empty");
        writeFile(source + "/tree/readme.txt", textBytes(40000, 1));
        writeFile(source + "/tree/random.bin", randomBytes(70000, 2));
        writeFile(source + "/tree/empty.txt", {});
        writeFile(source + "/tree/with space.txt", bytesOf("spaced"));
        writeFile(source + "/tree/sub/tool.sh", bytesOf("#!/bin/sh\necho hi\n"));
        writeFile(source + "/tree/sub/deeper/secret", bytesOf("private"));
        run("chmod 755 src/tree/sub/tool.sh && chmod 600 src/tree/sub/deeper/secret");
        run("ln -s ../readme.txt src/tree/sub/link && ln -s deeper src/tree/sub/dirlink");
        run("find src/tree -exec touch -h -d @" + std::to_string(kModified) + " {} +");
        owned = ::chown((source + "/tree/readme.txt").c_str(), kOwner, kGroup) == 0;
    }

    void run(const std::string& command) {
        const auto result = runCommand("cd " + shellQuote(directory.path()) + " && " + command);
        ASSERT_EQ(result.status, 0) << command << "\n" << result.output;
    }

    TemporaryDirectory directory;
    std::string source;
    bool owned = false;
};

TEST_P(GWZipPeers, ListsAsZipinfoAndExtractsAsUnzip) {
    const PeerCase& c = GetParam();
    if (!toolAvailable(c.tool)) {
        GTEST_SKIP() << c.tool << " not installed";
    }
    writeFile(directory.file("src/make.py"), bytesOf(kPythonScript));
    run(std::string("cd src && ") + c.command);
    const std::string path = directory.file("peer.zip");
    GWErrorPtr error;
    auto archive = GWZipArchive::initWithURL(GWURL::fileURLWithPath(path), &error);
    ASSERT_TRUE(archive) << error->localizedDescription();

    // Entries zipinfo does not list must be directories the loader made for
    // paths without an entry.
    if (toolAvailable("zipinfo")) {
        const Listing theirs = zipinfoListing(path);
        const Listing ours = listingOfTree(archive->files());
        ASSERT_GE(theirs.size(), 8u);
        for (const auto& [name, entry] : theirs) {
            auto found = ours.find(name);
            ASSERT_NE(found, ours.end()) << name << " is missing";
            EXPECT_EQ(found->second, entry) << name;
        }
        for (const auto& [name, entry] : ours) {
            if (!theirs.count(name)) {
                EXPECT_EQ(entry.mode[0], 'd') << name << " is not in zipinfo's listing";
            }
        }
    }
    if (c.ownerAndUTCTime) {
        auto readme = archive->fileWithPath("tree/readme.txt");
        ASSERT_TRUE(readme);
        ASSERT_TRUE(readme->modificationDate());
        EXPECT_EQ(readme->modificationDate()->timeIntervalSince1970(), double(kModified));
        if (owned && std::string(c.tool) == "zip") {
            EXPECT_EQ(readme->owner(), kOwner);
            EXPECT_EQ(readme->groupOwner(), kGroup);
        }
    }

    const std::string ours = directory.file("ours");
    ASSERT_TRUE(archive->extractFiles(archive->files(), GWURL::fileURLWithPath(ours), true, nullptr,
                                      &error))
        << error->localizedDescription();
    run("mkdir -p unzip && unzip -q peer.zip -d unzip");
    const Tree expected = treeAt(directory.file("unzip"));
    const Tree actual = treeAt(ours);
    ASSERT_GE(expected.size(), 9u) << "the peer left out most of the tree";
    expectSameTree(expected, actual, c.compareDates);
    if (c.againstBsdtar) {
        run("mkdir -p bsdtar && bsdtar -xf peer.zip -C bsdtar");
        expectSameTree(treeAt(directory.file("bsdtar")), actual, c.compareDates);
    }
}

INSTANTIATE_TEST_SUITE_P(
    EveryPeer, GWZipPeers,
    ::testing::Values(
        PeerCase{"InfoZip", "zip", "zip -q -r -y ../peer.zip tree", true, true},
        PeerCase{"InfoZipWithoutExtraFields", "zip", "zip -q -r -X -y ../peer.zip tree", false,
                 false},
        PeerCase{"Bsdtar", "bsdtar", "bsdtar --format zip -cf ../peer.zip tree", true, true, true},
        PeerCase{"SevenZipNTFSTimes", "7zz",
                 "7zz a -tzip -snl -mtm=on -mta=on -mtc=on ../peer.zip tree > /dev/null", false,
                 true},
        PeerCase{"PythonAndroidLike", "python3", "python3 make.py ../peer.zip", false, false}),
    [](const auto& info) { return std::string(info.param.label); });

// An archive cut short in an entry's data, in the central directory or in
// the end record gives back every whole entry 7zz gives back, and never the
// cut one.
TEST_F(GWZipPeers, CutArchivesGiveBackWhatSevenZipDoes) {
    if (!toolAvailable("7zz")) {
        GTEST_SKIP() << "7zz not installed";
    }
    run("cd src && 7zz a -tzip -snl ../whole.zip tree > /dev/null");
    const GWData whole = readFile(directory.file("whole.zip"));
    const Tree original = treeAt(source);
    for (std::size_t cut : {whole.size() / 2, whole.size() - 30, whole.size() - 10}) {
        SCOPED_TRACE(cut);
        const std::string name = "cut" + std::to_string(cut);
        writeFile(directory.file(name + ".zip"), GWData(whole.begin(), whole.begin() + cut));
        GWErrorPtr error;
        auto opened = GWZipArchive::initWithURL(directory.url(name + ".zip"), &error);
        ASSERT_TRUE(opened) << error->localizedDescription();
        EXPECT_GT(opened->recoveredEntryCount(), 0u);
        ASSERT_TRUE(opened->extractFiles(opened->files(), directory.url("ours-" + name), true,
                                         nullptr, &error))
            << error->localizedDescription();
        runCommand("cd " + shellQuote(directory.path()) + " && 7zz x -y -o7zz-" + name + " " +
                   name + ".zip > /dev/null 2>&1");
        const Tree ours = treeAt(directory.file("ours-" + name));
        const Tree theirs = treeAt(directory.file("7zz-" + name));
        for (const auto& [path, item] : theirs) {
            const bool whole = item.bytes == original.at(path).bytes;
            EXPECT_EQ(ours.count(path) != 0, whole || item.kind == 'd') << path;
        }
        for (const auto& [path, item] : ours) {
            ASSERT_TRUE(theirs.count(path)) << path;
            EXPECT_EQ(item.bytes, original.at(path).bytes) << path;
        }
    }
}

// The methods only 7zz writes here: what it extracts, the library does.
TEST_F(GWZipPeers, SevenZipArchivesOfEveryMethodExtractAsSevenZipDoes) {
    if (!toolAvailable("7zz")) {
        GTEST_SKIP() << "7zz is not installed";
    }
    // Runs of a 40000-byte block reach Deflate64's far distances and long lengths.
    GWData content = textBytes(1 << 20, 5);
    const GWData block = randomBytes(40000, 6);
    for (int copies = 0; copies < 5; ++copies) {
        content.insert(content.end(), block.begin(), block.end());
    }
    writeFile(directory.file("member.bin"), content);
    for (const std::string method : {"Deflate64", "LZMA", "xz"}) {
        const std::string archive = method + ".zip";
        run("7zz a -tzip -mm=" + method + " " + archive + " member.bin >/dev/null");
        const CommandResult peer =
            runCommand("cd " + shellQuote(directory.path()) + " && 7zz x -so " + archive);
        ASSERT_EQ(peer.output, std::string(content.begin(), content.end())) << method;
        GWErrorPtr error;
        auto opened = GWZipArchive::initWithURL(directory.url(archive), &error);
        ASSERT_TRUE(opened) << method;
        ASSERT_TRUE(
            opened->extractFiles(opened->files(), directory.url(method), true, nullptr, &error))
            << method << ": " << error->localizedDescription();
        EXPECT_TRUE(readFile(directory.file(method + "/member.bin")) == content) << method;
    }
}

}  // namespace
