// Extra fields of classic Mac archivers: Finder information, dates and names.

#include "GWZipExtraInfoKeys.h"
#include "GWZipFieldReader.h"
#include "GWZipWorkOperation.h"
#include "foundation/GWChecksum.h"
#include "foundation/GWConversions.h"

namespace {

// A decompressed attribute block holds Finder information, three dates and
// two short strings; anything much larger is not one.
constexpr std::size_t kMaxMac3AttributeBlock = 1 << 20;
constexpr std::size_t kMinMac3AttributeBlock = 52;

void setFourCharCode(GWDictionary& info, const char* key, std::optional<std::uint32_t> code) {
    if (code) {
        info.insert_or_assign(key, GWValue(GWStringWithFourCharCode(*code)));
    }
}

void setMacRoman(GWDictionary& info, const char* key,
                 std::optional<std::span<const std::uint8_t>> bytes) {
    if (bytes) {
        info.insert_or_assign(key, GWValue(GWZipMacRomanString(*bytes)));
    }
}

void setLocalMacTime(GWDictionary& info, const char* key, std::optional<std::uint32_t> seconds) {
    if (seconds) {
        info.insert_or_assign(key, GWValue(GWZipDateFromMacTime(*seconds)));
    }
}

GWErrorPtr corruptAttributeBlock(const char* format, unsigned long a, unsigned long b) {
    return GWGenerateError(kGWCocoaErrorDomain, GWFileReadCorruptFileError, std::nullopt, nullptr,
                           {}, format, a, b);
}

// The Finder information, dates and strings of a Mac3 attribute block.
void decodeMac3Attributes(std::span<const std::uint8_t> attributes, std::uint16_t flags,
                          GWDictionary& info) {
    const GWZipFieldReader block(attributes, attributes.size());
    GWZipSetInfo(info, kGWZipFinderFlagsKey, block.u16le(0));
    GWZipSetInfo(info, kGWZipVerticalIconLocationKey, block.u16le(2));
    GWZipSetInfo(info, kGWZipHorizontalIconLocationKey, block.u16le(4));
    GWZipSetInfo(info, kGWZipFolderContainingFileKey, block.u16le(6));
    GWZipSetInfo(info, kGWZipIconIDKey, block.s16le(8));
    GWZipSetInfo(info, kGWZipScriptKey, block.s8(16));
    GWZipSetInfo(info, kGWZipExtendedFlagsKey, block.s8(17));
    GWZipSetInfo(info, kGWZipCommentIDKey, block.s16le(18));
    GWZipSetInfo(info, kGWZipPutAwayFolderKey, block.s32le(20));
    GWZipSetInfo(info, kGWZipVersionNumberKey, block.u8(24));
    GWZipSetInfo(info, kGWZipAccessRightsKey, block.u8(25));

    const bool wideTimes = flags & 0x0008;
    const bool hasOffsets = !(flags & 0x0010);
    const std::size_t width = wideTimes ? 8 : 4;
    const std::size_t offsetsStart = 26 + 3 * width;
    const char* const keys[] = {kGWZipUTCCreationDateKey, kGWZipUTCModificationDateKey,
                                kGWZipUTCBackupDateKey};
    for (std::size_t i = 0; i < 3; ++i) {
        const std::size_t at = 26 + i * width;
        const std::optional<std::uint64_t> seconds =
            wideTimes ? block.u64le(at) : std::optional<std::uint64_t>(block.u32le(at));
        if (!seconds) {
            continue;
        }
        // Each date carries its own offset from UTC; without one the
        // system's zone is the best guess.
        std::optional<GWTimeZone> zone;
        if (hasOffsets) {
            if (auto offset = block.s32le(offsetsStart + 4 * i)) {
                zone = GWTimeZone{*offset};
            }
        }
        info.insert_or_assign(keys[i], GWValue(GWZipDateFromMacTime(*seconds, zone)));
    }

    // Two bytes sit between the times (or offsets) and the path, unread.
    const std::size_t pathStart = offsetsStart + (hasOffsets ? 14 : 2);
    std::size_t next = 0;
    auto path = block.zeroTerminatedBytes(pathStart, &next);
    setMacRoman(info, kGWZipHFSPathKey, path);
    if (path && next < block.size()) {
        setMacRoman(info, kGWZipCommentKey, block.zeroTerminatedBytes(next, nullptr));
    }
}

}  // namespace

