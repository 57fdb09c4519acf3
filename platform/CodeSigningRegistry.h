// The code-signing service: who a peer process is (its signing identifier)
// and what it may do (its entitlements).
//
// Identity comes from a root-owned registry of signatures, by default in
// <root>/etc/berthd/signatures/. Each entry binds either an executable (its
// absolute path and the SHA-256 of its contents) or a unit of the service
// manager (its name) to a signing identifier and an entitlements dictionary.
//
// Who counts as which entry depends on who the process is:
//
//   - root is trusted: a process of uid 0 is the executable it runs. The
//     file is read through /proc/<pid>/exe (confirmed against the peer's
//     pidfd), its path selects the entry, and its digest must equal the
//     entry's.
//   - any other process is who it was started as (identifyLaunched): the
//     application berth-launch started in its launch group, after checking
//     the program against its entry and recording the launch; or the unit
//     bound to an entry, for a process of that unit's group. What it runs
//     now does not matter: on Linux another process of the same user can
//     exec, preload or inject code into it (see ProcessCgroup.h).
//
// A process that is none of these has no identifier and no entitlements.
//
// Entry files. One binary property list per executable or unit, named
// "<hex SHA-256 of the path's bytes, or of the unit's name>.plist", holding
// the dictionary
//   "Path"          string      the executable's absolute canonical path
//   "SHA256"        data (32)   digest of the executable's contents
// or
//   "Unit"          string      the unit's name ("name.service")
// and
//   "Identifier"    string      the signing identifier (non-empty)
//   "Entitlements"  dictionary  the entitlements
// written atomically and durably (temporary file, fsync, rename, fsync of
// the directory), mode 0644. Paths are absolute and unit names never hold a
// "/", so the two kinds never share a file name.
//
// Trust. An entry counts only when every directory from below the device
// root down to the registry directory, and the entry file itself, is owned
// by root and not writable by group or others; the file must be a regular
// file reached without a symbolic link, and its "Path" or "Unit" must be
// what it was looked up by. Anything else is ignored, with the reason given
// back.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <mutex>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "core/Value.h"
#include "platform/ExecutableIdentity.h"
#include "platform/IdentityBasis.h"
#include "platform/LaunchRecord.h"
#include "platform/ProcessCgroup.h"

namespace berth {

// The identity of a peer process. The executable is named only for a peer
// identified by the executable it runs.
struct PeerIdentity {
    std::string identifier;
    Value entitlements;  // always a dictionary
    ExecutableId executable;
    std::filesystem::path executablePath;
    // What it was read from; empty when the service does not say, and the
    // identity is then evaluated anew for every request.
    IdentityBasis basis = {};
};

// What the message service asks of the code-signing service; tests of the
// message service substitute their own.
class CodeSigningService {
  public:
    virtual ~CodeSigningService() = default;

    // The identity of the process `pid` that `pidfd` refers to by the
    // executable it runs, or nullopt (with the reason) when it has none or it
    // cannot be established. Believed for root's processes only.
    virtual std::optional<PeerIdentity> identify(pid_t pid, int pidfd,
                                                 std::string* why = nullptr) = 0;

    // The identity the process `pid` (that `pidfd` refers to, running as
    // `uid`) was started with: by berth-launch as an application, or by the
    // service manager as a unit bound to an entry. nullopt, with the reason,
    // for any other process.
    virtual std::optional<PeerIdentity> identifyLaunched(pid_t pid, int pidfd, uid_t uid,
                                                         std::string* why = nullptr) = 0;

    // The executable the process runs now; nullopt once it has exited. A
    // connection whose peer now runs another file than the one it was
    // identified by must not be served under the old identity.
    virtual std::optional<ExecutableId> executableOf(pid_t pid, int pidfd,
                                                     std::string* why = nullptr) = 0;
};

// One signature of the registry: of an executable (its path and digest) or
// of a unit (its name), never both.
struct SignatureEntry {
    std::filesystem::path executablePath;
    Sha256Digest digest{};
    std::string unit;
    std::string identifier;
    Value entitlements;  // always a dictionary

    bool isUnit() const { return !unit.empty(); }
    // What the entry is looked up by: the path, or the unit's name.
    std::string key() const { return isUnit() ? unit : executablePath.string(); }

    friend bool operator==(const SignatureEntry&, const SignatureEntry&) = default;
};

class CodeSigningRegistry final : public CodeSigningService {
  public:
    struct Options {
        // Empty: DeviceRoot::resolve("/etc/berthd/signatures").
        std::filesystem::path directory;
        // Empty: LaunchRecords::defaultDirectory().
        std::filesystem::path launchRecordDirectory = {};
        // Empty: LaunchCgroup::configuredParent().
        std::string launchCgroupParent = {};
        size_t digestCacheCapacity = 512;
        std::chrono::nanoseconds racyWindow = std::chrono::seconds(1);
    };

    // An entry file that was not taken into account, and why.
    struct Ignored {
        std::string fileName;
        std::string reason;
    };
    struct Listing {
        std::vector<SignatureEntry> entries;  // ordered by path or unit name
        std::vector<Ignored> ignored;
    };

