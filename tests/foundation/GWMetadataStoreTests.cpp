#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include "foundation/GWAppleDouble.h"
#include "foundation/GWFileDescriptor.h"
#include "foundation/GWMetadataStore.h"
#include "support/MetadataTestSupport.h"
#include "support/TestSupport.h"

namespace {

using gwtest::bytesOf;
using gwtest::fileExists;
using gwtest::rawAttribute;

class GWMetadataStoreTest : public ::testing::Test {
protected:
    void SetUp() override {
        path_ = directory_.file("item");
        gwtest::writeFile(path_, bytesOf("data fork"));
        sidePath_ = directory_.file("._item");
    }

    GWData fork(const GWMetadataStore& store) {
        GWErrorPtr error;
        auto value = store.attribute(kGWResourceForkAttributeName, &error);
        EXPECT_FALSE(error) << error->localizedDescription();
        return value.value_or(GWData());
    }

    gwtest::TemporaryDirectory directory_;
    std::string path_;
    std::string sidePath_;
};

}  // namespace

TEST(GWMetadataNamesTest, MacNamesGoToTheUserNamespaceAndLinuxNamesStay) {
    EXPECT_EQ(GWLinuxAttributeName("com.apple.ResourceFork"), "user.com.apple.ResourceFork");
    EXPECT_EQ(GWLinuxAttributeName("user.xdg.comment"), "user.xdg.comment");
    EXPECT_EQ(GWLinuxAttributeName("trusted.x"), "trusted.x");
    EXPECT_EQ(GWLinuxAttributeName("security.selinux"), "security.selinux");
    EXPECT_EQ(GWLinuxAttributeName("system.posix_acl_access"), "system.posix_acl_access");
    EXPECT_EQ(GWLinuxAttributeName("usersettings"), "user.usersettings");
    EXPECT_EQ(GWMacAttributeName("user.com.apple.FinderInfo"), "com.apple.FinderInfo");
    EXPECT_EQ(GWMacAttributeName("trusted.x"), "trusted.x");
}

TEST_F(GWMetadataStoreTest, SmallValuesLiveInExtendedAttributes) {
    if (!gwtest::userAttributesSupported(directory_.path())) {
        GTEST_SKIP() << "no user extended attributes here";
    }
    GWMetadataStore store(path_);
    ASSERT_TRUE(store.setAttribute("com.example.small", bytesOf("abc"), nullptr));
    EXPECT_EQ(rawAttribute(path_, "user.com.example.small"), bytesOf("abc"));
    EXPECT_FALSE(fileExists(sidePath_));
    EXPECT_EQ(store.attribute("user.com.example.small", nullptr), bytesOf("abc"));
    EXPECT_FALSE(store.attribute("com.example.absent", nullptr));
}

TEST_F(GWMetadataStoreTest, ValuesTheFileSystemRefusesGoToTheSideFileAndComeBack) {
    // Over 64 KiB no Linux file system takes an attribute value (E2BIG).
    const GWData big = gwtest::randomBytes(1 << 20, 7);
    GWMetadataStore store(path_);
    GWErrorPtr error;
    ASSERT_TRUE(store.setAttribute("com.example.big", big, &error))
        << error->localizedDescription();
    EXPECT_FALSE(rawAttribute(path_, "user.com.example.big"));
    EXPECT_TRUE(fileExists(sidePath_));
    EXPECT_EQ(store.attribute("com.example.big", nullptr), big);
    const auto names = store.attributeNames(nullptr);
    ASSERT_TRUE(names);
    EXPECT_NE(std::find(names->begin(), names->end(), "com.example.big"), names->end());

    // Once the value fits again it moves back, and the emptied side file goes.
    ASSERT_TRUE(store.setAttribute("com.example.big", bytesOf("small"), nullptr));
    EXPECT_EQ(store.attribute("com.example.big", nullptr), bytesOf("small"));
    if (gwtest::userAttributesSupported(directory_.path())) {
        EXPECT_FALSE(fileExists(sidePath_));
    }
}

TEST_F(GWMetadataStoreTest, ForcedRefusalKeepsEveryKindOfValueInTheSideFile) {
    gwtest::ScopedAttributeLimit refuseEverything(0);
    GWMetadataStore store(path_);
    GWData finderInfo(32, 0);
    finderInfo[0] = 'T';
    ASSERT_TRUE(store.setAttribute(kGWFinderInfoAttributeName, finderInfo, nullptr));
    ASSERT_TRUE(store.setAttribute("com.example.a", bytesOf("alpha"), nullptr));
    ASSERT_TRUE(store.setAttribute(kGWCommentAttributeName, bytesOf("note"), nullptr));
    ASSERT_TRUE(store.writeResourceFork(bytesOf("fork"), 0, nullptr));
    EXPECT_FALSE(rawAttribute(path_, "user.com.apple.FinderInfo"));

    GWAppleDoubleContents contents;
    auto side = GWFileDescriptor::open(sidePath_.c_str(), O_RDONLY);
    ASSERT_TRUE(GWReadAppleDouble(side.get(), contents, nullptr));
    EXPECT_EQ(contents.finderInfo, finderInfo);
    EXPECT_EQ(contents.comment, bytesOf("note"));
    ASSERT_EQ(contents.attributes.size(), 1u);
    EXPECT_EQ(contents.attributes[0].name, "com.example.a");
    ASSERT_TRUE(contents.resourceFork);
    EXPECT_EQ(contents.resourceFork->length, 4u);

    EXPECT_EQ(store.attribute("com.apple.FinderInfo", nullptr), finderInfo);
    EXPECT_EQ(store.attribute("user.xdg.comment", nullptr), bytesOf("note"));
    EXPECT_EQ(fork(store), bytesOf("fork"));

    ASSERT_TRUE(store.removeAttribute("com.example.a", nullptr));
    ASSERT_TRUE(store.removeAttribute(kGWFinderInfoAttributeName, nullptr));
    ASSERT_TRUE(store.removeAttribute(kGWCommentAttributeName, nullptr));
    EXPECT_FALSE(store.attribute("com.example.a", nullptr));
    ASSERT_TRUE(store.removeAttribute(kGWResourceForkAttributeName, nullptr));
    EXPECT_FALSE(fileExists(sidePath_));
}

