#include "BTHUserManagedAssets.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "BTHContainerCache.h"
#include "BTHFileManager.h"
#include "BTHLocks.h"
#include "BTHLog.h"
#include "BTHPathStrings.h"
#include "BTHSharedContent.h"
#include "core/BTHContainerClass.h"
#include "platform/SafeFs.h"

namespace berth {

namespace {

constexpr const char* kURLFunction =
    "-[BTHClientConnection userManagedAssetsURLForUser:identifier:withError:]";
constexpr const char* kDeleteFunction =
    "-[BTHClientConnection deleteUserManagedAssetForUser:identifier:relativePath:withError:]";

std::filesystem::path libraryURL(const BTHMetadata& container) {
    return container.url() / "Library";
}

// The remembered assets directory. The metadata file lies in the app's own
// container, so its name is used only when it is one plain name in
// "Library"; any other counts as a directory that no longer exists.
std::optional<std::filesystem::path> rememberedAssetsURL(const BTHMetadata& container) {
    const std::optional<std::string>& name = container.userManagedAssetsDirName();
    if (!name || name->empty() || *name == "." || *name == ".." ||
        name->find('/') != std::string::npos || name->find('\0') != std::string::npos)
        return std::nullopt;
    return libraryURL(container) / *name;
}

// The application's data container, or the error of its absence.
BTHMetadataRef dataContainer(const char* bthFunctionName, uid_t userId,
                             const std::string& identifier, BTHErrorRef* failure) {
    BTHErrorRef cacheError;
    BTHMetadataRef container = BTHContainerCache::sharedInstance().containerForUser(
        userId, BTHContainerClassDataApplication, identifier, false, &cacheError);
    if (!container) {
        *failure = BTHMakeError(
            BTHErrorInvalidArgument, cacheError,
            "Failed to create app data container for user managed assets path for %@: %@",
            identifier, cacheError);
    }
    return container;
}

// Gives the new directory its mode and owner through a descriptor opened
// without following a link, so a link planted in its place is not changed.
BTHErrorRef setModeAndOwner(const char* bthFunctionName, const std::filesystem::path& url,
                            uid_t userId) {
    UniqueFd fd = fs::openNoFollow(url, O_RDONLY | O_DIRECTORY);
    if (!fd || ::fchmod(fd.get(), 0755) != 0) {
        return BTHMakeError(BTHErrorDirectorySetupFailed, nullptr,
                            "Failed to chmod user managed assets dir at %@: %s", url,
                            std::strerror(errno));
    }
    if (::fchown(fd.get(), userId, userId) != 0) {
        return BTHMakeError(BTHErrorDirectorySetupFailed, nullptr,
                            "Failed to chown user managed assets dir at %@: %s", url,
                            std::strerror(errno));
    }
    return nullptr;
}

// Makes the directory and records its name in the metadata file and the
// cache. A directory made stays when a later step fails.
BTHErrorRef makeAssetsDirectory(const char* bthFunctionName, uid_t userId,
                                const BTHMetadataRef& container,
                                std::optional<std::filesystem::path>* result) {
    BTHFileManager& fileManager = BTHFileManager::defaultManager();
    const std::filesystem::path library = libraryURL(*container);
    BTHErrorRef makeError;
    const std::optional<BTHFileURL> made = fileManager.createTemporaryDirectoryInDirectoryURL(
        library, kBTHUserManagedAssetsPrefix, &makeError);
    if (!made) {
        return BTHMakeError(BTHErrorDirectorySetupFailed, makeError,
                            "Failed to create user managed assets dir at %@: %@", library,
                            makeError);
    }
    if (BTHErrorRef refused = setModeAndOwner(bthFunctionName, made->path, userId)) return refused;
    container->setUserManagedAssetsDirName(made->path.filename().string());
    BTHErrorRef writeError;
    if (!container->writeMetadataToDisk(&writeError)) {
        // The cached record must keep saying what the file says.
        container->setUserManagedAssetsDirName(std::nullopt);
        return writeError;
    }
    BTHErrorRef cacheError;
    if (!BTHContainerCache::sharedInstance().addContainerMetadata(
            container, userId, container->url(), container->transient(), &cacheError)) {
        return BTHMakeError(BTHErrorCacheAddFailed, cacheError,
                            "Failed to add to cache: %@, url: %@, transient: %d", container,
                            container->url(), container->transient());
    }
    *result = made->path;
    return nullptr;
}

// The refusal of an asset path that is not proven inside the assets
// directory, or that is the directory itself.
BTHErrorRef invalidAsset(const char* bthFunctionName, const std::filesystem::path& url,
                         const std::string& identifier, const std::filesystem::path& assets) {
    return BTHMakeError(BTHErrorInvalidPath, nullptr, "Invalid asset URL %@ for %@ at %@", url,
                        identifier, assets);
}

// Proves the asset inside the assets directory and moves it, reached from a
// directory opened beneath the container, to death row.
BTHErrorRef deleteInContainer(const char* bthFunctionName, BTHClientConnection& client,
                              const std::string& identifier, const BTHMetadata& container,
                              const std::string& relativePath) {
    BTHFileManager& fileManager = BTHFileManager::defaultManager();
    const std::filesystem::path assets = *rememberedAssetsURL(container);
    const std::filesystem::path asset = BTHAppendRelativePath(assets, relativePath);
    if (!fileManager.realPathForURL(asset, assets) ||
        asset.lexically_normal() == (assets / "").lexically_normal())
        return invalidAsset(bthFunctionName, asset, identifier, assets);
    const std::optional<BTHFileManager::ContainedItem> entry =
        fileManager.openContainedEntry(asset, container.url());
    if (!entry) return invalidAsset(bthFunctionName, asset, identifier, assets);
    // The entry's directory is link-free up to the container, and the move
    // refuses a link anywhere in it, so a swap after the check fails the
    // move instead of leading outside.
    BTHErrorRef moveError;
    if (!client._moveItemAtURLToDeathRow(entry->realPath, false, false, &moveError)) {
        return BTHMakeError(BTHErrorMoveToDeathRowFailed, moveError, "Failed to remove asset at %@",
                            asset);
    }
    return nullptr;
}

}  // namespace

std::optional<std::filesystem::path> userManagedAssetsURLForUser(
    uid_t userId, const std::optional<std::string>& identifier, uint64_t* error) {
    BTH_FUNCTION(kURLFunction);
    std::optional<std::filesystem::path> result;
    const BTHErrorRef failure = BTHRunUnderExceptionRule(bthFunctionName, __LINE__, [&] {
        if (!identifier) {
            return BTHMakeError(BTHErrorInvalidArgument, nullptr,
                                "Can't act on invalid input: ID: %@", identifier);
        }
        BTHErrorRef refused;
        const BTHMetadataRef container =
            dataContainer(bthFunctionName, userId, *identifier, &refused);
        if (!container) return refused;
        if (container->url().empty()) {
            return BTHMakeError(BTHErrorInvalidArgument, nullptr,
                                "No URL in container metadata object: %@", container);
        }
        BTHIdentifierLockGuard lock(container->uuid().string(), true);
        if (container->userManagedAssetsDirName()) {
            const std::optional<std::filesystem::path> assets = rememberedAssetsURL(*container);
            if (!assets || BTHFileManager::defaultManager().itemDoesNotExistAtURL(*assets)) {
                return BTHMakeError(
                    BTHErrorInvalidArgument, nullptr, "User Managed Assets path does not exist: %@",
                    assets.value_or(BTHAppendRelativePath(libraryURL(*container),
                                                          *container->userManagedAssetsDirName())));
            }
            result = assets;
            return BTHErrorRef();
        }
        return makeAssetsDirectory(bthFunctionName, userId, container, &result);
    });
    if (failure) {
        BTHSetErrorCode(error, failure->code64());
        return std::nullopt;
    }
    return result;
}

void deleteUserManagedAssetForUser(BTHClientConnection& client, uid_t userId,
                                   const std::optional<std::string>& identifier,
                                   const std::optional<std::string>& relativePath,
                                   uint64_t* error) {
    BTH_FUNCTION(kDeleteFunction);
    const BTHErrorRef failure = BTHRunUnderExceptionRule(bthFunctionName, __LINE__, [&] {
        if (!identifier || !relativePath) {
            return BTHMakeError(BTHErrorInvalidArgument, nullptr,
                                "Can't act on invalid input: ID: %@, Path: %@", identifier,
                                relativePath);
        }
        if (containsDotDotPathComponents(*relativePath)) {
            return BTHMakeError(BTHErrorInvalidParameter, nullptr,
                                "Asset path can't contain dots: %@", *relativePath);
        }
        BTHErrorRef refused;
        const BTHMetadataRef container =
            dataContainer(bthFunctionName, userId, *identifier, &refused);
        if (!container) return refused;
        if (container->url().empty() || !rememberedAssetsURL(*container)) {
            return BTHMakeError(
                BTHErrorInvalidArgument, nullptr,
                "No userManagedAssetsDirName or URL in container metadata object: %@", container);
        }
        BTHIdentifierLockGuard lock(container->uuid().string(), true);
        return deleteInContainer(bthFunctionName, client, *identifier, *container, *relativePath);
    });
    if (failure) BTHSetErrorCode(error, failure->code64());
}

}  // namespace berth
