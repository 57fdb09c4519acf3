#include "libberth/BerthGroups.h"

namespace berth {
namespace {

void setError(ContainerError* out, ContainerError error) {
    if (out) *out = std::move(error);
}

ContainerError malformed(std::string why) {
    ContainerError result;
    result.transport =
        BerthError{BerthError::Code::ProtocolError, 0, "malformed reply: " + std::move(why)};
    result.text = result.transport.message;
    return result;
}

// The paths of a group dictionary; none (with the error) when a path is not
// a string.
std::optional<GroupContainerPaths> pathsOf(const Value& dictionary, ContainerError* error) {
    GroupContainerPaths paths;
    for (const auto& [group, path] : *dictionary.dictionaryValue()) {
        if (!path.string()) {
            setError(error, malformed("the path of \"" + group + "\" is not a string"));
            return std::nullopt;
        }
        paths.emplace(group, *path.string());
    }
    return paths;
}

}  // namespace

std::optional<Value> CodeSigningOptions::dictionary() const {
    Value options = Value::dictionary();
    if (dataContainerClass) options.set("sys.kelp.Berth.DataContainerClass", *dataContainerClass);
    if (parentIdentifier) options.set("sys.kelp.Berth.ParentBundleID", *parentIdentifier);
    if (placeholder) options.set("sys.kelp.Berth.PlaceholderEntitlements", true);
    if (options.size() == 0) return std::nullopt;
    return options;
}

Value makeGroupRequest(uint64_t command, const std::optional<std::string>& identifier,
                       std::optional<uint64_t> userId) {
    Value request = Value::dictionary();
    request.set("Command", command);
    if (userId) request.set("UserID", *userId);
    if (identifier) request.set("Identifier", *identifier);
    return request;
}

Value makeSystemGroupPathRequest(const std::optional<std::string>& identifier,
                                 const std::string& group) {
    Value request = makeGroupRequest(kBerthCommandSystemGroupContainerPath, identifier);
    request.set("GroupIdentifier", group);
    return request;
}

Value makeProcessCodeSigningInfoRequest(const std::string& identifier,
                                        const std::optional<Value>& info,
                                        const CodeSigningOptions& options) {
    Value request = makeGroupRequest(kBerthCommandProcessCodeSigningInfo, identifier);
    if (info) request.set("CodeSigningInfo", *info);
    if (auto dictionary = options.dictionary()) request.set("OptionsDictionary", *dictionary);
    return request;
}

std::optional<GroupContainerPaths> decodeGroupPathsReply(const Value& reply,
                                                         ContainerError* error) {
    if (!decodeReplyStatus(reply, error)) return std::nullopt;
    const Value* paths = reply.find("ReplyGroupContainerDict");
    if (!paths) return GroupContainerPaths{};
    if (!paths->isDictionary()) {
        setError(error, malformed("\"ReplyGroupContainerDict\" is not a dictionary"));
        return std::nullopt;
    }
    return pathsOf(*paths, error);
}

std::optional<std::vector<std::string>> decodeGroupIdentifiersReply(const Value& reply,
                                                                    ContainerError* error) {
    if (!decodeReplyStatus(reply, error)) return std::nullopt;
    std::vector<std::string> groups;
    const Value* list = reply.find("ReplyGroupIdentifiersArray");
    if (!list) return groups;
    if (!list->isArray()) {
        setError(error, malformed("\"ReplyGroupIdentifiersArray\" is not an array"));
        return std::nullopt;
    }
    for (const Value& group : *list->arrayValue()) {
        if (!group.string()) {
            setError(error, malformed("a group identifier is not a string"));
            return std::nullopt;
        }
        groups.push_back(*group.string());
    }
    return groups;
}

std::optional<std::filesystem::path> decodePathReply(const Value& reply, ContainerError* error) {
    if (!decodeReplyStatus(reply, error)) return std::nullopt;
    const Value* path = reply.find("ReplyPath");
    if (!path || !path->string()) {
        setError(error, malformed("it lacks a string \"ReplyPath\""));
        return std::nullopt;
    }
    return std::filesystem::path(*path->string());
}

std::optional<Value> decodeCodeSigningInfoReply(const Value& reply, ContainerError* error) {
    if (!decodeReplyStatus(reply, error)) return std::nullopt;
    const Value* info = reply.find("ReplyInfoDictionary");
    if (!info || !info->isDictionary()) {
        setError(error, malformed("it lacks a dictionary \"ReplyInfoDictionary\""));
        return std::nullopt;
    }
    return *info;
}

std::optional<Value> BerthGroups::exchange(const Value& request, ContainerError* error) {
    BerthError failure;
    std::optional<Value> reply = connection_.request(request, timeout_, &failure);
    if (!reply) {
        ContainerError transport;
        transport.text = failure.message;
        transport.transport = std::move(failure);
        setError(error, std::move(transport));
    }
    return reply;
}

std::optional<GroupContainerPaths> BerthGroups::groupContainerPaths(
    const std::optional<std::string>& identifier, uint64_t userId, ContainerError* error) {
    auto reply =
        exchange(makeGroupRequest(kBerthCommandGroupContainerPaths, identifier, userId), error);
    return reply ? decodeGroupPathsReply(*reply, error) : std::nullopt;
}

std::optional<std::vector<std::string>> BerthGroups::groupIdentifiers(
    const std::optional<std::string>& identifier, uint64_t userId, ContainerError* error) {
    auto reply =
        exchange(makeGroupRequest(kBerthCommandGroupIdentifiers, identifier, userId), error);
    return reply ? decodeGroupIdentifiersReply(*reply, error) : std::nullopt;
}

std::optional<std::filesystem::path> BerthGroups::systemContainerPath(
    const std::optional<std::string>& identifier, ContainerError* error) {
    auto reply = exchange(makeGroupRequest(kBerthCommandSystemContainerPath, identifier), error);
    return reply ? decodePathReply(*reply, error) : std::nullopt;
}

std::optional<GroupContainerPaths> BerthGroups::systemGroupContainerPaths(
    const std::optional<std::string>& identifier, ContainerError* error) {
    auto reply =
        exchange(makeGroupRequest(kBerthCommandSystemGroupContainerPaths, identifier), error);
    return reply ? decodeGroupPathsReply(*reply, error) : std::nullopt;
}

std::optional<std::filesystem::path> BerthGroups::systemGroupContainerPath(
    const std::optional<std::string>& identifier, const std::string& group, ContainerError* error) {
    auto reply = exchange(makeSystemGroupPathRequest(identifier, group), error);
    return reply ? decodePathReply(*reply, error) : std::nullopt;
}

bool BerthGroups::processCodeSigningInfo(const std::string& identifier,
                                         const std::optional<Value>& info,
                                         const CodeSigningOptions& options, ContainerError* error) {
    auto reply = exchange(makeProcessCodeSigningInfoRequest(identifier, info, options), error);
    return reply && decodeReplyStatus(*reply, error);
}

std::optional<Value> BerthGroups::codeSigningInfo(const std::string& identifier,
                                                  ContainerError* error) {
    auto reply = exchange(makeGroupRequest(kBerthCommandGetCodeSigningInfo, identifier), error);
    return reply ? decodeCodeSigningInfoReply(*reply, error) : std::nullopt;
}

bool BerthGroups::invalidateCodeSigningInfo(ContainerError* error) {
    auto reply =
        exchange(makeGroupRequest(kBerthCommandInvalidateCodeSigningInfo, std::nullopt), error);
    return reply && decodeReplyStatus(*reply, error);
}

}  // namespace berth
