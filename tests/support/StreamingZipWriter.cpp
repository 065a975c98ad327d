#include "StreamingZipWriter.h"

#include <zlib.h>

#include <algorithm>

#include "ZipBuilder.h"

namespace gwtest {

namespace {

void putLE(GWData& out, std::uint64_t value, int width) {
    for (int byte = 0; byte < width; ++byte) {
        out.push_back(std::uint8_t(value >> (8 * byte)));
    }
}

const std::uint16_t kTime = zipDOSTime(12, 0, 0);
const std::uint16_t kDate = zipDOSDate(2020, 1, 1);

}  // namespace

StreamingZipWriter::StreamingZipWriter(const std::string& path)
    : out_(path, std::ios::binary | std::ios::trunc) {}

void StreamingZipWriter::writeHeaders(const std::string& name, std::uint16_t method,
                                      std::uint32_t crc, std::uint64_t storedSize,
                                      std::uint64_t size) {
    // Fields both headers share, from "version needed" to the name length.
    GWData common;
    putLE(common, 20, 2);
    putLE(common, 0, 2);
    putLE(common, method, 2);
    putLE(common, kTime, 2);
    putLE(common, kDate, 2);
    putLE(common, crc, 4);
    putLE(common, storedSize, 4);
    putLE(common, size, 4);
    putLE(common, name.size(), 2);

    GWData local;
    putLE(local, 0x04034B50, 4);
    local.insert(local.end(), common.begin(), common.end());
    putLE(local, 0, 2);
    local.insert(local.end(), name.begin(), name.end());
    out_.write(reinterpret_cast<const char*>(local.data()), std::streamsize(local.size()));

    putLE(directory_, 0x02014B50, 4);
    putLE(directory_, (kZipHostUnix << 8) | 30, 2);
    directory_.insert(directory_.end(), common.begin(), common.end());
    putLE(directory_, 0, 2);  // extra field
    putLE(directory_, 0, 2);  // comment
    putLE(directory_, 0, 2);  // disk
    putLE(directory_, 0, 2);  // internal attributes
    putLE(directory_, 0100644u << 16, 4);
    putLE(directory_, offset_, 4);
    directory_.insert(directory_.end(), name.begin(), name.end());

    offset_ += local.size();
    members_.push_back({offset_, storedSize});
    offset_ += storedSize;
    ++count_;
}

void StreamingZipWriter::add(const std::string& name, const GWData& content, std::uint16_t method) {
    const GWData stored = zipCompress(content, method);
    const auto crc = std::uint32_t(::crc32(0, content.data(), uInt(content.size())));
    writeHeaders(name, method, crc, stored.size(), content.size());
    out_.write(reinterpret_cast<const char*>(stored.data()), std::streamsize(stored.size()));
}

void StreamingZipWriter::addZeros(const std::string& name, std::uint64_t size) {
    const GWData zeros(1 << 20, 0);
    uLong crc = ::crc32(0, nullptr, 0);
    for (std::uint64_t done = 0; done < size;) {
        const std::size_t piece = std::size_t(std::min<std::uint64_t>(zeros.size(), size - done));
        crc = ::crc32(crc, zeros.data(), uInt(piece));
        done += piece;
    }
    writeHeaders(name, 0, std::uint32_t(crc), size, size);
    // Skipping over the data leaves a hole that reads back as zeros.
    out_.seekp(std::streamoff(offset_));
}

bool StreamingZipWriter::finish() {
    const std::uint64_t directoryOffset = offset_;
    out_.write(reinterpret_cast<const char*>(directory_.data()),
               std::streamsize(directory_.size()));
    const std::uint64_t endOffset = directoryOffset + directory_.size();
    const bool zip64 = count_ > 0xFFFF;
    GWData end;
    if (zip64) {
        putLE(end, 0x06064B50, 4);
        putLE(end, 44, 8);
        putLE(end, 45, 2);
        putLE(end, 45, 2);
        putLE(end, 0, 4);
        putLE(end, 0, 4);
        putLE(end, count_, 8);
        putLE(end, count_, 8);
        putLE(end, directory_.size(), 8);
        putLE(end, directoryOffset, 8);
        putLE(end, 0x07064B50, 4);
        putLE(end, 0, 4);
        putLE(end, endOffset, 8);
        putLE(end, 1, 4);
    }
    putLE(end, 0x06054B50, 4);
    putLE(end, 0, 4);
    putLE(end, std::min<std::uint64_t>(count_, 0xFFFF), 2);
    putLE(end, std::min<std::uint64_t>(count_, 0xFFFF), 2);
    putLE(end, directory_.size(), 4);
    putLE(end, zip64 ? 0xFFFFFFFF : directoryOffset, 4);
    putLE(end, 0, 2);
    out_.write(reinterpret_cast<const char*>(end.data()), std::streamsize(end.size()));
    out_.close();
    return !out_.fail();
}

}  // namespace gwtest
