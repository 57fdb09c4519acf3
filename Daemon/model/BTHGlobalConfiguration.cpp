#include "BTHGlobalConfiguration.h"

#include "BTHFileManager.h"
#include "BTHLog.h"
#include "core/BTHContainerClass.h"
#include "platform/DeviceRoot.h"
#include "platform/UserDatabase.h"

namespace berth {

namespace {

constexpr mode_t kDirectoryMode = 0755;
constexpr int32_t kLibraryProtectionClass = 4;
constexpr int32_t kNoProtectionClass = -1;

// Creates `path` with parents, logging `failureFormat` under `function`.
void createWithParents(const std::filesystem::path& path, uid_t owner, int32_t protectionClass,
                       const char* function, const char* failureFormat) {
    const char* bthFunctionName = function;
    BTHErrorRef error;
    if (!BTHFileManager::defaultManager().createDirectoryAtURL(path, true, kDirectoryMode, owner,
                                                               protectionClass, &error))
        BTHLogError(failureFormat, path, error);
}

}  // namespace

BTHGlobalConfiguration& BTHGlobalConfiguration::sharedInstance() {
    static BTHGlobalConfiguration instance;
    return instance;
}

BTHGlobalConfiguration::BTHGlobalConfiguration()
    : homeDirectory_(DeviceRoot::resolve("/private/var/root/")),
      ladingdHomeDirectory_(DeviceRoot::resolve("/private/var/ladingd/")) {
    BTH_FUNCTION("-[BTHGlobalConfiguration init]");
    if (std::optional<UserRecord> mobile = UserDatabase::userByName("mobile")) {
        currentMobileUserId_ = mobile->uid;
        BTHLogError("Current mobile user ID is %u", currentMobileUserId_);
    } else {
        BTHLogError("Failed to get mobile uid. This is bad");
    }
}

std::filesystem::path BTHGlobalConfiguration::logDirectory() {
    std::filesystem::path path = homeDirectory_ / "Library/Logs/Berth";
    createWithParents(path, kBTHRootUserId, kLibraryProtectionClass,
                      "-[BTHGlobalConfiguration logDirectory]",
                      "Failed to create log directory at \"%@\": %@");
    return path;
}

std::filesystem::path BTHGlobalConfiguration::keptDirectory(
    OptionalPath& slot, const std::function<std::filesystem::path()>& compute,
    int32_t protectionClass, const char* function, const char* failureFormat) {
    std::lock_guard lock(mutex_);
    if (!slot) slot = compute();
    createWithParents(*slot, kBTHRootUserId, protectionClass, function, failureFormat);
    return *slot;
}

std::filesystem::path BTHGlobalConfiguration::sharedContainersDirectory() {
    return keptDirectory(
        sharedContainersDirectory_, [] { return DeviceRoot::resolve("/private/var/containers"); },
        kNoProtectionClass, "-[BTHGlobalConfiguration sharedContainersDirectory]",
        "Failed to create shared container dir at \"%@\": %@");
}

std::filesystem::path BTHGlobalConfiguration::cachesDirectory() {
    return keptDirectory(
        cachesDirectory_, [this] { return homeDirectory_ / "Library/Caches/sys.kelp.berthd"; },
        kLibraryProtectionClass, "-[BTHGlobalConfiguration cachesDirectory]",
        "Failed to create cache dir at \"%@\": %@");
}

std::filesystem::path BTHGlobalConfiguration::libraryDirectory() {
    return keptDirectory(
        libraryDirectory_, [this] { return homeDirectory_ / "Library/Berth"; },
        kLibraryProtectionClass, "-[BTHGlobalConfiguration libraryDirectory]",
        "Failed to create library dir at \"%@\": %@");
}

std::filesystem::path BTHGlobalConfiguration::transientDirectory() {
    std::lock_guard lock(mutex_);
    return keptDirectory(
        transientDirectory_, [this] { return cachesDirectory() / "Temp"; }, kNoProtectionClass,
        "-[BTHGlobalConfiguration transientDirectory]",
        "Failed to create transient dir at \"%@\": %@");
}

std::filesystem::path BTHGlobalConfiguration::stagingDirectory() {
    std::lock_guard lock(mutex_);
    return keptDirectory(
        stagingDirectory_, [this] { return cachesDirectory() / "Staging"; }, kNoProtectionClass,
        "-[BTHGlobalConfiguration stagingDirectory]", "Failed to create staging dir at \"%@\": %@");
}

std::filesystem::path BTHGlobalConfiguration::deathrowDirectory() {
    std::lock_guard lock(mutex_);
    return keptDirectory(
        deathrowDirectory_, [this] { return cachesDirectory() / "Dead"; }, kNoProtectionClass,
        "-[BTHGlobalConfiguration deathrowDirectory]",
        "Failed to create deathrow dir at \"%@\": %@");
}

std::filesystem::path BTHGlobalConfiguration::replaceDirectory() {
    std::lock_guard lock(mutex_);
    return keptDirectory(
        replaceDirectory_, [this] { return libraryDirectory() / "Replace"; }, kNoProtectionClass,
        "-[BTHGlobalConfiguration replaceDirectory]", "Failed to create replace dir at \"%@\": %@");
}

std::filesystem::path BTHGlobalConfiguration::bundleDirectory() {
    std::lock_guard lock(mutex_);
    return keptDirectory(
        bundleDirectory_, [this] { return sharedContainersDirectory() / "Bundle"; },
        kNoProtectionClass, "-[BTHGlobalConfiguration bundleDirectory]",
        "Failed to create bundle dir at \"%@\": %@");
}

std::filesystem::path BTHGlobalConfiguration::transientBundleDirectory() {
    BTH_FUNCTION("-[BTHGlobalConfiguration transientBundleDirectory]");
    std::lock_guard lock(mutex_);
    std::filesystem::path level = ladingdHomeDirectory_;
    for (const char* name : {"Library", "Caches", "sys.kelp.berthd"}) {
        level /= name;
        BTHErrorRef error;
        if (!BTHFileManager::defaultManager().createDirectoryAtURL(level, false, kDirectoryMode,
                                                                   kBTHBundleUserId, &error))
            BTHLogError("Failed to create transient bundle dir at \"%@\": %@", level, error);
    }
    if (!transientBundleDirectory_) transientBundleDirectory_ = level;
    return *transientBundleDirectory_;
}

std::shared_ptr<BTHPerUserConfiguration> BTHGlobalConfiguration::getPerUserConfigurationForUserId(
    uid_t userId) {
    std::lock_guard lock(mutex_);
    auto it = perUserConfigurations_.find(userId);
    if (it == perUserConfigurations_.end())
        it = perUserConfigurations_
                 .emplace(userId, std::make_shared<BTHPerUserConfiguration>(userId))
                 .first;
    return it->second;
}

std::shared_ptr<BTHPerUserConfiguration>
BTHGlobalConfiguration::getPerUserConfigurationForCurrentMobileUser() {
    return getPerUserConfigurationForUserId(currentMobileUserId_);
}

BTHGlobalConfiguration::OptionalPath BTHGlobalConfiguration::globalContainerBaseURLWithContentClass(
    uint64_t containerClass, bool transient) {
    std::lock_guard lock(mutex_);
    std::filesystem::path base;
    if (BTHContainerClassIsBundle(containerClass))
        base = transient ? transientBundleDirectory() : sharedContainersDirectory();
    else if (BTHContainerClassIsSystem(containerClass))
        base = transient ? transientDirectory() : sharedContainersDirectory();
    else
        return std::nullopt;
    return base / BTHContainerClassName(containerClass);
}

BTHGlobalConfiguration::OptionalPath BTHGlobalConfiguration::containerDirectoryURLForUser(
    uid_t userId, uint64_t containerClass, bool transient) {
    if (BTHContainerClassIsPerUser(containerClass)) {
        std::shared_ptr<BTHPerUserConfiguration> user = getPerUserConfigurationForUserId(userId);
        return user ? user->containerDirectoryURLForContentClass(containerClass, transient)
                    : std::nullopt;
    }
    std::lock_guard lock(mutex_);
    OptionalPath directory = globalContainerBaseURLWithContentClass(containerClass, transient);
    if (!directory) return std::nullopt;
    createWithParents(
        *directory,
        BTHContainerClassGlobalUser(containerClass) == kBTHBundleUserId ? kBTHBundleUserId
                                                                        : kBTHRootUserId,
        kNoProtectionClass,
        "-[BTHGlobalConfiguration containerDirectoryURLForUser:contentClass:transient:]",
        "Failed to create container dir at \"%@\": %@");
    return directory;
}

BTHGlobalConfiguration::OptionalPath BTHGlobalConfiguration::containerDirectoryPathForUser(
    uid_t userId, uint64_t containerClass, bool transient) {
    if (!BTHContainerClassIsPerUser(containerClass))
        return globalContainerBaseURLWithContentClass(containerClass, transient);
    std::shared_ptr<BTHPerUserConfiguration> user = getPerUserConfigurationForUserId(userId);
    return user ? user->containerDirectoryPathForContentClass(containerClass, transient)
                : std::nullopt;
}

const std::vector<std::string>& BTHGlobalConfiguration::appUserDataItemNames() {
    static const std::vector<std::string> names{"Documents", "Library", "tmp", "Merchantry"};
    return names;
}

bool BTHGlobalConfiguration::migrationFileExistsWithName(const std::string& name) {
    return BTHFileManager::defaultManager().itemExistsAtURL(libraryDirectory() / name);
}

void BTHGlobalConfiguration::enumerateUsers(const std::function<void(uid_t userId)>& callback) {
    callback(currentMobileUserId_);
}

}  // namespace berth
