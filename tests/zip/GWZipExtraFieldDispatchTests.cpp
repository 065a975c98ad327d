// The extra-field dispatcher, the kinds every host writes, and reads that
// must stay inside truncated or lying blocks.

#include <gtest/gtest.h>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "support/TestSupport.h"
#include "support/ZipExtraFields.h"
#include "zip/ZipTestSupport.h"

namespace {

using namespace gwtest;

class GWZipExtraFieldDispatch : public ::testing::Test {
protected:
    std::optional<GWDictionary> decode(const GWData& field, bool isLocal = false) {
        error = nullptr;
        return operation->infoFromExtraFieldData(field, isLocal, &error);
    }

    std::shared_ptr<GWZipWorkOperation> operation = std::make_shared<GWZipWorkOperation>();
    GWErrorPtr error;
    ZipLogCapture log;
};

const double kTime1 = utcSeconds(2001, 2, 3, 4, 5, 6);
const double kTime2 = utcSeconds(2011, 12, 13, 14, 15, 16);

TEST_F(GWZipExtraFieldDispatch, EmptyFieldGivesAnEmptyDictionary) {
    auto info = decode({});
    ASSERT_TRUE(info);
    EXPECT_TRUE(info->empty());
    EXPECT_EQ(error, nullptr);
}

TEST_F(GWZipExtraFieldDispatch, UnknownIDsAreLoggedAndSkipped) {
    auto alone = decode(zipExtraBlock(0x1234, GWData{1, 2, 3}));
    ASSERT_TRUE(alone);
    EXPECT_TRUE(alone->empty());
    EXPECT_EQ(error, nullptr);
    EXPECT_TRUE(log.contains("unknown extra info signature: 0x1234"));

    auto info = decode(concat({zipExtraBlock(0x4453, GWData{1, 2, 3}),
                               zipExtraBlock(0x5455, extendedTimestampPayload(1, {1000}))}));
    ASSERT_TRUE(info);
    EXPECT_EQ(error, nullptr);
    EXPECT_EQ(dateInfo(*info, kGWZipUTCModificationDateKey), 1000.0);
}

TEST_F(GWZipExtraFieldDispatch, AFailingBlockIsFatalOnlyWhenNothingElseDecoded) {
    const GWData badVersion = zipExtraBlock(0x7875, infoZipUnix3GPayload(1, 2, 4, 4, 2));
    EXPECT_FALSE(decode(badVersion));
    ASSERT_NE(error, nullptr);
    EXPECT_TRUE(error->is(kGWZipArchiveErrorDomain, GWZipArchiveUnknownExtraFieldVersionError));

    auto info =
        decode(concat({zipExtraBlock(0x000A, ntfsPayload(ntfsTicks(kTime1), 0, 0)), badVersion}));
    ASSERT_TRUE(info);
    EXPECT_EQ(error, nullptr);
    EXPECT_EQ(dateInfo(*info, kGWZipUTCModificationDateKey), kTime1);

    // An unknown block beside it decodes nothing either.
    EXPECT_FALSE(decode(concat({zipExtraBlock(0x9999, {}), badVersion})));
    EXPECT_TRUE(error->is(kGWZipArchiveErrorDomain, GWZipArchiveUnknownExtraFieldVersionError));
}

TEST_F(GWZipExtraFieldDispatch, LaterBlocksOverwriteEarlierKeys) {
    auto info = decode(concat({zipExtraBlock(0x5455, extendedTimestampPayload(1, {1000})),
                               zipExtraBlock(0x000A, ntfsPayload(ntfsTicks(kTime2), 0, 0))}));
    ASSERT_TRUE(info);
    EXPECT_EQ(dateInfo(*info, kGWZipUTCModificationDateKey), kTime2);
}

TEST_F(GWZipExtraFieldDispatch, MarkerAndPaddingBlocksDecodeToNothing) {
    for (std::uint16_t id : {0xCAFE, 0xA220, 0xD935}) {
        for (const GWData& payload : {GWData{}, GWData{0, 0, 0x10, 0}}) {
            auto info = decode(zipExtraBlock(id, payload));
            ASSERT_TRUE(info) << std::hex << id;
            EXPECT_TRUE(info->empty());
        }
    }
    EXPECT_TRUE(log.lines().empty());
}

TEST_F(GWZipExtraFieldDispatch, ABlockLongerThanTheFieldIsCutToWhatIsThere) {
    // Declares 13 bytes (mtime, atime, ctime) but holds only the flags and mtime.
    auto info = decode(zipExtraBlock(0x5455, extendedTimestampPayload(7, {1000}), 13));
    ASSERT_TRUE(info);
    EXPECT_EQ(dateInfo(*info, kGWZipUTCModificationDateKey), 1000.0);
    EXPECT_FALSE(dateInfo(*info, kGWZipUTCAccessDateKey));
}

TEST_F(GWZipExtraFieldDispatch, ATailTooShortForAHeaderIsIgnored) {
    for (const GWData& tail : {GWData{0}, GWData{0x55, 0x54}, GWData{0x55, 0x54, 0x05}}) {
        auto info = decode(concat({zipExtraBlock(0x5455, extendedTimestampPayload(1, {7})), tail}));
        ASSERT_TRUE(info);
        EXPECT_EQ(dateInfo(*info, kGWZipUTCModificationDateKey), 7.0);
        EXPECT_EQ(error, nullptr);
    }
}

TEST_F(GWZipExtraFieldDispatch, Zip64CentralFormGivesTheOffset) {
    auto central = decode(zipExtraBlock(0x0001, zip64Payload({0x123456789ull, 5})), false);
    ASSERT_TRUE(central);
    EXPECT_EQ(unsignedInfo(*central, kGWZipLocalHeaderOffsetKey), 0x123456789ull);
    EXPECT_FALSE(unsignedInfo(*central, kGWZipUncompressedSizeKey));
    auto shortCentral = decode(zipExtraBlock(0x0001, GWData{1, 2, 3, 4}), false);
    ASSERT_TRUE(shortCentral);
    EXPECT_TRUE(shortCentral->empty());
}

TEST_F(GWZipExtraFieldDispatch, Zip64LocalFormGivesBothSizesOnlyFromSixteenBytes) {
    auto local = decode(zipExtraBlock(0x0001, zip64Payload({0x100000000ull, 0x80000000ull})), true);
    ASSERT_TRUE(local);
    EXPECT_EQ(unsignedInfo(*local, kGWZipUncompressedSizeKey), 0x100000000ull);
    EXPECT_EQ(unsignedInfo(*local, kGWZipCompressedSizeKey), 0x80000000ull);
    EXPECT_FALSE(unsignedInfo(*local, kGWZipLocalHeaderOffsetKey));
    GWData fifteen = zip64Payload({1, 2});
    fifteen.pop_back();
    auto shortLocal = decode(zipExtraBlock(0x0001, fifteen), true);
    ASSERT_TRUE(shortLocal);
    EXPECT_TRUE(shortLocal->empty());
}

TEST_F(GWZipExtraFieldDispatch, NTFSTimesDecodeWithTheirFractions) {
    const std::uint64_t modified = ntfsTicks(kTime1) + 1234567;  // 0.1234567 s later
    auto info =
        decode(zipExtraBlock(0x000A, ntfsPayload(modified, ntfsTicks(kTime2), ntfsTicks(0))));
    ASSERT_TRUE(info);
    EXPECT_NEAR(*dateInfo(*info, kGWZipUTCModificationDateKey), kTime1 + 0.1234567, 1e-6);
    EXPECT_EQ(dateInfo(*info, kGWZipUTCAccessDateKey), kTime2);
    EXPECT_EQ(dateInfo(*info, kGWZipUTCCreationDateKey), 0.0);
    // Cut after the modification time: only that one.
    GWData cut = ntfsPayload(modified, 1, 2);
    cut.resize(20);
    auto partial = decode(zipExtraBlock(0x000A, cut));
    ASSERT_TRUE(partial);
    EXPECT_EQ(partial->size(), 1u);
}

// Every kind of block, cut at every length and in both header kinds, with
// the block's bytes in an allocation of exactly that size: the sanitizer
// build reports any read past it.
TEST_F(GWZipExtraFieldDispatch, TruncatedBlocksNeverReadOutside) {
    Mac3Attributes attributes;
    attributes.hfsPath = "Disk:Folder:File";
    attributes.comment = "comment";
    const GWData attributeBlock = mac3AttributeBlock(attributes, true, true);
    SmartZipInfo smart;
    smart.name = "name";
    const std::vector<std::pair<std::uint16_t, GWData>> blocks = {
        {0x0001, zip64Payload({1, 2, 3})},
        {0x000A, ntfsPayload(1, 2, 3)},
        {0x000D, unixPayload(1, 2, 3, 4, "target")},
        {0x07C8, jleePayload("TEXT", "ttxt", 0x100, 5, 6, false)},
        {0x2605, zipItPayload("name", "TEXT", "ttxt", 0x100)},
        {0x2705, zipItPayload(std::nullopt, "TEXT", "ttxt", 0x100)},
        {0x2805, zipIt135Payload(0x100, true)},
        {0x334D, mac3Payload(0x0008, "TEXT", "ttxt", attributeBlock, 8)},
        {0x334D, mac3Payload(0x0004 | 0x0010, "TEXT", "ttxt", attributeBlock)},
        {0x334D, mac3Payload(0x0000, "TEXT", "ttxt", attributeBlock, 0)},
        {0x4D63, smartZipPayload(smart)},
        {0x5455, extendedTimestampPayload(7, {1, 2, 3})},
        {0x5855, unixPayload(1, 2, 3, 4)},
        {0x6375, infoZipUnicodePayload("comment")},
        {0x7075, infoZipUnicodePayload("path/name")},
        {0x756E, asiUnixPayload(1, 0120777, 2, 3, "target")},
        {0x7855, infoZipUnixPayload(1, 2)},
        {0x7875, infoZipUnix3GPayload(1, 2, 8, 8)},
        {0xA220, GWData{0, 0, 0, 0}},
    };
    for (const auto& [id, payload] : blocks) {
        for (std::size_t length = 0; length <= payload.size(); ++length) {
            for (bool isLocal : {false, true}) {
                // The field alone, declaring the full size but cut short.
                const GWData whole = zipExtraBlock(id, payload);
                const GWData field(whole.begin(), whole.begin() + 4 + length);
                GWErrorPtr fieldError;
                auto info = operation->infoFromExtraFieldData(field, isLocal, &fieldError);
                if (!info) {
                    ASSERT_NE(fieldError, nullptr);
                    // Cut Mac3 streams fail to decompress or check; nothing else fails.
                    EXPECT_TRUE(id == 0x334D || id == 0x6375 || id == 0x7075)
                        << std::hex << id << " cut to " << std::dec << length;
                }
            }
        }
    }
}

// Deterministic garbage in every known kind: decoders answer or fail cleanly.
TEST_F(GWZipExtraFieldDispatch, GarbageBlocksDecodeOrFailCleanly) {
    const std::uint16_t ids[] = {0x0001, 0x000A, 0x000D, 0x07C8, 0x2605, 0x2705,
                                 0x2805, 0x334D, 0x4D63, 0x5455, 0x5855, 0x6375,
                                 0x7075, 0x756E, 0x7855, 0x7875, 0xA220, 0xCAFE};
    std::uint32_t seed = 1;
    for (std::uint16_t id : ids) {
        for (std::size_t length : {1u, 5u, 14u, 20u, 33u, 52u, 64u, 200u}) {
            GWData payload = randomBytes(length, seed++);
            // Keep the signatures some kinds look for, so the rest is reached.
            if (id == 0x07C8 && length >= 4) {
                std::copy_n("JLEE", 4, payload.begin());
            } else if ((id == 0x2605 || id == 0x2705 || id == 0x2805) && length >= 4) {
                std::copy_n("ZPIT", 4, payload.begin());
            } else if (id == 0x4D63 && length >= 4) {
                std::copy_n("dZip", 4, payload.begin());
            }
            for (bool isLocal : {false, true}) {
                GWErrorPtr fieldError;
                auto info = operation->infoFromExtraFieldData(zipExtraBlock(id, payload), isLocal,
                                                              &fieldError);
                if (!info) {
                    ASSERT_NE(fieldError, nullptr);
                    EXPECT_TRUE(fieldError->domain() == kGWZipArchiveErrorDomain ||
                                fieldError->domain() == kGWCocoaErrorDomain ||
                                fieldError->domain() == kGWPOSIXErrorDomain)
                        << fieldError->domain();
                }
            }
        }
    }
}

}  // namespace
