#include "GWOperationQueue.h"

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <map>
#include <mutex>
#include <system_error>
#include <thread>
#include <unordered_map>
#include <utility>

#include "GWLog.h"

class GWOperationQueueCore;

namespace {

// Long enough that a batch of short operations reuses its workers.
constexpr std::chrono::seconds kWorkerIdleTimeout{5};

std::size_t defaultWidth() {
    const unsigned processors = std::max(1u, std::thread::hardware_concurrency());
    return std::size_t(processors) * 4;
}

// The queue whose worker runs on this thread, and the operations of that
// queue that finished here since the worker last took the lock: the worker
// settles them when it takes its next operation, under the same lock.
thread_local GWOperationQueueCore* tWorkerCore = nullptr;
thread_local std::vector<GWOperation*> tFinishedHere;

}  // namespace

// The queue's state, shared with its workers and with the hooks of the
// operations it holds, so that it outlives the GWOperationQueue object for as
// long as anything still runs.
class GWOperationQueueCore : public std::enable_shared_from_this<GWOperationQueueCore> {
public:
    enum class Phase { waiting, ready, running };
    struct Member {
        std::uint64_t sequence;
        GWOperationPtr operation;
        Phase phase;
    };

    mutable std::mutex mutex;
    std::condition_variable workAvailable;
    std::condition_variable allFinished;
    std::unordered_map<GWOperation*, Member> members;
    std::map<std::uint64_t, GWOperation*> readyOrder;
    std::deque<GWOperationPtr> handoff;
    std::size_t runningCount = 0;
    std::size_t idleWorkerCount = 0;
    // Started but not yet running: each takes work without being woken.
    std::size_t startingWorkerCount = 0;
    std::uint64_t nextSequence = 0;
    long maxConcurrentOperationCount = kGWOperationQueueDefaultMaxConcurrentOperationCount;
    bool suspended = false;
    std::string name;

    std::size_t width() const {
        return maxConcurrentOperationCount > 0 ? std::size_t(maxConcurrentOperationCount)
                                               : defaultWidth();
    }

    void add(const GWOperationPtr& operation) {
        std::unique_lock<std::mutex> lock(mutex);
        record(operation);
        drain(lock);
    }

    // Many under one lock: workers already running would otherwise queue on
    // it once per operation added.
    void add(const std::vector<GWOperationPtr>& operations) {
        std::unique_lock<std::mutex> lock(mutex);
        for (const GWOperationPtr& operation : operations) {
            record(operation);
        }
        drain(lock);
    }

    void record(const GWOperationPtr& operation) {
        // Finished by hand between attaching and here: its finish hook found
        // nothing to remove, so it must not be recorded now.
        if (operation->isFinished()) {
            return;
        }
        const std::uint64_t sequence = nextSequence++;
        const bool isReady = operation->isReady();
        members.emplace(operation.get(),
                        Member{sequence, operation, isReady ? Phase::ready : Phase::waiting});
        if (isReady) {
            readyOrder.emplace(sequence, operation.get());
        }
    }

    void readinessChanged(GWOperation* operation) {
        std::unique_lock<std::mutex> lock(mutex);
        const auto found = members.find(operation);
        if (found == members.end() || found->second.phase != Phase::waiting ||
            !operation->isReady()) {
            return;
        }
        found->second.phase = Phase::ready;
        readyOrder.emplace(found->second.sequence, operation);
        drain(lock);
    }

    void didFinish(GWOperation* operation) {
        if (tWorkerCore == this) {
            tFinishedHere.push_back(operation);
            return;
        }
        GWOperationPtr released;
        std::unique_lock<std::mutex> lock(mutex);
        released = settle(operation);
        drain(lock);
        lock.unlock();
    }

    // Forgets a finished operation; called with the lock held. The operation
    // is handed back so that it is destroyed once the lock is released.
    GWOperationPtr settle(GWOperation* operation) {
        const auto found = members.find(operation);
        if (found == members.end()) {
            return nullptr;
        }
        if (found->second.phase == Phase::running) {
            --runningCount;
        } else if (found->second.phase == Phase::ready) {
            readyOrder.erase(found->second.sequence);
        }
        GWOperationPtr released = std::move(found->second.operation);
        members.erase(found);
        if (members.empty()) {
            allFinished.notify_all();
        }
        return released;
    }

    std::vector<GWOperationPtr> snapshot() const {
        std::vector<std::pair<std::uint64_t, GWOperationPtr>> ordered;
        {
            std::lock_guard<std::mutex> lock(mutex);
            ordered.reserve(members.size());
            for (const auto& [pointer, member] : members) {
                ordered.emplace_back(member.sequence, member.operation);
            }
        }
        std::sort(ordered.begin(), ordered.end(),
                  [](const auto& a, const auto& b) { return a.first < b.first; });
        std::vector<GWOperationPtr> operations;
        operations.reserve(ordered.size());
        for (auto& entry : ordered) {
            operations.push_back(std::move(entry.second));
        }
        return operations;
    }

