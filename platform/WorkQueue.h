// Work queues: the daemon's unit of concurrency.
//
// A queue takes work items and runs them on the threads of an executor (the
// shared thread pools, or the main thread's run loop for the main queue).
//
//   - A serial queue runs one item at a time, in submission order. An item
//     submitted after another starts only once the earlier one has returned.
//   - A concurrent queue starts its items in submission order and lets them
//     run side by side.
//
// Targets. Every queue but the global and root queues has a target queue, by
// default the global queue of its priority. A queue's items run as work of
// its target: a serial target therefore serialises all the queues that
// target it with its own items, and suspending a target holds back the work
// of every queue that targets it. The target may be changed at any time; the
// change applies to work scheduled after it. Targets never form a cycle.
//
// Suspension. `suspend` and `resume` nest: after n suspends it takes n
// resumes before the queue starts anything again. A suspended queue accepts
// work but starts none of it; items already running when it is suspended
// finish. Resuming more often than suspending is a programming error and
// ends the process. Global queues cannot be suspended.
//
// Synchronous submission. `sync` submits an item and waits until it has run,
// returning its result and passing on anything it throws. Waiting on a queue
// whose work can only proceed once the caller returns - the queue the caller
// is running on, a queue that targets it, or the main queue from the main
// thread - would never end; it is detected and ends the process with a
// message naming the queue, instead of hanging it. The same holds for a sync
// made from inside a sync item on behalf of its waiting caller.
//
// Running on the caller. A thread may claim an idle serial queue (nothing
// pending, running or suspending it, on the normal priority) and run work as
// the queue's own, on itself: nothing else of the queue runs meanwhile, and
// work submitted meanwhile waits for the claim to end, in order. A sync onto
// such a queue does this by itself, and the message service runs a request
// on the thread that read it this way, sparing both a thread hop.
//
// Lifetime. A queue lives as long as its last holder, and work that is
// waiting to run holds its queue: dropping every handle of a queue that has
// pending items still runs them all, in order, and then frees the queue. Only
// a queue dropped while suspended destroys its pending items without running
// them, since nothing could resume it any more. Work whose executor has shut
// down (a destroyed run loop, a stopped pool) is destroyed unrun, and a sync
// waiting for such work ends the process rather than wait forever.
//
// Exceptions. An exception that escapes an asynchronous item ends the process
// through std::terminate (where the daemon's terminate handler reports it).
//
// Once-only initialisation needs nothing of this library: a function-local
// static or std::call_once gives it, safely against concurrent first calls.
#pragma once

#include <cstddef>
#include <deque>
#include <exception>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <type_traits>
#include <utility>

#include "platform/ThreadPool.h"

namespace berth {

class WorkQueue : public std::enable_shared_from_this<WorkQueue> {
    struct Passkey {};

  public:
    enum class Kind {
        serial,
        concurrent,
    };

    // A serial or concurrent queue targeting the global queue of `priority`.
    static std::shared_ptr<WorkQueue> makeSerial(std::string label,
                                                 QueuePriority priority = QueuePriority::normal);
    static std::shared_ptr<WorkQueue> makeConcurrent(
        std::string label, QueuePriority priority = QueuePriority::normal);

    // A root queue whose work runs directly on `executor` (the run loop makes
    // the main queue this way). Its target cannot be set.
    static std::shared_ptr<WorkQueue> makeRoot(std::string label, Kind kind,
                                               std::shared_ptr<Executor> executor);

    // The process-wide concurrent queue of `priority`, on the shared pool of
    // that priority.
    static const std::shared_ptr<WorkQueue>& global(QueuePriority priority);

    // The queue whose item the calling thread is running, or null.
    static const WorkQueue* current();

    WorkQueue(Passkey, std::string label, Kind kind, std::shared_ptr<WorkQueue> target,
              std::shared_ptr<Executor> executor, bool global);
    ~WorkQueue();
    WorkQueue(const WorkQueue&) = delete;
    WorkQueue& operator=(const WorkQueue&) = delete;

