// Named POSIX semaphores, used as markers that last until the system
// restarts (the first-boot marker). Names are namespaced by device root: on a
// scratch root the name carries a hash of the root's path, so daemons serving
// different roots never see each other's markers.
#pragma once

#include <string>
#include <string_view>

namespace berth {

class NamedSemaphore {
  public:
    // The system-wide name for `name` on this device root ("/name" on the
    // host, "/name.<hash of the root>" on a scratch root).
    static std::string systemName(std::string_view name);

    // True when the semaphore exists (opened without creating, then closed).
    static bool exists(std::string_view name);

    // Creates it with `mode` and value 0 if it does not exist. On failure
    // returns false with errno set.
    static bool create(std::string_view name, unsigned mode);

    // Removes it (tests and tools only; the daemon never removes its marker).
    static bool remove(std::string_view name);
};

}  // namespace berth
