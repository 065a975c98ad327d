// Archives written by other tools extract to the tree unzip (and bsdtar, for
// its own archives) makes of them: same paths, bytes, links and modes, and
// the same modification times where the archive carries extended timestamps.
// Each case skips when its tools are not installed.

#include <dirent.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <map>

#include "support/TestSupport.h"
#include "zip/GWZipArchive.h"

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
// files and links are compared by date.
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

class GWZipExtractPeers : public ::testing::Test {
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
        writeFile(source + "/tree/sub/tool.sh", bytesOf("#!/bin/sh\necho hi\n"));
        writeFile(source + "/tree/sub/deeper/secret", bytesOf("private"));
        run("chmod 755 src/tree/sub/tool.sh && chmod 600 src/tree/sub/deeper/secret");
        run("ln -s ../readme.txt src/tree/sub/link && ln -s deeper src/tree/sub/dirlink");
        run("touch -d '2021-03-04 05:06:07 UTC' src/tree/readme.txt src/tree/sub/tool.sh");
    }

    void run(const std::string& command) {
        const auto result = runCommand("cd " + shellQuote(directory.path()) + " && " + command);
        ASSERT_EQ(result.status, 0) << command << "\n" << result.output;
    }

    // Extracts `archive` with the library into `into`, and checks it
    // against `unzip` (and `bsdtar`, if asked).
    void check(const std::string& archive, bool compareDates, bool againstBsdtar = false) {
        const std::string archivePath = directory.file(archive);
        GWErrorPtr error;
        auto opened = GWZipArchive::initWithURL(GWURL::fileURLWithPath(archivePath), &error);
        ASSERT_TRUE(opened) << error->localizedDescription();
        const std::string ours = directory.file("ours-" + archive);
        ASSERT_TRUE(opened->extractFiles(opened->files(), GWURL::fileURLWithPath(ours), true,
                                         nullptr, &error))
            << error->localizedDescription();
        run("mkdir -p unzip-" + archive + " && unzip -q " + shellQuote(archive) + " -d unzip-" +
            archive);
        const Tree expected = treeAt(directory.file("unzip-" + archive));
        const Tree actual = treeAt(ours);
        ASSERT_GE(expected.size(), 9u) << "the peer left out most of the tree";
        expectSameTree(expected, actual, compareDates);
        if (againstBsdtar) {
            run("mkdir -p bsdtar-" + archive + " && bsdtar -xf " + shellQuote(archive) +
                " -C bsdtar-" + archive);
            expectSameTree(treeAt(directory.file("bsdtar-" + archive)), actual, compareDates);
        }
    }

    TemporaryDirectory directory;
    std::string source;
};

TEST_F(GWZipExtractPeers, InfoZipWithExtraFieldsAndStoredLinks) {
    if (!toolAvailable("zip")) {
        GTEST_SKIP() << "zip not installed";
    }
    run("cd src && zip -q -r -y ../infozip.zip tree");
    check("infozip.zip", true);
}

TEST_F(GWZipExtractPeers, InfoZipWithoutExtraFields) {
    if (!toolAvailable("zip")) {
        GTEST_SKIP() << "zip not installed";
    }
    run("cd src && zip -q -r -X -y ../plain.zip tree");
    check("plain.zip", false);
}

// Laid out as Android and Java tools do: a JAR marker on the first entry and
// alignment padding blocks on stored ones.
TEST_F(GWZipExtractPeers, PythonAndroidLikeStoredDeflatedBzip2AndZip64) {
    if (!toolAvailable("python3")) {
        GTEST_SKIP() << "python3 not installed";
    }
    const char* script = R"(
import os, struct, sys, zipfile
out = sys.argv[1]
with zipfile.ZipFile(out, 'w') as z:
    for root, dirs, files in os.walk('src/tree'):
        dirs.sort()
        for name in sorted(dirs + files):
            path = os.path.join(root, name)
            if os.path.islink(path):
                continue
            info = zipfile.ZipInfo.from_file(path, os.path.relpath(path, 'src'))
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
    writeFile(directory.file("make.py"), bytesOf(script));
    run("python3 make.py python.zip");
    check("python.zip", false);
}

// An archive cut short in an entry's data, in the central directory or in
// the end record gives back every whole entry 7zz gives back, and never the
// cut one.
TEST_F(GWZipExtractPeers, CutArchivesGiveBackWhatSevenZipDoes) {
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

TEST_F(GWZipExtractPeers, BsdtarZipMatchesUnzipAndBsdtar) {
    if (!toolAvailable("bsdtar")) {
        GTEST_SKIP() << "bsdtar not installed";
    }
    run("cd src && bsdtar --format zip -cf ../bsdtar.zip tree");
    check("bsdtar.zip", true, true);
}

TEST_F(GWZipExtractPeers, SevenZipZip) {
    if (!toolAvailable("7zz")) {
        GTEST_SKIP() << "7zz not installed";
    }
    run("cd src && 7zz a -tzip -snl ../seven.zip tree > /dev/null");
    check("seven.zip", false);
}

}  // namespace
