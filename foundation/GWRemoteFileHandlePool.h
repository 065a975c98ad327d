#pragma once

#include <array>
#include <atomic>
#include <memory>
#include <mutex>
#include <vector>

#include "GWRemoteFileHandle.h"

// Open read handles on one archive, lent to the operations of one extraction
// one at a time, so that a batch of thousands of entries opens the file (or
// connects to the server) a handful of times instead of once per entry.
// Lending and taking back take no lock: workers would queue on it per entry.
class GWRemoteFileHandlePool {
public:
    explicit GWRemoteFileHandlePool(GWURL url) : url_(std::move(url)) {}
    GWRemoteFileHandlePool(const GWRemoteFileHandlePool&) = delete;
    GWRemoteFileHandlePool& operator=(const GWRemoteFileHandlePool&) = delete;

    // An idle handle, or a new one; none with the error of opening it. The
    // handle belongs to the pool, which must outlive its use.
    std::shared_ptr<GWRemoteFileHandle> acquire(GWErrorPtr* error);
    // Gives a handle back for the next operation.
    void release(const std::shared_ptr<GWRemoteFileHandle>& handle);

private:
    GWURL url_;
    std::array<std::atomic<GWRemoteFileHandle*>, 16> idle_{};
    std::mutex mutex_;
    std::vector<std::shared_ptr<GWRemoteFileHandle>> owned_;
};
