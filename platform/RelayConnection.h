// A peer connection of the relay and the events it delivers.
//
// Delivery. Each request a peer sends becomes an event, handed to the
// connection's event handler on the connection's own serial queue: one at a
// time and in the order the peer sent them. The queue runs over the shared
// pool (through the listener's queue), so different peers are served in
// parallel and a peer whose handler blocks delays only itself. When the
// queue is idle and the poller has a place for inline work, the I/O thread
// that read a request runs it itself, as the queue's own item (claimed, so
// later events of the peer wait for it): the same order and the same one at
// a time, without a hop to another thread. With every inline place taken,
// such a request waits parked, its queue claimed the same way, for the next
// I/O thread that finishes its own, and goes to the pool once no inline
// place has been given back for RelayPoller::kParkedWait, or at the latest
// after RelayPoller::kParkedLimit. When the
// connection ends - the peer hung up, broke the protocol, flooded it, or
// the connection was cancelled - the handler gets one last event,
// ConnectionInvalid, after every event delivered before; then the
// connection lets go of the handler (which may hold the connection itself).
//
// Replies. A reply is made from a request event, so it carries the request's
// message id and goes back on the connection the request came in on. Sending
// never blocks: what the socket cannot take at once is buffered and written
// as the peer reads. Sending on a connection that has ended does nothing.
//
// Bounds, so that one peer cannot exhaust the daemon:
//   - a frame that cannot be decoded, is too large or nests too deep ends
//     that connection at once (its pending requests get no replies);
//   - at most `maxQueuedRequests` requests of a peer wait or run; beyond
//     that the connection stops reading, and the peer's own writes stall;
//   - while more than `outputHighWater` bytes of replies wait to be
//     written, the connection stops reading too; a peer that lets more than
//     `maxBufferedOutput` bytes pile up is dropped.
//
// A peer that hangs up (or shuts down its writing side) ends the connection:
// requests it sent that have not started yet are dropped, since nobody is
// left to read their replies; the request running at that moment finishes.
// While a request runs on the I/O thread that read it, nothing more of the
// peer is read, and the hang-up is watched for only once the request waits
// parked or has held its thread up (RelayPoller::Watcher::heldUp): a short
// run ends first, and the socket armed after it reports the hang-up before
// anything else of the peer starts. That spares an epoll call a request.
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "core/RelayCodec.h"
#include "core/Value.h"
#include "platform/RelayPeer.h"
#include "platform/RelayPoller.h"
#include "platform/RelayUserBudget.h"
#include "platform/UniqueFd.h"
#include "platform/WorkQueue.h"

namespace berth {

class RelayConnection;

// Where the relay reports what happened to connections: the daemon passes
// its logger. Levels: 3 error (a peer broke the protocol or a limit), 5
// notice, 7 debug (ordinary hang-ups).
using RelayLog = std::function<void(int level, const std::string& message)>;

struct RelayLimits {
    size_t maxQueuedRequests = 32;
    size_t outputHighWater = 1 << 20;
    size_t maxBufferedOutput = 16 << 20;
    // Bytes taken from a socket per readiness, so busy peers take turns.
    size_t readChunk = 64 << 10;
};

// The reply to one request. Sent at most once.
class RelayReply {
  public:
    RelayReply(std::weak_ptr<RelayConnection> remote, uint64_t messageId)
        : remote_(std::move(remote)), messageId_(messageId) {}

    uint64_t messageId() const { return messageId_; }
    // The reply dictionary, empty when made.
    Value& body() { return body_; }
    const Value& body() const { return body_; }

    // Sends body() on the request's remote connection, the first time only.
    // False when it was sent before or the connection has ended.
    bool send();
    bool sent() const { return sent_; }

  private:
    std::weak_ptr<RelayConnection> remote_;
    uint64_t messageId_;
    Value body_ = Value::dictionary();
    bool sent_ = false;
};

class RelayEvent {
  public:
    enum class Type {
        Message,            // a request or one-way message of the peer
        ConnectionInvalid,  // the connection has ended; the last event
    };

