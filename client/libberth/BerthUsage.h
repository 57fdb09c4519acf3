// Typed calls of berthd's disk-usage and protection-class commands.
//
//   berth::BerthUsage usage(*connection);
//   berth::ContainerSelector data{2, berth::kBerthCallerUserId, "com.example.notes", uuid};
//   berth::ContainerError failure;
//   std::optional<uint64_t> bytes = usage.diskUsage(data, &failure);
//   // Re-class the app's data; wait for the next unlock if the device is locked.
//   usage.setDataProtection(data, /*protectionClass=*/3, /*thirdParty=*/true,
//                           /*retryIfLocked=*/true, &failure);
//
//   command  call               reads
//   23       diskUsage          class, user, identifier, UUID
//   21       setDataProtection  class, user, identifier (no UUID: the daemon
//                               finds the permanent container)
//
// A bundle container's usage is measured once and then answered from what
// the daemon kept. setDataProtection replies once, when the change is over:
// with retryIfLocked on a locked device that is after the next unlock, so
// give it a timeout long enough (or kBerthWaitForever).
#pragma once

#include <chrono>
#include <cstdint>
#include <optional>

#include "libberth/BerthContainers.h"

namespace berth {

enum BerthUsageCommand : uint64_t {
    kBerthCommandSetDataProtection = 21,
    kBerthCommandDiskUsage = 23,
};

// A timeout that never runs out within the life of a program.
inline constexpr std::chrono::milliseconds kBerthWaitForever = std::chrono::hours(24 * 365);

Value makeDiskUsageRequest(const ContainerSelector& selector);
// "DataProtectionClass" goes as int64, the flags as bools.
Value makeSetDataProtectionRequest(const ContainerSelector& selector, int32_t protectionClass,
                                   bool thirdParty, bool retryIfLocked);
// The bytes of a successful reply; a success without an unsigned
// "ReplyDiskUsage" is a ProtocolError.
std::optional<uint64_t> decodeDiskUsageReply(const Value& reply, ContainerError* error);

class BerthUsage {
  public:
    explicit BerthUsage(BerthConnection& connection,
                        std::chrono::milliseconds timeout = std::chrono::seconds(30))
        : connection_(connection), timeout_(timeout) {}

    // Command 23.
    std::optional<uint64_t> diskUsage(const ContainerSelector& selector,
                                      ContainerError* error = nullptr);

    // Command 21: re-classes the user data of a data container (classes 2,
    // 4, 6, 7, 9, 10, 11). Class 2 is refused (BTHErrorInvalidParameter,
    // 38), as is any class but 0, 1 and 3 for a third-party app. A locked
    // device fails it with BTHErrorDeviceLocked (61) unless `retryIfLocked`.
    bool setDataProtection(const ContainerSelector& selector, int32_t protectionClass,
                           bool thirdParty, bool retryIfLocked, ContainerError* error = nullptr);

  private:
    std::optional<Value> exchange(const Value& request, ContainerError* error);

    BerthConnection& connection_;
    std::chrono::milliseconds timeout_;
};

}  // namespace berth