TEST_F(GWMetadataStoreTest, ResourceForkWritesReplaceBytesInPlaceAndZeroFillGaps) {
    GWMetadataStore store(path_);
    ASSERT_TRUE(store.writeResourceFork(bytesOf("hello"), 0, nullptr));
    ASSERT_TRUE(store.writeResourceFork(bytesOf("XY"), 2, nullptr));
    EXPECT_EQ(fork(store), bytesOf("heXYo"));
    ASSERT_TRUE(store.writeResourceFork(bytesOf("!"), 8, nullptr));
    EXPECT_EQ(fork(store), bytesOf(std::string("heXYo\0\0\0!", 9)));
    // Nothing is truncated, not even by an empty write.
    ASSERT_TRUE(store.writeResourceFork({}, 0, nullptr));
    EXPECT_EQ(fork(store).size(), 9u);
}

TEST_F(GWMetadataStoreTest, AForkGrowingPastAnyAttributeMovesToTheSideFile) {
    GWMetadataStore store(path_);
    const GWData head = gwtest::randomBytes(1000, 1);
    ASSERT_TRUE(store.writeResourceFork(head, 0, nullptr));
    ASSERT_TRUE(store.writeResourceFork(bytesOf("tail"), 70000, nullptr));
    EXPECT_FALSE(rawAttribute(path_, "user.com.apple.ResourceFork"));
    GWData expected = head;
    expected.resize(70000);
    expected.insert(expected.end(), {'t', 'a', 'i', 'l'});
    EXPECT_EQ(fork(store), expected);

    // Later writes land in the side file in place.
    ASSERT_TRUE(store.writeResourceFork(bytesOf("HEAD"), 0, nullptr));
    std::copy_n("HEAD", 4, expected.begin());
    EXPECT_EQ(fork(store), expected);
}

TEST_F(GWMetadataStoreTest, DescriptorAndPathSeeTheSameMetadata) {
    const GWData big = gwtest::randomBytes(3 << 20, 2);
    auto file = GWFileDescriptor::open(path_.c_str(), O_WRONLY);
    ASSERT_TRUE(file.isValid());
    GWMetadataStore byDescriptor(file.get(), path_);
    for (std::size_t done = 0; done < big.size(); done += 10240) {
        const std::size_t length = std::min<std::size_t>(10240, big.size() - done);
        ASSERT_TRUE(byDescriptor.writeResourceFork(std::span(big).subspan(done, length),
                                                   std::uint32_t(done), nullptr));
    }
    ASSERT_TRUE(byDescriptor.setAttribute("com.example.tag", bytesOf("t"), nullptr));
    GWMetadataStore byPath(path_);
    EXPECT_EQ(fork(byPath), big);
    EXPECT_EQ(byPath.attribute("com.example.tag", nullptr), bytesOf("t"));
    EXPECT_EQ(gwtest::readFile(path_), bytesOf("data fork"));
}

TEST_F(GWMetadataStoreTest, SideFilesMoveAndGoWithTheirItems) {
    gwtest::ScopedAttributeLimit refuseEverything(0);
    ASSERT_TRUE(GWMetadataStore(path_).setAttribute("com.example.a", bytesOf("a"), nullptr));
    const std::string moved = directory_.file("moved");
    gwtest::writeFile(directory_.file("._moved"), bytesOf("stale"));
    ASSERT_EQ(::rename(path_.c_str(), moved.c_str()), 0);
    ASSERT_TRUE(GWMetadataStore::moveMetadata(path_, moved, nullptr));
    EXPECT_FALSE(fileExists(sidePath_));
    EXPECT_EQ(GWMetadataStore(moved).attribute("com.example.a", nullptr), bytesOf("a"));

    // Moving an item without a side file removes a stale one at the destination.
    gwtest::writeFile(path_, bytesOf("x"));
    gwtest::writeFile(sidePath_, bytesOf("stale"));
    ASSERT_TRUE(GWMetadataStore::moveMetadata(directory_.file("none"), path_, nullptr));
    EXPECT_FALSE(fileExists(sidePath_));
    ASSERT_TRUE(GWMetadataStore::removeMetadata(moved, nullptr));
    EXPECT_FALSE(fileExists(directory_.file("._moved")));
}

TEST_F(GWMetadataStoreTest, AMalformedSideFileIsReportedNotIgnored) {
    gwtest::writeFile(sidePath_, bytesOf("not AppleDouble at all, but long enough"));
    GWErrorPtr error;
    EXPECT_FALSE(GWMetadataStore(path_).attribute("com.example.a", &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWPOSIXErrorDomain, EINVAL)) << error->localizedDescription();
}