    const std::string& label() const { return label_; }
    Kind kind() const { return kind_; }

    // True while the calling thread runs an item of this queue, directly or
    // as work of a queue that targets it.
    bool isCurrent() const;

    // Submits `item` and returns at once.
    void async(WorkItem item);

    // Submits `fn`, waits until it has run and returns its result; an
    // exception it throws is rethrown here. On an idle serial queue over the
    // normal global queue, `fn` runs on the calling thread (nothing of the queue
    // can run meanwhile, as if the queue's own thread ran it), so a sync
    // costs no thread hop when nobody else holds the queue.
    template <class F>
    std::invoke_result_t<F&> sync(F&& fn);

    // Claims this queue for the calling thread when it is a serial queue
    // with nothing pending, running or suspended, over concurrent queues
    // that are not suspended and end at the normal global queue. False, and
    // nothing claimed, otherwise. A claim must be ended by runClaimed().
    bool tryClaim();
    // Runs `work` on the calling thread as this queue's item (isCurrent() is
    // true for it and its targets meanwhile), then ends the claim taken by
    // tryClaim() and schedules what was submitted meanwhile, also when
    // `work` throws. With `drainAfter`, items submitted meanwhile run on the
    // calling thread too, as a drain would run them (a batch at most),
    // before the claim ends.
    void runClaimed(const std::function<void()>& work, bool drainAfter = false);

    void suspend();
    void resume();

    void setTarget(std::shared_ptr<WorkQueue> target);
    std::shared_ptr<WorkQueue> target() const;

  private:
    // Entry point of a type-erased synchronous call.
    void syncInvoke(void (*call)(void*), void* context);
    void checkSyncWouldFinish() const;
    // Whether every queue this one targets lets a claimed item run now.
    bool targetsAllowClaim() const;

    // Hands the work that pending items need (a drain, or runners) to the
    // target, unless suspended. Releases `lock`.
    void schedule(std::unique_lock<std::mutex> lock);
    void drainSerial();
    void runOneConcurrent();
    // Called when the target dropped scheduled work unrun.
    void abandonScheduledWork();

    class ScheduledWork;

    const std::string label_;
    const Kind kind_;
    const bool global_;
    const std::shared_ptr<Executor> executor_;  // root and global queues only

    mutable std::mutex mutex_;
    std::shared_ptr<WorkQueue> target_;
    std::deque<WorkItem> pending_;
    unsigned suspendCount_ = 0;
    // Serial: a drain is scheduled on the target or running.
    bool draining_ = false;
    // Concurrent: runners scheduled on the target that have not yet taken an
    // item; there are always at least as many as pending items unless the
    // queue is suspended.
    size_t scheduledRunners_ = 0;
};

template <class F>
std::invoke_result_t<F&> WorkQueue::sync(F&& fn) {
    using Result = std::invoke_result_t<F&>;
    using Fn = std::remove_reference_t<F>;
    if constexpr (std::is_void_v<Result>) {
        struct Call {
            Fn* fn;
        } call{std::addressof(fn)};
        syncInvoke([](void* c) { (*static_cast<Call*>(c)->fn)(); }, &call);
    } else if constexpr (std::is_reference_v<Result>) {
        struct Call {
            Fn* fn;
            std::remove_reference_t<Result>* result;
        } call{std::addressof(fn), nullptr};
        syncInvoke(
            [](void* c) {
                auto* call = static_cast<Call*>(c);
                call->result = std::addressof((*call->fn)());
            },
            &call);
        return static_cast<Result>(*call.result);
    } else {
        struct Call {
            Fn* fn;
            std::optional<Result> result;
        } call{std::addressof(fn), std::nullopt};
        syncInvoke(
            [](void* c) {
                auto* call = static_cast<Call*>(c);
                call->result.emplace((*call->fn)());
            },
            &call);
        return std::move(*call.result);
    }
}

}  // namespace berth
