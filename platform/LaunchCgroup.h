// The control groups in which berth-launch places the programs it starts:
// one cgroup v2 group per application identifier, all under one parent
// group, so the termination service can find and end every process of an
// application, however many times it was launched and whatever it forked.
//
//   <cgroup2 mount>/<parent>/<identifier>
//
// The parent is "berthd.launch" unless BERTH_LAUNCH_CGROUP names another
// (a path relative to the cgroup2 mount; tests use scratch parents). The
// cgroup2 mount is found in /proc/self/mountinfo: /sys/fs/cgroup on a pure
// v2 system, /sys/fs/cgroup/unified on a hybrid one.
#pragma once

#include <chrono>
#include <filesystem>
#include <optional>
#include <string>
#include <string_view>

#include "platform/UniqueFd.h"

namespace berth {

// The mount point of the first cgroup2 file system in a mountinfo text;
// nullopt when there is none.
std::optional<std::filesystem::path> BTHCgroup2MountIn(std::string_view mountinfo);

class LaunchCgroup {
  public:
    static constexpr const char* kDefaultParent = "berthd.launch";

    // BERTH_LAUNCH_CGROUP, or kDefaultParent.
    static std::string configuredParent();

    // The launch cgroups of this system under `parent`. Nullopt, with the
    // reason in `why`, when no cgroup v2 hierarchy is mounted (then
    // `*unmounted` is set, when given) or `parent` is not a relative path
    // without "..". Creates nothing.
    static std::optional<LaunchCgroup> locate(const std::string& parent, std::string* why,
                                              bool* unmounted = nullptr);

    // Whether `identifier` can name a group: a single directory name, not
    // hidden (no leading "."), and no interface file of the cgroup file
    // system ("cgroup.*"). The reason in `why`.
    static bool validName(std::string_view identifier, std::string* why);

    // <mount>/<parent>
    const std::filesystem::path& parentPath() const { return parent_; }
    std::filesystem::path pathOf(const std::string& identifier) const {
        return parent_ / identifier;
    }

    // Creates the parent (when missing) and the identifier's group, and
    // opens the group's directory. Invalid, with errno set, on failure.
    UniqueFd create(const std::string& identifier) const;

    // Moves the calling process into the group opened as `groupFd`. 0 or an
    // errno.
    static int join(int groupFd);

    // Kills every process of the identifier's group and returns once the
    // group holds none, within `limit` (ETIMEDOUT otherwise). A group that
    // does not exist holds nothing: 0. The group's kill file is used where
    // the kernel has one (5.14 and later) unless `useKillFile` is false;
    // else each listed process is killed, again and again, until none is
    // left (a process forking meanwhile is caught by the next round).
    int killAll(const std::string& identifier, std::chrono::milliseconds limit,
                bool useKillFile = true) const;

    // Whether the identifier's group holds a process now (false when it does
    // not exist).
    bool populated(const std::string& identifier) const;

    // Removes the identifier's group if it is empty. 0, or the errno (EBUSY
    // while processes remain, ENOENT when it is gone already).
    int remove(const std::string& identifier) const;

  private:
    explicit LaunchCgroup(std::filesystem::path parent) : parent_(std::move(parent)) {}
    std::filesystem::path parent_;
};

}  // namespace berth
