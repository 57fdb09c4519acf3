// The key bag's lock state and its change notification. The state lives in
// <root>/run/berthd/lockstate: "1" locked, "0" unlocked, an absent file
// unlocked, any other number a transitional state that callers ignore. The
// notification is an inotify watch on the runtime directory; its descriptor
// goes into the main run loop, which calls drain() when it is readable.
#pragma once

#include <filesystem>
#include <string>

#include "platform/UniqueFd.h"

namespace berth {

class LockStateNotification {
  public:
    // The notification's name, as start-up reports it.
    static constexpr const char* kName = "sys.kelp.keybag.lockstatus";

    static std::filesystem::path stateFile();

    // The current state: 0 unlocked, 1 locked, or the other number written.
    static int lockState();

    // Writes the state atomically (for the administrator's tool and tests).
    static bool setLockState(int state, std::string* why = nullptr);

    // Starts watching; on failure returns false with errno set (the
    // registration status).
    bool registerForChanges();
    int fd() const { return fd_.get(); }

    // Consumes pending events; true when one of them concerned the state file.
    bool drain();

  private:
    UniqueFd fd_;
};

}  // namespace berth
