// Typed calls of berthd's container commands: create or look up a container,
// list a class, read and write info values, read metadata, recreate the
// default structure, and the commands that replace and remove containers.
//
//   berth::BerthError error;
//   auto connection = berth::BerthConnection::connect(&error);
//   if (!connection) fail(error.message);
//   berth::BerthContainers containers(*connection);
//   berth::ContainerSelector data;
//   data.containerClass = 2;                    // Data/Application
//   data.identifier = "com.example.notes";
//   berth::ContainerError failure;
//   auto found = containers.createOrLookup(data, /*createIfNecessary=*/true, &failure);
//   if (!found) fail(failure.describe());       // "BTHErrorNotFound (21): no such container"
//   use(found->path, found->uuid);
//
// Every call is one request and one reply. The request builders and reply
// decoders are public too, for programs that send requests their own way.
//
// A container is addressed by class, user, identifier and internal UUID;
// each command reads only the fields it needs:
//
//   command  call                      reads
//   0        createOrLookup            class, user, identifier (absent: the
//                                      caller's own), transient
//   1        list                      class, user, transient
//   5        setInfoValue              class, user, identifier, UUID
//   6        infoValue                 class, user, identifier, UUID
//   7        metadata                  class, user, identifier, UUID
//   8, 22    recreateDefaultStructure  class, user, identifier, UUID
//   2        replace                   both containers: class, user,
//                                      identifier, UUID
//   3        stageForDelete            each container: class, user,
//                                      identifier, UUID
//   4        emptyDeathRow             nothing
//   9        regenerateDirectoryUUID   class, user, identifier, UUID
//   10       deleteContainer           class, user, identifier, transient
//   11       wipePluginData            user, identifier (the class is 4)
//   12       wipeData                  class, user, identifier
//
// Commands other than 0 take no default identifier: the daemon answers a
// request without one as it sees fit (usually BTHErrorNotFound). Absent
// fields are left out of the request. Every command but 0 needs the
// entitlement "sys.kelp.private.Berth.allowed".
//
// Removal is two-step: staging (3), deleting (10) and replacing (2) move a
// container's directory to death row; emptying death row (4) destroys what
// is there and replies only when it has finished. A wipe (11, 12) gives a
// container fresh contents under its old UUID and path and starts emptying
// death row by itself.
#pragma once

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "core/Uuid.h"
#include "core/Value.h"
#include "libberth/BerthConnection.h"

namespace berth {

// "UserID" 1 stands for the calling process's own user.
inline constexpr uint64_t kBerthCallerUserId = 1;

// The container command numbers ("Command").
enum BerthContainerCommand : uint64_t {
    kBerthCommandCreateOrLookup = 0,
    kBerthCommandList = 1,
    kBerthCommandReplace = 2,
    kBerthCommandStageForDelete = 3,
    kBerthCommandEmptyDeathRow = 4,
    kBerthCommandSetInfoValue = 5,
    kBerthCommandGetInfoValue = 6,
    kBerthCommandMetadata = 7,
    kBerthCommandRecreateDefaultStructure = 8,
    kBerthCommandRegenerateDirectoryUUID = 9,
    kBerthCommandDelete = 10,
    kBerthCommandWipePluginData = 11,
    kBerthCommandWipeData = 12,
    // The same command under a second number; the daemon serves both alike.
    kBerthCommandRecreateDefaultStructureAlias = 22,
};

// Which container (or, for listing, which class of which user) a request
// is about.
struct ContainerSelector {
    uint64_t containerClass = 0;  // 1..13; see the daemon's class table
    uint64_t userId = kBerthCallerUserId;
    std::optional<std::string> identifier;
    std::optional<Uuid> uuid;  // the container's internal UUID
    bool transient = false;
};

// Why a call failed: the daemon refused or failed (code is its "ReplyError"),
// or it could not be asked or sent something that is not a reply of its
// own (code 0, transport says why; ProtocolError for a malformed reply).
struct ContainerError {
    uint64_t code = 0;
    std::string name;  // "BTHErrorNotFound"; empty for numbers the table lacks
    std::string text;  // a readable sentence, or the transport error's message
    BerthError transport;

