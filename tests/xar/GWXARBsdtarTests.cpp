// Archives written by an independent tool (bsdtar) open with a valid checksum,
// list as the tool lists them, and extract to the tree they were made from and
// to what the tool itself extracts.

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/acl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <sstream>

#include "XarExtractTestSupport.h"

namespace {

using gwtest::TreeItem;

std::string modeString(std::uint16_t mode) {
    std::string text;
    switch (mode & 0170000) {
        case 0040000: text = "d"; break;
        case 0120000: text = "l"; break;
        case 0010000: text = "p"; break;
        case 0020000: text = "c"; break;
        case 0060000: text = "b"; break;
        default: text = "-";
    }
    const char* letters = "rwxrwxrwx";
    for (int bit = 8; bit >= 0; --bit) {
        text += (mode >> bit) & 1 ? letters[8 - bit] : '-';
    }
    return text;
}

void expectSameItems(const std::map<std::string, TreeItem>& expected,
                     const std::map<std::string, TreeItem>& actual, const std::string& what,
                     bool compareDevices = true) {
    ASSERT_EQ(expected.size(), actual.size()) << what;
    for (const auto& [path, want] : expected) {
        ASSERT_TRUE(actual.count(path)) << what << ": " << path << " is missing";
        const TreeItem& got = actual.at(path);
        SCOPED_TRACE(what + ": " + path);
        EXPECT_EQ(got.mode, want.mode);
        EXPECT_EQ(got.owner, want.owner);
        EXPECT_EQ(got.group, want.group);
        if (compareDevices) {
            EXPECT_EQ(got.device, want.device);
        }
        EXPECT_EQ(got.linkText, want.linkText);
        EXPECT_EQ(got.digest, want.digest);
        EXPECT_EQ(got.attributes, want.attributes);
        if (!S_ISLNK(want.mode)) {
            EXPECT_EQ(got.modificationSeconds, want.modificationSeconds);
        }
    }
}

// Builds tree/ with every kind of item bsdtar archives and archives it with
// the compression named by the parameter.
class GWXARBsdtar : public ::testing::TestWithParam<std::string> {
protected:
    void SetUp() override {
        if (!gwtest::toolAvailable("bsdtar")) {
            GTEST_SKIP() << "bsdtar is not installed";
        }
        root = directory.file("source/tree");
        ASSERT_EQ(mkdir(directory.file("source").c_str(), 0755), 0);
        ASSERT_EQ(mkdir(root.c_str(), 0751), 0);
        write("empty", {});
        write("small", gwtest::bytesOf("small file\n"));
        // Many decoder pieces; bsdtar takes most of a minute to write this much as xz.
        write("large", gwtest::textBytes(xz() ? 300000 : 50 * 1024 * 1024, 11));
        ASSERT_EQ(mkdir((root + "/d").c_str(), 0700), 0);
        ASSERT_EQ(mkdir((root + "/d/e").c_str(), 0755), 0);
        ASSERT_EQ(mkdir((root + "/d/e/f").c_str(), 0705), 0);
        write("d/e/f/deep", gwtest::randomBytes(10000, 3));
        setxattr((root + "/d/e/f").c_str(), "user.folder", "f", 1, 0);
        ASSERT_EQ(symlink("../small", (root + "/d/relative").c_str()), 0);
        ASSERT_EQ(symlink("/nonexistent/absolute", (root + "/absolute").c_str()), 0);
        ASSERT_EQ(link((root + "/small").c_str(), (root + "/d/hard").c_str()), 0);
        ASSERT_EQ(mkfifo((root + "/fifo").c_str(), 0640), 0);
        chmod((root + "/fifo").c_str(), 0640);
        if (geteuid() == 0) {
            ASSERT_EQ(mknod((root + "/char").c_str(), S_IFCHR | 0620, makedev(1, 7)), 0);
            ASSERT_EQ(mknod((root + "/block").c_str(), S_IFBLK | 0600, makedev(7, 200)), 0);
            ASSERT_EQ(chown((root + "/small").c_str(), 4321, 765), 0);
        }
        write("attributes", gwtest::bytesOf("with attributes"));
        setxattr((root + "/attributes").c_str(), "user.first", "1", 1, 0);
        setxattr((root + "/attributes").c_str(), "user.second", "two", 3, 0);
        write("acl", gwtest::bytesOf("with an ACL"));
        if (acl_t acl = acl_from_text("u::rw-,u:1234:r--,g::r--,m::r--,o::---")) {
            acl_set_file((root + "/acl").c_str(), ACL_TYPE_ACCESS, acl);
            acl_free(acl);
        }
        chmod((root + "/large").c_str(), 0604);
        // Dates in whole seconds, in the past: what the format keeps.
        const timespec times[2] = {{1000000000, 0}, {1100000000, 0}};
        for (const char* path : {"", "/small", "/d", "/d/e/f", "/absolute"}) {
            utimensat(AT_FDCWD, (root + path).c_str(), times, AT_SYMLINK_NOFOLLOW);
        }
        archivePath = directory.file("tree.xar");
        const auto result =
            gwtest::runCommand("bsdtar --format xar --options xar:compression=" + GetParam() +
                               " -cf " + gwtest::shellQuote(archivePath) + " -C " +
                               gwtest::shellQuote(directory.file("source")) + " tree 2>&1");
        ASSERT_EQ(result.status, 0) << result.output;
        GWErrorPtr error;
        archive = GWXARArchive::initWithURL(GWURL::fileURLWithPath(archivePath), true, &error);
        ASSERT_TRUE(archive) << error->localizedDescription();
    }

