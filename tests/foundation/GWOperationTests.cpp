#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <memory>
#include <mutex>
#include <thread>
#include <vector>

#include "foundation/GWFoundation.h"

namespace {

using namespace std::chrono_literals;

// Bounds waits that must succeed, so that a fault fails instead of hanging.
constexpr auto kEventually = 10s;
// How long to watch for something that must not happen.
constexpr auto kMeanwhile = 30ms;

class Recorder {
public:
    void add(int value) {
        std::lock_guard<std::mutex> lock(mutex_);
        values_.push_back(value);
    }
    std::vector<int> values() const {
        std::lock_guard<std::mutex> lock(mutex_);
        return values_;
    }

private:
    mutable std::mutex mutex_;
    std::vector<int> values_;
};

class CountingOperation : public GWOperation {
public:
    void main() override {
        executingInsideMain = isExecuting();
        ++mainCalls;
    }
    std::atomic<int> mainCalls{0};
    std::atomic<bool> executingInsideMain{false};
};

// Stays executing after start() returns until the test finishes it.
class ManualOperation : public GWOperation {
public:
    bool isAsynchronous() const override { return true; }
    void main() override { started.signal(); }
    void complete() { finish(); }
    GWSemaphore started;
};

GWBlockOperationPtr recordingOperation(Recorder& recorder, int value) {
    return GWBlockOperation::blockOperationWithBlock([&recorder, value] { recorder.add(value); });
}

}  // namespace

TEST(GWOperation, StartRunsMainOnceAndADependencyOnItIsMetAtOnce) {
    auto operation = std::make_shared<CountingOperation>();
    EXPECT_TRUE(operation->isReady());
    operation->start();
    operation->start();
    EXPECT_EQ(operation->mainCalls, 1);
    EXPECT_TRUE(operation->executingInsideMain);
    EXPECT_FALSE(operation->isExecuting());
    EXPECT_TRUE(operation->isFinished());

    auto dependent = std::make_shared<CountingOperation>();
    dependent->addDependency(operation);
    dependent->addDependency(operation);
    dependent->addDependency(dependent);
    dependent->addDependency(nullptr);
    EXPECT_TRUE(dependent->isReady());
    EXPECT_EQ(dependent->dependencies().size(), 1u);

    // Block operations run their blocks in order, and ignore those added late.
    Recorder recorder;
    auto blocks = recordingOperation(recorder, 1);
    blocks->addExecutionBlock([&] { recorder.add(2); });
    blocks->addExecutionBlock(nullptr);
    EXPECT_EQ(blocks->executionBlocks().size(), 2u);
    blocks->start();
    blocks->addExecutionBlock([&] { recorder.add(3); });
    EXPECT_EQ(recorder.values(), (std::vector<int>{1, 2}));
}

TEST(GWOperation, CompletionBlockRunsOnceWhenCancelledBeforeStartOrWhenFinishIsRaced) {
    auto cancelled = std::make_shared<CountingOperation>();
    auto raced = std::make_shared<ManualOperation>();
    std::atomic<int> completions{0};
    std::atomic<bool> finishedInsideCompletion{false};
    cancelled->setCompletionBlock([&, raw = cancelled.get()] {
        finishedInsideCompletion = raw->isFinished();
        ++completions;
    });
    raced->setCompletionBlock([&] { ++completions; });
    cancelled->cancel();
    cancelled->start();
    cancelled->start();
    cancelled->waitUntilFinished();
    EXPECT_EQ(cancelled->mainCalls, 0);
    EXPECT_TRUE(cancelled->isCancelled() && cancelled->isFinished());
    EXPECT_TRUE(finishedInsideCompletion);

    raced->start();
    EXPECT_TRUE(raced->isExecuting());
    std::vector<std::thread> finishers;
    for (int i = 0; i < 4; ++i) {
        finishers.emplace_back([raced] { raced->complete(); });
    }
    for (auto& finisher : finishers) {
        finisher.join();
    }
    EXPECT_TRUE(raced->isFinished());
    EXPECT_EQ(completions, 2);
    EXPECT_FALSE(raced->completionBlock());
}

