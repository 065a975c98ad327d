#pragma once

#include <cstdint>
#include <fstream>
#include <initializer_list>
#include <optional>
#include <string>
#include <vector>

#include "foundation/GWValue.h"

namespace gwtest {

// Host systems (high byte of "version made by").
enum ZipHost : std::uint8_t {
    kZipHostMSDOS = 0,
    kZipHostUnix = 3,
    kZipHostMacintosh = 7,
    kZipHostNTFS = 10,
    kZipHostOSX = 19,
};

// `content` as ZIP method 8 (raw deflate) or 12 (bzip2) stores it; other
// methods return it unchanged.
GWData zipCompress(const GWData& content, std::uint16_t method);

// Appends each value as `width` bytes, least (putLE) or most (putBE)
// significant first.
void putLE(GWData& out, std::initializer_list<std::pair<std::uint64_t, int>> values);
void putBE(GWData& out, std::initializer_list<std::pair<std::uint64_t, int>> values);

std::uint16_t zipDOSTime(int hour, int minute, int second);  // second / 2 is stored
std::uint16_t zipDOSDate(int year, int month, int day);

// One member as the builder writes it. Everything the headers hold can be
// set; what is left alone is derived from `content` and `method`.
struct ZipEntry {
    GWData name;                      // stored as is: any bytes
    std::optional<GWData> localName;  // a different name in the local header
    GWData content;                   // the uncompressed data
    // The bytes that follow the local header; by default `content` stored,
    // deflated (8) or bzip2-compressed (12), for other methods `content`.
    std::optional<GWData> stored;

    std::uint8_t host = kZipHostUnix;
    std::uint16_t flags = 0;
    std::uint16_t method = 0;
    std::uint16_t dosTime = zipDOSTime(12, 0, 0);
    std::uint16_t dosDate = zipDOSDate(2020, 1, 1);
    std::uint32_t externalAttributes = 0100644u << 16;

    // Raw extra fields, central and local separately (see ZipExtraFields.h).
    GWData centralExtra;
    GWData localExtra;
    GWData comment;

    // Overrides of the derived values, in both headers.
    std::optional<std::uint32_t> crc32;
    std::optional<std::uint64_t> compressedSize;
    std::optional<std::uint64_t> uncompressedSize;
    // Written into the central record instead of the real offset.
    std::optional<std::uint64_t> centralLocalHeaderOffset;

    // Sets flag bit 3, zeroes CRC and sizes in the local header and writes a
    // descriptor (with its optional signature) after the data.
    bool dataDescriptor = false;
    bool dataDescriptorSignature = true;
    // Write 0xFFFFFFFF for the sizes (both headers) or the local header
    // offset (central record) and append a Zip64 extra block holding the true
    // values, in the standard order: uncompressed, compressed, offset.
    bool zip64Sizes = false;
    bool zip64Offset = false;
    // Leaves the local header and data out (the central record still points
    // where they would be).
    bool omitLocalHeader = false;

    // The values that will be written.
    GWData storedBytes() const;
    std::uint32_t effectiveCRC32() const;
};

// Writes ZIP archives record by record:
//
//     ZipBuilder zip;
//     zip.addFile("a.txt", bytesOf("hello"), 8).centralExtra = zipExtraBlock(0x5455, ...);
//     zip.addDirectory("dir/");
//     writeFile(path, zip.bytes());
class ZipBuilder {
public:
    ZipEntry& add(ZipEntry entry);
    ZipEntry& addFile(const std::string& name, GWData content, std::uint16_t method = 0);
    // Name should end in "/"; a Unix directory mode.
    ZipEntry& addDirectory(const std::string& name);
    // A Unix symbolic link whose data is the target.
    ZipEntry& addSymlink(const std::string& name, const std::string& target);
    std::vector<ZipEntry>& entries() { return entries_; }

    // Bytes before the archive (a self-extractor stub, say). Offsets in the
    // archive are relative to its own start unless `offsetsIncludePrefix`.
    GWData prefix;
    bool offsetsIncludePrefix = false;
    GWData archiveComment;
    // Writes a Zip64 end record and locator, and 0xFFFFFFFF / 0xFFFF in the
    // classic end record.
    bool zip64EndRecord = false;
    // Overrides of the end record's counts, size and offset.
    std::optional<std::uint16_t> endRecordEntryCount;
    std::optional<std::uint32_t> endRecordCentralDirectorySize;
    std::optional<std::uint32_t> endRecordCentralDirectoryOffset;

    GWData bytes() const;
    void write(const std::string& path) const;
    // Offsets of each entry's local header in the last bytes() (file offsets,
    // prefix included).
    const std::vector<std::uint64_t>& localHeaderOffsets() const { return offsets_; }

private:
    std::vector<ZipEntry> entries_;
    mutable std::vector<std::uint64_t> offsets_;
};

// Writes large archives straight to disk, member by member, for tests that
// need more entries or bytes than a ZipBuilder should hold in memory. More
// than 65535 members get a Zip64 end record.
class StreamingZipWriter {
public:
    explicit StreamingZipWriter(const std::string& path);

    // `content` stored (method 0) or deflated (8).
    void add(const std::string& name, const GWData& content, std::uint16_t method = 0);
    // A stored member of `size` zero bytes, left as a hole in the file.
    void addZeros(const std::string& name, std::uint64_t size);
    // Writes the central directory and the end records; false on a write error.
    bool finish();

    std::uint64_t centralDirectorySize() const { return directory_.size(); }
    std::uint64_t storedSize(std::size_t index) const { return storedSizes_[index]; }

private:
    void writeHeaders(const ZipEntry& entry, std::uint64_t storedSize);

    std::ofstream out_;
    std::uint64_t offset_ = 0;
    GWData directory_;
    std::vector<std::uint64_t> storedSizes_;
};

}  // namespace gwtest
