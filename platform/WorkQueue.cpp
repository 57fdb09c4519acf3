#include "platform/WorkQueue.h"

#include <algorithm>
#include <condition_variable>
#include <thread>
#include <vector>

namespace berth {

namespace {

// How many items a serial queue runs before it lets other work of its target
// have a turn. Order within the queue is unaffected.
constexpr size_t kDrainBatch = 16;

// What the calling thread is doing, for `current`, `isCurrent` and the
// detection of syncs that could never finish.
struct ThreadContext {
    // The queues whose work this thread is running, innermost last.
    std::vector<const WorkQueue*> running;
    // While this thread runs a sync item: the context of the thread waiting
    // for it. That thread is blocked, so its context cannot change meanwhile.
    const ThreadContext* waiter = nullptr;
    std::thread::id thread = std::this_thread::get_id();
};

thread_local ThreadContext tlsContext;

class RunningFrame {
  public:
    explicit RunningFrame(const WorkQueue* queue) { tlsContext.running.push_back(queue); }
    ~RunningFrame() { tlsContext.running.pop_back(); }
    RunningFrame(const RunningFrame&) = delete;
    RunningFrame& operator=(const RunningFrame&) = delete;
};

void runItem(WorkItem& item) noexcept {
    item();
}

// The rendezvous between a sync caller and the item run on its behalf.
struct SyncWait {
    std::mutex mutex;
    std::condition_variable done;
    bool finished = false;
    bool ran = false;
    std::exception_ptr error;

    void finish() {
        std::lock_guard lock(mutex);
        finished = true;
        done.notify_one();
    }
    void await() {
        std::unique_lock lock(mutex);
        done.wait(lock, [this] { return finished; });
    }
};

// The item a sync submits. It releases the waiting caller when it is
// destroyed, whether it ran or was dropped, so a caller never waits forever
// on work that is gone.
class SyncItem {
  public:
    SyncItem(SyncWait* wait, void (*call)(void*), void* context, const ThreadContext* caller)
        : wait_(wait), call_(call), context_(context), caller_(caller) {}
    SyncItem(SyncItem&& other) noexcept
        : wait_(std::exchange(other.wait_, nullptr)),
          call_(other.call_),
          context_(other.context_),
          caller_(other.caller_) {}
    SyncItem& operator=(SyncItem&&) = delete;
    ~SyncItem() {
        if (wait_ != nullptr) wait_->finish();
    }

    void operator()() {
        const ThreadContext* saved = std::exchange(tlsContext.waiter, caller_);
        try {
            call_(context_);
        } catch (...) {
            wait_->error = std::current_exception();
        }
        tlsContext.waiter = saved;
        wait_->ran = true;
    }

  private:
    SyncWait* wait_;
    void (*call_)(void*);
    void* context_;
    const ThreadContext* caller_;
};

}  // namespace

// The work a queue hands to its target for its pending items: a drain of a
// serial queue, or one runner of a concurrent queue. If the target drops it
// unrun (its executor has shut down), the queue can never run what is
// pending, and drops that too.
class WorkQueue::ScheduledWork {
  public:
    ScheduledWork(std::shared_ptr<WorkQueue> queue, void (WorkQueue::*run)())
        : queue_(std::move(queue)), run_(run) {}
    ScheduledWork(ScheduledWork&& other) noexcept
        : queue_(std::move(other.queue_)), run_(other.run_) {}
    ScheduledWork& operator=(ScheduledWork&&) = delete;
    ~ScheduledWork() {
        if (queue_) queue_->abandonScheduledWork();
    }

    void operator()() {
        const std::shared_ptr<WorkQueue> queue = std::move(queue_);
        ((*queue).*run_)();
    }

