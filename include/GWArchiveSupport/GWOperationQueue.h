#pragma once

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "GWExport.h"
#include "GWOperation.h"

class GWOperationQueueCore;
using GWOperationQueuePtr = std::shared_ptr<GWOperationQueue>;

// The width a queue runs with until it is given one.
inline constexpr long kGWOperationQueueDefaultMaxConcurrentOperationCount = -1;

// Runs operations on a pool of worker threads of its own. Among the operations
// that are ready, the one added first starts first; no more than the width run
// at once, and an asynchronous operation keeps its slot until it finishes.
//
// Workers are started on demand and exit after a few idle seconds. The queue
// object may be dropped at any time, even from one of its own operations: what
// was added still runs to the end. An operation that never becomes ready (its
// dependency never runs) keeps its queue's state alive until it is cancelled.
class GW_EXPORT GWOperationQueue {
public:
    GWOperationQueue();
    GWOperationQueue(const GWOperationQueue&) = delete;
    GWOperationQueue& operator=(const GWOperationQueue&) = delete;
    ~GWOperationQueue();

    // kGWOperationQueueDefaultMaxConcurrentOperationCount (or any value below 1)
    // means four workers per processor: the library's operations mostly block on
    // file and network I/O rather than compute.
    long maxConcurrentOperationCount() const;
    void setMaxConcurrentOperationCount(long count);

    // False, and nothing happens, for a null operation or one that already
    // belongs to a queue or has started.
    bool addOperation(const GWOperationPtr& operation);
    void addOperations(const std::vector<GWOperationPtr>& operations, bool waitUntilFinished);
    void addOperationWithBlock(std::function<void()> block);

    // Operations added and not yet finished, in the order they were added.
    std::vector<GWOperationPtr> operations() const;
    std::size_t operationCount() const;
    void cancelAllOperations();
    // Must not be called from one of this queue's operations.
    void waitUntilAllOperationsAreFinished();

    // A suspended queue starts nothing new; running operations go on.
    void setSuspended(bool suspended);
    bool isSuspended() const;

    std::string name() const;
    void setName(std::string name);

private:
    // Gives the operation the hooks that tell the core of it.
    bool attach(const GWOperationPtr& operation);

    std::shared_ptr<GWOperationQueueCore> core_;
};
