// The upcall's messages as they travel on the upcall socket: what the daemon
// and the launchers that play the kernel's part both need to build and read
// them. All fields are 32-bit, in host byte order.
//
// A request is 52 bytes: the header (bits with the complex bit set, size 52,
// the port to reply to, local port, voucher, message id 322514900), one
// out-of-line memory descriptor (count 1, address, size, flags with type 1 in
// byte 3), the native data representation record and the request size. The
// request pack buffer rides along as a sealed memory file descriptor; the
// descriptor's address field means nothing on this platform and is sent as 0.
//
// The receiver appends the trailer itself from the sender's credentials (the
// kernel vouches for them): type 0, size 52, and the audit token, whose
// process id is 0 when the sender runs as root (the launcher plays the
// kernel) and the real process id otherwise.
//
// A success reply is 52 bytes laid out like the request, id + 100, with the
// reply pack buffer as a sealed memory file descriptor; an error reply is 36
// bytes: the header with size 36 and no complex bit, the native data
// representation record at 24 and the signed return code at 32.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <cstring>

namespace berth {

inline constexpr uint32_t kBTHUpcallRequestId = 322514900;
inline constexpr uint32_t kBTHUpcallReplyIdOffset = 100;
inline constexpr size_t kBTHUpcallRequestSize = 52;
inline constexpr size_t kBTHUpcallSuccessReplySize = 52;
inline constexpr size_t kBTHUpcallErrorReplySize = 36;
inline constexpr size_t kBTHUpcallTrailerSize = 52;
inline constexpr size_t kBTHUpcallReceivedSize = kBTHUpcallRequestSize + kBTHUpcallTrailerSize;

inline constexpr uint32_t kBTHUpcallComplexBit = 0x80000000u;
inline constexpr uint32_t kBTHUpcallReplyPortDispositionMask = 0x1f;
// The disposition a sender names for the reply port ("make send-once").
inline constexpr uint32_t kBTHUpcallMakeSendOnce = 0x12;
inline constexpr uint8_t kBTHUpcallOutOfLineMemoryType = 1;
inline constexpr uint8_t kBTHUpcallVirtualCopy = 1;

// Return codes of an error reply.
inline constexpr int32_t kBTHUpcallTypeError = -300;
inline constexpr int32_t kBTHUpcallBadMessageId = -303;
inline constexpr int32_t kBTHUpcallBadArguments = -304;
inline constexpr int32_t kBTHUpcallTrailerError = -309;
inline constexpr int32_t kBTHUpcallUnknownItem = 4;
inline constexpr int32_t kBTHUpcallBadItemOrSender = 5;
inline constexpr int32_t kBTHUpcallOutOfMemory = 9;

// Field offsets.
namespace upcall {
inline constexpr size_t kBits = 0;
inline constexpr size_t kSize = 4;
inline constexpr size_t kRemotePort = 8;
inline constexpr size_t kLocalPort = 12;
inline constexpr size_t kVoucher = 16;
inline constexpr size_t kId = 20;
inline constexpr size_t kDescriptorCount = 24;
inline constexpr size_t kDataAddress = 28;
inline constexpr size_t kDataSize = 32;
inline constexpr size_t kDescriptorFlags = 36;
inline constexpr size_t kDataRecord = 40;
inline constexpr size_t kBodySize = 48;
inline constexpr size_t kErrorDataRecord = 24;
inline constexpr size_t kErrorReturnCode = 32;
inline constexpr size_t kTrailerType = 52;
inline constexpr size_t kTrailerSize = 56;
inline constexpr size_t kAuditToken = 72;
// The audit token is eight fields; the process id is the sixth.
inline constexpr size_t kAuditTokenProcessId = kAuditToken + 5 * 4;
inline constexpr size_t kAuditTokenEffectiveUser = kAuditToken + 1 * 4;
}  // namespace upcall

// Native data representation: integers little-endian, the rest zero.
inline constexpr std::array<uint8_t, 8> kBTHUpcallNativeDataRecord = {0, 0, 0, 0, 1, 0, 0, 0};

inline uint32_t BTHUpcallField(const uint8_t* message, size_t offset) {
    uint32_t value;
    std::memcpy(&value, message + offset, sizeof value);
    return value;
}

inline void BTHUpcallSetField(uint8_t* message, size_t offset, uint32_t value) {
    std::memcpy(message + offset, &value, sizeof value);
}

// Descriptor flags: deallocate in byte 0, copy option in byte 1, type in
// byte 3.
inline constexpr uint32_t BTHUpcallDescriptorFlags(bool deallocate, uint8_t copyOption,
                                                   uint8_t type) {
    return (deallocate ? 1u : 0u) | (uint32_t{copyOption} << 8) | (uint32_t{type} << 24);
}

inline constexpr uint8_t BTHUpcallDescriptorType(uint32_t flags) {
    return static_cast<uint8_t>(flags >> 24);
}

// A request for `dataSize` bytes of pack buffer, answered on `remotePort`
// (any number the sender likes; the reply carries it back).
std::array<uint8_t, kBTHUpcallRequestSize> BTHUpcallMakeRequest(
    uint32_t remotePort, uint32_t dataSize, uint32_t messageId = kBTHUpcallRequestId);

}  // namespace berth
