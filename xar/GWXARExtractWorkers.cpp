// Writing the regular files of a directory tree on several threads.

#include <algorithm>
#include <thread>

#include "GWXARExtractOperation.h"
#include "foundation/GWOperationQueue.h"

struct GWXARExtractOperation::Workers {
    GWOperationQueuePtr queue = std::make_shared<GWOperationQueue>();
    std::mutex mutex;
    std::size_t submitted = 0;
    // The failure of the file submitted first among those that failed.
    std::optional<std::size_t> failedAt;
    GWErrorPtr failure;
    bool failureIsCancellation = false;
    std::atomic<bool> failed{false};

    Workers() {
        const long cores = long(std::max(1u, std::thread::hardware_concurrency()));
        queue->setMaxConcurrentOperationCount(2 * cores);
    }
};

void GWXARExtractOperation::extractFileOnWorker(const GWXARFilePtr& file, const GWURL& url) {
    if (!workers_) {
        workers_ = std::make_shared<Workers>();
    }
    auto workers = workers_;
    std::size_t order;
    {
        std::lock_guard lock(workers->mutex);
        order = workers->submitted++;
    }
    // The queue is waited for before this operation ends, so `this` outlives the block.
    workers->queue->addOperationWithBlock([this, workers, order, file, url] {
        {
            // Files before the first failure still run, so the one reported is the
            // first in tree order whatever order the workers reach them in.
            std::lock_guard lock(workers->mutex);
            if (workers->failedAt && *workers->failedAt < order &&
                !workers->failureIsCancellation) {
                return;
            }
        }
        GWErrorPtr error;
        if (isCancelled()) {
            error = cancelledError();
        } else if (extractFile(file, url, &error)) {
            return;
        }
        if (!error) {
            error = GWCocoaError(GWFileWriteUnknownError, url);
        }
        // A stream stopped by another file's failure reports a cancellation; the
        // failure that caused it is the one to report.
        const bool cancellation = error->is(kGWCocoaErrorDomain, GWUserCancelledError);
        std::lock_guard lock(workers->mutex);
        const bool replaces =
            !workers->failedAt ||
            (cancellation ? workers->failureIsCancellation && order < *workers->failedAt
                          : workers->failureIsCancellation || order < *workers->failedAt);
        if (replaces) {
            workers->failedAt = order;
            workers->failure = error;
            workers->failureIsCancellation = cancellation;
        }
        workers->failed.store(true);
    });
}

bool GWXARExtractOperation::workerFailed() const {
    return workers_ && workers_->failed.load();
}

bool GWXARExtractOperation::finishWorkers(GWErrorPtr* error) {
    if (!workers_) {
        return true;
    }
    workers_->queue->waitUntilAllOperationsAreFinished();
    std::lock_guard lock(workers_->mutex);
    return !workers_->failure || GWFail(error, workers_->failure);
}
