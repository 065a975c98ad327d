#include "ZipExtraFields.h"

#include <zlib.h>

#include "ZipBuilder.h"

namespace gwtest {

namespace {

void put8(GWData& out, std::uint64_t value) {
    out.push_back(std::uint8_t(value));
}

void putLE(GWData& out, std::uint64_t value, int width) {
    for (int i = 0; i < width; ++i) {
        out.push_back(std::uint8_t(value >> (8 * i)));
    }
}

void putBE(GWData& out, std::uint64_t value, int width) {
    for (int i = width - 1; i >= 0; --i) {
        out.push_back(std::uint8_t(value >> (8 * i)));
    }
}

void putText(GWData& out, const std::string& text) {
    out.insert(out.end(), text.begin(), text.end());
}

std::uint32_t crcOf(const GWData& bytes) {
    return std::uint32_t(crc32(0, bytes.data(), uInt(bytes.size())));
}

}  // namespace

GWData zipExtraBlock(std::uint16_t headerID, const GWData& payload,
                     std::optional<std::uint16_t> declaredSize) {
    GWData block;
    putLE(block, headerID, 2);
    putLE(block, declaredSize.value_or(std::uint16_t(payload.size())), 2);
    block.insert(block.end(), payload.begin(), payload.end());
    return block;
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
        putLE(out, value, 8);
    }
    return out;
}

GWData ntfsPayload(std::uint64_t modified, std::uint64_t accessed, std::uint64_t created) {
    GWData out;
    putLE(out, 0, 4);
    putLE(out, 1, 2);
    putLE(out, 24, 2);
    putLE(out, modified, 8);
    putLE(out, accessed, 8);
    putLE(out, created, 8);
    return out;
}

GWData unixPayload(std::uint32_t accessed, std::uint32_t modified, std::optional<std::uint16_t> uid,
                   std::optional<std::uint16_t> gid, const std::string& tail) {
    GWData out;
    putLE(out, accessed, 4);
    putLE(out, modified, 4);
    if (uid) {
        putLE(out, *uid, 2);
    }
    if (gid) {
        putLE(out, *gid, 2);
    }
    putText(out, tail);
    return out;
}

GWData extendedTimestampPayload(std::uint8_t flags, const std::vector<std::uint32_t>& times) {
    GWData out{flags};
    for (std::uint32_t time : times) {
        putLE(out, time, 4);
    }
    return out;
}

GWData infoZipUnixPayload(std::uint16_t uid, std::uint16_t gid) {
    GWData out;
    putLE(out, uid, 2);
    putLE(out, gid, 2);
    return out;
}

GWData infoZipUnix3GPayload(std::uint64_t uid, std::uint64_t gid, std::uint8_t uidSize,
                            std::uint8_t gidSize, std::uint8_t version) {
    GWData out{version, uidSize};
    putLE(out, uid, uidSize);
    put8(out, gidSize);
    putLE(out, gid, gidSize);
    return out;
}

GWData infoZipUnicodePayload(const std::string& text, std::optional<std::uint32_t> crc,
                             std::uint8_t version) {
    const GWData bytes(text.begin(), text.end());
    GWData out{version};
    putLE(out, crc.value_or(crcOf(bytes)), 4);
    putText(out, text);
    return out;
}

GWData asiUnixPayload(std::uint32_t crc, std::uint16_t mode, std::uint16_t uid, std::uint16_t gid,
                      const std::string& linkTarget) {
    GWData out;
    putLE(out, crc, 4);
    putLE(out, mode, 2);
    putLE(out, linkTarget.size(), 4);
    putLE(out, uid, 2);
    putLE(out, gid, 2);
    putText(out, linkTarget);
    return out;
}

GWData jleePayload(const std::string& type, const std::string& creator, std::uint16_t finderFlags,
                   std::uint32_t created, std::uint32_t modified, bool isDataFork,
                   const std::string& signature) {
    GWData out;
    putText(out, signature);
    putText(out, type);
    putText(out, creator);
    putBE(out, finderFlags, 2);
    out.resize(22, 0);  // the rest of the Finder information
    putBE(out, created, 4);
    putBE(out, modified, 4);
    put8(out, 0);
    put8(out, 0);
    put8(out, 0);
    put8(out, isDataFork ? 1 : 0);
    return out;
}

GWData zipItPayload(const std::optional<std::string>& name, const std::string& type,
                    const std::string& creator, std::optional<std::uint16_t> finderFlags) {
    GWData out;
    putText(out, "ZPIT");
    if (name) {
        put8(out, name->size());
        putText(out, *name);
    }
    putText(out, type);
    putText(out, creator);
    if (finderFlags) {
        putBE(out, *finderFlags, 2);
    }
    return out;
}

GWData zipIt135Payload(std::uint16_t finderFlags, bool automaticallyOpen) {
    GWData out;
    putText(out, "ZPIT");
    putBE(out, finderFlags, 2);
    put8(out, 0);
    put8(out, automaticallyOpen ? 1 : 0);
    return out;
}

GWData smartZipPayload(const SmartZipInfo& info) {
    GWData out;
    putText(out, "dZip");
    putText(out, info.type);
    putText(out, info.creator);
    putBE(out, info.finderFlags, 2);
    putBE(out, info.vertical, 2);
    putBE(out, info.horizontal, 2);
    putBE(out, info.folder, 2);
    putBE(out, info.created, 4);
    putBE(out, info.modified, 4);
    put8(out, 0);
    put8(out, info.script);
    put8(out, 0);
    put8(out, info.extendedFlags);
    put8(out, info.nameLength.value_or(std::uint8_t(info.name.size())));
    putText(out, info.name);
    return out;
}

GWData mac3AttributeBlock(const Mac3Attributes& a, bool wideTimes, bool withOffsets) {
    GWData out;
    putLE(out, a.finderFlags, 2);
    putLE(out, a.vertical, 2);
    putLE(out, a.horizontal, 2);
    putLE(out, a.folder, 2);
    putLE(out, std::uint16_t(a.iconID), 2);
    out.resize(16, 0);
    put8(out, std::uint8_t(a.script));
    put8(out, std::uint8_t(a.extendedFlags));
    putLE(out, std::uint16_t(a.commentID), 2);
    putLE(out, std::uint32_t(a.putAway), 4);
    put8(out, a.version);
    put8(out, a.accessRights);
    for (std::uint64_t time : a.times) {
        putLE(out, time, wideTimes ? 8 : 4);
    }
    if (withOffsets) {
        for (std::int32_t offset : a.offsets) {
            putLE(out, std::uint32_t(offset), 4);
        }
    }
    putLE(out, 0, 2);  // the two bytes no reader looks at
    putText(out, a.hfsPath);
    put8(out, 0);
    putText(out, a.comment);
    put8(out, 0);
    return out;
}

GWData mac3Payload(std::uint16_t flags, const std::string& type, const std::string& creator,
                   const std::optional<GWData>& attributeBlock, std::uint16_t method,
                   std::optional<std::uint32_t> crc) {
    GWData out;
    putLE(out, attributeBlock ? attributeBlock->size() : 0, 4);
    putLE(out, flags, 2);
    putText(out, type);
    putText(out, creator);
    if (!attributeBlock) {
        return out;
    }
    if (flags & 0x0004) {
        out.insert(out.end(), attributeBlock->begin(), attributeBlock->end());
        return out;
    }
    putLE(out, method, 2);
    putLE(out, crc.value_or(crcOf(*attributeBlock)), 4);
    const GWData compressed = zipCompress(*attributeBlock, method);
    out.insert(out.end(), compressed.begin(), compressed.end());
    return out;
}

}  // namespace gwtest
