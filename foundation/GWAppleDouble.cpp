#include "GWAppleDouble.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstdarg>
#include <cstring>

#include "GWByteReader.h"
#include "GWFileDescriptor.h"
#include "GWFormat.h"

namespace {

constexpr std::size_t kHeaderLength = 26;  // magic, version, 16 filler bytes, entry count
constexpr std::size_t kEntryLength = 12;   // identifier, offset, length
// Mac OS X pads the Finder information to 34 bytes before its attribute header.
constexpr std::size_t kAttributeHeaderOffset = kGWFinderInfoLength + 2;
constexpr std::size_t kAttributeHeaderLength = 36;
constexpr std::size_t kAttributeEntryFixedLength = 11;  // offset, length, flags, name length
constexpr std::uint32_t kAttributeMagic = 0x41545452;   // "ATTR"
constexpr char kFiller[] = "Mac OS X        ";

// Attribute entries are aligned to four bytes.
constexpr std::size_t attributeEntryLength(std::size_t nameLength) {
    return (kAttributeEntryFixedLength + nameLength + 3) & ~std::size_t(3);
}

GWErrorPtr malformed(const char* format, ...) __attribute__((format(printf, 1, 2)));
GWErrorPtr malformed(const char* format, ...) {
    va_list arguments;
    va_start(arguments, format);
    std::string text = GWFormatV(format, arguments);
    va_end(arguments);
    return GWGenerateError(kGWPOSIXErrorDomain, EINVAL, std::nullopt, nullptr, {},
                           "malformed AppleDouble file: %s", text.c_str());
}

// [offset, offset + length) of a file of `fileSize` bytes, read only once it
// is known to lie inside the file.
std::optional<GWData> readRange(int fd, std::uint64_t offset, std::uint64_t length,
                                std::uint64_t fileSize, const char* what, GWErrorPtr* error) {
    if (offset > fileSize || length > fileSize - offset) {
        GWFail(error,
               malformed("%s at [0x%llx, 0x%llx) lies past the end of the file (0x%llx)", what,
                         (unsigned long long)offset, (unsigned long long)(offset + length),
                         (unsigned long long)fileSize));
        return std::nullopt;
    }
    GWData bytes(length);
    std::size_t got = 0;
    if (!GWReadFully(fd, offset, bytes, got)) {
        GWFail(error, GWPOSIXError(errno));
        return std::nullopt;
    }
    if (got != length) {
        GWFail(error, malformed("the file ended while reading %s", what));
        return std::nullopt;
    }
    return bytes;
}

// The "ATTR" block behind the Finder information. Attribute data must lie
// inside the Finder information entry, which is where the format keeps it.
bool readAttributes(const GWData& entry, std::uint64_t entryOffset,
                    std::vector<GWAppleDoubleAttribute>& attributes, GWErrorPtr* error) {
    GWByteReader reader(entry);
    reader.seek(kAttributeHeaderOffset);
    if (reader.u32be() != kAttributeMagic || !reader.ok()) {
        return true;  // plain Finder information without attributes
    }
    reader.skip(4 + 4 + 4 + 4 + 12 + 2);  // debug tag, sizes, reserved words, flags
    const unsigned count = reader.u16be();
    if (!reader.ok()) {
        return GWFail(error,
                      malformed("attribute header: %s", reader.failureDescription().c_str()));
    }
    std::size_t position = kAttributeHeaderOffset + kAttributeHeaderLength;
    for (unsigned index = 0; index < count; ++index) {
        reader.seek(position);
        const std::uint64_t valueOffset = reader.u32be();
        const std::uint64_t valueLength = reader.u32be();
        reader.skip(2);
        const std::size_t nameLength = reader.u8();
        const auto name = reader.bytes(nameLength);
        if (!reader.ok()) {
            return GWFail(error, malformed("attribute entry %u of %u runs past the Finder "
                                           "information entry (%s)",
                                           index, count, reader.failureDescription().c_str()));
        }
        if (nameLength < 2 || name[nameLength - 1] != 0 ||
            std::memchr(name.data(), 0, nameLength - 1) != nullptr) {
            return GWFail(error, malformed("attribute entry %u has no NUL-terminated name", index));
        }
        std::string text(name.begin(), name.end() - 1);
        if (valueOffset < entryOffset || valueOffset - entryOffset > entry.size() ||
            valueLength > entry.size() - (valueOffset - entryOffset)) {
            return GWFail(error,
                          malformed("data of attribute \"%s\" at [0x%llx, 0x%llx) lies outside "
                                    "the Finder information entry",
                                    text.c_str(), (unsigned long long)valueOffset,
                                    (unsigned long long)(valueOffset + valueLength)));
        }
        const auto begin = entry.begin() + std::ptrdiff_t(valueOffset - entryOffset);
        attributes.push_back({std::move(text), GWData(begin, begin + std::ptrdiff_t(valueLength))});
        position += attributeEntryLength(nameLength);
    }
    return true;
}

// Big-endian appenders for the writer.
void put16(GWData& out, std::uint16_t value) {
    out.push_back(std::uint8_t(value >> 8));
    out.push_back(std::uint8_t(value));
}

void put32(GWData& out, std::uint32_t value) {
    put16(out, std::uint16_t(value >> 16));
    put16(out, std::uint16_t(value));
}

}  // namespace

