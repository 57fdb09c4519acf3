#include "BTHPerUserConfiguration.h"

#include <climits>
#include <cstdlib>

#include "BTHFileManager.h"
#include "BTHLog.h"
#include "core/BTHContainerClass.h"
#include "platform/DeviceRoot.h"
#include "platform/UserDatabase.h"

namespace berth {

namespace {

constexpr size_t kMaxHomePathLength = 1024;
// Below the home: the containers, and the transient containers.
constexpr const char* kContainersBelowHome = "Containers";
constexpr const char* kTransientBelowHome = "Library/Caches/sys.kelp.berthd/Temp";

bool isInsideDeviceRoot(const std::filesystem::path& path) {
    if (DeviceRoot::isHost()) return true;
    const std::string p = path.string(), r = DeviceRoot::path().string();
    return p == r || (p.size() > r.size() && p.compare(0, r.size(), r) == 0 && p[r.size()] == '/');
}

// The home with links resolved. A home that does not exist (yet) keeps its
// database path; one whose links lead outside the device root, or whose real
// path is too long, is not believed either.
std::filesystem::path realHome(const std::filesystem::path& home) {
    char resolved[PATH_MAX];
    if (!::realpath(home.c_str(), resolved)) return home;
    std::filesystem::path real(resolved);
    if (real.string().size() > kMaxHomePathLength || !isInsideDeviceRoot(real)) return home;
    return real;
}

}  // namespace

BTHPerUserConfiguration::BTHPerUserConfiguration(uid_t userId) : userId_(userId) {
    BTH_FUNCTION("-[BTHPerUserConfiguration initWithUserId:]");
    std::optional<UserRecord> user = UserDatabase::userById(userId);
    if (!user || user->home.empty()) {
        BTHLogError("Failed to getpwuid for uid: %u", userId);
        return;
    }
    userHomeDirectory_ = realHome(user->home);
    for (uint64_t containerClass = 0; containerClass < classDirectoryPaths_.size();
         ++containerClass) {
        if (!BTHContainerClassIsPerUser(containerClass)) continue;
        for (const bool transient : {false, true})
            classDirectoryPaths_[containerClass][transient] =
                *userHomeDirectory_ / (transient ? kTransientBelowHome : kContainersBelowHome) /
                BTHContainerClassName(containerClass);
    }
}

bool BTHPerUserConfiguration::existsUserBaseDirectory() const {
    return userHomeDirectory_ &&
           BTHFileManager::defaultManager().itemExistsAtURL(*userHomeDirectory_);
}

BTHPerUserConfiguration::OptionalPath BTHPerUserConfiguration::underHome(
    const char* relative) const {
    if (!userHomeDirectory_) return std::nullopt;
    return *userHomeDirectory_ / relative;
}

void BTHPerUserConfiguration::create(const std::filesystem::path& path, const char* function,
                                     const char* failureFormat) {
    const char* bthFunctionName = function;
    BTHErrorRef error;
    if (!BTHFileManager::defaultManager().createDirectoryAtURL(path, true, 0755, userId_, &error))
        BTHLogError(failureFormat, path, error);
}

BTHPerUserConfiguration::OptionalPath BTHPerUserConfiguration::userBaseDirectory() {
    std::lock_guard lock(mutex_);
    if (!userBaseDirectory_) userBaseDirectory_ = underHome(kContainersBelowHome);
    if (userBaseDirectory_)
        create(*userBaseDirectory_, "-[BTHPerUserConfiguration userBaseDirectory]",
               "Failed to create user base dir at \"%@\": %@");
    return userBaseDirectory_;
}

BTHPerUserConfiguration::OptionalPath BTHPerUserConfiguration::transientDirectory() {
    std::lock_guard lock(mutex_);
    if (!transientDirectory_) transientDirectory_ = underHome(kTransientBelowHome);
    if (transientDirectory_)
        create(*transientDirectory_, "-[BTHPerUserConfiguration transientDirectory]",
               "Failed to create transient dir at \"%@\": %@");
    return transientDirectory_;
}

BTHPerUserConfiguration::OptionalPath
BTHPerUserConfiguration::systemContainerBackupBaseDirectory() {
    std::lock_guard lock(mutex_);
    if (!backupBaseDirectory_) backupBaseDirectory_ = underHome("Library/Backup/SystemContainers");
    return backupBaseDirectory_;
}

BTHPerUserConfiguration::OptionalPath BTHPerUserConfiguration::systemContainerBackupDirectory() {
    std::lock_guard lock(mutex_);
    OptionalPath base = systemContainerBackupBaseDirectory();
    return base ? OptionalPath(*base / "Data") : std::nullopt;
}

BTHPerUserConfiguration::OptionalPath
BTHPerUserConfiguration::systemGroupContainerBackupDirectory() {
    std::lock_guard lock(mutex_);
    OptionalPath base = systemContainerBackupBaseDirectory();
    return base ? OptionalPath(*base / "Shared") : std::nullopt;
}

BTHPerUserConfiguration::OptionalPath BTHPerUserConfiguration::oldLibraryDirectoryPath() const {
    return underHome("Library/Berth");
}

BTHPerUserConfiguration::OptionalPath BTHPerUserConfiguration::oldLoggingPath() const {
    return underHome("Library/Logs/Berth");
}

BTHPerUserConfiguration::OptionalPath BTHPerUserConfiguration::containerDirectoryURLForContentClass(
    uint64_t containerClass, bool transient) {
    BTH_FUNCTION("-[BTHPerUserConfiguration containerDirectoryURLForContentClass:transient:]");
    if (!BTHContainerClassIsPerUser(containerClass)) {
        BTHLogError("Invalid class for a per user container directory: %llu", containerClass);
        return std::nullopt;
    }
    std::lock_guard lock(mutex_);
    OptionalPath base = transient ? transientDirectory() : userBaseDirectory();
    if (!base) return std::nullopt;
    std::filesystem::path directory = *base / BTHContainerClassName(containerClass);
    create(directory, bthFunctionName, "Failed to create container dir at \"%@\": %@");
    return directory;
}

BTHPerUserConfiguration::OptionalPath
BTHPerUserConfiguration::containerDirectoryPathForContentClass(uint64_t containerClass,
                                                               bool transient) const {
    if (!BTHContainerClassIsPerUser(containerClass)) return std::nullopt;
    return classDirectoryPaths_[containerClass][transient];
}

}  // namespace berth
