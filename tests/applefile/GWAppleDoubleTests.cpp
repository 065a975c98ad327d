#include <gtest/gtest.h>
#include <sys/stat.h>

#include <functional>

#include "applefile/GWAppleFileDecoder.h"
#include "foundation/GWConversions.h"
#include "foundation/GWFileInfo.h"
#include "foundation/GWMetadataStore.h"
#include "support/AppleDoubleBuilder.h"
#include "support/MetadataTestSupport.h"
#include "support/TestSupport.h"

namespace {

using gwtest::AppleDoubleFile;
using gwtest::bytesOf;

// Finder information, a resource fork of 1 MiB, two attributes and a comment.
AppleDoubleFile fullFile() {
    AppleDoubleFile file;
    file.finderInfo = gwtest::finderInfoBytes("TEXT", "R*ch", 0x0100, 12, 34);
    file.attributes = {{"com.example.label", bytesOf("blue")},
                       {"com.apple.metadata:kMDItemWhereFroms", gwtest::randomBytes(300, 1)}};
    file.resourceFork = gwtest::randomBytes(1 << 20, 2);
    file.comment = "A comment";
    return file;
}

class GWAppleDoubleTest : public ::testing::Test {
protected:
    void SetUp() override {
        dataPath_ = directory_.file("Document.txt");
        gwtest::writeFile(dataPath_, contents_);
    }

    bool merge(const GWData& appleDouble, GWErrorPtr* error = nullptr) {
        gwtest::writeFile(directory_.file("companion"), appleDouble);
        return GWAppleFileDecoder::sharedInstance()->mergeAppleDoubleFileAtURL(
            directory_.url("companion"), directory_.url("Document.txt"), error);
    }

    std::optional<GWData> stored(std::string_view name) {
        return GWMetadataStore(dataPath_).attribute(name, nullptr);
    }

    gwtest::TemporaryDirectory directory_;
    const GWData contents_ = gwtest::textBytes(5000, 3);
    std::string dataPath_;
};

}  // namespace

TEST_F(GWAppleDoubleTest, EverythingInTheFileArrivesAndTheDataStays) {
    const AppleDoubleFile file = fullFile();
    GWErrorPtr error;
    ASSERT_TRUE(merge(gwtest::buildAppleDouble(file), &error)) << error->localizedDescription();
    EXPECT_EQ(gwtest::readFile(dataPath_), contents_);

    const auto info = GWFileInfo::initWithURL(directory_.url("Document.txt"), nullptr);
    ASSERT_TRUE(info);
    EXPECT_EQ(GWStringWithFourCharCode(info->typeCode()), "TEXT");
    EXPECT_EQ(GWStringWithFourCharCode(info->creatorCode()), "R*ch");
    EXPECT_EQ(info->finderFlags(), 0x0100);
    EXPECT_EQ(info->location(), (34u << 16) | 12u);
    EXPECT_EQ(stored("com.example.label"), bytesOf("blue"));
    EXPECT_EQ(stored("com.apple.metadata:kMDItemWhereFroms"), file.attributes[1].second);
    EXPECT_EQ(stored(kGWCommentAttributeName), bytesOf("A comment"));
    EXPECT_EQ(stored(kGWResourceForkAttributeName), file.resourceFork);
    // No Linux file system takes 1 MiB in an attribute: the fork is in the side file.
    EXPECT_FALSE(gwtest::rawAttribute(dataPath_, "user.com.apple.ResourceFork"));
    EXPECT_TRUE(gwtest::fileExists(directory_.file("._Document.txt")));
    if (gwtest::userAttributesSupported(directory_.path())) {
        EXPECT_EQ(gwtest::rawAttribute(dataPath_, "user.com.example.label"), bytesOf("blue"));
    }
}

TEST_F(GWAppleDoubleTest, AResourceForkAloneReplacesTheFilesOwn) {
    GWMetadataStore(dataPath_).writeResourceFork(gwtest::randomBytes(3000, 8), 0, nullptr);
    AppleDoubleFile file;
    file.resourceFork = gwtest::randomBytes(700, 9);
    ASSERT_TRUE(merge(gwtest::buildAppleDouble(file)));
    EXPECT_EQ(stored(kGWResourceForkAttributeName), file.resourceFork);
    EXPECT_FALSE(stored(kGWFinderInfoAttributeName));
    EXPECT_EQ(gwtest::readFile(dataPath_), contents_);
}

