// The listener of the relay: accepts peers on a checked-in stream socket and
// hands each new connection to its event handler.
//
//   auto listener = RelayListener::make(checkIn.takeSocket(), listenerQueue, options);
//   listener->setEventHandler([](const std::shared_ptr<RelayConnection>& peer) {
//       peer->setEventHandler([peer](const RelayEvent& event) { ... });
//       peer->resume();
//   });
//   listener->resume();
//
// New connections are handed over on the listener's queue. Each connection's
// own serial queue runs on that queue too, so with a concurrent listener
// queue different peers are served in parallel.
//
// Accepting never waits on a peer: a few I/O threads accept and serve the
// sockets of all connections, non-blocking, whatever their number, and run
// requests themselves while one of them is left waiting (see RelayPoller); a
// peer's credentials, pidfd and executable are taken at accept (see
// RelayPeer) and its signing identity is left for the requests to evaluate.
#pragma once

#include <cstddef>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/CodeSigningRegistry.h"
#include "platform/RelayConnection.h"
#include "platform/RelayPoller.h"
#include "platform/UniqueFd.h"
#include "platform/WorkQueue.h"

namespace berth {

class RelayListener {
    class Acceptor;
    struct Passkey {};

  public:
    struct Options {
        // Names the threads, queues and log lines of the listener.
        std::string label = "sys.kelp.berthd";
        // Identifies the peers; null: a CodeSigningRegistry over the device
        // root's signature registry.
        std::shared_ptr<CodeSigningService> codeSigning;
        RelayLimits limits;
        // I/O threads; 0: twice the processors the process may use, plus
        // one. All but one may run requests inline, so with two per
        // processor most requests do, while threads blocked in a request
        // still leave others reading.
        size_t ioThreads = 0;
        // What one user other than root may hold; see RelayUserBudget.
        RelayUserLimits userLimits;
        RelayLog log;
    };

    using EventHandler = std::function<void(const std::shared_ptr<RelayConnection>&)>;

    // A suspended listener on the listening, non-blocking stream socket
    // `socket`, handing connections over on `queue` (null: the global
    // queue). Null, with the reason, when the I/O thread cannot be set up.
    static std::unique_ptr<RelayListener> make(UniqueFd socket, std::shared_ptr<WorkQueue> queue,
                                               Options options, std::string* why = nullptr);

    // Made by make() only.
    RelayListener(Passkey, std::shared_ptr<RelayPoller> poller, std::shared_ptr<Acceptor> acceptor);

    // Stops accepting, ends every connection it accepted and stops the I/O
    // thread. Events already queued are still delivered.
    ~RelayListener();
    RelayListener(const RelayListener&) = delete;
    RelayListener& operator=(const RelayListener&) = delete;

    // Sets the handler of new connections. A connection accepted while no
    // handler is set is cancelled.
    void setEventHandler(EventHandler handler);
    // Starts accepting. Later calls do nothing.
    void resume();

    // Connections accepted and not yet ended.
    size_t connectionCount() const;

  private:
    std::shared_ptr<RelayPoller> poller_;
    std::shared_ptr<Acceptor> acceptor_;
};

}  // namespace berth
