// Archives written by an independent tool (bsdtar) open with a valid checksum,
// read as the tree they were made from, and extract to that tree.

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/acl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/xattr.h>
#include <unistd.h>

#include "XarExtractTestSupport.h"

namespace {

using gwtest::TreeItem;

void expectSameItems(const std::map<std::string, TreeItem>& expected,
                     const std::map<std::string, TreeItem>& actual) {
    ASSERT_EQ(expected.size(), actual.size());
    for (const auto& [path, want] : expected) {
        ASSERT_TRUE(actual.count(path)) << path << " is missing";
        const TreeItem& got = actual.at(path);
        SCOPED_TRACE(path);
        EXPECT_EQ(got.mode, want.mode);
        EXPECT_EQ(got.owner, want.owner);
        EXPECT_EQ(got.group, want.group);
        EXPECT_EQ(got.device, want.device);
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

    // Extracted, the tree is the source's.
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
    expectSameItems(source, ours);
    EXPECT_EQ(ours.at("").modificationSeconds, 1100000000);
    // bsdtar gives the second name of a hard link no data of its own, so
    // nothing proves the bytes there are the target's: it becomes a copy.
    ASSERT_EQ(source.at("small").inode, source.at("d/hard").inode);
    EXPECT_NE(ours.at("small").inode, ours.at("d/hard").inode);
    EXPECT_EQ(ours.at("d/hard").digest, source.at("small").digest);
}

INSTANTIATE_TEST_SUITE_P(Compressions, GWXARBsdtar,
                         ::testing::Values("gzip", "bzip2", "xz", "lzma", "none"));

}  // namespace
