#pragma once

#include <cstddef>
#include <cstdint>

// The end-of-central-directory record, normalised from either the classic or
// the Zip64 form (fields the source lacks stay zero).
struct GWZipEndOfCentralDirectoryRecord {
    static constexpr std::uint32_t kSignature = 0x06054B50;              // "PK" 05 06
    static constexpr std::uint32_t kZip64Signature = 0x06064B50;         // "PK" 06 06
    static constexpr std::uint32_t kZip64LocatorSignature = 0x07064B50;  // "PK" 06 07
    static constexpr std::size_t kLength = 22;
    static constexpr std::size_t kZip64Length = 56;
    static constexpr std::size_t kZip64LocatorLength = 20;

    std::uint32_t signature = 0;
    std::uint16_t versionMadeBy = 0;
    std::uint16_t versionNeeded = 0;
    std::uint32_t diskNumber = 0;
    std::uint32_t centralDirectoryDisk = 0;
    std::uint64_t entriesOnDisk = 0;
    std::uint64_t totalEntries = 0;
    std::uint64_t centralDirectorySize = 0;
    std::uint64_t centralDirectoryOffset = 0;
    std::uint16_t commentLength = 0;
};

// The fixed part of a central directory record, normalised.
struct GWZipCentralDirectoryRecord {
    static constexpr std::uint32_t kSignature = 0x02014B50;  // "PK" 01 02
    static constexpr std::size_t kLength = 46;

    std::uint32_t signature = 0;
    std::uint16_t versionMadeBy = 0;
    std::uint16_t versionNeeded = 0;
    std::uint16_t generalPurposeFlags = 0;
    std::uint16_t compressionMethod = 0;
    std::uint16_t modificationTime = 0;  // MS-DOS time
    std::uint16_t modificationDate = 0;  // MS-DOS date
    std::uint32_t crc32 = 0;
    std::uint64_t compressedSize = 0;
    std::uint64_t uncompressedSize = 0;
    std::uint16_t filenameLength = 0;
    std::uint16_t extraFieldLength = 0;
    std::uint16_t commentLength = 0;
    std::uint16_t diskNumberStart = 0;
    std::uint16_t internalAttributes = 0;
    std::uint32_t externalAttributes = 0;
    std::uint64_t localHeaderOffset = 0;
};

// Host systems ("version made by", high byte) the loader treats specially.
enum GWZipHostSystem : std::uint8_t {
    GWZipHostMSDOS = 0,
    GWZipHostVMCMS = 4,
    GWZipHostUnix = 3,
    GWZipHostOS2HPFS = 6,
    GWZipHostMacintosh = 7,
    GWZipHostNTFS = 10,
    GWZipHostMVS = 11,
    GWZipHostAcorn = 13,
    GWZipHostAlternateMVS = 15,
    GWZipHostOSX = 19,
};

// A 32-bit field holding this defers to a Zip64 value.
inline constexpr std::uint64_t kGWZip32BitSentinel = 0xFFFFFFFF;
