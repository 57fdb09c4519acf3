#include "libberth/BerthContainers.h"

#include "core/ErrorCodes.h"

namespace berth {
namespace {

void setError(ContainerError* out, ContainerError error) {
    if (out) *out = std::move(error);
}

ContainerError transportError(BerthError error) {
    ContainerError result;
    result.text = error.message;
    result.transport = std::move(error);
    return result;
}

// A reply that is not one this daemon sends for the command.
ContainerError malformed(std::string why) {
    return transportError(
        BerthError{BerthError::Code::ProtocolError, 0, "malformed reply: " + std::move(why)});
}

ContainerError replyError(uint64_t code) {
    ContainerError result;
    result.code = code;
    result.name = std::string(BTHErrorCodeName(code));
    result.text = std::string(describeReplyError(code));
    return result;
}

// The member `key` of a successful reply, of the kind `kind`; null, with
// the error set, when it is absent or of another kind.
const Value* member(const Value& reply, const char* key, Value::Kind kind, ContainerError* error) {
    const Value* value = reply.find(key);
    if (!value) {
        setError(error, malformed(std::string("it lacks \"") + key + "\""));
        return nullptr;
    }
    if (value->kind() != kind) {
        setError(error, malformed(std::string("\"") + key + "\" is " + kindName(value->kind()) +
                                  ", not " + kindName(kind)));
        return nullptr;
    }
    return value;
}

// The fields shared by every request about one class of one user.
Value baseRequest(uint64_t command, const ContainerSelector& selector) {
    Value request = Value::dictionary();
    request.set("Command", command);
    request.set("ContainerClass", selector.containerClass);
    request.set("UserID", selector.userId);
    return request;
}

// ... and those of a request about one container.
Value containerRequest(uint64_t command, const ContainerSelector& selector) {
    Value request = baseRequest(command, selector);
    if (selector.identifier) request.set("Identifier", *selector.identifier);
    if (selector.uuid) request.set("UUID", *selector.uuid);
    return request;
}

// One side of a replace, under keys such as "OldContainerClass".
void setReplaceSide(Value& request, const char* side, const ContainerSelector& selector) {
    const std::string prefix(side);
    request.set(prefix + "ContainerClass", selector.containerClass);
    request.set(prefix + "ContainerUserID", selector.userId);
    if (selector.identifier) request.set(prefix + "Identifier", *selector.identifier);
    if (selector.uuid) request.set(prefix + "ContainerUUID", *selector.uuid);
}

// A request refused before it is sent.
ContainerError invalidRequest(std::string why) {
    return transportError(BerthError{BerthError::Code::InvalidRequest, 0, std::move(why)});
}

}  // namespace

std::string ContainerError::describe() const {
    if (!isReplyError()) return text;
    std::string line =
        name.empty() ? "code " + std::to_string(code) : name + " (" + std::to_string(code) + ")";
    return line + ": " + text;
}

std::string_view describeReplyError(uint64_t code) {
    struct Text {
        uint64_t code;
        std::string_view text;
    };
    static constexpr Text kTexts[] = {
        {BTHErrorSuccess, "no error"},
        {BTHErrorMoveAsideFailed, "an item could not be moved out of the way"},
        {BTHErrorRemoveTransientFailed, "a transient container could not be removed"},
        {BTHErrorDirectorySetupFailed, "a container subdirectory could not be made"},
        {BTHErrorCreateStagingFailed, "the staging directory could not be made"},
        {BTHErrorMoveStagingFailed, "a new container could not be moved into place"},
        {BTHErrorRemoveStagingFailed, "a staging directory could not be removed"},
        {BTHErrorInvalidPath, "a path is not of the required form"},
        {BTHErrorInvalidArgument,
         "an argument is missing or malformed (identifier, user, UUID or class)"},
        {BTHErrorMetadataReadFailed, "a container's metadata could not be read"},
        {BTHErrorMoveToStagingFailed, "a container could not be moved to staging"},
        {BTHErrorReplaceFailed, "the container could not be replaced"},
        {BTHErrorDestroyFailed, "an item could not be destroyed"},
        {BTHErrorIdentifierMissing, "the operation needs an identifier"},
        {BTHErrorNotFound, "no such container"},
        {BTHErrorReplaceSameContainer, "a container cannot replace itself"},
        {BTHErrorReplaceClassMismatch, "the containers are of different classes"},
        {BTHErrorInfoValueNotFound, "the container holds no info value for that key"},
        {BTHErrorAlreadyExists, "the container already exists"},
        {BTHErrorDeleteFailed, "the container could not be deleted"},
        {BTHErrorMetadataInvalid, "a container's metadata is invalid"},
        {BTHErrorReplaceInfoInvalid, "the replace information is invalid"},
        {BTHErrorWriteFailed, "a state file could not be written"},
        {BTHErrorReplaceJournalFailed, "the replace journal is unreadable or invalid"},
        {BTHErrorCleanupFailed, "leftovers of a replace could not be removed"},
        {BTHErrorInvalidParameter,
         "a value is not allowed (such as a user not valid for the class or the caller)"},
        {BTHErrorException, "the daemon caught an exception"},
        {BTHErrorMoveToDeathRowFailed, "an item could not be moved to death row"},
        {BTHErrorCacheRebuildFailed, "the container cache could not be rebuilt"},
        {BTHErrorCacheInconsistent, "the container cache disagrees with the disk"},
        {BTHErrorCacheAddFailed, "the container could not be added to the cache"},
        {BTHErrorCacheRemoveFailed, "the container could not be removed from the cache"},
        {BTHErrorCacheInvalidInput, "the container cache was asked something invalid"},
        {BTHErrorRegenerateMoveFailed, "the container could not be renamed"},
        {BTHErrorInvalidCommand, "the daemon does not serve this command"},
        {BTHErrorNotEntitled, "the caller lacks the entitlement this needs"},
        {BTHErrorReplaceUserMismatch, "the containers belong to different users"},
        {BTHErrorMappingWriteFailed, "the code-signing mapping could not be written"},
        {BTHErrorMappingInvalidInput, "the code-signing input is inconsistent"},
        {BTHErrorDeviceLocked, "the device is locked"},
        {BTHErrorChangeOwnerFailed, "an owner could not be changed"},
        {BTHErrorACLFailed, "an access control list could not be set"},
        {BTHErrorStageSharedContentFailed, "shared content could not be staged"},
    };
    for (const Text& entry : kTexts)
        if (entry.code == code) return entry.text;
    return "a code the daemon's table does not use";
}

Value makeCreateOrLookupRequest(const ContainerSelector& selector, bool createIfNecessary) {
    // A container is created or found by its identifier; a UUID has no say.
    Value request = baseRequest(kBerthCommandCreateOrLookup, selector);
    if (selector.identifier) request.set("Identifier", *selector.identifier);
    request.set("CreateIfNecessary", createIfNecessary);
    request.set("Transient", selector.transient);
    return request;
}

Value makeListRequest(const ContainerSelector& selector) {
    Value request = baseRequest(kBerthCommandList, selector);
    request.set("Transient", selector.transient);
    return request;
}

Value makeSetInfoValueRequest(const ContainerSelector& selector, std::string_view key,
                              const std::optional<Value>& value) {
    Value request = containerRequest(kBerthCommandSetInfoValue, selector);
    request.set("Key", key);
    if (value) request.set("Value", *value);
    return request;
}

Value makeGetInfoValueRequest(const ContainerSelector& selector, std::string_view key) {
    Value request = containerRequest(kBerthCommandGetInfoValue, selector);
    request.set("Key", key);
    return request;
}

Value makeMetadataRequest(const ContainerSelector& selector, bool infoRequested) {
    Value request = containerRequest(kBerthCommandMetadata, selector);
    request.set("InfoDictRequested", infoRequested);
    return request;
}

Value makeRecreateDefaultStructureRequest(const ContainerSelector& selector, uint64_t command) {
    return containerRequest(command, selector);
}

Value makeReplaceRequest(const std::optional<ContainerSelector>& old,
                         const ContainerSelector& replacement) {
    Value request = Value::dictionary();
    request.set("Command", uint64_t{kBerthCommandReplace});
    if (old) setReplaceSide(request, "Old", *old);
    setReplaceSide(request, "New", replacement);
    return request;
}

Value makeStageForDeleteRequest(const std::vector<ContainerSelector>& containers) {
    Value classes = Value::array(), uuids = Value::array(), users = Value::array(),
          identifiers = Value::array();
    for (const ContainerSelector& container : containers) {
        classes.push(container.containerClass);
        uuids.push(container.uuid ? Value(*container.uuid) : Value());
        users.push(container.userId);
        identifiers.push(container.identifier ? Value(*container.identifier) : Value());
    }
    Value request = Value::dictionary();
    request.set("Command", uint64_t{kBerthCommandStageForDelete});
    request.set("ContainerClassesArray", std::move(classes));
    request.set("UUIDsArray", std::move(uuids));
    request.set("UserIDsArray", std::move(users));
    request.set("IdentifiersArray", std::move(identifiers));
    return request;
}

Value makeEmptyDeathRowRequest() {
    Value request = Value::dictionary();
    request.set("Command", uint64_t{kBerthCommandEmptyDeathRow});
    return request;
}

Value makeRegenerateDirectoryUUIDRequest(const ContainerSelector& selector) {
    return containerRequest(kBerthCommandRegenerateDirectoryUUID, selector);
}

Value makeDeleteRequest(const ContainerSelector& selector) {
    // The daemon finds the container to delete by identifier; a UUID has no say.
    Value request = baseRequest(kBerthCommandDelete, selector);
    if (selector.identifier) request.set("Identifier", *selector.identifier);
    request.set("Transient", selector.transient);
    return request;
}

Value makeWipePluginDataRequest(const ContainerSelector& selector) {
    Value request = Value::dictionary();
    request.set("Command", uint64_t{kBerthCommandWipePluginData});
    request.set("UserID", selector.userId);
    if (selector.identifier) request.set("Identifier", *selector.identifier);
    return request;
}

Value makeWipeDataRequest(const ContainerSelector& selector) {
    Value request = baseRequest(kBerthCommandWipeData, selector);
    if (selector.identifier) request.set("Identifier", *selector.identifier);
    return request;
}

bool decodeReplyStatus(const Value& reply, ContainerError* error) {
    const Value* code = reply.find("ReplyError");
    // The daemon sends an unsigned code; a negative one is not its code.
    const bool usable = code && (code->kind() == Value::Kind::UInt64 ||
                                 (code->kind() == Value::Kind::Int64 && *code->int64Value() >= 0));
    if (!usable) {
        setError(error, malformed("it carries no unsigned \"ReplyError\""));
        return false;
    }
    if (*code->uint64Value() == BTHErrorSuccess) return true;
    setError(error, replyError(*code->uint64Value()));
    return false;
}

std::optional<ContainerLocation> decodeCreateOrLookupReply(const Value& reply,
                                                           ContainerError* error) {
    if (!decodeReplyStatus(reply, error)) return std::nullopt;
    const Value* path = member(reply, "ReplyPath", Value::Kind::String, error);
    const Value* uuid = path ? member(reply, "ReplyUUID", Value::Kind::Uuid, error) : nullptr;
    const Value* existed = uuid ? member(reply, "ReplyExisted", Value::Kind::Bool, error) : nullptr;
    const Value* identifier =
        existed ? member(reply, "ReplyIdentifier", Value::Kind::String, error) : nullptr;
    if (!identifier) return std::nullopt;
    return ContainerLocation{*path->string(), *uuid->uuid(), *existed->boolValue(),
                             *identifier->string()};
}

std::optional<std::vector<ContainerListEntry>> decodeListReply(const Value& reply,
                                                               ContainerError* error) {
    if (!decodeReplyStatus(reply, error)) return std::nullopt;
    const bool hasIds = reply.find("ReplyIdsArray") != nullptr;
    const bool hasUuids = reply.find("ReplyUUIDsArray") != nullptr;
    if (!hasIds && !hasUuids) return std::vector<ContainerListEntry>{};
    const Value* ids = member(reply, "ReplyIdsArray", Value::Kind::Array, error);
    const Value* uuids =
        ids ? member(reply, "ReplyUUIDsArray", Value::Kind::Array, error) : nullptr;
    if (!uuids) return std::nullopt;
    if (ids->size() != uuids->size()) {
        setError(error, malformed("\"ReplyIdsArray\" and \"ReplyUUIDsArray\" differ in length"));
        return std::nullopt;
    }
    std::vector<ContainerListEntry> entries;
    entries.reserve(ids->size());
    for (size_t i = 0; i < ids->size(); ++i) {
        const Value& id = (*ids->arrayValue())[i];
        const Value& uuid = (*uuids->arrayValue())[i];
        if (!id.isString() || !uuid.isUuid()) {
            setError(error, malformed("entry " + std::to_string(i) +
                                      " of the listing is not an identifier and a UUID"));
            return std::nullopt;
        }
        entries.push_back({*id.string(), *uuid.uuid()});
    }
    return entries;
}

std::optional<Value> decodeGetInfoValueReply(const Value& reply, ContainerError* error) {
    if (!decodeReplyStatus(reply, error)) return std::nullopt;
    const Value* value = reply.find("ReplyInfoValue");
    if (!value) {
        setError(error, malformed("it lacks \"ReplyInfoValue\""));
        return std::nullopt;
    }
    return *value;
}

std::optional<ContainerMetadata> decodeMetadataReply(const Value& reply, ContainerError* error) {
    if (!decodeReplyStatus(reply, error)) return std::nullopt;
    const Value* path = member(reply, "ReplyPath", Value::Kind::String, error);
    const Value* transient =
        path ? member(reply, "ReplyTransient", Value::Kind::Bool, error) : nullptr;
    if (!transient) return std::nullopt;
    ContainerMetadata metadata{*path->string(), *transient->boolValue(), std::nullopt};
    if (reply.find("ReplyInfoDictionary")) {
        const Value* info = member(reply, "ReplyInfoDictionary", Value::Kind::Dictionary, error);
        if (!info) return std::nullopt;
        metadata.info = *info;
    }
    return metadata;
}

std::optional<Value> BerthContainers::exchange(const Value& request, ContainerError* error) {
    BerthError failure;
    std::optional<Value> reply = connection_.request(request, timeout_, &failure);
    if (!reply) setError(error, transportError(std::move(failure)));
    return reply;
}

std::optional<ContainerLocation> BerthContainers::createOrLookup(const ContainerSelector& selector,
                                                                 bool createIfNecessary,
                                                                 ContainerError* error) {
    const std::optional<Value> reply =
        exchange(makeCreateOrLookupRequest(selector, createIfNecessary), error);
    return reply ? decodeCreateOrLookupReply(*reply, error) : std::nullopt;
}

std::optional<std::vector<ContainerListEntry>> BerthContainers::list(
    const ContainerSelector& selector, ContainerError* error) {
    const std::optional<Value> reply = exchange(makeListRequest(selector), error);
    return reply ? decodeListReply(*reply, error) : std::nullopt;
}

bool BerthContainers::setInfoValue(const ContainerSelector& selector, std::string_view key,
                                   const std::optional<Value>& value, ContainerError* error) {
    return call(makeSetInfoValueRequest(selector, key, value), error);
}

std::optional<Value> BerthContainers::infoValue(const ContainerSelector& selector,
                                                std::string_view key, ContainerError* error) {
    const std::optional<Value> reply = exchange(makeGetInfoValueRequest(selector, key), error);
    return reply ? decodeGetInfoValueReply(*reply, error) : std::nullopt;
}

std::optional<ContainerMetadata> BerthContainers::metadata(const ContainerSelector& selector,
                                                           bool infoRequested,
                                                           ContainerError* error) {
    const std::optional<Value> reply =
        exchange(makeMetadataRequest(selector, infoRequested), error);
    return reply ? decodeMetadataReply(*reply, error) : std::nullopt;
}

bool BerthContainers::call(const Value& request, ContainerError* error) {
    const std::optional<Value> reply = exchange(request, error);
    return reply && decodeReplyStatus(*reply, error);
}

bool BerthContainers::recreateDefaultStructure(const ContainerSelector& selector,
                                               ContainerError* error, uint64_t command) {
    return call(makeRecreateDefaultStructureRequest(selector, command), error);
}

bool BerthContainers::replace(const std::optional<ContainerSelector>& old,
                              const ContainerSelector& replacement, ContainerError* error) {
    if (old && !old->uuid) {
        setError(error, invalidRequest("the old container of a replace needs its UUID"));
        return false;
    }
    return call(makeReplaceRequest(old, replacement), error);
}

bool BerthContainers::stageForDelete(const std::vector<ContainerSelector>& containers,
                                     ContainerError* error) {
    for (size_t i = 0; i < containers.size(); ++i) {
        if (!containers[i].identifier || !containers[i].uuid) {
            setError(error, invalidRequest("container " + std::to_string(i) +
                                           " to stage lacks its identifier or UUID"));
            return false;
        }
    }
    return call(makeStageForDeleteRequest(containers), error);
}

bool BerthContainers::emptyDeathRow(ContainerError* error) {
    return call(makeEmptyDeathRowRequest(), error);
}

bool BerthContainers::regenerateDirectoryUUID(const ContainerSelector& selector,
                                              ContainerError* error) {
    return call(makeRegenerateDirectoryUUIDRequest(selector), error);
}

bool BerthContainers::deleteContainer(const ContainerSelector& selector, ContainerError* error) {
    return call(makeDeleteRequest(selector), error);
}

bool BerthContainers::wipePluginData(const ContainerSelector& selector, ContainerError* error) {
    return call(makeWipePluginDataRequest(selector), error);
}

bool BerthContainers::wipeData(const ContainerSelector& selector, ContainerError* error) {
    return call(makeWipeDataRequest(selector), error);
}

}  // namespace berth
