// BTHGlobalConfiguration: every global directory the daemon owns, the class
// directories of the global classes, the current mobile user, and one
// BTHPerUserConfiguration per user asked for.
//
//   home            /private/var/root/
//   log             home/Library/Logs/Berth                    class 4
//   caches          home/Library/Caches/sys.kelp.berthd        class 4
//   library         home/Library/Berth                         class 4
//   transient       caches/Temp
//   staging         caches/Staging
//   death row       caches/Dead
//   replace         library/Replace
//   shared          /private/var/containers
//   bundle          shared/Bundle
//   transient bundle  /private/var/ladingd/Library/Caches/sys.kelp.berthd (owner 33)
//
// All paths resolve under the device root. Getters compute their path once
// and keep it (the log directory excepted), and (re-)create the directory,
// mode 0755, on every call; a directory that cannot be made is logged and its
// path still returned, so the caller fails later where it needs it. Safe from
// any thread.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "BTHPerUserConfiguration.h"

namespace berth {

class BTHGlobalConfiguration {
  public:
    using OptionalPath = std::optional<std::filesystem::path>;

    // The one instance, made on first call.
    static BTHGlobalConfiguration& sharedInstance();

    const std::filesystem::path& homeDirectory() const { return homeDirectory_; }
    const std::filesystem::path& ladingdHomeDirectory() const { return ladingdHomeDirectory_; }

    // Computed and created on every call; neither kept nor locked.
    std::filesystem::path logDirectory();

    std::filesystem::path sharedContainersDirectory();
    std::filesystem::path cachesDirectory();
    std::filesystem::path libraryDirectory();
    std::filesystem::path transientDirectory();
    std::filesystem::path stagingDirectory();
    std::filesystem::path deathrowDirectory();
    std::filesystem::path replaceDirectory();
    std::filesystem::path bundleDirectory();
    // Created one level at a time below the installer's home, without
    // parents, each level owned by user 33.
    std::filesystem::path transientBundleDirectory();

    // The uid of the user "mobile", looked up once; 0 when there is none.
    uid_t currentMobileUserId() const { return currentMobileUserId_; }

    // The user's configuration, made on first request and kept for the life
    // of the process; concurrent first requests get the same one.
    std::shared_ptr<BTHPerUserConfiguration> getPerUserConfigurationForUserId(uid_t userId);
    std::shared_ptr<BTHPerUserConfiguration> getPerUserConfigurationForCurrentMobileUser();

    // The class directory of a bundle or system class, without creating it;
    // null for every other class.
    OptionalPath globalContainerBaseURLWithContentClass(uint64_t containerClass, bool transient);

    // The class directory for (user, class, transient), created: global
    // classes ignore the user (owner 33 for bundle classes, root for system
    // classes); per-user classes are the user's. Null for invalid classes.
    OptionalPath containerDirectoryURLForUser(uid_t userId, uint64_t containerClass,
                                              bool transient);
    // The same directory's path alone, nothing created: a look-up that finds
    // its container needs no more.
    OptionalPath containerDirectoryPathForUser(uid_t userId, uint64_t containerClass,
                                               bool transient);

    // The top-level items of an application data container that hold the
    // user's data: "Documents", "Library", "tmp", "Merchantry".
    static const std::vector<std::string>& appUserDataItemNames();

    // True when an item of that name exists in the library directory.
    bool migrationFileExistsWithName(const std::string& name);

    // Visits every user whose data maintenance work must look at: the
    // current mobile user, once.
    void enumerateUsers(const std::function<void(uid_t userId)>& callback);

  private:
    BTHGlobalConfiguration();

    // Returns `slot`, computing it from `compute` the first time, and
    // (re-)creates it with parents (mode 0755, `protectionClass`), logging
    // `failureFormat` under `function` on failure.
    std::filesystem::path keptDirectory(OptionalPath& slot,
                                        const std::function<std::filesystem::path()>& compute,
                                        int32_t protectionClass, const char* function,
                                        const char* failureFormat);

    const std::filesystem::path homeDirectory_;
    const std::filesystem::path ladingdHomeDirectory_;
    uid_t currentMobileUserId_ = 0;

    std::recursive_mutex mutex_;
    OptionalPath sharedContainersDirectory_, cachesDirectory_, libraryDirectory_,
        transientDirectory_, stagingDirectory_, deathrowDirectory_, replaceDirectory_,
        bundleDirectory_, transientBundleDirectory_;
    std::map<uid_t, std::shared_ptr<BTHPerUserConfiguration>> perUserConfigurations_;
};

}  // namespace berth
