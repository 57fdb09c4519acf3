#include "libberth/BerthConnection.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "core/RelayCodec.h"

namespace berth {
namespace {

using Clock = std::chrono::steady_clock;

BerthError makeError(BerthError::Code code, std::string message, int errorNumber = 0) {
    return BerthError{code, errorNumber, std::move(message)};
}

void setError(BerthError* out, BerthError error) {
    if (out) *out = std::move(error);
}

BerthError connectError(int code, const std::filesystem::path& path) {
    switch (code) {
        case ENOENT:
        case ECONNREFUSED:
            return makeError(BerthError::Code::NotRunning,
                             "berthd is not running (nobody listens at " + path.string() + ")",
                             code);
        case EACCES:
        case EPERM:
            return makeError(BerthError::Code::PermissionDenied,
                             "not allowed to connect to " + path.string(), code);
        default:
            return makeError(BerthError::Code::SystemError,
                             "cannot connect to " + path.string() + ": " + strerror(code), code);
    }
}

// Connects `fd` to the socket at `path`. A path too long for a socket
// address is reached through a descriptor of its directory.
int connectTo(int fd, const std::filesystem::path& path) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::string target = path.string();
    UniqueFd directory;
    if (target.size() >= sizeof address.sun_path) {
        directory.reset(::open(path.parent_path().c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
        if (!directory) return errno;
        target =
            "/proc/self/fd/" + std::to_string(directory.get()) + "/" + path.filename().string();
        if (target.size() >= sizeof address.sun_path) return ENAMETOOLONG;
    }
    std::memcpy(address.sun_path, target.c_str(), target.size() + 1);
    if (::connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0)
        return errno;
    return 0;
}

int millisecondsUntil(Clock::time_point deadline) {
    const auto left =
        std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
    return left <= 0 ? 0 : static_cast<int>(std::min<int64_t>(left, 1 << 30));
}

}  // namespace

const char* describe(BerthError::Code code) {
    switch (code) {
        case BerthError::Code::None:
            return "no error";
        case BerthError::Code::NotRunning:
            return "not running";
        case BerthError::Code::PermissionDenied:
            return "permission denied";
        case BerthError::Code::Timeout:
            return "timeout";
        case BerthError::Code::ProtocolError:
            return "protocol error";
        case BerthError::Code::ConnectionClosed:
            return "connection closed";
        case BerthError::Code::InvalidRequest:
            return "invalid request";
        case BerthError::Code::SystemError:
            return "system error";
    }
    return "unknown error";
}

std::filesystem::path BerthConnection::defaultSocketPath() {
    const char* root = std::getenv("BERTH_ROOT");
    std::filesystem::path path = root && *root ? root : "/";
    return path / "run/berthd/sys.kelp.berthd";
}

std::unique_ptr<BerthConnection> BerthConnection::connect(BerthError* error) {
    return connect(defaultSocketPath(), error);
}

std::unique_ptr<BerthConnection> BerthConnection::connect(const std::filesystem::path& socketPath,
                                                          BerthError* error) {
    UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (!fd) {
        setError(error, makeError(BerthError::Code::SystemError,
                                  std::string("socket: ") + strerror(errno), errno));
        return nullptr;
    }
    if (int code = connectTo(fd.get(), socketPath); code != 0) {
        setError(error, connectError(code, socketPath));
        return nullptr;
    }
    ::fcntl(fd.get(), F_SETFL, ::fcntl(fd.get(), F_GETFL) | O_NONBLOCK);
    return std::make_unique<BerthConnection>(Passkey{}, std::move(fd));
}

BerthConnection::BerthConnection(Passkey, UniqueFd socket) : socket_(std::move(socket)) {
    reader_ = std::thread([this] { readReplies(); });
}

BerthConnection::~BerthConnection() {
    breakWith(makeError(BerthError::Code::ConnectionClosed, "the connection was closed"));
    // Wakes the reader: its next read sees the end of the stream.
    ::shutdown(socket_.get(), SHUT_RDWR);
    reader_.join();
}

bool BerthConnection::isOpen() const {
    std::lock_guard lock(mutex_);
    return !broken_;
}

std::optional<Value> BerthConnection::request(const Value& message,
                                              std::chrono::milliseconds timeout,
                                              BerthError* error) {
    const Clock::time_point deadline = Clock::now() + timeout;
    const uint64_t id = nextMessageId_.fetch_add(1);
    std::vector<uint8_t> frame;
    relay::CodecError codecError = relay::CodecError::None;
    if (!relay::encodeFrame({relay::FrameKind::Request, id, message}, frame, &codecError)) {
        setError(error, makeError(BerthError::Code::InvalidRequest,
                                  std::string("cannot encode the request: ") +
                                      relay::describe(codecError)));
        return std::nullopt;
    }
    auto pending = std::make_shared<Pending>();
    {
        std::lock_guard lock(mutex_);
        if (broken_) {
            setError(error, broken_);
            return std::nullopt;
        }
        pending_.emplace(id, pending);
    }
    if (!write(frame, deadline, error)) {
        std::lock_guard lock(mutex_);
        pending_.erase(id);
        return std::nullopt;
    }

    std::unique_lock lock(mutex_);
    if (!replied_.wait_until(lock, deadline, [&] { return pending->done; })) {
        pending_.erase(id);
        setError(error,
                 makeError(BerthError::Code::Timeout, "no reply from berthd within " +
                                                          std::to_string(timeout.count()) + " ms"));
        return std::nullopt;
    }
    if (!pending->reply) {
        setError(error, broken_);
        return std::nullopt;
    }
    return std::move(pending->reply);
}

bool BerthConnection::write(const std::vector<uint8_t>& frame, Clock::time_point deadline,
                            BerthError* error) {
    std::lock_guard lock(writeMutex_);
    size_t written = 0;
    while (written < frame.size()) {
        const ssize_t count =
            ::send(socket_.get(), frame.data() + written, frame.size() - written, MSG_NOSIGNAL);
        if (count >= 0) {
            written += static_cast<size_t>(count);
            continue;
        }
        if (errno == EINTR) continue;
        if (errno != EAGAIN) {
            BerthError failure =
                errno == EPIPE || errno == ECONNRESET
                    ? makeError(BerthError::Code::ConnectionClosed, "berthd closed the connection",
                                errno)
                    : makeError(BerthError::Code::SystemError,
                                std::string("cannot send the request: ") + strerror(errno), errno);
            breakWith(failure);
            setError(error, failure);
            return false;
        }
        pollfd ready{socket_.get(), POLLOUT, 0};
        if (::poll(&ready, 1, millisecondsUntil(deadline)) == 0) {
            BerthError timedOut =
                makeError(BerthError::Code::Timeout, "berthd did not take the request in time");
            // Half a frame on the stream leaves it unusable.
            if (written > 0) breakWith(timedOut);
            setError(error, timedOut);
            return false;
        }
    }
    return true;
}

void BerthConnection::readReplies() {
    relay::FrameDecoder decoder;
    std::vector<uint8_t> chunk(64 << 10);
    for (;;) {
        pollfd ready{socket_.get(), POLLIN, 0};
        if (::poll(&ready, 1, -1) < 0 && errno != EINTR) {
            breakWith(makeError(BerthError::Code::SystemError,
                                std::string("poll: ") + strerror(errno), errno));
            return;
        }
        const ssize_t count = ::read(socket_.get(), chunk.data(), chunk.size());
        if (count < 0 && (errno == EAGAIN || errno == EINTR)) continue;
        if (count <= 0) {
            breakWith(makeError(BerthError::Code::ConnectionClosed, "berthd closed the connection",
                                count < 0 ? errno : 0));
            return;
        }
        decoder.feed(std::span<const uint8_t>(chunk.data(), static_cast<size_t>(count)));
        relay::Frame frame;
        relay::FrameDecoder::Status status;
        while ((status = decoder.next(frame)) == relay::FrameDecoder::Status::Frame) {
            if (frame.kind != relay::FrameKind::Reply) continue;  // nothing else is awaited
            std::lock_guard lock(mutex_);
            auto found = pending_.find(frame.messageId);
            if (found == pending_.end()) continue;  // its request gave up waiting
            found->second->reply = std::move(frame.body);
            found->second->done = true;
            pending_.erase(found);
            replied_.notify_all();
        }
        if (status == relay::FrameDecoder::Status::Error) {
            breakWith(makeError(
                BerthError::Code::ProtocolError,
                std::string("bad frame from berthd: ") + relay::describe(decoder.error())));
            ::shutdown(socket_.get(), SHUT_RDWR);
            return;
        }
    }
}

void BerthConnection::breakWith(BerthError error) {
    std::lock_guard lock(mutex_);
    if (!broken_) broken_ = std::move(error);
    for (auto& [id, pending] : pending_) pending->done = true;
    pending_.clear();
    replied_.notify_all();
}

}  // namespace berth
