// Every extra-field kind the reader decodes, as one table of blocks and the
// information (or error) each gives; then reads that must stay inside
// truncated or lying blocks.

#include <gtest/gtest.h>

#include <cerrno>
#include <cmath>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "support/TestSupport.h"
#include "support/ZipExtraFields.h"
#include "zip/ZipTestSupport.h"

namespace {

using namespace gwtest;

double utc(int year, int month, int day, int hour, int minute, int second) {
    return GWDate::gregorianDateWithYear(year, month, day, hour, minute, second, GWTimeZone::UTC())
        .timeIntervalSince1970();
}

// Two hours east of UTC, without daylight saving: local Mac times then sit
// a fixed 7200 seconds after the UTC instant they name.
constexpr const char* kZone = "XXX-2";
constexpr double kZoneOffset = 7200;
const double kTime1 = utc(2001, 2, 3, 4, 5, 6);
const double kTime2 = utc(2011, 12, 13, 14, 15, 16);
const double kY2K = utc(2000, 1, 1, 0, 0, 0);
const double kLater = utc(2010, 6, 15, 12, 30, 45);
constexpr std::uint32_t kAccess = 1600000000;
constexpr std::uint32_t kModify = 1500000000;
// Top bit set: a date after 2038, never one before 1970.
constexpr std::uint32_t kAfter2038 = 0x90000000u;

// Mac seconds of the local wall-clock time that reads like the UTC time `t`.
std::uint64_t macSeconds(double t) {
    return std::uint64_t(t) + kMacEpochOffset;
}

std::uint64_t ntfsTicks(double secondsSince1970) {
    return std::uint64_t((secondsSince1970 + 11644473600.0) * 1e7);
}

GWData cut(GWData bytes, std::size_t length) {
    bytes.resize(length);
    return bytes;
}

GWData patched(GWData bytes, std::size_t at, std::uint8_t value) {
    bytes[at] = value;
    return bytes;
}

Mac3Attributes sampleAttributes() {
    return {.finderFlags = 0x0500,
            .vertical = 0xFFFE,
            .horizontal = 300,
            .folder = 7,
            .iconID = -5,
            .script = -1,
            .extendedFlags = 0x40,
            .commentID = -300,
            .putAway = -2,
            .version = 4,
            .accessRights = 0x80,
            .times = {macSeconds(kY2K), macSeconds(kLater), macSeconds(kY2K + 86400)},
            .offsets = {3600, -18000, 0},
            .hfsPath =
                "Macintosh HD:Dokumente:Gr\x9f\xa7"
                "e",                       // "Grüße"
            .comment = "Kommentar \xa5"};  // "•"
}

GWDictionary merged(GWDictionary base, const GWDictionary& more) {
    for (const auto& [key, value] : more) {
        base[key] = value;
    }
    return base;
}

// The first 52 bytes of the sample attributes: the Finder fields.
const GWDictionary kSampleFinderInfo = {{kGWZipFinderFlagsKey, 0x0500u},
                                        {kGWZipVerticalIconLocationKey, 0xFFFEu},
                                        {kGWZipHorizontalIconLocationKey, 300u},
                                        {kGWZipFolderContainingFileKey, 7u},
                                        {kGWZipIconIDKey, -5},
                                        {kGWZipScriptKey, -1},
                                        {kGWZipExtendedFlagsKey, 0x40},
                                        {kGWZipCommentIDKey, -300},
                                        {kGWZipPutAwayFolderKey, -2},
                                        {kGWZipVersionNumberKey, 4u},
                                        {kGWZipAccessRightsKey, 0x80u}};
const GWDictionary kMac3Header = {{kGWZipTypeCodeKey, "TEXT"},
                                  {kGWZipCreatorCodeKey, "ttxt"},
                                  {kGWZipIsResourceForkKey, true},
                                  {kGWZipDontChangeFilenameKey, false}};
// Each date in the zone of its own stored offset.
const GWDictionary kSampleMac3 = merged(merged(kMac3Header, kSampleFinderInfo),
                                        {{kGWZipHFSPathKey, "Macintosh HD:Dokumente:Grüße"},
                                         {kGWZipCommentKey, "Kommentar •"},
                                         {kGWZipUTCCreationDateKey, GWDate(kY2K - 3600)},
                                         {kGWZipUTCModificationDateKey, GWDate(kLater + 18000)},
                                         {kGWZipUTCBackupDateKey, GWDate(kY2K + 86400)}});

GWDictionary without(GWDictionary info, const std::string& key) {
    info.erase(key);
    return info;
}

GWData mac3(std::uint16_t flags, const GWData& attributes, std::uint16_t method = 8,
            std::optional<std::uint32_t> crc = std::nullopt) {
    return mac3Payload(flags, "TEXT", "ttxt", attributes, method, crc);
}

struct ErrorCode {
    std::string domain;
    std::int64_t code;  // -1: any
};

struct FieldCase {
    std::string name;
    GWData field;
    bool isLocal;
    std::optional<GWDictionary> info;  // none: the field fails with `error`
    ErrorCode error = {};
    std::optional<std::string> logged = {};  // "": nothing at all
};

FieldCase block(std::string name, std::uint16_t id, const GWData& payload, bool isLocal,
                std::optional<GWDictionary> info, ErrorCode error = {},
                std::optional<std::string> logged = {}) {
    return {std::move(name), zipExtraBlock(id, payload), isLocal,
            std::move(info), std::move(error),           std::move(logged)};
}

void PrintTo(const FieldCase& c, std::ostream* out) {
    *out << c.name;
}

const ErrorCode kBadVersion = {kGWZipArchiveErrorDomain, GWZipArchiveUnknownExtraFieldVersionError};
const ErrorCode kCorrupt = {kGWCocoaErrorDomain, GWFileReadCorruptFileError};

std::vector<FieldCase> fieldCases() {
    const GWData badVersion = zipExtraBlock(0x7875, infoZipUnix3GPayload(1, 2, 4, 4, 2));
    const GWData extended1000 = zipExtraBlock(0x5455, extendedTimestampPayload(1, {1000}));
    const GWDictionary mod1000 = {{kGWZipUTCModificationDateKey, GWDate(1000)},
                                  {kGWZipMoreInfoAvailableInLocalHeaderKey, true}};
    const double ntfsZero = -11644473600.0;
    const GWDictionary accessModify = {{kGWZipUTCAccessDateKey, GWDate(kAccess)},
                                       {kGWZipUTCModificationDateKey, GWDate(kModify)}};
    const GWDictionary moreInLocal = {{kGWZipMoreInfoAvailableInLocalHeaderKey, true}};
    const GWDictionary unixLink = {{kGWZipUTCAccessDateKey, GWDate(kAccess)},
                                   {kGWZipUTCModificationDateKey, GWDate(kAfter2038)},
                                   {kGWZipUserIDKey, 501u},
                                   {kGWZipGroupIDKey, 20u},
                                   {kGWZipSymbolicLinkFilenameKey, "../target"}};
    const GWDictionary owner12 = {{kGWZipUserIDKey, 1u}, {kGWZipGroupIDKey, 2u}};
    const std::uint64_t fractional = ntfsTicks(kTime1) + 1234567;  // 0.1234567 s later
    const GWData attributes = mac3AttributeBlock(sampleAttributes(), false, true);
    Mac3Attributes beyond32Bits = sampleAttributes();
    beyond32Bits.times[2] = 0x1'0000'0000ull + macSeconds(kY2K);
    GWData statedSize51 = mac3(0x0004, attributes);
    statedSize51[0] = 51;
    statedSize51[1] = statedSize51[2] = statedSize51[3] = 0;
    const Mac3Attributes sample = sampleAttributes();
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
    SmartZipInfo smartLongName = smart;
    smartLongName.nameLength = 32;  // too long for the field: no name
    const GWDictionary smartInfo = {{kGWZipTypeCodeKey, "PICT"},
                                    {kGWZipCreatorCodeKey, "8BIM"},
                                    {kGWZipFinderFlagsKey, 0x4000u},
                                    {kGWZipVerticalIconLocationKey, 0xFFF0u},
                                    {kGWZipHorizontalIconLocationKey, 64u},
                                    {kGWZipFolderContainingFileKey, 3u},
                                    {kGWZipCreationDateKey, GWDate(kY2K - kZoneOffset)},
                                    {kGWZipModificationDateKey, GWDate(kLater - kZoneOffset)},
                                    {kGWZipScriptKey, 1u},
                                    {kGWZipExtendedFinderFlagsKey, 0x80u},
                                    {kGWZipIsMacBinaryEncodedKey, true}};

    std::vector<FieldCase> cases = {
        // The dispatcher.
        {"Empty", {}, false, GWDictionary{}, {}, ""},
        block("UnknownIsLoggedAndSkipped", 0x1234, {1, 2, 3}, false, GWDictionary{}, {},
              "unknown extra info signature: 0x1234"),
        {"UnknownBesideAKnownOne", concat({zipExtraBlock(0x4453, {1, 2, 3}), extended1000}), false,
         mod1000},
        {"AFailingBlockAloneFails", badVersion, false, std::nullopt, kBadVersion,
         "Unknown version of the Info-ZIP Unix 3G extra field: 2"},
        {"AFailingBlockBesideADecodedOne",
         concat({zipExtraBlock(0x000A, ntfsPayload(ntfsTicks(kTime1), 0, 0)), badVersion}), false,
         GWDictionary{{kGWZipUTCModificationDateKey, GWDate(kTime1)},
                      {kGWZipUTCAccessDateKey, GWDate(ntfsZero)},
                      {kGWZipUTCCreationDateKey, GWDate(ntfsZero)}}},
        {"AFailingBlockBesideAnUnknownOne", concat({zipExtraBlock(0x9999, {}), badVersion}), false,
         std::nullopt, kBadVersion},
        {"LaterBlocksOverwriteEarlierKeys",
         concat({extended1000, zipExtraBlock(0x000A, ntfsPayload(ntfsTicks(kTime2), 0, 0))}), false,
         GWDictionary{{kGWZipUTCModificationDateKey, GWDate(kTime2)},
                      {kGWZipMoreInfoAvailableInLocalHeaderKey, true},
                      {kGWZipUTCAccessDateKey, GWDate(ntfsZero)},
                      {kGWZipUTCCreationDateKey, GWDate(ntfsZero)}}},
        block("PaddingCAFE", 0xCAFE, {}, false, GWDictionary{}, {}, ""),
        block("PaddingA220", 0xA220, {0, 0, 0x10, 0}, false, GWDictionary{}, {}, ""),
        block("PaddingD935", 0xD935, {0, 0, 0x10, 0}, true, GWDictionary{}, {}, ""),
        // Declares mtime, atime and ctime but holds only the flags and mtime.
        {"ABlockLongerThanTheFieldIsCut",
         zipExtraBlock(0x5455, extendedTimestampPayload(7, {1000}), 13), false,
         GWDictionary{{kGWZipUTCModificationDateKey, GWDate(1000)}}},
        {"ATailOfOneByteIsIgnored", concat({extended1000, GWData{0}}), false, mod1000},
        {"ATailOfThreeBytesIsIgnored", concat({extended1000, GWData{0x55, 0x54, 0x05}}), false,
         mod1000},
        // Zip64: the central form gives the offset, the local one both sizes.
        block("Zip64Central", 0x0001, zip64Payload({0x123456789ull, 5}), false,
              GWDictionary{{kGWZipLocalHeaderOffsetKey, 0x123456789ull}}),
        block("Zip64CentralShort", 0x0001, {1, 2, 3, 4}, false, GWDictionary{}),
        block("Zip64Local", 0x0001, zip64Payload({0x100000000ull, 0x80000000ull}), true,
              GWDictionary{{kGWZipUncompressedSizeKey, 0x100000000ull},
                           {kGWZipCompressedSizeKey, 0x80000000ull}}),
        block("Zip64LocalOf15Bytes", 0x0001, cut(zip64Payload({1, 2}), 15), true, GWDictionary{}),
        block("NTFSWithFractions", 0x000A, ntfsPayload(fractional, ntfsTicks(kTime2), ntfsTicks(0)),
              false,
              GWDictionary{{kGWZipUTCModificationDateKey, GWDate(kTime1 + 0.1234567)},
                           {kGWZipUTCAccessDateKey, GWDate(kTime2)},
                           {kGWZipUTCCreationDateKey, GWDate(0)}}),
        block("NTFSCutAfterTheModificationTime", 0x000A, cut(ntfsPayload(fractional, 1, 2), 20),
              false, GWDictionary{{kGWZipUTCModificationDateKey, GWDate(kTime1 + 0.1234567)}}),

        // Unix archivers.
        block("PKWareUnixCentral", 0x000D, unixPayload(kAccess, kAfter2038, 501, 20, "../target"),
              false, unixLink),
        block("PKWareUnixLocal", 0x000D, unixPayload(kAccess, kAfter2038, 501, 20, "../target"),
              true, unixLink),
        block("PKWareUnixWithoutLink", 0x000D, unixPayload(kAccess, kModify, 1, 2), true,
              merged(accessModify, owner12)),
        block("PKWareUnixLinkNotUTF8", 0x000D, unixPayload(kAccess, kModify, 1, 2, "\xff\xfe"),
              true, merged(accessModify, owner12)),
        block("InfoZipUnixOldLocal", 0x5855, unixPayload(kAccess, kModify, 1, 2, "ignored"), true,
              merged(accessModify, owner12)),
        block("InfoZipUnixOldCentral", 0x5855, unixPayload(kAccess, kModify), false,
              merged(accessModify, moreInLocal)),
        block("InfoZipUnixOldLocalTimesOnly", 0x5855, unixPayload(kAccess, kModify), true,
              accessModify),
        block("ExtendedTimestampAll", 0x5455,
              extendedTimestampPayload(0x07, {kModify, kAccess, kAfter2038}), false,
              merged(accessModify, {{kGWZipUTCCreationDateKey, GWDate(kAfter2038)}})),
        block("ExtendedTimestampTwoCentral", 0x5455,
              extendedTimestampPayload(0x03, {kModify, kAccess}), false,
              merged(accessModify, moreInLocal)),
        block("ExtendedTimestampTwoLocal", 0x5455,
              extendedTimestampPayload(0x03, {kModify, kAccess}), true, accessModify),
        // Access and creation only: the first time is the access time.
        block("ExtendedTimestampWithoutModification", 0x5455,
              extendedTimestampPayload(0x06, {kAccess, kModify}), true,
              GWDictionary{{kGWZipUTCAccessDateKey, GWDate(kAccess)},
                           {kGWZipUTCCreationDateKey, GWDate(kModify)}}),
        // The central copy Info-ZIP writes: all flags, only the modification
        // time, and no "more info" even though times are missing.
        block("ExtendedTimestampCentralCopy", 0x5455, extendedTimestampPayload(0x07, {kModify}),
              false, GWDictionary{{kGWZipUTCModificationDateKey, GWDate(kModify)}}),
        block("InfoZipUnixNewLocal", 0x7855, infoZipUnixPayload(65534, 100), true,
              GWDictionary{{kGWZipUserIDKey, 65534u}, {kGWZipGroupIDKey, 100u}}),
        block("InfoZipUnixNewCentral", 0x7855, {}, false, moreInLocal),
        block("Unix3GWideCentral", 0x7875, infoZipUnix3GPayload(0x123456789ull, 7, 8, 1), false,
              GWDictionary{{kGWZipUserIDKey, 0x123456789ull}, {kGWZipGroupIDKey, 7u}}),
        block("Unix3GWideLocal", 0x7875, infoZipUnix3GPayload(0x123456789ull, 7, 8, 1), true,
              GWDictionary{{kGWZipUserIDKey, 0x123456789ull}, {kGWZipGroupIDKey, 7u}}),
        block("Unix3GUsual", 0x7875, infoZipUnix3GPayload(1234, 5678), true,
              GWDictionary{{kGWZipUserIDKey, 1234u}, {kGWZipGroupIDKey, 5678u}}),
        // Widths the integer conversion refuses (0, more than 8) give no ID.
        block("Unix3GRefusedWidths", 0x7875, {1, 0, 9, 1, 2, 3, 4, 5, 6, 7, 8, 9}, true,
              GWDictionary{}),
        block("Unix3GUIDPastTheBlock", 0x7875, {1, 4, 1, 2}, true, GWDictionary{}),
        block("UnicodePathCentral", 0x7075, infoZipUnicodePayload("dir/Ünïcödé名.txt"), false,
              GWDictionary{{kGWZipPOSIXPathKey, "dir/Ünïcödé名.txt"}}),
        block("UnicodePathLocal", 0x7075, infoZipUnicodePayload("dir/Ünïcödé名.txt"), true,
              GWDictionary{{kGWZipPOSIXPathKey, "dir/Ünïcödé名.txt"}}),
        block("UnicodePathBadChecksum", 0x7075, infoZipUnicodePayload("name", 0x12345678), false,
              std::nullopt, kCorrupt, "Bad checksum for UTF-8 Path"),
        {"UnicodePathBadChecksumBesideAGoodBlock",
         concat({zipExtraBlock(0x7075, infoZipUnicodePayload("name", 0x12345678)),
                 zipExtraBlock(0x7855, infoZipUnixPayload(1, 2))}),
         true, owner12},
        block("UnicodePathOtherVersion", 0x7075, infoZipUnicodePayload("name", std::nullopt, 2),
              true, std::nullopt, kBadVersion,
              "Unknown version of the Info-ZIP Unix path extra field: 2"),
        block("UnicodePathNotUTF8", 0x7075, infoZipUnicodePayload("\xc3\x28"), true,
              GWDictionary{}),
        block("UnicodeComment", 0x6375, infoZipUnicodePayload("Кommentar ✓"), false,
              GWDictionary{{kGWZipCommentKey, "Кommentar ✓"}}),
        block("UnicodeCommentBadChecksum", 0x6375, infoZipUnicodePayload("note", 1), false,
              std::nullopt, kCorrupt, "Bad checksum for UTF-8 Comment"),
        block("UnicodeCommentEmptyHasCRC0", 0x6375, infoZipUnicodePayload("", 0), false,
              GWDictionary{{kGWZipCommentKey, ""}}),
        block("UnicodeCommentOtherVersion", 0x6375, infoZipUnicodePayload("n", std::nullopt, 0),
              true, std::nullopt, kBadVersion,
              "Unknown version of the Info-ZIP Unix comment extra field: 0"),
        block("ASiUnixLink", 0x756E, asiUnixPayload(0xCAFEBABE, 0120755, 501, 20, "/abs/target"),
              true,
              GWDictionary{{kGWZipCRC32Key, 0xCAFEBABEu},
                           {kGWZipPermissionsModeKey, 0120755u},
                           {kGWZipUserIDKey, 501u},
                           {kGWZipGroupIDKey, 20u},
                           {kGWZipSymbolicLinkFilenameKey, "/abs/target"}}),
        block("ASiUnixRegular", 0x756E, asiUnixPayload(1, 0100644, 2, 3), false,
              GWDictionary{{kGWZipCRC32Key, 1u},
                           {kGWZipPermissionsModeKey, 0100644u},
                           {kGWZipUserIDKey, 2u},
                           {kGWZipGroupIDKey, 3u}}),

        // Mac archivers; local dates are in the zone set above.
        block("JLEE", 0x07C8,
              jleePayload("TEXT", "R*ch", 0x0100, std::uint32_t(macSeconds(kY2K)),
                          std::uint32_t(macSeconds(kLater)), false),
              false,
              GWDictionary{{kGWZipTypeCodeKey, "TEXT"},
                           {kGWZipCreatorCodeKey, "R*ch"},
                           {kGWZipFinderFlagsKey, 0x0100u},
                           {kGWZipCreationDateKey, GWDate(kY2K - kZoneOffset)},
                           {kGWZipModificationDateKey, GWDate(kLater - kZoneOffset)},
                           {kGWZipIsResourceForkKey, true}}),
        block("JLEEDataFork", 0x07C8,
              jleePayload("TEXT", "R*ch", 0, std::uint32_t(macSeconds(kY2K)),
                          std::uint32_t(macSeconds(kY2K)), true),
              true,
              GWDictionary{{kGWZipTypeCodeKey, "TEXT"},
                           {kGWZipCreatorCodeKey, "R*ch"},
                           {kGWZipFinderFlagsKey, 0u},
                           {kGWZipCreationDateKey, GWDate(kY2K - kZoneOffset)},
                           {kGWZipModificationDateKey, GWDate(kY2K - kZoneOffset)},
                           {kGWZipIsResourceForkKey, false}}),
        block("JLEEWrongSignature", 0x07C8, jleePayload("TEXT", "ttxt", 1, 2, 3, false, "JLEF"),
              true, GWDictionary{}),
        block("JLEETooShort", 0x07C8, {'J', 'L'}, true, GWDictionary{}),
        block("ZipItWrongSignature", 0x2605, patched(zipItPayload("n", "TEXT", "ttxt", 1), 0, 'X'),
              true, GWDictionary{}),
        block("ZipIt135WrongSignature", 0x2805, patched(zipIt135Payload(1, true), 3, 'X'), true,
              GWDictionary{}),
        block("SmartZipWrongSignature", 0x4D63, patched(smartZipPayload(smart), 0, 'D'), true,
              GWDictionary{}),
        block("ZipItNamedInMacRoman", 0x2605, zipItPayload("Read\x80Me", "APPL", "\xa5zIt", 0x2000),
              true,
              GWDictionary{{kGWZipFilenameKey, "ReadÄMe"},
                           {kGWZipIsMacBinaryEncodedKey, true},
                           {kGWZipTypeCodeKey, "APPL"},
                           {kGWZipCreatorCodeKey, "•zIt"},
                           {kGWZipFinderFlagsKey, 0x2000u}}),
        block("ZipItShort", 0x2705, zipItPayload(std::nullopt, "TEXT", "ttxt", 0x0400), false,
              GWDictionary{{kGWZipTypeCodeKey, "TEXT"},
                           {kGWZipCreatorCodeKey, "ttxt"},
                           {kGWZipFinderFlagsKey, 0x0400u}}),
        block("ZipItShortWithoutFlags", 0x2705,
              zipItPayload(std::nullopt, "TEXT", "ttxt", std::nullopt), false,
              GWDictionary{{kGWZipTypeCodeKey, "TEXT"}, {kGWZipCreatorCodeKey, "ttxt"}}),
        block("ZipItFolder", 0x2805, zipIt135Payload(0x0010, true), false,
              GWDictionary{{kGWZipFinderFlagsKey, 0x0010u}, {kGWZipAutomaticallyOpenKey, true}}),
        block("ZipItFolderFlagsOnly", 0x2805, cut(zipIt135Payload(0x0010, true), 6), false,
              GWDictionary{{kGWZipFinderFlagsKey, 0x0010u}}),
        block("SmartZip", 0x4D63, smartZipPayload(smart), true,
              merged(smartInfo, {{kGWZipFilenameKey, "Bild ✓"}})),
        block("SmartZipNameTooLong", 0x4D63, smartZipPayload(smartLongName), true, smartInfo),
        // Mac3: only the header centrally; locally the attributes, stored,
        // or compressed with any method the decompressor knows.
        block("Mac3Central", 0x334D, mac3(0x0004, attributes), false,
              merged(kMac3Header, moreInLocal)),
        block("Mac3CentralDataForkKeepingTheName", 0x334D,
              mac3Payload(0x0003, "APPL", "????", std::nullopt), false,
              GWDictionary{{kGWZipTypeCodeKey, "APPL"},
                           {kGWZipCreatorCodeKey, "????"},
                           {kGWZipIsResourceForkKey, false},
                           {kGWZipDontChangeFilenameKey, true},
                           {kGWZipMoreInfoAvailableInLocalHeaderKey, true}}),
        block("Mac3Stored32BitTimes", 0x334D, mac3(0x0004 | 0x0001, attributes), true,
              merged(kSampleMac3, {{kGWZipIsResourceForkKey, false}})),
        block("Mac3Deflated64BitTimes", 0x334D,
              mac3(0x0008, mac3AttributeBlock(beyond32Bits, true, true)), true,
              merged(kSampleMac3, {{kGWZipUTCBackupDateKey, GWDate(kY2K + 4294967296.0)}})),
        block("Mac3WithoutOffsetsUsesTheSystemZone", 0x334D,
              mac3(0x0010, mac3AttributeBlock(sample, false, false)), true,
              merged(kSampleMac3, {{kGWZipUTCCreationDateKey, GWDate(kY2K - kZoneOffset)},
                                   {kGWZipUTCModificationDateKey, GWDate(kLater - kZoneOffset)},
                                   {kGWZipUTCBackupDateKey, GWDate(kY2K + 86400 - kZoneOffset)}})),
        block("Mac3WideWithoutOffsets", 0x334D,
              mac3(0x0018, mac3AttributeBlock(sample, true, false)), true,
              merged(kSampleMac3, {{kGWZipUTCCreationDateKey, GWDate(kY2K - kZoneOffset)},
                                   {kGWZipUTCModificationDateKey, GWDate(kLater - kZoneOffset)},
                                   {kGWZipUTCBackupDateKey, GWDate(kY2K + 86400 - kZoneOffset)}})),
        block("Mac3MethodStored", 0x334D, mac3(0, attributes, 0), true, kSampleMac3),
        block("Mac3MethodDeflate", 0x334D, mac3(0, attributes, 8), true, kSampleMac3),
        block("Mac3MethodBzip2", 0x334D, mac3(0, attributes, 12), true, kSampleMac3),
        block("Mac3BadChecksum", 0x334D, mac3(0, attributes, 8, 0xBAD), true, std::nullopt,
              kCorrupt),
        // Methods that need an entry's size have none here.
        block("Mac3Imploded", 0x334D, mac3(0, attributes, 6), true, std::nullopt,
              {kGWPOSIXErrorDomain, EINVAL}),
        block("Mac3UnknownMethod", 0x334D, mac3(0, attributes, 98), true, std::nullopt,
              {kGWZipArchiveErrorDomain, GWZipArchiveUnsupportedCompressionMethodError}),
        block("Mac3DamagedDeflate", 0x334D,
              cut(mac3(0, attributes, 8), mac3(0, attributes).size() - 8), true, std::nullopt,
              {"", -1}),
        block("Mac3AttributesOf51Bytes", 0x334D, mac3(0x0004, cut(attributes, 51)), true,
              kMac3Header),
        block("Mac3AttributesOf52Bytes", 0x334D, mac3(0x0004, cut(attributes, 52)), true,
              merged(merged(kMac3Header, kSampleFinderInfo),
                     {{kGWZipUTCCreationDateKey, GWDate(kY2K - 3600)},
                      {kGWZipUTCModificationDateKey, GWDate(kLater + 18000)},
                      {kGWZipUTCBackupDateKey, GWDate(kY2K + 86400)}})),
        block("Mac3StatedSizeLimitsAStoredBlock", 0x334D, statedSize51, true, kMac3Header),
        // Without the comment and both zero bytes the path runs to the end.
        block("Mac3StringsWithoutTerminators", 0x334D,
              mac3(0x0004, cut(attributes, attributes.size() - sample.comment.size() - 2)), true,
              without(merged(kSampleMac3, {{kGWZipIsResourceForkKey, true}}), kGWZipCommentKey)),
    };
    return cases;
}

std::string describe(const GWDictionary& info) {
    return GWValue(info).description();
}

// Dates compare to the microsecond (NTFS fractions), everything else exactly.
bool sameInfo(const GWDictionary& a, const GWDictionary& b) {
    if (a.size() != b.size()) {
        return false;
    }
    for (const auto& [key, value] : a) {
        const GWValue* other = GWDictionaryValue(b, key);
        if (!other) {
            return false;
        }
        if (value.date() && other->date()) {
            if (std::fabs(value.date()->timeIntervalSince1970() -
                          other->date()->timeIntervalSince1970()) > 1e-6) {
                return false;
            }
        } else if (!(value == *other)) {
            return false;
        }
    }
    return true;
}

class GWZipExtraField : public ::testing::TestWithParam<FieldCase> {
protected:
    ScopedTimeZone zone{kZone};
    std::shared_ptr<GWZipWorkOperation> operation = std::make_shared<GWZipWorkOperation>();
    ZipLogCapture log;
};

TEST_P(GWZipExtraField, DecodesToItsInformationOrError) {
    const FieldCase& c = GetParam();
    GWErrorPtr error;
    auto info = operation->infoFromExtraFieldData(c.field, c.isLocal, &error);
    if (c.info) {
        ASSERT_TRUE(info) << error->localizedDescription();
        EXPECT_TRUE(sameInfo(*info, *c.info)) << describe(*info) << "\nexpected\n"
                                              << describe(*c.info);
    } else {
        ASSERT_FALSE(info) << describe(*info);
        ASSERT_NE(error, nullptr);
        if (!c.error.domain.empty()) {
            EXPECT_TRUE(error->is(c.error.domain, c.error.code)) << error->localizedDescription();
        }
    }
    if (c.logged && c.logged->empty()) {
        EXPECT_TRUE(log.lines().empty());
    } else if (c.logged) {
        EXPECT_TRUE(log.contains(*c.logged));
    }
}

INSTANTIATE_TEST_SUITE_P(EveryKind, GWZipExtraField, ::testing::ValuesIn(fieldCases()),
                         [](const auto& info) { return info.param.name; });

// Every kind of block, cut at every length and in both header kinds, with
// the block's bytes in an allocation of exactly that size: the sanitizer
// build reports any read past it.
TEST(GWZipExtraFieldBounds, TruncatedBlocksNeverReadOutside) {
    auto operation = std::make_shared<GWZipWorkOperation>();
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

}  // namespace
