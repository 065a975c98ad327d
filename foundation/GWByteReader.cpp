#include "GWByteReader.h"

#include "GWFormat.h"

bool GWByteReader::fail(std::size_t start, std::size_t length) {
    if (!failed_) {
        failed_ = true;
        failure_ = GWFormat("unexpected end of data at offset 0x%zx while reading [0x%zx, 0x%zx)",
                            bytes_.size(), start, start + length);
    }
    return false;
}

bool GWByteReader::seek(std::size_t offset) {
    if (failed_ || offset > bytes_.size()) {
        return fail(offset, 0);
    }
    offset_ = offset;
    return true;
}

bool GWByteReader::skip(std::size_t count) {
    if (failed_ || count > remaining()) {
        return fail(offset_, count);
    }
    offset_ += count;
    return true;
}

std::uint64_t GWByteReader::read(std::size_t width, bool bigEndian) {
    if (failed_ || width == 0 || width > 8 || width > remaining()) {
        fail(offset_, width);
        return 0;
    }
    std::uint64_t value = 0;
    for (std::size_t i = 0; i < width; ++i) {
        const std::uint64_t byte = bytes_[offset_ + i];
        value |= bigEndian ? byte << (8 * (width - 1 - i)) : byte << (8 * i);
    }
    offset_ += width;
    return value;
}

std::string GWByteReader::string(std::size_t count) {
    auto piece = bytes(count);
    return std::string(piece.begin(), piece.end());
}

std::span<const std::uint8_t> GWByteReader::rest() {
    return bytes(remaining());
}

GWByteReader GWByteReader::slice(std::size_t offset, std::size_t length) const {
    GWByteReader sub;
    if (failed_ || offset > bytes_.size() || length > bytes_.size() - offset) {
        sub.bytes_ = bytes_;
        sub.fail(offset, length);
        sub.bytes_ = {};
        return sub;
    }
    sub.bytes_ = bytes_.subspan(offset, length);
    return sub;
}
