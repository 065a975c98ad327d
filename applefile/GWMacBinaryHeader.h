#pragma once

#include <cstddef>
#include <cstdint>
#include <span>

#include "foundation/GWError.h"
#include "foundation/GWURL.h"

inline constexpr std::size_t kGWMacBinaryHeaderLength = 128;

struct GWMacBinaryHeader {
    int version = 1;  // 1, 2 or 3
    std::uint32_t typeCode = 0;
    std::uint32_t creatorCode = 0;
    std::uint16_t finderFlags = 0;  // the low byte only from versions II and III
    std::uint16_t extendedFinderFlags = 0;
    std::uint16_t verticalPosition = 0;
    std::uint16_t horizontalPosition = 0;
    std::uint32_t dataForkLength = 0;
    std::uint32_t resourceForkLength = 0;
    std::uint32_t creationDate = 0;  // seconds since 1904-01-01 00:00:00, local time
    std::uint32_t modificationDate = 0;
    std::uint16_t commentLength = 0;
    std::uint16_t secondaryHeaderLength = 0;
};

// CRC-16 with the CCITT polynomial 0x1021, initial value 0, no final inversion.
std::uint16_t GWMacBinaryCRC16(std::span<const std::uint8_t> bytes);

// Reads the 128-byte header and tells the version. A header that is not
// MacBinary fails with Cocoa error 259 naming `source`; a version newer than
// this reader knows is logged and fails with Cocoa error 259 without a location.
bool GWParseMacBinaryHeader(std::span<const std::uint8_t, kGWMacBinaryHeaderLength> bytes,
                            const GWURL& source, GWMacBinaryHeader& header, GWErrorPtr* error);
