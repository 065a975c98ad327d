#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/limits.h>
#include <sys/stat.h>
#include <unistd.h>

#include "foundation/GWAppleDouble.h"
#include "foundation/GWConversions.h"
#include "foundation/GWFileDescriptor.h"
#include "foundation/GWFileInfo.h"
#include "foundation/GWLog.h"
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
    for (const char* name :
         {"user.xdg.comment", "trusted.x", "security.selinux", "system.posix_acl_access"}) {
        EXPECT_EQ(GWLinuxAttributeName(name), name);
    }
    EXPECT_EQ(GWMacAttributeName("trusted.x"), "trusted.x");
    EXPECT_EQ(GWLinuxAttributeName("com.apple.ResourceFork"), "user.com.apple.ResourceFork");
    EXPECT_EQ(GWLinuxAttributeName("usersettings"), "user.usersettings");
    EXPECT_EQ(GWMacAttributeName("user.com.apple.FinderInfo"), "com.apple.FinderInfo");
}

TEST_F(GWMetadataStoreTest, ValuesLiveInAttributesUntilTheFileSystemRefusesThem) {
    GWMetadataStore store(path_);
    const bool attributes = gwtest::userAttributesSupported(directory_.path());
    if (attributes) {
        ASSERT_TRUE(store.setAttribute("com.example.small", bytesOf("abc"), nullptr));
        EXPECT_EQ(rawAttribute(path_, "user.com.example.small"), bytesOf("abc"));
        EXPECT_FALSE(fileExists(sidePath_));
        EXPECT_EQ(store.attribute("user.com.example.small", nullptr), bytesOf("abc"));
        EXPECT_FALSE(store.attribute("com.example.absent", nullptr));
    }
    // Over 64 KiB no Linux file system takes an attribute value (E2BIG).
    const GWData big = gwtest::randomBytes(1 << 20, 7);
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
    EXPECT_EQ(fileExists(sidePath_), !attributes);
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

TEST_F(GWMetadataStoreTest, ResourceForkWritesLandInPlaceAndZeroFillGapsWhereverTheForkLives) {
    GWMetadataStore store(path_);
    ASSERT_TRUE(store.writeResourceFork(bytesOf("hello"), 0, nullptr));
    ASSERT_TRUE(store.writeResourceFork(bytesOf("XY"), 2, nullptr));
    EXPECT_EQ(fork(store), bytesOf("heXYo"));
    ASSERT_TRUE(store.writeResourceFork(bytesOf("!"), 8, nullptr));
    GWData expected = bytesOf(std::string("heXYo\0\0\0!", 9));
    EXPECT_EQ(fork(store), expected);
    // Nothing is truncated, not even by an empty write.
    ASSERT_TRUE(store.writeResourceFork({}, 0, nullptr));
    EXPECT_EQ(fork(store), expected);

    // Growing past any attribute, it moves to the side file, where later writes land in place.
    ASSERT_TRUE(store.writeResourceFork(bytesOf("tail"), 70000, nullptr));
    EXPECT_FALSE(rawAttribute(path_, "user.com.apple.ResourceFork"));
    expected.resize(70000);
    expected.insert(expected.end(), {'t', 'a', 'i', 'l'});
    EXPECT_EQ(fork(store), expected);
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

// --- Side files: only this library's own are read, written, moved or removed -

enum class Planted { nothing, member, link, ours };
enum class Step { writeInPlace, move, moveReplacing, moveWithout, remove };

struct SideFileCase {
    const char* label;
    Planted planted;  // at "._dest" before the step
    Step step;
    bool plantedStays;
    bool valueKept;
    std::size_t warnings;
    bool longName = false;  // "dest" as long as names go, so "._dest" is too long
};

class GWMetadataSideFiles : public GWMetadataStoreTest,
                            public ::testing::WithParamInterface<SideFileCase> {};

TEST_P(GWMetadataSideFiles, NobodyElsesFileIsTouched) {
    const SideFileCase& c = GetParam();
    const std::string dest = directory_.file(c.longName ? std::string(NAME_MAX - 1, 'd') : "dest");
    const std::string side = GWMetadataSideFile::pathForItem(dest);
    const std::string outside = directory_.file("outside");
    gwtest::writeFile(outside, bytesOf("outside"));
    const GWData member = bytesOf("an archive member, not AppleDouble");
    const GWData value = gwtest::randomBytes(300, 3);
    const GWData fork = gwtest::randomBytes(30000, 4);
    gwtest::ScopedAttributeLimit refuseEverything(0);
    if (c.planted == Planted::member) {
        gwtest::writeFile(side, member);
    } else if (c.planted == Planted::link) {
        ASSERT_EQ(::symlink(outside.c_str(), side.c_str()), 0);
    } else if (c.planted == Planted::ours) {
        gwtest::writeFile(dest, bytesOf("old"));
        ASSERT_TRUE(GWMetadataStore(dest).setAttribute("com.example.v", value, nullptr));
    }
    std::vector<std::string> logged;
    auto previous = GWSetLogSink([&](const std::string& line) { logged.push_back(line); });
    auto write = [&](const std::string& item) {
        GWMetadataStore store(item);
        ASSERT_TRUE(store.setAttribute("com.example.v", value, nullptr));
        for (std::uint32_t done = 0; done < fork.size(); done += 10000) {
            ASSERT_TRUE(
                store.writeResourceFork(std::span(fork).subspan(done, 10000), done, nullptr));
        }
    };
    const bool moving = c.step != Step::writeInPlace && c.step != Step::remove;
    if (c.step == Step::writeInPlace) {
        gwtest::writeFile(dest, bytesOf("data"));
        write(dest);
    } else if (moving) {
        if (c.step != Step::moveWithout) {
            write(path_);
        }
        ASSERT_EQ(::rename(path_.c_str(), dest.c_str()), 0);
        ASSERT_TRUE(
            GWMetadataStore::moveMetadata(path_, dest, c.step == Step::moveReplacing, nullptr));
        EXPECT_FALSE(fileExists(sidePath_));
    } else {
        gwtest::writeFile(dest, bytesOf("old"));
        ASSERT_TRUE(GWMetadataStore::removeMetadata(dest, nullptr));
    }
    GWSetLogSink(previous);

    EXPECT_EQ(logged.size(), c.warnings);
    EXPECT_EQ(gwtest::readFile(outside), bytesOf("outside"));
    if (c.planted == Planted::member) {
        EXPECT_EQ(fileExists(side) && gwtest::readFile(side) == member, c.plantedStays);
    } else if (c.planted == Planted::link) {
        char target[PATH_MAX] = {};
        EXPECT_GT(::readlink(side.c_str(), target, sizeof target), 0);
    } else if (c.planted == Planted::ours) {
        EXPECT_EQ(fileExists(side), c.plantedStays);
    }
    GWErrorPtr error;
    const auto kept = GWMetadataStore(dest).attribute("com.example.v", &error);
    EXPECT_FALSE(error) << error->localizedDescription();
    EXPECT_EQ(kept == value, c.valueKept);
    if (c.valueKept && c.step != Step::moveWithout) {
        EXPECT_EQ(GWMetadataStore(dest).attribute(kGWResourceForkAttributeName, nullptr), fork);
    }
}

INSTANTIATE_TEST_SUITE_P(
    Cases, GWMetadataSideFiles,
    ::testing::Values(
        SideFileCase{"OursFollowsItsItem", Planted::nothing, Step::move, false, true, 0},
        SideFileCase{"AMemberBesideAMovedItemStays", Planted::member, Step::moveWithout, true,
                     false, 0},
        SideFileCase{"AMemberInTheWayStaysAndTheMetadataIsDropped", Planted::member, Step::move,
                     true, false, 1},
        SideFileCase{"ReplacementReplacesAMemberInTheWay", Planted::member, Step::moveReplacing,
                     false, true, 0},
        SideFileCase{"AStaleOneOfOursGoes", Planted::ours, Step::moveWithout, false, false, 0},
        SideFileCase{"AMemberIsNeitherReadNorWritten", Planted::member, Step::writeInPlace, true,
                     false, 2},
        SideFileCase{"APlantedLinkIsNotFollowed", Planted::link, Step::writeInPlace, true, false,
                     2},
        SideFileCase{"RemovingLeavesAMember", Planted::member, Step::remove, true, false, 0},
        SideFileCase{"RemovingTakesOurs", Planted::ours, Step::remove, false, false, 0},
        SideFileCase{"ATooLongNameDropsTheMetadataInPlace", Planted::nothing, Step::writeInPlace,
                     false, false, 2, true},
        SideFileCase{"ATooLongNameDropsTheMetadataOnAMove", Planted::nothing, Step::move, false,
                     false, 1, true}),
    [](const auto& info) { return std::string(info.param.label); });

// --- What is not written -----------------------------------------------------

struct UnwrittenCase {
    const char* label;
    const char* kind;  // "file", "folder" or "link"
    const char* typeAndCreator;
    bool written;
};

class GWMetadataUnwritten : public GWMetadataStoreTest,
                            public ::testing::WithParamInterface<UnwrittenCase> {};

TEST_P(GWMetadataUnwritten, FinderInformationOnlyWhenItSaysSomething) {
    const UnwrittenCase& c = GetParam();
    if (!gwtest::userAttributesSupported(directory_.path())) {
        GTEST_SKIP() << "no user extended attributes here";
    }
    const std::string item = directory_.file("x");
    const std::string kind = c.kind;
    if (kind == "folder") {
        ASSERT_EQ(::mkdir(item.c_str(), 0755), 0);
    } else if (kind == "link") {
        ASSERT_EQ(::symlink("item", item.c_str()), 0);
    } else {
        gwtest::writeFile(item, bytesOf("x"));
    }
    const std::string codes(c.typeAndCreator, 8);
    auto info = GWFileInfo::initWithURL(GWURL::fileURLWithPath(item), nullptr);
    ASSERT_TRUE(info);
    info->setTypeCode(GWFourCharCode(codes.substr(0, 4)));
    info->setCreatorCode(GWFourCharCode(codes.substr(4)));
    std::vector<std::string> logged;
    auto previous = GWSetLogSink([&](const std::string& line) { logged.push_back(line); });
    GWErrorPtr error;
    const bool set = info->applyToURL(GWURL::fileURLWithPath(item), &error);
    GWSetLogSink(previous);
    EXPECT_TRUE(set) << error->localizedDescription();
    EXPECT_EQ(rawAttribute(item, "user.com.apple.FinderInfo").has_value(), c.written);
    EXPECT_EQ(logged.size(), kind == "link" ? 1u : 0u);
    EXPECT_FALSE(fileExists(directory_.file("._x")));
    EXPECT_EQ(gwtest::readFile(path_), bytesOf("data fork"));
}

INSTANTIATE_TEST_SUITE_P(
    Cases, GWMetadataUnwritten,
    ::testing::Values(UnwrittenCase{"ZerosOnAFile", "file", "\0\0\0\0\0\0\0\0", false},
                      UnwrittenCase{"CodesOnAFile", "file", "TEXTttxt", true},
                      UnwrittenCase{"FoldMACSOnAFolder", "folder", "foldMACS", false},
                      UnwrittenCase{"ZerosOnAFolder", "folder", "\0\0\0\0\0\0\0\0", false},
                      UnwrittenCase{"OtherCodesOnAFolder", "folder", "foldCARO", true},
                      UnwrittenCase{"CodesOnALinkWarn", "link", "TEXTttxt", false}),
    [](const auto& info) { return std::string(info.param.label); });
