#pragma once

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "GWOperationQueue.h"

class GWDispatchQueue;
class GWSemaphore;
class GWGroup;
using GWDispatchQueuePtr = std::shared_ptr<GWDispatchQueue>;
using GWSemaphorePtr = std::shared_ptr<GWSemaphore>;
using GWGroupPtr = std::shared_ptr<GWGroup>;

// A counting semaphore. A negative start value needs that many extra signals
// before a wait succeeds.
class GWSemaphore {
public:
    explicit GWSemaphore(long value = 0) : count_(value) {}
    GWSemaphore(const GWSemaphore&) = delete;
    GWSemaphore& operator=(const GWSemaphore&) = delete;

    void signal();
    void wait();
    // True when signalled before the time-out ran out.
    bool wait(std::chrono::steady_clock::duration timeout);

private:
    std::mutex mutex_;
    std::condition_variable condition_;
    long count_;
};

// Counts outstanding pieces of work; waiters and notify blocks go on once every
// enter() has been matched by a leave(). A leave() without an enter() is ignored.
class GWGroup {
public:
    GWGroup() = default;
    GWGroup(const GWGroup&) = delete;
    GWGroup& operator=(const GWGroup&) = delete;

    void enter();
    void leave();
    void wait();
    // True when the group emptied before the time-out ran out.
    bool wait(std::chrono::steady_clock::duration timeout);
    // Runs `block` on `queue` (the global queue when none) as soon as the group
    // is empty: at once if it already is.
    void notify(const GWDispatchQueuePtr& queue, std::function<void()> block);

private:
    std::mutex mutex_;
    std::condition_variable condition_;
    std::size_t count_ = 0;
    std::vector<std::pair<GWDispatchQueuePtr, std::function<void()>>> notifications_;
};

// A labelled queue of blocks: serial (one at a time, in order) or the single
// process-wide concurrent queue.
class GWDispatchQueue {
public:
    static GWDispatchQueuePtr serialQueue(std::string label);
    // Width twice the processor count. Never destroyed, so blocks may still run
    // while the process exits.
    static GWDispatchQueuePtr globalQueue();

    GWDispatchQueue(const GWDispatchQueue&) = delete;
    GWDispatchQueue& operator=(const GWDispatchQueue&) = delete;

    const std::string& label() const { return label_; }
    bool isSerial() const { return serial_; }

    void async(std::function<void()> block);
    // Returns after `block` ran: on a serial queue after everything queued
    // before it (calling it from that same queue deadlocks); on the global
    // queue at once, on the calling thread.
    void sync(std::function<void()> block);

private:
    GWDispatchQueue(std::string label, bool serial, long width);

    const std::string label_;
    const bool serial_;
    GWOperationQueue queue_;
};