TEST_F(GWAppleDoubleTest, ClassicFilesAndMacOSRomanCommentsAreRead) {
    AppleDoubleFile file;
    file.withAttributeHeader = false;
    file.finderInfo = gwtest::finderInfoBytes("PICT", "8BIM");
    file.comment = "R\x8Esum\x8E";
    ASSERT_TRUE(merge(gwtest::buildAppleDouble(file)));
    EXPECT_EQ(stored(kGWFinderInfoAttributeName), file.finderInfo);
    EXPECT_EQ(stored(kGWCommentAttributeName), bytesOf("R\xC3\xA9sum\xC3\xA9"));
}

TEST_F(GWAppleDoubleTest, AttributesNamedIntoOtherLinuxNamespacesAreSkipped) {
    AppleDoubleFile file;
    file.attributes = {{"security.capability", GWData(20, 0xFF)},
                       {"trusted.gw", bytesOf("t")},
                       {"user.kept", bytesOf("k")}};
    ASSERT_TRUE(merge(gwtest::buildAppleDouble(file)));
    EXPECT_FALSE(gwtest::rawAttribute(dataPath_, "security.capability"));
    EXPECT_FALSE(gwtest::rawAttribute(dataPath_, "trusted.gw"));
    EXPECT_EQ(stored("user.kept"), bytesOf("k"));
}

TEST_F(GWAppleDoubleTest, ALaterMergeRestoresWhatTheSideFileKept) {
    {
        gwtest::ScopedAttributeLimit refuseEverything(0);
        ASSERT_TRUE(merge(gwtest::buildAppleDouble(fullFile())));
    }
    const std::string other = directory_.file("Copy.txt");
    gwtest::writeFile(other, bytesOf("copy"));
    ASSERT_TRUE(GWAppleFileDecoder::sharedInstance()->mergeAppleDoubleFileAtURL(
        directory_.url("._Document.txt"), directory_.url("Copy.txt"), nullptr));
    GWMetadataStore copy(other);
    for (const auto& name : {"com.example.label", "com.apple.metadata:kMDItemWhereFroms",
                             "com.apple.FinderInfo", "xdg.comment", "com.apple.ResourceFork"}) {
        SCOPED_TRACE(name);
        EXPECT_EQ(copy.attribute(name, nullptr), stored(name));
        EXPECT_TRUE(copy.attribute(name, nullptr));
    }
}

TEST_F(GWAppleDoubleTest, MissingFilesFailWithENOENT) {
    GWErrorPtr error;
    EXPECT_FALSE(GWAppleFileDecoder::sharedInstance()->mergeAppleDoubleFileAtURL(
        directory_.url("missing"), directory_.url("Document.txt"), &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWPOSIXErrorDomain, ENOENT));
    EXPECT_FALSE(error->URL());
    gwtest::writeFile(directory_.file("companion"), gwtest::buildAppleDouble(fullFile()));
    EXPECT_FALSE(GWAppleFileDecoder::sharedInstance()->mergeAppleDoubleFileAtURL(
        directory_.url("companion"), directory_.url("missing"), &error));
    EXPECT_TRUE(error->is(kGWPOSIXErrorDomain, ENOENT));
    EXPECT_FALSE(gwtest::fileExists(directory_.file("._missing")));
}

