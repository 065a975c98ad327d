#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "foundation/GWFileManager.h"
#include "foundation/GWMetadataStore.h"
#include "support/MetadataTestSupport.h"
#include "support/TestSupport.h"

namespace {

using namespace gwtest;

class GWFileManagerTest : public ::testing::Test {
protected:
    TemporaryDirectory directory;
    GWErrorPtr error;
};

TEST_F(GWFileManagerTest, MovingNeverReplacesAnExistingItem) {
    writeFile(directory.file("from"), bytesOf("new"));
    writeFile(directory.file("to"), bytesOf("old"));
    EXPECT_FALSE(GWMoveItemAtURL(directory.url("from"), directory.url("to"), &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWPOSIXErrorDomain, EEXIST));
    EXPECT_EQ(readFile(directory.file("to")), bytesOf("old"));
    EXPECT_TRUE(fileExists(directory.file("from")));

    ASSERT_TRUE(GWMoveItemAtURL(directory.url("from"), directory.url("moved"), &error));
    EXPECT_EQ(readFile(directory.file("moved")), bytesOf("new"));
    EXPECT_FALSE(fileExists(directory.file("from")));
}

TEST_F(GWFileManagerTest, RefusedMetadataMovesWithItsItem) {
    writeFile(directory.file("item"), bytesOf("data"));
    {
        ScopedAttributeLimit limit(16);
        ASSERT_TRUE(GWMetadataStore(directory.file("item"))
                        .setAttribute("com.example.big", GWData(64, 7), &error));
    }
    ASSERT_TRUE(fileExists(directory.file("._item")));
    ASSERT_TRUE(GWMoveItemAtURL(directory.url("item"), directory.url("renamed"), &error));
    EXPECT_FALSE(fileExists(directory.file("._item")));
    EXPECT_EQ(GWMetadataStore(directory.file("renamed")).attribute("com.example.big", nullptr),
              GWData(64, 7));
}

TEST_F(GWFileManagerTest, AReplacementDirectoryIsFreshPrivateAndOnTheSameDevice) {
    auto first = GWItemReplacementDirectoryForURL(directory.url(""), &error);
    auto second = GWItemReplacementDirectoryForURL(directory.url(""), &error);
    ASSERT_TRUE(first && second);
    EXPECT_NE(first->path(), second->path());
    struct stat made {
    }, near{};
    ASSERT_EQ(::stat(first->path().c_str(), &made), 0);
    ASSERT_EQ(::stat(directory.path().c_str(), &near), 0);
    EXPECT_TRUE(S_ISDIR(made.st_mode));
    EXPECT_EQ(made.st_mode & 0777, 0700u);
    EXPECT_EQ(made.st_dev, near.st_dev);
    ::rmdir(first->path().c_str());
    ::rmdir(second->path().c_str());

    EXPECT_FALSE(GWItemReplacementDirectoryForURL(directory.url("missing"), &error));
    const auto remote = GWURL::URLWithString("https://example.com/x");
    EXPECT_FALSE(GWItemReplacementDirectoryForURL(*remote, &error));
    EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileWriteUnsupportedSchemeError));
}

}  // namespace
