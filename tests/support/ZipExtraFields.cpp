#include "ZipExtraFields.h"

#include <zlib.h>

#include "TestSupport.h"
#include "ZipBuilder.h"

namespace gwtest {

namespace {

std::uint32_t crcOf(const GWData& bytes) {
    return std::uint32_t(crc32(0, bytes.data(), uInt(bytes.size())));
}

}  // namespace

GWData zipExtraBlock(std::uint16_t headerID, const GWData& payload,
                     std::optional<std::uint16_t> declaredSize) {
    GWData block;
    putLE(block, {{headerID, 2}, {declaredSize.value_or(std::uint16_t(payload.size())), 2}});
    return concat({block, payload});
}

GWData concat(const std::vector<GWData>& pieces) {
    GWData out;
    for (const GWData& piece : pieces) {
        out.insert(out.end(), piece.begin(), piece.end());
    }
    return out;
}

GWData zip64Payload(const std::vector<std::uint64_t>& values) {
    GWData out;
    for (std::uint64_t value : values) {
        putLE(out, {{value, 8}});
    }
    return out;
}

GWData ntfsPayload(std::uint64_t modified, std::uint64_t accessed, std::uint64_t created) {
    GWData out;
    putLE(out, {{0, 4}, {1, 2}, {24, 2}, {modified, 8}, {accessed, 8}, {created, 8}});
    return out;
}

GWData unixPayload(std::uint32_t accessed, std::uint32_t modified, std::optional<std::uint16_t> uid,
                   std::optional<std::uint16_t> gid, const std::string& tail) {
    GWData out;
    putLE(out, {{accessed, 4}, {modified, 4}});
    if (uid) {
        putLE(out, {{*uid, 2}});
    }
    if (gid) {
        putLE(out, {{*gid, 2}});
    }
    return concat({out, bytesOf(tail)});
}

GWData extendedTimestampPayload(std::uint8_t flags, const std::vector<std::uint32_t>& times) {
    GWData out{flags};
    for (std::uint32_t time : times) {
        putLE(out, {{time, 4}});
    }
    return out;
}

GWData infoZipUnixPayload(std::uint16_t uid, std::uint16_t gid) {
    GWData out;
    putLE(out, {{uid, 2}, {gid, 2}});
    return out;
}

GWData infoZipUnix3GPayload(std::uint64_t uid, std::uint64_t gid, std::uint8_t uidSize,
                            std::uint8_t gidSize, std::uint8_t version) {
    GWData out;
    putLE(out, {{version, 1}, {uidSize, 1}, {uid, uidSize}, {gidSize, 1}, {gid, gidSize}});
    return out;
}

GWData infoZipUnicodePayload(const std::string& text, std::optional<std::uint32_t> crc,
                             std::uint8_t version) {
    GWData out;
    putLE(out, {{version, 1}, {crc.value_or(crcOf(bytesOf(text))), 4}});
    return concat({out, bytesOf(text)});
}

GWData asiUnixPayload(std::uint32_t crc, std::uint16_t mode, std::uint16_t uid, std::uint16_t gid,
                      const std::string& linkTarget) {
    GWData out;
    putLE(out, {{crc, 4}, {mode, 2}, {linkTarget.size(), 4}, {uid, 2}, {gid, 2}});
    return concat({out, bytesOf(linkTarget)});
}

GWData jleePayload(const std::string& type, const std::string& creator, std::uint16_t finderFlags,
                   std::uint32_t created, std::uint32_t modified, bool isDataFork,
                   const std::string& signature) {
    GWData out = bytesOf(signature + type + creator);
    putBE(out, {{finderFlags, 2}});
    out.resize(22, 0);  // the rest of the Finder information
    putBE(out, {{created, 4}, {modified, 4}, {isDataFork ? 1u : 0u, 4}});
    return out;
}

GWData zipItPayload(const std::optional<std::string>& name, const std::string& type,
                    const std::string& creator, std::optional<std::uint16_t> finderFlags) {
    GWData out = bytesOf("ZPIT");
    if (name) {
        putLE(out, {{name->size(), 1}});
        out = concat({out, bytesOf(*name)});
    }
    out = concat({out, bytesOf(type + creator)});
    if (finderFlags) {
        putBE(out, {{*finderFlags, 2}});
    }
    return out;
}

GWData zipIt135Payload(std::uint16_t finderFlags, bool automaticallyOpen) {
    GWData out = bytesOf("ZPIT");
    putBE(out, {{finderFlags, 2}, {automaticallyOpen ? 1u : 0u, 2}});
    return out;
}

GWData smartZipPayload(const SmartZipInfo& info) {
    GWData out = bytesOf("dZip" + info.type + info.creator);
    putBE(out, {{info.finderFlags, 2},
                {info.vertical, 2},
                {info.horizontal, 2},
                {info.folder, 2},
                {info.created, 4},
                {info.modified, 4},
                {info.script, 2},
                {info.extendedFlags, 2},
                {info.nameLength.value_or(std::uint8_t(info.name.size())), 1}});
    return concat({out, bytesOf(info.name)});
}

GWData mac3AttributeBlock(const Mac3Attributes& a, bool wideTimes, bool withOffsets) {
    GWData out;
    putLE(out, {{a.finderFlags, 2},
                {a.vertical, 2},
                {a.horizontal, 2},
                {a.folder, 2},
                {std::uint16_t(a.iconID), 2},
                {0, 6},
                {std::uint8_t(a.script), 1},
                {std::uint8_t(a.extendedFlags), 1},
                {std::uint16_t(a.commentID), 2},
                {std::uint32_t(a.putAway), 4},
                {a.version, 1},
                {a.accessRights, 1}});
    for (std::uint64_t time : a.times) {
        putLE(out, {{time, wideTimes ? 8 : 4}});
    }
    for (std::int32_t offset : a.offsets) {
        putLE(out, {{std::uint32_t(offset), withOffsets ? 4 : 0}});
    }
    putLE(out, {{0, 2}});  // the two bytes no reader looks at
    return concat({out, bytesOf(a.hfsPath), {0}, bytesOf(a.comment), {0}});
}

GWData mac3Payload(std::uint16_t flags, const std::string& type, const std::string& creator,
                   const std::optional<GWData>& attributeBlock, std::uint16_t method,
                   std::optional<std::uint32_t> crc) {
    GWData out;
    putLE(out, {{attributeBlock ? attributeBlock->size() : 0, 4}, {flags, 2}});
    out = concat({out, bytesOf(type + creator)});
    if (!attributeBlock) {
        return out;
    }
    if (flags & 0x0004) {
        return concat({out, *attributeBlock});
    }
    putLE(out, {{method, 2}, {crc.value_or(crcOf(*attributeBlock)), 4}});
    return concat({out, zipCompress(*attributeBlock, method)});
}

}  // namespace gwtest
