// The private build directory beside a destination, the no-replace move and
// the removal of trees that flags would pin.

#include <gtest/gtest.h>

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>

#include "foundation/GWFileDescriptor.h"
#include "foundation/GWItemReplacement.h"
#include "support/TestSupport.h"

namespace {

bool exists(const std::string& path) {
    struct stat info;
    return lstat(path.c_str(), &info) == 0;
}

TEST(GWItemReplacement, NearestExistingAncestorClimbsToWhatExists) {
    gwtest::TemporaryDirectory directory;
    EXPECT_EQ(GWNearestExistingAncestor(directory.file("a/b/c")), directory.path());
    EXPECT_EQ(GWNearestExistingAncestor(directory.path()), directory.path());
    EXPECT_EQ(GWNearestExistingAncestor("/nonexistent-gw/x"), "/");
}

TEST(GWItemReplacement, DirectoryIsPrivateOnTheDestinationsDeviceAndGoesAway) {
    gwtest::TemporaryDirectory directory;
    std::string path;
    {
        GWErrorPtr error;
        auto temporary =
            GWItemReplacementDirectory::createForDestination(directory.file("new/item"), &error);
        ASSERT_TRUE(temporary) << error->localizedDescription();
        path = temporary->path();
        struct stat made, destination;
        ASSERT_EQ(stat(path.c_str(), &made), 0);
        ASSERT_EQ(stat(directory.path().c_str(), &destination), 0);
        EXPECT_TRUE(S_ISDIR(made.st_mode));
        EXPECT_EQ(made.st_mode & 0777, 0700u);
        EXPECT_EQ(made.st_dev, destination.st_dev);
        ASSERT_EQ(mkdir((path + "/sub").c_str(), 0500), 0);
        gwtest::writeFile(path + "/file", gwtest::bytesOf("x"));
        ASSERT_EQ(mkdir(directory.file("keep").c_str(), 0755), 0);
        gwtest::writeFile(directory.file("keep/file"), gwtest::bytesOf("kept"));
        ASSERT_EQ(symlink(directory.file("keep").c_str(), (path + "/link").c_str()), 0);
    }
    EXPECT_FALSE(exists(path));
    EXPECT_TRUE(exists(directory.file("keep/file"))) << "removal followed a symbolic link";
}

TEST(GWItemReplacement, MoveNeverReplaces) {
    gwtest::TemporaryDirectory directory;
    gwtest::writeFile(directory.file("from"), gwtest::bytesOf("new"));
    gwtest::writeFile(directory.file("to"), gwtest::bytesOf("old"));
    GWErrorPtr error;
    EXPECT_FALSE(GWMoveItemNoReplace(directory.file("from"), directory.file("to"), &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWPOSIXErrorDomain, EEXIST));
    EXPECT_EQ(gwtest::readFile(directory.file("to")), gwtest::bytesOf("old"));

    // A dangling symbolic link is something too.
    ASSERT_EQ(symlink("nowhere", directory.file("dangling").c_str()), 0);
    EXPECT_FALSE(GWMoveItemNoReplace(directory.file("from"), directory.file("dangling"), nullptr));

    EXPECT_TRUE(GWMoveItemNoReplace(directory.file("from"), directory.file("fresh"), &error));
    EXPECT_EQ(gwtest::readFile(directory.file("fresh")), gwtest::bytesOf("new"));
    EXPECT_FALSE(exists(directory.file("from")));
}

TEST(GWItemReplacement, RemovalClearsFlagsThatPinTheTree) {
    if (geteuid() != 0) {
        GTEST_SKIP() << "inode flags need root";
    }
    gwtest::TemporaryDirectory directory;
    const std::string tree = directory.file("tree");
    ASSERT_EQ(mkdir(tree.c_str(), 0755), 0);
    gwtest::writeFile(tree + "/pinned", gwtest::bytesOf("x"));
    auto fd = GWFileDescriptor::open((tree + "/pinned").c_str(), O_RDONLY);
    int flags = 0;
    if (ioctl(fd.get(), FS_IOC_GETFLAGS, &flags) != 0) {
        GTEST_SKIP() << "the file system has no inode flags";
    }
    flags |= FS_IMMUTABLE_FL;
    ASSERT_EQ(ioctl(fd.get(), FS_IOC_SETFLAGS, &flags), 0);
    fd.reset();
    GWErrorPtr error;
    EXPECT_TRUE(GWRemoveItemRecursively(tree, &error))
        << (error ? error->localizedDescription() : "");
    EXPECT_FALSE(exists(tree));
}

}  // namespace
