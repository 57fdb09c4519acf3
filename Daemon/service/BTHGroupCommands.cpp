#include "BTHGroupCommands.h"

#include <algorithm>

#include "BTHCodeSigningMapping.h"
#include "BTHGroupManager.h"
#include "BTHLog.h"
#include "BTHRequestIntake.h"
#include "BTHRequestReaders.h"
#include "BTHWhitelist.h"
#include "core/BTHContainerClass.h"

namespace berth {

namespace {

// The group whose refusals are routine enough not to be logged.
constexpr const char* kQuietSystemGroup = "systemgroup.sys.kelp.tallylog";

Value pathsValue(const BTHGroupManager::GroupPaths& paths) {
    Value dictionary = Value::dictionary();
    for (const auto& [group, path] : paths) dictionary.set(group, path);
    return dictionary;
}

// Commands 13 and 16: the group containers of the identifier for `user`.
void replyGroupPaths(const BTHRequestRef& request, BTHClientConnection& client, uid_t user,
                     uint64_t* replyError) {
    auto paths = BTHGroupManager::defaultManager().groupContainerPathsForUser(
        user, client, BTHRequestIdentifier(request->message(), client), replyError);
    if (paths) request->reply().set("ReplyGroupContainerDict", pathsValue(*paths));
}

// The effective user of a request for application groups; none (38 in the
// reply error) when the requested user is not valid for class 7.
std::optional<uint32_t> validatedGroupUser(const Value& message, const BTHClientConnection& client,
                                           uint64_t* replyError) {
    const auto requested = static_cast<uint32_t>(BTHRequestUInt64(message, "UserID"));
    uint32_t effective = 0;
    if (!validateUserId(requested, BTHContainerClassSharedAppGroup, client.clientUserId(),
                        &effective, replyError))
        return std::nullopt;
    return effective;
}

}  // namespace

void groupContainerPaths(const BTHRequestRef& request,
                         const std::shared_ptr<BTHClientConnection>& client, uint64_t* replyError) {
    if (auto user = validatedGroupUser(request->message(), *client, replyError))
        replyGroupPaths(request, *client, *user, replyError);
}

void groupContainerIdentifiers(const BTHRequestRef& request,
                               const std::shared_ptr<BTHClientConnection>& client,
                               uint64_t* replyError) {
    const Value& message = request->message();
    auto user = validatedGroupUser(message, *client, replyError);
    if (!user) return;
    auto groups = BTHGroupManager::defaultManager().groupContainerIdentifiersForUser(
        *user, BTHRequestIdentifier(message, *client), replyError);
    if (groups) request->reply().set("ReplyGroupIdentifiersArray", BTHStringListValue(*groups));
}

void systemContainerPath(const BTHRequestRef& request,
                         const std::shared_ptr<BTHClientConnection>& client, uint64_t* replyError) {
    const std::optional<std::string> identifier = BTHRequestIdentifier(request->message(), *client);
    // A well-known system container is any caller's to find.
    if (identifier && identifier != client->clientBundleIdentifier() &&
        !client->allowOtherIdLookup() &&
        BTHWhitelist::sharedWhitelist().systemContainerIdIsWellknown(*identifier))
        client->setAllowOtherIdLookup(true);
    const BTHMetadataRef container = client->createOrLookupContainerForUser(
        kBTHSystemUserId, identifier, true, BTHContainerClassDataSystem, false, true, replyError);
    if (container) request->reply().set("ReplyPath", container->url().string());
}

void systemGroupContainerPaths(const BTHRequestRef& request,
                               const std::shared_ptr<BTHClientConnection>& client,
                               uint64_t* replyError) {
    replyGroupPaths(request, *client, kBTHSystemUserId, replyError);
}

void systemGroupContainerPath(const BTHRequestRef& request,
                              const std::shared_ptr<BTHClientConnection>& client,
                              uint64_t* replyError) {
    BTH_FUNCTION("systemGroupContainerPath");
    const Value& message = request->message();
    const std::optional<std::string> identifier = BTHRequestIdentifier(message, *client);
    const std::optional<std::string> group = BTHRequestString(message, "GroupIdentifier");
    std::vector<std::string> entitled;
    if (BTHCodeSigningMapping* mapping = BTHCodeSigningMapping::sharedInstance();
        mapping && identifier)
        entitled = mapping->systemGroupIdentifiersForIdentifier(*identifier)
                       .value_or(std::vector<std::string>{});

    std::optional<std::string> path;
    if (group && std::find(entitled.begin(), entitled.end(), *group) != entitled.end()) {
        auto paths = BTHGroupManager::defaultManager().groupContainerPathsForUser(
            kBTHSystemUserId, *client, identifier, replyError);
        if (paths && paths->contains(*group)) path = paths->at(*group);
    } else if (group && BTHWhitelist::sharedWhitelist().systemGroupContainerIdIsWellknown(*group)) {
        client->setAllowGroupIdLookup(true);
        const BTHMetadataRef container = client->createOrLookupContainerForUser(
            kBTHSystemUserId, group, true, BTHContainerClassSharedSystemGroup, false, true,
            replyError);
        if (container) path = container->url().string();
    } else {
        if (group != kQuietSystemGroup)
            BTHLogError(
                "%@ is not entitled for system group identifier: %@.  Only entitled for: %@",
                identifier, group, BTHStringListValue(entitled));
        BTHSetErrorCode(replyError, BTHErrorNotEntitled);
        return;
    }
    if (!path) {
        BTHLogError("Did not find system group container with identifier: %@ for %@", group,
                    identifier);
        BTHSetErrorCode(replyError, BTHErrorNotFound);
        return;
    }
    request->reply().set("ReplyPath", *path);
}

}  // namespace berth
