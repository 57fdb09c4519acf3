// Work queues and the thread pool under them: ordering, mutual exclusion,
// suspension, targets, synchronous calls, lifetime, and progress while many
// handlers are blocked.
//
// Waits that expect something to happen have a generous deadline only so a
// broken queue fails instead of hanging the suite; checks that something does
// NOT happen give a broken queue a short while to misbehave first.
#include "platform/WorkQueue.h"

#include <sys/resource.h>
#include <sys/syscall.h>

#include <tuple>

#include "TestSupport.h"

namespace berth {
namespace {

using namespace std::chrono_literals;
using test::Event;
using test::eventually;

// How long a deliberately blocked item waits for its release: longer than
// any wait of a check, so such a check fails before the items give up.
constexpr std::chrono::milliseconds kBlocked = 10min;

// Time for a faulty queue to run something it should not.
void giveChanceToMisbehave() {
    std::this_thread::sleep_for(50ms);
}

// Records the largest number of holders seen inside at once.
class OverlapMeter {
  public:
    void enter() {
        const int now = ++inside_;
        int seen = most_.load();
        while (now > seen && !most_.compare_exchange_weak(seen, now)) {
        }
    }
    void leave() { --inside_; }
    int most() const { return most_.load(); }

  private:
    std::atomic<int> inside_{0};
    std::atomic<int> most_{0};
};

int currentNice() {
    errno = 0;
    return ::getpriority(PRIO_PROCESS, static_cast<id_t>(::syscall(SYS_gettid)));
}

using WorkQueueDeathTest = test::ThreadsafeDeathTest;

TEST(WorkQueueTest, SerialQueueRunsOneItemAtATimeInSubmissionOrder) {
    auto queue = WorkQueue::makeSerial("test.serial");
    constexpr int kThreads = 4;
    constexpr int kPerThread = 500;
    OverlapMeter meter;
    // Deliberately unsynchronised: only the queue's serialisation protects it.
    std::vector<std::pair<int, int>> order;

    std::vector<std::thread> submitters;
    for (int t = 0; t < kThreads; ++t) {
        submitters.emplace_back([&, t] {
            for (int i = 0; i < kPerThread; ++i) {
                queue->async([&, t, i] {
                    meter.enter();
                    order.emplace_back(t, i);
                    meter.leave();
                });
            }
        });
    }
    for (auto& s : submitters) s.join();
    const size_t seen = queue->sync([&] { return order.size(); });

    EXPECT_EQ(seen, size_t{kThreads * kPerThread});
    EXPECT_EQ(meter.most(), 1);
    std::vector<int> next(kThreads, 0);
    for (const auto& [t, i] : order) {
        ASSERT_EQ(i, next[t]) << "items of submitter " << t << " ran out of order";
        ++next[t];
    }
}

TEST(WorkQueueTest, ConcurrentQueueRunsItemsSideBySide) {
    auto queue = WorkQueue::makeConcurrent("test.concurrent");
    constexpr int kItems = 6;
    std::atomic<int> arrived{0};
    std::atomic<int> sawAll{0};
    Event done;
    for (int i = 0; i < kItems; ++i) {
        queue->async([&] {
            ++arrived;
            // Only items running at the same time can all get past this.
            if (eventually([&] { return arrived.load() == kItems; })) ++sawAll;
            if (sawAll.load() == kItems) done.set();
        });
    }
    ASSERT_TRUE(done.wait());
    EXPECT_EQ(sawAll.load(), kItems);
}

TEST(WorkQueueTest, SyncReturnsResultAfterEarlierItemsAndPassesOnExceptions) {
    auto queue = WorkQueue::makeSerial("test.sync");
    Event release;
    int counter = 0;  // touched only on the queue
    queue->async([&] { release.wait(kBlocked); });
    for (int i = 0; i < 100; ++i) queue->async([&] { ++counter; });

    std::atomic<bool> syncReturned{false};
    int seenBySync = -1;
    std::thread caller([&] {
        seenBySync = queue->sync([&] { return counter; });
        syncReturned = true;
    });
    giveChanceToMisbehave();
    EXPECT_FALSE(syncReturned.load()) << "sync returned while an earlier item was still blocked";
    release.set();
    caller.join();
    EXPECT_EQ(seenBySync, 100);

    // Move-only results, references and exceptions cross back to the caller.
    auto owned = queue->sync([] { return std::make_unique<int>(7); });
    ASSERT_TRUE(owned);
    EXPECT_EQ(*owned, 7);
    int& ref = queue->sync([&]() -> int& { return counter; });
    EXPECT_EQ(&ref, &counter);
    EXPECT_THROW(queue->sync([]() -> int { throw std::runtime_error("from the queue"); }),
                 std::runtime_error);
    // The queue keeps working after an item threw.
    EXPECT_EQ(queue->sync([&] { return counter; }), 100);
}

TEST(WorkQueueTest, SyncOntoAnIdleSerialQueueRunsOnTheCallerAndHoldsTheQueue) {
    auto queue = WorkQueue::makeSerial("test.sync.inline");
    Event entered, release;
    std::vector<int> order;  // touched only on the queue
    std::thread::id ranOn;
    bool current = false;
    std::thread caller([&] {
        queue->sync([&] {
            ranOn = std::this_thread::get_id();
            current = queue->isCurrent();
            entered.set();
            release.wait(kBlocked);
            order.push_back(1);
        });
    });
    ASSERT_TRUE(entered.wait());
    // Submitted while the sync holds the queue: runs after it, not beside it.
    Event ranAfter;
    queue->async([&] {
        order.push_back(2);
        ranAfter.set();
    });
    giveChanceToMisbehave();
    EXPECT_FALSE(ranAfter.isSet()) << "an item ran while a sync held the serial queue";
    release.set();
    ASSERT_TRUE(ranAfter.wait());
    const std::thread::id callerId = caller.get_id();
    caller.join();
    EXPECT_EQ(ranOn, callerId);
    EXPECT_TRUE(current);
    EXPECT_EQ(order, (std::vector<int>{1, 2}));
    // Once the drain that ran the item has let go, syncs run inline again.
    EXPECT_TRUE(eventually([&] {
        return queue->sync([] { return std::this_thread::get_id(); }) == std::this_thread::get_id();
    }));
}

TEST(WorkQueueTest, SyncOntoConcurrentQueueFromItsOwnItemFinishes) {
    auto queue = WorkQueue::makeConcurrent("test.concurrent.reentry");
    const int result = queue->sync([&] { return queue->sync([] { return 41; }) + 1; });
    EXPECT_EQ(result, 42);
}

TEST(WorkQueueTest, SuspendedQueueStartsNothingUntilResumedAsOftenAsSuspended) {
    for (const auto kind : {WorkQueue::Kind::serial, WorkQueue::Kind::concurrent}) {
        SCOPED_TRACE(kind == WorkQueue::Kind::serial ? "serial" : "concurrent");
        auto queue = kind == WorkQueue::Kind::serial ? WorkQueue::makeSerial("test.suspend")
                                                     : WorkQueue::makeConcurrent("test.suspend");
        std::atomic<int> ran{0};
        queue->suspend();
        queue->suspend();
        for (int i = 0; i < 10; ++i) queue->async([&] { ++ran; });

        giveChanceToMisbehave();
        EXPECT_EQ(ran.load(), 0);
        queue->resume();
        giveChanceToMisbehave();
        EXPECT_EQ(ran.load(), 0) << "one resume undid two suspends";

        queue->resume();
        EXPECT_TRUE(eventually([&] { return ran.load() == 10; }));
    }
}

TEST(WorkQueueTest, ItemRunningWhenSuspendedFinishesAndTheNextWaits) {
    auto queue = WorkQueue::makeSerial("test.suspend.running");
    Event started, release, firstDone, secondRan;
    queue->async([&] {
        started.set();
        release.wait(kBlocked);
        firstDone.set();
    });
    queue->async([&] { secondRan.set(); });

    ASSERT_TRUE(started.wait());
    queue->suspend();
    release.set();
    EXPECT_TRUE(firstDone.wait());
    giveChanceToMisbehave();
    EXPECT_FALSE(secondRan.isSet());

    queue->resume();
    EXPECT_TRUE(secondRan.wait());
}

TEST(WorkQueueTest, ItemMaySuspendItsOwnQueueToHoldBackLaterWork) {
    // The lock-state callback's pattern: suspend from work on a queue and
    // resume later from elsewhere. Everything is queued before it runs, so
    // the later item is pending when the earlier one suspends.
    auto queue = WorkQueue::makeSerial("test.lockstate");
    Event submitted, secondRan;
    std::vector<int> order;
    queue->async([&] { submitted.wait(); });
    queue->async([&] {
        order.push_back(1);
        queue->suspend();
    });
    queue->async([&] {
        order.push_back(2);
        secondRan.set();
    });
    submitted.set();
    giveChanceToMisbehave();
    EXPECT_FALSE(secondRan.isSet());
    queue->resume();
    ASSERT_TRUE(secondRan.wait());
    EXPECT_EQ(order, (std::vector<int>{1, 2}));
}

TEST(WorkQueueTest, TargetQueueSerialisesTheQueuesOnItAndTheirSuspension) {
    auto target = WorkQueue::makeSerial("test.target");
    auto serialA = WorkQueue::makeSerial("test.a");
    auto serialB = WorkQueue::makeSerial("test.b");
    auto concurrent = WorkQueue::makeConcurrent("test.c");
    for (auto* q : {&serialA, &serialB, &concurrent}) (*q)->setTarget(target);
    EXPECT_EQ(serialA->target(), target);

    OverlapMeter meter;
    std::atomic<int> ran{0};
    auto work = [&] {
        meter.enter();
        std::this_thread::yield();
        meter.leave();
        ++ran;
    };
    for (int i = 0; i < 200; ++i) {
        serialA->async(work);
        serialB->async(work);
        concurrent->async(work);
        target->async(work);
    }
    ASSERT_TRUE(eventually([&] { return ran.load() == 800; }));
    EXPECT_EQ(meter.most(), 1);

    // Suspending the target holds back the work of the queues on it.
    target->suspend();
    Event ranWhileTargetSuspended;
    serialA->async([&] { ranWhileTargetSuspended.set(); });
    giveChanceToMisbehave();
    EXPECT_FALSE(ranWhileTargetSuspended.isSet());
    target->resume();
    EXPECT_TRUE(ranWhileTargetSuspended.wait());
}

TEST(WorkQueueTest, CurrentQueueIsKnownInsideItsWorkAndItsTargets) {
    auto target = WorkQueue::makeSerial("test.outer");
    auto inner = WorkQueue::makeSerial("test.inner");
    auto other = WorkQueue::makeSerial("test.other");
    inner->setTarget(target);
    const auto seen = inner->sync([&] {
        return std::tuple(WorkQueue::current(), inner->isCurrent(), target->isCurrent(),
                          other->isCurrent());
    });
    EXPECT_EQ(seen, std::tuple(static_cast<const WorkQueue*>(inner.get()), true, true, false));
    EXPECT_EQ(WorkQueue::current(), nullptr);
    EXPECT_FALSE(inner->isCurrent());
}

TEST(WorkQueueTest, ReleasedQueueStillRunsPendingItemsInOrderThenGoes) {
    auto queue = WorkQueue::makeSerial("test.released");
    std::weak_ptr<WorkQueue> watch = queue;
    Event release;
    std::mutex mutex;
    std::vector<int> order;
    queue->async([&] { release.wait(kBlocked); });
    for (int i = 0; i < 10; ++i) {
        queue->async([&, i] {
            std::lock_guard lock(mutex);
            order.push_back(i);
        });
    }
    queue.reset();
    EXPECT_FALSE(watch.expired()) << "pending work must keep its queue";

    release.set();
    EXPECT_TRUE(eventually([&] { return watch.expired(); }));
    std::lock_guard lock(mutex);
    EXPECT_EQ(order, (std::vector<int>{0, 1, 2, 3, 4, 5, 6, 7, 8, 9}));
}

TEST(WorkQueueTest, QueueReleasedWhileSuspendedDestroysPendingItemsUnrun) {
    auto queue = WorkQueue::makeSerial("test.released.suspended");
    std::weak_ptr<WorkQueue> watch = queue;
    auto token = std::make_shared<int>(0);
    std::weak_ptr<int> tokenWatch = token;
    std::atomic<int> ran{0};
    queue->suspend();
    for (int i = 0; i < 5; ++i) queue->async([&ran, token] { ++ran; });
    token.reset();
    EXPECT_FALSE(tokenWatch.expired());

    queue.reset();
    EXPECT_TRUE(watch.expired());
    EXPECT_TRUE(tokenWatch.expired()) << "pending items leaked";
    EXPECT_EQ(ran.load(), 0);
}

TEST(WorkQueueTest, BlockedHandlersDoNotStopOtherQueues) {
    // More handlers blocked (as on identifier locks) than there are cores.
    const int blocked = static_cast<int>(4 * std::max(1u, std::thread::hardware_concurrency())) + 8;
    Event release;
    std::atomic<int> blockedRunning{0};
    std::atomic<int> blockedDone{0};
    std::vector<std::shared_ptr<WorkQueue>> peers;
    for (int i = 0; i < blocked; ++i) {
        peers.push_back(WorkQueue::makeSerial("test.peer." + std::to_string(i)));
        peers.back()->async([&] {
            ++blockedRunning;
            release.wait(kBlocked);
            ++blockedDone;
        });
    }
    ASSERT_TRUE(eventually([&] { return blockedRunning.load() == blocked; }))
        << "only " << blockedRunning.load() << " of " << blocked << " handlers started";

    auto other = WorkQueue::makeSerial("test.progress");
    auto background = WorkQueue::makeSerial("test.progress.bg", QueuePriority::background);
    std::atomic<int> progressed{0};
    for (int i = 0; i < 100; ++i) {
        other->async([&] { ++progressed; });
        background->async([&] { ++progressed; });
    }
    EXPECT_TRUE(eventually([&] { return progressed.load() == 200; }));
    EXPECT_EQ(blockedDone.load(), 0);

    release.set();
    EXPECT_TRUE(eventually([&] { return blockedDone.load() == blocked; }));
}

TEST(WorkQueueTest, BackgroundQueuesRunAtLowerPriority) {
    const int base = currentNice();
    if (base > 9) GTEST_SKIP() << "already running at niceness " << base;
    const int normal = WorkQueue::makeSerial("test.prio.normal")->sync(currentNice);
    const int background =
        WorkQueue::makeSerial("test.prio.bg", QueuePriority::background)->sync(currentNice);
    EXPECT_EQ(background, normal + 10);
}

TEST(ThreadPoolTest, GrowsWhileWorkWaitsUpToItsCapAndIdleWorkersExit) {
    ThreadPool pool({.name = "test-pool", .maxThreads = 3, .idleTimeout = 50ms});
    Event release;
    std::atomic<int> started{0};
    std::atomic<int> finished{0};
    for (int i = 0; i < 4; ++i) {
        pool.execute([&] {
            ++started;
            release.wait(kBlocked);
            ++finished;
        });
    }
    ASSERT_TRUE(eventually([&] { return started.load() == 3; }));
    EXPECT_EQ(pool.threadCount(), 3u);
    // The fourth waits for a worker: the cap holds.
    EXPECT_EQ(pool.pendingCount(), 1u);
    giveChanceToMisbehave();
    EXPECT_EQ(started.load(), 3);

    release.set();
    EXPECT_TRUE(eventually([&] { return finished.load() == 4; }));
    EXPECT_TRUE(eventually([&] { return pool.threadCount() == 0; })) << "idle workers stayed";

    // A retired pool starts workers again for new work.
    Event ranAgain;
    pool.execute([&] { ranAgain.set(); });
    EXPECT_TRUE(ranAgain.wait());
}

TEST(ThreadPoolTest, BurstOfShortItemsIsServedByTheWorkersThereAre) {
    // A stall threshold never reached: only the immediate workers exist.
    ThreadPool pool({.name = "test-burst", .immediateThreads = 2, .stallThreshold = 1h});
    std::atomic<int> ran{0};
    for (int i = 0; i < 1000; ++i) pool.execute([&] { ++ran; });
    EXPECT_TRUE(eventually([&] { return ran.load() == 1000; }));
    EXPECT_LE(pool.threadCount(), 2u);
}

TEST(ThreadPoolTest, ItemsWaitingBehindBlockedWorkersGetNewWorkers) {
    ThreadPool pool({.name = "test-stall",
                     .maxThreads = 16,
                     .immediateThreads = 1,
                     .stallThreshold = 20ms,
                     .idleTimeout = 50ms});
    Event release;
    std::atomic<int> started{0};
    for (int i = 0; i < 6; ++i) {
        pool.execute([&] {
            ++started;
            release.wait(kBlocked);
        });
    }
    EXPECT_TRUE(eventually([&] { return started.load() == 6; }))
        << "only " << started.load() << " blocked items started";
    // Later work is not held up either, once no spare worker is left and the
    // monitor has long had nothing to watch.
    std::this_thread::sleep_for(100ms);
    EXPECT_TRUE(eventually([&] { return pool.threadCount() == 6 && pool.idleThreadCount() == 0; }));
    Event later;
    pool.execute([&] { later.set(); });
    EXPECT_TRUE(later.wait());
    release.set();
}

TEST(ThreadPoolTest, StoppingWaitsForRunningItemsAndDropsWaitingOnes) {
    auto pool =
        std::make_unique<ThreadPool>(ThreadPool::Options{.name = "test-stop", .maxThreads = 1});
    Event started, release;
    std::atomic<bool> firstFinished{false};
    pool->execute([&] {
        started.set();
        release.wait(kBlocked);
        firstFinished = true;
    });
    auto token = std::make_shared<int>(0);
    std::weak_ptr<int> tokenWatch = token;
    std::atomic<bool> secondRan{false};
    pool->execute([&secondRan, token] { secondRan = true; });
    token.reset();
    ASSERT_TRUE(started.wait());

    std::thread releaser([&] {
        giveChanceToMisbehave();
        release.set();
    });
    pool.reset();
    EXPECT_TRUE(firstFinished.load()) << "the pool went while an item still ran";
    EXPECT_FALSE(secondRan.load());
    EXPECT_TRUE(tokenWatch.expired());
    releaser.join();
}

TEST(ThreadPoolTest, PoolReleasedByItsOwnWorkerDoesNotWaitForItself) {
    auto pool = std::make_shared<ThreadPool>(ThreadPool::Options{.name = "test-self"});
    Event done;
    std::weak_ptr<ThreadPool> watch = pool;
    ThreadPool& executor = *pool;
    executor.execute([pool = std::move(pool), &done]() mutable {
        pool.reset();
        done.set();
    });
    EXPECT_TRUE(done.wait());
    EXPECT_TRUE(watch.expired());
}

TEST(ThreadPoolTest, WorkersTakeTheirPoolsPriorityWhoeverStartsThem) {
    const int base = currentNice();
    if (base > 9) GTEST_SKIP() << "already running at niceness " << base;
    ThreadPool normal({.name = "test-normal"});
    ThreadPool low({.name = "test-low", .niceIncrement = 10});
    std::atomic<int> lowNice{-100}, normalNice{-100};
    Event done;
    // The normal pool's first worker is started from a low-priority worker.
    low.execute([&] {
        lowNice = currentNice();
        normal.execute([&] {
            normalNice = currentNice();
            done.set();
        });
    });
    ASSERT_TRUE(done.wait());
    EXPECT_EQ(lowNice.load(), base + 10);
    if (::geteuid() == 0) {
        EXPECT_EQ(normalNice.load(), base);
    } else {
        // Unprivileged threads cannot raise their priority again.
        EXPECT_GE(normalNice.load(), base);
    }
}

TEST_F(WorkQueueDeathTest, SyncThatCouldNeverFinishEndsTheProcessWithAMessage) {
    auto queue = WorkQueue::makeSerial("test.self");
    EXPECT_DEATH_BOUNDED(queue->sync([&] { queue->sync([] {}); }),
                         "sync onto queue \"test.self\" would never finish");

    auto target = WorkQueue::makeSerial("test.target.queue");
    auto child = WorkQueue::makeSerial("test.child");
    child->setTarget(target);
    // From work of the child onto its target, and from the target's own work
    // onto a queue whose work must run on it.
    EXPECT_DEATH_BOUNDED(child->sync([&] { target->sync([] {}); }),
                         "serial queue \"test.target.queue\"");
    EXPECT_DEATH_BOUNDED(target->sync([&] { child->sync([] {}); }),
                         "serial queue \"test.target.queue\"");

    // Through a sync made on behalf of a caller that waits on the first queue.
    auto other = WorkQueue::makeSerial("test.other");
    EXPECT_DEATH_BOUNDED(queue->sync([&] { other->sync([&] { queue->sync([] {}); }); }),
                         "sync onto queue \"test.self\" would never finish");
}

TEST_F(WorkQueueDeathTest, MisuseOfSuspensionAndTargetsEndsTheProcess) {
    auto queue = WorkQueue::makeSerial("test.misuse");
    queue->suspend();
    queue->resume();
    EXPECT_DEATH_BOUNDED(queue->resume(), "resumed more often than it was suspended");
    EXPECT_DEATH(WorkQueue::global(QueuePriority::normal)->suspend(), "cannot be suspended");

    auto a = WorkQueue::makeSerial("test.a");
    auto b = WorkQueue::makeSerial("test.b");
    b->setTarget(a);
    EXPECT_DEATH(a->setTarget(b), "its own target");
}

}  // namespace
}  // namespace berth
