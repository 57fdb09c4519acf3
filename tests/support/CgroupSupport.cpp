#include "CgroupSupport.h"

#include <sys/wait.h>
#include <unistd.h>

#include <fcntl.h>
#include <signal.h>

#include <cerrno>
#include <cstring>
#include <fstream>
#include <thread>

#include "platform/ExecutableIdentity.h"

namespace berth::test {

std::string launchCgroupsUnusable(const LaunchCgroup& cgroups) {
    const std::string probe = "berth-probe";
    UniqueFd group = cgroups.create(probe);
    if (!group)
        return "cannot create control groups under " + cgroups.parentPath().string() + ": " +
               std::strerror(errno);
    const pid_t pid = ::fork();
    if (pid == 0) _exit(LaunchCgroup::join(group.get()));
    int status = 0;
    ::waitpid(pid, &status, 0);
    for (int attempt = 0; attempt < 100 && cgroups.remove(probe) == EBUSY; ++attempt)
        ::usleep(10000);
    ::rmdir(cgroups.parentPath().c_str());
    if (!WIFEXITED(status) || WEXITSTATUS(status) != 0)
        return "cannot move a process into a control group under " + cgroups.parentPath().string() +
               ": " + std::strerror(WIFEXITED(status) ? WEXITSTATUS(status) : EINTR);
    return {};
}

std::optional<RecordedLaunch> recordLaunch(const LaunchCgroup& cgroups,
                                           const std::string& identifier,
                                           const std::filesystem::path& program, uid_t persona) {
    std::optional<LaunchGroup> group = cgroups.createLaunch(identifier);
    if (!group) return std::nullopt;
    std::error_code error;
    const std::filesystem::path canonical = std::filesystem::canonical(program, error);
    UniqueFd file(::open(canonical.c_str(), O_RDONLY | O_CLOEXEC));
    const std::optional<Sha256Digest> digest = file ? sha256OfFile(file.get()) : std::nullopt;
    if (error || !digest) return std::nullopt;
    LaunchRecord record{identifier, canonical, *digest, persona, group->path, group->id};
    if (LaunchRecords().write(group->name, record) != 0) return std::nullopt;
    return RecordedLaunch{std::move(*group), std::move(record)};
}

void removeCgroupTree(const std::filesystem::path& group) {
    std::error_code ignored;
    if (!std::filesystem::is_directory(group, ignored)) return;
    for (const auto& entry : std::filesystem::directory_iterator(group, ignored))
        if (entry.is_directory(ignored)) removeCgroupTree(entry.path());
    for (int attempt = 0; attempt < 200; ++attempt) {
        std::ifstream procs(group / "cgroup.procs");
        for (pid_t pid; procs >> pid;) ::kill(pid, SIGKILL);
        if (::rmdir(group.c_str()) == 0 || errno != EBUSY) return;
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
}

}  // namespace berth::test
