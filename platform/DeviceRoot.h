// The device root: every fixed absolute path of the system resolves under it.
// It comes from the environment variable BERTH_ROOT (default "/"), read once
// on first use, so tests, the demo and benchmarks run on scratch roots and
// never touch the host's own directories.
#pragma once

#include <filesystem>
#include <string_view>

namespace berth {

class DeviceRoot {
  public:
    // The root, absolute and without trailing slash ("/" for the host).
    static const std::filesystem::path& path();
    static bool isHost() { return path() == "/"; }

    // A fixed absolute path of the system (e.g. "/private/var/containers")
    // under the device root. A trailing slash of `absolute` is dropped.
    static std::filesystem::path resolve(std::string_view absolute);
};

}  // namespace berth