std::optional<GWDictionary> GWZipWorkOperation::infoFromJLEEMacExtraField(
    std::span<const std::uint8_t> data, std::size_t length, GWErrorPtr*) const {
    const GWZipFieldReader field(data, length);
    GWDictionary info;
    if (!field.hasSignature("JLEE")) {
        return info;
    }
    setFourCharCode(info, kGWZipTypeCodeKey, field.u32be(4));
    setFourCharCode(info, kGWZipCreatorCodeKey, field.u32be(8));
    GWZipSetInfo(info, kGWZipFinderFlagsKey, field.u16be(12));
    setLocalMacTime(info, kGWZipCreationDateKey, field.u32be(22));
    setLocalMacTime(info, kGWZipModificationDateKey, field.u32be(26));
    if (auto forkFlags = field.u8(33)) {
        // Bit 0 set marks the data fork.
        info.insert_or_assign(kGWZipIsResourceForkKey, GWValue((*forkFlags & 0x01) == 0));
    }
    return info;
}

std::optional<GWDictionary> GWZipWorkOperation::infoFromZipItExtraField(
    std::span<const std::uint8_t> data, std::size_t length, bool isOldFormat, GWErrorPtr*) const {
    const GWZipFieldReader field(data, length);
    GWDictionary info;
    if (!field.hasSignature("ZPIT")) {
        return info;
    }
    std::size_t p = 4;
    if (isOldFormat) {
        // The long form names the file and stores its data as MacBinary.
        const std::size_t nameLength = field.u8(4).value_or(0);
        setMacRoman(info, kGWZipFilenameKey, field.bytes(5, nameLength));
        info.insert_or_assign(kGWZipIsMacBinaryEncodedKey, GWValue(true));
        p = 5 + nameLength;
    }
    setMacRoman(info, kGWZipTypeCodeKey, field.bytes(p, 4));
    setMacRoman(info, kGWZipCreatorCodeKey, field.bytes(p + 4, 4));
    GWZipSetInfo(info, kGWZipFinderFlagsKey, field.u16be(p + 8));
    return info;
}

std::optional<GWDictionary> GWZipWorkOperation::infoFromZipIt135DirExtraField(
    std::span<const std::uint8_t> data, std::size_t length, GWErrorPtr*) const {
    const GWZipFieldReader field(data, length);
    GWDictionary info;
    if (!field.hasSignature("ZPIT")) {
        return info;
    }
    GWZipSetInfo(info, kGWZipFinderFlagsKey, field.u16be(4));
    if (auto folderFlags = field.u8(7)) {
        info.insert_or_assign(kGWZipAutomaticallyOpenKey, GWValue((*folderFlags & 0x01) != 0));
    }
    return info;
}

std::optional<GWDictionary> GWZipWorkOperation::infoFromSmartZipExtraField(
    std::span<const std::uint8_t> data, std::size_t length, GWErrorPtr*) const {
    const GWZipFieldReader field(data, length);
    GWDictionary info;
    if (!field.hasSignature("dZip")) {
        return info;
    }
    setMacRoman(info, kGWZipTypeCodeKey, field.bytes(4, 4));
    setMacRoman(info, kGWZipCreatorCodeKey, field.bytes(8, 4));
    GWZipSetInfo(info, kGWZipFinderFlagsKey, field.u16be(12));
    GWZipSetInfo(info, kGWZipVerticalIconLocationKey, field.u16be(14));
    GWZipSetInfo(info, kGWZipHorizontalIconLocationKey, field.u16be(16));
    GWZipSetInfo(info, kGWZipFolderContainingFileKey, field.u16be(18));
    setLocalMacTime(info, kGWZipCreationDateKey, field.u32be(20));
    setLocalMacTime(info, kGWZipModificationDateKey, field.u32be(24));
    GWZipSetInfo(info, kGWZipScriptKey, field.u8(29));
    GWZipSetInfo(info, kGWZipExtendedFinderFlagsKey, field.u8(31));
    if (auto nameLength = field.u8(32); nameLength && *nameLength < 32) {
        if (auto name = field.bytes(33, *nameLength)) {
            GWZipSetInfo(info, kGWZipFilenameKey, GWZipFileSystemString(*name));
        }
    }
    // SmartZIP always stores MacBinary data.
    info.insert_or_assign(kGWZipIsMacBinaryEncodedKey, GWValue(true));
    return info;
}

