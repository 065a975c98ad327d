#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string>

// A cursor over untrusted bytes. Every read is checked against the end; the
// first read that does not fit fails the reader for good and yields zeros, so
// a run of fields can be read and checked once with ok().
class GWByteReader {
public:
    GWByteReader() = default;
    explicit GWByteReader(std::span<const std::uint8_t> bytes) : bytes_(bytes) {}

    bool ok() const { return !failed_; }
    std::size_t offset() const { return offset_; }
    std::size_t size() const { return bytes_.size(); }
    std::size_t remaining() const { return bytes_.size() - offset_; }

    // Moves to an absolute offset; past the end fails.
    bool seek(std::size_t offset);
    bool skip(std::size_t count);

    std::uint8_t u8() { return std::uint8_t(fixed<1, false>()); }
    std::uint16_t u16le() { return std::uint16_t(fixed<2, false>()); }
    std::uint32_t u32le() { return std::uint32_t(fixed<4, false>()); }
    std::uint64_t u64le() { return fixed<8, false>(); }
    std::uint16_t u16be() { return std::uint16_t(fixed<2, true>()); }
    std::uint32_t u32be() { return std::uint32_t(fixed<4, true>()); }
    std::uint64_t u64be() { return fixed<8, true>(); }
    std::int16_t s16be() { return std::int16_t(u16be()); }
    std::int32_t s32le() { return std::int32_t(u32le()); }
    std::int32_t s32be() { return std::int32_t(u32be()); }
    // An unsigned integer of 1 to 8 bytes.
    std::uint64_t uintLE(std::size_t width) { return read(width, false); }
    std::uint64_t uintBE(std::size_t width) { return read(width, true); }

    // The next `count` bytes (empty, and failed, when fewer remain).
    std::span<const std::uint8_t> bytes(std::size_t count) {
        if (failed_ || count > remaining()) {
            fail(offset_, count);
            return {};
        }
        auto piece = bytes_.subspan(offset_, count);
        offset_ += count;
        return piece;
    }
    std::string string(std::size_t count);
    // Everything from here to the end.
    std::span<const std::uint8_t> rest();

    // A reader over [offset, offset + length) of the same bytes; failed when
    // the range does not lie inside.
    GWByteReader slice(std::size_t offset, std::size_t length) const;

    // "unexpected end of data at offset 0x6 while reading [0x0, 0x8)", or empty.
    const std::string& failureDescription() const { return failure_; }

private:
    std::uint64_t read(std::size_t width, bool bigEndian);
    // Inline: a central directory of 200,000 records is read field by field.
    template <std::size_t Width, bool BigEndian>
    std::uint64_t fixed() {
        if (failed_ || Width > remaining()) {
            fail(offset_, Width);
            return 0;
        }
        const std::uint8_t* bytes = bytes_.data() + offset_;
        std::uint64_t value = 0;
        for (std::size_t i = 0; i < Width; ++i) {
            value |= std::uint64_t(bytes[i]) << (8 * (BigEndian ? Width - 1 - i : i));
        }
        offset_ += Width;
        return value;
    }
    [[gnu::cold]] bool fail(std::size_t start, std::size_t length);

    std::span<const std::uint8_t> bytes_;
    std::size_t offset_ = 0;
    bool failed_ = false;
    std::string failure_;
};