TEST(GWOperation, WaitersAndDependentsGoOnOnlyAfterTheCompletionBlockReturned) {
    GWOperationQueue first, second;
    auto operation = GWBlockOperation::blockOperationWithBlock([] {});
    GWSemaphore completionEntered, releaseCompletion, waiterReturned, dependentStarted;
    std::atomic<bool> completed{false};
    operation->setCompletionBlock([&] {
        completionEntered.signal();
        releaseCompletion.wait();
        completed = true;
    });
    std::atomic<bool> completedWhenWaitReturned{false}, completedWhenDependentRan{false};
    std::thread waiter([&] {
        operation->waitUntilFinished();
        completedWhenWaitReturned = completed.load();
        waiterReturned.signal();
    });
    auto dependent = GWBlockOperation::blockOperationWithBlock([&] {
        completedWhenDependentRan = completed.load();
        dependentStarted.signal();
    });
    dependent->addDependency(operation);
    second.addOperation(dependent);
    first.addOperation(operation);
    ASSERT_TRUE(completionEntered.wait(kEventually));
    EXPECT_TRUE(operation->isFinished());
    EXPECT_FALSE(waiterReturned.wait(kMeanwhile));
    EXPECT_FALSE(dependentStarted.wait(kMeanwhile));
    releaseCompletion.signal();
    waiter.join();
    ASSERT_TRUE(dependentStarted.wait(kEventually));
    EXPECT_TRUE(completedWhenWaitReturned);
    EXPECT_TRUE(completedWhenDependentRan);
}

TEST(GWOperation, DependenciesOrderExecutionAcrossQueues) {
    GWOperationQueue first, second;
    Recorder recorder;
    auto a = recordingOperation(recorder, 1);
    auto b = recordingOperation(recorder, 2);
    auto c = recordingOperation(recorder, 3);
    auto d = recordingOperation(recorder, 4);
    b->addDependency(a);
    c->addDependency(b);
    d->addDependency(c);
    d->addDependency(a);
    // Added last-first, so only the dependencies can produce the order.
    first.addOperation(d);
    second.addOperation(c);
    first.addOperation(b);
    second.addOperation(a);
    d->waitUntilFinished();
    EXPECT_EQ(recorder.values(), (std::vector<int>{1, 2, 3, 4}));
    EXPECT_EQ(d->dependencies().size(), 2u);
}

TEST(GWOperation, ADependencyThatNeverFinishesIsLeftByRemovalOrCancellation) {
    GWOperationQueue queue;
    auto never = std::make_shared<CountingOperation>();
    auto removed = std::make_shared<CountingOperation>();
    auto cancelled = std::make_shared<CountingOperation>();
    std::atomic<int> completions{0};
    cancelled->setCompletionBlock([&] { ++completions; });
    for (const auto& dependent : {removed, cancelled}) {
        dependent->addDependency(never);
        queue.addOperation(dependent);
    }
    removed->removeDependency(never);
    removed->waitUntilFinished();
    EXPECT_EQ(removed->mainCalls, 1);
    EXPECT_TRUE(removed->dependencies().empty());
    cancelled->cancel();
    cancelled->waitUntilFinished();
    EXPECT_EQ(cancelled->mainCalls, 0);
    EXPECT_EQ(completions, 1);
    EXPECT_FALSE(never->isFinished());
    queue.waitUntilAllOperationsAreFinished();
}

TEST(GWOperationQueue, NeverRunsMoreThanItsWidthAndReachesIt) {
    constexpr int kWidth = 3;
    constexpr int kOperations = 24;
    GWOperationQueue queue;
    queue.setMaxConcurrentOperationCount(kWidth);
    std::atomic<int> running{0}, peak{0}, started{0};
    GWSemaphore widthReached, gate;
    for (int i = 0; i < kOperations; ++i) {
        queue.addOperationWithBlock([&] {
            const int now = ++running;
            int seen = peak.load();
            while (now > seen && !peak.compare_exchange_weak(seen, now)) {
            }
            if (++started == kWidth) {
                widthReached.signal();
            }
            gate.wait();
            --running;
        });
    }
    ASSERT_TRUE(widthReached.wait(kEventually));
    EXPECT_EQ(running, kWidth);
    EXPECT_EQ(queue.operationCount(), std::size_t(kOperations));
    for (int i = 0; i < kOperations; ++i) {
        gate.signal();
    }
    queue.waitUntilAllOperationsAreFinished();
    EXPECT_EQ(peak, kWidth);
    EXPECT_EQ(started, kOperations);
    EXPECT_EQ(queue.operationCount(), 0u);
}

TEST(GWOperationQueue, AsynchronousOperationHoldsItsSlotUntilItFinishes) {
    GWOperationQueue queue;
    queue.setMaxConcurrentOperationCount(1);
    auto manual = std::make_shared<ManualOperation>();
    GWSemaphore nextRan;
    auto next = GWBlockOperation::blockOperationWithBlock([&] { nextRan.signal(); });
    queue.addOperation(manual);
    queue.addOperation(next);
    ASSERT_TRUE(manual->started.wait(kEventually));
    EXPECT_FALSE(nextRan.wait(kMeanwhile));
    EXPECT_TRUE(manual->isExecuting());
    EXPECT_FALSE(manual->isFinished());
    manual->complete();
    EXPECT_TRUE(nextRan.wait(kEventually));
    EXPECT_TRUE(manual->isFinished());
}

