#include "platform/RelayUserBudget.h"

#include <dirent.h>
#include <sys/resource.h>

#include <algorithm>
#include <cstdint>

namespace berth {
namespace {

constexpr auto kRefusalLogInterval = std::chrono::minutes(1);
// A connection holds its socket and the peer's pidfd.
constexpr size_t kDescriptorsPerConnection = 2;

size_t openDescriptors() {
    DIR* dir = ::opendir("/proc/self/fd");
    if (!dir) return 0;
    size_t count = 0;
    while (const struct dirent* entry = ::readdir(dir))
        if (entry->d_name[0] != '.') ++count;
    ::closedir(dir);
    return count > 0 ? count - 1 : 0;  // not the listing's own
}

}  // namespace

RelayUserBudget::RelayUserBudget(RelayUserLimits limits, Log log)
    : limits_(limits), log_(std::move(log)), baselineDescriptors_(openDescriptors()) {}

size_t RelayUserBudget::connectionsForOthers() const {
    struct rlimit limit {};
    if (::getrlimit(RLIMIT_NOFILE, &limit) != 0 || limit.rlim_cur == RLIM_INFINITY) return SIZE_MAX;
    const size_t kept = baselineDescriptors_ + limits_.reservedDescriptors;
    const size_t total = static_cast<size_t>(limit.rlim_cur);
    return total > kept ? (total - kept) / kDescriptorsPerConnection : 0;
}

bool RelayUserBudget::admitConnection(uid_t uid) {
    std::lock_guard lock(mutex_);
    User& user = users_[uid];
    if (uid != 0) {
        if (user.connections >= limits_.maxConnectionsPerUser) {
            refuseLocked(uid, user,
                         "has " + std::to_string(user.connections) + " connections open");
            return false;
        }
        // What is left is root's and the daemon's own.
        if (totalConnections_ >= connectionsForOthers()) {
            refuseLocked(uid, user, "would take the descriptors kept for root and the daemon");
            return false;
        }
    }
    ++user.connections;
    ++totalConnections_;
    return true;
}

void RelayUserBudget::releaseConnection(uid_t uid) {
    std::lock_guard lock(mutex_);
    auto it = users_.find(uid);
    if (it == users_.end() || it->second.connections == 0) return;
    --it->second.connections;
    --totalConnections_;
}

bool RelayUserBudget::charge(uid_t uid, ptrdiff_t delta) {
    std::lock_guard lock(mutex_);
    User& user = users_[uid];
    if (delta < 0)
        user.bytes -= std::min(user.bytes, static_cast<size_t>(-delta));
    else
        user.bytes += static_cast<size_t>(delta);
    if (uid == 0 || user.bytes <= limits_.maxBufferedBytesPerUser) return true;
    refuseLocked(uid, user, "buffers " + std::to_string(user.bytes) + " bytes");
    return false;
}

size_t RelayUserBudget::connections(uid_t uid) const {
    std::lock_guard lock(mutex_);
    auto it = users_.find(uid);
    return it == users_.end() ? 0 : it->second.connections;
}

size_t RelayUserBudget::bufferedBytes(uid_t uid) const {
    std::lock_guard lock(mutex_);
    auto it = users_.find(uid);
    return it == users_.end() ? 0 : it->second.bytes;
}

void RelayUserBudget::refuseLocked(uid_t uid, User& user, const std::string& why) {
    const Clock::time_point now = now_();
    if (user.refusalLogged && now - user.lastRefusalLogged < kRefusalLogInterval) return;
    user.refusalLogged = true;
    user.lastRefusalLogged = now;
    if (log_) log_("refusing connections of user " + std::to_string(uid) + ": it " + why);
}

}  // namespace berth