    bool xz() const { return GetParam() == "xz" || GetParam() == "lzma"; }
    void write(const std::string& path, const GWData& bytes) {
        gwtest::writeFile(root + "/" + path, bytes);
    }

    gwtest::TemporaryDirectory directory;
    std::string root;
    std::string archivePath;
    GWXARArchivePtr archive;
};

TEST_P(GWXARBsdtar, ReadsAndExtractsAsTheSourceAndBsdtarSay) {
    EXPECT_TRUE(archive->checksumIsValid());
    const auto source = gwtest::snapshotTree(root);
    for (const auto& [path, item] : source) {
        SCOPED_TRACE(path);
        auto entry = archive->fileWithPath(path.empty() ? "tree" : "tree/" + path);
        ASSERT_TRUE(entry);
        EXPECT_EQ(entry->permissionsMode(), item.mode & 0177777);
        EXPECT_EQ(entry->ownerID(), item.owner);
        EXPECT_EQ(entry->groupOwnerID(), item.group);
        EXPECT_EQ(entry->inode(), item.inode);
        ASSERT_TRUE(entry->modificationDate());
        EXPECT_EQ(entry->modificationDate()->timeIntervalSince1970(),
                  double(item.modificationSeconds));
        if (S_ISLNK(item.mode)) {
            EXPECT_EQ(entry->symlinkDestination(), item.linkText);
        }
        if (item.device) {
            EXPECT_EQ(entry->deviceMajorNumber(), major(item.device));
            EXPECT_EQ(entry->deviceMinorNumber(), minor(item.device));
        }
    }
    // bsdtar marks the first of the pair as the original and links the second to it.
    auto small = archive->fileWithPath("tree/small"), hard = archive->fileWithPath("tree/d/hard");
    EXPECT_TRUE(small->hardlinkDestination() == hard || hard->hardlinkDestination() == small);

    // Extracted, the tree is the source's and what bsdtar makes of the archive.
    ASSERT_EQ(mkdir(directory.file("ours").c_str(), 0755), 0);
    bool checksumIsInvalid = true;
    GWErrorPtr error;
    GWExtractOptions devices;
    devices.createDevices = true;
    ASSERT_TRUE(archive->extractFile(archive->fileWithPath("tree"), directory.url("ours/tree"),
                                     &checksumIsInvalid, &error, devices))
        << error->localizedDescription();
    EXPECT_FALSE(checksumIsInvalid);
    const auto ours = gwtest::snapshotTree(directory.file("ours/tree"));
    expectSameItems(source, ours, "source vs library");
    EXPECT_EQ(ours.at("").modificationSeconds, 1100000000);
    // bsdtar gives the second name of a hard link no data of its own, so
    // nothing proves the bytes there are the target's: it becomes a copy.
    ASSERT_EQ(gwtest::hardLinkGroups(source).size(), 1u);
    EXPECT_TRUE(gwtest::hardLinkGroups(ours).empty());
    EXPECT_EQ(ours.at("d/hard").digest, source.at("small").digest);
    if (xz()) {
        return;  // bsdtar fails to read back the small xz streams it writes
    }
    // bsdtar's own listing: mode, owner, group and size of every member.
    auto listing = gwtest::runCommand("bsdtar -tvf " + gwtest::shellQuote(archivePath));
    ASSERT_EQ(listing.status, 0) << listing.output;
    std::istringstream lines(listing.output);
    std::string line;
    int checked = 0;
    while (std::getline(lines, line)) {
        std::istringstream fields(line);
        std::string mode, links, owner, group, size, month, day, time, name;
        fields >> mode >> links >> owner >> group >> size;
        if (size.ends_with(',')) {
            fields >> size;  // "1, 3": a device's numbers stand where the size would
        }
        fields >> month >> day >> time >> name;
        SCOPED_TRACE(line);
        auto entry = archive->fileWithPath(name);
        ASSERT_TRUE(entry);
        EXPECT_EQ(modeString(entry->permissionsMode()), mode);
        // Owners without a name here are listed by number.
        EXPECT_EQ(entry->ownerName().value_or(std::to_string(entry->ownerID())), owner);
        EXPECT_EQ(entry->groupOwnerName().value_or(std::to_string(entry->groupOwnerID())), group);
        if (entry->type() == GWXARFileTypeRegular) {
            EXPECT_EQ(std::to_string(entry->dataFork() ? entry->dataFork()->uncompressedSize() : 0),
                      size);
        }
        ++checked;
    }
    EXPECT_EQ(checked, int(source.size()));
    ASSERT_EQ(mkdir(directory.file("theirs").c_str(), 0755), 0);
    const auto result =
        gwtest::runCommand("bsdtar -xpf " + gwtest::shellQuote(archivePath) + " -C " +
                           gwtest::shellQuote(directory.file("theirs")) + " 2>&1");
    ASSERT_EQ(result.status, 0) << result.output;
    // bsdtar reads its own device elements back as 0,0 (bsdtar -tv shows it).
    expectSameItems(gwtest::snapshotTree(directory.file("theirs/tree")), ours, "bsdtar vs library",
                    false);
}

INSTANTIATE_TEST_SUITE_P(Compressions, GWXARBsdtar,
                         ::testing::Values("gzip", "bzip2", "xz", "lzma", "none"));

}  // namespace
