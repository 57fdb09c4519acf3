#include "platform/RunLoop.h"

#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <deque>
#include <string>

namespace berth {

namespace {

// Readiness of the inbox's event descriptor; watches are numbered from 1.
constexpr uint64_t kInboxEvent = 0;
constexpr uint32_t kWatchEvents = EPOLLIN | EPOLLONESHOT;

bool armWatch(int epollFd, int op, int fd, uint64_t id) {
    epoll_event event{};
    event.events = kWatchEvents;
    event.data.u64 = id;
    return ::epoll_ctl(epollFd, op, fd, &event) == 0;
}

}  // namespace

// The executor of a run loop's queue: work handed to it waits here until the
// loop's thread takes it, and an event descriptor wakes that thread up.
class RunLoop::Inbox final : public Executor {
  public:
    explicit Inbox(std::thread::id owner)
        : owner_(owner), event_(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
        if (!event_) abortWithMessage(std::string("eventfd: ") + std::strerror(errno));
    }

    int eventFd() const { return event_.get(); }

    void execute(WorkItem item) override {
        std::unique_lock lock(mutex_);
        if (closed_) {
            lock.unlock();
            return;  // `item` is destroyed, unrun, outside the lock
        }
        items_.push_back(std::move(item));
        if (!signalled_) {
            signalled_ = true;
            wake();
        }
    }

    bool isDrainedOnlyBy(std::thread::id thread) const override { return thread == owner_; }
    bool wantsYield() const override { return stopRequested_.load(std::memory_order_acquire); }

    bool hasItems() const {
        std::lock_guard lock(mutex_);
        return !items_.empty();
    }

    std::deque<WorkItem> take() {
        std::lock_guard lock(mutex_);
        uint64_t count;
        while (::read(event_.get(), &count, sizeof count) > 0) {
        }
        signalled_ = false;
        return std::exchange(items_, {});
    }

    void requestStop() {
        stopRequested_.store(true, std::memory_order_release);
        wake();
    }
    bool takeStopRequest() { return stopRequested_.exchange(false, std::memory_order_acq_rel); }

    // From now on nothing is kept; what is waiting is destroyed.
    void close() {
        std::deque<WorkItem> dropped;
        std::lock_guard lock(mutex_);
        closed_ = true;
        dropped.swap(items_);
    }

  private:
    void wake() {
        const uint64_t one = 1;
        // Fails only when the counter is saturated, which wakes the loop too.
        [[maybe_unused]] ssize_t written = ::write(event_.get(), &one, sizeof one);
    }

    const std::thread::id owner_;
    const UniqueFd event_;
    mutable std::mutex mutex_;
    std::deque<WorkItem> items_;
    bool signalled_ = false;
    bool closed_ = false;
    std::atomic<bool> stopRequested_{false};
};

RunLoop::RunLoop(std::string label)
    : owner_(std::this_thread::get_id()),
      epoll_(::epoll_create1(EPOLL_CLOEXEC)),
      inbox_(std::make_shared<Inbox>(owner_)),
      queue_(WorkQueue::makeRoot(std::move(label), WorkQueue::Kind::serial, inbox_)) {
    if (!epoll_) abortWithMessage(std::string("epoll_create1: ") + std::strerror(errno));
    epoll_event event{};
    event.events = EPOLLIN;
    event.data.u64 = kInboxEvent;
    if (::epoll_ctl(epoll_.get(), EPOLL_CTL_ADD, inbox_->eventFd(), &event) != 0) {
        abortWithMessage(std::string("epoll_ctl: ") + std::strerror(errno));
    }
}

RunLoop::~RunLoop() {
    inbox_->close();
}

RunLoop& RunLoop::main() {
    static RunLoop loop = [] {
        if (::syscall(SYS_gettid) != ::getpid()) {
            abortWithMessage("the main run loop was first used off the main thread");
        }
        return RunLoop("berth.main");
    }();
    return loop;
}

RunLoop::WatchId RunLoop::watchReadable(int fd, std::function<void()> handler) {
    std::lock_guard lock(watchesMutex_);
    const WatchId id = nextWatchId_++;
    if (!armWatch(epoll_.get(), EPOLL_CTL_ADD, fd, id)) return 0;
    watches_.emplace(id, Watch{fd, std::make_shared<std::function<void()>>(std::move(handler))});
    return id;
}

bool RunLoop::unwatch(WatchId id) {
    std::lock_guard lock(watchesMutex_);
    const auto found = watches_.find(id);
    if (found == watches_.end()) return false;
    // Fails harmlessly when the descriptor was closed already.
    ::epoll_ctl(epoll_.get(), EPOLL_CTL_DEL, found->second.fd, nullptr);
    watches_.erase(found);
    return true;
}

void RunLoop::stop() {
    inbox_->requestStop();
}

void RunLoop::run() {
    if (std::this_thread::get_id() != owner_) {
        abortWithMessage("run loop of queue \"" + queue_->label() +
                         "\" run off the thread that made it");
    }
    std::array<epoll_event, 16> events;
    for (;;) {
        if (inbox_->takeStopRequest()) return;
        const int timeout = inbox_->hasItems() ? 0 : -1;
        const int count = ::epoll_wait(epoll_.get(), events.data(), events.size(), timeout);
        if (count < 0 && errno != EINTR) {
            abortWithMessage(std::string("epoll_wait: ") + std::strerror(errno));
        }
        for (int i = 0; i < count; ++i) {
            const WatchId id = events[i].data.u64;
            if (id == kInboxEvent) continue;  // take() resets it
            queue_->async([this, id] { deliverReadiness(id); });
        }
        runInbox();
    }
}

void RunLoop::runInbox() {
    // The queue's drain yields by itself once a stop is requested, so what
    // was taken here is run whole.
    for (WorkItem& item : inbox_->take()) item();
}

void RunLoop::deliverReadiness(WatchId id) {
    std::shared_ptr<std::function<void()>> handler;
    {
        std::lock_guard lock(watchesMutex_);
        const auto found = watches_.find(id);
        if (found == watches_.end()) return;
        handler = found->second.handler;
    }
    (*handler)();
    std::lock_guard lock(watchesMutex_);
    const auto found = watches_.find(id);
    if (found != watches_.end()) armWatch(epoll_.get(), EPOLL_CTL_MOD, found->second.fd, id);
}

}  // namespace berth
