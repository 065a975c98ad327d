#pragma once

#include <atomic>
#include <condition_variable>
#include <cstddef>
#include <functional>
#include <memory>
#include <mutex>
#include <unordered_set>
#include <vector>

#include "GWExport.h"

class GWOperation;
class GWBlockOperation;
class GWOperationQueue;
using GWOperationPtr = std::shared_ptr<GWOperation>;
using GWBlockOperationPtr = std::shared_ptr<GWBlockOperation>;

// A cancellable unit of work with dependencies and a completion block. Create
// operations with std::make_shared: dependencies and queues track them through
// their shared ownership.
//
// Life cycle: pending -> executing -> finished, each step once. On finishing,
// the completion block runs first (isFinished() is already true inside it),
// then waitUntilFinished() returns, dependents become ready and the queue frees
// the slot. All members are thread-safe.
class GW_EXPORT GWOperation : public std::enable_shared_from_this<GWOperation> {
public:
    GWOperation() = default;
    GWOperation(const GWOperation&) = delete;
    GWOperation& operator=(const GWOperation&) = delete;
    virtual ~GWOperation() = default;

    // Runs the operation on the calling thread, once; later calls do nothing.
    // A cancelled operation finishes without calling main(). Dependencies are
    // not waited for: that is the queue's job.
    virtual void start();
    // The work itself; the default does nothing.
    virtual void main() {}
    // An asynchronous operation is still executing when start() returns and
    // calls finish() itself, from any thread; a queue keeps its slot until then.
    virtual bool isAsynchronous() const { return false; }

    // Cooperative: sets the flag that main() polls, and makes a pending
    // operation ready so that its queue starts it and it finishes at once.
    void cancel();
    bool isCancelled() const { return cancelled_.load(); }
    bool isExecuting() const { return state_.load() == State::executing; }
    bool isFinished() const { return state_.load() == State::finished; }
    // True when every dependency has finished and run its completion block,
    // or when the operation is cancelled.
    bool isReady() const { return cancelled_.load() || unfinishedDependencies_.load() == 0; }

    // Dependencies may live in any queue or be started by hand. Adding the
    // operation itself, a null or a duplicate is ignored; cycles never become
    // ready.
    void addDependency(const GWOperationPtr& operation);
    void removeDependency(const GWOperationPtr& operation);
    std::vector<GWOperationPtr> dependencies() const;

    // Runs exactly once, on the thread that finishes the operation, and is
    // released right after so that what it captures does not outlive it.
    void setCompletionBlock(std::function<void()> block);
    std::function<void()> completionBlock() const;

    // Returns once the operation finished and its completion block returned.
    void waitUntilFinished();

protected:
    // For subclasses that override start(): claims the single start and marks
    // the operation executing; false when it was already started or finished.
    bool markExecuting();
    // Moves the operation to finished and releases completion block,
    // waiters, dependents and queue slot, in that order. Later calls do nothing.
    void finish();

private:
    friend class GWOperationQueue;

    enum class State { pending, executing, finished };

    // How a queue learns that the operation became ready or finished.
    struct QueueHooks {
        std::function<void()> readinessChanged;
        std::function<void()> didFinish;
    };

    // False when the operation already belongs to a queue, or has started.
    bool attachToQueue(QueueHooks hooks);
    void notifyReadinessChanged();
    void dependencyDidFinish();
    // Counts this operation as waiting for `dependent` unless this one is done.
    void registerDependent(GWOperation* dependent);
    void unregisterDependent(GWOperation* dependent);

    struct Dependent {
        GWOperation* pointer;
        std::weak_ptr<GWOperation> weak;
    };

    mutable std::mutex mutex_;
    std::condition_variable finishedCondition_;
    std::atomic<State> state_{State::pending};
    std::atomic<bool> cancelled_{false};
    std::atomic<std::size_t> unfinishedDependencies_{0};
    bool started_ = false;
    bool released_ = false;
    bool enqueued_ = false;
    std::vector<GWOperationPtr> dependencies_;
    std::unordered_set<const GWOperation*> dependencySet_;
    std::vector<Dependent> dependents_;
    std::function<void()> completionBlock_;
    QueueHooks hooks_;
};

// Runs its blocks one after another, in the order they were added.
class GW_EXPORT GWBlockOperation : public GWOperation {
public:
    static GWBlockOperationPtr blockOperationWithBlock(std::function<void()> block);

    // Ignored once the operation has started.
    void addExecutionBlock(std::function<void()> block);
    std::vector<std::function<void()>> executionBlocks() const;

    void main() override;

private:
    mutable std::mutex blocksMutex_;
    std::vector<std::function<void()>> blocks_;
    bool blocksTaken_ = false;
};
