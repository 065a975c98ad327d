#include "GWOperation.h"

#include <algorithm>
#include <utility>

void GWOperation::start() {
    // Whoever finishes this operation may drop the last outside reference.
    const GWOperationPtr keepAlive = weak_from_this().lock();
    bool skipMain = false;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        if (started_) {
            return;
        }
        started_ = true;
        skipMain = cancelled_.load();
        if (!skipMain) {
            state_.store(State::executing);
        }
    }
    if (skipMain) {
        finish();
        return;
    }
    main();
    if (!isAsynchronous()) {
        finish();
    }
}

bool GWOperation::markExecuting() {
    std::lock_guard<std::mutex> lock(mutex_);
    if (started_) {
        return false;
    }
    started_ = true;
    state_.store(State::executing);
    return true;
}

void GWOperation::finish() {
    const GWOperationPtr keepAlive = weak_from_this().lock();
    std::function<void()> completion;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        if (state_.load() == State::finished) {
            return;
        }
        started_ = true;
        state_.store(State::finished);
        completion = std::move(completionBlock_);
        completionBlock_ = nullptr;
    }
    if (completion) {
        completion();
        completion = nullptr;
    }
    std::vector<Dependent> dependents;
    QueueHooks hooks;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        released_ = true;
        dependents = std::move(dependents_);
        dependents_.clear();
        hooks = std::move(hooks_);
        hooks_ = QueueHooks();
        finishedCondition_.notify_all();
    }
    for (const Dependent& dependent : dependents) {
        if (const GWOperationPtr operation = dependent.weak.lock()) {
            operation->dependencyDidFinish();
        }
    }
    if (hooks.didFinish) {
        hooks.didFinish();
    }
}

void GWOperation::cancel() {
    if (cancelled_.exchange(true)) {
        return;
    }
    notifyReadinessChanged();
}

void GWOperation::addDependency(const GWOperationPtr& operation) {
    if (!operation || operation.get() == this) {
        return;
    }
    {
        std::lock_guard<std::mutex> lock(mutex_);
        // A batch's final operation depends on every other one: no linear scan.
        if (!dependencySet_.insert(operation.get()).second) {
            return;
        }
        dependencies_.push_back(operation);
    }
    operation->registerDependent(this);
}

void GWOperation::removeDependency(const GWOperationPtr& operation) {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        const auto found = std::find(dependencies_.begin(), dependencies_.end(), operation);
        if (found == dependencies_.end()) {
            return;
        }
        dependencies_.erase(found);
        dependencySet_.erase(operation.get());
    }
    operation->unregisterDependent(this);
}

std::vector<GWOperationPtr> GWOperation::dependencies() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return dependencies_;
}

void GWOperation::setCompletionBlock(std::function<void()> block) {
    std::lock_guard<std::mutex> lock(mutex_);
    completionBlock_ = std::move(block);
}

std::function<void()> GWOperation::completionBlock() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return completionBlock_;
}

void GWOperation::waitUntilFinished() {
    std::unique_lock<std::mutex> lock(mutex_);
    finishedCondition_.wait(lock, [this] { return released_; });
}

bool GWOperation::attachToQueue(QueueHooks hooks) {
    std::lock_guard<std::mutex> lock(mutex_);
    if (enqueued_ || started_) {
        return false;
    }
    enqueued_ = true;
    hooks_ = std::move(hooks);
    return true;
}

void GWOperation::notifyReadinessChanged() {
    std::function<void()> readinessChanged;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        readinessChanged = hooks_.readinessChanged;
    }
    if (readinessChanged) {
        readinessChanged();
    }
}

void GWOperation::dependencyDidFinish() {
    if (unfinishedDependencies_.fetch_sub(1) == 1) {
        notifyReadinessChanged();
    }
}

void GWOperation::registerDependent(GWOperation* dependent) {
    std::lock_guard<std::mutex> lock(mutex_);
    if (released_) {
        return;
    }
    // Counted under this lock so that finish() either sees the entry or the
    // dependent never counted it.
    dependents_.push_back(Dependent{dependent, dependent->weak_from_this()});
    dependent->unfinishedDependencies_.fetch_add(1);
}

void GWOperation::unregisterDependent(GWOperation* dependent) {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        const auto found = std::find_if(
            dependents_.begin(), dependents_.end(),
            [dependent](const Dependent& entry) { return entry.pointer == dependent; });
        if (found == dependents_.end()) {
            return;
        }
        dependents_.erase(found);
    }
    dependent->dependencyDidFinish();
}

GWBlockOperationPtr GWBlockOperation::blockOperationWithBlock(std::function<void()> block) {
    auto operation = std::make_shared<GWBlockOperation>();
    operation->addExecutionBlock(std::move(block));
    return operation;
}

void GWBlockOperation::addExecutionBlock(std::function<void()> block) {
    std::lock_guard<std::mutex> lock(blocksMutex_);
    if (block && !blocksTaken_) {
        blocks_.push_back(std::move(block));
    }
}

std::vector<std::function<void()>> GWBlockOperation::executionBlocks() const {
    std::lock_guard<std::mutex> lock(blocksMutex_);
    return blocks_;
}

void GWBlockOperation::main() {
    std::vector<std::function<void()>> blocks;
    {
        std::lock_guard<std::mutex> lock(blocksMutex_);
        blocksTaken_ = true;
        blocks = std::move(blocks_);
        blocks_.clear();
    }
    // Released as soon as they have run, like a completion block.
    for (auto& block : blocks) {
        block();
        block = nullptr;
    }
}
