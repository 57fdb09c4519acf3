#include "platform/RelayPeer.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <fstream>
#include <sstream>

#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77
#endif

namespace berth {
namespace {

// The effective uid and gid that /proc shows for `pid` ("Uid:" and "Gid:"
// lines, second field each).
bool procEffectiveIds(pid_t pid, uid_t* uid, gid_t* gid) {
    std::ifstream status("/proc/" + std::to_string(pid) + "/status");
    bool haveUid = false, haveGid = false;
    for (std::string line; std::getline(status, line);) {
        std::istringstream fields(line);
        std::string key;
        unsigned long real = 0, effective = 0;
        fields >> key >> real >> effective;
        if (!fields) continue;
        if (key == "Uid:") *uid = static_cast<uid_t>(effective), haveUid = true;
        if (key == "Gid:") *gid = static_cast<gid_t>(effective), haveGid = true;
    }
    return haveUid && haveGid;
}

// A pidfd for the process that connected. Kernels since 6.5 hand out the
// socket's own, taken at connect; older ones only give the pid, which is
// opened and then checked to be a live process with the connecting
// credentials (a process that inherited the number would have to share them).
UniqueFd peerPidfd(int fd, const ucred& cred, std::string* why) {
    int pidfd = -1;
    socklen_t length = sizeof pidfd;
    if (::getsockopt(fd, SOL_SOCKET, SO_PEERPIDFD, &pidfd, &length) == 0 && pidfd >= 0)
        return UniqueFd(pidfd);
    if (errno != ENOPROTOOPT && errno != EINVAL) {
        *why = std::string("no pidfd for the peer: ") + strerror(errno);
        return {};
    }
    UniqueFd opened(static_cast<int>(::syscall(SYS_pidfd_open, cred.pid, 0)));
    uid_t uid = 0;
    gid_t gid = 0;
    if (!opened || !pidfdRefersTo(opened.get(), cred.pid, why) ||
        !procEffectiveIds(cred.pid, &uid, &gid) || uid != cred.uid || gid != cred.gid) {
        if (why->empty()) *why = "the connecting process is gone";
        return {};
    }
    return opened;
}

}  // namespace

std::optional<RelayPeer> RelayPeer::ofSocket(int fd, std::shared_ptr<CodeSigningService> signing,
                                             std::string* why, std::shared_ptr<ChangeWatch> watch) {
    ucred cred{};
    socklen_t length = sizeof cred;
    if (::getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &length) != 0) {
        if (why) *why = std::string("no peer credentials: ") + strerror(errno);
        return std::nullopt;
    }
    RelayPeer peer;
    peer.pid_ = cred.pid;
    peer.uid_ = cred.uid;
    peer.gid_ = cred.gid;
    peer.signing_ = std::move(signing);
    peer.watch_ = std::move(watch);
    if (cred.pid <= 0) {
        // The peer lives in a pid namespace this one cannot see.
        peer.unboundReason_ = "the peer's process is not visible to the daemon";
        return peer;
    }
    peer.pidfd_ = peerPidfd(fd, cred, &peer.unboundReason_);
    if (!peer.pidfd_) return peer;
    // Opened before the pidfd is confirmed, so the directory is the peer's;
    // without it, /proc is read by pid and the pidfd confirms each time.
    peer.procDirectory_.reset(
        ::open(("/proc/" + std::to_string(cred.pid)).c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    std::string gone;
    if (peer.procDirectory_ && !pidfdRefersTo(peer.pidfd_.get(), cred.pid, &gone))
        peer.procDirectory_.reset();
    if (peer.uid_ != 0) return peer;
    // Opened before the executable is bound: an image unchanged later means
    // no exec since the binding (see ProcessImage).
    peer.image_ = ProcessImage::of(peer.procDirectory_.get());
    peer.bound_ = peer.signing_->executableOf(peer.pid_, peer.pidfd_.get(), &peer.unboundReason_);
    return peer;
}

RelayPeerIdentity RelayPeer::identity() const {
    std::lock_guard lock(remembered_->mutex);
    std::optional<RelayPeerIdentity>& remembered = remembered_->identity;
    if (remembered && remembered_->basis.holds(pid_, pidfd_.get(), procDirectory_.get(), &image_))
        return *remembered;
    IdentityBasis basis;
    RelayPeerIdentity evaluated = evaluate(&basis);
    if (evaluated.signingIdentifier && basis.settled()) {
        remembered = evaluated;
        remembered_->basis = std::move(basis);
        if (watch_) remembered_->basis.watchWith(watch_);
    } else {
        remembered.reset();
    }
    return evaluated;
}

RelayPeerIdentity RelayPeer::evaluate(IdentityBasis* basis) const {
    return uid_ == 0 ? executableIdentity(basis) : launchedIdentity(basis);
}

RelayPeerIdentity RelayPeer::credentials() const {
    RelayPeerIdentity identity;
    identity.pid = pid_;
    identity.effectiveUserId = uid_;
    identity.groupId = gid_;
    return identity;
}

RelayPeerIdentity RelayPeer::launchedIdentity(IdentityBasis* basis) const {
    RelayPeerIdentity identity = credentials();
    if (!pidfd_) {
        identity.signingError = unboundReason_;
        return identity;
    }
    std::string why;
    if (std::optional<PeerIdentity> started =
            signing_->identifyLaunched(pid_, pidfd_.get(), uid_, &why)) {
        identity.processStillBound = true;
        identity.signingIdentifier = std::move(started->identifier);
        identity.entitlements = std::move(started->entitlements);
        *basis = std::move(started->basis);
        return identity;
    }
    std::string gone;
    if (!pidfdRefersTo(pidfd_.get(), pid_, &gone)) {
        identity.signingError = "the connecting process has exited (" + gone + ")";
        return identity;
    }
    identity.processStillBound = true;
    identity.signingError = why;
    return identity;
}

RelayPeerIdentity RelayPeer::executableIdentity(IdentityBasis* basis) const {
    RelayPeerIdentity identity = credentials();
    if (!bound_) {
        identity.signingError = unboundReason_;
        return identity;
    }
    std::string why;
    if (std::optional<PeerIdentity> signedAs = signing_->identify(pid_, pidfd_.get(), &why)) {
        if (signedAs->executable != *bound_) {
            identity.signingError =
                "pid " + std::to_string(pid_) + " runs another executable than when it connected";
            return identity;
        }
        identity.processStillBound = true;
        identity.signingIdentifier = std::move(signedAs->identifier);
        identity.entitlements = std::move(signedAs->entitlements);
        *basis = std::move(signedAs->basis);
        return identity;
    }
    // No signature, or no process: only a live process still running the
    // bound executable keeps its (unsigned) identity.
    std::string gone;
    std::optional<ExecutableId> now = signing_->executableOf(pid_, pidfd_.get(), &gone);
    if (!now) {
        identity.signingError = "the connecting process has exited (" + gone + ")";
    } else if (*now != *bound_) {
        identity.signingError =
            "pid " + std::to_string(pid_) + " runs another executable than when it connected";
    } else {
        identity.processStillBound = true;
        identity.signingError = why;
    }
    return identity;
}

}  // namespace berth
