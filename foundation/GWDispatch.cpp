#include "GWDispatch.h"

#include <algorithm>
#include <thread>

// Notifying under the lock: a waiter often owns the semaphore and may destroy
// it as soon as it sees the count, which must not happen mid-notify.
void GWSemaphore::signal() {
    std::lock_guard<std::mutex> lock(mutex_);
    ++count_;
    condition_.notify_one();
}

void GWSemaphore::wait() {
    std::unique_lock<std::mutex> lock(mutex_);
    condition_.wait(lock, [this] { return count_ > 0; });
    --count_;
}

bool GWSemaphore::wait(std::chrono::steady_clock::duration timeout) {
    std::unique_lock<std::mutex> lock(mutex_);
    if (!condition_.wait_for(lock, timeout, [this] { return count_ > 0; })) {
        return false;
    }
    --count_;
    return true;
}

void GWGroup::enter() {
    std::lock_guard<std::mutex> lock(mutex_);
    ++count_;
}

void GWGroup::leave() {
    std::vector<std::pair<GWDispatchQueuePtr, std::function<void()>>> notifications;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        if (count_ == 0) {
            return;
        }
        if (--count_ != 0) {
            return;
        }
        notifications = std::move(notifications_);
        notifications_.clear();
        condition_.notify_all();
    }
    for (auto& [queue, block] : notifications) {
        queue->async(std::move(block));
    }
}

void GWGroup::wait() {
    std::unique_lock<std::mutex> lock(mutex_);
    condition_.wait(lock, [this] { return count_ == 0; });
}

bool GWGroup::wait(std::chrono::steady_clock::duration timeout) {
    std::unique_lock<std::mutex> lock(mutex_);
    return condition_.wait_for(lock, timeout, [this] { return count_ == 0; });
}

void GWGroup::notify(const GWDispatchQueuePtr& queue, std::function<void()> block) {
    GWDispatchQueuePtr target = queue ? queue : GWDispatchQueue::globalQueue();
    {
        std::lock_guard<std::mutex> lock(mutex_);
        if (count_ != 0) {
            notifications_.emplace_back(std::move(target), std::move(block));
            return;
        }
    }
    target->async(std::move(block));
}

GWDispatchQueue::GWDispatchQueue(std::string label, bool serial, long width)
    : label_(std::move(label)), serial_(serial) {
    queue_.setName(label_);
    queue_.setMaxConcurrentOperationCount(width);
}

GWDispatchQueuePtr GWDispatchQueue::serialQueue(std::string label) {
    return GWDispatchQueuePtr(new GWDispatchQueue(std::move(label), true, 1));
}

GWDispatchQueuePtr GWDispatchQueue::globalQueue() {
    static const GWDispatchQueuePtr* const queue = [] {
        const long processors = long(std::max(1u, std::thread::hardware_concurrency()));
        return new GWDispatchQueuePtr(
            new GWDispatchQueue("GWDispatchQueue global", false, processors * 2));
    }();
    return *queue;
}

void GWDispatchQueue::async(std::function<void()> block) {
    if (block) {
        queue_.addOperationWithBlock(std::move(block));
    }
}

void GWDispatchQueue::sync(std::function<void()> block) {
    if (!block) {
        return;
    }
    if (!serial_) {
        block();
        return;
    }
    const GWBlockOperationPtr operation =
        GWBlockOperation::blockOperationWithBlock(std::move(block));
    queue_.addOperation(operation);
    operation->waitUntilFinished();
}
