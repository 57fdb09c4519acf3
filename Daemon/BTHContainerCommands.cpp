#include "BTHContainerCommands.h"

#include "BTHRequestIntake.h"
#include "BTHRequestReaders.h"

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

}  // namespace berth