  private:
    std::shared_ptr<WorkQueue> queue_;
    void (WorkQueue::*run_)();
};

namespace {

template <class T>
bool contains(const std::vector<T>& items, const T& item) {
    return std::find(items.begin(), items.end(), item) != items.end();
}

// Hands `item` to `target`, or to `executor` when there is no target.
void submitTo(const std::shared_ptr<WorkQueue>& target, Executor* executor, WorkItem item) {
    if (target) {
        target->async(std::move(item));
    } else {
        executor->execute(std::move(item));
    }
}

}  // namespace

WorkQueue::WorkQueue(Passkey, std::string label, Kind kind, std::shared_ptr<WorkQueue> target,
                     std::shared_ptr<Executor> executor, bool global)
    : label_(std::move(label)),
      kind_(kind),
      global_(global),
      executor_(std::move(executor)),
      target_(std::move(target)) {}

// Pending items can only remain here when the queue was released while
// suspended (any other pending work holds the queue); they are destroyed
// with it, unrun.
WorkQueue::~WorkQueue() = default;

std::shared_ptr<WorkQueue> WorkQueue::makeSerial(std::string label, QueuePriority priority) {
    return std::make_shared<WorkQueue>(Passkey{}, std::move(label), Kind::serial, global(priority),
                                       nullptr, false);
}

std::shared_ptr<WorkQueue> WorkQueue::makeConcurrent(std::string label, QueuePriority priority) {
    return std::make_shared<WorkQueue>(Passkey{}, std::move(label), Kind::concurrent,
                                       global(priority), nullptr, false);
}

std::shared_ptr<WorkQueue> WorkQueue::makeRoot(std::string label, Kind kind,
                                               std::shared_ptr<Executor> executor) {
    if (!executor) abortWithMessage("a root queue needs an executor");
    return std::make_shared<WorkQueue>(Passkey{}, std::move(label), kind, nullptr,
                                       std::move(executor), false);
}

const std::shared_ptr<WorkQueue>& WorkQueue::global(QueuePriority priority) {
    static const auto normal =
        std::make_shared<WorkQueue>(Passkey{}, "berth.global.normal", Kind::concurrent, nullptr,
                                    ThreadPool::shared(QueuePriority::normal), true);
    static const auto background =
        std::make_shared<WorkQueue>(Passkey{}, "berth.global.background", Kind::concurrent, nullptr,
                                    ThreadPool::shared(QueuePriority::background), true);
    return priority == QueuePriority::background ? background : normal;
}

const WorkQueue* WorkQueue::current() {
    const auto& running = tlsContext.running;
    return running.empty() ? nullptr : running.back();
}

bool WorkQueue::isCurrent() const {
    return contains(tlsContext.running, this);
}

void WorkQueue::async(WorkItem item) {
    if (global_) {
        // Global queues are never suspended, so their items go straight to
        // the pool.
        executor_->execute([self = shared_from_this(), item = std::move(item)]() mutable {
            RunningFrame frame(self.get());
            runItem(item);
        });
        return;
    }
    std::unique_lock lock(mutex_);
    pending_.push_back(std::move(item));
    schedule(std::move(lock));
}

void WorkQueue::schedule(std::unique_lock<std::mutex> lock) {
    if (suspendCount_ > 0) return;
    const std::shared_ptr<WorkQueue> target = target_;
    if (kind_ == Kind::serial) {
        if (draining_ || pending_.empty()) return;
        draining_ = true;
        lock.unlock();
        submitTo(target, executor_.get(),
                 ScheduledWork(shared_from_this(), &WorkQueue::drainSerial));
        return;
    }
    size_t runners = pending_.size() > scheduledRunners_ ? pending_.size() - scheduledRunners_ : 0;
    scheduledRunners_ += runners;
    lock.unlock();
    for (; runners > 0; --runners) {
        submitTo(target, executor_.get(),
                 [self = shared_from_this()] { self->runOneConcurrent(); });
    }
}

void WorkQueue::drainSerial() {
    RunningFrame frame(this);
    for (size_t ran = 0;; ++ran) {
        WorkItem item;
        {
            std::unique_lock lock(mutex_);
            if (suspendCount_ > 0 || pending_.empty()) {
                draining_ = false;
                return;
            }
            if (ran == kDrainBatch || (executor_ && executor_->wantsYield())) {
                // Give the target's other work a turn; this drain goes on
                // later, so `draining_` stays set.
                const std::shared_ptr<WorkQueue> target = target_;
                lock.unlock();
                submitTo(target, executor_.get(),
                         ScheduledWork(shared_from_this(), &WorkQueue::drainSerial));
                return;
            }
            item = std::move(pending_.front());
            pending_.pop_front();
        }
        runItem(item);
    }
}

void WorkQueue::runOneConcurrent() {
    WorkItem item;
    {
        std::lock_guard lock(mutex_);
        --scheduledRunners_;
        if (suspendCount_ > 0 || pending_.empty()) return;
        item = std::move(pending_.front());
        pending_.pop_front();
    }
    RunningFrame frame(this);
    runItem(item);
}

void WorkQueue::abandonScheduledWork() {
    std::deque<WorkItem> dropped;
    std::lock_guard lock(mutex_);
    if (kind_ == Kind::serial) {
        draining_ = false;
    } else {
        --scheduledRunners_;
    }
    dropped.swap(pending_);
    // `dropped` goes after the lock is released (declared before it).
}

void WorkQueue::suspend() {
    if (global_) abortWithMessage("global queue \"" + label_ + "\" cannot be suspended");
    std::lock_guard lock(mutex_);
    ++suspendCount_;
}

void WorkQueue::resume() {
    if (global_) abortWithMessage("global queue \"" + label_ + "\" cannot be resumed");
    std::unique_lock lock(mutex_);
    if (suspendCount_ == 0) {
        lock.unlock();
        abortWithMessage("queue \"" + label_ + "\" resumed more often than it was suspended");
    }
    if (--suspendCount_ > 0) return;
    schedule(std::move(lock));
}

void WorkQueue::setTarget(std::shared_ptr<WorkQueue> target) {
    if (global_ || executor_) {
        abortWithMessage("the target of queue \"" + label_ + "\" cannot be changed");
    }
    if (!target) target = global(QueuePriority::normal);
    for (auto queue = target; queue; queue = queue->target()) {
        if (queue.get() == this) {
            abortWithMessage("targeting queue \"" + target->label() + "\" would make queue \"" +
                             label_ + "\" its own target");
        }
    }
    std::lock_guard lock(mutex_);
    target_ = std::move(target);
}

std::shared_ptr<WorkQueue> WorkQueue::target() const {
    std::lock_guard lock(mutex_);
    return target_;
}

void WorkQueue::checkSyncWouldFinish() const {
    // Everything this sync's item depends on: this queue and its targets.
    std::vector<std::shared_ptr<const WorkQueue>> chain{shared_from_this()};
    while (auto next = chain.back()->target()) chain.push_back(std::move(next));

    for (const ThreadContext* context = &tlsContext; context != nullptr;
         context = context->waiter) {
        for (const auto& queue : chain) {
            if (queue->kind_ == Kind::serial && contains(context->running, queue.get())) {
                abortWithMessage("sync onto queue \"" + label_ +
                                 "\" would never finish: it waits for serial queue \"" +
                                 queue->label_ + "\", whose work is waiting for it");
            }
            if (queue->executor_ && queue->executor_->isDrainedOnlyBy(context->thread)) {
                abortWithMessage("sync onto queue \"" + label_ + "\" would never finish: queue \"" +
                                 queue->label_ + "\" runs only on a thread that is waiting for it");
            }
        }
    }
}

bool WorkQueue::targetsAllowClaim() const {
    // Background work keeps its lower priority on its own threads.
    const std::shared_ptr<WorkQueue>& normal = global(QueuePriority::normal);
    for (std::shared_ptr<WorkQueue> queue = target(); queue != normal;) {
        if (!queue || queue->kind_ != Kind::concurrent || queue->global_ || queue->executor_)
            return false;
        std::lock_guard lock(queue->mutex_);
        if (queue->suspendCount_ > 0) return false;
        queue = queue->target_;
    }
    return true;
}

bool WorkQueue::tryClaim() {
    if (kind_ != Kind::serial || global_ || executor_ || !targetsAllowClaim()) return false;
    std::lock_guard lock(mutex_);
    if (suspendCount_ > 0 || draining_ || !pending_.empty()) return false;
    // Claimed as a drain would be: items submitted meanwhile wait.
    draining_ = true;
    return true;
}

void WorkQueue::runClaimed(const std::function<void()>& work, bool drainAfter) {
    // Ends the claim, scheduling what arrived meanwhile, even on a throw.
    struct Release {
        WorkQueue* queue;
        ~Release() {
            std::unique_lock lock(queue->mutex_);
            queue->draining_ = false;
            queue->schedule(std::move(lock));
        }
    } release{this};
    // Running as the queue's item would: as work of each target, outermost
    // first (each queue keeps its target alive).
    auto& running = tlsContext.running;
    const size_t depth = running.size();
    for (const WorkQueue* queue = this; queue; queue = queue->target().get())
        running.push_back(queue);
    std::reverse(running.begin() + static_cast<ptrdiff_t>(depth), running.end());
    struct Unwind {
        std::vector<const WorkQueue*>& running;
        size_t depth;
        ~Unwind() { running.resize(depth); }
    } unwind{running, depth};
    work();
    for (size_t ran = 0; drainAfter && ran < kDrainBatch; ++ran) {
        WorkItem item;
        {
            std::lock_guard lock(mutex_);
            if (suspendCount_ > 0 || pending_.empty()) break;
            item = std::move(pending_.front());
            pending_.pop_front();
        }
        runItem(item);
    }
}

void WorkQueue::syncInvoke(void (*call)(void*), void* context) {
    checkSyncWouldFinish();
    const auto self = shared_from_this();
    if (tryClaim()) {
        runClaimed([&] { call(context); });
        return;
    }
    SyncWait wait;
    async(SyncItem(&wait, call, context, &tlsContext));
    wait.await();
    if (!wait.ran) {
        abortWithMessage("sync item of queue \"" + label_ + "\" was destroyed without running");
    }
    if (wait.error) std::rethrow_exception(wait.error);
}

}  // namespace berth
