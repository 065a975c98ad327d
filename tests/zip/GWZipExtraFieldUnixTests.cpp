// Extra fields of Unix archivers: times, owners, link targets, UTF-8 names.

#include <gtest/gtest.h>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "support/ZipExtraFields.h"
#include "zip/ZipTestSupport.h"

namespace {

using namespace gwtest;

class GWZipUnixExtraFields : public ::testing::Test {
protected:
    std::optional<GWDictionary> decode(std::uint16_t id, const GWData& payload, bool isLocal) {
        error = nullptr;
        return operation->infoFromExtraFieldData(zipExtraBlock(id, payload), isLocal, &error);
    }

    std::shared_ptr<GWZipWorkOperation> operation = std::make_shared<GWZipWorkOperation>();
    GWErrorPtr error;
    ZipLogCapture log;
};

constexpr std::uint32_t kAccess = 1600000000;
constexpr std::uint32_t kModify = 1500000000;
// Top bit set: a date after 2038, never one before 1970.
constexpr std::uint32_t kAfter2038 = 0x90000000u;

TEST_F(GWZipUnixExtraFields, PKWareUnixGivesTimesOwnerAndLinkTarget) {
    for (bool isLocal : {false, true}) {
        auto info = decode(0x000D, unixPayload(kAccess, kAfter2038, 501, 20, "../target"), isLocal);
        ASSERT_TRUE(info);
        EXPECT_EQ(dateInfo(*info, kGWZipUTCAccessDateKey), double(kAccess));
        EXPECT_EQ(dateInfo(*info, kGWZipUTCModificationDateKey), double(kAfter2038));
        EXPECT_EQ(unsignedInfo(*info, kGWZipUserIDKey), 501u);
        EXPECT_EQ(unsignedInfo(*info, kGWZipGroupIDKey), 20u);
        EXPECT_EQ(stringInfo(*info, kGWZipSymbolicLinkFilenameKey), "../target");
        EXPECT_FALSE(boolInfo(*info, kGWZipMoreInfoAvailableInLocalHeaderKey));
    }
    // No bytes after the owner: no link target.
    auto noLink = decode(0x000D, unixPayload(kAccess, kModify, 1, 2), true);
    ASSERT_TRUE(noLink);
    EXPECT_FALSE(stringInfo(*noLink, kGWZipSymbolicLinkFilenameKey));
    // A link target that is not UTF-8 is left out, the rest stays.
    auto badLink = decode(0x000D, unixPayload(kAccess, kModify, 1, 2, "\xff\xfe"), true);
    ASSERT_TRUE(badLink);
    EXPECT_FALSE(stringInfo(*badLink, kGWZipSymbolicLinkFilenameKey));
    EXPECT_EQ(unsignedInfo(*badLink, kGWZipUserIDKey), 1u);
}

TEST_F(GWZipUnixExtraFields, OriginalInfoZipUnixHasTheOwnerOnlyLocally) {
    auto local = decode(0x5855, unixPayload(kAccess, kModify, 1000, 1001, "ignored"), true);
    ASSERT_TRUE(local);
    EXPECT_EQ(dateInfo(*local, kGWZipUTCModificationDateKey), double(kModify));
    EXPECT_EQ(unsignedInfo(*local, kGWZipUserIDKey), 1000u);
    EXPECT_EQ(unsignedInfo(*local, kGWZipGroupIDKey), 1001u);
    EXPECT_FALSE(stringInfo(*local, kGWZipSymbolicLinkFilenameKey));
    EXPECT_FALSE(boolInfo(*local, kGWZipMoreInfoAvailableInLocalHeaderKey));

    auto central = decode(0x5855, unixPayload(kAccess, kModify), false);
    ASSERT_TRUE(central);
    EXPECT_EQ(dateInfo(*central, kGWZipUTCAccessDateKey), double(kAccess));
    EXPECT_FALSE(unsignedInfo(*central, kGWZipUserIDKey));
    EXPECT_EQ(boolInfo(*central, kGWZipMoreInfoAvailableInLocalHeaderKey), true);
    // The 8-byte local form (times only, as 7-Zip writes it).
    auto timesOnly = decode(0x5855, unixPayload(kAccess, kModify), true);
    ASSERT_TRUE(timesOnly);
    EXPECT_EQ(timesOnly->size(), 2u);
}

TEST_F(GWZipUnixExtraFields, ExtendedTimestampReadsTheTimesItsFlagsAnnounce) {
    auto all =
        decode(0x5455, extendedTimestampPayload(0x07, {kModify, kAccess, kAfter2038}), false);
    ASSERT_TRUE(all);
    EXPECT_EQ(dateInfo(*all, kGWZipUTCModificationDateKey), double(kModify));
    EXPECT_EQ(dateInfo(*all, kGWZipUTCAccessDateKey), double(kAccess));
    EXPECT_EQ(dateInfo(*all, kGWZipUTCCreationDateKey), double(kAfter2038));
    EXPECT_FALSE(boolInfo(*all, kGWZipMoreInfoAvailableInLocalHeaderKey));

    auto two = decode(0x5455, extendedTimestampPayload(0x03, {kModify, kAccess}), false);
    ASSERT_TRUE(two);
    EXPECT_EQ(dateInfo(*two, kGWZipUTCAccessDateKey), double(kAccess));
    EXPECT_EQ(boolInfo(*two, kGWZipMoreInfoAvailableInLocalHeaderKey), true);

    auto twoLocal = decode(0x5455, extendedTimestampPayload(0x03, {kModify, kAccess}), true);
    ASSERT_TRUE(twoLocal);
    EXPECT_FALSE(boolInfo(*twoLocal, kGWZipMoreInfoAvailableInLocalHeaderKey));

    // Access and creation only: the first time is the access time.
    auto skipped = decode(0x5455, extendedTimestampPayload(0x06, {kAccess, kModify}), true);
    ASSERT_TRUE(skipped);
    EXPECT_FALSE(dateInfo(*skipped, kGWZipUTCModificationDateKey));
    EXPECT_EQ(dateInfo(*skipped, kGWZipUTCAccessDateKey), double(kAccess));
    EXPECT_EQ(dateInfo(*skipped, kGWZipUTCCreationDateKey), double(kModify));

    // The central copy Info-ZIP writes: all flags, only the modification time.
    auto central = decode(0x5455, extendedTimestampPayload(0x07, {kModify}), false);
    ASSERT_TRUE(central);
    EXPECT_EQ(central->size(), 1u);  // flags 7: no "more info" even though times are missing
}

TEST_F(GWZipUnixExtraFields, NewInfoZipUnixHasTheOwnerOnlyLocally) {
    auto local = decode(0x7855, infoZipUnixPayload(65534, 100), true);
    ASSERT_TRUE(local);
    EXPECT_EQ(unsignedInfo(*local, kGWZipUserIDKey), 65534u);
    EXPECT_EQ(unsignedInfo(*local, kGWZipGroupIDKey), 100u);
    auto central = decode(0x7855, {}, false);
    ASSERT_TRUE(central);
    EXPECT_EQ(central->size(), 1u);
    EXPECT_EQ(boolInfo(*central, kGWZipMoreInfoAvailableInLocalHeaderKey), true);
}

TEST_F(GWZipUnixExtraFields, ThirdGenerationUnixTakesIDsOfAnyWidth) {
    for (bool isLocal : {false, true}) {
        auto wide = decode(0x7875, infoZipUnix3GPayload(0x123456789ull, 7, 8, 1), isLocal);
        ASSERT_TRUE(wide);
        EXPECT_EQ(unsignedInfo(*wide, kGWZipUserIDKey), 0x123456789ull);
        EXPECT_EQ(unsignedInfo(*wide, kGWZipGroupIDKey), 7u);
    }
    auto usual = decode(0x7875, infoZipUnix3GPayload(1234, 5678), true);
    ASSERT_TRUE(usual);
    EXPECT_EQ(unsignedInfo(*usual, kGWZipUserIDKey), 1234u);
    EXPECT_EQ(unsignedInfo(*usual, kGWZipGroupIDKey), 5678u);
    // Widths the integer conversion refuses (0, more than 8) give no ID.
    auto refused = decode(0x7875, GWData{1, 0, 9, 1, 2, 3, 4, 5, 6, 7, 8, 9}, true);
    ASSERT_TRUE(refused);
    EXPECT_TRUE(refused->empty());
    // A UID that runs past the block gives neither ID.
    auto cut = decode(0x7875, GWData{1, 4, 1, 2}, true);
    ASSERT_TRUE(cut);
    EXPECT_TRUE(cut->empty());
}

TEST_F(GWZipUnixExtraFields, ThirdGenerationUnixOfAnotherVersionFails) {
    EXPECT_FALSE(decode(0x7875, infoZipUnix3GPayload(1, 2, 4, 4, 2), true));
    ASSERT_NE(error, nullptr);
    EXPECT_TRUE(error->is(kGWZipArchiveErrorDomain, GWZipArchiveUnknownExtraFieldVersionError));
    EXPECT_EQ(
        GWDictionaryValue(error->userInfo(), kGWZipArchiveUnknownEntityErrorKey)->unsignedValue(),
        2u);
    EXPECT_TRUE(log.contains("Unknown version of the Info-ZIP Unix 3G extra field: 2"));
}

TEST_F(GWZipUnixExtraFields, UnicodePathWithAGoodChecksumGivesThePOSIXPath) {
    const std::string path = "dir/Ünïcödé名.txt";
    for (bool isLocal : {false, true}) {
        auto info = decode(0x7075, infoZipUnicodePayload(path), isLocal);
        ASSERT_TRUE(info);
        EXPECT_EQ(stringInfo(*info, kGWZipPOSIXPathKey), path);
    }
}

TEST_F(GWZipUnixExtraFields, UnicodePathWithABadChecksumFails) {
    EXPECT_FALSE(decode(0x7075, infoZipUnicodePayload("name", 0x12345678), false));
    ASSERT_NE(error, nullptr);
    EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError));
    EXPECT_TRUE(log.contains("Bad checksum for UTF-8 Path"));
    // With a good block beside it, the field still decodes, without the path.
    auto info = operation->infoFromExtraFieldData(
        concat({zipExtraBlock(0x7075, infoZipUnicodePayload("name", 0x12345678)),
                zipExtraBlock(0x7855, infoZipUnixPayload(1, 2))}),
        true, &error);
    ASSERT_TRUE(info);
    EXPECT_FALSE(stringInfo(*info, kGWZipPOSIXPathKey));
}