const GWAppleDoubleAttribute* GWAppleDoubleContents::attribute(const std::string& name) const {
    for (const auto& candidate : attributes) {
        if (candidate.name == name) {
            return &candidate;
        }
    }
    return nullptr;
}

bool GWReadAppleDouble(int fd, GWAppleDoubleContents& contents, GWErrorPtr* error) {
    contents = {};
    struct stat info {};
    if (fstat(fd, &info) != 0) {
        return GWFail(error, GWPOSIXError(errno));
    }
    if (S_ISDIR(info.st_mode)) {
        return GWFail(error, GWPOSIXError(EISDIR));
    }
    const std::uint64_t fileSize = std::uint64_t(info.st_size);
    const auto header = readRange(fd, 0, kHeaderLength, fileSize, "the header", error);
    if (!header) {
        return false;
    }
    GWByteReader reader(*header);
    const std::uint32_t magic = reader.u32be();
    const std::uint32_t version = reader.u32be();
    reader.skip(16);
    const std::size_t count = reader.u16be();
    if (magic != kGWAppleDoubleMagic) {
        return GWFail(error, malformed("magic number 0x%08x is not AppleDouble's", magic));
    }
    if (version != kGWAppleDoubleVersion) {
        return GWFail(error, malformed("unsupported version 0x%08x", version));
    }
    const auto table =
        readRange(fd, kHeaderLength, count * kEntryLength, fileSize, "the entry table", error);
    if (!table) {
        return false;
    }
    GWByteReader entries(*table);
    for (std::size_t index = 0; index < count; ++index) {
        const std::uint32_t identifier = entries.u32be();
        const std::uint64_t offset = entries.u32be();
        const std::uint64_t length = entries.u32be();
        if (offset + length > fileSize) {
            return GWFail(error, malformed("entry %zu (id %u) at [0x%llx, 0x%llx) lies past the "
                                           "end of the file (0x%llx)",
                                           index, identifier, (unsigned long long)offset,
                                           (unsigned long long)(offset + length),
                                           (unsigned long long)fileSize));
        }
        const bool isMetadata =
            identifier == GWAppleDoubleFinderInfoEntry || identifier == GWAppleDoubleCommentEntry;
        if (isMetadata && length > kGWAppleDoubleMetadataLimit) {
            return GWFail(error, malformed("entry %zu (id %u) of %llu bytes exceeds the %llu-byte "
                                           "limit for metadata",
                                           index, identifier, (unsigned long long)length,
                                           (unsigned long long)kGWAppleDoubleMetadataLimit));
        }
        // The first entry of each kind counts; later duplicates are ignored.
        if (identifier == GWAppleDoubleFinderInfoEntry && !contents.finderInfo) {
            if (length < kGWFinderInfoLength) {
                return GWFail(error, malformed("Finder information entry of %llu bytes is shorter "
                                               "than 32",
                                               (unsigned long long)length));
            }
            const auto bytes =
                readRange(fd, offset, length, fileSize, "the Finder information entry", error);
            if (!bytes || !readAttributes(*bytes, offset, contents.attributes, error)) {
                return false;
            }
            contents.finderInfo = GWData(bytes->begin(), bytes->begin() + kGWFinderInfoLength);
        } else if (identifier == GWAppleDoubleCommentEntry && !contents.comment) {
            contents.comment = readRange(fd, offset, length, fileSize, "the comment", error);
            if (!contents.comment) {
                return false;
            }
        } else if (identifier == GWAppleDoubleResourceForkEntry && !contents.resourceFork) {
            contents.resourceFork = GWAppleDoubleContents::Extent{offset, length, index};
        }
    }
    return true;
}

