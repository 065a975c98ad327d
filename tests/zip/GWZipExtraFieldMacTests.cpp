// Extra fields of classic Mac archivers: Finder information, dates, names.

#include <gtest/gtest.h>

#include <cerrno>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "support/ZipExtraFields.h"
#include "zip/ZipTestSupport.h"

namespace {

using namespace gwtest;

// Two hours east of UTC, without daylight saving: local Mac times then sit
// a fixed 7200 seconds after the UTC instant they name.
constexpr const char* kZone = "XXX-2";
constexpr double kZoneOffset = 7200;

const double kY2K = utcSeconds(2000, 1, 1, 0, 0, 0);
const double kLater = utcSeconds(2010, 6, 15, 12, 30, 45);

// Mac seconds of the local wall-clock time that reads like the UTC time `t`.
std::uint64_t macSeconds(double t) {
    return std::uint64_t(t) + kMacEpochOffset;
}

class GWZipMacExtraFields : public ::testing::Test {
protected:
    std::optional<GWDictionary> decode(std::uint16_t id, const GWData& payload, bool isLocal) {
        error = nullptr;
        return operation->infoFromExtraFieldData(zipExtraBlock(id, payload), isLocal, &error);
    }

    ScopedTimeZone zone{kZone};
    std::shared_ptr<GWZipWorkOperation> operation = std::make_shared<GWZipWorkOperation>();
    GWErrorPtr error;
    ZipLogCapture log;
};

TEST_F(GWZipMacExtraFields, JLEEGivesFinderInfoLocalDatesAndFork) {
    const GWData payload = jleePayload("TEXT", "R*ch", 0x0100, std::uint32_t(macSeconds(kY2K)),
                                       std::uint32_t(macSeconds(kLater)), false);
    auto info = decode(0x07C8, payload, false);
    ASSERT_TRUE(info);
    EXPECT_EQ(stringInfo(*info, kGWZipTypeCodeKey), "TEXT");
    EXPECT_EQ(stringInfo(*info, kGWZipCreatorCodeKey), "R*ch");
    EXPECT_EQ(unsignedInfo(*info, kGWZipFinderFlagsKey), 0x0100u);
    EXPECT_EQ(dateInfo(*info, kGWZipCreationDateKey), kY2K - kZoneOffset);
    EXPECT_EQ(dateInfo(*info, kGWZipModificationDateKey), kLater - kZoneOffset);
    EXPECT_FALSE(dateInfo(*info, kGWZipUTCModificationDateKey));
    EXPECT_EQ(boolInfo(*info, kGWZipIsResourceForkKey), true);
    auto dataFork = decode(0x07C8, jleePayload("TEXT", "R*ch", 0, 0, 0, true), true);
    ASSERT_TRUE(dataFork);
    EXPECT_EQ(boolInfo(*dataFork, kGWZipIsResourceForkKey), false);
}

TEST_F(GWZipMacExtraFields, FieldsWithoutTheirSignatureDecodeToNothing) {
    struct Case {
        std::uint16_t id;
        GWData payload;
    };
    SmartZipInfo smart;
    GWData notZipIt = zipItPayload("n", "TEXT", "ttxt", 1);
    notZipIt[0] = 'X';
    GWData notZipIt135 = zipIt135Payload(1, true);
    notZipIt135[3] = 'X';
    GWData notSmart = smartZipPayload(smart);
    notSmart[0] = 'D';
    for (const Case& c :
         {Case{0x07C8, jleePayload("TEXT", "ttxt", 1, 2, 3, false, "JLEF")}, Case{0x2605, notZipIt},
          Case{0x2805, notZipIt135}, Case{0x4D63, notSmart}, Case{0x07C8, GWData{'J', 'L'}}}) {
        auto info = decode(c.id, c.payload, true);
        ASSERT_TRUE(info) << std::hex << c.id;
        EXPECT_TRUE(info->empty()) << std::hex << c.id;
    }
}

TEST_F(GWZipMacExtraFields, ZipItWithNameIsMacBinaryNamedInMacRoman) {
    auto info = decode(0x2605, zipItPayload("Read\x80Me", "APPL", "\xa5zIt", 0x2000), true);
    ASSERT_TRUE(info);
    EXPECT_EQ(stringInfo(*info, kGWZipFilenameKey), "ReadÄMe");
    EXPECT_EQ(boolInfo(*info, kGWZipIsMacBinaryEncodedKey), true);
    EXPECT_EQ(stringInfo(*info, kGWZipTypeCodeKey), "APPL");
    EXPECT_EQ(stringInfo(*info, kGWZipCreatorCodeKey), "•zIt");
    EXPECT_EQ(unsignedInfo(*info, kGWZipFinderFlagsKey), 0x2000u);
}

TEST_F(GWZipMacExtraFields, ShortZipItHasNoNameAndOptionalFlags) {
    auto info = decode(0x2705, zipItPayload(std::nullopt, "TEXT", "ttxt", 0x0400), false);
    ASSERT_TRUE(info);
    EXPECT_EQ(stringInfo(*info, kGWZipTypeCodeKey), "TEXT");
    EXPECT_EQ(unsignedInfo(*info, kGWZipFinderFlagsKey), 0x0400u);
    EXPECT_FALSE(stringInfo(*info, kGWZipFilenameKey));
    EXPECT_FALSE(boolInfo(*info, kGWZipIsMacBinaryEncodedKey));
    auto noFlags = decode(0x2705, zipItPayload(std::nullopt, "TEXT", "ttxt", std::nullopt), false);
    ASSERT_TRUE(noFlags);
    EXPECT_EQ(noFlags->size(), 2u);
}

TEST_F(GWZipMacExtraFields, ZipItFolderGivesFlagsAndAutomaticOpening) {
    auto info = decode(0x2805, zipIt135Payload(0x0010, true), false);
    ASSERT_TRUE(info);
    EXPECT_EQ(unsignedInfo(*info, kGWZipFinderFlagsKey), 0x0010u);
    EXPECT_EQ(boolInfo(*info, kGWZipAutomaticallyOpenKey), true);
    GWData six = zipIt135Payload(0x0010, true);
    six.resize(6);
    auto flagsOnly = decode(0x2805, six, false);
    ASSERT_TRUE(flagsOnly);
    EXPECT_EQ(flagsOnly->size(), 1u);
}

TEST_F(GWZipMacExtraFields, SmartZipGivesEverythingAndIsMacBinary) {
    SmartZipInfo smart;
    smart.type = "PICT";
    smart.creator = "8BIM";
    smart.finderFlags = 0x4000;
    smart.vertical = 0xFFF0;
    smart.horizontal = 64;
    smart.folder = 3;
    smart.created = std::uint32_t(macSeconds(kY2K));
    smart.modified = std::uint32_t(macSeconds(kLater));
    smart.script = 1;
    smart.extendedFlags = 0x80;
    smart.name = "Bild ✓";
    auto info = decode(0x4D63, smartZipPayload(smart), true);
    ASSERT_TRUE(info);
    EXPECT_EQ(stringInfo(*info, kGWZipTypeCodeKey), "PICT");
    EXPECT_EQ(stringInfo(*info, kGWZipCreatorCodeKey), "8BIM");
    EXPECT_EQ(unsignedInfo(*info, kGWZipFinderFlagsKey), 0x4000u);
    EXPECT_EQ(unsignedInfo(*info, kGWZipVerticalIconLocationKey), 0xFFF0u);
    EXPECT_EQ(unsignedInfo(*info, kGWZipHorizontalIconLocationKey), 64u);
    EXPECT_EQ(unsignedInfo(*info, kGWZipFolderContainingFileKey), 3u);
    EXPECT_EQ(dateInfo(*info, kGWZipCreationDateKey), kY2K - kZoneOffset);
    EXPECT_EQ(dateInfo(*info, kGWZipModificationDateKey), kLater - kZoneOffset);
    EXPECT_EQ(unsignedInfo(*info, kGWZipScriptKey), 1u);
    EXPECT_EQ(unsignedInfo(*info, kGWZipExtendedFinderFlagsKey), 0x80u);
    EXPECT_EQ(stringInfo(*info, kGWZipFilenameKey), "Bild ✓");
    EXPECT_EQ(boolInfo(*info, kGWZipIsMacBinaryEncodedKey), true);

    smart.nameLength = 32;  // too long for the field: no name
    auto longName = decode(0x4D63, smartZipPayload(smart), true);
    ASSERT_TRUE(longName);
    EXPECT_FALSE(stringInfo(*longName, kGWZipFilenameKey));
    EXPECT_EQ(boolInfo(*longName, kGWZipIsMacBinaryEncodedKey), true);
}

// --- Mac3 ---------------------------------------------------------------------------

Mac3Attributes sampleAttributes() {
    Mac3Attributes a;
    a.finderFlags = 0x0500;
    a.vertical = 0xFFFE;
    a.horizontal = 300;
    a.folder = 7;
    a.iconID = -5;
    a.script = -1;
    a.extendedFlags = 0x40;
    a.commentID = -300;
    a.putAway = -2;
    a.version = 4;
    a.accessRights = 0x80;
    a.times = {macSeconds(kY2K), macSeconds(kLater), macSeconds(kY2K + 86400)};
    a.offsets = {3600, -18000, 0};
    a.hfsPath =
        "Macintosh HD:Dokumente:Gr\x9f\xa7"
        "e";                       // "Grüße"
    a.comment = "Kommentar \xa5";  // "•"
    return a;
}

void expectSampleFinderInfo(const GWDictionary& info) {
    EXPECT_EQ(unsignedInfo(info, kGWZipFinderFlagsKey), 0x0500u);
    EXPECT_EQ(unsignedInfo(info, kGWZipVerticalIconLocationKey), 0xFFFEu);
    EXPECT_EQ(unsignedInfo(info, kGWZipHorizontalIconLocationKey), 300u);
    EXPECT_EQ(unsignedInfo(info, kGWZipFolderContainingFileKey), 7u);
    EXPECT_EQ(signedInfo(info, kGWZipIconIDKey), -5);
    EXPECT_EQ(signedInfo(info, kGWZipScriptKey), -1);
    EXPECT_EQ(signedInfo(info, kGWZipExtendedFlagsKey), 0x40);
    EXPECT_EQ(signedInfo(info, kGWZipCommentIDKey), -300);
    EXPECT_EQ(signedInfo(info, kGWZipPutAwayFolderKey), -2);
    EXPECT_EQ(unsignedInfo(info, kGWZipVersionNumberKey), 4u);
    EXPECT_EQ(unsignedInfo(info, kGWZipAccessRightsKey), 0x80u);
    EXPECT_EQ(stringInfo(info, kGWZipHFSPathKey), "Macintosh HD:Dokumente:Grüße");
    EXPECT_EQ(stringInfo(info, kGWZipCommentKey), "Kommentar •");
}

// Each date in the zone of its own stored offset.
void expectSampleDatesWithOffsets(const GWDictionary& info) {
    EXPECT_EQ(dateInfo(info, kGWZipUTCCreationDateKey), kY2K - 3600);
    EXPECT_EQ(dateInfo(info, kGWZipUTCModificationDateKey), kLater + 18000);
    EXPECT_EQ(dateInfo(info, kGWZipUTCBackupDateKey), kY2K + 86400);
}

TEST_F(GWZipMacExtraFields, Mac3CentralFormHasOnlyTheHeader) {
    const GWData attributes = mac3AttributeBlock(sampleAttributes(), false, true);
    auto info = decode(0x334D, mac3Payload(0x0004, "TEXT", "ttxt", attributes), false);
    ASSERT_TRUE(info);
    EXPECT_EQ(stringInfo(*info, kGWZipTypeCodeKey), "TEXT");
    EXPECT_EQ(stringInfo(*info, kGWZipCreatorCodeKey), "ttxt");
    EXPECT_EQ(boolInfo(*info, kGWZipIsResourceForkKey), true);
    EXPECT_EQ(boolInfo(*info, kGWZipDontChangeFilenameKey), false);
    EXPECT_EQ(boolInfo(*info, kGWZipMoreInfoAvailableInLocalHeaderKey), true);
    EXPECT_EQ(info->size(), 5u);
    // Data fork, keep the archive's name.
    auto flagged = decode(0x334D, mac3Payload(0x0003, "APPL", "????", std::nullopt), false);
    ASSERT_TRUE(flagged);
    EXPECT_EQ(boolInfo(*flagged, kGWZipIsResourceForkKey), false);
    EXPECT_EQ(boolInfo(*flagged, kGWZipDontChangeFilenameKey), true);
}

TEST_F(GWZipMacExtraFields, Mac3StoredBlockWith32BitTimesAndOffsets) {
    const GWData attributes = mac3AttributeBlock(sampleAttributes(), false, true);
    auto info = decode(0x334D, mac3Payload(0x0004 | 0x0001, "TEXT", "ttxt", attributes), true);
    ASSERT_TRUE(info);
    EXPECT_EQ(stringInfo(*info, kGWZipTypeCodeKey), "TEXT");
    EXPECT_EQ(boolInfo(*info, kGWZipIsResourceForkKey), false);
    EXPECT_FALSE(boolInfo(*info, kGWZipMoreInfoAvailableInLocalHeaderKey));
    expectSampleFinderInfo(*info);
    expectSampleDatesWithOffsets(*info);
}

TEST_F(GWZipMacExtraFields, Mac3DeflatedBlockWith64BitTimesAndOffsets) {
    Mac3Attributes a = sampleAttributes();
    a.times[2] = 0x1'0000'0000ull + macSeconds(kY2K);  // past what 32 bits hold
    const GWData attributes = mac3AttributeBlock(a, true, true);
    auto info = decode(0x334D, mac3Payload(0x0008, "TEXT", "ttxt", attributes, 8), true);
    ASSERT_TRUE(info) << (error ? error->localizedDescription() : "");
    expectSampleFinderInfo(*info);
    EXPECT_EQ(dateInfo(*info, kGWZipUTCCreationDateKey), kY2K - 3600);
    EXPECT_EQ(dateInfo(*info, kGWZipUTCModificationDateKey), kLater + 18000);
    EXPECT_EQ(dateInfo(*info, kGWZipUTCBackupDateKey), kY2K + 4294967296.0);
}

TEST_F(GWZipMacExtraFields, Mac3WithoutOffsetsUsesTheSystemZone) {
    for (bool wide : {false, true}) {
        const GWData attributes = mac3AttributeBlock(sampleAttributes(), wide, false);
        const std::uint16_t flags = 0x0010 | (wide ? 0x0008 : 0);
        auto info = decode(0x334D, mac3Payload(flags, "TEXT", "ttxt", attributes, 8), true);
        ASSERT_TRUE(info);
        expectSampleFinderInfo(*info);
        EXPECT_EQ(dateInfo(*info, kGWZipUTCCreationDateKey), kY2K - kZoneOffset);
        EXPECT_EQ(dateInfo(*info, kGWZipUTCModificationDateKey), kLater - kZoneOffset);
    }
}

TEST_F(GWZipMacExtraFields, Mac3CompressedWithEveryMethodTheDecompressorKnows) {
    const GWData attributes = mac3AttributeBlock(sampleAttributes(), false, true);
    for (std::uint16_t method : {0, 8, 12}) {
        auto info = decode(0x334D, mac3Payload(0, "TEXT", "ttxt", attributes, method), true);
        ASSERT_TRUE(info) << method;
        expectSampleFinderInfo(*info);
        expectSampleDatesWithOffsets(*info);
    }
}

TEST_F(GWZipMacExtraFields, Mac3WithABadChecksumOrMethodFails) {
    const GWData attributes = mac3AttributeBlock(sampleAttributes(), false, true);
    EXPECT_FALSE(decode(0x334D, mac3Payload(0, "TEXT", "ttxt", attributes, 8, 0xBAD), true));
    EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError));
    // Methods that need an entry's size have none here.
    EXPECT_FALSE(decode(0x334D, mac3Payload(0, "TEXT", "ttxt", attributes, 6), true));
    EXPECT_TRUE(error->is(kGWPOSIXErrorDomain, EINVAL));
    EXPECT_FALSE(decode(0x334D, mac3Payload(0, "TEXT", "ttxt", attributes, 98), true));
    EXPECT_TRUE(error->is(kGWZipArchiveErrorDomain, GWZipArchiveUnsupportedCompressionMethodError));
    // A damaged deflate stream.
    GWData damaged = mac3Payload(0, "TEXT", "ttxt", attributes, 8);
    damaged.resize(damaged.size() - 8);
    EXPECT_FALSE(decode(0x334D, damaged, true));
    EXPECT_NE(error, nullptr);
}

