// The system's service manager, as the daemon meets it when it runs as a
// service: readiness and status notifications, sockets it opened on the
// daemon's behalf (socket activation), and whether the daemon's output goes
// to the journal.
//
// Every call is harmless when the daemon was not started by the service
// manager: notifications go nowhere and no socket is passed.
#pragma once

#include <string>

#include "platform/UniqueFd.h"

namespace berth {

class ServiceManager {
  public:
    // "READY=1": start-up is done and requests are served.
    static void notifyReady();
    // "STATUS=<text>": what long start-up work is doing.
    static void notifyStatus(const std::string& text);
    // "STOPPING=1": the daemon is ending.
    static void notifyStopping();

    // The listening socket the service manager passed under `name` (its
    // file descriptor name), taken over by the caller; invalid when none was
    // passed. Passed sockets are collected once, on the first call, and the
    // environment that announced them is cleared so children do not inherit
    // it.
    static UniqueFd takeActivatedSocket(const std::string& name);

    // Whether the daemon was started by the service manager (its output
    // connected to the journal, or an invocation of a unit), so that its
    // lines belong in the journal too.
    static bool loggingToJournal();
};

}  // namespace berth
