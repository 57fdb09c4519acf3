// A relay server for the relay's test programs: a checked-in socket in a
// scratch directory, a listener on a concurrent queue, and a per-request
// handler supplied by the test (or a processor that takes every event and
// replies itself, as the daemon's request processing does). Records what the
// connections went through.
#pragma once

#include <cstring>

#include "TestSupport.h"
#include "core/RelayCodec.h"
#include "platform/RelayListener.h"
#include "platform/ServiceCheckIn.h"

namespace berth::test {

class RelayTestServer {
  public:
    // Fills the reply of a request, which is then sent.
    using Handler = std::function<void(const RelayEvent&, RelayReply&)>;

    // Peers are identified by `signing`, by default the scratch device
    // root's registry (which signs nothing). `ioThreads` 0: the listener's
    // default.
    explicit RelayTestServer(Handler handler, RelayLimits limits = {},
                             std::shared_ptr<CodeSigningService> signing = nullptr,
                             RelayUserLimits userLimits = {}, size_t ioThreads = 0)
        : state_(std::make_shared<State>()) {
        state_->handler = std::move(handler);
        start(limits, std::move(signing), userLimits, ioThreads);
    }

    // Takes every event of every connection, the connection's end included,
    // and makes and sends the replies itself.
    using Processor = std::function<void(const RelayEvent&)>;
    struct ProcessEvents {
        Processor processor;
    };
    RelayTestServer(ProcessEvents process, std::shared_ptr<CodeSigningService> signing,
                    RelayLimits limits = {}, RelayUserLimits userLimits = {})
        : state_(std::make_shared<State>()) {
        state_->processor = std::move(process.processor);
        start(limits, std::move(signing), userLimits);
    }

    ~RelayTestServer() { listener_.reset(); }
    RelayTestServer(const RelayTestServer&) = delete;
    RelayTestServer& operator=(const RelayTestServer&) = delete;

    const std::filesystem::path& path() const { return path_; }
    RelayListener& listener() { return *listener_; }

