#include "platform/IdentityBasis.h"

#include <signal.h>
#include <sys/syscall.h>
#include <unistd.h>

#include "platform/ProcessCgroup.h"

namespace berth {

namespace {

std::optional<FileVersion> versionAt(const std::string& path, bool followLink) {
    struct stat status {};
    const int result = followLink ? ::stat(path.c_str(), &status) : ::lstat(path.c_str(), &status);
    if (result != 0) return std::nullopt;
    return FileVersion::of(status);
}

}  // namespace

void IdentityBasis::record(std::filesystem::path path, const struct stat& status) {
    files_.emplace_back(std::move(path), FileVersion::of(status));
}

void IdentityBasis::recordExecutable(const struct stat& status) {
    executable_ = FileVersion::of(status);
}

void IdentityBasis::recordCgroup(std::string cgroup) {
    cgroup_ = std::move(cgroup);
}

void IdentityBasis::settle(std::chrono::nanoseconds window) {
    settled_ = false;
    if (files_.empty() && !executable_) return;
    // Only contents read are at stake; directories count by owner and mode.
    auto changedLately = [window](const FileVersion& v) {
        return S_ISREG(v.mode) && v.changedWithin(window);
    };
    if (executable_ && changedLately(*executable_)) return;
    for (const auto& [path, version] : files_)
        if (changedLately(version)) return;
    settled_ = true;
}

void IdentityBasis::watchWith(std::shared_ptr<ChangeWatch> watch) {
    watch_ = std::move(watch);
    watched_ = false;
    // Watched at once, so the very next check may rely on the watch; files
    // that changed since they were recorded leave it unwatched, and that
    // check finds them changed.
    filesHold();
}

bool IdentityBasis::filesHold() {
    if (watched_ && watch_->unchangedSince(watchedSince_)) return true;
    watched_ = false;
    // The moment comes first: a change after it is either seen by the stats
    // below or counted by the watch.
    const uint64_t moment = watch_ ? watch_->now() : 0;
    bool watched = watch_ != nullptr;
    for (const auto& [path, version] : files_)
        if (watched && !watch_->watch(path)) watched = false;
    for (const auto& [path, version] : files_)
        if (versionAt(path, false) != version) return false;
    watched_ = watched;
    watchedSince_ = moment;
    return true;
}

bool IdentityBasis::holds(pid_t pid, int pidfd) {
    if (pid <= 0 || pidfd < 0) return false;
    const std::string proc = "/proc/" + std::to_string(pid);
    if (executable_ && versionAt(proc + "/exe", true) != executable_) return false;
    if (!filesHold()) return false;
    if (cgroup_) {
        std::string why;
        if (cgroupShownFor(pid, &why) != cgroup_) return false;
    }
    return ::syscall(SYS_pidfd_send_signal, pidfd, 0, nullptr, 0) == 0;
}

}  // namespace berth
