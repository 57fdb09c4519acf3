// What the connections of each user hold on the relay, and the limits that
// keep one user from taking the daemon's descriptors or memory: how many
// connections are open and how many bytes they buffer (unfinished requests
// and replies not yet read). Root is counted but never limited, and a
// number of descriptors is kept back from everyone else so that root can
// always connect and the daemon's own files can always be opened.
//
// Shared by a listener and the connections it accepts; every call is
// thread-safe.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstddef>
#include <functional>
#include <map>
#include <mutex>
#include <string>

namespace berth {

struct RelayUserLimits {
    // Connections one user other than root may have open.
    size_t maxConnectionsPerUser = 256;
    // Bytes the connections of one user other than root may buffer.
    size_t maxBufferedBytesPerUser = 64 << 20;
    // Descriptors below the process's limit, beyond those open when the
    // listener started, that only root's connections and the daemon's own
    // work may use.
    size_t reservedDescriptors = 128;
};

class RelayUserBudget {
  public:
    using Log = std::function<void(const std::string& message)>;
    using Clock = std::chrono::steady_clock;

    // `log` gets the refusals, each user's at most once a minute.
    RelayUserBudget(RelayUserLimits limits, Log log);

    // Whether a new connection of `uid` may be kept, counting it when so.
    bool admitConnection(uid_t uid);
    // Forgets one admitted connection of `uid`.
    void releaseConnection(uid_t uid);
    // Adds `delta` (which may be negative) to the bytes buffered for `uid`;
    // false when `uid` is now over its limit.
    bool charge(uid_t uid, ptrdiff_t delta);

    size_t connections(uid_t uid) const;
    size_t bufferedBytes(uid_t uid) const;

    // For tests: the clock that paces the refusal lines.
    void setClock(std::function<Clock::time_point()> now) { now_ = std::move(now); }

  private:
    struct User {
        size_t connections = 0;
        size_t bytes = 0;
        Clock::time_point lastRefusalLogged{};
        bool refusalLogged = false;
    };

    void refuseLocked(uid_t uid, User& user, const std::string& why);
    // How many connections the descriptors not kept back allow.
    size_t connectionsForOthers() const;

    const RelayUserLimits limits_;
    const Log log_;
    const size_t baselineDescriptors_;  // open when the budget was made
    std::function<Clock::time_point()> now_ = [] { return Clock::now(); };

    mutable std::mutex mutex_;
    std::map<uid_t, User> users_;
    size_t totalConnections_ = 0;
};

}  // namespace berth
