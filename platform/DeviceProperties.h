// The device-property query: "InternalBuild" and "MultiUser" from
// DeviceProperties.plist under the device root. A missing or unreadable file,
// or a missing key, answers false.
#pragma once

#include <cstdint>

namespace berth {

class DeviceProperties {
  public:
    // Read on every call: an administrator may change the file while the
    // daemon runs and expects the next request to see it.
    static bool isInternalBuild();
    static bool isMultiUser();

    // The host's multi-user configuration flags: bit 31 is "MultiUser".
    static uint32_t multiUserFlags();
};

}  // namespace berth
