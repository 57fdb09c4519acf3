// The code-signing service: who a peer process is (its signing identifier)
// and what it may do (its entitlements).
//
// Identity comes from a root-owned registry of signatures, by default in
// <root>/etc/berthd/signatures/. Each entry binds the absolute path of an
// executable and the SHA-256 of its contents to a signing identifier and an
// entitlements dictionary. A process is identified by the file it runs: the
// file is read through /proc/<pid>/exe (confirmed against the peer's pidfd),
// its path selects the entry, and its digest must equal the entry's. A
// process whose executable has no valid, matching entry has no identifier
// and no entitlements.
//
// Entry files. One binary property list per executable, named
// "<hex SHA-256 of the path's bytes>.plist", holding the dictionary
//   "Path"          string      the executable's absolute canonical path
//   "SHA256"        data (32)   digest of the executable's contents
//   "Identifier"    string      the signing identifier (non-empty)
//   "Entitlements"  dictionary  the entitlements
// written atomically and durably (temporary file, fsync, rename, fsync of
// the directory), mode 0644.
//
// Trust. An entry counts only when every directory from below the device
// root down to the registry directory, and the entry file itself, is owned
// by root and not writable by group or others; the file must be a regular
// file reached without a symbolic link, and its "Path" must be the path it
// was looked up by. Anything else is ignored, with the reason given back.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "core/Value.h"
#include "platform/ExecutableIdentity.h"

namespace berth {

// The identity of a peer process, to be bound to its connection.
struct PeerIdentity {
    std::string identifier;
    Value entitlements;  // always a dictionary
    ExecutableId executable;
    std::filesystem::path executablePath;
};

// What the message service asks of the code-signing service; tests of the
// message service substitute their own.
class CodeSigningService {
  public:
    virtual ~CodeSigningService() = default;

    // The identity of the process `pid` that `pidfd` refers to, or nullopt
    // (with the reason) when it has none or it cannot be established.
    virtual std::optional<PeerIdentity> identify(pid_t pid, int pidfd,
                                                 std::string* why = nullptr) = 0;

    // The executable the process runs now; nullopt once it has exited. A
    // connection whose peer now runs another file than the one it was
    // identified by must not be served under the old identity.
    virtual std::optional<ExecutableId> executableOf(pid_t pid, int pidfd,
                                                     std::string* why = nullptr) = 0;
};

// One signature of the registry.
struct SignatureEntry {
    std::filesystem::path executablePath;
    Sha256Digest digest{};
    std::string identifier;
    Value entitlements;  // always a dictionary

    friend bool operator==(const SignatureEntry&, const SignatureEntry&) = default;
};

class CodeSigningRegistry final : public CodeSigningService {
  public:
    struct Options {
        // Empty: DeviceRoot::resolve("/etc/berthd/signatures").
        std::filesystem::path directory;
        size_t digestCacheCapacity = 512;
        std::chrono::nanoseconds racyWindow = std::chrono::seconds(1);
    };

    // An entry file that was not taken into account, and why.
    struct Ignored {
        std::string fileName;
        std::string reason;
    };
    struct Listing {
        std::vector<SignatureEntry> entries;  // ordered by executable path
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

    // Removes the entry of `executablePath` (resolved as in sign(); the file
    // itself need not exist any more). Root only. Returns 0, EPERM, ENOENT
    // when there is no such entry, or the failing operation's errno.
    int remove(const std::filesystem::path& executablePath, std::string* why = nullptr);

    // Every entry that counts, and every entry file that does not.
    Listing list() const;

    // The entry stored for the canonical absolute path `executablePath`, if it
    // counts. The path is used exactly as given.
    std::optional<SignatureEntry> entryFor(const std::filesystem::path& executablePath,
                                           std::string* why = nullptr) const;

    std::optional<PeerIdentity> identify(pid_t pid, int pidfd, std::string* why = nullptr) override;
    std::optional<ExecutableId> executableOf(pid_t pid, int pidfd,
                                             std::string* why = nullptr) override;

    // How many times an executable was actually hashed (tests, benchmarks).
    uint64_t digestComputations() const { return digests_.computations(); }

    // The entry file name of an executable path.
    static std::string entryFileName(const std::filesystem::path& executablePath);

  private:
    UniqueFd openTrustedDirectory(bool create, std::string* why, int* error) const;
    // Reads and checks one entry file; `missing` tells a file that is not
    // there from one that does not count.
    std::optional<SignatureEntry> readEntry(int dirFd, const std::string& fileName,
                                            std::string* why, bool* missing = nullptr) const;

    std::filesystem::path directory_;
    mutable DigestCache digests_;
};

}  // namespace berth
