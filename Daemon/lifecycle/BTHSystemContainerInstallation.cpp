#include "BTHSystemContainerInstallation.h"

#include <sys/stat.h>

#include "BTHFaultInjection.h"
#include "BTHFileManager.h"
#include "BTHGlobalConfiguration.h"
#include "BTHLog.h"
#include "core/BTHContainerClass.h"
#include "platform/DeviceProperties.h"
#include "platform/SafeFs.h"

namespace berth {

namespace {

std::filesystem::path withExtension(const std::filesystem::path& path, const char* extension) {
    std::filesystem::path result = path;
    result += ".";
    result += extension;
    return result;
}

// Only the system can have made it: a directory (not a link to one) owned by
// root that no one else may write.
bool madeBySystem(const std::filesystem::path& directory) {
    BTH_FUNCTION("BTHMoveSystemContainersIntoPlace");
    struct stat st;
    if (fs::lstatNoFollow(directory, &st) != 0) return false;
    if (S_ISDIR(st.st_mode) && st.st_uid == 0 && (st.st_mode & (S_IWGRP | S_IWOTH)) == 0)
        return true;
    BTHLogError(
        "Refusing prepared system containers at %@: not a directory of root's that only "
        "root may write",
        directory);
    return false;
}

// Step 1 or 2: the prepared directory renamed to its ".inprogress" name, a
// leftover of an earlier start removed first. True when there is an
// ".inprogress" directory to install from: the one just renamed, or, when
// nothing new was prepared, one that a start stopped part-way through
// installing (never on internal builds, which keep it after installing).
bool moveToInProgress(const std::filesystem::path& backup, const char* moveFailureFormat) {
    BTH_FUNCTION("BTHMoveSystemContainersIntoPlace");
    BTHFileManager& files = BTHFileManager::defaultManager();
    const std::filesystem::path inProgress = withExtension(backup, "inprogress");
    if (!files.itemExistsAtURL(backup))
        return !DeviceProperties::isInternalBuild() && files.itemExistsAtURL(inProgress) &&
               madeBySystem(inProgress);
    if (!madeBySystem(backup)) return false;
    BTHErrorRef error;
    if (!files.removeItemAtURL(inProgress, &error))
        BTHLogError("Failed to remove existing inprogress system containers: %@", error);
    if (!files.moveItemAtURL(backup, inProgress, &error)) {
        BTHLogError(moveFailureFormat, error);
        return false;
    }
    return true;
}

void installAll(const std::filesystem::path& inProgress, BTHClientConnection& client,
                uint64_t containerClass, const char* listFailureFormat) {
    BTH_FUNCTION("BTHMoveSystemContainersIntoPlace");
    BTHErrorRef error;
    const auto prepared =
        BTHFileManager::defaultManager().urlsForItemsInDirectoryAtURL(inProgress, &error);
    if (!prepared) {
        BTHLogError(listFailureFormat, inProgress, error);
        return;
    }
    for (const BTHFileURL& container : *prepared)
        _moveSystemContainerIntoPlace(container.path, client, containerClass);
}

bool isLink(const std::filesystem::path& item) {
    struct stat st;
    return fs::lstatNoFollow(item, &st) == 0 && S_ISLNK(st.st_mode);
}

}  // namespace

void BTHMoveSystemContainersIntoPlace(BTHClientConnection& client) {
    BTH_FUNCTION("BTHMoveSystemContainersIntoPlace");
    const auto user =
        BTHGlobalConfiguration::sharedInstance().getPerUserConfigurationForCurrentMobileUser();
    const auto base = user->systemContainerBackupBaseDirectory();
    const auto systemBackup = user->systemContainerBackupDirectory();
    const auto groupBackup = user->systemGroupContainerBackupDirectory();
    if (!base || !systemBackup || !groupBackup) return;

    const bool systemMoved =
        moveToInProgress(*systemBackup, "Failed to move system containers to inprogress: %@");
    const bool groupMoved =
        moveToInProgress(*groupBackup, "Failed to move shared system containers to inprogress: %@");
    BTHCrashPoint("install.after-inprogress");
    if (systemMoved) {
        BTHLogNotice("Installing system containers");
        installAll(withExtension(*systemBackup, "inprogress"), client, BTHContainerClassDataSystem,
                   "Couldn't find any system containers at %@: %@");
    }
    if (groupMoved) {
        BTHLogNotice("Installing system group containers");
        installAll(withExtension(*groupBackup, "inprogress"), client,
                   BTHContainerClassSharedSystemGroup,
                   "Couldn't find any system shared containers at %@: %@");
    }
    if (DeviceProperties::isInternalBuild()) return;
    BTHErrorRef error;
    if (!BTHFileManager::defaultManager().removeItemAtURL(*base, &error))
        BTHLogError("Failed to remove system container base dir %@: %@", *base, error);
}

void _moveSystemContainerIntoPlace(const std::filesystem::path& prepared,
                                   BTHClientConnection& client, uint64_t containerClass) {
    BTH_FUNCTION("_moveSystemContainerIntoPlace");
    const std::string identifier = prepared.filename().string();
    const std::filesystem::path failed =
        withExtension(prepared.parent_path(), "failed") / identifier;
    if (!madeBySystem(prepared)) return;

    uint64_t code = BTHErrorSuccess;
    const BTHMetadataRef live = client.createOrLookupContainerForUser(
        kBTHSystemUserId, identifier, true, containerClass, false, true, &code);
    if (!live || code != BTHErrorSuccess) {
        BTHLogError("Failed to create system container %@: %llu", identifier,
                    static_cast<unsigned long long>(code));
        return;
    }
    BTHLogNotice("Restoring container for %@ at %@ to %@", identifier, prepared, live->url());
    BTHFileManager& files = BTHFileManager::defaultManager();
    BTHErrorRef error;
    const auto items = files.urlsForItemsInDirectoryAtURL(prepared, &error);
    if (!items) {
        BTHLogError("Failed to enumerate contents of restored system container %@ at %@: %@",
                    identifier, prepared, error);
        return;
    }
    for (const BTHFileURL& item : *items) {
        const std::string name = item.path.filename().string();
        if (isLink(item.path)) {
            BTHLogError("Refusing to install the link %@ into system container %@", item.path,
                        identifier);
            _moveFailedPathAside(item.path, failed, name);
            continue;
        }
        const std::filesystem::path destination = live->url() / name;
        if (!files.removeItemAtURL(destination, &error)) {
            BTHLogError("Failed to remove destination %@:%@: %@", identifier, destination, error);
            _moveFailedPathAside(item.path, failed, name);
            continue;
        }
        if (!files.moveItemAtURL(item.path, destination, &error)) {
            BTHLogError(
                "Failed to move file in restored system container %@:%@ to destination %@: "
                "%@",
                identifier, item.path, destination, error);
            _moveFailedPathAside(item.path, failed, name);
            continue;
        }
        BTHCrashPoint("install.after-item");
    }
    client.recreateDefaultStructureForUser(live->uid(), live->uuid(), live->identifier(),
                                           live->containerClass(), &code);
    if (code != BTHErrorSuccess)
        BTHLogError("Error processing restored system container %@: %llu", identifier,
                    static_cast<unsigned long long>(code));
}

void _moveFailedPathAside(const std::filesystem::path& item, const std::filesystem::path& directory,
                          const std::string& name) {
    BTH_FUNCTION("_moveFailedPathAside");
    BTHFileManager& files = BTHFileManager::defaultManager();
    BTHErrorRef error;
    if (!files.createDirectoryAtURL(directory, true, 0777, &error))
        BTHLogError("Failed to create %@: %@", directory, error);
    if (!files.moveItemAtURL(item, directory / name, &error))
        BTHLogError("Failed to move %@ to %@: %@", item, directory / name, error);
}

}  // namespace berth
