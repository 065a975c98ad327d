#pragma once

#include <cstdint>
#include <string>

#include "foundation/GWValue.h"

namespace gwtest {

// Check values of 0x8000 and more never match in the library's reader (it
// compares them as signed numbers), so a sealed header is made to come out
// below that unless a test asks for one above.
enum class MacBinarySeal { matching, fromx8000 };

// A classic Mac file to encode as MacBinary.
struct MacBinaryFile {
    int version = 2;  // 1, 2 or 3
    std::string name = "Example";
    std::string type = "TEXT";
    std::string creator = "ttxt";
    std::uint16_t finderFlags = 0;  // high byte at 73, low byte at 101
    std::uint8_t extendedFinderFlags = 0;
    std::uint16_t verticalPosition = 0;
    std::uint16_t horizontalPosition = 0;
    std::uint32_t creationDate = 0;  // seconds since 1904-01-01 00:00:00
    std::uint32_t modificationDate = 0;
    GWData dataFork;
    GWData resourceFork;
    std::string comment;  // versions II and III
    GWData secondaryHeader;
    std::uint8_t writerVersion = 129;  // byte 122
    std::uint8_t readerVersion = 129;  // byte 123
    MacBinarySeal seal = MacBinarySeal::matching;
};

// How forks are padded. Standard files pad to the next multiple of 128 (none
// after a fork that already ends on one); the library's reader always skips
// 128 - length % 128 bytes, so files for it pad a full block after such a fork.
enum class MacBinaryPadding { standard, fullBlockAfterAlignedFork };

// The 128-byte header. Versions II and III carry the CRC of bytes 1 to 123 at
// 124; version I leaves it zero.
GWData macBinaryHeader(const MacBinaryFile& file);

GWData buildMacBinary(const MacBinaryFile& file,
                      MacBinaryPadding padding = MacBinaryPadding::fullBlockAfterAlignedFork);

// Header fields, for tests that corrupt them.
namespace macbinary {
inline constexpr std::size_t kNameLength = 1;
inline constexpr std::size_t kZeroByte74 = 74;
inline constexpr std::size_t kZeroByte82 = 82;
inline constexpr std::size_t kWriterVersion = 122;
inline constexpr std::size_t kReaderVersion = 123;
inline constexpr std::size_t kCRC = 124;
}  // namespace macbinary

// Rewrites the CRC at 124 to match the header's bytes 1 to 123, changing the
// unused last byte of the name field (64) until the CRC falls on the asked
// side of 0x8000.
void resealMacBinaryHeader(GWData& bytes, MacBinarySeal seal = MacBinarySeal::matching);

}  // namespace gwtest
