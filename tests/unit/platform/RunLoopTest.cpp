// The run loop: draining its queue on its own thread, stopping and running
// again, delivering descriptor readiness through its queue, and refusing
// waits that could never end.
#include "platform/RunLoop.h"

#include <fcntl.h>

#include <cstring>

#include "TestSupport.h"

namespace berth {
namespace {

using namespace std::chrono_literals;

// A pipe whose ends close with the test.
struct Pipe {
    Pipe() {
        int fds[2];
        if (::pipe2(fds, O_CLOEXEC | O_NONBLOCK) == 0) {
            read.reset(fds[0]);
            write.reset(fds[1]);
        }
    }
    void put(const char* bytes) const {
        ASSERT_EQ(::write(write.get(), bytes, strlen(bytes)), static_cast<ssize_t>(strlen(bytes)));
    }
    UniqueFd read;
    UniqueFd write;
};

// Runs `loop` until it stops. A watchdog stops it after a while, so a test
// that expects the loop to stop by itself fails instead of hanging.
void runGuarded(RunLoop& loop) {
    test::Event done;
    std::atomic<bool> fired{false};
    std::thread watchdog([&] {
        if (!done.wait(60s)) {
            fired = true;
            loop.stop();
        }
    });
    loop.run();
    done.set();
    watchdog.join();
    EXPECT_FALSE(fired.load()) << "the run loop had to be stopped by the watchdog";
}

using RunLoopDeathTest = test::ThreadsafeDeathTest;

TEST(RunLoopTest, RunsItsQueueInOrderOnItsThreadUntilStopped) {
    RunLoop loop;
    const auto self = std::this_thread::get_id();
    std::vector<int> order;
    bool allOnLoopThread = true;
    auto record = [&](int n) {
        return [&, n] {
            order.push_back(n);
            allOnLoopThread = allOnLoopThread && std::this_thread::get_id() == self;
        };
    };
    loop.queue()->async(record(1));
    loop.queue()->async(record(2));
    loop.queue()->async([&] { loop.stop(); });
    loop.queue()->async(record(3));
    runGuarded(loop);
    // The item after the stop waits for the next run.
    EXPECT_EQ(order, (std::vector<int>{1, 2}));

    loop.queue()->async([&] { loop.stop(); });
    runGuarded(loop);
    EXPECT_EQ(order, (std::vector<int>{1, 2, 3}));
    EXPECT_TRUE(allOnLoopThread);
}

TEST(RunLoopTest, WorkFromOtherThreadsAndTheirSyncsRunOnTheLoop) {
    RunLoop loop;
    const auto self = std::this_thread::get_id();
    constexpr int kThreads = 4, kPerThread = 200;
    int count = 0;  // touched only on the loop's thread
    std::atomic<bool> offThread{false};
    std::vector<std::thread> submitters;
    for (int t = 0; t < kThreads; ++t) {
        submitters.emplace_back([&] {
            for (int i = 0; i < kPerThread; ++i) {
                loop.queue()->async([&] {
                    if (std::this_thread::get_id() != self) offThread = true;
                    ++count;
                });
            }
            // A sync from another thread is served by the running loop.
            const bool onLoop =
                loop.queue()->sync([&] { return std::this_thread::get_id() == self; });
            if (!onLoop) offThread = true;
        });
    }
    std::thread stopper([&] {
        for (auto& s : submitters) s.join();
        loop.queue()->async([&] { loop.stop(); });
    });
    runGuarded(loop);
    stopper.join();
    EXPECT_EQ(count, kThreads * kPerThread);
    EXPECT_FALSE(offThread.load());
}

TEST(RunLoopTest, StopBeforeRunMakesTheNextRunReturn) {
    RunLoop loop;
    loop.stop();
    runGuarded(loop);  // returns at once instead of waiting for work
}

TEST(RunLoopTest, ReadinessIsDeliveredOnTheQueueUntilTheDataIsRead) {
    RunLoop loop;
    Pipe pipe;
    ASSERT_TRUE(pipe.read.valid());
    const auto self = std::this_thread::get_id();
    std::vector<char> received;
    bool onLoopThread = true;
    const auto id = loop.watchReadable(pipe.read.get(), [&] {
        onLoopThread = onLoopThread && std::this_thread::get_id() == self;
        // One byte per call: what is left must be delivered again.
        char byte;
        if (::read(pipe.read.get(), &byte, 1) == 1) received.push_back(byte);
        if (received.size() == 3) loop.stop();
    });
    ASSERT_NE(id, 0u);

    std::thread writer([&] { pipe.put("abc"); });
    runGuarded(loop);
    writer.join();
    EXPECT_EQ(received, (std::vector<char>{'a', 'b', 'c'}));
    EXPECT_TRUE(onLoopThread);

    // Once unwatched, readiness reaches nobody.
    EXPECT_TRUE(loop.unwatch(id));
    EXPECT_FALSE(loop.unwatch(id));
    pipe.put("d");
    loop.queue()->async([&] { loop.stop(); });
    runGuarded(loop);
    EXPECT_EQ(received.size(), 3u);

    errno = 0;
    EXPECT_EQ(loop.watchReadable(-1, [] {}), 0u);
    EXPECT_EQ(errno, EBADF);
}

TEST(RunLoopTest, SuspendedQueueHoldsReadinessBack) {
    RunLoop loop;
    Pipe pipe;
    std::atomic<int> calls{0};
    loop.watchReadable(pipe.read.get(), [&] {
        char buffer[8];
        while (::read(pipe.read.get(), buffer, sizeof buffer) > 0) {
        }
        ++calls;
        loop.stop();
    });
    loop.queue()->suspend();
    pipe.put("x");

    std::atomic<int> callsWhileSuspended{-1};
    std::thread resumer([&] {
        std::this_thread::sleep_for(50ms);  // the loop runs meanwhile
        callsWhileSuspended = calls.load();
        loop.queue()->resume();
    });
    runGuarded(loop);
    resumer.join();
    EXPECT_EQ(callsWhileSuspended.load(), 0);
    EXPECT_EQ(calls.load(), 1);
}

TEST(RunLoopTest, DestroyedLoopDropsItsWaitingWorkUnrun) {
    std::shared_ptr<WorkQueue> queue;
    auto token = std::make_shared<int>(0);
    std::weak_ptr<int> tokenWatch = token;
    bool ran = false;
    {
        RunLoop loop;
        queue = loop.queue();
        queue->async([token, &ran] { ran = true; });
        token.reset();
    }
    EXPECT_TRUE(tokenWatch.expired());
    queue->async([&ran] { ran = true; });  // accepted, never run
    EXPECT_FALSE(ran);
}

TEST_F(RunLoopDeathTest, WaitsThatCouldNeverEndEndTheProcess) {
    RunLoop loop;
    // The loop's thread waiting on its own queue, even before it runs.
    EXPECT_DEATH_BOUNDED(loop.queue()->sync([] {}), "runs only on a thread that is waiting for it");
    // ... or through work it waits for on another queue.
    auto queue = WorkQueue::makeSerial("test.helper");
    EXPECT_DEATH_BOUNDED(queue->sync([&] { loop.queue()->sync([] {}); }),
                         "runs only on a thread that is waiting for it");
    // Only the loop's own thread runs it.
    EXPECT_DEATH_BOUNDED(std::thread([&] { loop.run(); }).join(),
                         "run off the thread that made it");
}

}  // namespace
}  // namespace berth
