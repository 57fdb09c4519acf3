// Who is at the other end of a relay connection.
//
// Everything here comes from the kernel, never from what the client sends:
//
//   - pid, effective uid and gid from SO_PEERCRED, as they were when the
//     peer connected;
//   - a pidfd of that process, from SO_PEERPIDFD (on kernels without it,
//     pidfd_open(pid) confirmed against the credentials), so that a pid
//     recycled after the peer exits cannot stand in for it.
//
// The peer's signing identity (identifier and entitlements) holds only while
// the process that connected is alive: a socket that outlives it, passed to
// another process, carries no identity at all, and every request on it must
// be refused. It is evaluated through the code-signing service once, and
// then checked for every request against what it was read from (see
// IdentityBasis): the process still alive and running the same file or in
// the same group, and every file and directory the answer rested on
// unchanged. When any of it changed - the program exec'd another or was
// replaced on disk, its entry was re-signed or withdrawn, a launch record or
// an owner or mode on the way changed - the request evaluates it anew, so
// every such change applies to the very next request. How the identity is found depends on the uid
// the peer connected with:
//
//   - root (uid 0) is trusted, and is the executable it runs: the file is
//     bound to the connection at accept (not at connect(), which only a root
//     process's own exec could exploit), and a peer that has exec'd another
//     program since has no identity;
//   - any other user is who its process was started as (launched by
//     berth-launch, or a process of a unit bound to an entry), whatever it
//     runs now: on Linux neither the executable of a non-root process nor
//     its pid across exec says which code is speaking (see ProcessCgroup.h).
//     Everything such a process forks or execs keeps its identity, as a
//     sandboxed app's children do, and nothing else can take it on.
#pragma once

#include <sys/types.h>

#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "core/Value.h"
#include "platform/ChangeWatch.h"
#include "platform/CodeSigningRegistry.h"
#include "platform/ExecutableIdentity.h"
#include "platform/ProcessImage.h"
#include "platform/UniqueFd.h"

namespace berth {

// The caller of one request, as the code-signing service sees it now.
struct RelayPeerIdentity {
    pid_t pid = 0;
    uid_t effectiveUserId = 0;
    gid_t groupId = 0;
    // False when the connecting process has exited, or (root's) now runs
    // another executable than the one bound at accept: the peer then has no
    // identity, and `signingError` says why.
    bool processStillBound = false;
    // The signing identifier and the whole entitlements dictionary; both
    // absent when the peer has no signature (`signingError` says why).
    std::optional<std::string> signingIdentifier;
    std::optional<Value> entitlements;
    std::string signingError;
};

class RelayPeer {
  public:
    // Establishes the credentials, pidfd and (for root) bound executable of
    // the peer of the connected socket `fd`. Fails (nullopt, with the reason)
    // only when the kernel gives no credentials; a peer whose pidfd or
    // executable cannot be had is kept, with no identity.
    // With `watch`, what a remembered identity rests on is checked through
    // it (see IdentityBasis).
    static std::optional<RelayPeer> ofSocket(int fd, std::shared_ptr<CodeSigningService> signing,
                                             std::string* why = nullptr,
                                             std::shared_ptr<ChangeWatch> watch = nullptr);

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

    // The kernel's credentials alone, no identity yet.
    RelayPeerIdentity credentials() const;
    // A full evaluation; what a signed identity rests on goes to `basis`.
    RelayPeerIdentity evaluate(IdentityBasis* basis) const;
    RelayPeerIdentity executableIdentity(IdentityBasis* basis) const;
    RelayPeerIdentity launchedIdentity(IdentityBasis* basis) const;

    // The last signed identity, while its basis holds.
    struct Remembered {
        std::mutex mutex;
        std::optional<RelayPeerIdentity> identity;  // guarded by mutex
        IdentityBasis basis;                        // guarded by mutex
    };

    pid_t pid_ = 0;
    uid_t uid_ = 0;
    gid_t gid_ = 0;
    UniqueFd pidfd_;
    // /proc/<pid>, opened while the peer lived: shows only that process.
    UniqueFd procDirectory_;
    // Root's peers only: the executable bound at accept, and the process's
    // image opened just before.
    std::optional<ExecutableId> bound_;
    ProcessImage image_;
    std::string unboundReason_;  // why there is no identity to be had
    std::shared_ptr<CodeSigningService> signing_;
    std::shared_ptr<ChangeWatch> watch_;
    std::unique_ptr<Remembered> remembered_ = std::make_unique<Remembered>();
};

}  // namespace berth