    bool isReplyError() const { return code != 0; }
    // "BTHErrorNotFound (21): no such container", "code 70: ..." or, for a
    // transport failure, its message.
    std::string describe() const;
};

// A short readable text for a "ReplyError" code, e.g. "no such container"
// for 21; a generic sentence for numbers the table does not use.
std::string_view describeReplyError(uint64_t code);

// What command 0 answers.
struct ContainerLocation {
    std::filesystem::path path;
    Uuid uuid;
    bool existed = false;  // found rather than made by this request
    std::string identifier;
};

// One container of a listing.
struct ContainerListEntry {
    std::string identifier;
    Uuid uuid;
    friend bool operator==(const ContainerListEntry&, const ContainerListEntry&) = default;
};

// What command 7 answers.
struct ContainerMetadata {
    std::filesystem::path path;
    bool transient = false;
    // The info dictionary, when asked for and the container has one.
    std::optional<Value> info;
};

// Request builders: the exact dictionaries sent. Numbers are uint64, UUIDs
// UUID values, flags bools.
Value makeCreateOrLookupRequest(const ContainerSelector& selector, bool createIfNecessary);
Value makeListRequest(const ContainerSelector& selector);
// A null `value` removes the key: "Value" is left out.
Value makeSetInfoValueRequest(const ContainerSelector& selector, std::string_view key,
                              const std::optional<Value>& value);
Value makeGetInfoValueRequest(const ContainerSelector& selector, std::string_view key);
Value makeMetadataRequest(const ContainerSelector& selector, bool infoRequested);
// `command` is 8 or 22.
Value makeRecreateDefaultStructureRequest(const ContainerSelector& selector,
                                          uint64_t command = kBerthCommandRecreateDefaultStructure);
// Without `old` the "Old…" keys are left out and the daemon moves
// `replacement` (usually a transient container) to a permanent place. The
// daemon takes the old container as absent when its UUID is.
Value makeReplaceRequest(const std::optional<ContainerSelector>& old,
                         const ContainerSelector& replacement);
// Four index-aligned arrays; an absent identifier or UUID is sent as null so
// the entries after it stay aligned (the daemon skips that entry).
Value makeStageForDeleteRequest(const std::vector<ContainerSelector>& containers);
Value makeEmptyDeathRowRequest();
Value makeRegenerateDirectoryUUIDRequest(const ContainerSelector& selector);
Value makeDeleteRequest(const ContainerSelector& selector);
// No "ContainerClass": the command always means class 4.
Value makeWipePluginDataRequest(const ContainerSelector& selector);
Value makeWipeDataRequest(const ContainerSelector& selector);

// Reply decoders. Each checks "ReplyError" first: anything but 1 is a reply
// error; a missing or non-numeric code, or a success that lacks a key the
// command must answer with, is a ProtocolError. A listing without its arrays
// is empty (the daemon leaves them out when there is nothing to list).
bool decodeReplyStatus(const Value& reply, ContainerError* error);
std::optional<ContainerLocation> decodeCreateOrLookupReply(const Value& reply,
                                                           ContainerError* error);
std::optional<std::vector<ContainerListEntry>> decodeListReply(const Value& reply,
                                                               ContainerError* error);
std::optional<Value> decodeGetInfoValueReply(const Value& reply, ContainerError* error);
std::optional<ContainerMetadata> decodeMetadataReply(const Value& reply, ContainerError* error);

// The container commands over one connection. Not thread-safe by itself
// beyond what the connection is: share the connection, not this object, or
// give each thread its own.
class BerthContainers {
  public:
    explicit BerthContainers(BerthConnection& connection,
                             std::chrono::milliseconds timeout = std::chrono::seconds(30))
        : connection_(connection), timeout_(timeout) {}

    // Command 0. Finds the container, or makes it when `createIfNecessary`.
    std::optional<ContainerLocation> createOrLookup(const ContainerSelector& selector,
                                                    bool createIfNecessary,
                                                    ContainerError* error = nullptr);

    // Command 1: every container of the class and user, in the daemon's order.
    std::optional<std::vector<ContainerListEntry>> list(const ContainerSelector& selector,
                                                        ContainerError* error = nullptr);

    // Command 5. A null `value` removes the key.
    bool setInfoValue(const ContainerSelector& selector, std::string_view key,
                      const std::optional<Value>& value, ContainerError* error = nullptr);

    // Command 6. A key the container does not hold fails with
    // BTHErrorInfoValueNotFound (24).
    std::optional<Value> infoValue(const ContainerSelector& selector, std::string_view key,
                                   ContainerError* error = nullptr);

    // Command 7.
    std::optional<ContainerMetadata> metadata(const ContainerSelector& selector, bool infoRequested,
                                              ContainerError* error = nullptr);

    // Command 8 (or its twin 22): makes the container's missing standard
    // subdirectories again, leaving existing ones alone.
    bool recreateDefaultStructure(const ContainerSelector& selector,
                                  ContainerError* error = nullptr,
                                  uint64_t command = kBerthCommandRecreateDefaultStructure);

    // Command 2: puts `replacement` in the place of `old` (same class and
    // user), whose contents go to death row; without `old`, moves
    // `replacement` from its transient place to a permanent one. Both need
    // their UUIDs: an old container without one is refused here
    // (InvalidRequest), since the daemon would read it as no old container.
    bool replace(const std::optional<ContainerSelector>& old, const ContainerSelector& replacement,
                 ContainerError* error = nullptr);

    // Command 3: moves each container to death row. The daemon silently
    // skips containers it does not know; an entry without identifier or
    // UUID is refused here (InvalidRequest) instead, and nothing is sent.
    bool stageForDelete(const std::vector<ContainerSelector>& containers,
                        ContainerError* error = nullptr);

    // Command 4: destroys everything on death row. The reply comes when it
    // is done, so give this object a timeout long enough for that.
    bool emptyDeathRow(ContainerError* error = nullptr);

    // Command 9: renames the container's directory to a fresh UUID; its
    // internal UUID and contents stay.
    bool regenerateDirectoryUUID(const ContainerSelector& selector,
                                 ContainerError* error = nullptr);

    // Command 10: finds the container by identifier (and transient flag) and
    // moves it to death row.
    bool deleteContainer(const ContainerSelector& selector, ContainerError* error = nullptr);

    // Command 11: wipes a class 4 container, only of an identifier the
    // caller's "sys.kelp.private.Berth.wipeContainer" entitlement lists.
    bool wipePluginData(const ContainerSelector& selector, ContainerError* error = nullptr);

    // Command 12: wipes a data container (classes 2, 4, 6, 7, 9, 10, 11) of
    // any identifier.
    bool wipeData(const ContainerSelector& selector, ContainerError* error = nullptr);

  private:
    // Sends `request`; nullopt with a transport error when no reply came.
    std::optional<Value> exchange(const Value& request, ContainerError* error);
    // Sends `request` and reads the reply's code alone.
    bool call(const Value& request, ContainerError* error);

    BerthConnection& connection_;
    std::chrono::milliseconds timeout_;
};

}  // namespace berth