std::optional<GWData> GWZipWorkOperation::mac3AttributeBlock(std::span<const std::uint8_t> block,
                                                             std::uint32_t statedSize,
                                                             std::uint16_t flags,
                                                             GWErrorPtr* error) const {
    const GWZipFieldReader field(block, block.size());
    if (flags & 0x0004) {
        const auto stored = field.bytesFrom(14);
        return GWData(stored.begin(),
                      stored.begin() + std::min<std::size_t>(statedSize, stored.size()));
    }
    const auto method = field.u16le(14);
    const auto storedCRC = field.u32le(16);
    if (!method || !storedCRC) {
        return GWData();  // too short to hold an attribute block
    }
    auto decompressor = decompressorForFile(nullptr, *method, error);
    if (!decompressor) {
        return std::nullopt;
    }
    GWData attributes;
    std::span<const std::uint8_t> input = field.bytesFrom(20);
    bool runAgain = true;
    for (int idleSteps = 0; runAgain;) {
        runAgain = false;
        auto piece =
            decompressor->decompressedDataFromStreamWithInputData(input, true, &runAgain, error);
        if (!piece) {
            return std::nullopt;
        }
        input = {};
        if (attributes.size() + piece->size() > kMaxMac3AttributeBlock) {
            GWFail(error, corruptAttributeBlock("Mac attribute block expands past %lu bytes (%lu)",
                                                kMaxMac3AttributeBlock,
                                                attributes.size() + piece->size()));
            return std::nullopt;
        }
        // A decoder that keeps asking without giving anything is stuck.
        idleSteps = piece->empty() ? idleSteps + 1 : 0;
        if (idleSteps > 64) {
            GWFail(error, corruptAttributeBlock("Mac attribute block: decoder stalled after %lu "
                                                "bytes (method %lu)",
                                                attributes.size(), *method));
            return std::nullopt;
        }
        attributes.insert(attributes.end(), piece->begin(), piece->end());
    }
    const GWData digest = GWChecksum::checksumForData(attributes, GWChecksumAlgorithmCRC32);
    const GWZipFieldReader digestField(digest, digest.size());
    const std::uint32_t computed = digestField.u32le(0).value_or(0);
    if (computed != *storedCRC) {
        GWFail(error, corruptAttributeBlock("Mac attribute block: CRC-32 0x%08lx stored, 0x%08lx "
                                            "computed",
                                            *storedCRC, computed));
        return std::nullopt;
    }
    return attributes;
}

std::optional<GWDictionary> GWZipWorkOperation::infoFromMac3ExtraField(
    std::span<const std::uint8_t> data, std::size_t length, bool isLocalHeader,
    GWErrorPtr* error) const {
    const GWZipFieldReader field(data, length);
    GWDictionary info;
    const auto statedSize = field.u32le(0);
    const auto flags = field.u16le(4);
    setMacRoman(info, kGWZipTypeCodeKey, field.bytes(6, 4));
    setMacRoman(info, kGWZipCreatorCodeKey, field.bytes(10, 4));
    if (flags) {
        info.insert_or_assign(kGWZipIsResourceForkKey, GWValue((*flags & 0x0001) == 0));
        info.insert_or_assign(kGWZipDontChangeFilenameKey, GWValue((*flags & 0x0002) != 0));
    }
    if (!isLocalHeader) {
        // The central copy holds only the header; the attributes are local.
        info.insert_or_assign(kGWZipMoreInfoAvailableInLocalHeaderKey, GWValue(true));
        return info;
    }
    if (!statedSize || !flags) {
        return info;
    }
    auto attributes = mac3AttributeBlock(field.block(), *statedSize, *flags, error);
    if (!attributes) {
        return std::nullopt;
    }
    if (attributes->size() >= kMinMac3AttributeBlock) {
        decodeMac3Attributes(*attributes, *flags, info);
    }
    return info;
}
