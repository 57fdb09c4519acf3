// The I/O thread of the relay: one epoll loop that waits on the listening
// socket and every peer socket of a listener, and tells each watcher when
// its descriptor is ready.
//
// One thread serves any number of peers, because nothing it does can block:
// every socket is non-blocking, frames are decoded as their bytes arrive, and
// request handling runs elsewhere (on the peers' queues). Watchers are
// called on the poller's thread, one at a time.
#pragma once

#include <sys/epoll.h>

#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <unordered_map>

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

    // A poller with its thread running, or null with the reason.
    static std::shared_ptr<RelayPoller> start(const std::string& threadName,
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

    // Ends the thread after the watcher call under way, if any; waits for it
    // unless called on the poller's own thread. Registrations stay until
    // removed but are never notified again. The thread keeps the poller
    // alive until it has ended, so whoever starts a poller must stop it.
    void stop();

    bool isPollerThread() const { return std::this_thread::get_id() == thread_.get_id(); }

  private:
    void run();

    UniqueFd epoll_;
    UniqueFd wake_;  // eventfd that ends the thread
    std::mutex joinMutex_;
    std::thread thread_;
    std::mutex mutex_;
    std::unordered_map<uint64_t, std::shared_ptr<Watcher>> watchers_;
    uint64_t nextToken_ = 1;
    bool stopping_ = false;
};

}  // namespace berth
