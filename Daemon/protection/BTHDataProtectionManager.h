// BTHDataProtectionManager: accepts a request to move a data container's
// user data to another protection class, and runs the change.
//
// A request is refused when it names no identifier or a class that is not a
// data class (2, 4, 6, 7, 9, 10, 11) (11), names an unknown container (21),
// asks for class 2, or asks a third party's app for anything but 0, 1 or 3
// (38). A request for the class the container already has succeeds at once
// and touches no file. Lowering the class (or leaving the default for a
// class below 3) re-classes directories and files, files already stronger
// than the new class excepted; raising it re-classes directories only, so
// existing files keep their class and new ones inherit the new one.
//
// The class applied is kept as the container's info value
// "sys.kelp.Lading.ContentProtectionClass" once the change has succeeded.
// When the device is locked and the caller allows it, the change waits for
// the next unlock and runs with the app held terminated.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <optional>
#include <string>

namespace berth {

class BTHDataProtectionManager {
  public:
    static BTHDataProtectionManager& defaultManager();

    // `completion` gets 1 or the failure's code exactly once: before this
    // returns when the request is refused, already satisfied or done at
    // once, else after an unlock (on the lock-state queue).
    void setDataProtectionOnDataContainerForUser(uid_t userId,
                                                 const std::optional<std::string>& identifier,
                                                 uint64_t containerClass,
                                                 int32_t dataProtectionClass,
                                                 bool isSecondOrThirdPartyApp, bool retryIfLocked,
                                                 std::function<void(uint64_t)> completion);

  private:
    BTHDataProtectionManager() = default;
};

}  // namespace berth
