#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "foundation/GWByteReader.h"
#include "foundation/GWDate.h"
#include "foundation/GWValue.h"

// Reads fields at fixed offsets of one extra-field block. Each read is
// checked on its own: a field that does not lie inside the block reads as
// none, so a truncated block still yields the fields before the cut.
class GWZipFieldReader {
public:
    // The block is the smaller of its declared length and the bytes present.
    GWZipFieldReader(std::span<const std::uint8_t> data, std::size_t length)
        : block_(data.first(length < data.size() ? length : data.size())) {}

    std::size_t size() const { return block_.size(); }
    std::span<const std::uint8_t> block() const { return block_; }

    std::optional<std::uint8_t> u8(std::size_t offset) const;
    std::optional<std::int8_t> s8(std::size_t offset) const;
    std::optional<std::uint16_t> u16le(std::size_t offset) const;
    std::optional<std::int16_t> s16le(std::size_t offset) const;
    std::optional<std::uint32_t> u32le(std::size_t offset) const;
    std::optional<std::int32_t> s32le(std::size_t offset) const;
    std::optional<std::uint64_t> u64le(std::size_t offset) const;
    std::optional<std::uint16_t> u16be(std::size_t offset) const;
    std::optional<std::uint32_t> u32be(std::size_t offset) const;

    // `count` bytes at `offset`, or none when they do not all fit.
    std::optional<std::span<const std::uint8_t>> bytes(std::size_t offset, std::size_t count) const;
    // From `offset` to the end of the block; empty past it.
    std::span<const std::uint8_t> bytesFrom(std::size_t offset) const;
    // From `offset` up to the next zero byte, or to the end of the block when
    // there is none; `next` receives the offset after the zero byte (or the
    // block's size). None when no byte lies at `offset`.
    std::optional<std::span<const std::uint8_t>> zeroTerminatedBytes(std::size_t offset,
                                                                     std::size_t* next) const;
    bool hasSignature(std::string_view signature) const;

private:
    GWByteReader readerAt(std::size_t offset) const;

    std::span<const std::uint8_t> block_;
};

// Stores the value under `key` when there is one.
template <typename T>
void GWZipSetInfo(GWDictionary& info, const char* key, const std::optional<T>& value) {
    if (value) {
        info.insert_or_assign(key, GWValue(*value));
    }
}

// Unix time: unsigned seconds since 1970 (after 2038 when the top bit is set).
GWDate GWZipDateFromUnixTime(std::uint32_t seconds);
// Classic Mac time: seconds since 1904-01-01 00:00:00 in the given zone (none:
// the system's current zone).
GWDate GWZipDateFromMacTime(std::uint64_t seconds,
                            const std::optional<GWTimeZone>& timeZone = std::nullopt);
// Bytes of a file-system path (UTF-8) up to any zero byte; none when invalid.
std::optional<std::string> GWZipFileSystemString(std::span<const std::uint8_t> bytes);
std::string GWZipMacRomanString(std::span<const std::uint8_t> bytes);
