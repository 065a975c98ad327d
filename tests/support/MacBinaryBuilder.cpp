#include "MacBinaryBuilder.h"

#include <algorithm>
#include <stdexcept>

namespace gwtest {
namespace {

void put16(GWData& out, std::size_t at, std::uint16_t value) {
    out[at] = std::uint8_t(value >> 8);
    out[at + 1] = std::uint8_t(value);
}

void put32(GWData& out, std::size_t at, std::uint32_t value) {
    put16(out, at, std::uint16_t(value >> 16));
    put16(out, at + 2, std::uint16_t(value));
}

void putCode(GWData& out, std::size_t at, const std::string& code) {
    if (code.size() != 4) {
        throw std::invalid_argument("four-character code expected: " + code);
    }
    std::copy(code.begin(), code.end(), out.begin() + std::ptrdiff_t(at));
}

void appendFork(GWData& out, const GWData& fork, MacBinaryPadding padding) {
    if (fork.empty()) {
        return;
    }
    out.insert(out.end(), fork.begin(), fork.end());
    std::size_t pad = (128 - fork.size() % 128) % 128;
    if (pad == 0 && padding == MacBinaryPadding::fullBlockAfterAlignedFork) {
        pad = 128;
    }
    out.resize(out.size() + pad);
}

// The CRC-16 of MacBinary II headers, bit by bit rather than by table as the library does.
std::uint16_t macBinaryCRC(const std::uint8_t* bytes, std::size_t length) {
    std::uint16_t crc = 0;
    for (std::size_t i = 0; i < length; ++i) {
        crc ^= std::uint16_t(bytes[i] << 8);
        for (int bit = 0; bit < 8; ++bit) {
            crc = (crc & 0x8000) ? std::uint16_t((crc << 1) ^ 0x1021) : std::uint16_t(crc << 1);
        }
    }
    return crc;
}

}  // namespace

void resealMacBinaryHeader(GWData& bytes, MacBinarySeal seal) {
    for (int filler = 0; filler < 256; ++filler) {
        bytes[64] = std::uint8_t(filler);
        const std::uint16_t crc = macBinaryCRC(bytes.data() + 1, 123);
        if ((crc >= 0x8000) == (seal == MacBinarySeal::fromx8000)) {
            put16(bytes, macbinary::kCRC, crc);
            return;
        }
    }
    throw std::logic_error("no filler byte gives the wanted check value");
}

GWData macBinaryHeader(const MacBinaryFile& file) {
    if (file.name.size() > 63) {
        throw std::invalid_argument("MacBinary names have at most 63 bytes");
    }
    GWData header(128, 0);
    header[1] = std::uint8_t(file.name.size());
    std::copy(file.name.begin(), file.name.end(), header.begin() + 2);
    putCode(header, 65, file.type);
    putCode(header, 69, file.creator);
    header[73] = std::uint8_t(file.finderFlags >> 8);
    put16(header, 75, file.verticalPosition);
    put16(header, 77, file.horizontalPosition);
    put32(header, 83, std::uint32_t(file.dataFork.size()));
    put32(header, 87, std::uint32_t(file.resourceFork.size()));
    put32(header, 91, file.creationDate);
    put32(header, 95, file.modificationDate);
    if (file.version >= 2) {
        put16(header, 99, std::uint16_t(file.comment.size()));
        header[101] = std::uint8_t(file.finderFlags);
        put16(header, 120, std::uint16_t(file.secondaryHeader.size()));
        header[122] = file.writerVersion;
        header[123] = file.readerVersion;
    }
    if (file.version == 3) {
        std::copy_n("mBIN", 4, header.begin() + 102);
        header[107] = file.extendedFinderFlags;
    }
    if (file.version >= 2) {
        resealMacBinaryHeader(header, file.seal);
    }
    return header;
}

GWData buildMacBinary(const MacBinaryFile& file, MacBinaryPadding padding) {
    GWData out = macBinaryHeader(file);
    if (file.version >= 2) {
        out.insert(out.end(), file.secondaryHeader.begin(), file.secondaryHeader.end());
    }
    appendFork(out, file.dataFork, padding);
    appendFork(out, file.resourceFork, padding);
    if (file.version >= 2) {
        out.insert(out.end(), file.comment.begin(), file.comment.end());
    }
    return out;
}

}  // namespace gwtest
