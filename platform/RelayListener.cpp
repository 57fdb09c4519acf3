#include "platform/RelayListener.h"

#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <thread>

#include "platform/ChangeWatch.h"

namespace berth {
namespace {

constexpr int kLogError = 3;
constexpr int kLogDebug = 7;
// Connections taken per readiness, so a connection storm does not starve
// the peers already connected.
constexpr int kAcceptsPerReadiness = 64;

}  // namespace

// Accepts on the poller's threads and owns what the listener shares with it.
class RelayListener::Acceptor final : public RelayPoller::Watcher {
  public:
    Acceptor(UniqueFd socket, std::shared_ptr<WorkQueue> queue, Options options,
             std::shared_ptr<RelayPoller> poller)
        : socket_(std::move(socket)),
          queue_(queue ? std::move(queue) : WorkQueue::global(QueuePriority::normal)),
          options_(std::move(options)),
          poller_(std::move(poller)),
          budget_(std::make_shared<RelayUserBudget>(
              options_.userLimits,
              // Connections may outlive the listener: the budget keeps its own
              // copy of where to log.
              [log = options_.log, label = options_.label](const std::string& message) {
                  if (log) log(kLogError, label + ": " + message);
              })),
          // Kept for the moment the process runs out of descriptors.
          reserve_(::open("/dev/null", O_RDONLY | O_CLOEXEC)) {
        if (!options_.codeSigning) options_.codeSigning = std::make_shared<CodeSigningRegistry>();
        // Without one, remembered identities are checked file by file.
        std::string why;
        changeWatch_ = ChangeWatch::make(&why);
        if (!changeWatch_) log(kLogError, "identities are checked without a watch: " + why);
    }

    void setEventHandler(EventHandler handler) {
        std::lock_guard lock(mutex_);
        handler_ = std::move(handler);
    }

    void resume(const std::shared_ptr<Acceptor>& self) {
        std::lock_guard lock(mutex_);
        if (resumed_ || stopped_) return;
        resumed_ = true;
        token_ = poller_->add(socket_.get(), EPOLLIN, self);
        if (token_ == 0)
            log(kLogError, std::string("cannot watch the listener: ") + strerror(errno));
    }

    // Stops accepting; gives back the connections still open.
    std::vector<std::shared_ptr<RelayConnection>> stop(std::shared_ptr<Watcher>* released) {
        std::lock_guard lock(mutex_);
        stopped_ = true;
        if (token_ != 0) *released = poller_->remove(socket_.get(), token_);
        token_ = 0;
        socket_.reset();
        std::vector<std::shared_ptr<RelayConnection>> open;
        for (auto& weak : connections_)
            if (auto connection = weak.lock()) open.push_back(std::move(connection));
        connections_.clear();
        return open;
    }

    size_t connectionCount() const {
        std::lock_guard lock(mutex_);
        size_t open = 0;
        for (const auto& weak : connections_)
            if (auto connection = weak.lock(); connection && connection->isOpen()) ++open;
        return open;
    }

