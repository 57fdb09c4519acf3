// The control groups in which berth-launch places the programs it starts:
// one cgroup v2 group per application identifier, all under one parent
// group, and in it one group per launch, so the termination service can find
// and end every process of an application, however many times it was
// launched and whatever it forked, and the daemon can tell each launch's
// processes by their group (see ProcessCgroup.h and LaunchRecord.h).
//
//   <cgroup2 mount>/<parent>/<identifier>/<launch>
//
// The parent is "berthd.launch" unless BERTH_LAUNCH_CGROUP names another
// (a path relative to the cgroup2 mount; tests use scratch parents). The
// cgroup2 mount is found in /proc/self/mountinfo: /sys/fs/cgroup on a pure
// v2 system, /sys/fs/cgroup/unified on a hybrid one. A launch's name is 32
// random hexadecimal digits. Every group is made by root with mode 0755, so
// no other user can move a process into one.
#pragma once

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <string_view>

#include "platform/UniqueFd.h"

namespace berth {

// The mount point of the first cgroup2 file system in a mountinfo text;
// nullopt when there is none.
std::optional<std::filesystem::path> BTHCgroup2MountIn(std::string_view mountinfo);

// The group of one launch, made and opened.
struct LaunchGroup {
    UniqueFd fd;
    std::string name;  // the launch's name
    std::string path;  // relative to the cgroup2 mount
    uint64_t id = 0;   // the inode of its directory: the kernel's id of the group
};

class LaunchCgroup {
  public:
    static constexpr const char* kDefaultParent = "berthd.launch";

    // BERTH_LAUNCH_CGROUP, or kDefaultParent.
    static std::string configuredParent();

    // The mount point of this system's cgroup v2 hierarchy, from
    // /proc/self/mountinfo; nullopt with the reason when there is none.
    static std::optional<std::filesystem::path> cgroup2Mount(std::string* why);

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
    // The cgroup2 mount, and the parent relative to it.
    const std::filesystem::path& mount() const { return mount_; }
    const std::string& relativeParent() const { return relative_; }
    std::filesystem::path pathOf(const std::string& identifier) const {
        return parent_ / identifier;
    }

    // Creates the parent (when missing) and the identifier's group, and
    // opens the group's directory. Invalid, with errno set, on failure.
    UniqueFd create(const std::string& identifier) const;

    // Creates a new launch group of `identifier` under a fresh random name
    // (and the groups above it when missing). nullopt, with errno set, on
    // failure. A launch group removed by the launcher that made it is never
    // made again.
    std::optional<LaunchGroup> createLaunch(const std::string& identifier) const;

    // Removes the launch group `launch` of `identifier` if it is empty. 0, or
    // the errno (EBUSY while processes remain, ENOENT when it is gone).
    int removeLaunch(const std::string& identifier, const std::string& launch) const;

    // Whether the group `path` (relative to the cgroup2 mount) exists, is
    // the group of id `id`, and holds a process now.
    bool holdsProcesses(const std::string& path, uint64_t id) const;

    // Moves the calling process into the group opened as `groupFd`. 0 or an
    // errno.
    static int join(int groupFd);

    // Kills every process of the identifier's group and of its launch groups
    // and returns once they hold none, within `limit` (ETIMEDOUT otherwise).
    // A group that does not exist holds nothing: 0. The group's kill file is
    // used where the kernel has one (5.14 and later) unless `useKillFile` is
    // false; else each listed process is killed, again and again, until none
    // is left (a process forking meanwhile is caught by the next round).
    int killAll(const std::string& identifier, std::chrono::milliseconds limit,
                bool useKillFile = true) const;

    // Whether the identifier's group, or one of its launch groups, holds a
    // process now (false when it does not exist).
    bool populated(const std::string& identifier) const;

    // Removes the identifier's group if it is empty and has no launch group.
    // 0, or the errno (EBUSY while processes or launch groups remain, ENOENT
    // when it is gone already).
    int remove(const std::string& identifier) const;

  private:
    LaunchCgroup(std::filesystem::path mount, std::string relative)
        : mount_(std::move(mount)), relative_(std::move(relative)), parent_(mount_ / relative_) {}
    std::filesystem::path mount_;
    std::string relative_;
    std::filesystem::path parent_;
};

}  // namespace berth