// Malformed files: each mutation of a full file must fail with EINVAL and leave
// the data file without any metadata.
namespace {

struct MalformedCase {
    const char* name;
    std::function<void(GWData&, const gwtest::AppleDoubleLayout&)> mutate;
};

using Layout = gwtest::AppleDoubleLayout;
using gwtest::storeBE16;
using gwtest::storeBE32;

const MalformedCase kMalformedCases[] = {
    {"Empty", [](GWData& b, const Layout&) { b.clear(); }},
    {"CutInTheHeader", [](GWData& b, const Layout&) { b.resize(25); }},
    {"CutInTheEntryTable", [](GWData& b, const Layout&) { b.resize(Layout::entryOffset(2) + 5); }},
    {"CutInTheResourceFork",
     [](GWData& b, const Layout& l) { b.resize(l.resourceForkOffset + 9); }},
    {"AppleSingleMagic", [](GWData& b, const Layout&) { storeBE32(b, 0, 0x00051600); }},
    {"VersionOne", [](GWData& b, const Layout&) { storeBE32(b, 4, 0x00010000); }},
    {"EntryCountPastTheEnd",
     [](GWData& b, const Layout& l) {
         storeBE16(b, 24, 0xFFFF);
         b.resize(l.resourceForkOffset);
     }},
    {"EntryCountIntoGarbage", [](GWData& b, const Layout&) { storeBE16(b, 24, 0xFFFF); }},
    {"EntryOffsetPastTheEnd",
     [](GWData& b, const Layout&) { storeBE32(b, Layout::entryOffset(1) + 4, 0xFFFFFFF0); }},
    {"AbsurdResourceForkLength",
     [](GWData& b, const Layout&) { storeBE32(b, Layout::entryOffset(1) + 8, 0xFFFFFFFF); }},
    {"AbsurdCommentLength",
     [](GWData& b, const Layout&) { storeBE32(b, Layout::entryOffset(2) + 8, 0x7FFFFFFF); }},
    {"FinderInfoShorterThan32",
     [](GWData& b, const Layout&) { storeBE32(b, Layout::entryOffset(0) + 8, 31); }},
    {"AttributeCountPastTheEntry",
     [](GWData& b, const Layout& l) { storeBE16(b, l.attributeHeaderOffset + 34, 0xFFFF); }},
    {"AttributeEntryPastTheFinderInfo",
     [](GWData& b, const Layout&) { storeBE32(b, Layout::entryOffset(0) + 8, 34 + 36 + 4); }},
    {"AttributeDataPastTheEnd",
     [](GWData& b, const Layout& l) { storeBE32(b, l.firstAttributeEntryOffset, 0xFFFFFF00); }},
    {"AbsurdAttributeLength",
     [](GWData& b, const Layout& l) { storeBE32(b, l.firstAttributeEntryOffset + 4, 0xFFFFFFFF); }},
    {"AttributeDataOutsideTheFinderInfo",
     [](GWData& b, const Layout& l) {
         storeBE32(b, l.firstAttributeEntryOffset, std::uint32_t(l.resourceForkOffset));
     }},
    {"EmptyAttributeName",
     [](GWData& b, const Layout& l) { b[l.firstAttributeEntryOffset + 10] = 0; }},
    {"UnterminatedAttributeName",
     [](GWData& b, const Layout& l) { b[l.firstAttributeEntryOffset + 10] = 5; }},
};

class GWAppleDoubleMalformedTest : public GWAppleDoubleTest,
                                   public ::testing::WithParamInterface<MalformedCase> {};

}  // namespace

TEST_P(GWAppleDoubleMalformedTest, FailsWithEINVALAndChangesNothing) {
    Layout layout;
    GWData bytes = gwtest::buildAppleDouble(fullFile(), &layout);
    GetParam().mutate(bytes, layout);
    GWErrorPtr error;
    ASSERT_FALSE(merge(bytes, &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWPOSIXErrorDomain, EINVAL))
        << error->code() << ": " << error->localizedDescription();
    EXPECT_FALSE(error->URL());
    EXPECT_EQ(gwtest::readFile(dataPath_), contents_);
    const auto names = GWMetadataStore(dataPath_).attributeNames(nullptr);
    ASSERT_TRUE(names);
    for (const auto& name : *names) {
        EXPECT_TRUE(name.starts_with("security.")) << name;
    }
    EXPECT_FALSE(gwtest::fileExists(directory_.file("._Document.txt")));
}

INSTANTIATE_TEST_SUITE_P(Structures, GWAppleDoubleMalformedTest,
                         ::testing::ValuesIn(kMalformedCases),
                         [](const auto& info) { return std::string(info.param.name); });