TEST_F(GWZipUnixExtraFields, UnicodeFieldsOfAnotherVersionFail) {
    EXPECT_FALSE(decode(0x7075, infoZipUnicodePayload("name", std::nullopt, 2), true));
    EXPECT_TRUE(error->is(kGWZipArchiveErrorDomain, GWZipArchiveUnknownExtraFieldVersionError));
    EXPECT_TRUE(log.contains("Unknown version of the Info-ZIP Unix path extra field: 2"));
    EXPECT_FALSE(decode(0x6375, infoZipUnicodePayload("note", std::nullopt, 0), true));
    EXPECT_TRUE(error->is(kGWZipArchiveErrorDomain, GWZipArchiveUnknownExtraFieldVersionError));
    EXPECT_TRUE(log.contains("Unknown version of the Info-ZIP Unix comment extra field: 0"));
}

TEST_F(GWZipUnixExtraFields, UnicodeCommentWithGoodAndBadChecksums) {
    auto good = decode(0x6375, infoZipUnicodePayload("Кommentar ✓"), false);
    ASSERT_TRUE(good);
    EXPECT_EQ(stringInfo(*good, kGWZipCommentKey), "Кommentar ✓");
    EXPECT_FALSE(decode(0x6375, infoZipUnicodePayload("note", 1), false));
    EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError));
    EXPECT_TRUE(log.contains("Bad checksum for UTF-8 Comment"));
    // An empty comment has the CRC 0.
    auto empty = decode(0x6375, infoZipUnicodePayload("", 0), false);
    ASSERT_TRUE(empty);
    EXPECT_EQ(stringInfo(*empty, kGWZipCommentKey), "");
}

