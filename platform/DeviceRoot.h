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

    // Keeps an O_PATH descriptor of the root open for the rest of the
    // process, so that link-safe opens beneath it need not open the root
    // each time. For the daemon, whose root is never replaced while it runs;
    // a process that keeps it pins the root's file system (which then cannot
    // be unmounted). False when the root cannot be opened.
    static bool keepOpen();
    // The kept descriptor, or -1 when none is kept. Not to be closed.
    static int descriptor();

    // A fixed absolute path of the system (e.g. "/private/var/containers")
    // under the device root. A trailing slash of `absolute` is dropped.
    static std::filesystem::path resolve(std::string_view absolute);
};

}  // namespace berth
