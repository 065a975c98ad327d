#include "AppleDoubleBuilder.h"

#include <algorithm>
#include <stdexcept>

namespace gwtest {
namespace {

constexpr std::size_t kMacOSXAttributeAreaEnd = 0xEE2;

void append32(GWData& out, std::uint32_t value) {
    for (int shift = 24; shift >= 0; shift -= 8) {
        out.push_back(std::uint8_t(value >> shift));
    }
}

void append16(GWData& out, std::uint16_t value) {
    out.push_back(std::uint8_t(value >> 8));
    out.push_back(std::uint8_t(value));
}

}  // namespace

void storeBE32(GWData& bytes, std::size_t at, std::uint32_t value) {
    for (int i = 0; i < 4; ++i) {
        bytes.at(at + std::size_t(i)) = std::uint8_t(value >> (24 - 8 * i));
    }
}

void storeBE16(GWData& bytes, std::size_t at, std::uint16_t value) {
    bytes.at(at) = std::uint8_t(value >> 8);
    bytes.at(at + 1) = std::uint8_t(value);
}

GWData finderInfoBytes(const std::string& type, const std::string& creator, std::uint16_t flags,
                       std::uint16_t vertical, std::uint16_t horizontal) {
    if (type.size() != 4 || creator.size() != 4) {
        throw std::invalid_argument("four-character codes expected");
    }
    // Filled in place: growing the vector from a 4-byte start trips a false
    // array-bounds warning in g++ 12 at -O3.
    GWData info(32, 0);
    std::copy(type.begin(), type.end(), info.begin());
    std::copy(creator.begin(), creator.end(), info.begin() + 4);
    storeBE16(info, 8, flags);
    storeBE16(info, 10, vertical);
    storeBE16(info, 12, horizontal);
    return info;
}

GWData buildAppleDouble(const AppleDoubleFile& file, AppleDoubleLayout* layoutOut) {
    if (file.finderInfo.size() != 32) {
        throw std::invalid_argument("Finder information has 32 bytes");
    }
    AppleDoubleLayout layout;
    layout.entryCount = file.comment ? 3 : 2;
    layout.finderInfoOffset = 26 + 12 * layout.entryCount;

    // The Finder information entry: 32 bytes, 2 of padding, then the attributes.
    GWData finder = file.finderInfo;
    finder.resize(34);
    if (file.withAttributeHeader) {
        const std::size_t entriesStart = layout.finderInfoOffset + 34 + 36;
        std::size_t dataStart = entriesStart;
        std::size_t dataLength = 0;
        for (const auto& [name, value] : file.attributes) {
            dataStart += (11 + name.size() + 1 + 3) & ~std::size_t(3);
            dataLength += value.size();
        }
        const std::size_t dataEnd = std::max(dataStart + dataLength, kMacOSXAttributeAreaEnd);
        layout.attributeHeaderOffset = layout.finderInfoOffset + 34;
        layout.firstAttributeEntryOffset = entriesStart;
        finder.insert(finder.end(), {'A', 'T', 'T', 'R'});
        append32(finder, 0);  // debug tag
        append32(finder, std::uint32_t(dataEnd));
        append32(finder, std::uint32_t(dataStart));
        append32(finder, std::uint32_t(dataLength));
        finder.resize(finder.size() + 12 + 2);  // reserved, flags
        append16(finder, std::uint16_t(file.attributes.size()));
        std::size_t valueOffset = dataStart;
        for (const auto& [name, value] : file.attributes) {
            const std::size_t start = finder.size();
            append32(finder, std::uint32_t(valueOffset));
            append32(finder, std::uint32_t(value.size()));
            append16(finder, 0);
            finder.push_back(std::uint8_t(name.size() + 1));
            finder.insert(finder.end(), name.begin(), name.end());
            finder.push_back(0);
            finder.resize(start + ((11 + name.size() + 1 + 3) & ~std::size_t(3)));
            valueOffset += value.size();
        }
        for (const auto& attribute : file.attributes) {
            finder.insert(finder.end(), attribute.second.begin(), attribute.second.end());
        }
        finder.resize(dataEnd - layout.finderInfoOffset);
    } else {
        finder.resize(32);
    }
    layout.finderInfoLength = finder.size();
    layout.resourceForkOffset = layout.finderInfoOffset + finder.size();
    const std::size_t commentOffset = layout.resourceForkOffset + file.resourceFork.size();

    GWData out;
    append32(out, 0x00051607);
    append32(out, 0x00020000);
    const std::string filler = "Mac OS X        ";
    out.insert(out.end(), filler.begin(), filler.end());
    append16(out, std::uint16_t(layout.entryCount));
    append32(out, 9);
    append32(out, std::uint32_t(layout.finderInfoOffset));
    append32(out, std::uint32_t(finder.size()));
    append32(out, 2);
    append32(out, std::uint32_t(layout.resourceForkOffset));
    append32(out, std::uint32_t(file.resourceFork.size()));
    if (file.comment) {
        // After the fork, unlike the library's own side files, so readers meet both orders.
        append32(out, 4);
        append32(out, std::uint32_t(commentOffset));
        append32(out, std::uint32_t(file.comment->size()));
    }
    out.insert(out.end(), finder.begin(), finder.end());
    out.insert(out.end(), file.resourceFork.begin(), file.resourceFork.end());
    if (file.comment) {
        out.insert(out.end(), file.comment->begin(), file.comment->end());
    }
    if (layoutOut) {
        *layoutOut = layout;
    }
    return out;
}

}  // namespace gwtest
