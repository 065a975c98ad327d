#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "foundation/GWValue.h"

namespace gwtest {

// The contents of an AppleDouble file as Mac OS X writes it: Finder
// information with the extended attributes in an "ATTR" block behind it, the
// resource fork, and optionally a comment entry.
struct AppleDoubleFile {
    GWData finderInfo = GWData(32, 0);
    std::vector<std::pair<std::string, GWData>> attributes;
    GWData resourceFork;
    std::optional<std::string> comment;
    bool withAttributeHeader = true;
};

// Where the parts went, for tests that corrupt them.
struct AppleDoubleLayout {
    std::size_t entryCount = 0;
    std::size_t finderInfoOffset = 0;
    std::size_t finderInfoLength = 0;
    std::size_t attributeHeaderOffset = 0;  // the "ATTR" magic
    std::size_t firstAttributeEntryOffset = 0;
    std::size_t resourceForkOffset = 0;

    static constexpr std::size_t entryOffset(std::size_t index) { return 26 + 12 * index; }
};

// Mac OS X leaves room up to offset 0xEE2 for attributes; so does this builder.
GWData buildAppleDouble(const AppleDoubleFile& file, AppleDoubleLayout* layout = nullptr);

// 32 bytes of Finder information.
GWData finderInfoBytes(const std::string& type, const std::string& creator, std::uint16_t flags = 0,
                       std::uint16_t vertical = 0, std::uint16_t horizontal = 0);

// Big-endian stores for corrupting built files.
void storeBE32(GWData& bytes, std::size_t at, std::uint32_t value);
void storeBE16(GWData& bytes, std::size_t at, std::uint16_t value);

}  // namespace gwtest
