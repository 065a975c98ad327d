#include "ZipBuilder.h"

#include <bzlib.h>
#include <zlib.h>

#include <algorithm>
#include <stdexcept>

#include "TestSupport.h"

namespace gwtest {

namespace {

constexpr std::uint32_t kEscaped32 = 0xFFFFFFFF;

// Each value as `width` little-endian bytes.
template <typename... Values>
void le(GWData& out, int width, Values... values) {
    (putLE(out, {{std::uint64_t(values), width}}), ...);
}

void append(GWData& out, const GWData& bytes) {
    out.insert(out.end(), bytes.begin(), bytes.end());
}

GWData rawDeflate(const GWData& input) {
    z_stream stream{};
    if (deflateInit2(&stream, 6, Z_DEFLATED, -15, 8, Z_DEFAULT_STRATEGY) != Z_OK) {
        throw std::runtime_error("deflateInit2 failed");
    }
    GWData output(deflateBound(&stream, uLong(input.size())) + 16);
    stream.next_in = const_cast<Bytef*>(input.data());
    stream.avail_in = uInt(input.size());
    stream.next_out = output.data();
    stream.avail_out = uInt(output.size());
    const int status = deflate(&stream, Z_FINISH);
    output.resize(stream.total_out);
    deflateEnd(&stream);
    if (status != Z_STREAM_END) {
        throw std::runtime_error("deflate did not finish");
    }
    return output;
}

GWData bzip2Compress(const GWData& input) {
    unsigned int length = unsigned(input.size() + input.size() / 100 + 600);
    GWData output(length);
    if (BZ2_bzBuffToBuffCompress(reinterpret_cast<char*>(output.data()), &length,
                                 const_cast<char*>(reinterpret_cast<const char*>(input.data())),
                                 unsigned(input.size()), 9, 0, 0) != BZ_OK) {
        throw std::runtime_error("bzip2 compression failed");
    }
    output.resize(length);
    return output;
}

// The Zip64 block for the fields a header escaped, in their standard order.
GWData zip64Block(const std::vector<std::uint64_t>& values) {
    GWData block;
    le(block, 2, 0x0001, values.size() * 8);
    for (std::uint64_t value : values) {
        le(block, 8, value);
    }
    return block;
}

}  // namespace

void putLE(GWData& out, std::initializer_list<std::pair<std::uint64_t, int>> values) {
    for (const auto& [value, width] : values) {
        for (int i = 0; i < width; ++i) {
            out.push_back(std::uint8_t(value >> (8 * i)));
        }
    }
}

void putBE(GWData& out, std::initializer_list<std::pair<std::uint64_t, int>> values) {
    for (const auto& [value, width] : values) {
        for (int i = width - 1; i >= 0; --i) {
            out.push_back(std::uint8_t(value >> (8 * i)));
        }
    }
}

std::uint16_t zipDOSTime(int hour, int minute, int second) {
    return std::uint16_t(hour << 11 | minute << 5 | second / 2);
}

std::uint16_t zipDOSDate(int year, int month, int day) {
    return std::uint16_t((year - 1980) << 9 | month << 5 | day);
}

GWData zipCompress(const GWData& content, std::uint16_t method) {
    switch (method) {
        case 8: return rawDeflate(content);
        case 12: return bzip2Compress(content);
        default: return content;
    }
}

GWData ZipEntry::storedBytes() const {
    return stored ? *stored : zipCompress(content, method);
}

std::uint32_t ZipEntry::effectiveCRC32() const {
    return crc32 ? *crc32 : std::uint32_t(::crc32(0, content.data(), uInt(content.size())));
}

ZipEntry& ZipBuilder::add(ZipEntry entry) {
    entries_.push_back(std::move(entry));
    return entries_.back();
}

ZipEntry& ZipBuilder::addFile(const std::string& name, GWData content, std::uint16_t method) {
    ZipEntry entry;
    entry.name = bytesOf(name);
    entry.content = std::move(content);
    entry.method = method;
    return add(std::move(entry));
}

ZipEntry& ZipBuilder::addDirectory(const std::string& name) {
    ZipEntry entry;
    entry.name = bytesOf(name);
    entry.externalAttributes = (040755u << 16) | 0x10;
    return add(std::move(entry));
}

ZipEntry& ZipBuilder::addSymlink(const std::string& name, const std::string& target) {
    ZipEntry entry;
    entry.name = bytesOf(name);
    entry.content = bytesOf(target);
    entry.externalAttributes = 0120777u << 16;
    return add(std::move(entry));
}

namespace {

// Appends the member's local header, data and descriptor to `out` and its
// central record, saying the local header is at `offset`, to `directory`.
void appendZipEntry(const ZipEntry& entry, std::uint64_t offset, GWData& out, GWData& directory) {
    const GWData stored = entry.storedBytes();
    const std::uint32_t crc = entry.effectiveCRC32();
    const std::uint64_t compressed = entry.compressedSize.value_or(stored.size());
    const std::uint64_t uncompressed = entry.uncompressedSize.value_or(entry.content.size());
    const std::uint16_t flags = entry.flags | (entry.dataDescriptor ? 0x0008 : 0);

    if (!entry.omitLocalHeader) {
        const GWData& localName = entry.localName ? *entry.localName : entry.name;
        GWData localExtra = entry.localExtra;
        if (entry.zip64Sizes) {
            append(localExtra, zip64Block({uncompressed, compressed}));
        }
        const bool zeroed = entry.dataDescriptor;
        const std::uint64_t localCompressed = entry.zip64Sizes ? kEscaped32 : compressed;
        const std::uint64_t localUncompressed = entry.zip64Sizes ? kEscaped32 : uncompressed;
        le(out, 4, 0x04034B50);
        le(out, 2, 20, flags, entry.method, entry.dosTime, entry.dosDate);
        le(out, 4, zeroed ? 0 : crc, zeroed ? 0 : localCompressed, zeroed ? 0 : localUncompressed);
        le(out, 2, localName.size(), localExtra.size());
        append(out, localName);
        append(out, localExtra);
        append(out, stored);
        if (entry.dataDescriptor) {
            if (entry.dataDescriptorSignature) {
                le(out, 4, 0x08074B50);
            }
            le(out, 4, crc);
            le(out, entry.zip64Sizes ? 8 : 4, compressed, uncompressed);
        }
    }

    GWData centralExtra = entry.centralExtra;
    std::vector<std::uint64_t> escaped;
    if (entry.zip64Sizes) {
        escaped = {uncompressed, compressed};
    }
    const std::uint64_t recordedOffset = entry.centralLocalHeaderOffset.value_or(offset);
    if (entry.zip64Offset) {
        escaped.push_back(recordedOffset);
    }
    if (!escaped.empty()) {
        append(centralExtra, zip64Block(escaped));
    }
    le(directory, 4, 0x02014B50);
    le(directory, 2, entry.host << 8 | 30, 20, flags, entry.method, entry.dosTime, entry.dosDate);
    le(directory, 4, crc, entry.zip64Sizes ? kEscaped32 : compressed,
       entry.zip64Sizes ? kEscaped32 : uncompressed);
    // Name, extra and comment lengths, disk number and internal attributes.
    le(directory, 2, entry.name.size(), centralExtra.size(), entry.comment.size(), 0, 0);
    le(directory, 4, entry.externalAttributes, entry.zip64Offset ? kEscaped32 : recordedOffset);
    append(directory, entry.name);
    append(directory, centralExtra);
    append(directory, entry.comment);
}

// The Zip64 end record and locator when asked for, then the classic end
// record; `recordOffset` is where the Zip64 record begins.
struct EndRecords {
    std::uint64_t count = 0;
    std::uint64_t directorySize = 0;
    std::uint64_t directoryOffset = 0;
    std::uint64_t recordOffset = 0;
    bool zip64 = false;
    std::optional<std::uint16_t> entryCount;
    std::optional<std::uint32_t> size;
    std::optional<std::uint32_t> offset;
};

void appendEndRecords(const EndRecords& end, GWData& out) {
    if (end.zip64) {
        // The record (44 bytes after its size field), then the locator.
        le(out, 4, 0x06064B50);
        le(out, 8, 44);
        le(out, 2, kZipHostUnix << 8 | 45, 45);
        le(out, 4, 0, 0);
        le(out, 8, end.count, end.count, end.directorySize, end.directoryOffset);
        le(out, 4, 0x07064B50, 0);
        le(out, 8, end.recordOffset);
        le(out, 4, 1);
    }
    const std::uint16_t shortCount = end.zip64 ? 0xFFFF : std::uint16_t(end.count);
    le(out, 4, 0x06054B50);
    le(out, 2, 0, 0, end.entryCount.value_or(shortCount), end.entryCount.value_or(shortCount));
    le(out, 4, end.size.value_or(end.zip64 ? kEscaped32 : end.directorySize),
       end.offset.value_or(end.zip64 ? kEscaped32 : end.directoryOffset));
}

}  // namespace

GWData ZipBuilder::bytes() const {
    GWData out = prefix;
    const std::uint64_t base = offsetsIncludePrefix ? 0 : prefix.size();
    GWData directory;
    offsets_.clear();
    for (const ZipEntry& entry : entries_) {
        offsets_.push_back(out.size());
        appendZipEntry(entry, out.size() - base, out, directory);
    }
    const std::uint64_t directoryOffset = out.size() - base;
    append(out, directory);
    appendEndRecords(
        {entries_.size(), directory.size(), directoryOffset,
         out.size() - base + (offsetsIncludePrefix ? 0 : prefix.size()), zip64EndRecord,
         endRecordEntryCount, endRecordCentralDirectorySize, endRecordCentralDirectoryOffset},
        out);
    le(out, 2, archiveComment.size());
    append(out, archiveComment);
    return out;
}

void ZipBuilder::write(const std::string& path) const {
    writeFile(path, bytes());
}

StreamingZipWriter::StreamingZipWriter(const std::string& path)
    : out_(path, std::ios::binary | std::ios::trunc) {}

void StreamingZipWriter::writeHeaders(const ZipEntry& entry, std::uint64_t storedSize) {
    GWData local;
    appendZipEntry(entry, offset_, local, directory_);
    out_.write(reinterpret_cast<const char*>(local.data()), std::streamsize(local.size()));
    offset_ += local.size() - (entry.stored ? entry.stored->size() : 0) + storedSize;
    storedSizes_.push_back(storedSize);
}

void StreamingZipWriter::add(const std::string& name, const GWData& content, std::uint16_t method) {
    ZipEntry entry;
    entry.name = bytesOf(name);
    entry.content = content;
    entry.method = method;
    entry.stored = zipCompress(content, method);
    writeHeaders(entry, entry.stored->size());
}

void StreamingZipWriter::addZeros(const std::string& name, std::uint64_t size) {
    const GWData zeros(1 << 20, 0);
    uLong crc = ::crc32(0, nullptr, 0);
    for (std::uint64_t done = 0; done < size;) {
        const std::size_t piece = std::size_t(std::min<std::uint64_t>(zeros.size(), size - done));
        crc = ::crc32(crc, zeros.data(), uInt(piece));
        done += piece;
    }
    ZipEntry entry;
    entry.name = bytesOf(name);
    entry.stored = GWData();
    entry.crc32 = std::uint32_t(crc);
    entry.compressedSize = entry.uncompressedSize = size;
    writeHeaders(entry, size);
    // Skipping over the data leaves a hole that reads back as zeros.
    out_.seekp(std::streamoff(offset_));
}

bool StreamingZipWriter::finish() {
    const std::uint64_t directoryOffset = offset_;
    GWData end = directory_;
    appendEndRecords({storedSizes_.size(),
                      directory_.size(),
                      directoryOffset,
                      directoryOffset + directory_.size(),
                      storedSizes_.size() > 0xFFFF,
                      {},
                      {},
                      {}},
                     end);
    le(end, 2, 0);
    out_.write(reinterpret_cast<const char*>(end.data()), std::streamsize(end.size()));
    out_.close();
    return !out_.fail();
}

}  // namespace gwtest