GWData GWAppleDoubleBytesBeforeResourceFork(const GWAppleDoubleContents& contents,
                                            std::uint32_t resourceForkLength) {
    const bool hasComment = contents.comment && !contents.comment->empty();
    const std::size_t entryCount = hasComment ? 3 : 2;
    const std::size_t finderInfoOffset = kHeaderLength + entryCount * kEntryLength;
    const std::size_t attributeEntriesOffset =
        finderInfoOffset + kAttributeHeaderOffset + kAttributeHeaderLength;
    std::size_t dataStart = attributeEntriesOffset;
    std::size_t dataLength = 0;
    for (const auto& attribute : contents.attributes) {
        dataStart += attributeEntryLength(attribute.name.size() + 1);
        dataLength += attribute.value.size();
    }
    const std::size_t dataEnd = dataStart + dataLength;
    const std::size_t commentLength = hasComment ? contents.comment->size() : 0;
    const std::size_t forkOffset = dataEnd + commentLength;

    GWData out;
    out.reserve(forkOffset);
    put32(out, kGWAppleDoubleMagic);
    put32(out, kGWAppleDoubleVersion);
    out.insert(out.end(), kFiller, kFiller + 16);
    put16(out, std::uint16_t(entryCount));
    put32(out, GWAppleDoubleFinderInfoEntry);
    put32(out, std::uint32_t(finderInfoOffset));
    put32(out, std::uint32_t(dataEnd - finderInfoOffset));
    if (hasComment) {
        put32(out, GWAppleDoubleCommentEntry);
        put32(out, std::uint32_t(dataEnd));
        put32(out, std::uint32_t(commentLength));
    }
    put32(out, GWAppleDoubleResourceForkEntry);
    put32(out, std::uint32_t(forkOffset));
    put32(out, resourceForkLength);

    if (contents.finderInfo && contents.finderInfo->size() == kGWFinderInfoLength) {
        out.insert(out.end(), contents.finderInfo->begin(), contents.finderInfo->end());
    } else {
        out.resize(out.size() + kGWFinderInfoLength);
    }
    out.resize(out.size() + 2);
    put32(out, kAttributeMagic);
    put32(out, 0);  // debug tag
    put32(out, std::uint32_t(dataEnd));
    put32(out, std::uint32_t(dataStart));
    put32(out, std::uint32_t(dataLength));
    out.resize(out.size() + 12 + 2);  // reserved words, flags
    put16(out, std::uint16_t(contents.attributes.size()));

    std::size_t valueOffset = dataStart;
    for (const auto& attribute : contents.attributes) {
        const std::size_t entryStart = out.size();
        put32(out, std::uint32_t(valueOffset));
        put32(out, std::uint32_t(attribute.value.size()));
        put16(out, 0);
        out.push_back(std::uint8_t(attribute.name.size() + 1));
        out.insert(out.end(), attribute.name.begin(), attribute.name.end());
        out.resize(entryStart + attributeEntryLength(attribute.name.size() + 1));
        valueOffset += attribute.value.size();
    }
    for (const auto& attribute : contents.attributes) {
        out.insert(out.end(), attribute.value.begin(), attribute.value.end());
    }
    if (hasComment) {
        out.insert(out.end(), contents.comment->begin(), contents.comment->end());
    }
    return out;
}
