// The I/O threads of the relay: one epoll set holding the listening socket
// and every peer socket of a listener, and a few threads that take turns
// waiting on it, each of which tells a watcher when its descriptor is ready.
//
// Any number of peers are served by a few threads because nothing a thread
// does for a socket blocks: every socket is non-blocking and frames are
// decoded as their bytes arrive. A watcher registered one-shot
// (EPOLLONESHOT) is told by one thread at a time and re-arms itself with
// modify(); others may be told by several threads at once.
//
// One thread at a time waits on the set (the reader); a thread that comes
// back from its work while another waits there stands by instead. So a
// busy relay runs on one thread that takes the next ready peer whenever it
// is done with the last, in the order they became ready, as a bare server
// loop would: no thread is woken per request and the requests of all peers
// keep their turns. A request may run on the thread that read it; when the
// reader has not come back from such work within about kStandbyTick (a
// handler that blocks, or one that is simply long), the sentry - one of the
// standing-by threads, asleep on a timer that each reader pushes forward
// when it takes work - reads in its place, and so on while threads are
// left. Inline work a thread publishes (InlineRun) and that has held it up
// for half of kStandbyTick is told so (Watcher::heldUp), by the sentry when
// its timer goes off or by a thread pushing the timer forward (a reader
// taking work, a thread publishing a run), whichever comes first. At most
// all threads but one run such inline work at a time (reserveInline), so a
// request that blocks never stops the reading of other peers for longer
// than that. A request read while every place is
// taken may wait parked (park) for the next thread that finishes its inline
// work - a thread already running, so nobody is woken - for as long as
// inline work keeps finishing: once no place has been given back for
// kParkedWait (handlers that block, not a busy processor), or at the latest
// kParkedLimit after it was parked, it goes to the pool (the watcher's
// unpark()).
#pragma once

#include <sys/epoll.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <unordered_map>
#include <vector>

#include "platform/UniqueFd.h"

namespace berth {

class RelayPoller {
    struct Passkey {};
    struct Run;

  public:
    // Made by start() only.
    explicit RelayPoller(Passkey) {}

    class Watcher {
      public:
        virtual ~Watcher() = default;
        // `events` is the epoll event mask that became ready.
        virtual void ready(uint32_t events) = 0;
        // Runs the work the watcher parked; the caller took an inline place
        // for it, which the watcher gives back.
        virtual void runParked() {}
        // The parked work found no place in time (or the poller stops): it
        // is to run elsewhere.
        virtual void unpark() {}
        // The inline work published for this watcher (InlineRun) has held
        // its thread up for between half of kStandbyTick and about twice
        // it. Called once per run, from another poller thread, while the
        // run lasts.
        virtual void heldUp() {}
    };

    // Publishes, for as long as it lives, that the calling poller thread
    // runs inline work for `watcher`, which lives at least as long.
    class InlineRun {
      public:
        InlineRun(RelayPoller& poller, Watcher& watcher);
        ~InlineRun();
        InlineRun(const InlineRun&) = delete;
        InlineRun& operator=(const InlineRun&) = delete;

      private:
        RelayPoller& poller_;
        Run& slot_;
    };

    // A poller with `threads` threads running (at least one), or null with
    // the reason.
    static std::shared_ptr<RelayPoller> start(const std::string& threadName, size_t threads = 1,
                                              std::string* why = nullptr);

    ~RelayPoller();
    RelayPoller(const RelayPoller&) = delete;
    RelayPoller& operator=(const RelayPoller&) = delete;

    // Watches `fd` for `events` (level-triggered) and keeps `watcher` alive
    // until remove(). Returns the registration's token, or 0 with errno set.
    uint64_t add(int fd, uint32_t events, std::shared_ptr<Watcher> watcher);

    // Changes the events a registration waits for; 0 waits only for hang-up
    // and errors. Returns 0 or an errno value.
    int modify(int fd, uint64_t token, uint32_t events);

    // Stops watching `fd` (call it before closing the descriptor) and gives
    // the watcher back, so the caller decides where it is released. A ready
    // notification already collected for the registration is not delivered.
    std::shared_ptr<Watcher> remove(int fd, uint64_t token);

    // Ends the threads after the watcher calls under way, if any; waits for
    // them except for the calling thread when it is one of them.
    // Registrations stay until removed but are never notified again. Each
    // thread keeps the poller alive until it has ended, so whoever starts a
    // poller must stop it.
    void stop();

    bool isPollerThread() const;

    // Takes one of the places for inline work (all threads but one); false
    // when none is free. Each place taken is given back by releaseInline().
    bool reserveInline();
    void releaseInline();

    // How long parked work waits while no inline place is given back, and
    // how long at most: places that keep freeing may be taken by requests
    // read meanwhile.
    static constexpr std::chrono::milliseconds kParkedWait{1};
    static constexpr std::chrono::milliseconds kParkedLimit{4};

