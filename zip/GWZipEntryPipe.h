#pragma once

#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "foundation/GWDate.h"
#include "foundation/GWError.h"
#include "foundation/GWValue.h"

// A central directory record made ready for the tree: what the loader derives
// from the record and its local header.
struct GWZipParsedEntry {
    std::size_t nameStart = 0;  // in the batch's names
    std::size_t nameLength = 0;
    std::uint64_t compressedSize = 0;
    std::uint64_t uncompressedSize = 0;
    std::uint64_t localHeaderOffset = 0;
    // Where the entry's bytes (local header, data, descriptor) end, counted
    // like localHeaderOffset.
    std::uint64_t dataEnd = 0;
    std::uint32_t crc32 = 0;
    std::uint16_t compressionMethod = 0;
    std::uint16_t generalPurposeFlags = 0;
    std::uint16_t permissionsMode = 0;
    GWDate modificationDate;
    GWDictionary extraInfo;
};

// Parsed records in directory order. Their names share one buffer, so that
// the thread that frees them is spared a free per name of another thread's
// allocation.
struct GWZipParsedBatch {
    std::string names;
    std::vector<GWZipParsedEntry> entries;

    std::string_view name(const GWZipParsedEntry& entry) const {
        return std::string_view(names).substr(entry.nameStart, entry.nameLength);
    }
};

// Carries batches from the directory walk to the tree builder, which may run
// on two threads. A bounded pipe makes the walk wait for the builder.
class GWZipEntryPipe {
public:
    static constexpr std::size_t kUnbounded = SIZE_MAX;

    explicit GWZipEntryPipe(std::size_t capacity) : capacity_(capacity) {}

    // Waits for room; false once the reading side has abandoned the pipe.
    bool push(GWZipParsedBatch batch) {
        std::unique_lock lock(mutex_);
        changed_.wait(lock, [&] { return abandoned_ || batches_.size() < capacity_; });
        if (abandoned_) {
            return false;
        }
        batches_.push_back(std::move(batch));
        changed_.notify_all();
        return true;
    }

    // The walk's last word: whether every record was read, and if not, why
    // (an undecodable name fails without an error).
    void close(bool succeeded, GWErrorPtr error = nullptr) {
        std::lock_guard lock(mutex_);
        closed_ = true;
        succeeded_ = succeeded;
        error_ = std::move(error);
        changed_.notify_all();
    }

    // The next batch; none once the pipe is closed and drained.
    std::optional<GWZipParsedBatch> pop() {
        std::unique_lock lock(mutex_);
        changed_.wait(lock, [&] { return closed_ || !batches_.empty(); });
        if (batches_.empty()) {
            return std::nullopt;
        }
        GWZipParsedBatch batch = std::move(batches_.front());
        batches_.pop_front();
        changed_.notify_all();
        return batch;
    }

    // The reading side stops early; a waiting or later push fails.
    void abandon() {
        std::lock_guard lock(mutex_);
        abandoned_ = true;
        batches_.clear();
        changed_.notify_all();
    }

    bool succeeded() const {
        std::lock_guard lock(mutex_);
        return succeeded_;
    }
    GWErrorPtr error() const {
        std::lock_guard lock(mutex_);
        return error_;
    }

private:
    mutable std::mutex mutex_;
    std::condition_variable changed_;
    std::deque<GWZipParsedBatch> batches_;
    const std::size_t capacity_;
    bool closed_ = false;
    bool succeeded_ = false;
    bool abandoned_ = false;
    GWErrorPtr error_;
};
