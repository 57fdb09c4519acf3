#include "libberth/BerthUsage.h"

namespace berth {

namespace {

Value selectorRequest(uint64_t command, const ContainerSelector& selector) {
    Value request = Value::dictionary();
    request.set("Command", command);
    request.set("ContainerClass", selector.containerClass);
    request.set("UserID", selector.userId);
    if (selector.identifier) request.set("Identifier", *selector.identifier);
    return request;
}

void setError(ContainerError* out, ContainerError error) {
    if (out) *out = std::move(error);
}

ContainerError transportError(BerthError error) {
    ContainerError result;
    result.text = error.message;
    result.transport = std::move(error);
    return result;
}

}  // namespace

Value makeDiskUsageRequest(const ContainerSelector& selector) {
    Value request = selectorRequest(kBerthCommandDiskUsage, selector);
    if (selector.uuid) request.set("UUID", *selector.uuid);
    return request;
}

Value makeSetDataProtectionRequest(const ContainerSelector& selector, int32_t protectionClass,
                                   bool thirdParty, bool retryIfLocked) {
    Value request = selectorRequest(kBerthCommandSetDataProtection, selector);
    request.set("DataProtectionClass", int64_t{protectionClass});
    request.set("IsThirdParty", thirdParty);
    request.set("RetryIfLocked", retryIfLocked);
    return request;
}

std::optional<uint64_t> decodeDiskUsageReply(const Value& reply, ContainerError* error) {
    if (!decodeReplyStatus(reply, error)) return std::nullopt;
    const Value* usage = reply.find("ReplyDiskUsage");
    if (!usage || usage->kind() != Value::Kind::UInt64) {
        setError(error, transportError(BerthError{
                            BerthError::Code::ProtocolError, 0,
                            "malformed reply: it lacks an unsigned \"ReplyDiskUsage\""}));
        return std::nullopt;
    }
    return usage->uint64Value();
}

std::optional<Value> BerthUsage::exchange(const Value& request, ContainerError* error) {
    BerthError failure;
    std::optional<Value> reply = connection_.request(request, timeout_, &failure);
    if (!reply) setError(error, transportError(std::move(failure)));
    return reply;
}

std::optional<uint64_t> BerthUsage::diskUsage(const ContainerSelector& selector,
                                              ContainerError* error) {
    const std::optional<Value> reply = exchange(makeDiskUsageRequest(selector), error);
    return reply ? decodeDiskUsageReply(*reply, error) : std::nullopt;
}

bool BerthUsage::setDataProtection(const ContainerSelector& selector, int32_t protectionClass,
                                   bool thirdParty, bool retryIfLocked, ContainerError* error) {
    const std::optional<Value> reply = exchange(
        makeSetDataProtectionRequest(selector, protectionClass, thirdParty, retryIfLocked), error);
    return reply && decodeReplyStatus(*reply, error);
}

}  // namespace berth
