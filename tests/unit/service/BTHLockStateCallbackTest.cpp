#include "BTHLockStateCallback.h"

#include <gtest/gtest.h>

#include <atomic>
#include <future>

namespace berth {
namespace {

// Whether `queue` runs new work now: submit a marker and see whether it runs
// within `patienceMs` (a suspended queue holds it). Checks that expect the
// queue to run are patient; checks that expect it held need not be.
bool runsWork(const std::shared_ptr<WorkQueue>& queue, std::atomic<int>& counter,
              int patienceMs = 200) {
    int before = counter.load();
    queue->async([&counter] { ++counter; });
    // A barrier on an independent queue gives the pool time; the marker of a
    // running serial queue is done once a sync after it returns.
    auto probe = WorkQueue::makeSerial("probe");
    for (int i = 0; i < patienceMs && counter.load() == before; ++i)
        probe->sync([] { std::this_thread::sleep_for(std::chrono::milliseconds(1)); });
    return counter.load() > before;
}

TEST(BTHLockStateCallbackTest, SuspendsOnceWhileLockedAndResumesOnUnlock) {
    auto queue = WorkQueue::makeSerial("sys.kelp.berthd.lockstate");
    int state = 1;
    std::atomic<int> ran{0};
    BTHLockStateCallback callback(queue, [&] { return state; });
    EXPECT_EQ(callback.cachedLockState(), 3);

    callback.run();  // locked at start-up
    EXPECT_EQ(callback.cachedLockState(), 1);
    EXPECT_FALSE(runsWork(queue, ran));
    callback.run();  // a second lock notification must not suspend twice
    state = 2;       // transitional: nothing changes
    callback.run();
    EXPECT_EQ(callback.cachedLockState(), 1);

    state = 0;
    callback.run();  // one resume undoes the one suspend
    EXPECT_EQ(callback.cachedLockState(), 0);
    EXPECT_TRUE(runsWork(queue, ran, 10000));
    EXPECT_EQ(ran.load(), 2) << "work held while locked runs after the unlock";

    callback.run();  // unlocked again: no extra resume
    state = 1;
    callback.run();
    EXPECT_FALSE(runsWork(queue, ran));
    state = 0;
    callback.run();
    EXPECT_TRUE(runsWork(queue, ran, 10000));
}

TEST(BTHLockStateCallbackTest, UnlockedAtStartUpNeverResumes) {
    auto queue = WorkQueue::makeSerial("sys.kelp.berthd.lockstate");
    std::atomic<int> ran{0};
    BTHLockStateCallback callback(queue, [] { return 0; });
    callback.run();
    callback.run();
    EXPECT_EQ(callback.cachedLockState(), 0);
    EXPECT_TRUE(runsWork(queue, ran, 10000));
}

}  // namespace
}  // namespace berth
