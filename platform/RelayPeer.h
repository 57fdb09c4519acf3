// Who is at the other end of a relay connection.
//
// Everything here comes from the kernel, never from what the client sends:
//
//   - pid, effective uid and gid from SO_PEERCRED, as they were when the
//     peer connected;
//   - a pidfd of that process, from SO_PEERPIDFD (on kernels without it,
//     pidfd_open(pid) confirmed against the credentials), so that a pid
//     recycled after the peer exits cannot stand in for it;
//   - the executable the process ran when its connection was accepted
//     (device and inode), bound to the connection for its whole life.
//
// The peer's signing identity (identifier and entitlements) is evaluated
// anew for every request through the code-signing service. It is believed
// only while the connecting process is alive and still runs the executable
// bound at accept: a process that execs another program, or that exits
// after passing its socket to another process, leaves a connection with no
// identity at all, and every request on it must be refused.
//
// Limit: the executable is bound when the daemon accepts the connection, not
// at the instant of connect(). A process that connects and execs before the
// daemon got round to accepting is bound to the program it exec'd. The
// daemon accepts as soon as a connection is queued, which keeps that window
// short; the kernel offers no exec counter that would close it.
#pragma once

#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>

#include "core/Value.h"
#include "platform/CodeSigningRegistry.h"
#include "platform/ExecutableIdentity.h"
#include "platform/UniqueFd.h"

namespace berth {

// The caller of one request, as the code-signing service sees it now.
struct RelayPeerIdentity {
    pid_t pid = 0;
    uid_t effectiveUserId = 0;
    gid_t groupId = 0;
    // False when the connecting process has exited or now runs another
    // executable than the one bound at accept: the peer then has no
    // identity, and `signingError` says why.
    bool processStillBound = false;
    // The signing identifier and the whole entitlements dictionary; both
    // absent when the executable has no signature (`signingError` says why).
    std::optional<std::string> signingIdentifier;
    std::optional<Value> entitlements;
    std::string signingError;
};

class RelayPeer {
  public:
    // Establishes the credentials, pidfd and bound executable of the peer of
    // the connected socket `fd`. Fails (nullopt, with the reason) only when
    // the kernel gives no credentials; a peer whose pidfd or executable
    // cannot be had is kept, with no identity.
    static std::optional<RelayPeer> ofSocket(int fd, std::shared_ptr<CodeSigningService> signing,
                                             std::string* why = nullptr);

    RelayPeer(RelayPeer&&) noexcept = default;
    RelayPeer& operator=(RelayPeer&&) noexcept = default;

    pid_t pid() const { return pid_; }
    uid_t effectiveUserId() const { return uid_; }
    gid_t groupId() const { return gid_; }
    int pidfd() const { return pidfd_.get(); }
    const std::optional<ExecutableId>& boundExecutable() const { return bound_; }

    // The peer's identity at this moment. Safe from any thread.
    RelayPeerIdentity identity() const;

  private:
    RelayPeer() = default;

    pid_t pid_ = 0;
    uid_t uid_ = 0;
    gid_t gid_ = 0;
    UniqueFd pidfd_;
    std::optional<ExecutableId> bound_;
    std::string unboundReason_;  // why bound_ is empty
    std::shared_ptr<CodeSigningService> signing_;
};

}  // namespace berth
