// Writing the regular files of a directory tree on several threads.

#include <algorithm>
#include <thread>

#include "GWXARExtractOperation.h"
#include "foundation/GWOperationQueue.h"

struct GWXARExtractOperation::Workers {
    GWOperationQueuePtr queue = std::make_shared<GWOperationQueue>();

    Workers() {
        const long cores = long(std::max(1u, std::thread::hardware_concurrency()));
        queue->setMaxConcurrentOperationCount(2 * cores);
    }
};

void GWXARExtractOperation::extractFileOnWorker(const GWXARFilePtr& file, const GWURL& url,
                                                std::size_t order) {
    if (!workers_) {
        workers_ = std::make_shared<Workers>();
    }
    // The queue is waited for before this operation ends, so `this` outlives the block.
    // Each file fails alone, so which worker reaches it first changes nothing.
    workers_->queue->addOperationWithBlock([this, order, file, url] {
        if (!isCancelled()) {
            extractEntry(file, url, order);
        }
    });
}

void GWXARExtractOperation::finishWorkers() {
    if (workers_) {
        workers_->queue->waitUntilAllOperationsAreFinished();
    }
}