TEST_F(GWZipMacExtraFields, Mac3AttributeBlocksOfAtMost51BytesAreNotDecoded) {
    const GWData attributes = mac3AttributeBlock(sampleAttributes(), false, true);
    const GWData short51(attributes.begin(), attributes.begin() + 51);
    auto info = decode(0x334D, mac3Payload(0x0004, "TEXT", "ttxt", short51), true);
    ASSERT_TRUE(info);
    EXPECT_FALSE(unsignedInfo(*info, kGWZipFinderFlagsKey));
    EXPECT_EQ(info->size(), 4u);
    const GWData short52(attributes.begin(), attributes.begin() + 52);
    auto decoded = decode(0x334D, mac3Payload(0x0004, "TEXT", "ttxt", short52), true);
    ASSERT_TRUE(decoded);
    EXPECT_EQ(unsignedInfo(*decoded, kGWZipFinderFlagsKey), 0x0500u);
    EXPECT_FALSE(stringInfo(*decoded, kGWZipHFSPathKey));  // starts at 52
}

TEST_F(GWZipMacExtraFields, Mac3StoredBlockIsLimitedByItsStatedSize) {
    const GWData attributes = mac3AttributeBlock(sampleAttributes(), false, true);
    GWData payload = mac3Payload(0x0004, "TEXT", "ttxt", attributes);
    payload[0] = 51;  // stated size: the block then counts as too short
    payload[1] = payload[2] = payload[3] = 0;
    auto info = decode(0x334D, payload, true);
    ASSERT_TRUE(info);
    EXPECT_FALSE(unsignedInfo(*info, kGWZipFinderFlagsKey));
}

