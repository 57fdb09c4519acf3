#include "platform/RelayPoller.h"

#include <pthread.h>
#include <sys/eventfd.h>
#include <sys/timerfd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

namespace berth {
namespace {

// The wake eventfd's token; registrations count from 1.
constexpr uint64_t kWakeToken = 0;
constexpr int kEventsPerWait = 64;

// Whether this poller thread's last event was already waiting when it
// asked (read by busy()).
thread_local bool foundWaiting = false;

// This poller thread's place in runs_.
thread_local size_t runIndex = 0;

}  // namespace

std::shared_ptr<RelayPoller> RelayPoller::start(const std::string& threadName, size_t threads,
                                                std::string* why) {
    auto poller = std::make_shared<RelayPoller>(Passkey{});
    poller->epoll_.reset(::epoll_create1(EPOLL_CLOEXEC));
    poller->wake_.reset(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    poller->sentryTimer_.reset(::timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC));
    epoll_event event{};
    event.events = EPOLLIN;
    event.data.u64 = kWakeToken;
    if (!poller->epoll_ || !poller->wake_ || !poller->sentryTimer_ ||
        ::epoll_ctl(poller->epoll_.get(), EPOLL_CTL_ADD, poller->wake_.get(), &event) != 0) {
        if (why) *why = std::string("cannot set up the relay's epoll loop: ") + strerror(errno);
        return nullptr;
    }
    threads = std::max<size_t>(threads, 1);
    poller->inlinePlaces_ = threads - 1;
    poller->inlineCapacity_ = threads - 1;
    poller->runs_.assign(threads, Run{});
    // Each thread holds the poller until it ends, so a watcher that drops
    // the last other reference from inside ready() cannot free the loop
    // under its feet. No thread runs before all are in the vector.
    std::unique_lock starting(poller->startMutex_);
    for (size_t i = 0; i < threads; ++i)
        poller->threads_.emplace_back([self = poller, name = threadName.substr(0, 15), i] {
            ::pthread_setname_np(::pthread_self(), name.c_str());
            runIndex = i;
            { std::lock_guard started(self->startMutex_); }
            self->run();
        });
    return poller;
}

RelayPoller::~RelayPoller() {
    // Only reached once every thread has left run(): each holds a reference
    // while it runs.
    for (std::thread& thread : threads_) {
        if (!thread.joinable()) continue;
        if (thread.get_id() == std::this_thread::get_id())
            thread.detach();
        else
            thread.join();
    }
}

bool RelayPoller::isPollerThread() const {
    const std::thread::id self = std::this_thread::get_id();
    return std::any_of(threads_.begin(), threads_.end(),
                       [self](const std::thread& thread) { return thread.get_id() == self; });
}

bool RelayPoller::busy() const {
    return handling_.load(std::memory_order_relaxed) > 0 || foundWaiting;
}

RelayPoller::InlineRun::InlineRun(RelayPoller& poller, Watcher& watcher)
    : poller_(poller), slot_(poller.runs_.at(runIndex)) {
    const Clock::rep now = Clock::now().time_since_epoch().count();
    {
        std::lock_guard lock(poller_.runsMutex_);
        slot_ = {&watcher, now, false};
    }
    // The timer may have gone off since this thread took the work, before
    // the run was there to be told: it goes off again.
    poller_.armSentry();
}

RelayPoller::InlineRun::~InlineRun() {
    std::lock_guard lock(poller_.runsMutex_);
    slot_ = Run{};
}

bool RelayPoller::tellHeldUp() {
    const Clock::rep now = Clock::now().time_since_epoch().count();
    const Clock::rep half = std::chrono::duration_cast<Clock::duration>(kStandbyTick).count() / 2;
    bool younger = false;
    // Under the lock: a watcher is told only while its run lasts, and so
    // while it lives.
    std::lock_guard lock(runsMutex_);
    for (Run& run : runs_) {
        if (!run.watcher || run.told) continue;
        if (now - run.since < half) {
            younger = true;
            continue;
        }
        run.told = true;
        run.watcher->heldUp();
    }
    return younger;
}

bool RelayPoller::reserveInline() {
    size_t free = inlinePlaces_.load(std::memory_order_relaxed);
    while (free > 0)
        if (inlinePlaces_.compare_exchange_weak(free, free - 1, std::memory_order_acquire))
            return true;
    return false;
}

void RelayPoller::releaseInline() {
    inlinePlaces_.fetch_add(1, std::memory_order_release);
    // Only while work is parked does anyone ask.
    if (parkedCount_.load(std::memory_order_relaxed) > 0)
        lastRelease_.store(Clock::now().time_since_epoch().count(), std::memory_order_relaxed);
}

uint64_t RelayPoller::add(int fd, uint32_t events, std::shared_ptr<Watcher> watcher) {
    std::lock_guard lock(mutex_);
    const uint64_t token = nextToken_++;
    epoll_event event{};
    event.events = events;
    event.data.u64 = token;
    if (::epoll_ctl(epoll_.get(), EPOLL_CTL_ADD, fd, &event) != 0) return 0;
    watchers_.emplace(token, std::move(watcher));
    return token;
}

int RelayPoller::modify(int fd, uint64_t token, uint32_t events) {
    epoll_event event{};
    event.events = events;
    event.data.u64 = token;
    return ::epoll_ctl(epoll_.get(), EPOLL_CTL_MOD, fd, &event) == 0 ? 0 : errno;
}

std::shared_ptr<RelayPoller::Watcher> RelayPoller::remove(int fd, uint64_t token) {
    ::epoll_ctl(epoll_.get(), EPOLL_CTL_DEL, fd, nullptr);
    std::lock_guard lock(mutex_);
    auto found = watchers_.find(token);
    if (found == watchers_.end()) return nullptr;
    std::shared_ptr<Watcher> watcher = std::move(found->second);
    watchers_.erase(found);
    return watcher;
}

void RelayPoller::stop() {
    {
        std::lock_guard lock(mutex_);
        if (!stopping_) {
            stopping_ = true;
            const uint64_t one = 1;
            (void)!::write(wake_.get(), &one, sizeof one);
        }
    }
    {
        // Taken so that a thread about to stand by either sees stopping_
        // or is already waiting for this.
        std::lock_guard standby(standbyMutex_);
    }
    standbyChanged_.notify_all();
    itimerspec now{};
    now.it_value.tv_nsec = 1;
    ::timerfd_settime(sentryTimer_.get(), 0, &now, nullptr);  // wakes the sentry
    {
        std::lock_guard join(joinMutex_);
        for (std::thread& thread : threads_)
            if (thread.joinable() && thread.get_id() != std::this_thread::get_id()) thread.join();
    }
    // Nobody is left to run parked work here.
    std::deque<Parked> parked;
    {
        std::lock_guard lock(parkMutex_);
        parked.swap(parked_);
        parkedCount_.store(0, std::memory_order_relaxed);
    }
    for (Parked& item : parked) item.watcher->unpark();
}

void RelayPoller::park(std::shared_ptr<Watcher> watcher) {
    std::lock_guard lock(parkMutex_);
    parked_.push_back({std::move(watcher), Clock::now()});
    parkedCount_.store(parked_.size(), std::memory_order_relaxed);
}

RelayPoller::Clock::time_point RelayPoller::expiry(Clock::time_point since) const {
    const Clock::time_point released(Clock::duration(lastRelease_.load(std::memory_order_relaxed)));
    return std::min(std::max(since, released) + kParkedWait, since + kParkedLimit);
}

int RelayPoller::parkedTimeout() {
    if (parkedCount_.load(std::memory_order_relaxed) == 0) return -1;
    std::lock_guard lock(parkMutex_);
    if (parked_.empty()) return -1;
    const auto left = expiry(parked_.front().since) - Clock::now();
    const auto ms = std::chrono::ceil<std::chrono::milliseconds>(left).count();
    return ms > 0 ? static_cast<int>(ms) : 0;
}

std::shared_ptr<RelayPoller::Watcher> RelayPoller::takeParked(bool expiredOnly) {
    std::lock_guard lock(parkMutex_);
    if (parked_.empty() || (expiredOnly && expiry(parked_.front().since) > Clock::now()))
        return nullptr;
    std::shared_ptr<Watcher> watcher = std::move(parked_.front().watcher);
    parked_.pop_front();
    parkedCount_.store(parked_.size(), std::memory_order_relaxed);
    return watcher;
}

void RelayPoller::serveParked() {
    // Parked work is only ever added by these threads, which all pass here
    // after each event: a stale zero is seen again at the next pass.
    if (parkedCount_.load(std::memory_order_relaxed) == 0) return;
    while (reserveInline()) {
        std::shared_ptr<Watcher> watcher = takeParked(false);
        if (!watcher) {
            releaseInline();
            break;
        }
        watcher->runParked();
    }
    while (std::shared_ptr<Watcher> watcher = takeParked(true)) watcher->unpark();
}

bool RelayPoller::isStopping() {
    std::lock_guard lock(mutex_);
    return stopping_;
}

std::optional<int> RelayPoller::waitAsReader(epoll_event* events, int capacity) {
    if (waiting_.fetch_add(1) != 0) {
        waiting_.fetch_sub(1);
        return std::nullopt;
    }
    // Asked first without waiting, to know whether peers queue up.
    int count = ::epoll_wait(epoll_.get(), events, capacity, 0);
    foundWaiting = count > 0;
    if (count == 0) {
        const int timeout = parkedTimeout();
        if (timeout != 0) count = ::epoll_wait(epoll_.get(), events, capacity, timeout);
    }
    const int error = errno;
    waiting_.fetch_sub(1);
    // What the caller does now may block: the sentry reads in its place
    // unless it is back in time.
    if (count != 0 || parkedCount_.load(std::memory_order_relaxed) > 0) armSentry();
    errno = error;
    return count;
}

bool RelayPoller::standBy() {
    std::unique_lock lock(standbyMutex_);
    for (;;) {
        if (isStopping()) return false;
        if (!sentryPosted_) {
            sentryPosted_ = true;
            const bool read = keepSentry(lock);
            sentryPosted_ = false;
            // Another standing-by thread is the sentry from now on.
            standbyChanged_.notify_all();
            return read;
        }
        standbyChanged_.wait(lock);
    }
}

void RelayPoller::armSentry() {
    if (threads_.size() < 2) return;  // nobody to take over
    // Pushed forward only once half of kStandbyTick has passed: the timer
    // then goes off between half of it and all of it after a reader last
    // took work.
    const Clock::rep now = Clock::now().time_since_epoch().count();
    const Clock::rep half = std::chrono::duration_cast<Clock::duration>(kStandbyTick).count() / 2;
    Clock::rep armed = sentryArmed_.load(std::memory_order_relaxed);
    if (now - armed < half ||
        !sentryArmed_.compare_exchange_strong(armed, now, std::memory_order_relaxed))
        return;
    setSentryTimer(kStandbyTick);
    // While readers keep taking work the timer never goes off: runs that
    // hold other threads up are told here instead.
    tellHeldUp();
}

void RelayPoller::setSentryTimer(std::chrono::nanoseconds after) {
    itimerspec expiry{};
    expiry.it_value.tv_nsec = after.count();
    ::timerfd_settime(sentryTimer_.get(), 0, &expiry, nullptr);
}

bool RelayPoller::keepSentry(std::unique_lock<std::mutex>& lock) {
    lock.unlock();
    bool read = false;
    for (;;) {
        uint64_t expirations = 0;
        const ssize_t got = ::read(sentryTimer_.get(), &expirations, sizeof expirations);
        if (isStopping()) break;
        // Runs too young to tell yet are looked at again once they may not be.
        if (tellHeldUp()) setSentryTimer(kStandbyTick / 2);
        // Gone off (a failed read counts as such) while no thread waits on
        // the set: none took work for half of kStandbyTick and none came
        // back, so the readers are held up in what they took.
        if (got != 0 && waiting_.load() == 0) {
            read = true;
            break;
        }
    }
    lock.lock();
    return read;
}

void RelayPoller::run() {
    epoll_event events[kEventsPerWait];
    // With several threads, each takes one event at a time: a thread that
    // goes on to run a request inline must not hold back events it collected
    // for other peers.
    const int perWait = threads_.size() > 1 ? 1 : kEventsPerWait;
    for (;;) {
        const std::optional<int> count = waitAsReader(events, perWait);
        if (!count) {
            if (!standBy()) return;
            continue;
        }
        if (*count < 0 && errno != EINTR) return;
        for (int i = 0; i < *count; ++i) {
            std::shared_ptr<Watcher> watcher;
            {
                std::lock_guard lock(mutex_);
                if (stopping_) return;
                if (events[i].data.u64 == kWakeToken) continue;
                auto found = watchers_.find(events[i].data.u64);
                if (found == watchers_.end()) continue;  // removed after it was collected
                watcher = found->second;
            }
            watcher->ready(events[i].events);
        }
        serveParked();
        if (isStopping()) return;
    }
}

}  // namespace berth
