// The main thread's run loop and the main queue.
//
// A run loop belongs to the thread that made it, and only that thread runs
// it. While it runs it does two things:
//   - it drains its queue, a serial root queue (for the main run loop, the
//     main queue): the items submitted to it run on the loop's thread, one at
//     a time, in order;
//   - it waits for registered file descriptors (the upcall socket, the
//     lock-state notification) to become readable, and delivers each
//     readiness as an item on its queue that calls the descriptor's handler.
//     A descriptor is not watched again until its handler has returned, so a
//     handler that leaves data unread is called again, once per turn, and a
//     suspended queue holds readiness back like any other item.
//
// `run` returns only after `stop`; the daemon never stops its main run loop,
// tests do. A run loop can be run again after it stopped; work submitted
// meanwhile waits for the next run. Waiting (`sync`) on the loop's queue from
// the loop's own thread would never finish and ends the process instead.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <thread>

#include "platform/UniqueFd.h"
#include "platform/WorkQueue.h"

namespace berth {

class RunLoop {
  public:
    using WatchId = uint64_t;

    // A run loop of the calling thread, with a queue labelled `label`.
    explicit RunLoop(std::string label = "berth.runloop");
    // Work still waiting on the queue is destroyed, unrun, and so is work
    // given to the queue later: nothing runs it any more.
    ~RunLoop();
    RunLoop(const RunLoop&) = delete;
    RunLoop& operator=(const RunLoop&) = delete;

    // The run loop of the process's main thread, whose queue is the main
    // queue "berth.main". Its first use must be on the main thread.
    static RunLoop& main();

    const std::shared_ptr<WorkQueue>& queue() const { return queue_; }

    // Calls `handler` on the queue each time `fd` is readable. The descriptor
    // stays the caller's; unwatch it before closing it. Returns 0 with errno
    // set when the descriptor cannot be watched.
    WatchId watchReadable(int fd, std::function<void()> handler);

    // Stops watching; a readiness already delivered but not yet handled is
    // dropped. False when `id` is not watched.
    bool unwatch(WatchId id);

    // Runs the loop on its thread until `stop`.
    void run();

    // Makes the current run (or, if none is under way, the next one) return
    // after the item it is running. May be called from any thread.
    void stop();

  private:
    class Inbox;
    struct Watch {
        int fd;
        std::shared_ptr<std::function<void()>> handler;
    };

    // Runs what the loop's queue handed over.
    void runInbox();
    void deliverReadiness(WatchId id);

    const std::thread::id owner_;
    UniqueFd epoll_;
    std::shared_ptr<Inbox> inbox_;
    std::shared_ptr<WorkQueue> queue_;

    std::mutex watchesMutex_;
    std::map<WatchId, Watch> watches_;
    WatchId nextWatchId_ = 1;
};

}  // namespace berth