TEST_F(GWZipMacExtraFields, Mac3StringsWithoutTerminatorsEndWithTheBlock) {
    Mac3Attributes a = sampleAttributes();
    GWData attributes = mac3AttributeBlock(a, false, true);
    // Drop the comment and both zero bytes: the path runs to the end.
    attributes.resize(attributes.size() - a.comment.size() - 2);
    auto info = decode(0x334D, mac3Payload(0x0004, "TEXT", "ttxt", attributes), true);
    ASSERT_TRUE(info);
    EXPECT_EQ(stringInfo(*info, kGWZipHFSPathKey), "Macintosh HD:Dokumente:Grüße");
    EXPECT_FALSE(stringInfo(*info, kGWZipCommentKey));
}

TEST_F(GWZipMacExtraFields, Mac3InfoDrivesTheEntryModel) {
    const GWData attributes = mac3AttributeBlock(sampleAttributes(), false, true);
    auto info = decode(0x334D, mac3Payload(0x0004 | 0x0001, "TEXT", "ttxt", attributes), true);
    ASSERT_TRUE(info);
    auto file = GWZipFile::initWithName("Gr", nullptr, 0, 0, std::nullopt, 0, 0, 0, 0100644,
                                        GWDate(0), std::nullopt, 0, 0, 0, {});
    file->setExtraInfo(*info);
    EXPECT_EQ(file->name(), "Grüße");  // from the HFS path
    EXPECT_EQ(file->typeCode(), 0x54455854u);
    EXPECT_EQ(file->iconLocationV(), -2);
    EXPECT_EQ(file->putAwayFolderID(), 0xFFFE);
    EXPECT_EQ(file->creationDate(), GWDate(kY2K - 3600));
    EXPECT_EQ(file->comment(), "Kommentar •");
}

}  // namespace
