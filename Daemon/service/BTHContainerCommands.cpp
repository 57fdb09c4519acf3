#include "BTHContainerCommands.h"

#include "BTHCommandTable.h"
#include "BTHLog.h"
#include "BTHRequestIntake.h"
#include "BTHRequestReaders.h"
#include "core/BTHContainerClass.h"

namespace berth {

namespace {

// The class and effective user of a request that names both; none (with 38
// in the reply error) when the user is not valid for the class.
struct ValidatedTarget {
    uint64_t containerClass;
    uint32_t userId;
};

std::optional<ValidatedTarget> validatedTarget(const Value& message,
                                               const BTHClientConnection& client,
                                               uint64_t* replyError) {
    const uint64_t containerClass = BTHRequestUInt64(message, "ContainerClass");
    const auto requestedUser = static_cast<uint32_t>(BTHRequestUInt64(message, "UserID"));
    uint32_t effectiveUser = 0;
    if (!validateUserId(requestedUser, containerClass, client.clientUserId(), &effectiveUser,
                        replyError))
        return std::nullopt;
    return ValidatedTarget{containerClass, effectiveUser};
}

}  // namespace

void createOrLookupContainer(const BTHRequestRef& request,
                             const std::shared_ptr<BTHClientConnection>& client,
                             uint64_t* replyError) {
    const Value& message = request->message();
    const auto target = validatedTarget(message, *client, replyError);
    if (!target) return;
    const BTHMetadataRef container = client->createOrLookupContainerForUser(
        target->userId, BTHRequestIdentifier(message, *client),
        BTHRequestBool(message, "CreateIfNecessary"), target->containerClass,
        BTHRequestBool(message, "Transient"), true, replyError);
    if (!container) return;
    Value& reply = request->reply();
    reply.set("ReplyUUID", Value(container->uuid()));
    reply.set("ReplyExisted", Value(container->existed()));
    reply.set("ReplyPath", Value(container->url().string()));
    reply.set("ReplyIdentifier", Value(container->identifier()));
}

void listContainers(const BTHRequestRef& request,
                    const std::shared_ptr<BTHClientConnection>& client, uint64_t* replyError) {
    const Value& message = request->message();
    const auto target = validatedTarget(message, *client, replyError);
    if (!target) return;
    const auto containers = client->containersForUser(
        target->userId, target->containerClass, BTHRequestBool(message, "Transient"), replyError);
    if (!containers) return;
    Value identifiers = Value::array();
    Value uuids = Value::array();
    for (const BTHMetadataRef& container : *containers) {
        identifiers.push(Value(container->identifier()));
        uuids.push(Value(container->uuid()));
    }
    Value& reply = request->reply();
    reply.set("ReplyIdsArray", std::move(identifiers));
    reply.set("ReplyUUIDsArray", std::move(uuids));
}

void setInfoValue(const BTHRequestRef& request, const std::shared_ptr<BTHClientConnection>& client,
                  uint64_t* replyError) {
    const Value& message = request->message();
    const auto target = validatedTarget(message, *client, replyError);
    if (!target) return;
    client->setInfoValue(BTHRequestObject(message, "Value"), BTHRequestString(message, "Key"),
                         target->userId, BTHRequestUUID(message, "UUID"),
                         BTHRequestString(message, "Identifier"), target->containerClass, true,
                         replyError);
}

void getInfoValue(const BTHRequestRef& request, const std::shared_ptr<BTHClientConnection>& client,
                  uint64_t* replyError) {
    const Value& message = request->message();
    const auto target = validatedTarget(message, *client, replyError);
    if (!target) return;
    std::optional<Value> value = client->infoValueForKey(
        BTHRequestString(message, "Key"), target->userId, BTHRequestUUID(message, "UUID"),
        BTHRequestString(message, "Identifier"), target->containerClass, true, replyError);
    if (value) request->reply().set("ReplyInfoValue", std::move(*value));
}

void getContainerMetadata(const BTHRequestRef& request,
                          const std::shared_ptr<BTHClientConnection>& client,
                          uint64_t* replyError) {
    const Value& message = request->message();
    const auto target = validatedTarget(message, *client, replyError);
    if (!target) return;
    const BTHMetadataRef container = client->metadataForUser(
        target->userId, BTHRequestUUID(message, "UUID"), BTHRequestString(message, "Identifier"),
        target->containerClass, replyError);
    if (!container) return;
    Value& reply = request->reply();
    reply.set("ReplyPath", Value(container->url().string()));
    reply.set("ReplyTransient", Value(container->transient()));
    if (BTHRequestBool(message, "InfoDictRequested") && container->info())
        reply.set("ReplyInfoDictionary", *container->info());
}

void recreateDefaultStructure(const BTHRequestRef& request,
                              const std::shared_ptr<BTHClientConnection>& client,
                              uint64_t* replyError) {
    const Value& message = request->message();
    const auto target = validatedTarget(message, *client, replyError);
    if (!target) return;
    client->recreateDefaultStructureForUser(target->userId, BTHRequestUUID(message, "UUID"),
                                            BTHRequestString(message, "Identifier"),
                                            target->containerClass, replyError);
}

void replaceContainer(const BTHRequestRef& request,
                      const std::shared_ptr<BTHClientConnection>& client, uint64_t* replyError) {
    const Value& message = request->message();
    BTHReplaceRequest replace;
    replace.oldUUID = BTHRequestUUID(message, "OldContainerUUID");
    if (replace.oldUUID) {
        replace.oldClass = BTHRequestUInt64(message, "OldContainerClass");
        replace.oldIdentifier = BTHRequestString(message, "OldIdentifier");
        const auto oldUser = static_cast<uint32_t>(BTHRequestUInt64(message, "OldContainerUserID"));
        if (!validateUserId(oldUser, replace.oldClass, client->clientUserId(), &replace.oldUserId,
                            replyError))
            return;
    }
    replace.newClass = BTHRequestUInt64(message, "NewContainerClass");
    const auto newUser = static_cast<uint32_t>(BTHRequestUInt64(message, "NewContainerUserID"));
    if (!validateUserId(newUser, replace.newClass, client->clientUserId(), &replace.newUserId,
                        replyError))
        return;
    replace.newUUID = BTHRequestUUID(message, "NewContainerUUID");
    replace.newIdentifier = BTHRequestString(message, "NewIdentifier");
    client->replaceContainer(replace, replyError);
}

void stageContainerForDelete(const BTHRequestRef& request,
                             const std::shared_ptr<BTHClientConnection>& client,
                             uint64_t* replyError) {
    BTH_FUNCTION("stageContainerForDelete");
    const Value& message = request->message();
    std::vector<Value> classes;
    if (const Value* array = message.find("ContainerClassesArray"); array && array->arrayValue())
        classes = *array->arrayValue();
    std::vector<std::optional<Uuid>> uuids;
    if (const Value* array = message.find("UUIDsArray"); array && array->arrayValue()) {
        for (const Value& entry : *array->arrayValue())
            uuids.push_back(entry.uuid() ? std::optional<Uuid>(*entry.uuid()) : std::nullopt);
    }
    std::vector<uid_t> users;
    if (const Value* array = message.find("UserIDsArray"); array && array->arrayValue()) {
        const auto& requested = *array->arrayValue();
        // Each user is validated against the class at its index; there must
        // be one.
        if (requested.size() > classes.size()) {
            BTHSetErrorCode(replyError, BTHErrorInvalidArgument);
            return;
        }
        for (size_t i = 0; i < requested.size(); ++i) {
            const auto user = static_cast<uint32_t>(requested[i].uint64Value().value_or(0));
            const uint64_t containerClass = classes[i].uint64Value().value_or(0);
            uint32_t effective = 0;
            if (!validateUserId(user, containerClass, client->clientUserId(), &effective,
                                replyError))
                return;
            users.push_back(effective);
        }
    }
    std::optional<std::vector<std::optional<std::string>>> identifiers;
    const Value* identifierArray = message.find("IdentifiersArray");
    if (identifierArray && identifierArray->arrayValue()) {
        identifiers.emplace();
        for (const Value& entry : *identifierArray->arrayValue())
            identifiers->push_back(entry.string() ? std::optional<std::string>(*entry.string())
                                                  : std::nullopt);
    } else {
        BTHLogError("Got non-Array input for the identifiers array");
    }
    client->stageForDeleteContainersWithUsers(users, uuids, identifiers, classes, true, replyError);
}

void deleteContainersOnDeathRow(const BTHRequestRef& request,
                                const std::shared_ptr<BTHClientConnection>& client, uint64_t*) {
    client->deleteContainersOnDeathRowWithCompletion(
        [request, client](uint64_t code) { BTHSendAsynchronousReply(request, code); });
}

void regenerateDirectoryUUID(const BTHRequestRef& request,
                             const std::shared_ptr<BTHClientConnection>& client,
                             uint64_t* replyError) {
    const Value& message = request->message();
    const auto target = validatedTarget(message, *client, replyError);
    if (!target) return;
    client->regenerateDirectoryUUIDForUser(target->userId, BTHRequestUUID(message, "UUID"),
                                           BTHRequestString(message, "Identifier"),
                                           target->containerClass, replyError);
}

void deleteContainer(const BTHRequestRef& request,
                     const std::shared_ptr<BTHClientConnection>& client, uint64_t* replyError) {
    const Value& message = request->message();
    const auto target = validatedTarget(message, *client, replyError);
    if (!target) return;
    client->deleteContainerForUser(target->userId, BTHRequestString(message, "Identifier"),
                                   target->containerClass, BTHRequestBool(message, "Transient"),
                                   replyError);
}

namespace {

void wipe(const BTHRequestRef& request, const std::shared_ptr<BTHClientConnection>& client,
          uint64_t containerClass, uint64_t* replyError) {
    const Value& message = request->message();
    const auto requestedUser = static_cast<uint32_t>(BTHRequestUInt64(message, "UserID"));
    uint32_t effectiveUser = 0;
    if (!validateUserId(requestedUser, containerClass, client->clientUserId(), &effectiveUser,
                        replyError))
        return;
    client->deleteDataContainerContentForUser(
        effectiveUser, BTHRequestString(message, "Identifier"), containerClass, replyError);
}

}  // namespace

void wipePluginDataContainer(const BTHRequestRef& request,
                             const std::shared_ptr<BTHClientConnection>& client,
                             uint64_t* replyError) {
    // Only the identifiers the caller is entitled to wipe count here.
    client->setAllowOtherIdLookup(false);
    wipe(request, client, BTHContainerClassDataSprocketPlugin, replyError);
}

void wipeDataContainer(const BTHRequestRef& request,
                       const std::shared_ptr<BTHClientConnection>& client, uint64_t* replyError) {
    wipe(request, client, BTHRequestUInt64(request->message(), "ContainerClass"), replyError);
}

}  // namespace berth
