// The kernel upcall service: the sandbox launcher asks, on the upcall socket,
// for every directory of a process being started. Messages are received and
// answered one at a time on the main queue. Each received message gets the
// trailer the kernel interface would add (the sender's audit token, from the
// credentials the kernel recorded when the sender connected) and goes to
// demux_server; a message of an id no routine handles is answered with -303
// (bad message id), so no sender waits for ever.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <vector>

#include "core/UpcallWire.h"
#include "platform/RunLoop.h"
#include "platform/ServiceCheckIn.h"
#include "platform/UniqueFd.h"

namespace berth {

// The error reply to `request` (at least the 24-byte header): the request's
// reply-port disposition without the complex bit, size 36, its remote port,
// message id + 100, the native data representation record and `code`.
std::vector<uint8_t> BTHUpcallErrorReply(const uint8_t* request, size_t size, int32_t code);

class BTHUpcallServer {
    struct Passkey {};

  public:
    // Checks the upcall socket in and serves it on `runLoop`. Null, with the
    // failure logged under BTHKernServerStart, when the check-in fails.
    static std::unique_ptr<BTHUpcallServer> start(RunLoop& runLoop);
    BTHUpcallServer(Passkey, RunLoop& runLoop, ServiceCheckIn checkIn);
    ~BTHUpcallServer();
    BTHUpcallServer(const BTHUpcallServer&) = delete;
    BTHUpcallServer& operator=(const BTHUpcallServer&) = delete;

  private:
    void accept();
    void serve(int fd);
    void close(int fd);

    RunLoop& runLoop_;
    ServiceCheckIn checkIn_;
    RunLoop::WatchId listenerWatch_{};
    std::map<int, std::pair<UniqueFd, RunLoop::WatchId>> clients_;
};

}  // namespace berth