TEST_F(GWZipUnixExtraFields, UnicodePathThatIsNotUTF8IsLeftOut) {
    auto info = decode(0x7075, infoZipUnicodePayload("\xc3\x28"), true);  // CRC matches
    ASSERT_TRUE(info);
    EXPECT_TRUE(info->empty());
}

TEST_F(GWZipUnixExtraFields, ASiUnixGivesModeOwnerChecksumAndLink) {
    auto info = decode(0x756E, asiUnixPayload(0xCAFEBABE, 0120755, 501, 20, "/abs/target"), true);
    ASSERT_TRUE(info);
    EXPECT_EQ(unsignedInfo(*info, kGWZipCRC32Key), 0xCAFEBABEu);
    EXPECT_EQ(unsignedInfo(*info, kGWZipPermissionsModeKey), 0120755u);
    EXPECT_EQ(unsignedInfo(*info, kGWZipUserIDKey), 501u);
    EXPECT_EQ(unsignedInfo(*info, kGWZipGroupIDKey), 20u);
    EXPECT_EQ(stringInfo(*info, kGWZipSymbolicLinkFilenameKey), "/abs/target");
    auto regular = decode(0x756E, asiUnixPayload(1, 0100644, 2, 3), false);
    ASSERT_TRUE(regular);
    EXPECT_FALSE(stringInfo(*regular, kGWZipSymbolicLinkFilenameKey));
    EXPECT_EQ(regular->size(), 4u);
}

}  // namespace