    // True when work can run inline at all (more than one thread), and so
    // may be parked.
    bool hasInlinePlaces() const { return inlineCapacity_ > 0; }

    // Counts a request of this poller's peers as being handled for as long
    // as it lives, wherever the request runs (inline, parked or in a pool).
    class Handling {
      public:
        explicit Handling(RelayPoller& poller) : poller_(poller) {
            poller_.handling_.fetch_add(1, std::memory_order_relaxed);
        }
        ~Handling() { poller_.handling_.fetch_sub(1, std::memory_order_relaxed); }
        Handling(const Handling&) = delete;
        Handling& operator=(const Handling&) = delete;

      private:
        RelayPoller& poller_;
    };
    // True while any request is being handled, or when the calling poller
    // thread found its last event already waiting: other peers are then
    // waiting for their turn too.
    bool busy() const;

    // How long after a reader last took work, at most, a standing-by thread
    // reads in its place if it has not come back (at least half of it): so
    // about how long a reader stuck in a request holds up the peers behind
    // it.
    static constexpr std::chrono::milliseconds kStandbyTick{1};

    // Parks `watcher`'s work until a thread finishing inline work has a
    // place for it (runParked), or until kParkedWait has passed both since
    // it was parked and since a place was last given back, or kParkedLimit
    // since it was parked (unpark). Call it from a poller thread, as part
    // of ready(), and only when hasInlinePlaces().
    void park(std::shared_ptr<Watcher> watcher);

  private:
    using Clock = std::chrono::steady_clock;
    struct Run {
        Watcher* watcher = nullptr;
        Clock::rep since = 0;  // when the run was published
        bool told = false;     // heldUp() was called
    };
    struct Parked {
        std::shared_ptr<Watcher> watcher;
        Clock::time_point since;
    };

    void run();
    // Waits for events as the reader: their count (negative with errno
    // set), or nothing when another thread already waits on the set (the
    // caller then stands by).
    std::optional<int> waitAsReader(epoll_event* events, int capacity);
    // Until the caller is to read again (true) or the poller stops (false).
    // One standing-by thread at a time is the sentry.
    bool standBy();
    // Sets the sentry's timer to go off kStandbyTick from now, unless it was
    // set less than half of that ago.
    void armSentry();
    // The sentry's watch, entered with standbyMutex_ held (released while it
    // waits): true when the readers were held up in their work and the
    // caller is to read in their place, false when the poller stops.
    bool keepSentry(std::unique_lock<std::mutex>& lock);
    // Tells the watchers of inline work that has run for half of
    // kStandbyTick that it holds its thread up; true when younger runs are
    // left to tell later.
    bool tellHeldUp();
    void setSentryTimer(std::chrono::nanoseconds after);
    bool isStopping();
    // When parked work that came at `since` is to go elsewhere.
    Clock::time_point expiry(Clock::time_point since) const;
    // The epoll timeout that wakes a waiting thread when the oldest parked
    // work's time is up; -1 with nothing parked.
    int parkedTimeout();
    // Runs parked work while places are free, then sends work whose time is
    // up elsewhere.
    void serveParked();
    std::shared_ptr<Watcher> takeParked(bool expiredOnly);

    UniqueFd epoll_;
    UniqueFd wake_;          // eventfd that ends the threads
    std::mutex startMutex_;  // held by start() until every thread is in threads_
    std::mutex joinMutex_;
    std::vector<std::thread> threads_;  // set by start(), then only joined
    std::atomic<size_t> inlinePlaces_{0};
    std::atomic<Clock::rep> lastRelease_{0};  // when a place was last given back
    size_t inlineCapacity_ = 0;               // set by start()
    std::atomic<size_t> handling_{0};
    std::mutex mutex_;
    std::unordered_map<uint64_t, std::shared_ptr<Watcher>> watchers_;
    uint64_t nextToken_ = 1;
    bool stopping_ = false;
    std::mutex parkMutex_;  // never held while calling a watcher
    std::deque<Parked> parked_;
    std::atomic<size_t> parkedCount_{0};  // parked_.size(), read without the lock

    std::atomic<size_t> waiting_{0};          // threads in epoll_wait (at most one reads)
    UniqueFd sentryTimer_;                    // timerfd the sentry sleeps on (armSentry)
    std::atomic<Clock::rep> sentryArmed_{0};  // when sentryTimer_ was last set
    std::mutex standbyMutex_;                 // never held while calling a watcher
    std::condition_variable standbyChanged_;
    bool sentryPosted_ = false;  // a standing-by thread is the sentry
    std::mutex runsMutex_;       // taken before a watcher's own lock, never after
    std::vector<Run> runs_;      // per thread: the inline work it runs (InlineRun)
};

}  // namespace berth
