#include "CgroupSupport.h"

#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

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

}  // namespace berth::test
