// The threads that work queues run on.
//
// A `ThreadPool` runs submitted work items in submission order on worker
// threads that it starts on demand. Daemon handlers may block for a long time
// (waiting for an identifier lock, for the termination service, for a disk),
// so the pool never lets waiting work sit behind blocked workers. When an item
// arrives and no worker is idle to take it, a worker is started at once while
// there are fewer than a few per core; beyond that, any item that has waited
// a short while (busy workers that do not come back are taken to be blocked)
// gets a new worker, up to a high cap. A burst of short items is thus served
// by the workers there are, and blocked handlers never hold up other work for
// more than that short while. Workers that stay idle for a while exit again,
// so a burst of blocked handlers does not leave threads behind.
//
// Two process-wide pools exist, one per priority (`ThreadPool::shared`). The
// workers of the background pool lower their own CPU and I/O priority, so
// background work (emptying death row) yields to request handling.
//
// `Executor` is the one thing a work queue needs of whatever runs its work;
// the pool is one, the main thread's run loop (platform/RunLoop.h) another.
#pragma once

#include <chrono>
#include <concepts>
#include <cstddef>
#include <memory>
#include <string>
#include <string_view>
#include <thread>
#include <type_traits>
#include <utility>

namespace berth {

// A move-only callable with no arguments and no result: one unit of work.
class WorkItem {
  public:
    WorkItem() = default;

    template <class F>
    requires(!std::same_as<std::decay_t<F>, WorkItem> && std::invocable<std::decay_t<F>&>)
        WorkItem(F&& f)  // NOLINT(google-explicit-constructor): lambdas convert implicitly
        : impl_(std::make_unique<Model<std::decay_t<F>>>(std::forward<F>(f))) {}

    WorkItem(WorkItem&&) noexcept = default;
    WorkItem& operator=(WorkItem&&) noexcept = default;

    explicit operator bool() const { return impl_ != nullptr; }
    void operator()() { impl_->call(); }

  private:
    struct Concept {
        virtual ~Concept() = default;
        virtual void call() = 0;
    };
    template <class F>
    struct Model final : Concept {
        explicit Model(F&& f) : fn(std::move(f)) {}
        explicit Model(const F& f) : fn(f) {}
        void call() override { fn(); }
        F fn;
    };
    std::unique_ptr<Concept> impl_;
};

// Runs work items on threads of its own.
class Executor {
  public:
    virtual ~Executor() = default;

    // Takes `item` and runs it later on one of the executor's threads. An
    // executor that has shut down destroys the item without running it.
    virtual void execute(WorkItem item) = 0;

    // True when `thread` is the only thread that runs this executor's work,
    // so that waiting on that thread for such work could never end.
    virtual bool isDrainedOnlyBy(std::thread::id thread) const { return false; }

    // True when a queue draining on this executor should hand its thread
    // back after the item it is running (the run loop was asked to stop).
    virtual bool wantsYield() const { return false; }
};

enum class QueuePriority {
    normal,
    background,
};

class ThreadPool final : public Executor {
  public:
    struct Options {
        // Prefix of the worker threads' names (at most 10 characters are
        // kept, the worker number follows).
        std::string name = "berth-pool";
        // Upper bound of live workers; items wait when it is reached.
        size_t maxThreads = 512;
        // Workers started as soon as an item finds no idle worker.
        size_t immediateThreads = 8;
        // Beyond `immediateThreads`, an item that has waited this long gets
        // a new worker.
        std::chrono::milliseconds stallThreshold{10};
        // A worker idle for this long exits.
        std::chrono::milliseconds idleTimeout = std::chrono::seconds(10);
        // Workers run at the niceness of the thread that made the pool plus
        // this, whichever thread happens to start them; with `lowIoPriority`
        // their disk I/O goes at the lowest best-effort level.
        int niceIncrement = 0;
        bool lowIoPriority = false;
    };

    explicit ThreadPool(Options options);

    // Stops the pool: items already running finish (and are waited for,
    // unless the last holder lets go from one of the pool's own workers),
    // items still waiting are destroyed without running.
    ~ThreadPool() override;

    ThreadPool(const ThreadPool&) = delete;
    ThreadPool& operator=(const ThreadPool&) = delete;

    // The process-wide pool of `priority`, made on first use.
    static const std::shared_ptr<ThreadPool>& shared(QueuePriority priority);

    void execute(WorkItem item) override;

    // Observations for tests and diagnostics; stale as soon as returned.
    size_t threadCount() const;
    size_t idleThreadCount() const;
    size_t pendingCount() const;

  private:
    struct State;

    // Shared with the workers, so that it outlives a pool dropped by one of
    // its own workers.
    std::shared_ptr<State> state_;
};

// Ends the process after writing `message` to standard error and the system
// log. For misuse of the queue library that would otherwise hang or corrupt
// (a sync that can never finish, an unbalanced resume).
[[noreturn]] void abortWithMessage(std::string_view message);

}  // namespace berth
