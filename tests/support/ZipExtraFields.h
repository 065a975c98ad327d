#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "foundation/GWValue.h"

// Extra-field blocks of each kind the ZIP reader decodes, for ZipBuilder
// entries and for the decoders directly. Payload builders return the block
// data only; zipExtraBlock puts the 4-byte header in front.
namespace gwtest {

// ID, size (the payload's, unless `declaredSize` says otherwise), payload.
GWData zipExtraBlock(std::uint16_t headerID, const GWData& payload,
                     std::optional<std::uint16_t> declaredSize = std::nullopt);
GWData concat(const std::vector<GWData>& pieces);

// 0x0001: the 64-bit values, in order.
GWData zip64Payload(const std::vector<std::uint64_t>& values);
// 0x000A: reserved word, attribute 1 of 24 bytes with the three tick counts.
GWData ntfsPayload(std::uint64_t modified, std::uint64_t accessed, std::uint64_t created);
// 0x000D and 0x5855: access and modification time, then (when given) the
// 16-bit owner and group and any trailing bytes (0x000D: a link target).
GWData unixPayload(std::uint32_t accessed, std::uint32_t modified,
                   std::optional<std::uint16_t> uid = std::nullopt,
                   std::optional<std::uint16_t> gid = std::nullopt, const std::string& tail = "");
// 0x5455: the flags byte, then the given times.
GWData extendedTimestampPayload(std::uint8_t flags, const std::vector<std::uint32_t>& times);
// 0x7855 local form.
GWData infoZipUnixPayload(std::uint16_t uid, std::uint16_t gid);
// 0x7875: version, then each ID with its width.
GWData infoZipUnix3GPayload(std::uint64_t uid, std::uint64_t gid, std::uint8_t uidSize = 4,
                            std::uint8_t gidSize = 4, std::uint8_t version = 1);
// 0x7075 and 0x6375: version, CRC-32 (of `text` unless given), UTF-8 text.
GWData infoZipUnicodePayload(const std::string& text, std::optional<std::uint32_t> crc = {},
                             std::uint8_t version = 1);
// 0x756E
GWData asiUnixPayload(std::uint32_t crc, std::uint16_t mode, std::uint16_t uid, std::uint16_t gid,
                      const std::string& linkTarget = "");
// 0x07C8: "JLEE", type, creator, Finder flags, dates (Mac seconds) and the
// fork flag byte (bit 0 set: data fork).
GWData jleePayload(const std::string& type, const std::string& creator, std::uint16_t finderFlags,
                   std::uint32_t created, std::uint32_t modified, bool isDataFork,
                   const std::string& signature = "JLEE");
// 0x2605 (with `name`) and 0x2705 (without).
GWData zipItPayload(const std::optional<std::string>& name, const std::string& type,
                    const std::string& creator, std::optional<std::uint16_t> finderFlags);
// 0x2805
GWData zipIt135Payload(std::uint16_t finderFlags, bool automaticallyOpen);
// 0x4D63
struct SmartZipInfo {
    std::string type = "TEXT", creator = "ttxt";
    std::uint16_t finderFlags = 0, vertical = 0, horizontal = 0, folder = 0;
    std::uint32_t created = 0, modified = 0;
    std::uint8_t script = 0, extendedFlags = 0;
    std::string name;
    std::optional<std::uint8_t> nameLength;  // overrides name.size()
};
GWData smartZipPayload(const SmartZipInfo& info);
// 0x334D
struct Mac3Attributes {
    std::uint16_t finderFlags = 0, vertical = 0, horizontal = 0, folder = 0;
    std::int16_t iconID = 0;
    std::int8_t script = 0, extendedFlags = 0;
    std::int16_t commentID = 0;
    std::int32_t putAway = 0;
    std::uint8_t version = 0, accessRights = 0;
    std::array<std::uint64_t, 3> times{};   // creation, modification, backup (Mac seconds)
    std::array<std::int32_t, 3> offsets{};  // seconds east of UTC, each
    std::string hfsPath;                    // Mac OS Roman bytes
    std::string comment;
};
// The attribute block itself; `wideTimes` and `withOffsets` follow flags
// 0x0008 and (cleared) 0x0010.
GWData mac3AttributeBlock(const Mac3Attributes& attributes, bool wideTimes, bool withOffsets);
// Header (stated size, flags, type, creator) and, for a local block, the
// attribute block: stored when flags has 0x0004, otherwise preceded by
// `method` and the CRC (of the block unless `crc` is given) and compressed
// with it (0 stored, 8 deflate, 12 bzip2).
GWData mac3Payload(std::uint16_t flags, const std::string& type, const std::string& creator,
                   const std::optional<GWData>& attributeBlock, std::uint16_t method = 8,
                   std::optional<std::uint32_t> crc = std::nullopt);

// Seconds since 1904-01-01 00:00:00 for seconds since 1970 (same zone).
constexpr std::uint64_t kMacEpochOffset = 2082844800;

}  // namespace gwtest
