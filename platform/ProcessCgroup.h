// The control group a process runs in, read so that it can stand for how
// the process was started.
//
// On Linux the program a process runs says nothing about the code that speaks
// for it: a pid survives exec, and any process of a user can put code into
// another of the same user. Where a process was placed by root does: a
// process's group (the cgroup v2 hierarchy's) is inherited by everything it
// forks and execs, and moving a process into a group takes write access to
// the "cgroup.procs" file of that group and of the closest common ancestor of
// its old and new groups. So when every group from the hierarchy's root down
// to a group, and each one's "cgroup.procs", is root's alone, no process but
// root's own could have been moved in from outside; what runs there was put
// there by root, or descends from what was.
//
// Two kinds of group are understood:
//
//   <launch parent>/<identifier>/<launch>   a launch by berth-launch
//   <slice>.slice/.../<unit>                 a unit of the service manager
//
// (the unit is the first component that is not a slice; below it are the
// unit's own groups).
#pragma once

#include <sys/types.h>

#include <filesystem>
#include <optional>
#include <string>
#include <string_view>

#include "platform/IdentityBasis.h"
#include "platform/UniqueFd.h"

namespace berth {

// The path of the "0::" line of a /proc/<pid>/cgroup text, without its
// leading "/" ("" for the root group); nullopt when there is no such line.
std::optional<std::string> unifiedCgroupIn(std::string_view text);

// The group of process `pid`, the one `pidfd` refers to, relative to the
// hierarchy's root. The file is read first and the pidfd confirmed after, so
// the answer belonged to that process and not to one that inherited its pid.
// nullopt with the reason.
std::optional<std::string> cgroupOfProcess(pid_t pid, int pidfd, std::string* why);

// The group /proc shows for `pid` now, unconfirmed: whoever holds the pid at
// that moment. The caller confirms the process afterwards.
std::optional<std::string> cgroupShownFor(pid_t pid, std::string* why);

// The group shown in `procDirectory`, a /proc/<pid> directory opened while
// the process lived: its own, since such a directory never shows a process
// that took the number over (its entries vanish when the process goes).
std::optional<std::string> cgroupShownIn(int procDirectory, std::string* why);

// Whether `name` can name a unit whose processes may be bound to an
// identity: a service or scope unit name of the service manager ("a.service",
// "getty@tty1.service", "run-u7.scope"). The reason in `why`.
bool isServiceUnitName(std::string_view name, std::string* why);

// What a group says about how its processes were started.
struct CgroupOrigin {
    enum class Kind { Other, Launch, Unit };
    Kind kind = Kind::Other;
    std::string identifier;  // Launch: the application's identifier
    std::string launch;      // Launch: the launch's name
    std::string unit;        // Unit: the unit's name
    // How many components of the path, from the top, must be root's alone
    // (with the hierarchy's root itself) for the origin to be believed.
    size_t trustedDepth = 0;
};

// The origin of the group `path` (relative to the hierarchy's root), given
// the launch groups' parent `launchParent` (relative too). A launch group is
// exactly <parent>/<identifier>/<launch>, with an identifier that can name a
// group and a launch name of 32 lower-case hexadecimal digits; every level of
// it must be trusted. A unit's group is trusted down to the slice holding it.
CgroupOrigin classifyCgroup(std::string_view path, std::string_view launchParent);

// Whether `name` is a launch's name: 32 lower-case hexadecimal digits.
bool isLaunchName(std::string_view name);

// Opens the first `depth` components of `path` below the hierarchy mounted at
// `mount`, one at a time without following links, and requires the root and
// each of them to be a directory root's alone whose "cgroup.procs" is root's
// alone too. Gives the deepest one opened, or an invalid descriptor with the
// reason. Every level trusted is recorded in `basis`, if given.
UniqueFd openTrustedCgroup(const std::filesystem::path& mount, std::string_view path, size_t depth,
                           std::string* why, IdentityBasis* basis = nullptr);

}  // namespace berth
