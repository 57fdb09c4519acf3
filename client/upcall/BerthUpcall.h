// The sender's side of the process-containers upcall for programs that play
// the kernel's part (berth-launch, "berthctl upcall"): a request built from
// plain fields, and the daemon's answer read back into plain fields.
#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace berth::upcall {

// What a starting process asks for. Empty strings are left out of the
// request.
struct Request {
    std::string signingIdentifier;          // item 0
    std::string containerIdentifier;        // item 1: the data container's, when it differs
    uint32_t persona = 0;                   // item 3: whose containers
    bool plugin = false;                    // item 5: container type 1 instead of 0
    std::vector<std::string> groups;        // item 4, one each
    std::string systemContainer;            // item 6
    std::vector<std::string> systemGroups;  // item 7, one each
};

// The request pack buffer.
std::vector<uint8_t> encodeRequest(const Request& request);

// A reply pack buffer, item by item, in the order the daemon wrote it.
struct Reply {
    std::optional<std::string> home;                                // item 100
    std::optional<std::string> dataContainer;                       // item 1
    std::optional<std::string> tmp;                                 // item 2
    std::vector<std::pair<std::string, std::string>> groups;        // pairs 3/4
    std::optional<std::string> systemContainer;                     // item 101
    std::vector<std::pair<std::string, std::string>> systemGroups;  // pairs 102/103
    bool success = false;                                           // item 0
};

// Reads a reply pack buffer. Nullopt, with the reason in `why`, when it is
// not one: an unknown value type, an item of the wrong kind, a pair without
// its path, or no success item at the end.
std::optional<Reply> decodeReply(std::vector<uint8_t> data, std::string* why);

// What the daemon answered: a reply, or an error reply's return code.
struct Answer {
    int32_t returnCode = 0;
    Reply reply;  // when returnCode is 0
};

// Where the call failed before an answer came.
struct CallFailure {
    enum class Stage { Connect, Exchange, Decode } stage = Stage::Connect;
    int error = 0;       // errno of Connect and Exchange
    std::string detail;  // the reason of Decode
};

// Connects to the daemon's upcall socket (default: in the device root's
// runtime directory), sends the request and reads the answer. No answer
// within `timeout` fails the exchange with ETIMEDOUT.
std::optional<Answer> call(const Request& request, const std::string& socketPath,
                           CallFailure* failure,
                           std::chrono::milliseconds timeout = std::chrono::seconds(30));

// The text of a return code ("bad arguments", "not the kernel", ...).
std::string returnCodeText(int32_t code);

}  // namespace berth::upcall
