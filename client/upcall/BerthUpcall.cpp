#include "BerthUpcall.h"

#include <sys/socket.h>
#include <sys/time.h>

#include <cerrno>
#include <memory>

#include "core/UpcallWire.h"
#include "packbuff/packbuff.h"
#include "platform/UpcallTransport.h"

namespace berth::upcall {

namespace {

struct PackbuffDeleter {
    void operator()(sb_packbuff* pb) const { sb_packbuff_free(pb); }
};
using Packbuff = std::unique_ptr<sb_packbuff, PackbuffDeleter>;

enum RequestItem : uint16_t {
    kSigningIdentifier = 0,
    kContainerIdentifier = 1,
    kPersona = 3,
    kGroup = 4,
    kContainerType = 5,
    kSystemContainer = 6,
    kSystemGroup = 7,
};

enum ReplyItem : uint16_t {
    kSuccess = 0,
    kDataContainer = 1,
    kTmp = 2,
    kGroupIdentifier = 3,
    kGroupPath = 4,
    kHome = 100,
    kSystemContainerPath = 101,
    kSystemGroupIdentifier = 102,
    kSystemGroupPath = 103,
};

void packString(sb_packbuff* pb, uint16_t type, const std::string& value) {
    if (!value.empty()) sb_packbuff_pack_string(pb, type, value.c_str(), value.size());
}

// The string of the item under the cursor, or nullopt (with `why`).
std::optional<std::string> unpackString(sb_packbuff* pb, uint16_t type, std::string* why) {
    int error = 0;
    size_t length = 0;
    const char* text = sb_packbuff_unpack_string(pb, &length, &error);
    if (!text) {
        *why = "reply item " + std::to_string(type) + " is not a string (error " +
               std::to_string(error) + ")";
        return std::nullopt;
    }
    return std::string(text, length);
}

// A key item followed by its path item of `pathType`.
bool unpackPair(sb_packbuff* pb, uint16_t keyType, uint16_t pathType,
                std::vector<std::pair<std::string, std::string>>* pairs, std::string* why) {
    std::optional<std::string> key = unpackString(pb, keyType, why);
    if (!key) return false;
    uint16_t next = 0;
    if (!sb_packbuff_get_item_value_type(pb, &next) || next != pathType) {
        *why = "reply item " + std::to_string(keyType) + " (" + *key + ") has no path after it";
        return false;
    }
    std::optional<std::string> path = unpackString(pb, pathType, why);
    if (!path) return false;
    pairs->emplace_back(std::move(*key), std::move(*path));
    return true;
}

bool unpackItem(sb_packbuff* pb, uint16_t type, Reply* reply, bool* sawSuccess, std::string* why) {
    std::optional<std::string>* single = nullptr;
    switch (type) {
        case kSuccess: {
            int error = 0;
            const uint32_t value = sb_packbuff_unpack_uint32(pb, &error);
            if (error) {
                *why = "the success item is not a number (error " + std::to_string(error) + ")";
                return false;
            }
            reply->success = value == 1;
            *sawSuccess = true;
            return true;
        }
        case kGroupIdentifier:
            return unpackPair(pb, kGroupIdentifier, kGroupPath, &reply->groups, why);
        case kSystemGroupIdentifier:
            return unpackPair(pb, kSystemGroupIdentifier, kSystemGroupPath, &reply->systemGroups,
                              why);
        case kHome:
            single = &reply->home;
            break;
        case kDataContainer:
            single = &reply->dataContainer;
            break;
        case kTmp:
            single = &reply->tmp;
            break;
        case kSystemContainerPath:
            single = &reply->systemContainer;
            break;
        default:
            *why = "unexpected reply item of value type " + std::to_string(type);
            return false;
    }
    *single = unpackString(pb, type, why);
    return single->has_value();
}

}  // namespace

std::vector<uint8_t> encodeRequest(const Request& request) {
    Packbuff pb(sb_packbuff_new(1024));
    if (!pb) return {};
    packString(pb.get(), kSigningIdentifier, request.signingIdentifier);
    packString(pb.get(), kContainerIdentifier, request.containerIdentifier);
    sb_packbuff_pack_uint32(pb.get(), kPersona, request.persona);
    sb_packbuff_pack_uint32(pb.get(), kContainerType, request.plugin ? 1 : 0);
    for (const std::string& group : request.groups) packString(pb.get(), kGroup, group);
    packString(pb.get(), kSystemContainer, request.systemContainer);
    for (const std::string& group : request.systemGroups) packString(pb.get(), kSystemGroup, group);
    const auto* bytes = static_cast<const uint8_t*>(sb_packbuff_get_bytes(pb.get()));
    if (!bytes) return {};
    return {bytes, bytes + sb_packbuff_get_size(pb.get())};
}

std::optional<Reply> decodeReply(std::vector<uint8_t> data, std::string* why) {
    Packbuff pb(
        sb_packbuff_init_with_buffer(data.data(), data.size(), true, SB_PACKBUFF_DEALLOC_NONE));
    if (!pb) {
        *why = "the reply is too short to be a pack buffer";
        return std::nullopt;
    }
    Reply reply;
    bool sawSuccess = false;
    uint16_t type = 0;
    while (sb_packbuff_get_item_value_type(pb.get(), &type)) {
        if (sawSuccess) {
            *why = "reply item " + std::to_string(type) + " after the success item";
            return std::nullopt;
        }
        if (!unpackItem(pb.get(), type, &reply, &sawSuccess, why)) return std::nullopt;
    }
    if (!sawSuccess) {
        *why = "the reply has no success item";
        return std::nullopt;
    }
    return reply;
}

std::optional<Answer> call(const Request& request, const std::string& socketPath,
                           CallFailure* failure, std::chrono::milliseconds timeout) {
    int error = 0;
    std::optional<BTHUpcallClient> client = socketPath.empty()
                                                ? BTHUpcallClient::connect(&error)
                                                : BTHUpcallClient::connect(socketPath, &error);
    if (!client) {
        *failure = {CallFailure::Stage::Connect, error, {}};
        return std::nullopt;
    }
    struct timeval limit {};
    limit.tv_sec = static_cast<time_t>(timeout.count() / 1000);
    limit.tv_usec = static_cast<suseconds_t>(timeout.count() % 1000 * 1000);
    ::setsockopt(client->socket(), SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
    const std::vector<uint8_t> data = encodeRequest(request);
    if (data.empty()) {
        *failure = {CallFailure::Stage::Exchange, ENOMEM, {}};
        return std::nullopt;
    }
    std::optional<BTHUpcallAnswer> raw = client->call(data, &error);
    if (!raw) {
        *failure = {CallFailure::Stage::Exchange, error == EAGAIN ? ETIMEDOUT : error, {}};
        return std::nullopt;
    }
    Answer answer;
    answer.returnCode = raw->returnCode;
    if (answer.returnCode != 0) return answer;
    std::string why;
    std::optional<Reply> reply = decodeReply(std::move(raw->replyData), &why);
    if (!reply) {
        *failure = {CallFailure::Stage::Decode, 0, why};
        return std::nullopt;
    }
    answer.reply = std::move(*reply);
    return answer;
}

std::string returnCodeText(int32_t code) {
    switch (code) {
        case kBTHUpcallTypeError:
            return "type error: the request's memory is missing or does not match its size";
        case kBTHUpcallBadMessageId:
            return "bad message id";
        case kBTHUpcallBadArguments:
            return "bad arguments: malformed request message";
        case kBTHUpcallTrailerError:
            return "trailer error";
        case kBTHUpcallUnknownItem:
            return "a request item of an unknown value type";
        case kBTHUpcallBadItemOrSender:
            return "a request item that cannot be read, or a sender that is not the kernel "
                   "(not root)";
        case kBTHUpcallOutOfMemory:
            return "the daemon ran out of memory";
        default:
            return "code " + std::to_string(code);
    }
}

}  // namespace berth::upcall
