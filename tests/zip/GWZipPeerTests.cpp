// Archives other tools write extract to the tree unzip (and bsdtar, for its
// own archives) makes of them: same paths, bytes, links, modes and file
// times, and the owners and UTC times their extra fields carry. Each case
// skips when its tools are not installed.

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <map>

#include "support/TestSupport.h"
#include "zip/GWZipArchive.h"

namespace {

using namespace gwtest;

// Path -> kind ('f', 'd', 'l'), mode, file time and bytes or link target.
// Directories get their dates before their children are written, so only
// files keep theirs.
using Tree = std::map<std::string, std::string>;

Tree treeAt(const std::string& root, bool withDates) {
    Tree tree;
    for (const auto& item : std::filesystem::recursive_directory_iterator(root)) {
        struct stat status {};
        ::lstat(item.path().c_str(), &status);
        std::string description;
        if (S_ISLNK(status.st_mode)) {
            description = "l " + std::filesystem::read_symlink(item.path()).string();
        } else if (S_ISDIR(status.st_mode)) {
            description = "d " + std::to_string(status.st_mode & 07777);
        } else {
            const GWData bytes = readFile(item.path());
            description = "f " + std::to_string(status.st_mode & 07777) + " " +
                          (withDates ? std::to_string(status.st_mtim.tv_sec) : "") + " " +
                          std::string(bytes.begin(), bytes.end());
        }
        tree[std::filesystem::relative(item.path(), root).string()] = description;
    }
    return tree;
}

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
        const std::string source = directory.file("src");
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
    bool owned = false;
};

TEST_P(GWZipPeers, ExtractsAsUnzip) {
    const PeerCase& c = GetParam();
    if (!toolAvailable(c.tool)) {
        GTEST_SKIP() << c.tool << " not installed";
    }
    run(std::string("cd src && ") + c.command);
    GWErrorPtr error;
    auto archive = GWZipArchive::initWithURL(directory.url("peer.zip"), &error);
    ASSERT_TRUE(archive) << error->localizedDescription();
    if (c.ownerAndUTCTime) {
        auto readme = archive->fileWithPath("tree/readme.txt");
        ASSERT_TRUE(readme && readme->modificationDate());
        EXPECT_EQ(readme->modificationDate()->timeIntervalSince1970(), double(kModified));
        if (owned && std::string(c.tool) == "zip") {
            EXPECT_EQ(readme->owner(), kOwner);
            EXPECT_EQ(readme->groupOwner(), kGroup);
        }
    }
    ASSERT_TRUE(
        archive->extractFiles(archive->files(), directory.url("ours"), true, nullptr, &error))
        << error->localizedDescription();
    run("mkdir -p unzip && unzip -q peer.zip -d unzip");
    const Tree actual = treeAt(directory.file("ours"), c.compareDates);
    const Tree expected = treeAt(directory.file("unzip"), c.compareDates);
    ASSERT_GE(expected.size(), 9u) << "the peer left out most of the tree";
    EXPECT_TRUE(actual == expected);
    if (c.againstBsdtar) {
        run("mkdir -p bsdtar && bsdtar -xf peer.zip -C bsdtar");
        EXPECT_TRUE(treeAt(directory.file("bsdtar"), c.compareDates) == actual);
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
                 true}),
    [](const auto& info) { return std::string(info.param.label); });

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
