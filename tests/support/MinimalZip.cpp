#include "MinimalZip.h"

#include <zlib.h>

#include "TestSupport.h"

namespace gwtest {

namespace {

void put16(GWData& out, std::uint32_t value) {
    out.push_back(std::uint8_t(value));
    out.push_back(std::uint8_t(value >> 8));
}

void put32(GWData& out, std::uint32_t value) {
    put16(out, value & 0xFFFF);
    put16(out, value >> 16);
}

constexpr std::uint16_t kVersionNeeded = 10;                         // 1.0: shrink and implode
constexpr std::uint16_t kVersionMadeBy = 3 << 8 | 20;                // Unix, 2.0
constexpr std::uint16_t kDosTime = 0;                                // 00:00:00
constexpr std::uint16_t kDosDate = (2020 - 1980) << 9 | 1 << 5 | 1;  // 2020-01-01

// The fields local and central headers share, from "version needed" on.
void putCommonFields(GWData& out, const MinimalZipEntry& entry) {
    put16(out, kVersionNeeded);
    put16(out, entry.flags);
    put16(out, entry.method);
    put16(out, kDosTime);
    put16(out, kDosDate);
    put32(out, entry.crc32);
    put32(out, std::uint32_t(entry.stored.size()));
    put32(out, entry.uncompressedSize);
    put16(out, std::uint16_t(entry.name.size()));
    put16(out, 0);  // extra field length
}

}  // namespace

MinimalZipEntry minimalZipEntry(std::string name, std::uint16_t method, std::uint16_t flags,
                                GWData stored, const GWData& original) {
    MinimalZipEntry entry;
    entry.name = std::move(name);
    entry.method = method;
    entry.flags = flags;
    entry.stored = std::move(stored);
    entry.uncompressedSize = std::uint32_t(original.size());
    entry.crc32 = std::uint32_t(crc32(0, original.data(), uInt(original.size())));
    return entry;
}

GWData minimalZipBytes(const std::vector<MinimalZipEntry>& entries) {
    GWData out, directory;
    for (const MinimalZipEntry& entry : entries) {
        const std::uint32_t offset = std::uint32_t(out.size());
        put32(out, 0x04034B50);
        putCommonFields(out, entry);
        out.insert(out.end(), entry.name.begin(), entry.name.end());
        out.insert(out.end(), entry.stored.begin(), entry.stored.end());

        put32(directory, 0x02014B50);
        put16(directory, kVersionMadeBy);
        putCommonFields(directory, entry);
        put16(directory, 0);               // comment length
        put16(directory, 0);               // disk number
        put16(directory, 0);               // internal attributes
        put32(directory, 0100644u << 16);  // external attributes: a regular file
        put32(directory, offset);
        directory.insert(directory.end(), entry.name.begin(), entry.name.end());
    }
    const std::uint32_t directoryOffset = std::uint32_t(out.size());
    out.insert(out.end(), directory.begin(), directory.end());
    put32(out, 0x06054B50);
    put16(out, 0);  // this disk
    put16(out, 0);  // disk with the directory
    put16(out, std::uint16_t(entries.size()));
    put16(out, std::uint16_t(entries.size()));
    put32(out, std::uint32_t(directory.size()));
    put32(out, directoryOffset);
    put16(out, 0);  // comment length
    return out;
}

void writeMinimalZip(const std::string& path, const std::vector<MinimalZipEntry>& entries) {
    writeFile(path, minimalZipBytes(entries));
}

}  // namespace gwtest
