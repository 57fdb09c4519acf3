// Typed calls of berthd's group, system container and code-signing
// commands.
//
//   berth::BerthGroups groups(*connection);
//   berth::ContainerError failure;
//   auto paths = groups.groupContainerPaths(std::nullopt, berth::kBerthCallerUserId, &failure);
//   if (!paths) fail(failure.describe());
//   for (const auto& [group, path] : *paths) use(group, path);
//
//   command  call                        needs          answers
//   13       groupContainerPaths         (open)         group -> path of the identifier's
//                                                       application groups, made on demand
//   14       groupIdentifiers            ".allowed"     the identifier's application groups
//   15       systemContainerPath         (open)         its system container (user 499):
//                                                       the caller's own when entitled to
//                                                       one, a well-known one for anybody
//   16       systemGroupContainerPaths   (open)         group -> path of its system groups
//   17       systemGroupContainerPath    (open)         one system group's path, when
//                                                       entitled or well known (else 55)
//   18       processCodeSigningInfo      ".allowed"     records an identifier's code-signing
//                                                       information (none removes it)
//   19       codeSigningInfo             ".allowed"     the recorded information (21 when
//                                                       none, placeholder or invalid)
//   20       invalidateCodeSigningInfo   ".allowed"     invalidates the information of
//                                                       identifiers without bundle container
//
// An absent identifier means the caller's own (13 to 17); 18 and 19 need
// one. Failures are ContainerErrors, as for the container commands.
#pragma once

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "core/Value.h"
#include "libberth/BerthConnection.h"
#include "libberth/BerthContainers.h"

namespace berth {

enum BerthGroupCommand : uint64_t {
    kBerthCommandGroupContainerPaths = 13,
    kBerthCommandGroupIdentifiers = 14,
    kBerthCommandSystemContainerPath = 15,
    kBerthCommandSystemGroupContainerPaths = 16,
    kBerthCommandSystemGroupContainerPath = 17,
    kBerthCommandProcessCodeSigningInfo = 18,
    kBerthCommandGetCodeSigningInfo = 19,
    kBerthCommandInvalidateCodeSigningInfo = 20,
};

// Options of command 18 (every one optional).
struct CodeSigningOptions {
    std::optional<uint64_t> dataContainerClass;   // the identifier's data container class
    std::optional<std::string> parentIdentifier;  // it is a child (a plug-in) of this one
    bool placeholder = false;                     // placeholder entitlements
    // The options dictionary as sent; none when nothing is set.
    std::optional<Value> dictionary() const;
};

using GroupContainerPaths = std::map<std::string, std::filesystem::path>;

// Request builders (the exact dictionaries sent) and reply decoders.
Value makeGroupRequest(uint64_t command, const std::optional<std::string>& identifier,
                       std::optional<uint64_t> userId = std::nullopt);
Value makeSystemGroupPathRequest(const std::optional<std::string>& identifier,
                                 const std::string& group);
Value makeProcessCodeSigningInfoRequest(const std::string& identifier,
                                        const std::optional<Value>& info,
                                        const CodeSigningOptions& options);
// A successful reply without the dictionary is an empty one.
std::optional<GroupContainerPaths> decodeGroupPathsReply(const Value& reply, ContainerError* error);
std::optional<std::vector<std::string>> decodeGroupIdentifiersReply(const Value& reply,
                                                                    ContainerError* error);
std::optional<std::filesystem::path> decodePathReply(const Value& reply, ContainerError* error);
std::optional<Value> decodeCodeSigningInfoReply(const Value& reply, ContainerError* error);

class BerthGroups {
  public:
    explicit BerthGroups(BerthConnection& connection,
                         std::chrono::milliseconds timeout = std::chrono::seconds(30))
        : connection_(connection), timeout_(timeout) {}

    std::optional<GroupContainerPaths> groupContainerPaths(
        const std::optional<std::string>& identifier, uint64_t userId,
        ContainerError* error = nullptr);
    std::optional<std::vector<std::string>> groupIdentifiers(
        const std::optional<std::string>& identifier, uint64_t userId,
        ContainerError* error = nullptr);
    std::optional<std::filesystem::path> systemContainerPath(
        const std::optional<std::string>& identifier, ContainerError* error = nullptr);
    std::optional<GroupContainerPaths> systemGroupContainerPaths(
        const std::optional<std::string>& identifier, ContainerError* error = nullptr);
    std::optional<std::filesystem::path> systemGroupContainerPath(
        const std::optional<std::string>& identifier, const std::string& group,
        ContainerError* error = nullptr);
    bool processCodeSigningInfo(const std::string& identifier, const std::optional<Value>& info,
                                const CodeSigningOptions& options = {},
                                ContainerError* error = nullptr);
    std::optional<Value> codeSigningInfo(const std::string& identifier,
                                         ContainerError* error = nullptr);
    bool invalidateCodeSigningInfo(ContainerError* error = nullptr);

  private:
    std::optional<Value> exchange(const Value& request, ContainerError* error);

    BerthConnection& connection_;
    std::chrono::milliseconds timeout_;
};

}  // namespace berth
