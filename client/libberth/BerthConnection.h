// A client's connection to berthd over the relay.
//
//   berth::BerthError error;
//   auto connection = berth::BerthConnection::connect(&error);
//   if (!connection) fail(error.message);
//   Value request = Value::dictionary();
//   request.set("Command", uint64_t{0});
//   std::optional<Value> reply = connection->request(request, std::chrono::seconds(30), &error);
//
// The socket is the daemon's request socket under the device root
// (BERTH_ROOT, default "/"), or any path given. A connection may be shared by
// any number of threads: each request gets its own message id and its caller
// gets the reply with that id, whatever order replies arrive in. The daemon
// handles one connection's requests one at a time, in order; open several
// connections to have requests served in parallel.
//
// A connection that breaks (the daemon went away, a reply could not be
// decoded, a request was cut off half written) fails every request waiting
// on it and every later one, with the same error; connect again.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <filesystem>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>

#include "core/Value.h"
#include "platform/UniqueFd.h"

namespace berth {

struct BerthError {
    enum class Code {
        None,
        NotRunning,        // no socket at the path, or nobody listening on it
        PermissionDenied,  // the socket may not be used by this user
        Timeout,           // no reply within the time given
        ProtocolError,     // the daemon sent bytes that are not a valid reply
        ConnectionClosed,  // the daemon closed the connection
        InvalidRequest,    // the request cannot be encoded (see the relay's rules)
        SystemError,       // any other failure of a system call (see errorNumber)
    };

    Code code = Code::None;
    int errorNumber = 0;
    std::string message;

    explicit operator bool() const { return code != Code::None; }
};

// The name of an error code, e.g. "timeout".
const char* describe(BerthError::Code code);

class BerthConnection {
    struct Passkey {};

  public:
    // Made by connect() only.
    BerthConnection(Passkey, UniqueFd socket);

    // <BERTH_ROOT>/run/berthd/sys.kelp.berthd
    static std::filesystem::path defaultSocketPath();

    // Connects to the daemon's request socket, or to `socketPath`. Null, with
    // the error, when it cannot.
    static std::unique_ptr<BerthConnection> connect(BerthError* error = nullptr);
    static std::unique_ptr<BerthConnection> connect(const std::filesystem::path& socketPath,
                                                    BerthError* error = nullptr);

    // Closes the connection; requests still waiting fail with
    // ConnectionClosed.
    ~BerthConnection();
    BerthConnection(const BerthConnection&) = delete;
    BerthConnection& operator=(const BerthConnection&) = delete;

    // Sends `message` (a dictionary) as a request and waits up to `timeout`
    // for its reply. The reply, or nullopt with the error. A reply arriving
    // after its request timed out is dropped.
    std::optional<Value> request(const Value& message, std::chrono::milliseconds timeout,
                                 BerthError* error = nullptr);

    // Sends `message` as a one-way message: no reply comes.
    bool send(const Value& message, std::chrono::milliseconds timeout, BerthError* error = nullptr);

    // False once the connection broke or was closed.
    bool isOpen() const;

    // The connected socket (for tests and for passing it on).
    int socket() const { return socket_.get(); }

  private:
    struct Pending {
        std::optional<Value> reply;
        bool done = false;
    };

    // Writes one whole frame before `deadline`.
    bool write(const std::vector<uint8_t>& frame, std::chrono::steady_clock::time_point deadline,
               BerthError* error);
    void readReplies();
    // Marks the connection broken with `error` and fails every waiting
    // request. The first error wins.
    void breakWith(BerthError error);

    const UniqueFd socket_;
    std::atomic<uint64_t> nextMessageId_{1};
    std::mutex writeMutex_;

    mutable std::mutex mutex_;
    std::condition_variable replied_;
    std::map<uint64_t, std::shared_ptr<Pending>> pending_;
    BerthError broken_;
    std::thread reader_;
};

}  // namespace berth
