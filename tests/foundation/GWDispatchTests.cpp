#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <numeric>
#include <thread>
#include <vector>

#include "foundation/GWFoundation.h"

namespace {

using namespace std::chrono_literals;

// Bounds waits that must succeed, so that a fault fails instead of hanging.
constexpr auto kEventually = 10s;
// How long to watch for something that must not happen.
constexpr auto kMeanwhile = 20ms;

}  // namespace

TEST(GWSemaphore, CountsSignalsAndTimesOutWithoutOne) {
    GWSemaphore semaphore(2);
    EXPECT_TRUE(semaphore.wait(0ms));
    EXPECT_TRUE(semaphore.wait(0ms));
    EXPECT_FALSE(semaphore.wait(kMeanwhile));
    semaphore.signal();
    semaphore.signal();
    semaphore.wait();
    EXPECT_TRUE(semaphore.wait(0ms));
    EXPECT_FALSE(semaphore.wait(0ms));
    // A negative start needs extra signals.
    GWSemaphore owing(-1);
    owing.signal();
    EXPECT_FALSE(owing.wait(0ms));
    owing.signal();
    EXPECT_TRUE(owing.wait(0ms));
    // A waiter on another thread wakes.
    std::atomic<bool> woke{false};
    std::thread waiter([&] { woke = semaphore.wait(kEventually); });
    semaphore.signal();
    waiter.join();
    EXPECT_TRUE(woke);
}

TEST(GWGroup, WaitsUntilEveryEnterIsMatched) {
    GWGroup group;
    EXPECT_TRUE(group.wait(0ms));
    group.enter();
    group.enter();
    EXPECT_FALSE(group.wait(kMeanwhile));
    group.leave();
    EXPECT_FALSE(group.wait(0ms));
    std::thread leaver([&] { group.leave(); });
    group.wait();
    leaver.join();
    EXPECT_TRUE(group.wait(0ms));
    // An unbalanced leave is ignored.
    group.leave();
    group.enter();
    EXPECT_FALSE(group.wait(0ms));
    group.leave();
    EXPECT_TRUE(group.wait(0ms));
}

TEST(GWGroup, NotifyRunsOnTheQueueOnceTheGroupEmpties) {
    GWGroup group;
    auto queue = GWDispatchQueue::serialQueue("group notify");
    std::atomic<bool> notified{false};
    GWSemaphore done;
    group.enter();
    group.enter();
    group.notify(queue, [&] {
        notified = true;
        done.signal();
    });
    group.leave();
    // Anything dispatched by the first leave would run before this.
    queue->sync([] {});
    EXPECT_FALSE(notified);
    group.leave();
    ASSERT_TRUE(done.wait(kEventually));
    EXPECT_TRUE(notified);

    // On an empty group it goes out at once; no queue means the global one.
    group.notify(nullptr, [&] { done.signal(); });
    EXPECT_TRUE(done.wait(kEventually));
}

TEST(GWDispatchQueue, SerialQueueRunsBlocksOneAtATimeInOrder) {
    auto queue = GWDispatchQueue::serialQueue("GWXARArchive setxattr queue");
    EXPECT_TRUE(queue->isSerial());
    std::vector<int> order;
    std::atomic<int> inside{0};
    std::atomic<bool> overlapped{false};
    for (int i = 0; i < 200; ++i) {
        queue->async([&, i] {
            if (++inside != 1) {
                overlapped = true;
            }
            order.push_back(i);
            --inside;
        });
    }
    int lastSeen = -1;
    queue->sync([&] { lastSeen = order.empty() ? -1 : order.back(); });
    EXPECT_EQ(lastSeen, 199);
    EXPECT_FALSE(overlapped);
    std::vector<int> expected(200);
    std::iota(expected.begin(), expected.end(), 0);
    EXPECT_EQ(order, expected);

    // A dropped queue still runs its blocks.
    GWSemaphore ran;
    GWDispatchQueue::serialQueue("short-lived")->async([&] { ran.signal(); });
    EXPECT_TRUE(ran.wait(kEventually));
}
