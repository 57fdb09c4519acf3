#include "platform/RelayConnection.h"

#include <sys/epoll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <utility>

namespace berth {
namespace {

constexpr int kLogError = 3;
constexpr int kLogDebug = 7;

}  // namespace

bool RelayReply::send() {
    if (sent_) return false;
    sent_ = true;
    std::shared_ptr<RelayConnection> remote = remote_.lock();
    return remote && remote->sendReply(messageId_, body_);
}

RelayEvent RelayEvent::message(std::shared_ptr<RelayConnection> connection, relay::Frame frame) {
    RelayEvent event(Type::Message, std::move(connection));
    event.kind_ = frame.kind;
    event.messageId_ = frame.messageId;
    event.message_ = std::make_shared<const Value>(std::move(frame.body));
    return event;
}

const Value& RelayEvent::message() const {
    static const Value kNone;
    return message_ ? *message_ : kNone;
}

RelayEvent RelayEvent::connectionInvalid(std::shared_ptr<RelayConnection> connection) {
    return RelayEvent(Type::ConnectionInvalid, std::move(connection));
}

std::optional<RelayReply> RelayEvent::makeReply() const {
    if (!awaitsReply()) return std::nullopt;
    return RelayReply(connection_, messageId_);
}

std::shared_ptr<RelayConnection> RelayConnection::make(UniqueFd socket, RelayPeer peer,
                                                       std::shared_ptr<RelayPoller> poller,
                                                       Options options) {
    return std::make_shared<RelayConnection>(Passkey{}, std::move(socket), std::move(peer),
                                             std::move(poller), std::move(options));
}

RelayConnection::RelayConnection(Passkey, UniqueFd socket, RelayPeer peer,
                                 std::shared_ptr<RelayPoller> poller, Options options)
    : peer_(std::move(peer)),
      poller_(std::move(poller)),
      options_(std::move(options)),
      queue_(WorkQueue::makeSerial(options_.label)),
      socket_(std::move(socket)) {
    if (options_.target) queue_->setTarget(options_.target);
    // With a peek offset, a peek returns only bytes not looked at before, so
    // requests that follow one another can all be looked at before any is
    // taken.
    const int start = 0;
    peekOffset_ = ::setsockopt(socket_.get(), SOL_SOCKET, SO_PEEK_OFF, &start, sizeof start) == 0;
    // Events wait until the owner has set its handler and resumed.
    queue_->suspend();
}

RelayConnection::~RelayConnection() {
    // A connection never resumed still holds its queue suspended; its
    // pending events go with it.
    if (!closed_ && options_.budget) {
        options_.budget->charge(peer_.effectiveUserId(), -static_cast<ptrdiff_t>(charged_));
        options_.budget->releaseConnection(peer_.effectiveUserId());
    }
}

void RelayConnection::setEventHandler(EventHandler handler) {
    std::lock_guard lock(mutex_);
    handler_ = std::move(handler);
}

void RelayConnection::resume() {
    {
        Released released(*this);
        std::lock_guard lock(mutex_);
        if (resumed_) return;
        resumed_ = true;
        if (!closed_) {
            interest_ = EPOLLIN | EPOLLRDHUP;
            token_ = poller_->add(socket_.get(), interest_ | EPOLLONESHOT, shared_from_this());
            if (token_ == 0)
                closeLocked(kLogError,
                            std::string("cannot watch the connection: ") + strerror(errno),
                            released);
        }
    }
    queue_->resume();
}

void RelayConnection::cancel() {
    Released released(*this);
    std::lock_guard lock(mutex_);
    closeLocked(kLogDebug, "cancelled", released);
}

bool RelayConnection::isOpen() const {
    std::lock_guard lock(mutex_);
    return !closed_;
}

bool RelayConnection::sendReply(uint64_t messageId, const Value& body) {
    // Encoded into a buffer each thread keeps, so a reply allocates nothing
    // once the buffer has grown to the replies' size (one that grew for a
    // large reply is let go at the next).
    thread_local std::vector<uint8_t> frame;
    if (frame.capacity() > options_.limits.outputHighWater) frame = {};
    frame.clear();
    relay::CodecError error = relay::CodecError::None;
    const bool encoded =
        relay::encodeFrame(relay::FrameKind::Reply, messageId, body, frame, &error);

    Released released(*this);
    std::lock_guard lock(mutex_);
    if (closed_) return false;
    if (!encoded) {
        // The peer would wait for this reply forever; ending the connection
        // tells it at once.
        closeLocked(kLogError,
                    "cannot encode the reply to message " + std::to_string(messageId) + ": " +
                        relay::describe(error),
                    released);
        return false;
    }
    if (pendingOutputLocked() + frame.size() > options_.limits.maxBufferedOutput) {
        closeLocked(kLogError, "the peer leaves its replies unread", released);
        return false;
    }
    output_.insert(output_.end(), frame.begin(), frame.end());
    if (!flushLocked(released)) return false;
    chargeLocked(released);
    if (closed_) return false;
    updateInterestLocked();
    return true;
}

void RelayConnection::ready(uint32_t events) {
    std::optional<RelayEvent> runHere;
    {
        Released released(*this);
        std::lock_guard lock(mutex_);
        if (closed_) return;
        // The delivery disarmed the one-shot registration.
        interest_ = 0;
        // A peer that hung up, or shut down its writing side, gives up the
        // requests it sent that have not started: nothing more is read.
        if (events & (EPOLLHUP | EPOLLERR | EPOLLRDHUP)) {
            closeLocked(kLogDebug, "the peer hung up", released);
            return;
        }
        if ((events & EPOLLOUT) && !flushLocked(released)) return;
        if (events & EPOLLIN) readLocked(released, &runHere);
        chargeLocked(released);
        if (runHere) runningInline_ = true;
        updateInterestLocked();
    }
    if (runHere) runInline(std::move(*runHere));
}

void RelayConnection::runInline(RelayEvent event) {
    // Gives back the poller's place and arms the socket for reading again,
    // even on a throw. The peer's next request is not looked for here: it
    // waits for its turn behind the peers that became ready before it. A
    // hang-up during the run is reported as soon as the socket is armed.
    struct Finish {
        RelayConnection& connection;
        ~Finish() {
            connection.poller_->releaseInline();
            Released released(connection);
            std::lock_guard lock(connection.mutex_);
            // A request of the peer parked by the last read still counts
            // as running here.
            connection.runningInline_ = connection.parked_.has_value();
            connection.heldUp_ = false;
            if (!connection.runningInline_) connection.takePeekedLocked(released);
            connection.chargeLocked(released);
            connection.updateInterestLocked();
        }
    } finish{*this};
    const RelayPoller::InlineRun published(*poller_, *this);
    queue_->runClaimed([&] { deliver(event); }, true);
}

void RelayConnection::heldUp() {
    Released released(*this);
    std::lock_guard lock(mutex_);
    if (!runningInline_) return;
    heldUp_ = true;
    updateInterestLocked();
}

void RelayConnection::runParked() {
    std::optional<RelayEvent> event;
    {
        std::lock_guard lock(mutex_);
        event = std::exchange(parked_, std::nullopt);
    }
    if (event)
        runInline(std::move(*event));
    else
        poller_->releaseInline();
}

void RelayConnection::unpark() {
    std::optional<RelayEvent> event;
    {
        Released released(*this);
        std::lock_guard lock(mutex_);
        event = std::exchange(parked_, std::nullopt);
        if (!event) return;
        runningInline_ = false;
        heldUp_ = false;
        takePeekedLocked(released);
        chargeLocked(released);
        updateInterestLocked();
    }
    // Still claimed since it was parked: the request runs first, then what
    // the queue received meanwhile.
    const std::shared_ptr<WorkQueue>& pool =
        options_.target ? options_.target : WorkQueue::global(QueuePriority::normal);
    pool->async([self = shared_from_this(), event = std::move(*event)] {
        self->queue_->runClaimed([&] { self->deliver(event); }, true);
    });
}

bool RelayConnection::claimInlineLocked() {
    if (queued_ != 0 || !poller_->reserveInline()) return false;
    if (queue_->tryClaim()) return true;
    poller_->releaseInline();
    return false;
}

void RelayConnection::readLocked(Released& released, std::optional<RelayEvent>* runHere) {
    // Reads happen on the poller's threads only; one buffer per thread
    // serves them all.
    thread_local std::vector<uint8_t> chunk;
    const size_t wanted = peeked_ + options_.limits.readChunk;
    if (chunk.size() < wanted) chunk.resize(wanted);
    // A request that may run here is only looked at (see peeked_), and only
    // while other requests are being handled: on an otherwise idle relay the
    // peer's early wake-up costs nothing, and brings its processor out of
    // idle before the reply comes. Past bytes already looked at only with a
    // peek offset.
    const bool peek = runHere && queued_ == 0 && (peeked_ == 0 || peekOffset_) &&
                      (peeked_ > 0 || poller_->busy());
    size_t skip = 0;  // bytes of this read the decoder already has
    ssize_t count;
    if (peek) {
        count =
            ::recv(socket_.get(), chunk.data(), options_.limits.readChunk, MSG_PEEK | MSG_DONTWAIT);
        if (count > 0) peeked_ += static_cast<size_t>(count);
    } else {
        for (;;) {
            count = ::read(socket_.get(), chunk.data(), wanted);
            if (count <= 0 || static_cast<size_t>(count) >= peeked_) break;
            // The kernel returns the bytes of one sender at a time.
            peeked_ -= static_cast<size_t>(count);
        }
        if (count > 0) skip = std::exchange(peeked_, 0);
    }
    if (count == 0) {
        closeLocked(kLogDebug, "the peer closed the connection", released);
    } else if (count < 0) {
        if (errno != EAGAIN && errno != EINTR)
            closeLocked(kLogDebug, std::string("read failed: ") + strerror(errno), released);
    } else if (static_cast<size_t>(count) > skip) {
        decoder_.feed(
            std::span<const uint8_t>(chunk.data() + skip, static_cast<size_t>(count) - skip));
        pumpLocked(released, runHere);
        // Unless a request runs here, what was looked at is taken at once.
        if (peek && !(runHere && *runHere) && !parked_) takePeekedLocked(released);
    }
}

void RelayConnection::takePeekedLocked(Released& released) {
    thread_local std::vector<uint8_t> scratch;
    while (peeked_ > 0 && !closed_) {
        if (scratch.size() < peeked_) scratch.resize(peeked_);
        const ssize_t count = ::read(socket_.get(), scratch.data(), peeked_);
        if (count < 0 && errno == EINTR) continue;
        if (count <= 0) {
            closeLocked(kLogDebug, "the bytes of a request went missing", released);
            return;
        }
        peeked_ -= static_cast<size_t>(count);
    }
}

void RelayConnection::pumpLocked(Released& released, std::optional<RelayEvent>* runHere) {
    while (!closed_ && queued_ < options_.limits.maxQueuedRequests) {
        relay::Frame frame;
        const relay::FrameDecoder::Status status = decoder_.next(frame);
        if (status == relay::FrameDecoder::Status::NeedMore) return;
        if (status == relay::FrameDecoder::Status::Error) {
            closeLocked(kLogError,
                        std::string("protocol error: ") + relay::describe(decoder_.error()),
                        released);
            return;
        }
        if (frame.kind == relay::FrameKind::Reply) {
            closeLocked(kLogError, "protocol error: a reply frame from a client", released);
            return;
        }
        RelayEvent event = RelayEvent::message(shared_from_this(), std::move(frame));
        const bool mayRunHere = runHere && !*runHere && !parked_;
        const bool runsHere = mayRunHere && claimInlineLocked();
        // With every inline place taken, the request waits for the next
        // thread that finishes one rather than going to the pool at once.
        const bool parks = mayRunHere && !runsHere && queued_ == 0 && poller_->hasInlinePlaces() &&
                           queue_->tryClaim();
        ++queued_;
        if (runsHere) {
            runHere->emplace(std::move(event));
        } else if (parks) {
            parked_.emplace(std::move(event));
            runningInline_ = true;
            poller_->park(shared_from_this());
        } else {
            dispatchLocked(std::move(event));
        }
    }
}

bool RelayConnection::flushLocked(Released& released) {
    while (pendingOutputLocked() > 0) {
        const ssize_t count = ::send(socket_.get(), output_.data() + outputStart_,
                                     pendingOutputLocked(), MSG_NOSIGNAL | MSG_DONTWAIT);
        if (count < 0) {
            if (errno == EINTR) continue;
            if (errno == EAGAIN) break;
            closeLocked(kLogDebug, std::string("write failed: ") + strerror(errno), released);
            return false;
        }
        outputStart_ += static_cast<size_t>(count);
    }
    if (outputStart_ == output_.size()) {
        output_.clear();
        outputStart_ = 0;
    } else if (outputStart_ > output_.size() / 2) {
        output_.erase(output_.begin(), output_.begin() + static_cast<ptrdiff_t>(outputStart_));
        outputStart_ = 0;
    }
    return true;
}

void RelayConnection::updateInterestLocked() {
    if (closed_ || token_ == 0) return;
    uint32_t wanted = 0;
    // While a request runs inline nothing of the peer is read. A hang-up
    // then is watched for only once the request waits parked or has held
    // its thread up: a short run ends first, and the arming after it
    // reports the hang-up before anything more of the peer starts.
    if (runningInline_) {
        if (parked_ || heldUp_) wanted |= EPOLLRDHUP;
    } else if (queued_ < options_.limits.maxQueuedRequests &&
               pendingOutputLocked() <= options_.limits.outputHighWater) {
        wanted |= EPOLLIN | EPOLLRDHUP;
    }
    if (pendingOutputLocked() > 0) wanted |= EPOLLOUT;
    if (wanted == interest_) return;
    if (poller_->modify(socket_.get(), token_, wanted | EPOLLONESHOT) == 0) interest_ = wanted;
}

void RelayConnection::chargeLocked(Released& released) {
    if (closed_ || !options_.budget) return;
    const size_t held = decoder_.buffered() + pendingOutputLocked();
    const ptrdiff_t delta = static_cast<ptrdiff_t>(held) - static_cast<ptrdiff_t>(charged_);
    if (delta == 0) return;
    charged_ = held;
    // Only growth is refused: a connection that gives bytes back may stay.
    if (!options_.budget->charge(peer_.effectiveUserId(), delta) && delta > 0)
        closeLocked(kLogDebug, "its user buffers more than allowed", released);
}

void RelayConnection::closeLocked(int level, const std::string& reason, Released& released) {
    if (closed_) return;
    closed_ = true;
    if (options_.budget) {
        options_.budget->charge(peer_.effectiveUserId(), -static_cast<ptrdiff_t>(charged_));
        charged_ = 0;
        options_.budget->releaseConnection(peer_.effectiveUserId());
    }
    released.lines.emplace_back(level, reason);
    if (token_ != 0) released.watcher = poller_->remove(socket_.get(), token_);
    token_ = 0;
    socket_.reset();
    decoder_ = relay::FrameDecoder();
    peeked_ = 0;
    output_ = {};
    outputStart_ = 0;
    dispatchLocked(RelayEvent::connectionInvalid(shared_from_this()));
}

void RelayConnection::dispatchLocked(RelayEvent event) {
    queue_->async([self = shared_from_this(), event = std::move(event)] { self->deliver(event); });
}

void RelayConnection::deliver(const RelayEvent& event) {
    EventHandler handler;
    {
        std::lock_guard lock(mutex_);
        // A request that has not started when its connection ended is
        // dropped: nobody is left to read its reply.
        if (!closed_ || event.isConnectionInvalid()) handler = handler_;
    }
    if (handler && event.isConnectionInvalid()) {
        handler(event);
    } else if (handler) {
        RelayPoller::Handling handling(*poller_);
        handler(event);
    }

    Released released(*this);
    EventHandler last;  // dropped after the lock is let go
    std::lock_guard lock(mutex_);
    if (event.isConnectionInvalid()) {
        last = std::move(handler_);
        handler_ = nullptr;
        return;
    }
    --queued_;
    pumpLocked(released);
    updateInterestLocked();
}

RelayConnection::Released::~Released() {
    const Options& options = connection_.options_;
    if (!options.log) return;
    for (const auto& [level, message] : lines)
        options.log(level,
                    options.label + " (pid " + std::to_string(connection_.pid()) + "): " + message);
}

}  // namespace berth
