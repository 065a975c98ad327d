#include "GWZipUnicodePathCRC.h"

#include "foundation/GWByteReader.h"
#include "foundation/GWChecksum.h"

namespace {

constexpr std::uint16_t kUnicodePathID = 0x7075;
constexpr std::uint16_t kUnicodeCommentID = 0x6375;

std::uint32_t crc32Of(std::span<const std::uint8_t> bytes) {
    const GWData digest = GWChecksum::checksumForData(bytes, GWChecksumAlgorithmCRC32);
    if (digest.size() < 4) {
        return 0;
    }
    return std::uint32_t(digest[0]) | std::uint32_t(digest[1]) << 8 |
           std::uint32_t(digest[2]) << 16 | std::uint32_t(digest[3]) << 24;
}

}  // namespace

GWData GWZipNormaliseUnicodeFieldCRCs(std::span<const std::uint8_t> extraField,
                                      std::span<const std::uint8_t> headerName,
                                      std::span<const std::uint8_t> headerComment) {
    GWData normalised(extraField.begin(), extraField.end());
    GWByteReader reader(extraField);
    while (reader.remaining() >= 4) {
        const std::uint16_t id = reader.u16le();
        const std::uint16_t size = reader.u16le();
        const std::size_t start = reader.offset();
        if (size > reader.remaining()) {
            break;
        }
        GWByteReader block = reader.slice(start, size);
        reader.skip(size);
        if (id != kUnicodePathID && id != kUnicodeCommentID) {
            continue;
        }
        const std::uint8_t version = block.u8();
        const std::uint32_t stored = block.u32le();
        if (!block.ok() || version != 1) {
            continue;
        }
        const auto text = block.rest();
        const auto header = id == kUnicodePathID ? headerName : headerComment;
        const std::uint32_t textCRC = crc32Of(text);
        if (stored != textCRC && stored == crc32Of(header)) {
            for (int i = 0; i < 4; ++i) {
                normalised[start + 1 + i] = std::uint8_t(textCRC >> (8 * i));
            }
        }
    }
    return normalised;
}
