#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "foundation/GWValue.h"

// The smallest ZIP that peer tools accept: local headers, central directory
// and end record; no extra fields, no Zip64, no data descriptors.
namespace gwtest {

struct MinimalZipEntry {
    std::string name;
    std::uint16_t method = 0;
    std::uint16_t flags = 0;  // general-purpose flags (implode: bits 1 and 2)
    GWData stored;            // the entry's data as it lies in the archive
    std::uint32_t uncompressedSize = 0;
    std::uint32_t crc32 = 0;
};

// An entry whose `stored` bytes decode to `original`.
MinimalZipEntry minimalZipEntry(std::string name, std::uint16_t method, std::uint16_t flags,
                                GWData stored, const GWData& original);

GWData minimalZipBytes(const std::vector<MinimalZipEntry>& entries);
void writeMinimalZip(const std::string& path, const std::vector<MinimalZipEntry>& entries);

}  // namespace gwtest
