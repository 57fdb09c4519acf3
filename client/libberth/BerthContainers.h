// Typed calls of berthd's container commands: create or look up a container,
// list a class, read and write info values, read metadata, recreate the
// default structure.
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
//
// Commands other than 0 take no default identifier: the daemon answers a
// request without one as it sees fit (usually BTHErrorNotFound). Absent
// fields are left out of the request. Every command but 0 needs the
// entitlement "sys.kelp.private.Berth.allowed".
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
    kBerthCommandSetInfoValue = 5,
    kBerthCommandGetInfoValue = 6,
    kBerthCommandMetadata = 7,
    kBerthCommandRecreateDefaultStructure = 8,
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

  private:
    // Sends `request`; nullopt with a transport error when no reply came.
    std::optional<Value> exchange(const Value& request, ContainerError* error);

    BerthConnection& connection_;
    std::chrono::milliseconds timeout_;
};

}  // namespace berth
