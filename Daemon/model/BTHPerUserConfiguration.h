// BTHPerUserConfiguration: the directories under one user's home, where the
// user's per-user containers, transient containers and system-container
// backups live.
//
// A user unknown to the password database has no home, and every path of its
// configuration is null (std::nullopt); operations for that user then fail
// where they need a directory.
//
// Directory getters compute their path once and keep it, and (re-)create the
// directory with its parents on every call, so a directory removed from under
// the daemon comes back the next time it is used. A directory that cannot be
// made is logged and its path still returned. Every getter is safe to call
// from any thread.
#pragma once

#include <sys/types.h>

#include <array>
#include <cstdint>
#include <filesystem>
#include <mutex>
#include <optional>

namespace berth {

class BTHPerUserConfiguration {
  public:
    using OptionalPath = std::optional<std::filesystem::path>;

    // Resolves the user's home from the password database; logs "Failed to
    // getpwuid for uid: %u" when the user is unknown.
    explicit BTHPerUserConfiguration(uid_t userId);

    uid_t userId() const { return userId_; }

    // The real path (links resolved) of the user's home directory, or null.
    const OptionalPath& userHomeDirectory() const { return userHomeDirectory_; }

    // True when the user's home directory exists.
    bool existsUserBaseDirectory() const;

    // home/Containers, owned by the user. Created on every call.
    OptionalPath userBaseDirectory();
    // home/Library/Caches/sys.kelp.berthd/Temp, owned by the user. Created on every call.
    OptionalPath transientDirectory();

    // home/Library/Backup/SystemContainers and its "Data" and "Shared"
    // subdirectories. Never created.
    OptionalPath systemContainerBackupBaseDirectory();
    OptionalPath systemContainerBackupDirectory();
    OptionalPath systemGroupContainerBackupDirectory();

    // Where older releases kept the library and the log; not kept, not created.
    OptionalPath oldLibraryDirectoryPath() const;
    OptionalPath oldLoggingPath() const;

    // The class directory of a per-user class (transient or not), created
    // with parents, mode 0755, owned by the user. Null, with an error line,
    // for any other class.
    OptionalPath containerDirectoryURLForContentClass(uint64_t containerClass, bool transient);
    // The same directory's path alone; nothing is created.
    OptionalPath containerDirectoryPathForContentClass(uint64_t containerClass,
                                                       bool transient) const;

  private:
    OptionalPath underHome(const char* relative) const;
    // Creates `path` (with parents, mode 0755, owned by the user), logging
    // `failureFormat` under `function` when that fails.
    void create(const std::filesystem::path& path, const char* function, const char* failureFormat);

    const uid_t userId_;
    OptionalPath userHomeDirectory_;
    // containerDirectoryPathForContentClass() of every class, ordinary and
    // transient, made once: every look-up of a container asks for one.
    std::array<std::array<OptionalPath, 2>, 14> classDirectoryPaths_;

    std::recursive_mutex mutex_;
    OptionalPath userBaseDirectory_;
    OptionalPath transientDirectory_;
    OptionalPath backupBaseDirectory_;
};

}  // namespace berth
