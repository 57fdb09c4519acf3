#include "platform/ThreadPool.h"

#include <pthread.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <condition_variable>
#include <cstdio>
#include <deque>
#include <mutex>
#include <string>
#include <system_error>

namespace berth {

namespace {

// I/O priority encoding of the kernel (linux/ioprio.h is not always present).
constexpr int kIoprioWhoProcess = 1;
constexpr int kIoprioClassShift = 13;
constexpr int kIoprioClassBestEffort = 2;
constexpr int kIoprioLowestBestEffortLevel = 7;
constexpr int kLowestNice = 19;

pid_t currentTid() {
    return static_cast<pid_t>(::syscall(SYS_gettid));
}

// The scheduling priorities a thread has: niceness and I/O priority.
struct Priorities {
    int nice = 0;
    int ioprio = 0;

    static Priorities ofCurrentThread() {
        const pid_t tid = currentTid();
        Priorities p;
        errno = 0;
        const int nice = ::getpriority(PRIO_PROCESS, static_cast<id_t>(tid));
        if (errno == 0) p.nice = nice;
        const long ioprio = ::syscall(SYS_ioprio_get, kIoprioWhoProcess, tid);
        if (ioprio >= 0) p.ioprio = static_cast<int>(ioprio);
        return p;
    }
};

// Threads inherit the priorities of the thread that starts them, which may be
// a worker of another pool; a worker therefore sets its pool's own
// priorities instead of keeping whatever it was born with. Raising a
// niceness back needs privilege, so an unprivileged worker may keep a lower
// priority than its pool's; that is the best it can do.
void applyPriorities(const Priorities& wanted) {
    const pid_t tid = currentTid();
    const Priorities current = Priorities::ofCurrentThread();
    if (current.nice != wanted.nice) {
        ::setpriority(PRIO_PROCESS, static_cast<id_t>(tid), wanted.nice);
    }
    if (current.ioprio != wanted.ioprio) {
        ::syscall(SYS_ioprio_set, kIoprioWhoProcess, tid, wanted.ioprio);
    }
}

Priorities poolPriorities(const ThreadPool::Options& options) {
    Priorities p = Priorities::ofCurrentThread();
    p.nice = std::min(p.nice + options.niceIncrement, kLowestNice);
    if (options.lowIoPriority) {
        p.ioprio = (kIoprioClassBestEffort << kIoprioClassShift) | kIoprioLowestBestEffortLevel;
    }
    return p;
}

}  // namespace

[[noreturn]] void abortWithMessage(std::string_view message) {
    std::fprintf(stderr, "berthd: %.*s\n", static_cast<int>(message.size()), message.data());
    std::fflush(stderr);
    ::syslog(LOG_CRIT, "%.*s", static_cast<int>(message.size()), message.data());
    std::abort();
}

struct ThreadPool::State {
    explicit State(Options o) : options(std::move(o)), priorities(poolPriorities(options)) {}

    const Options options;
    // What every worker runs at: the priorities of the thread that made the
    // pool, lowered as the options say.
    const Priorities priorities;
    mutable std::mutex mutex;
    std::condition_variable workAvailable;
    std::condition_variable allExited;
    std::deque<WorkItem> pending;
    size_t threads = 0;
    size_t idle = 0;
    size_t nextNumber = 0;
    bool stopping = false;
};

ThreadPool::ThreadPool(Options options) : state_(std::make_shared<State>(std::move(options))) {
    if (state_->options.maxThreads == 0)
        abortWithMessage("a thread pool needs at least one thread");
}

namespace {
// The pool whose worker the current thread is, if any.
thread_local const void* tlsOwnPool = nullptr;
}  // namespace

ThreadPool::~ThreadPool() {
    std::deque<WorkItem> dropped;
    std::unique_lock lock(state_->mutex);
    state_->stopping = true;
    dropped.swap(state_->pending);
    state_->workAvailable.notify_all();
    lock.unlock();
    // Destroyed outside the lock: releasing an item may release a queue.
    dropped.clear();

    // A worker cannot wait for itself; it and the others exit on their own,
    // and the shared state goes with the last of them.
    if (tlsOwnPool == state_.get()) return;
    lock.lock();
    state_->allExited.wait(lock, [this] { return state_->threads == 0; });
}

const std::shared_ptr<ThreadPool>& ThreadPool::shared(QueuePriority priority) {
    static const auto normal = std::make_shared<ThreadPool>(Options{
        .name = "berth-work",
        .maxThreads = 512,
        .idleTimeout = std::chrono::seconds(10),
    });
    static const auto background = std::make_shared<ThreadPool>(Options{
        .name = "berth-bg",
        .maxThreads = 64,
        .idleTimeout = std::chrono::seconds(10),
        .niceIncrement = 10,
        .lowIoPriority = true,
    });
    return priority == QueuePriority::background ? background : normal;
}

void ThreadPool::execute(WorkItem item) {
    std::unique_lock lock(state_->mutex);
    if (state_->stopping) {
        lock.unlock();
        return;  // `item` is destroyed here, outside the lock
    }
    state_->pending.push_back(std::move(item));
    if (state_->pending.size() > state_->idle && state_->threads < state_->options.maxThreads) {
        startWorkerLocked();
    }
    if (state_->idle > 0) state_->workAvailable.notify_one();
}

size_t ThreadPool::threadCount() const {
    std::lock_guard lock(state_->mutex);
    return state_->threads;
}

size_t ThreadPool::idleThreadCount() const {
    std::lock_guard lock(state_->mutex);
    return state_->idle;
}

size_t ThreadPool::pendingCount() const {
    std::lock_guard lock(state_->mutex);
    return state_->pending.size();
}

void ThreadPool::startWorkerLocked() {
    const size_t number = state_->nextNumber++;
    try {
        std::thread(&ThreadPool::workerMain, state_, number).detach();
    } catch (const std::system_error& error) {
        // Out of threads: the waiting item is taken by a worker that exists,
        // as soon as one is free. With none at all nothing would ever run.
        if (state_->threads == 0) {
            abortWithMessage(std::string("cannot start a worker thread: ") + error.what());
        }
        return;
    }
    ++state_->threads;
}

void ThreadPool::workerMain(std::shared_ptr<State> state, size_t number) {
    tlsOwnPool = state.get();
    const std::string name =
        state->options.name.substr(0, 10) + "-" + std::to_string(number % 10000);
    ::pthread_setname_np(::pthread_self(), name.c_str());
    applyPriorities(state->priorities);

    std::unique_lock lock(state->mutex);
    for (;;) {
        if (state->stopping) break;
        if (!state->pending.empty()) {
            WorkItem item = std::move(state->pending.front());
            state->pending.pop_front();
            lock.unlock();
            item();
            item = WorkItem();  // release what the item holds before relocking
            lock.lock();
            continue;
        }
        ++state->idle;
        const bool woken = state->workAvailable.wait_for(lock, state->options.idleTimeout, [&] {
            return state->stopping || !state->pending.empty();
        });
        --state->idle;
        if (!woken) break;  // idle for too long
    }
    if (--state->threads == 0) state->allExited.notify_all();
}

}  // namespace berth
