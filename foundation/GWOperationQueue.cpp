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

namespace {

// Long enough that a batch of short operations reuses its workers.
constexpr std::chrono::seconds kWorkerIdleTimeout{5};

std::size_t defaultWidth() {
    const unsigned processors = std::max(1u, std::thread::hardware_concurrency());
    return std::size_t(processors) * 4;
}

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
        drain(lock);
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
        GWOperationPtr released;
        std::unique_lock<std::mutex> lock(mutex);
        const auto found = members.find(operation);
        if (found == members.end()) {
            return;
        }
        if (found->second.phase == Phase::running) {
            --runningCount;
        } else if (found->second.phase == Phase::ready) {
            readyOrder.erase(found->second.sequence);
        }
        released = std::move(found->second.operation);
        members.erase(found);
        drain(lock);
        if (members.empty()) {
            allFinished.notify_all();
        }
        lock.unlock();
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
        for (;;) {
            if (!handoff.empty()) {
                GWOperationPtr operation = std::move(handoff.front());
                handoff.pop_front();
                lock.unlock();
                operation->start();
                operation.reset();
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

bool GWOperationQueue::addOperation(const GWOperationPtr& operation) {
    if (!operation) {
        return false;
    }
    // The hooks hold the core, so a dropped queue still finishes its work; the
    // operation lets go of them when it finishes.
    const std::shared_ptr<GWOperationQueueCore> core = core_;
    GWOperation* const key = operation.get();
    GWOperation::QueueHooks hooks{[core, key] { core->readinessChanged(key); },
                                  [core, key] { core->didFinish(key); }};
    if (!operation->attachToQueue(std::move(hooks))) {
        return false;
    }
    core_->add(operation);
    return true;
}

void GWOperationQueue::addOperations(const std::vector<GWOperationPtr>& operations,
                                     bool waitUntilFinished) {
    std::vector<GWOperationPtr> added;
    for (const GWOperationPtr& operation : operations) {
        if (addOperation(operation)) {
            added.push_back(operation);
        }
    }
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