    static RelayEvent message(std::shared_ptr<RelayConnection> connection, relay::Frame frame);
    static RelayEvent connectionInvalid(std::shared_ptr<RelayConnection> connection);

    Type type() const { return type_; }
    bool isConnectionInvalid() const { return type_ == Type::ConnectionInvalid; }
    relay::FrameKind kind() const { return kind_; }
    uint64_t messageId() const { return messageId_; }
    // The message dictionary (null for ConnectionInvalid).
    const Value& message() const;
    // The same, to be kept beyond the event without a copy.
    const std::shared_ptr<const Value>& sharedMessage() const { return message_; }
    const std::shared_ptr<RelayConnection>& connection() const { return connection_; }

    // True for a request, whose sender waits for a reply.
    bool awaitsReply() const {
        return type_ == Type::Message && kind_ == relay::FrameKind::Request;
    }
    // The reply made from this request; nullopt when the event is not a
    // request awaiting a reply (a one-way message or ConnectionInvalid).
    std::optional<RelayReply> makeReply() const;

  private:
    RelayEvent(Type type, std::shared_ptr<RelayConnection> connection)
        : type_(type), connection_(std::move(connection)) {}

    Type type_;
    relay::FrameKind kind_ = relay::FrameKind::Message;
    uint64_t messageId_ = 0;
    std::shared_ptr<const Value> message_;  // null for ConnectionInvalid
    std::shared_ptr<RelayConnection> connection_;
};

class RelayConnection final : public RelayPoller::Watcher,
                              public std::enable_shared_from_this<RelayConnection> {
    struct Passkey {};

  public:
    using EventHandler = std::function<void(const RelayEvent&)>;

    struct Options {
        std::string label = "relay.peer";
        RelayLimits limits;
        RelayLog log;
        // The queue the connection's serial queue runs on; null: the global
        // queue.
        std::shared_ptr<WorkQueue> target;
        // Where the connection, already admitted for its user, charges what
        // it buffers and gives its place back when it ends; null: no limits
        // per user.
        std::shared_ptr<RelayUserBudget> budget;
    };

    // A connection over the connected, non-blocking `socket`, suspended:
    // nothing is read and no event delivered until resume().
    static std::shared_ptr<RelayConnection> make(UniqueFd socket, RelayPeer peer,
                                                 std::shared_ptr<RelayPoller> poller,
                                                 Options options);

    RelayConnection(Passkey, UniqueFd socket, RelayPeer peer, std::shared_ptr<RelayPoller> poller,
                    Options options);
    ~RelayConnection() override;
    RelayConnection(const RelayConnection&) = delete;
    RelayConnection& operator=(const RelayConnection&) = delete;

    // Sets the handler of the events delivered from now on.
    void setEventHandler(EventHandler handler);
    // Starts reading and delivering events. Later calls do nothing.
    void resume();
    // Ends the connection: the socket is closed at once, nothing more is
    // read or sent, and the handler gets ConnectionInvalid after the events
    // already delivered to its queue.
    void cancel();
    bool isOpen() const;

    // The peer's kernel credentials and bound executable.
    const RelayPeer& peer() const { return peer_; }
    pid_t pid() const { return peer_.pid(); }
    uid_t effectiveUserId() const { return peer_.effectiveUserId(); }
    // The peer's identity as the code-signing service sees it now; ask it
    // for every request (see RelayPeer).
    RelayPeerIdentity peerIdentity() const { return peer_.identity(); }

    // Sends `body` as the reply to the request `messageId`. False when the
    // connection has ended or ends because of it (a body that cannot be
    // encoded, or a peer that left too much unread).
    bool sendReply(uint64_t messageId, const Value& body);

    // The serial queue the events are delivered on.
    const std::shared_ptr<WorkQueue>& queue() const { return queue_; }

    // Called by the poller.
    void ready(uint32_t events) override;
    void runParked() override;
    void unpark() override;
    void heldUp() override;

  private:
    // What a locked section leaves to be done once the lock is let go: the
    // poller's reference to drop and the lines to log (the log function may
    // take locks of its own).
    class Released {
      public:
        explicit Released(const RelayConnection& connection) : connection_(connection) {}
        ~Released();
        Released(const Released&) = delete;
        Released& operator=(const Released&) = delete;

        std::shared_ptr<RelayPoller::Watcher> watcher;
        std::vector<std::pair<int, std::string>> lines;

      private:
        const RelayConnection& connection_;
    };

    size_t pendingOutputLocked() const { return output_.size() - outputStart_; }
    // Reads one chunk and hands over the requests it completes; the first
    // may be left in `runHere` to be run inline (see pumpLocked).
    void readLocked(Released& released, std::optional<RelayEvent>* runHere);
    // Turns buffered frames into events while the queue has room. With
    // `runHere`, the first event goes there instead of the queue when it may
    // run inline: nothing else of the peer is queued or running, the poller
    // has a place for it and the queue could be claimed.
    void pumpLocked(Released& released, std::optional<RelayEvent>* runHere = nullptr);
    bool claimInlineLocked();
    // Takes off the socket the bytes a peek left there (see peeked_).
    void takePeekedLocked(Released& released);
    // Runs an event pumpLocked() left for inline running, then gives back
    // the claim and the poller's place.
    void runInline(RelayEvent event);
    // Writes what the socket takes; false (connection closed) on an error.
    bool flushLocked(Released& released);
    // Waits for exactly the readiness the connection can use now. The
    // registration is one-shot: a readiness delivered leaves it disarmed
    // (interest_ 0) until this arms it again.
    void updateInterestLocked();
    // Ends the connection. The poller's reference goes to `released`, to be
    // dropped once the lock is let go.
    void closeLocked(int level, const std::string& reason, Released& released);
    // Charges what the connection buffers now to its user; ends the
    // connection when that puts the user over its limit.
    void chargeLocked(Released& released);
    void dispatchLocked(RelayEvent event);
    void deliver(const RelayEvent& event);

    const RelayPeer peer_;
    const std::shared_ptr<RelayPoller> poller_;
    const Options options_;
    const std::shared_ptr<WorkQueue> queue_;

    mutable std::mutex mutex_;
    UniqueFd socket_;
    uint64_t token_ = 0;  // poller registration, 0 when not registered
    uint32_t interest_ = 0;
    bool resumed_ = false;
    bool closed_ = false;
    // A request read by a poller thread runs on it: the socket is not read
    // meanwhile, so the peer's next request does not reach another thread
    // only to wait for this one.
    bool runningInline_ = false;
    // A request waiting, with the queue claimed for it, for a thread with an
    // inline place (see RelayPoller::park); runningInline_ is set meanwhile.
    std::optional<RelayEvent> parked_;
    // The request running inline has held its thread up (see
    // RelayPoller::Watcher::heldUp): the peer's hang-up is watched for.
    bool heldUp_ = false;
    EventHandler handler_;
    relay::FrameDecoder decoder_;
    // Bytes the decoder has that are still in the socket: a request that
    // runs on the thread that read it is only peeked at, and its bytes are
    // taken once it has been answered (by the next read, or when the run
    // ends). Taking them frees the peer's sending space, and the kernel
    // then wakes the peer - asleep waiting for its reply - for nothing:
    // that wake-up and the switches it costs would come with every request.
    size_t peeked_ = 0;
    bool peekOffset_ = false;  // the socket's peek offset is on
    size_t queued_ = 0;        // requests dispatched and not yet handled
    std::vector<uint8_t> output_;
    size_t outputStart_ = 0;  // first byte of output_ not yet written
    size_t charged_ = 0;      // bytes charged to the user's budget
};

}  // namespace berth
