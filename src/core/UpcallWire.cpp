#include "core/UpcallWire.h"

namespace berth {

std::array<uint8_t, kBTHUpcallRequestSize> BTHUpcallMakeRequest(uint32_t remotePort,
                                                                uint32_t dataSize,
                                                                uint32_t messageId) {
    std::array<uint8_t, kBTHUpcallRequestSize> request{};
    uint8_t* m = request.data();
    BTHUpcallSetField(m, upcall::kBits, kBTHUpcallComplexBit | kBTHUpcallMakeSendOnce);
    BTHUpcallSetField(m, upcall::kSize, kBTHUpcallRequestSize);
    BTHUpcallSetField(m, upcall::kRemotePort, remotePort);
    BTHUpcallSetField(m, upcall::kId, messageId);
    BTHUpcallSetField(m, upcall::kDescriptorCount, 1);
    BTHUpcallSetField(m, upcall::kDataSize, dataSize);
    BTHUpcallSetField(
        m, upcall::kDescriptorFlags,
        BTHUpcallDescriptorFlags(false, kBTHUpcallVirtualCopy, kBTHUpcallOutOfLineMemoryType));
    std::memcpy(m + upcall::kDataRecord, kBTHUpcallNativeDataRecord.data(),
                kBTHUpcallNativeDataRecord.size());
    BTHUpcallSetField(m, upcall::kBodySize, dataSize);
    return request;
}

}  // namespace berth