    // A raw client socket connected to the server.
    UniqueFd connectRaw() const {
        UniqueFd fd = connectUnix(path_);
        EXPECT_TRUE(fd) << strerror(errno);
        // Reads give up eventually, so a server that never answers fails the
        // test instead of hanging it.
        timeval limit{20, 0};
        ::setsockopt(fd.get(), SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
        return fd;
    }

    // Waits until `predicate` holds, or a generous limit that only a broken
    // server reaches.
    bool waitFor(const std::function<bool()>& predicate) {
        return eventually(predicate, std::chrono::seconds(20));
    }

    size_t invalidated() { return state_->invalidated; }
    // The replies whose send() failed (the peer was gone).
    size_t unsent() { return state_->unsent; }
    std::vector<std::string> log() {
        std::lock_guard lock(state_->mutex);
        return state_->log;
    }
    bool logged(const std::string& text) {
        for (const auto& line : log())
            if (line.find(text) != std::string::npos) return true;
        return false;
    }

  private:
    struct State {
        Handler handler;
        Processor processor;
        std::mutex mutex;  // guards the log
        std::atomic<size_t> invalidated = 0;
        std::atomic<size_t> unsent = 0;
        std::vector<std::string> log;
    };

    void start(RelayLimits limits, std::shared_ptr<CodeSigningService> signing,
               RelayUserLimits userLimits, size_t ioThreads = 0) {
        std::string why;
        auto checkIn = ServiceCheckIn::claim("relay.test", SOCK_STREAM, 0666, nullptr, &why,
                                             directory_.path());
        if (!checkIn) {
            ADD_FAILURE() << why;
            return;
        }
        path_ = checkIn->path();
        RelayListener::Options options;
        options.label = "relay.test";
        options.limits = limits;
        options.userLimits = userLimits;
        options.ioThreads = ioThreads;
        options.codeSigning = std::move(signing);
        options.log = [state = state_](int level, const std::string& line) {
            std::lock_guard lock(state->mutex);
            state->log.push_back(std::to_string(level) + " " + line);
        };
        listener_ = RelayListener::make(checkIn->takeSocket(),
                                        WorkQueue::makeConcurrent("relay.test.listener"),
                                        std::move(options), &why);
        checkIn_.emplace(std::move(*checkIn));
        if (!listener_) {
            ADD_FAILURE() << why;
            return;
        }
        // The connections' last events may come after the server is gone:
        // they hold on to the state, not to the server.
        listener_->setEventHandler(
            [state = state_](const std::shared_ptr<RelayConnection>& connection) {
                connection->setEventHandler([state, connection](const RelayEvent& event) {
                    onEvent(*state, connection, event);
                });
                connection->resume();
            });
        listener_->resume();
    }

    static void onEvent(State& state, const std::shared_ptr<RelayConnection>& connection,
                        const RelayEvent& event) {
        if (event.isConnectionInvalid()) ++state.invalidated;
        if (state.processor) {
            state.processor(event);
            return;
        }
        if (event.isConnectionInvalid()) return;
        std::optional<RelayReply> reply = event.makeReply();
        if (!reply) {
            connection->cancel();
            return;
        }
        state.handler(event, *reply);
        if (!reply->send()) ++state.unsent;
    }

    std::shared_ptr<State> state_;
    ScratchDir directory_;
    std::filesystem::path path_;
    std::optional<ServiceCheckIn> checkIn_;
    std::unique_ptr<RelayListener> listener_;
};

// Encodes one frame.
inline std::vector<uint8_t> frameBytes(relay::FrameKind kind, uint64_t id, const Value& body) {
    std::vector<uint8_t> bytes;
    EXPECT_TRUE(relay::encodeFrame({kind, id, body}, bytes));
    return bytes;
}

inline bool writeAll(int fd, const std::vector<uint8_t>& bytes) {
    size_t done = 0;
    while (done < bytes.size()) {
        const ssize_t count = ::send(fd, bytes.data() + done, bytes.size() - done, MSG_NOSIGNAL);
        if (count < 0 && errno == EINTR) continue;
        if (count <= 0) return false;
        done += static_cast<size_t>(count);
    }
    return true;
}

// The frames arriving on a blocking socket, one after another: bytes read
// past a frame stay for the next, so nothing that arrived is overlooked.
class FrameReader {
  public:
    explicit FrameReader(int fd) : fd_(fd) {}

    // The next frame; none when the stream ends, breaks or is not frames.
    std::optional<relay::Frame> next() {
        uint8_t chunk[4096];
        for (;;) {
            relay::Frame frame;
            const auto status = decoder_.next(frame);
            if (status == relay::FrameDecoder::Status::Frame) return frame;
            if (status == relay::FrameDecoder::Status::Error) return std::nullopt;
            const ssize_t got = ::read(fd_, chunk, sizeof chunk);
            if (got < 0 && errno == EINTR) continue;
            if (got <= 0) return std::nullopt;
            decoder_.feed(std::span<const uint8_t>(chunk, static_cast<size_t>(got)));
        }
    }

  private:
    int fd_;
    relay::FrameDecoder decoder_;
};

// Reads frames from a blocking socket until `count` arrived, or the stream
// ends or breaks.
inline std::vector<relay::Frame> readFrames(int fd, size_t count) {
    FrameReader reader(fd);
    std::vector<relay::Frame> frames;
    while (frames.size() < count) {
        std::optional<relay::Frame> frame = reader.next();
        if (!frame) break;
        frames.push_back(std::move(*frame));
    }
    return frames;
}

// True when the peer closed `fd` (reads reach the end of the stream).
inline bool readsEndOfStream(int fd) {
    uint8_t byte;
    ssize_t got;
    do got = ::read(fd, &byte, 1);
    while (got < 0 && errno == EINTR);
    return got == 0 || (got < 0 && errno == ECONNRESET);
}

}  // namespace berth::test
