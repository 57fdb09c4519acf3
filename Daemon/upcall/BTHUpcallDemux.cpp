#include "BTHUpcallDemux.h"

#include <cstring>

#include "BTHLog.h"
#include "BTHProcessContainers.h"

namespace berth {

namespace {

uint32_t get(const BTHUpcallRequestMessage& request, size_t offset) {
    return BTHUpcallField(request.bytes.data(), offset);
}

void set(BTHUpcallReplyMessage& reply, size_t offset, uint32_t value) {
    BTHUpcallSetField(reply.bytes.data(), offset, value);
}

// The error reply's body after a header already filled in.
void makeErrorReply(BTHUpcallReplyMessage& reply, int32_t code) {
    set(reply, upcall::kSize, kBTHUpcallErrorReplySize);
    std::memcpy(reply.bytes.data() + upcall::kErrorDataRecord, kBTHUpcallNativeDataRecord.data(),
                kBTHUpcallNativeDataRecord.size());
    set(reply, upcall::kErrorReturnCode, static_cast<uint32_t>(code));
    reply.size = kBTHUpcallErrorReplySize;
    reply.data.reset();
}

void makeSuccessReply(BTHUpcallReplyMessage& reply, UniqueFd data, uint32_t size) {
    set(reply, upcall::kBits,
        BTHUpcallField(reply.bytes.data(), upcall::kBits) | kBTHUpcallComplexBit);
    set(reply, upcall::kSize, kBTHUpcallSuccessReplySize);
    set(reply, upcall::kDescriptorCount, 1);
    set(reply, upcall::kDataAddress, 0);
    set(reply, upcall::kDataSize, size);
    set(reply, upcall::kDescriptorFlags,
        BTHUpcallDescriptorFlags(true, kBTHUpcallVirtualCopy, kBTHUpcallOutOfLineMemoryType));
    std::memcpy(reply.bytes.data() + upcall::kDataRecord, kBTHUpcallNativeDataRecord.data(),
                kBTHUpcallNativeDataRecord.size());
    set(reply, upcall::kBodySize, size);
    reply.size = kBTHUpcallSuccessReplySize;
    reply.data = std::move(data);
}

// The first check of a process-containers request that fails, as its
// return code; 0 when the message is well formed.
int32_t checkRequest(const BTHUpcallRequestMessage& request) {
    if (!(get(request, upcall::kBits) & kBTHUpcallComplexBit) ||
        get(request, upcall::kDescriptorCount) != 1 ||
        get(request, upcall::kSize) != kBTHUpcallRequestSize)
        return kBTHUpcallBadArguments;
    if (BTHUpcallDescriptorType(get(request, upcall::kDescriptorFlags)) !=
            kBTHUpcallOutOfLineMemoryType ||
        get(request, upcall::kBodySize) != get(request, upcall::kDataSize))
        return kBTHUpcallTypeError;
    if (get(request, upcall::kTrailerType) != 0 || get(request, upcall::kTrailerSize) < 32)
        return kBTHUpcallTrailerError;
    // The memory the descriptor announces must have come with the message.
    if (!request.data) return kBTHUpcallTypeError;
    return 0;
}

}  // namespace

bool demux_server(BTHUpcallRequestMessage& request, BTHUpcallReplyMessage& reply) {
    BTH_FUNCTION("demux_server");
    const uint32_t id = get(request, upcall::kId);
    BTHLogDebug("in demux_server(); request->msgh_id: %d", static_cast<int32_t>(id));
    if (id != kBTHUpcallRequestId && id != kBTHUpcallRequestId + 1) return false;

    BTHLogDebug("handling incomming request for berth server");
    reply.bytes.fill(0);
    set(reply, upcall::kBits, get(request, upcall::kBits) & kBTHUpcallReplyPortDispositionMask);
    set(reply, upcall::kRemotePort, get(request, upcall::kRemotePort));
    set(reply, upcall::kId, id + kBTHUpcallReplyIdOffset);
    if (id != kBTHUpcallRequestId) {
        makeErrorReply(reply, kBTHUpcallBadMessageId);
        BTHLogDebug("berth server returns: %d", 0);
        return false;
    }

    if (const int32_t malformed = checkRequest(request)) {
        makeErrorReply(reply, malformed);
    } else {
        int32_t code = kBTHUpcallBadItemOrSender;
        UniqueFd replyData;
        uint32_t replySize = 0;
        if (get(request, upcall::kAuditTokenProcessId) == 0)
            code = server_get_process_containers(request.data->data(),
                                                 static_cast<uint32_t>(request.data->size()),
                                                 &replyData, &replySize);
        // The request's memory is given back whatever the routine answered.
        request.data.reset();
        BTHUpcallSetField(request.bytes.data(), upcall::kDataAddress, 0);
        BTHUpcallSetField(request.bytes.data(), upcall::kDataSize, 0);
        if (code != 0)
            makeErrorReply(reply, code);
        else
            makeSuccessReply(reply, std::move(replyData), replySize);
    }
    BTHLogDebug("berth server returns: %d", 1);
    return true;
}

}  // namespace berth