TEST(GWOperationQueue, WaitsForEveryCompletionAndCancelAllSkipsWhatIsPending) {
    GWOperationQueue queue;
    std::atomic<int> completions{0};
    std::vector<std::shared_ptr<CountingOperation>> operations;
    for (int i = 0; i < 40; ++i) {
        operations.push_back(std::make_shared<CountingOperation>());
        operations.back()->setCompletionBlock([&] { ++completions; });
    }
    queue.addOperations({operations.begin(), operations.begin() + 20}, true);
    EXPECT_EQ(completions, 20);
    queue.setSuspended(true);
    queue.addOperations({operations.begin() + 20, operations.end()}, false);
    queue.cancelAllOperations();
    queue.setSuspended(false);
    queue.waitUntilAllOperationsAreFinished();
    EXPECT_EQ(completions, 40);
    EXPECT_EQ(queue.operationCount(), 0u);
    for (int i = 0; i < 40; ++i) {
        EXPECT_EQ(operations[i]->mainCalls, i < 20 ? 1 : 0);
        EXPECT_TRUE(operations[i]->isFinished());
    }
}

// The shape of a batch extraction: children after their directory, and a
// final operation that reports the first error the completion blocks recorded.
TEST(GWOperationQueue, BatchReportsTheFirstErrorAndCancelsTheRest) {
    constexpr int kChildren = 300;
    constexpr int kFailing = 40;
    GWOperationQueue queue;
    // One at a time, so exactly the operations after the failing one are skipped.
    queue.setMaxConcurrentOperationCount(1);
    std::mutex slotMutex;
    int firstError = 0, reported = -1;
    std::atomic<bool> everyOneFinishedFirst{false};
    std::vector<std::shared_ptr<CountingOperation>> batch;
    for (int i = 0; i <= kChildren; ++i) {
        batch.push_back(std::make_shared<CountingOperation>());
        if (i > 0) {
            batch.back()->addDependency(batch.front());
        }
    }
    auto final = GWBlockOperation::blockOperationWithBlock([&] {
        everyOneFinishedFirst = std::all_of(
            batch.begin(), batch.end(), [](const auto& member) { return member->isFinished(); });
        std::lock_guard<std::mutex> lock(slotMutex);
        reported = firstError;
    });
    for (int i = 0; i <= kChildren; ++i) {
        batch[i]->setCompletionBlock([&, i] {
            std::lock_guard<std::mutex> lock(slotMutex);
            if (i == kFailing && firstError == 0) {
                firstError = kFailing;
            }
            if (firstError != 0) {
                for (const auto& member : batch) {
                    member->cancel();
                }
            }
        });
        final->addDependency(batch[i]);
        queue.addOperation(batch[i]);
    }
    queue.addOperation(final);
    final->waitUntilFinished();
    EXPECT_TRUE(everyOneFinishedFirst);
    EXPECT_EQ(reported, kFailing);
    for (int i = 0; i <= kChildren; ++i) {
        EXPECT_EQ(batch[i]->mainCalls, i <= kFailing ? 1 : 0) << i;
        EXPECT_TRUE(batch[i]->isFinished());
    }
    queue.waitUntilAllOperationsAreFinished();
}

TEST(GWOperationQueue, ADroppedQueueRunsWhatItHoldsAndMayBeDroppedByItsOwnOperation) {
    auto queue = std::make_shared<GWOperationQueue>();
    std::weak_ptr<GWOperationQueue> watch = queue;
    queue->setMaxConcurrentOperationCount(1);
    GWSemaphore gate;
    auto blocked = GWBlockOperation::blockOperationWithBlock([&gate, queue] { gate.wait(); });
    auto waiting = std::make_shared<CountingOperation>();
    waiting->setCompletionBlock([queue] {});
    waiting->addDependency(blocked);
    queue->addOperation(waiting);
    queue->addOperation(blocked);
    queue.reset();
    gate.signal();
    waiting->waitUntilFinished();
    blocked->waitUntilFinished();
    EXPECT_EQ(waiting->mainCalls, 1);
    EXPECT_TRUE(watch.expired());
}

TEST(GWOperationQueue, DefaultWidthRunsBlockingWorkSideBySide) {
    GWOperationQueue queue;
    EXPECT_EQ(queue.maxConcurrentOperationCount(),
              kGWOperationQueueDefaultMaxConcurrentOperationCount);
    // Each waits for all the others: only a queue at least this wide completes.
    const int count = int(std::max(1u, std::thread::hardware_concurrency())) * 2;
    std::atomic<int> arrived{0};
    GWSemaphore allArrived;
    std::atomic<int> timedOut{0};
    for (int i = 0; i < count; ++i) {
        queue.addOperationWithBlock([&] {
            if (++arrived == count) {
                for (int j = 0; j < count; ++j) {
                    allArrived.signal();
                }
            }
            if (!allArrived.wait(kEventually)) {
                ++timedOut;
            }
        });
    }
    queue.waitUntilAllOperationsAreFinished();
    EXPECT_EQ(timedOut, 0);
}
