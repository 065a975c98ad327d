#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <list>
#include <memory>
#include <mutex>
#include <span>
#include <utility>

#include "GWError.h"
#include "GWValue.h"

// Read-ahead for a source where every fetch costs a round trip: small reads
// are served from a few aligned blocks kept in least-recently-used order, so
// records that lie close together (an end record, local headers, a TOC
// checksum) arrive in one fetch. Large reads go straight to the source.
// Several readers of one source may share a cache from different threads;
// fetches run outside its lock.
class GWBlockCache {
public:
    // Fills `into` with the bytes at `offset`, all of them or fail.
    using Fetch =
        std::function<bool(std::uint64_t offset, std::span<std::uint8_t> into, GWErrorPtr* error)>;

    GWBlockCache(std::size_t blockSize, std::size_t blockCount);

    // Up to into.size() bytes at `offset` of a source of `sourceSize` bytes;
    // `got` falls short only at the end of the source.
    bool read(std::uint64_t offset, std::span<std::uint8_t> into, std::uint64_t sourceSize,
              const Fetch& fetch, std::size_t& got, GWErrorPtr* error);

    // Keeps bytes that were fetched anyway, from `offset` (a block boundary)
    // on, so the first read of an opened source costs nothing extra.
    void store(std::uint64_t offset, std::span<const std::uint8_t> bytes, std::uint64_t sourceSize);

    std::size_t blockSize() const { return blockSize_; }

private:
    using Block = std::shared_ptr<const GWData>;
    Block find(std::uint64_t block);
    void insert(std::uint64_t block, Block bytes);

    const std::size_t blockSize_;
    const std::size_t blockCount_;
    std::mutex mutex_;
    std::list<std::pair<std::uint64_t, Block>> blocks_;  // most recently used first
};
