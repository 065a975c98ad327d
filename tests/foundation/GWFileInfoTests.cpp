#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include "foundation/GWFileInfo.h"
#include "foundation/GWMetadataStore.h"
#include "support/MetadataTestSupport.h"
#include "support/TestSupport.h"

namespace {

using gwtest::bytesOf;

class GWFileInfoTest : public ::testing::Test {
protected:
    void SetUp() override {
        path_ = directory_.file("file");
        url_ = directory_.url("file");
        gwtest::writeFile(path_, bytesOf("contents"));
    }

    std::shared_ptr<GWFileInfo> load() {
        GWErrorPtr error;
        auto info = GWFileInfo::initWithURL(url_, &error);
        EXPECT_TRUE(info) << (error ? error->localizedDescription() : "");
        return info;
    }

    std::optional<GWData> finderInfo() {
        return GWMetadataStore(path_).attribute(kGWFinderInfoAttributeName, nullptr);
    }

    struct stat lstatOf(const std::string& path) {
        struct stat info {};
        EXPECT_EQ(::lstat(path.c_str(), &info), 0);
        return info;
    }

    gwtest::TemporaryDirectory directory_;
    std::string path_;
    GWURL url_;
};

}  // namespace

TEST_F(GWFileInfoTest, ReadsPOSIXInformationAndDates) {
    ASSERT_EQ(::chmod(path_.c_str(), 02640), 0);
    const struct timespec times[2] = {{1000000000, 0}, {1200000000, 500000000}};
    ASSERT_EQ(::utimensat(AT_FDCWD, path_.c_str(), times, 0), 0);
    auto info = load();
    ASSERT_TRUE(info);
    EXPECT_EQ(info->permissionsMode(), 02640u);
    EXPECT_EQ(info->accessDate(), GWDate(1000000000));
    EXPECT_EQ(info->modificationDate(), GWDate(1200000000.5));
    EXPECT_EQ(info->typeCode(), 0u);
}

TEST_F(GWFileInfoTest, FinderInformationIsWrittenBigEndianInItsPlacesAndReadBack) {
    // Also where the file system refuses attributes and the side file holds it.
    for (const bool refused : {false, true}) {
        std::optional<gwtest::ScopedAttributeLimit> limit;
        if (refused) {
            limit.emplace(0);
        }
        auto info = load();
        info->setTypeCode(0x54455854);     // TEXT
        info->setCreatorCode(0x74747874);  // ttxt
        info->setFinderFlags(0x0102);
        info->setLocation(0x00200010);  // horizontal 0x20, vertical 0x10
        info->setExtendedFinderFlags(0x0304);
        info->setPutAwayFolderID(0x05060708);
        GWErrorPtr error;
        ASSERT_TRUE(info->applyToURL(url_, &error)) << error->localizedDescription();

        GWData expected = bytesOf("TEXTttxt");
        expected.insert(expected.end(), {0x01, 0x02, 0x00, 0x10, 0x00, 0x20});
        expected.resize(24);
        expected.insert(expected.end(), {0x03, 0x04, 0, 0, 0x05, 0x06, 0x07, 0x08});
        EXPECT_EQ(finderInfo(), expected);
        if (refused) {
            EXPECT_FALSE(gwtest::rawAttribute(path_, "user.com.apple.FinderInfo"));
            EXPECT_TRUE(gwtest::fileExists(directory_.file("._file")));
        }

        auto reloaded = load();
        EXPECT_EQ(reloaded->typeCode(), 0x54455854u);
        EXPECT_EQ(reloaded->location(), 0x00200010u);
        EXPECT_EQ(reloaded->putAwayFolderID(), 0x05060708u);
        ASSERT_TRUE(GWMetadataStore(path_).removeAttribute(kGWFinderInfoAttributeName, nullptr));
    }
}

TEST_F(GWFileInfoTest, ApplyingKeepsFinderFieldsThatWereNotSet) {
    auto info = load();
    // Written by someone else after the information was loaded.
    ASSERT_TRUE(
        GWMetadataStore(path_).setAttribute(kGWFinderInfoAttributeName, GWData(32, 0xAA), nullptr));
    info->setCreatorCode(0x41424344);
    ASSERT_TRUE(info->applyToURL(url_, nullptr));
    GWData expected(32, 0xAA);
    std::copy_n("ABCD", 4, expected.begin() + 4);
    EXPECT_EQ(finderInfo(), expected);
}

TEST_F(GWFileInfoTest, NothingSetChangesNothing) {
    const auto before = lstatOf(path_);
    auto info = load();
    info->setTypeCode(0);  // zeros alone make no attribute
    // Creation and backup dates cannot be set on Linux: skipped, not an error.
    info->setCreationDate(GWDate(5));
    info->setBackupDate(GWDate(6));
    ASSERT_TRUE(info->applyToURL(url_, nullptr));
    EXPECT_FALSE(finderInfo());
    EXPECT_FALSE(gwtest::fileExists(directory_.file("._file")));
    EXPECT_EQ(lstatOf(path_).st_mtim.tv_sec, before.st_mtim.tv_sec);
}

TEST_F(GWFileInfoTest, DatesAndModeLeaveTheTargetOfALinkAlone) {
    const std::string link = directory_.file("link");
    ASSERT_EQ(::symlink(path_.c_str(), link.c_str()), 0);
    const auto target = lstatOf(path_);
    const GWURL linkURL = directory_.url("link");
    auto info = GWFileInfo::initWithURL(linkURL, nullptr);
    ASSERT_TRUE(info);
    info->setModificationDate(GWDate(86400 * 365));
    info->setAccessDate(GWDate(86400 * 366));
    info->setPermissionsMode(0600);
    GWErrorPtr error;
    ASSERT_TRUE(info->applyToURL(linkURL, &error)) << error->localizedDescription();
    EXPECT_EQ(lstatOf(link).st_mtim.tv_sec, 86400 * 365);
    EXPECT_EQ(lstatOf(link).st_atim.tv_sec, 86400 * 366);
    EXPECT_EQ(lstatOf(path_).st_mtim.tv_sec, target.st_mtim.tv_sec);
    EXPECT_EQ(lstatOf(path_).st_mode, target.st_mode);
}

TEST(GWSpotlightCommentsTest, CommentsAreTheFreedesktopAttributeAndEmptyRemovesThem) {
    gwtest::TemporaryDirectory directory;
    const std::string path = directory.file("file");
    gwtest::writeFile(path, bytesOf("x"));
    ASSERT_TRUE(GWSetSpotlightComments("Caf\xC3\xA9 notes", directory.url("file"), nullptr));
    GWMetadataStore store(path);
    EXPECT_EQ(store.attribute("user.xdg.comment", nullptr), bytesOf("Caf\xC3\xA9 notes"));
    if (gwtest::userAttributesSupported(directory.path())) {
        EXPECT_EQ(gwtest::rawAttribute(path, "user.xdg.comment"), bytesOf("Caf\xC3\xA9 notes"));
    }
    ASSERT_TRUE(GWSetSpotlightComments("", directory.url("file"), nullptr));
    EXPECT_FALSE(store.attribute("user.xdg.comment", nullptr));
}
