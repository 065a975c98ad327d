#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "GWError.h"
#include "GWValue.h"

// The AppleDouble layout as Mac OS X writes it: a header, a table of entries,
// the Finder information entry with the extended attributes in an "ATTR"
// block behind it, and the resource fork. Both the AppleDouble merger and the
// metadata store's side files go through this one reader and writer.

inline constexpr std::uint32_t kGWAppleDoubleMagic = 0x00051607;
inline constexpr std::uint32_t kGWAppleDoubleVersion = 0x00020000;
inline constexpr std::size_t kGWFinderInfoLength = 32;

// Entry identifiers of the entry table.
enum GWAppleDoubleEntryID : std::uint32_t {
    GWAppleDoubleDataForkEntry = 1,
    GWAppleDoubleResourceForkEntry = 2,
    GWAppleDoubleCommentEntry = 4,
    GWAppleDoubleFinderInfoEntry = 9,
};

// The Finder information entry and the comment are held in memory, so they
// are capped; only the resource fork may be larger.
inline constexpr std::uint64_t kGWAppleDoubleMetadataLimit = 16 * 1024 * 1024;

struct GWAppleDoubleAttribute {
    std::string name;
    GWData value;
};

struct GWAppleDoubleContents {
    std::optional<GWData> finderInfo;  // kGWFinderInfoLength bytes
    std::vector<GWAppleDoubleAttribute> attributes;
    std::optional<GWData> comment;
    // The resource fork is located rather than read: it can be large.
    struct Extent {
        std::uint64_t offset = 0;
        std::uint64_t length = 0;
        std::size_t tableIndex = 0;
    };
    std::optional<Extent> resourceFork;

    const GWAppleDoubleAttribute* attribute(const std::string& name) const;
};

// Reads the AppleDouble file open at `fd`. Every offset and length is checked
// against the file before anything is read or allocated; a malformed file
// fails with POSIX EINVAL and a description naming the offending part, a
// failing read with its error number.
bool GWReadAppleDouble(int fd, GWAppleDoubleContents& contents, GWErrorPtr* error);

// The bytes of an AppleDouble file holding `contents` (Finder information,
// attributes, comment) up to the resource fork, which is the last entry, is
// `resourceForkLength` bytes long and starts at the end of the returned bytes.
GWData GWAppleDoubleBytesBeforeResourceFork(const GWAppleDoubleContents& contents,
                                            std::uint32_t resourceForkLength);

// Where the length field of entry `tableIndex` lies, for growing the last
// entry in place.
inline constexpr std::uint64_t GWAppleDoubleEntryLengthOffset(std::size_t tableIndex) {
    return 26 + 12 * std::uint64_t(tableIndex) + 8;
}
