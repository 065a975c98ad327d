#include "GWBlockCache.h"

#include <algorithm>
#include <cstring>

GWBlockCache::GWBlockCache(std::size_t blockSize, std::size_t blockCount)
    : blockSize_(std::max<std::size_t>(blockSize, 1)),
      // A read spans at most two blocks; both must survive its own fetch.
      blockCount_(std::max<std::size_t>(blockCount, 2)) {}

const GWData* GWBlockCache::find(std::uint64_t block) {
    auto found = std::find_if(blocks_.begin(), blocks_.end(),
                              [block](const auto& entry) { return entry.first == block; });
    if (found == blocks_.end()) {
        return nullptr;
    }
    blocks_.splice(blocks_.begin(), blocks_, found);
    return &blocks_.front().second;
}

void GWBlockCache::insert(std::uint64_t block, GWData bytes) {
    blocks_.remove_if([block](const auto& entry) { return entry.first == block; });
    blocks_.emplace_front(block, std::move(bytes));
    while (blocks_.size() > blockCount_) {
        blocks_.pop_back();
    }
}

void GWBlockCache::store(std::uint64_t offset, std::span<const std::uint8_t> bytes,
                         std::uint64_t sourceSize) {
    if (offset % blockSize_ != 0) {
        return;
    }
    for (std::size_t start = 0; start < bytes.size(); start += blockSize_) {
        const std::uint64_t blockOffset = offset + start;
        const std::size_t length = std::min(blockSize_, bytes.size() - start);
        // A block shorter than its size is whole only at the end of the source.
        if (length < blockSize_ && blockOffset + length != sourceSize) {
            return;
        }
        const auto piece = bytes.subspan(start, length);
        insert(blockOffset / blockSize_, GWData(piece.begin(), piece.end()));
    }
}

bool GWBlockCache::read(std::uint64_t offset, std::span<std::uint8_t> into,
                        std::uint64_t sourceSize, const Fetch& fetch, std::size_t& got,
                        GWErrorPtr* error) {
    got = 0;
    if (offset >= sourceSize || into.empty()) {
        return true;
    }
    const std::size_t length =
        std::size_t(std::min<std::uint64_t>(into.size(), sourceSize - offset));
    const std::uint64_t end = offset + length;
    if (length >= blockSize_) {
        if (!fetch(offset, into.first(length), error)) {
            return false;
        }
        got = length;
        return true;
    }

    const std::uint64_t first = offset / blockSize_;
    const std::uint64_t last = (end - 1) / blockSize_;
    std::uint64_t missingFirst = last + 1, missingLast = first;
    for (std::uint64_t block = first; block <= last; ++block) {
        if (!find(block)) {
            missingFirst = std::min(missingFirst, block);
            missingLast = std::max(missingLast, block);
        }
    }
    if (missingFirst <= last) {
        // The missing blocks of one read are adjacent: one fetch brings them.
        const std::uint64_t from = missingFirst * blockSize_;
        const std::uint64_t to =
            std::min<std::uint64_t>((missingLast + 1) * blockSize_, sourceSize);
        GWData fetched(std::size_t(to - from));
        if (!fetch(from, fetched, error)) {
            return false;
        }
        store(from, fetched, sourceSize);
    }
    for (std::uint64_t block = first; block <= last; ++block) {
        const GWData* bytes = find(block);
        const std::uint64_t blockStart = block * blockSize_;
        const std::uint64_t from = std::max(offset, blockStart);
        const std::uint64_t to =
            std::min<std::uint64_t>(end, blockStart + (bytes ? bytes->size() : 0));
        if (!bytes || to <= from) {
            break;
        }
        std::memcpy(into.data() + (from - offset), bytes->data() + (from - blockStart),
                    std::size_t(to - from));
        got = std::size_t(to - offset);
    }
    return true;
}