    static std::filesystem::path defaultDirectory();

    CodeSigningRegistry();
    explicit CodeSigningRegistry(Options options);

    const std::filesystem::path& directory() const { return directory_; }

    // Records that the executable at `executablePath`, with the contents it
    // has now, is `identifier` with `entitlements` (a dictionary), replacing
    // any earlier entry for it. Symbolic links in the path are resolved: the
    // entry names the file that a process running it shows in /proc. Creates
    // the registry directory when needed. Root only.
    // Returns 0 or an errno value: EPERM when the effective uid is not 0 or
    // the registry directory is not root's alone, EINVAL for a relative path,
    // a non-regular file, an empty identifier or entitlements that are not a
    // storable dictionary, or the error of the failing file operation.
    int sign(const std::filesystem::path& executablePath, const std::string& identifier,
             const Value& entitlements, std::string* why = nullptr,
             SignatureEntry* written = nullptr);

    // Records that the processes of the unit `unit` (a service or scope unit
    // name, see ProcessCgroup.h) are `identifier` with `entitlements`,
    // replacing any earlier entry for it. Root only. Returns 0, EPERM,
    // EINVAL (a bad unit name, identifier or entitlements) or the error of
    // the failing file operation.
    int signUnit(const std::string& unit, const std::string& identifier, const Value& entitlements,
                 std::string* why = nullptr, SignatureEntry* written = nullptr);

    // Removes the entry of `executablePath` (resolved as in sign(); the file
    // itself need not exist any more). Root only. Returns 0, EPERM, ENOENT
    // when there is no such entry, or the failing operation's errno.
    int remove(const std::filesystem::path& executablePath, std::string* why = nullptr);

    // Removes the entry of the unit `unit`, as remove() does.
    int removeUnit(const std::string& unit, std::string* why = nullptr);

    // Every entry that counts, and every entry file that does not.
    Listing list() const;

    // The entry stored for the canonical absolute path `executablePath`, if it
    // counts. The path is used exactly as given. What the answer was read
    // from goes to `basis`, if given.
    std::optional<SignatureEntry> entryFor(const std::filesystem::path& executablePath,
                                           std::string* why = nullptr,
                                           IdentityBasis* basis = nullptr) const;

    // The entry of the unit `unit`, if it counts.
    std::optional<SignatureEntry> entryForUnit(const std::string& unit, std::string* why = nullptr,
                                               IdentityBasis* basis = nullptr) const;

    std::optional<PeerIdentity> identify(pid_t pid, int pidfd, std::string* why = nullptr) override;
    std::optional<PeerIdentity> identifyLaunched(pid_t pid, int pidfd, uid_t uid,
                                                 std::string* why = nullptr) override;
    std::optional<ExecutableId> executableOf(pid_t pid, int pidfd,
                                             std::string* why = nullptr) override;

    // How many times an executable was actually hashed (tests, benchmarks).
    uint64_t digestComputations() const { return digests_.computations(); }

    // The entry file name of an executable path or a unit's name.
    static std::string entryFileName(const std::string& key);
    static std::string entryFileName(const std::filesystem::path& executablePath) {
        return entryFileName(executablePath.string());
    }

  private:
    UniqueFd openTrustedDirectory(bool create, std::string* why, int* error,
                                  IdentityBasis* basis = nullptr) const;
    // Reads and checks one entry file; `missing` tells a file that is not
    // there from one that does not count.
    std::optional<SignatureEntry> readEntry(int dirFd, const std::string& fileName,
                                            std::string* why, bool* missing = nullptr,
                                            IdentityBasis* basis = nullptr) const;
    // The entry looked up by `key` (a path or a unit's name).
    std::optional<SignatureEntry> entryByKey(const std::string& key, std::string* why,
                                             IdentityBasis* basis = nullptr) const;
    int writeEntry(const SignatureEntry& entry, std::string* why);
    int removeByKey(const std::string& key, std::string* why);
    std::optional<PeerIdentity> identifyLaunch(const std::string& cgroup,
                                               const CgroupOrigin& origin, uid_t uid,
                                               const std::filesystem::path& mount,
                                               IdentityBasis* basis, std::string* why) const;
    std::optional<PeerIdentity> identifyUnit(const std::string& cgroup, const CgroupOrigin& origin,
                                             const std::filesystem::path& mount,
                                             IdentityBasis* basis, std::string* why) const;

    // `basis`, settled against the registry's racy window.
    IdentityBasis settled(IdentityBasis basis) const {
        basis.settle(racyWindow_);
        return basis;
    }

    // The cgroup v2 mount, found on first use.
    std::optional<std::filesystem::path> cgroup2Mount(std::string* why) const;

    std::filesystem::path directory_;
    LaunchRecords launches_;
    std::string launchCgroupParent_;
    mutable std::mutex mountMutex_;
    mutable std::optional<std::filesystem::path> mount_;  // guarded by mountMutex_
    std::chrono::nanoseconds racyWindow_;
    mutable DigestCache digests_;
};

}  // namespace berth
