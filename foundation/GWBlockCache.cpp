#include "GWBlockCache.h"

#include <algorithm>
#include <cstring>

GWBlockCache::GWBlockCache(std::size_t blockSize, std::size_t blockCount)
    : blockSize_(std::max<std::size_t>(blockSize, 1)),
      blockCount_(std::max<std::size_t>(blockCount, 1)) {}

GWBlockCache::Block GWBlockCache::find(std::uint64_t block) {
    std::lock_guard lock(mutex_);
    auto found = std::find_if(blocks_.begin(), blocks_.end(),
                              [block](const auto& entry) { return entry.first == block; });
    if (found == blocks_.end()) {
        return nullptr;
    }
    blocks_.splice(blocks_.begin(), blocks_, found);
    return found->second;
}

void GWBlockCache::insert(std::uint64_t block, Block bytes) {
    std::lock_guard lock(mutex_);
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
        insert(blockOffset / blockSize_,
               std::make_shared<const GWData>(piece.begin(), piece.end()));
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

    // A small read spans one block or two; both are held here, so another
    // reader evicting them meanwhile does no harm.
    const std::uint64_t first = offset / blockSize_;
    const std::uint64_t last = (end - 1) / blockSize_;
    Block blocks[2] = {find(first), last != first ? find(last) : nullptr};
    const std::size_t count = last != first ? 2 : 1;
    const bool needFirst = !blocks[0], needLast = count == 2 && !blocks[1];
    if (needFirst || needLast) {
        // The missing blocks of one read are adjacent: one fetch brings them.
        const std::uint64_t from = (needFirst ? first : last) * blockSize_;
        const std::uint64_t to =
            std::min<std::uint64_t>(((needLast ? last : first) + 1) * blockSize_, sourceSize);
        GWData fetched(std::size_t(to - from));
        if (!fetch(from, fetched, error)) {
            return false;
        }
        for (std::size_t index = 0; index < count; ++index) {
            const std::uint64_t blockStart = (first + index) * blockSize_;
            if (!blocks[index] && blockStart >= from && blockStart < to) {
                const auto piece = std::span<const std::uint8_t>(fetched).subspan(
                    std::size_t(blockStart - from),
                    std::size_t(std::min<std::uint64_t>(blockSize_, to - blockStart)));
                blocks[index] = std::make_shared<const GWData>(piece.begin(), piece.end());
                insert(first + index, blocks[index]);
            }
        }
    }
    for (std::size_t index = 0; index < count; ++index) {
        const std::uint64_t blockStart = (first + index) * blockSize_;
        const std::uint64_t from = std::max(offset, blockStart);
        const std::uint64_t to = std::min<std::uint64_t>(end, blockStart + blocks[index]->size());
        if (to <= from) {
            break;
        }
        std::memcpy(into.data() + (from - offset), blocks[index]->data() + (from - blockStart),
                    std::size_t(to - from));
        got = std::size_t(to - offset);
    }
    return true;
}
