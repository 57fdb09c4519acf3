// Whether this machine lets the tests use launch cgroups: tests skip with
// the reason where the hierarchy is read-only or processes cannot be moved
// (containers that mount the cgroup file system read-only or confine it).
#pragma once

#include <string>

#include "platform/LaunchCgroup.h"

namespace berth::test {

// Empty when a group can be made under `cgroups` and a process can join
// it; else why not. Leaves nothing behind.
std::string launchCgroupsUnusable(const LaunchCgroup& cgroups);

}  // namespace berth::test
