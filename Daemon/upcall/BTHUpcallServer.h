// The kernel upcall service: the sandbox launcher asks, on the upcall socket,
// for every directory of a process being started. Messages are received and
// answered on the main queue.
//
// Until the process-containers routine is built into this daemon, every
// request gets an error reply whose return code is 5 (the request cannot be
// served); messages of another id get -303 (bad message id).
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <vector>

#include "platform/RunLoop.h"
#include "platform/ServiceCheckIn.h"
#include "platform/UniqueFd.h"

namespace berth {

inline constexpr uint32_t kBTHUpcallRequestId = 322514900;
inline constexpr uint32_t kBTHUpcallReplyIdOffset = 100;
inline constexpr size_t kBTHUpcallRequestSize = 52;
inline constexpr size_t kBTHUpcallErrorReplySize = 36;
inline constexpr int32_t kBTHUpcallBadMessageId = -303;
inline constexpr int32_t kBTHUpcallCannotServe = 5;

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
