#pragma once

#include <cstdint>
#include <fstream>
#include <string>
#include <vector>

#include "foundation/GWValue.h"

namespace gwtest {

// Writes large ZIP archives straight to disk, member by member, for tests
// that need more entries or bytes than ZipBuilder should hold in memory.
// More than 65535 members get a Zip64 end record.
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
    // Where the member's data begins and how many bytes it has, by index.
    std::uint64_t dataOffset(std::size_t index) const { return members_[index].dataOffset; }
    std::uint64_t storedSize(std::size_t index) const { return members_[index].storedSize; }

private:
    struct Member {
        std::uint64_t dataOffset;
        std::uint64_t storedSize;
    };
    void writeHeaders(const std::string& name, std::uint16_t method, std::uint32_t crc,
                      std::uint64_t storedSize, std::uint64_t size);

    std::ofstream out_;
    std::uint64_t offset_ = 0;
    std::uint64_t count_ = 0;
    GWData directory_;
    std::vector<Member> members_;
};

}  // namespace gwtest
