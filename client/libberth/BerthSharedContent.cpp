#include "libberth/BerthSharedContent.h"

#include "libberth/BerthGroups.h"

namespace berth {

namespace {

Value requestFor(uint64_t command, const std::string& identifier) {
    Value request = Value::dictionary();
    request.set("Command", command);
    request.set("Identifier", identifier);
    return request;
}

}  // namespace

Value makeStageSharedContentRequest(const std::string& systemGroup, const std::string& sourcePath,
                                    const std::string& destPath) {
    Value request = requestFor(kBerthCommandStageSharedContent, systemGroup);
    request.set("SourcePath", sourcePath);
    request.set("DestPath", destPath);
    return request;
}

Value makeSetNetworkExtensionRequest(const std::string& identifier, uint64_t containerClass) {
    Value request = requestFor(kBerthCommandSetNetworkExtension, identifier);
    request.set("ContainerClass", containerClass);
    return request;
}

Value makeUserManagedAssetsPathRequest(const std::string& identifier) {
    return requestFor(kBerthCommandUserManagedAssetsPath, identifier);
}

Value makeDeleteUserManagedAssetRequest(const std::string& identifier,
                                        const std::string& relativePath) {
    Value request = requestFor(kBerthCommandDeleteUserManagedAsset, identifier);
    request.set("SourcePath", relativePath);
    return request;
}

std::optional<Value> BerthSharedContent::exchange(const Value& request, ContainerError* error) {
    BerthError failure;
    std::optional<Value> reply = connection_.request(request, timeout_, &failure);
    if (!reply && error) {
        error->text = failure.message;
        error->transport = std::move(failure);
    }
    return reply;
}

std::optional<std::filesystem::path> BerthSharedContent::stageSharedContent(
    const std::string& systemGroup, const std::string& sourcePath, const std::string& destPath,
    ContainerError* error) {
    const std::optional<Value> reply =
        exchange(makeStageSharedContentRequest(systemGroup, sourcePath, destPath), error);
    return reply ? decodePathReply(*reply, error) : std::nullopt;
}

bool BerthSharedContent::setNetworkExtension(const std::string& identifier, uint64_t containerClass,
                                             ContainerError* error) {
    const std::optional<Value> reply =
        exchange(makeSetNetworkExtensionRequest(identifier, containerClass), error);
    return reply && decodeReplyStatus(*reply, error);
}

std::optional<std::filesystem::path> BerthSharedContent::userManagedAssetsPath(
    const std::string& identifier, ContainerError* error) {
    const std::optional<Value> reply =
        exchange(makeUserManagedAssetsPathRequest(identifier), error);
    return reply ? decodePathReply(*reply, error) : std::nullopt;
}

bool BerthSharedContent::deleteUserManagedAsset(const std::string& identifier,
                                                const std::string& relativePath,
                                                ContainerError* error) {
    const std::optional<Value> reply =
        exchange(makeDeleteUserManagedAssetRequest(identifier, relativePath), error);
    return reply && decodeReplyStatus(*reply, error);
}

}  // namespace berth
