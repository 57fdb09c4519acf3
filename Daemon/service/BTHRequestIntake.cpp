#include "BTHRequestIntake.h"

#include "BTHCodeSigningMapping.h"
#include "BTHCommandTable.h"
#include "BTHError.h"
#include "BTHGlobalConfiguration.h"
#include "BTHLog.h"
#include "core/BTHContainerClass.h"

namespace berth {

namespace {

constexpr uid_t kHighestSystemUserId = 500;

bool entitlementIsTrue(const Value& entitlements, const char* key) {
    const Value* v = entitlements.find(key);
    return v && v->boolValue() && *v->boolValue();
}

std::shared_ptr<BTHClientConnection> refuse(const BTHPeerIdentity& peer,
                                            const char* requiredEntitlement) {
    BTH_FUNCTION("checkEntitlementsAndInitClientObject");
    BTHLogError("connection attempt from pid %d (%@) missing required entitlement: %s", peer.pid,
                peer.signingIdentifier, requiredEntitlement);
    return nullptr;
}

// The identifier a request concerns, for the log: the one it names, else
// the caller's own.
std::string servedIdentifier(const Value& message, const BTHPeerIdentity& peer) {
    if (const Value* named = message.find("Identifier"); named && named->string())
        return *named->string();
    return peer.signingIdentifier.value_or("");
}

// A caller's own entitlements stand for its code-signing information until
// the installer reports some: registered when the identifier has none, and
// refreshed on every request while they are the caller's own. The request
// goes on whatever the outcome.
void refreshCallerRegisteredEntitlements(const std::string& identifier, const Value& entitlements) {
    BTH_FUNCTION("checkEntitlementsAndInitClientObject");
    BTHCodeSigningMapping* mapping = BTHCodeSigningMapping::sharedInstance();
    if (!mapping || mapping->callerEntitlementsNeedNoProcessing(entitlements, identifier)) return;
    const uint64_t code = mapping->processCallerRegisteredEntitlements(entitlements, identifier);
    if (code != BTHErrorSuccess)
        BTHLogError("Error processing entitlements for %@ : %llu", identifier, code);
}

}  // namespace

std::shared_ptr<BTHClientConnection> checkEntitlementsAndInitClientObject(
    const BTHPeerIdentity& peer, const char* requiredEntitlement) {
    BTH_FUNCTION("checkEntitlementsAndInitClientObject");
    if (!peer.signingIdentifier)
        BTHLogError("Failed to copy signing ID for pid %d : %@", peer.pid, peer.signingError);

    const bool none = std::string_view(requiredEntitlement) == kBTHEntitlementNone;
    if (!peer.entitlements || !peer.entitlements->isDictionary()) {
        if (!none) return refuse(peer, requiredEntitlement);
        return std::make_shared<BTHClientConnection>(peer.signingIdentifier, peer.effectiveUserId,
                                                     false, std::nullopt);
    }
    const Value& entitlements = *peer.entitlements;

    bool allowOtherIdLookup = false;
    bool met = none;
    if (entitlementIsTrue(entitlements, kBTHEntitlementAllowed)) {
        allowOtherIdLookup = true;
        met = true;
    } else {
        allowOtherIdLookup = entitlementIsTrue(entitlements, kBTHEntitlementOtherIdLookup);
    }

    std::optional<std::vector<std::string>> wipeIdentifiers;
    if (std::string_view(requiredEntitlement) == kBTHEntitlementWipeContainer) {
        const Value* wipe = entitlements.find(kBTHEntitlementWipeContainer);
        if (wipe && wipe->arrayValue()) {
            wipeIdentifiers.emplace();
            for (const Value& id : *wipe->arrayValue())
                if (id.string()) wipeIdentifiers->push_back(*id.string());
        } else {
            BTHLogError("No entitled containers to wipe");
            if (!met) return refuse(peer, requiredEntitlement);
        }
    } else if (!met && !entitlementIsTrue(entitlements, requiredEntitlement)) {
        return refuse(peer, requiredEntitlement);
    }

    if (peer.signingIdentifier)
        refreshCallerRegisteredEntitlements(*peer.signingIdentifier, entitlements);

    return std::make_shared<BTHClientConnection>(peer.signingIdentifier, peer.effectiveUserId,
                                                 allowOtherIdLookup, std::move(wipeIdentifiers));
}

bool validateUserId(uint32_t requestedUser, uint64_t containerClass, uint32_t clientUserId,
                    uint32_t* effectiveUser, uint64_t* error) {
    BTH_FUNCTION("validateUserId");
    bool valid = false;
    uint32_t effective = requestedUser;
    if (BTHContainerClassIsBundle(containerClass)) {
        valid = requestedUser == kBTHBundleUserId;
        effective = kBTHBundleUserId;
    } else if (BTHContainerClassIsSystem(containerClass)) {
        valid = requestedUser == kBTHSystemUserId;
        effective = kBTHSystemUserId;
    } else if (clientUserId > kHighestSystemUserId) {
        valid = requestedUser == clientUserId || requestedUser == kBTHCallerUserId;
        effective = clientUserId;
    } else if (requestedUser == kBTHCallerUserId) {
        valid = true;
        effective = BTHGlobalConfiguration::sharedInstance().currentMobileUserId();
    } else {
        valid = BTHContainerClassIsPerUser(containerClass);
    }
    if (!valid) {
        if (error) {
            BTHLogError("Invalid userId %u for class %llu from client %u", requestedUser,
                        containerClass, clientUserId);
            *error = BTHErrorInvalidParameter;
        }
        return false;
    }
    if (effectiveUser) *effectiveUser = effective;
    return true;
}

void BTHProcessRequest(const BTHRequestRef& request) {
    BTH_FUNCTION("BTHProcessRelayEvent");
    const Value* commandValue = request->message().find("Command");
    const uint64_t command =
        commandValue && commandValue->isInteger() ? *commandValue->uint64Value() : 0;
    uint64_t replyError = BTHErrorSuccess;
    bool repliesAtOnce = true;

    const BTHPeerIdentity& peer = request->peer();
    const BTHLogIdentifierScope logScope(servedIdentifier(request->message(), peer));
    if (command >= kBTHCommandCount) {
        BTHLogError("Invalid command index: %lld", command);
        replyError = BTHErrorInvalidCommand;
    } else if (const BTHCommandRow& row = BTHCommandTable()[command]; row.command != command) {
        BTHLogError("Invalid command at index %llu", command);
        replyError = BTHErrorInvalidCommand;
    } else if (!peer.processStillBound) {
        // The process that connected is gone or runs something else now:
        // whoever holds its socket is not who the identity describes.
        BTHLogError(
            "Refusing command %llu from pid %d: the connecting process exited or changed "
            "its executable",
            command, peer.pid);
        replyError = BTHErrorNotEntitled;
    } else if (auto client = checkEntitlementsAndInitClientObject(peer, row.requiredEntitlement)) {
        repliesAtOnce = row.repliesAtOnce != 0;
        row.handler(request, client, &replyError);
    } else {
        replyError = BTHErrorNotEntitled;
    }

    if (repliesAtOnce || replyError != BTHErrorSuccess) {
        request->reply().set("ReplyError", replyError);
        request->sendReply();
    }
}

}  // namespace berth
