// Path lookup in an opened archive: exact names, first match, and the
// deliberate passing over of components that match nothing.

#include <gtest/gtest.h>

#include "support/TestSupport.h"
#include "support/ZipBuilder.h"
#include "zip/GWZipArchive.h"

namespace {

using namespace gwtest;

class GWZipArchiveLookup : public ::testing::Test {
protected:
    void SetUp() override {
        ZipBuilder zip;
        zip.addFile("a/b", bytesOf("1"));
        zip.addFile("a/c/d", bytesOf("2"));
        zip.addFile("leaf", bytesOf("3"));
        zip.addFile("dup/x", bytesOf("first"));
        zip.addFile("dup/x", bytesOf("second"));
        zip.addFile("./dot", bytesOf("4"));
        zip.write(directory.file("lookup.zip"));
        GWErrorPtr error;
        archive = GWZipArchive::initWithURL(directory.url("lookup.zip"), &error);
        ASSERT_TRUE(archive);
    }

    std::string pathOf(const std::string& lookup) const {
        auto file = archive->fileWithPath(lookup);
        return file ? file->path() : "(none)";
    }

    TemporaryDirectory directory;
    GWZipArchivePtr archive;
};

TEST_F(GWZipArchiveLookup, FindsNodesByTheirPath) {
    EXPECT_EQ(pathOf("a"), "a");
    EXPECT_EQ(pathOf("a/c/d"), "a/c/d");
    EXPECT_EQ(pathOf("a/b/"), "a/b");
    EXPECT_EQ(pathOf("dot"), "dot");
    // The first of two same-named entries wins.
    EXPECT_EQ(archive->fileWithPath("dup/x")->storedUncompressedSize(), 5u);
}

TEST_F(GWZipArchiveLookup, ComponentsThatMatchNothingArePassedOver) {
    EXPECT_EQ(pathOf("/a"), "a");
    EXPECT_EQ(pathOf("x/a/b"), "a/b");
    EXPECT_EQ(pathOf("a/x/c/d"), "a/c/d");
    // Not standardised: "." and ".." are names that match nothing here.
    EXPECT_EQ(pathOf("./../leaf"), "leaf");
    EXPECT_EQ(pathOf("a/../b"), "a/b");
    // Once a directory matched, the search stays below it.
    EXPECT_EQ(pathOf("a/../leaf"), "(none)");
}

TEST_F(GWZipArchiveLookup, MissingLastComponentsAndLeavesFindNothing) {
    EXPECT_FALSE(archive->fileWithPath("a/zz"));
    EXPECT_FALSE(archive->fileWithPath("leaf/more"));
    EXPECT_FALSE(archive->fileWithPath(""));
    EXPECT_FALSE(archive->fileWithPath("/"));
    EXPECT_FALSE(archive->fileWithPath("A"));
}

TEST_F(GWZipArchiveLookup, ManyPathsKeepTheirOrderAndDropMisses) {
    auto found = archive->filesWithPaths({"a/c", "a/missing", "leaf", "", "a/b"});
    ASSERT_EQ(found.size(), 3u);
    EXPECT_EQ(found[0]->path(), "a/c");
    EXPECT_EQ(found[1]->path(), "leaf");
    EXPECT_EQ(found[2]->path(), "a/b");
}

TEST_F(GWZipArchiveLookup, RenamedRootsAreFoundByTheirNewName) {
    auto leaf = archive->fileWithPath("leaf");
    ASSERT_TRUE(leaf);
    leaf->setName("renamed");
    EXPECT_EQ(archive->fileWithPath("renamed"), leaf);
    EXPECT_FALSE(archive->fileWithPath("leaf"));
}

}  // namespace
