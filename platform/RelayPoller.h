// The I/O threads of the relay: one epoll set holding the listening socket
// and every peer socket of a listener, waited on by a few threads, each of
// which tells a watcher when its descriptor is ready.
//
// Any number of peers are served by a few threads because nothing a thread
// does for a socket blocks: every socket is non-blocking and frames are
// decoded as their bytes arrive. A watcher registered one-shot
// (EPOLLONESHOT) is told by one thread at a time and re-arms itself with
// modify(); others may be told by several threads at once.
//
// A request may run on the thread that read it, sparing a hop to another
// thread, but only while another thread is left waiting: at most all threads
// but one run such inline work at a time (reserveInline), so a request that
// blocks never stops the reading of other peers.
#pragma once

#include <sys/epoll.h>

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <unordered_map>
#include <vector>

#include "platform/UniqueFd.h"

namespace berth {

class RelayPoller {
    struct Passkey {};

  public:
    // Made by start() only.
    explicit RelayPoller(Passkey) {}

    class Watcher {
      public:
        virtual ~Watcher() = default;
        // `events` is the epoll event mask that became ready.
        virtual void ready(uint32_t events) = 0;
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

  private:
    void run();

    UniqueFd epoll_;
    UniqueFd wake_;          // eventfd that ends the threads
    std::mutex startMutex_;  // held by start() until every thread is in threads_
    std::mutex joinMutex_;
    std::vector<std::thread> threads_;  // set by start(), then only joined
    std::atomic<size_t> inlinePlaces_{0};
    std::mutex mutex_;
    std::unordered_map<uint64_t, std::shared_ptr<Watcher>> watchers_;
    uint64_t nextToken_ = 1;
    bool stopping_ = false;
};

}  // namespace berth
