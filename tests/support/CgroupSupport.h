// Whether this machine lets the tests use launch cgroups: tests skip with
// the reason where the hierarchy is read-only or processes cannot be moved
// (containers that mount the cgroup file system read-only or confine it).
#pragma once

#include <sys/types.h>

#include <filesystem>
#include <optional>
#include <string>

#include "platform/LaunchCgroup.h"
#include "platform/LaunchRecord.h"

namespace berth::test {

// Empty when a group can be made under `cgroups` and a process can join
// it; else why not. Leaves nothing behind.
std::string launchCgroupsUnusable(const LaunchCgroup& cgroups);

// A launch made the way berth-launch makes one, without the sandbox: a new
// launch group of `identifier` and its record for `program` (its digest as
// it is now) running as `persona`.
struct RecordedLaunch {
    LaunchGroup group;
    LaunchRecord record;
};
std::optional<RecordedLaunch> recordLaunch(const LaunchCgroup& cgroups,
                                           const std::string& identifier,
                                           const std::filesystem::path& program, uid_t persona);

// Kills every process in the groups below `group` and removes them, deepest
// first, then `group` itself.
void removeCgroupTree(const std::filesystem::path& group);

}  // namespace berth::test
