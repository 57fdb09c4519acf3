// What a running process executes, established so that a recycled pid or a
// swapped file cannot lend one process another's identity.
//
// A peer is named by its pid and a pidfd taken when it connected. The pid
// alone can be reused once the peer exits; the pidfd cannot. Every answer
// here is therefore read through /proc/<pid> and then confirmed against the
// pidfd: the pidfd must still refer to a live process holding that very pid,
// which proves that what /proc showed belonged to the peer and not to a
// newcomer that inherited its number.
//
// The contents of an executable are identified by their SHA-256 digest.
// Digests are remembered per file version (device, inode, size, times, mode
// and owner): any write to a file changes its ctime, which no unprivileged
// program can set back, so a changed file is always hashed again.
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <array>
#include <chrono>
#include <cstdint>
#include <filesystem>
#include <list>
#include <mutex>
#include <optional>
#include <span>
#include <string>
#include <unordered_map>

#include "platform/UniqueFd.h"

namespace berth {

using Sha256Digest = std::array<uint8_t, 32>;

// One version of a file or directory: its identity, size, times, mode and
// owner. Any write, rename, link, unlink, chmod or chown gives another one,
// except that two changes within one timestamp tick may share a ctime.
struct FileVersion {
    dev_t device = 0;
    ino_t inode = 0;
    off_t size = 0;
    int64_t mtimeNs = 0;
    int64_t ctimeNs = 0;
    mode_t mode = 0;
    uid_t owner = 0;
    gid_t group = 0;

    static FileVersion of(const struct stat& status);
    // Whether the file changed within `window` of now: a version that
    // another change could still share.
    bool changedWithin(std::chrono::nanoseconds window) const;
    friend bool operator==(const FileVersion&, const FileVersion&) = default;
};

// The file a process runs: the pair the message service binds a connection
// to, so that a peer that execs something else is noticed.
struct ExecutableId {
    dev_t device = 0;
    ino_t inode = 0;
    friend bool operator==(const ExecutableId&, const ExecutableId&) = default;
};

// SHA-256 of `bytes`.
Sha256Digest sha256(std::span<const uint8_t> bytes);

// SHA-256 of the whole file open at `fd`, read from offset 0 (the file
// offset is not used or moved). nullopt, with the reason, on a read failure.
std::optional<Sha256Digest> sha256OfFile(int fd, std::string* why = nullptr);

// Lower-case hexadecimal text of a digest (64 characters).
std::string hexString(const Sha256Digest& digest);

// True when `pidfd` is a pidfd whose process is alive and holds `pid` in this
// process's pid namespace (its fdinfo "Pid:" line reads `pid`, and signal 0
// can be sent through it). A reaped process reads as pid -1, a zombie is
// still "alive" here but has no executable any more.
bool pidfdRefersTo(int pidfd, pid_t pid, std::string* why = nullptr);

// The executable of a peer, opened for reading.
struct OpenedExecutable {
    UniqueFd fd;
    struct stat status {};
    // Where the executable is now, as the daemon sees it.
    std::filesystem::path path;

    ExecutableId id() const { return {status.st_dev, status.st_ino}; }
};

// Opens the file that process `pid` (the one `pidfd` refers to) runs.
// Guarantees, when it returns a value: the file is a regular file still
// linked in the file system, the process was alive with that pid after the
// file was opened, and it still ran that same file then (it had not exec'd
// something else in between). Anything else is nullopt with the reason.
std::optional<OpenedExecutable> openProcessExecutable(pid_t pid, int pidfd,
                                                      std::string* why = nullptr);

// The (device, inode) of the file process `pid` runs now, with the same
// pidfd confirmation. nullopt once the process has exited or is a zombie.
std::optional<ExecutableId> runningExecutable(pid_t pid, int pidfd, std::string* why = nullptr);

// Remembers digests per file version so that an executable is hashed once
// per version, not once per look-up. Safe to use from many threads; holds at
// most `capacity` digests and forgets the least recently used first.
//
// A file whose ctime lies within `racyWindow` of the moment it is hashed is
// hashed but not remembered: a write landing in the same timestamp tick as
// the hash could otherwise leave the old digest under an unchanged version.
class DigestCache {
  public:
    explicit DigestCache(size_t capacity = 512,
                         std::chrono::nanoseconds racyWindow = std::chrono::seconds(1));
    DigestCache(const DigestCache&) = delete;
    DigestCache& operator=(const DigestCache&) = delete;

    // The digest of the file open at `fd` as it is now. nullopt, with the
    // reason, when it cannot be read or changes while it is being hashed.
    std::optional<Sha256Digest> digestOf(int fd, std::string* why = nullptr);

    // How many times a file was actually hashed (for tests and benchmarks).
    uint64_t computations() const;
    size_t size() const;

  private:
    struct VersionHash {
        size_t operator()(const FileVersion& v) const noexcept;
    };
    using Recency = std::list<FileVersion>;
    struct Slot {
        Sha256Digest digest;
        Recency::iterator recency;
    };

    std::optional<Sha256Digest> find(const FileVersion& version);
    void remember(const FileVersion& version, const Sha256Digest& digest);

    const size_t capacity_;
    const std::chrono::nanoseconds racyWindow_;
    mutable std::mutex mutex_;
    std::unordered_map<FileVersion, Slot, VersionHash> slots_;
    Recency recency_;  // most recently used first
    uint64_t computations_ = 0;
};

}  // namespace berth
