#include "BTHSharedContent.h"

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "BTHCodeSigningMapping.h"
#include "BTHContainerCache.h"
#include "BTHFileManager.h"
#include "BTHLocks.h"
#include "BTHLog.h"
#include "BTHPathStrings.h"
#include "core/BTHContainerClass.h"

namespace berth {

namespace {

constexpr const char* kStageFunction =
    "-[BTHClientConnection "
    "stageSharedContentForIdentifier:sourceRelativePath:destRelativePath:withError:]";

bool clientHasSystemGroup(const BTHClientConnection& client, const std::string& group) {
    BTHCodeSigningMapping* mapping = BTHCodeSigningMapping::sharedInstance();
    if (!mapping || !client.clientBundleIdentifier()) return false;
    const std::vector<std::string> groups =
        mapping->systemGroupIdentifiersForIdentifier(*client.clientBundleIdentifier())
            .value_or(std::vector<std::string>{});
    return std::find(groups.begin(), groups.end(), group) != groups.end();
}

// The cause of a refusal: none when the check refused the path (its line
// says why), else the POSIX error of the open that failed.
BTHErrorRef openError(const char* bthFunctionName, const std::filesystem::path& url) {
    const int err = errno;
    if (err == EXDEV) return nullptr;
    return BTHMakePOSIXError(err, "open of %@ failed: %s", url, std::strerror(err));
}

// Steps from the identifier lock on: the two places proven and opened, the
// access control lists, the move.
BTHErrorRef stageInContainer(const std::string& identifier, const BTHMetadata& container,
                             const std::string& sourceRelativePath,
                             const std::string& destRelativePath) {
    BTH_FUNCTION(kStageFunction);
    BTHFileManager& fileManager = BTHFileManager::defaultManager();
    const std::filesystem::path& containerURL = container.url();
    const std::filesystem::path source = BTHAppendRelativePath(containerURL, sourceRelativePath);
    const std::filesystem::path dest = BTHAppendRelativePath(containerURL, destRelativePath);
    // The check is the open: what is moved is what was proven inside.
    std::optional<BTHFileManager::ContainedItem> sourceItem =
        fileManager.openContainedEntry(source, containerURL);
    if (!sourceItem) {
        return BTHMakeError(BTHErrorInvalidPath, openError(bthFunctionName, source),
                            "Invalid source URL %@ for %@ at %@", source, identifier, containerURL);
    }
    std::optional<BTHFileManager::ContainedItem> destItem =
        fileManager.openContainedEntry(dest, containerURL);
    if (!destItem) {
        return BTHMakeError(BTHErrorInvalidPath, openError(bthFunctionName, dest),
                            "Invalid dest URL %@ for %@ at %@", dest, identifier, containerURL);
    }
    BTHErrorRef aclError;
    if (!fileManager.standardizeACLsAtURL(sourceItem->realPath, false, &aclError)) {
        return BTHMakeError(BTHErrorACLFailed, aclError,
                            "Failed to standardize ACLs for %@ at %@: %@", identifier, source,
                            aclError);
    }
    BTHErrorRef moveError;
    if (!fileManager.moveContainedItem(*sourceItem, *destItem, &moveError)) {
        return BTHMakeError(BTHErrorStageSharedContentFailed, moveError,
                            "Failed move for %@ from %@ to: %@: %@", identifier, source, dest,
                            moveError);
    }
    return nullptr;
}

}  // namespace

std::filesystem::path BTHAppendRelativePath(const std::filesystem::path& url,
                                            const std::string& relative) {
    return std::filesystem::path(url.string() + "/" + relative);
}

std::optional<std::filesystem::path> stageSharedContentForIdentifier(
    const BTHClientConnection& client, const std::optional<std::string>& identifier,
    const std::optional<std::string>& sourceRelativePath,
    const std::optional<std::string>& destRelativePath, uint64_t* error) {
    BTH_FUNCTION(kStageFunction);
    std::optional<std::filesystem::path> staged;
    const BTHErrorRef failure = BTHRunUnderExceptionRule(bthFunctionName, __LINE__, [&] {
        if (!identifier || !sourceRelativePath || !destRelativePath) {
            return BTHMakeError(BTHErrorInvalidArgument, nullptr,
                                "Can't act on invalid input: ID: %@, source: %@, dest: %@",
                                identifier, sourceRelativePath, destRelativePath);
        }
        if (containsDotDotPathComponents(*sourceRelativePath) ||
            containsDotDotPathComponents(*destRelativePath)) {
            return BTHMakeError(BTHErrorInvalidParameter, nullptr,
                                "Paths can't contain dots. source: %@, dest: %@",
                                *sourceRelativePath, *destRelativePath);
        }
        if (!clientHasSystemGroup(client, *identifier)) {
            return BTHMakeError(BTHErrorNotEntitled, nullptr,
                                "%@ not entitled for system group container %@",
                                client.clientBundleIdentifier(), *identifier);
        }
        BTHErrorRef cacheError;
        const BTHMetadataRef container = BTHContainerCache::sharedInstance().containerForUser(
            kBTHSystemUserId, BTHContainerClassSharedSystemGroup, *identifier, false, &cacheError);
        if (!container) {
            return BTHMakeError(BTHErrorNotFound, cacheError,
                                "System group container with identifier %@ not found: %@",
                                *identifier, cacheError);
        }
        BTHIdentifierLockGuard lock(container->uuid().string(), true);
        BTHErrorRef stageError =
            stageInContainer(*identifier, *container, *sourceRelativePath, *destRelativePath);
        if (!stageError) staged = BTHAppendRelativePath(container->url(), *destRelativePath);
        return stageError;
    });
    if (failure) {
        BTHSetErrorCode(error, failure->code64());
        return std::nullopt;
    }
    return staged;
}

}  // namespace berth