    // Hands ready operations to workers while slots are free. Called with the
    // lock held.
    void drain(std::unique_lock<std::mutex>& lock) {
        (void)lock;
        const std::size_t limit = width();
        while (!suspended && runningCount < limit && !readyOrder.empty()) {
            const auto first = readyOrder.begin();
            Member& member = members.at(first->second);
            readyOrder.erase(first);
            // A dependency added after it became ready sends it back.
            if (!member.operation->isReady()) {
                member.phase = Phase::waiting;
                continue;
            }
            member.phase = Phase::running;
            ++runningCount;
            handoff.push_back(member.operation);
            workAvailable.notify_one();
        }
        while (handoff.size() > idleWorkerCount + startingWorkerCount) {
            if (!startWorker()) {
                break;
            }
        }
    }

    bool startWorker() {
        try {
            std::thread(&GWOperationQueueCore::workerLoop, shared_from_this()).detach();
        } catch (const std::system_error& error) {
            // The workers already running pick the operations up later.
            GWLog("GWOperationQueue: cannot start a worker thread: %s", error.what());
            return false;
        }
        ++startingWorkerCount;
        return true;
    }

    static void workerLoop(std::shared_ptr<GWOperationQueueCore> core) { core->runWorker(); }

    void runWorker() {
        std::unique_lock<std::mutex> lock(mutex);
        --startingWorkerCount;
        std::vector<GWOperationPtr> released;
        for (;;) {
            if (!handoff.empty()) {
                GWOperationPtr operation = std::move(handoff.front());
                handoff.pop_front();
                lock.unlock();
                released.clear();
                tWorkerCore = this;
                operation->start();
                operation.reset();
                tWorkerCore = nullptr;
                lock.lock();
                for (GWOperation* finished : tFinishedHere) {
                    released.push_back(settle(finished));
                }
                tFinishedHere.clear();
                drain(lock);
                continue;
            }
            if (!released.empty()) {
                lock.unlock();
                released.clear();
                lock.lock();
                continue;
            }
            ++idleWorkerCount;
            const bool hasWork = workAvailable.wait_for(lock, kWorkerIdleTimeout,
                                                        [this] { return !handoff.empty(); });
            --idleWorkerCount;
            if (!hasWork) {
                return;
            }
        }
    }
};

GWOperationQueue::GWOperationQueue() : core_(std::make_shared<GWOperationQueueCore>()) {}

GWOperationQueue::~GWOperationQueue() = default;

long GWOperationQueue::maxConcurrentOperationCount() const {
    std::lock_guard<std::mutex> lock(core_->mutex);
    return core_->maxConcurrentOperationCount;
}

void GWOperationQueue::setMaxConcurrentOperationCount(long count) {
    std::unique_lock<std::mutex> lock(core_->mutex);
    core_->maxConcurrentOperationCount =
        count > 0 ? count : kGWOperationQueueDefaultMaxConcurrentOperationCount;
    core_->drain(lock);
}

bool GWOperationQueue::attach(const GWOperationPtr& operation) {
    if (!operation) {
        return false;
    }
    // The hooks hold the core, so a dropped queue still finishes its work; the
    // operation lets go of them when it finishes.
    const std::shared_ptr<GWOperationQueueCore> core = core_;
    GWOperation* const key = operation.get();
    return operation->attachToQueue(
        {[core, key] { core->readinessChanged(key); }, [core, key] { core->didFinish(key); }});
}

bool GWOperationQueue::addOperation(const GWOperationPtr& operation) {
    if (!attach(operation)) {
        return false;
    }
    core_->add(operation);
    return true;
}

void GWOperationQueue::addOperations(const std::vector<GWOperationPtr>& operations,
                                     bool waitUntilFinished) {
    std::vector<GWOperationPtr> added;
    for (const GWOperationPtr& operation : operations) {
        if (attach(operation)) {
            added.push_back(operation);
        }
    }
    core_->add(added);
    if (waitUntilFinished) {
        for (const GWOperationPtr& operation : added) {
            operation->waitUntilFinished();
        }
    }
}

void GWOperationQueue::addOperationWithBlock(std::function<void()> block) {
    addOperation(GWBlockOperation::blockOperationWithBlock(std::move(block)));
}

std::vector<GWOperationPtr> GWOperationQueue::operations() const {
    return core_->snapshot();
}

std::size_t GWOperationQueue::operationCount() const {
    std::lock_guard<std::mutex> lock(core_->mutex);
    return core_->members.size();
}

void GWOperationQueue::cancelAllOperations() {
    // Cancelling re-enters the core through the readiness hook.
    for (const GWOperationPtr& operation : core_->snapshot()) {
        operation->cancel();
    }
}

void GWOperationQueue::waitUntilAllOperationsAreFinished() {
    std::unique_lock<std::mutex> lock(core_->mutex);
    core_->allFinished.wait(lock, [this] { return core_->members.empty(); });
}

void GWOperationQueue::setSuspended(bool suspended) {
    std::unique_lock<std::mutex> lock(core_->mutex);
    core_->suspended = suspended;
    core_->drain(lock);
}

bool GWOperationQueue::isSuspended() const {
    std::lock_guard<std::mutex> lock(core_->mutex);
    return core_->suspended;
}

std::string GWOperationQueue::name() const {
    std::lock_guard<std::mutex> lock(core_->mutex);
    return core_->name;
}

void GWOperationQueue::setName(std::string name) {
    std::lock_guard<std::mutex> lock(core_->mutex);
    core_->name = std::move(name);
}
