#include "platform/IdentityBasis.h"

#include <signal.h>
#include <sys/syscall.h>
#include <time.h>
#include <unistd.h>

#include "platform/ProcessCgroup.h"

namespace berth {

namespace {

int64_t nanoseconds(const struct timespec& t) {
    return static_cast<int64_t>(t.tv_sec) * 1'000'000'000 + t.tv_nsec;
}

std::optional<FileVersion> versionAt(const std::string& path, bool followLink) {
    struct stat status {};
    const int result = followLink ? ::stat(path.c_str(), &status) : ::lstat(path.c_str(), &status);
    if (result != 0) return std::nullopt;
    return FileVersion::of(status);
}

}  // namespace

FileVersion FileVersion::of(const struct stat& status) {
    return {status.st_dev,
            status.st_ino,
            status.st_size,
            nanoseconds(status.st_mtim),
            nanoseconds(status.st_ctim),
            status.st_mode,
            status.st_uid,
            status.st_gid};
}

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
    struct timespec now {};
    ::clock_gettime(CLOCK_REALTIME, &now);
    const int64_t cutoff = nanoseconds(now) - window.count();
    auto changedLately = [cutoff](const FileVersion& v) {
        return S_ISREG(v.mode) && v.ctimeNs >= cutoff;
    };
    if (executable_ && changedLately(*executable_)) return;
    for (const auto& [path, version] : files_)
        if (changedLately(version)) return;
    settled_ = true;
}

bool IdentityBasis::holds(pid_t pid, int pidfd) const {
    if (pid <= 0 || pidfd < 0) return false;
    const std::string proc = "/proc/" + std::to_string(pid);
    if (executable_ && versionAt(proc + "/exe", true) != executable_) return false;
    for (const auto& [path, version] : files_)
        if (versionAt(path, false) != version) return false;
    if (cgroup_) {
        std::string why;
        if (cgroupShownFor(pid, &why) != cgroup_) return false;
    }
    return ::syscall(SYS_pidfd_send_signal, pidfd, 0, nullptr, 0) == 0;
}

}  // namespace berth
