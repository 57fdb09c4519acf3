// The kernel message interface of the upcall on Linux: out-of-line memory
// handed over as sealed memory files, messages on a SOCK_SEQPACKET socket,
// and the client side that plays the kernel's part (the launcher, berthctl,
// tests).
//
// Out-of-line memory is a memory file (memfd) sealed against writing,
// shrinking and growing before it is sent, so what the receiver checked is
// what it reads: the sender cannot change it afterwards. The receiver maps it
// read-only; releasing the mapping is how received out-of-line memory is
// given back.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <optional>
#include <vector>

#include "core/UpcallWire.h"
#include "platform/UniqueFd.h"

namespace berth {

// A read-only mapping of received out-of-line memory; unmapped when
// destroyed. An empty region (size 0) maps nothing.
class OutOfLineMemory {
  public:
    // Maps `size` bytes of `fd`. Fails with EBADF when `fd` is not a memory
    // file sealed against writing, shrinking and growing, with EMSGSIZE when it
    // holds fewer than `size` bytes, or with mmap's error.
    static std::optional<OutOfLineMemory> adopt(UniqueFd fd, size_t size, int* error);

    OutOfLineMemory(OutOfLineMemory&& other) noexcept;
    OutOfLineMemory& operator=(OutOfLineMemory&& other) noexcept;
    OutOfLineMemory(const OutOfLineMemory&) = delete;
    OutOfLineMemory& operator=(const OutOfLineMemory&) = delete;
    ~OutOfLineMemory();

    const uint8_t* data() const { return data_; }
    size_t size() const { return size_; }
    // Unmaps now; data() is null afterwards.
    void release();

  private:
    OutOfLineMemory(uint8_t* data, size_t size) : data_(data), size_(size) {}
    uint8_t* data_ = nullptr;
    size_t size_ = 0;
};

// A sealed memory file holding a copy of `size` bytes of `data`, ready to be
// handed over. Invalid, with the error stored through `error`, on failure.
UniqueFd BTHMakeSealedMemory(const void* data, size_t size, int* error);

// Sends one message with at most one descriptor attached. 0 or an errno.
int BTHUpcallSend(int socket, const uint8_t* bytes, size_t size, int attachedFd = -1);

// Receives one message into `buffer`; the first attached descriptor, if any,
// is stored in `attached`, others are closed. Returns the message size, 0 at
// the end of the stream, or -1 with errno set.
ssize_t BTHUpcallReceive(int socket, uint8_t* buffer, size_t size, UniqueFd* attached,
                         int flags = 0);

// What the daemon answered a request.
struct BTHUpcallAnswer {
    // The message as received (52 or 36 bytes).
    std::vector<uint8_t> message;
    // 0 for a success reply, else the error reply's return code.
    int32_t returnCode = 0;
    // The reply pack buffer of a success reply.
    std::vector<uint8_t> replyData;
};

// The launcher's side of the upcall socket: one connection, requests sent
// one at a time.
class BTHUpcallClient {
  public:
    // Connects to the daemon's upcall socket (default: in the runtime
    // directory). Fails with errno stored through `error`.
    static std::optional<BTHUpcallClient> connect(int* error);
    static std::optional<BTHUpcallClient> connect(const std::filesystem::path& socketPath,
                                                  int* error);

    // Sends `requestData` (a pack buffer) with the message id `messageId` and
    // waits for the answer. Fails with an errno (EPROTO for an answer that is
    // neither a success nor an error reply).
    std::optional<BTHUpcallAnswer> call(const std::vector<uint8_t>& requestData, int* error,
                                        uint32_t messageId = kBTHUpcallRequestId);

    // Sends the given message bytes with an optional descriptor and waits for
    // the answer: for tests of malformed requests.
    std::optional<BTHUpcallAnswer> callRaw(const std::vector<uint8_t>& message, int attachedFd,
                                           int* error);

    int socket() const { return socket_.get(); }

  private:
    explicit BTHUpcallClient(UniqueFd socket) : socket_(std::move(socket)) {}
    UniqueFd socket_;
};

}  // namespace berth