    void ready(uint32_t) override {
        for (int i = 0; i < kAcceptsPerReadiness; ++i) {
            UniqueFd peer;
            int failure = 0;
            {
                std::lock_guard lock(mutex_);
                if (stopped_) return;
                peer.reset(
                    ::accept4(socket_.get(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC));
                failure = peer ? 0 : errno;
                if (failure == EMFILE || failure == ENFILE) shedLocked();
            }
            if (failure == EINTR || failure == ECONNABORTED) continue;
            if (failure == EMFILE || failure == ENFILE)
                log(kLogError, "out of file descriptors: refused a connection");
            else if (failure != 0 && failure != EAGAIN)
                log(kLogError, std::string("accept failed: ") + strerror(failure));
            if (failure != 0) return;
            adopt(std::move(peer));
        }
    }

  private:
    // Out of descriptors: the waiting peer would keep the listener readable
    // forever. Refuse it with the descriptor kept in reserve for this.
    void shedLocked() {
        reserve_.reset();
        UniqueFd refused(::accept4(socket_.get(), nullptr, nullptr, SOCK_CLOEXEC));
        refused.reset();
        reserve_.reset(::open("/dev/null", O_RDONLY | O_CLOEXEC));
    }

    void adopt(UniqueFd socket) {
        std::string why;
        std::optional<RelayPeer> peer =
            RelayPeer::ofSocket(socket.get(), options_.codeSigning, &why, changeWatch_);
        if (!peer) {
            log(kLogError, "refusing a connection: " + why);
            return;
        }
        // Closed at once: the peer sees its connection end before any reply.
        if (!budget_->admitConnection(peer->effectiveUserId())) return;
        RelayConnection::Options connectionOptions;
        connectionOptions.label = options_.label + ".peer." + std::to_string(peer->pid());
        connectionOptions.limits = options_.limits;
        connectionOptions.log = options_.log;
        connectionOptions.target = queue_;
        connectionOptions.budget = budget_;
        std::shared_ptr<RelayConnection> connection = RelayConnection::make(
            std::move(socket), std::move(*peer), poller_, std::move(connectionOptions));

        EventHandler handler;
        {
            std::lock_guard lock(mutex_);
            if (stopped_) {
                connection->cancel();
                return;
            }
            std::erase_if(connections_, [](const auto& weak) { return weak.expired(); });
            connections_.push_back(connection);
            handler = handler_;
        }
        log(kLogDebug, "accepted a connection from pid " + std::to_string(connection->pid()));
        queue_->async([handler = std::move(handler), connection = std::move(connection)] {
            if (handler)
                handler(connection);
            else
                connection->cancel();
        });
    }

    void log(int level, const std::string& message) const {
        if (options_.log) options_.log(level, options_.label + ": " + message);
    }

    UniqueFd socket_;
    const std::shared_ptr<WorkQueue> queue_;
    Options options_;
    const std::shared_ptr<RelayPoller> poller_;
    const std::shared_ptr<RelayUserBudget> budget_;
    UniqueFd reserve_;
    std::shared_ptr<ChangeWatch> changeWatch_;  // shared by the peers' identities

    mutable std::mutex mutex_;
    EventHandler handler_;
    uint64_t token_ = 0;
    bool resumed_ = false;
    bool stopped_ = false;
    std::vector<std::weak_ptr<RelayConnection>> connections_;
};

std::unique_ptr<RelayListener> RelayListener::make(UniqueFd socket,
                                                   std::shared_ptr<WorkQueue> queue,
                                                   Options options, std::string* why) {
    std::shared_ptr<RelayPoller> poller = RelayPoller::start(
        options.label.substr(0, 11) + ".io",
        options.ioThreads ? options.ioThreads : 2 * std::thread::hardware_concurrency() + 1, why);
    if (!poller) return nullptr;
    auto acceptor =
        std::make_shared<Acceptor>(std::move(socket), std::move(queue), std::move(options), poller);
    return std::make_unique<RelayListener>(Passkey{}, std::move(poller), std::move(acceptor));
}

RelayListener::RelayListener(Passkey, std::shared_ptr<RelayPoller> poller,
                             std::shared_ptr<Acceptor> acceptor)
    : poller_(std::move(poller)), acceptor_(std::move(acceptor)) {}

RelayListener::~RelayListener() {
    std::shared_ptr<RelayPoller::Watcher> released;
    for (const auto& connection : acceptor_->stop(&released)) connection->cancel();
    poller_->stop();
}

void RelayListener::setEventHandler(EventHandler handler) {
    acceptor_->setEventHandler(std::move(handler));
}

void RelayListener::resume() {
    acceptor_->resume(acceptor_);
}

size_t RelayListener::connectionCount() const {
    return acceptor_->connectionCount();
}

}  // namespace berth
