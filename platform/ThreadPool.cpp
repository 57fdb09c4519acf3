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

namespace {
// The pool whose worker the current thread is, if any.
thread_local const void* tlsOwnPool = nullptr;
}  // namespace

struct ThreadPool::State : std::enable_shared_from_this<State> {
    using Clock = std::chrono::steady_clock;
    struct Pending {
        WorkItem item;
        Clock::time_point queued;
    };

    explicit State(Options o) : options(std::move(o)), priorities(poolPriorities(options)) {}

    // Start a worker, or the stall monitor; the lock is held.
    void startWorker();
    void startMonitor();
    void workerMain(size_t number);
    void monitorMain();
    // Starts workers for the items that waited `stallThreshold` or longer and
    // that no idle worker is about to take.
    void relieveStall(Clock::time_point now);

    const Options options;
    // What every worker runs at: the priorities of the thread that made the
    // pool, lowered as the options say.
    const Priorities priorities;

    mutable std::mutex mutex;
    std::condition_variable workAvailable;
    std::condition_variable monitorWake;
    std::condition_variable allExited;
    std::deque<Pending> pending;
    size_t threads = 0;  // workers
    size_t idle = 0;
    size_t nextNumber = 0;
    bool monitorRunning = false;
    bool monitorAwaitsWork = false;  // rather than the age of a waiting item
    bool stopping = false;
};

void ThreadPool::State::startWorker() {
    try {
        std::thread([state = shared_from_this(), number = nextNumber] {
            state->workerMain(number);
        }).detach();
    } catch (const std::system_error& error) {
        // Out of threads: waiting items are taken by the workers that exist,
        // as they become free. With none at all nothing would ever run.
        if (threads == 0) {
            abortWithMessage(std::string("cannot start a worker thread: ") + error.what());
        }
        return;
    }
    ++nextNumber;
    ++threads;
}

void ThreadPool::State::startMonitor() {
    try {
        std::thread([state = shared_from_this()] { state->monitorMain(); }).detach();
    } catch (const std::system_error&) {
        return;  // tried again with the next item that has to wait
    }
    monitorRunning = true;
}

void ThreadPool::State::workerMain(size_t number) {
    tlsOwnPool = this;
    const std::string name = options.name.substr(0, 10) + "-" + std::to_string(number % 10000);
    ::pthread_setname_np(::pthread_self(), name.c_str());
    applyPriorities(priorities);

    std::unique_lock lock(mutex);
    for (;;) {
        if (stopping) break;
        if (!pending.empty()) {
            WorkItem item = std::move(pending.front().item);
            pending.pop_front();
            lock.unlock();
            item();
            item = WorkItem();  // release what the item holds before relocking
            lock.lock();
            continue;
        }
        ++idle;
        const bool woken = workAvailable.wait_for(lock, options.idleTimeout,
                                                  [&] { return stopping || !pending.empty(); });
        --idle;
        if (!woken) break;  // idle for too long
    }
    if (--threads == 0 && !monitorRunning) allExited.notify_all();
}

// Workers blocked in long operations look busy, so beyond the workers started
// at once the pool cannot tell a burst of short items from a pool whose
// workers are all stuck. The monitor tells them apart by age: an item that
// has waited `stallThreshold` gets a worker of its own.
void ThreadPool::State::monitorMain() {
    ::pthread_setname_np(::pthread_self(), (options.name.substr(0, 10) + "-mon").c_str());
    std::unique_lock lock(mutex);
    while (!stopping) {
        if (pending.empty()) {
            monitorAwaitsWork = true;
            monitorWake.wait(lock);
            monitorAwaitsWork = false;
            continue;
        }
        const Clock::time_point due = pending.front().queued + options.stallThreshold;
        if (Clock::now() < due) {
            monitorWake.wait_until(lock, due);
            continue;
        }
        relieveStall(Clock::now());
        // The workers just started need a moment to take their items.
        monitorWake.wait_for(lock, options.stallThreshold);
    }
    monitorRunning = false;
    if (threads == 0) allExited.notify_all();
}

void ThreadPool::State::relieveStall(Clock::time_point now) {
    size_t aged = 0;
    for (const Pending& p : pending) {
        if (p.queued + options.stallThreshold > now) break;  // FIFO: the rest are younger
        ++aged;
    }
    for (size_t wanted = aged > idle ? aged - idle : 0; wanted > 0; --wanted) {
        const size_t before = threads;
        if (before >= options.maxThreads) break;
        startWorker();
        if (threads == before) break;
    }
}

ThreadPool::ThreadPool(Options options) : state_(std::make_shared<State>(std::move(options))) {
    if (state_->options.maxThreads == 0) {
        abortWithMessage("a thread pool needs at least one thread");
    }
}

ThreadPool::~ThreadPool() {
    std::deque<State::Pending> dropped;
    std::unique_lock lock(state_->mutex);
    state_->stopping = true;
    dropped.swap(state_->pending);
    state_->workAvailable.notify_all();
    state_->monitorWake.notify_all();
    lock.unlock();
    // Destroyed outside the lock: releasing an item may release a queue.
    dropped.clear();

    // A worker cannot wait for itself; it and the others exit on their own,
    // and the shared state goes with the last of them.
    if (tlsOwnPool == state_.get()) return;
    lock.lock();
    state_->allExited.wait(lock,
                           [this] { return state_->threads == 0 && !state_->monitorRunning; });
}

const std::shared_ptr<ThreadPool>& ThreadPool::shared(QueuePriority priority) {
    static const auto normal = std::make_shared<ThreadPool>(Options{
        .name = "berth-work",
        .maxThreads = 512,
        .immediateThreads =
            std::max<size_t>(8, 2 * std::max(1u, std::thread::hardware_concurrency())),
    });
    static const auto background = std::make_shared<ThreadPool>(Options{
        .name = "berth-bg",
        .maxThreads = 64,
        .immediateThreads = 2,
        .niceIncrement = 10,
        .lowIoPriority = true,
    });
    return priority == QueuePriority::background ? background : normal;
}

void ThreadPool::execute(WorkItem item) {
    State& state = *state_;
    std::unique_lock lock(state.mutex);
    if (state.stopping) {
        lock.unlock();
        return;  // `item` is destroyed here, outside the lock
    }
    state.pending.push_back({std::move(item), State::Clock::now()});
    if (state.idle > 0) state.workAvailable.notify_one();
    if (state.pending.size() <= state.idle || state.threads >= state.options.maxThreads) return;
    if (state.threads < state.options.immediateThreads) {
        state.startWorker();
    } else if (!state.monitorRunning) {
        state.startMonitor();
    } else if (state.monitorAwaitsWork) {
        state.monitorWake.notify_one();
    }
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

}  // namespace berth
