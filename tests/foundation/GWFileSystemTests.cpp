// The file-system layer extraction goes through: replacement folders, moves,
// removal and descriptor walks that never follow a link.

#include <gtest/gtest.h>

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <functional>

#include "foundation/GWFileManager.h"
#include "foundation/GWFileSystem.h"
#include "foundation/GWMetadataStore.h"
#include "support/MetadataTestSupport.h"
#include "support/TestSupport.h"

namespace {

using namespace gwtest;

bool exists(const std::string& path) {
    struct stat info;
    return lstat(path.c_str(), &info) == 0;
}

TEST(GWFileSystem, NearestExistingAncestorClimbsToWhatExists) {
    TemporaryDirectory directory;
    EXPECT_EQ(GWNearestExistingAncestor(directory.file("a/b/c")), directory.path());
    EXPECT_EQ(GWNearestExistingAncestor(directory.path()), directory.path());
    EXPECT_EQ(GWNearestExistingAncestor("/nonexistent-gw/x"), "/");
}

TEST(GWFileSystem, ReplacementFolderIsPrivateOnTheDestinationsDeviceAndGoesAway) {
    TemporaryDirectory directory;
    ScopedEnvironment temporaryDirectory("TMPDIR", directory.file("tmp"));
    ASSERT_EQ(mkdir(directory.file("tmp").c_str(), 0700), 0);
    std::string first;
    std::string second;
    {
        GWErrorPtr error;
        auto folder = GWReplacementFolder::createForDestination(directory.file("new/item"), &error);
        auto other = GWReplacementFolder::createForDestination(directory.file("new/item"), &error);
        ASSERT_TRUE(folder && other) << error->localizedDescription();
        first = folder->path();
        second = other->path();
        EXPECT_NE(first, second);
        EXPECT_NE(folder->uniquePath(), folder->uniquePath());
        EXPECT_EQ(first.rfind(directory.file("tmp/.gwarchive-"), 0), 0u) << first;
        struct stat made;
        ASSERT_EQ(stat(first.c_str(), &made), 0);
        EXPECT_TRUE(S_ISDIR(made.st_mode));
        EXPECT_EQ(made.st_mode & 0777, 0700u);
        ASSERT_EQ(mkdir((first + "/sub").c_str(), 0500), 0);
        writeFile(first + "/file", bytesOf("x"));
        ASSERT_EQ(mkdir(directory.file("keep").c_str(), 0755), 0);
        writeFile(directory.file("keep/file"), bytesOf("kept"));
        ASSERT_EQ(symlink(directory.file("keep").c_str(), (first + "/link").c_str()), 0);
        // What an interrupted process does: the folders go while still owned.
        GWRemoveLiveReplacementFolders();
        EXPECT_FALSE(exists(second));
    }
    EXPECT_FALSE(exists(first));
    EXPECT_TRUE(exists(directory.file("keep/file"))) << "removal followed a symbolic link";
}

struct MoveCase {
    const char* name;
    std::function<void(TemporaryDirectory&)> arrange;
    bool replacing;
    int expectedError;  // 0: moved
};

class GWFileSystemMove : public ::testing::TestWithParam<MoveCase> {};

TEST_P(GWFileSystemMove, MovesOnlyWhereItMay) {
    TemporaryDirectory directory;
    writeFile(directory.file("from"), bytesOf("new"));
    GetParam().arrange(directory);
    GWErrorPtr error;
    const bool moved =
        GetParam().replacing
            ? GWMoveItemReplacing(directory.file("from"), directory.file("to"), &error)
            : GWMoveItemNoReplace(directory.file("from"), directory.file("to"), &error);
    if (GetParam().expectedError == 0) {
        ASSERT_TRUE(moved) << error->localizedDescription();
        EXPECT_EQ(readFile(directory.file("to")), bytesOf("new"));
        EXPECT_FALSE(exists(directory.file("from")));
    } else {
        EXPECT_FALSE(moved);
        ASSERT_TRUE(error);
        EXPECT_TRUE(error->is(kGWPOSIXErrorDomain, GetParam().expectedError))
            << error->localizedDescription();
        EXPECT_TRUE(exists(directory.file("from")));
    }
}

const MoveCase kMoveCases[] = {
    {"ToAFreeName", [](TemporaryDirectory&) {}, false, 0},
    {"NeverOverAFile", [](TemporaryDirectory& d) { writeFile(d.file("to"), bytesOf("old")); },
     false, EEXIST},
    {"NeverOverADanglingLink",
     [](TemporaryDirectory& d) { ASSERT_EQ(symlink("nowhere", d.file("to").c_str()), 0); }, false,
     EEXIST},
    {"ReplacingOverAFile", [](TemporaryDirectory& d) { writeFile(d.file("to"), bytesOf("old")); },
     true, 0},
    {"ReplacingOverALinkReplacesTheLink",
     [](TemporaryDirectory& d) { ASSERT_EQ(symlink("/etc/passwd", d.file("to").c_str()), 0); },
     true, 0},
    {"ReplacingNeverOverADirectory",
     [](TemporaryDirectory& d) {
         ASSERT_EQ(mkdir(d.file("to").c_str(), 0755), 0);
         writeFile(d.file("to/user-file"), bytesOf("mine"));
     },
     true, EISDIR},
};

INSTANTIATE_TEST_SUITE_P(Cases, GWFileSystemMove, ::testing::ValuesIn(kMoveCases),
                         [](const auto& info) { return std::string(info.param.name); });

TEST(GWFileSystem, RefusedMetadataMovesWithItsItem) {
    TemporaryDirectory directory;
    GWErrorPtr error;
    writeFile(directory.file("item"), bytesOf("data"));
    {
        ScopedAttributeLimit limit(16);
        ASSERT_TRUE(GWMetadataStore(directory.file("item"))
                        .setAttribute("com.example.big", GWData(64, 7), &error));
    }
    ASSERT_TRUE(exists(directory.file("._item")));
    ASSERT_TRUE(GWMoveItemAtURL(directory.url("item"), directory.url("renamed"), &error));
    EXPECT_FALSE(exists(directory.file("._item")));
    EXPECT_EQ(GWMetadataStore(directory.file("renamed")).attribute("com.example.big", nullptr),
              GWData(64, 7));
}

TEST(GWFileSystem, RemovalClearsFlagsThatPinTheTree) {
    if (geteuid() != 0) {
        GTEST_SKIP() << "inode flags need root";
    }
    TemporaryDirectory directory;
    const std::string tree = directory.file("tree");
    ASSERT_EQ(mkdir(tree.c_str(), 0755), 0);
    writeFile(tree + "/pinned", bytesOf("x"));
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

TEST(GWFileSystem, DirectoryWalkNeverFollowsALink) {
    TemporaryDirectory directory;
    TemporaryDirectory outside;
    ASSERT_EQ(mkdir(directory.file("a").c_str(), 0755), 0);
    ASSERT_EQ(symlink(outside.path().c_str(), directory.file("a/link").c_str()), 0);
    const struct {
        const char* relative;
        bool create;
        int expectedError;  // 0: opened
    } cases[] = {
        {"", false, 0},
        {"a", false, 0},
        {"a/new/deeper", true, 0},
        {"a/missing", false, ENOENT},
        {"a/link", false, ENOTDIR},
        {"a/link/inside", true, ENOTDIR},
        {"a/../a", false, EINVAL},
    };
    for (const auto& row : cases) {
        GWErrorPtr error;
        GWFileDescriptor fd =
            GWOpenDirectoryBelow(directory.path(), row.relative, row.create, &error);
        EXPECT_EQ(fd.isValid(), row.expectedError == 0) << row.relative;
        if (row.expectedError != 0) {
            ASSERT_TRUE(error) << row.relative;
            EXPECT_TRUE(error->is(kGWPOSIXErrorDomain, row.expectedError))
                << row.relative << ": " << error->localizedDescription();
        }
    }
    EXPECT_TRUE(exists(directory.file("a/new/deeper")));
    EXPECT_FALSE(exists(outside.file("inside")));
}

}  // namespace
