// What the first start after boot does once the upcall service is up:
// transient containers never survive a reboot, and whatever is not a
// container in a container directory goes to death row. Also the retry test,
// which makes the daemon exit a given number of times in a row.
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <thread>

#include "BTHClientConnection.h"
#include "BTHFileManager.h"
#include "BTHGlobalConfiguration.h"
#include "BTHLog.h"
#include "BTHWhitelist.h"
#include "core/BTHContainerClass.h"
#include "core/Uuid.h"
#include "platform/DeviceProperties.h"
#include "platform/SafeFs.h"

namespace berth {

namespace {

constexpr const char* kRetryTestIdentifier = "sys.kelp.retryTest";
constexpr const char* kCrashCounterKey = "CrashCounter";

// Per-user classes whose directories of the current user are cleaned, in
// ascending order.
constexpr uint64_t kPerUserCleanedClasses[] = {
    BTHContainerClassDataApplication,  BTHContainerClassDataSprocketPlugin,
    BTHContainerClassDataVPNPlugin,    BTHContainerClassSharedAppGroup,
    BTHContainerClassDataRelayService, BTHContainerClassDataInternalDaemon,
    BTHContainerClassDataTempDir};

// Whether `name` can name a container of `containerClass`: a UUID, or a
// well-known name of the system classes.
bool mayNameContainer(const std::string& name, uint64_t containerClass) {
    if (Uuid::parse(name)) return true;
    const BTHWhitelist& wellKnown = BTHWhitelist::sharedWhitelist();
    if (containerClass == BTHContainerClassDataSystem)
        return wellKnown.systemContainerIdIsWellknown(name);
    if (containerClass == BTHContainerClassSharedSystemGroup)
        return wellKnown.systemGroupContainerIdIsWellknown(name);
    return false;
}

// A real directory (not a link to one) holding a metadata file.
bool holdsMetadataFile(const BTHFileURL& item) {
    struct stat st;
    if (fs::lstatNoFollow(item.path, &st) != 0 || !S_ISDIR(st.st_mode)) return false;
    return fs::lstatNoFollow(item.path / kBTHMetadataFileName, &st) == 0 && S_ISREG(st.st_mode);
}

void reportOrphanOnInternalBuild(const std::filesystem::path& item) {
    BTH_FUNCTION("-[BTHClientConnection _cleanupOrphanedDataForUser:containerClass:]");
    if (!DeviceProperties::isInternalBuild()) return;
    BTHLogError(
        "***INTERNAL BUILD REQUEST: If you see this, file a Snag in \"Berth | all\" with the "
        "following data:");
    BTHLogError(
        "\tSomeone is writing invalid data to a container, which has now been orphaned. Here are "
        "the invalid files:");
    BTHFileManager::defaultManager().printDirectoryStructureAtURL(item);
    BTHLogError("***END INTERNAL BUILD REQUEST");
}

}  // namespace

void BTHClientConnection::rebootBerthCleanup() {
    BTH_FUNCTION("-[BTHClientConnection rebootBerthCleanup]");
    BTHGlobalConfiguration& configuration = BTHGlobalConfiguration::sharedInstance();
    BTHErrorRef error;
    const std::filesystem::path transient = configuration.transientDirectory();
    if (!_moveItemAtURLToDeathRow(transient, true, false, &error))
        BTHLogError("Failed to delete shared transient URL %@ : %@", transient, error);
    const std::filesystem::path transientBundles = configuration.transientBundleDirectory();
    if (!_moveItemAtURLToDeathRow(transientBundles, true, false, &error))
        BTHLogError("Failed to delete shared transient bundle URL %@ : %@", transientBundles,
                    error);

    const uid_t mobileUser = configuration.currentMobileUserId();
    const auto user = configuration.getPerUserConfigurationForUserId(mobileUser);
    if (user->existsUserBaseDirectory()) {
        if (const auto userTransient = user->transientDirectory()) {
            if (!_moveItemAtURLToDeathRow(*userTransient, true, false, &error))
                BTHLogError("Failed to delete per-user transient URL %@ : %@", *userTransient,
                            error);
        }
        for (const uint64_t containerClass : kPerUserCleanedClasses)
            _cleanupOrphanedDataForUser(mobileUser, containerClass);
    }
    for (uint64_t containerClass = 1; containerClass <= 13; ++containerClass) {
        if (BTHContainerClassIsBundle(containerClass))
            _cleanupOrphanedDataForUser(kBTHBundleUserId, containerClass);
        else if (BTHContainerClassIsSystem(containerClass))
            _cleanupOrphanedDataForUser(kBTHSystemUserId, containerClass);
    }
}

void BTHClientConnection::_cleanupOrphanedDataForUser(uid_t userId, uint64_t containerClass) {
    BTH_FUNCTION("-[BTHClientConnection _cleanupOrphanedDataForUser:containerClass:]");
    const auto directory = BTHGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(
        userId, containerClass, false);
    if (!directory) return;
    BTHErrorRef listError;
    const auto items =
        BTHFileManager::defaultManager().urlsForItemsInDirectoryAtURL(*directory, &listError);
    if (!items) {
        if (!listError || !listError->isPOSIXError(ENOENT))
            BTHLogError("Failed to get items at %@ : %@", *directory, listError);
        return;
    }
    for (const BTHFileURL& item : *items) {
        if (mayNameContainer(item.path.filename().string(), containerClass)) {
            if (holdsMetadataFile(item)) continue;
            BTHLogError("Deleting orphaned data missing a metadata file at: %@", item.path);
        }
        reportOrphanOnInternalBuild(item.path);
        _moveItemAtURLToDeathRow(item.path, true, false, nullptr);
    }
}

void BTHClientConnection::retryTestForUser(uid_t userId, uint64_t numCrashes, uint64_t* error) {
    BTH_FUNCTION("-[BTHClientConnection retryTestForUser:withNumCrashes:withError:]");
    uint64_t result = BTHErrorSuccess;
    BTHErrorRef exceptionError = BTHRunUnderExceptionRule(bthFunctionName, __LINE__, [&] {
        result = runRetryTest(userId, numCrashes);
        return BTHErrorRef();
    });
    if (exceptionError) result = BTHErrorException;
    BTHSetErrorCode(error, result);
}

uint64_t BTHClientConnection::runRetryTest(uid_t userId, uint64_t numCrashes) {
    BTH_FUNCTION("-[BTHClientConnection retryTestForUser:withNumCrashes:withError:]");
    uint64_t code = BTHErrorSuccess;
    const BTHMetadataRef container =
        createOrLookupContainerForUser(userId, std::string(kRetryTestIdentifier), true,
                                       BTHContainerClassDataApplication, false, true, &code);
    if (!container) {
        BTHLogError("Failed to create or lookup lookup existing container for retry test: %@",
                    kRetryTestIdentifier);
        return code;
    }
    const Value* counter = container->info() ? container->info()->find(kCrashCounterKey) : nullptr;
    // A stored 0 means the countdown had ended when the daemon stopped
    // before removing the container: the test finishes now rather than
    // counting down from the largest number there is.
    const std::optional<uint64_t> stored = counter ? counter->uint64Value() : std::nullopt;
    const uint64_t remaining = stored ? (*stored == 0 ? 0 : *stored - 1) : numCrashes;
    BTHLogError("Crashes Remaining in retry test: %llu",
                static_cast<unsigned long long>(remaining));
    setInfoValue(Value(remaining), std::string(kCrashCounterKey), container->uid(),
                 container->uuid(), container->identifier(), BTHContainerClassDataApplication, true,
                 nullptr);
    if (remaining != 0) {
        BTHLogError("Crashing");
        std::this_thread::sleep_for(std::chrono::seconds(2));
        ::_exit(0);
    }
    uint64_t stageCode = BTHErrorSuccess;
    stageForDeleteContainersWithUsers(
        {container->uid()}, {container->uuid()},
        std::vector<std::optional<std::string>>{container->identifier()},
        {Value(uint64_t{BTHContainerClassDataApplication})}, true, &stageCode);
    if (stageCode != BTHErrorSuccess) {
        BTHLogError("Failed to delete retry container at : %@", container->url());
        return stageCode;
    }
    BTHLogError("Returning Successfully");
    return BTHErrorSuccess;
}

}  // namespace berth
