#include "GWZipFieldReader.h"

#include <algorithm>

#include "foundation/GWStringEncoding.h"

GWByteReader GWZipFieldReader::readerAt(std::size_t offset) const {
    GWByteReader reader(block_);
    reader.seek(offset);
    return reader;
}

namespace {

template <typename T, typename Read>
std::optional<T> readAt(GWByteReader reader, Read read) {
    const auto value = read(reader);
    if (!reader.ok()) {
        return std::nullopt;
    }
    return T(value);
}

}  // namespace

std::optional<std::uint8_t> GWZipFieldReader::u8(std::size_t offset) const {
    return readAt<std::uint8_t>(readerAt(offset), [](GWByteReader& r) { return r.u8(); });
}

std::optional<std::int8_t> GWZipFieldReader::s8(std::size_t offset) const {
    return readAt<std::int8_t>(readerAt(offset), [](GWByteReader& r) { return r.u8(); });
}

std::optional<std::uint16_t> GWZipFieldReader::u16le(std::size_t offset) const {
    return readAt<std::uint16_t>(readerAt(offset), [](GWByteReader& r) { return r.u16le(); });
}

std::optional<std::int16_t> GWZipFieldReader::s16le(std::size_t offset) const {
    return readAt<std::int16_t>(readerAt(offset), [](GWByteReader& r) { return r.u16le(); });
}

std::optional<std::uint32_t> GWZipFieldReader::u32le(std::size_t offset) const {
    return readAt<std::uint32_t>(readerAt(offset), [](GWByteReader& r) { return r.u32le(); });
}

std::optional<std::int32_t> GWZipFieldReader::s32le(std::size_t offset) const {
    return readAt<std::int32_t>(readerAt(offset), [](GWByteReader& r) { return r.s32le(); });
}

std::optional<std::uint64_t> GWZipFieldReader::u64le(std::size_t offset) const {
    return readAt<std::uint64_t>(readerAt(offset), [](GWByteReader& r) { return r.u64le(); });
}

std::optional<std::uint16_t> GWZipFieldReader::u16be(std::size_t offset) const {
    return readAt<std::uint16_t>(readerAt(offset), [](GWByteReader& r) { return r.u16be(); });
}

std::optional<std::uint32_t> GWZipFieldReader::u32be(std::size_t offset) const {
    return readAt<std::uint32_t>(readerAt(offset), [](GWByteReader& r) { return r.u32be(); });
}

std::optional<std::span<const std::uint8_t>> GWZipFieldReader::bytes(std::size_t offset,
                                                                     std::size_t count) const {
    GWByteReader reader = readerAt(offset);
    auto piece = reader.bytes(count);
    if (!reader.ok()) {
        return std::nullopt;
    }
    return piece;
}

std::span<const std::uint8_t> GWZipFieldReader::bytesFrom(std::size_t offset) const {
    GWByteReader reader = readerAt(offset);
    return reader.ok() ? reader.rest() : std::span<const std::uint8_t>();
}

std::optional<std::span<const std::uint8_t>> GWZipFieldReader::zeroTerminatedBytes(
    std::size_t offset, std::size_t* next) const {
    GWByteReader reader = readerAt(offset);
    if (!reader.ok() || reader.remaining() == 0) {
        return std::nullopt;
    }
    const auto rest = reader.rest();
    const auto zero = std::find(rest.begin(), rest.end(), std::uint8_t(0));
    const std::size_t length = std::size_t(zero - rest.begin());
    if (next) {
        *next = zero == rest.end() ? block_.size() : offset + length + 1;
    }
    return rest.first(length);
}

bool GWZipFieldReader::hasSignature(std::string_view signature) const {
    auto head = bytes(0, signature.size());
    return head && std::equal(head->begin(), head->end(), signature.begin(),
                              [](std::uint8_t byte, char c) { return byte == std::uint8_t(c); });
}

GWDate GWZipDateFromUnixTime(std::uint32_t seconds) {
    return GWDate::dateWithTimeIntervalSince1970(double(seconds));
}

GWDate GWZipDateFromMacTime(std::uint64_t seconds, const std::optional<GWTimeZone>& timeZone) {
    return GWDate::gregorianDateWithYear(1904, 1, 1, 0, 0, 0, timeZone)
        .dateByAddingTimeInterval(double(seconds));
}

std::optional<std::string> GWZipFileSystemString(std::span<const std::uint8_t> bytes) {
    // A path ends at its first zero byte, as the C string it becomes.
    const auto zero = std::find(bytes.begin(), bytes.end(), std::uint8_t(0));
    return GWStringFromBytes(bytes.first(std::size_t(zero - bytes.begin())),
                             GWStringEncoding::UTF8);
}

std::string GWZipMacRomanString(std::span<const std::uint8_t> bytes) {
    return GWStringFromBytes(bytes, GWStringEncoding::MacOSRoman).value_or(std::string());
}
