// What berth-launch records about each program it starts, for the daemon to
// know later who a process of that launch is.
//
// One record per launch, in <root>/run/berthd/launches/<launch>.plist, a
// binary property list holding
//   "Identifier"  string      the application's signing identifier
//   "Path"        string      the program's canonical path
//   "SHA256"      data (32)   the digest of the program as it was started
//   "Persona"     integer     the user the program runs as
//   "Cgroup"      string      the launch's group, relative to the cgroup2 root
//   "CgroupID"    integer     the inode of that group's directory
// written by root (atomically, mode 0644) after the launcher's child joined
// the group and before it dropped privileges. A record counts only when it
// and every directory above it up to the device root are root's alone (see
// RootOwnedFiles.h).
//
// The group's inode is the kernel's id of the group, never given to another
// group while the system runs: a group removed and made again under the same
// name is another group, and the old record does not speak for it. The
// launch's name is random, so nobody can make a group of a future launch's
// name ahead of time either.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <vector>

#include "platform/ExecutableIdentity.h"
#include "platform/IdentityBasis.h"

namespace berth {

struct LaunchRecord {
    std::string identifier;
    std::filesystem::path executablePath;
    Sha256Digest digest{};
    uid_t persona = 0;
    std::string cgroup;
    uint64_t cgroupId = 0;

    friend bool operator==(const LaunchRecord&, const LaunchRecord&) = default;
};

class LaunchRecords {
  public:
    // <root>/run/berthd/launches
    static std::filesystem::path defaultDirectory();

    // Empty: the default directory.
    explicit LaunchRecords(std::filesystem::path directory = {});

    const std::filesystem::path& directory() const { return directory_; }

    // Records launch `launch` (a launch name, see ProcessCgroup.h), creating
    // the directory when needed. Root only. 0, EPERM (not root, or a
    // directory on the way that is not root's alone), EINVAL (a bad name or
    // record) or the failing operation's errno.
    int write(const std::string& launch, const LaunchRecord& record,
              std::string* why = nullptr) const;

    // The record of launch `launch`, if it counts; nullopt with the reason.
    // What it was read from (its directories and file) goes to `basis`, if
    // given.
    std::optional<LaunchRecord> read(const std::string& launch, std::string* why = nullptr,
                                     IdentityBasis* basis = nullptr) const;

    // Removes the record of `launch`. 0, ENOENT when there is none, or the
    // errno of the failing operation.
    int remove(const std::string& launch) const;

    // The launch names that have a record file, in no order.
    std::vector<std::string> launches() const;

  private:
    std::filesystem::path directory_;
};

}  // namespace berth
