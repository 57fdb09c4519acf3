#include "platform/IdentityBasis.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/syscall.h>
#include <unistd.h>

#include "platform/ProcessCgroup.h"
#include "platform/UniqueFd.h"

namespace berth {

namespace {

// The version of what `path` (relative to `directory`) leads to, a last
// link followed: the executable a /proc entry names.
std::optional<FileVersion> versionAt(int directory, const std::string& path) {
    struct stat status {};
    if (::fstatat(directory, path.c_str(), &status, 0) != 0) return std::nullopt;
    return FileVersion::of(status);
}

// The version of the item at `path` itself.
std::optional<FileVersion> itemVersionAt(const std::string& path) {
    struct stat status {};
    if (::lstat(path.c_str(), &status) != 0) return std::nullopt;
    return FileVersion::of(status);
}

}  // namespace

void IdentityBasis::record(std::filesystem::path path, const struct stat& status) {
    files_.emplace_back(std::move(path), FileVersion::of(status));
}

void IdentityBasis::recordExecutable(const struct stat& status, UniqueFd file) {
    executable_ = FileVersion::of(status);
    executableFile_ = std::move(file);
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
        if (itemVersionAt(path) != version) return false;
    watched_ = watched;
    watchedSince_ = moment;
    return true;
}

bool IdentityBasis::executableHolds(int procDirectory, const ProcessImage* image) const {
    // An image unchanged since before the evaluation: no exec since, so the
    // process runs the file recorded, still open here.
    if (image && executableFile_ && image->unchanged()) {
        struct stat status {};
        return ::fstat(executableFile_.get(), &status) == 0 &&
               FileVersion::of(status) == *executable_;
    }
    return versionAt(procDirectory, "exe") == executable_;
}

bool IdentityBasis::holds(pid_t pid, int pidfd, int procDirectory, const ProcessImage* image) {
    if (!filesHold()) return false;
    // /proc is read last. The process's own directory, opened while it
    // lived, shows only that process and nothing once it is gone; one opened
    // now by pid could show a process that took the number, so the pidfd
    // confirms afterwards.
    UniqueFd openedNow;
    if (procDirectory < 0) {
        if (pid <= 0 || pidfd < 0) return false;
        openedNow.reset(
            ::open(("/proc/" + std::to_string(pid)).c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
        if (!openedNow) return false;
        procDirectory = openedNow.get();
    }
    std::string why;
    if (executable_ && !executableHolds(procDirectory, image)) return false;
    if (cgroup_ && cgroupShownIn(procDirectory, &why) != cgroup_) return false;
    if (openedNow || (!executable_ && !cgroup_))
        return ::syscall(SYS_pidfd_send_signal, pidfd, 0, nullptr, 0) == 0;
    return true;
}

}  // namespace berth
