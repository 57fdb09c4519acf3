// RelayCodec: the bytes of the relay, the message service between berthd and
// its clients. Shared by the daemon, libberth and berthctl.
//
// A connection is a stream of frames. Each frame is a 16-byte header followed
// by a body that encodes exactly one Value:
//
//   offset  size  field
//        0     2  magic 'B' 'R' (0x42 0x52)
//        2     1  version, kRelayVersion
//        3     1  kind: 1 request, 2 reply, 3 one-way message
//        4     8  message id, little-endian; a reply carries its request's id
//       12     4  body length in bytes, little-endian, at most kMaxBodySize
//
// Body encoding (all multi-byte numbers little-endian, no padding): one tag
// byte, then the payload of that tag.
//
//   0x00 null        -
//   0x01 false       -
//   0x02 true        -
//   0x03 int64       8 bytes, two's complement
//   0x04 uint64      8 bytes
//   0x05 double      8 bytes, IEEE-754 binary64 bits (NaN payloads kept)
//   0x06 string      u32 byte length, then that many bytes of valid UTF-8
//   0x07 data        u32 byte length, then the bytes
//   0x08 date        8 bytes, binary64 seconds since 1970-01-01 00:00:00 UTC
//   0x09 uuid        16 bytes in the order of the canonical text form
//   0x0A array       u32 element count, then the elements
//   0x0B dictionary  u32 entry count, then per entry: key as u32 byte length
//                    plus UTF-8 bytes (no tag), then the value; keys strictly
//                    ascending by unsigned bytewise comparison
//
// Every Value has exactly one encoding, so a decoded frame re-encodes to the
// bytes it came from. Kinds survive the trip: an int64 5 arrives as an int64,
// a uint64 5 as a uint64.
//
// A peer is untrusted. Decoding checks every declared length against both the
// limits below and the bytes actually present before it allocates, runs in
// time linear in the input, and turns every violation into a CodecError. A
// decode error leaves the stream at an unknown position: the only recovery is
// to drop the connection.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string_view>
#include <vector>

#include "core/Value.h"

namespace berth::relay {

inline constexpr uint8_t kRelayMagic0 = 0x42;  // 'B'
inline constexpr uint8_t kRelayMagic1 = 0x52;  // 'R'
inline constexpr uint8_t kRelayVersion = 1;
inline constexpr size_t kHeaderSize = 16;

// Largest body of one frame.
inline constexpr uint32_t kMaxBodySize = 4 * 1024 * 1024;
// Deepest nesting of arrays and dictionaries: a scalar body has depth 0, a
// dictionary of scalars depth 1.
inline constexpr int kMaxDepth = 64;
// Most values in one body, counting the top-level value, every array element
// and every dictionary entry's value. Bounds the memory one frame can cost.
inline constexpr size_t kMaxValueCount = 131072;

enum class FrameKind : uint8_t {
    Request = 1,  // awaits a reply with the same message id
    Reply = 2,    // answers the request with the same message id
    Message = 3,  // one-way: no reply is expected or possible
};

struct Frame {
    FrameKind kind = FrameKind::Request;
    uint64_t messageId = 0;
    Value body;
};

enum class CodecError : uint8_t {
    None,
    BadMagic,        // the stream is not a relay stream
    BadVersion,      // a version this side does not speak
    BadKind,         // a frame kind outside FrameKind
    BodyTooLarge,    // declared or encoded body above kMaxBodySize
    Truncated,       // a length or count runs past the end of the body
    TrailingBytes,   // the body holds more than one value
    UnknownTag,      // a tag byte outside the table
    InvalidUtf8,     // a string or key that is not valid UTF-8
    TooDeep,         // nesting above kMaxDepth
    TooManyValues,   // more than kMaxValueCount values
    KeysOutOfOrder,  // dictionary keys not strictly ascending (includes duplicates)
};

// A short English text for logs, e.g. "body too large".
const char* describe(CodecError error);

// True when `text` is well-formed UTF-8: no overlong forms, no surrogates,
// nothing above U+10FFFF, no truncated sequence. NUL bytes are allowed.
bool isValidUtf8(std::string_view text);

// Appends the body encoding of `value` to `out`. Fails, leaving `out` as it
// was, when the value could not be decoded by a peer: a string or key that is
// not UTF-8, nesting above kMaxDepth, more than kMaxValueCount values, or an
// encoding above kMaxBodySize.
bool encodeValue(const Value& value, std::vector<uint8_t>& out, CodecError* error = nullptr);

// Decodes one body that must consist of exactly one value.
bool decodeValue(std::span<const uint8_t> body, Value& value, CodecError* error = nullptr);

// Appends header and body of `frame` to `out`; same failures as encodeValue.
bool encodeFrame(const Frame& frame, std::vector<uint8_t>& out, CodecError* error = nullptr);
// The same for a frame given by its parts, so that a body need not be
// copied into a Frame.
bool encodeFrame(FrameKind kind, uint64_t messageId, const Value& body, std::vector<uint8_t>& out,
                 CodecError* error = nullptr);

// Turns the bytes of a stream, in whatever pieces they arrive, into frames.
//
//   decoder.feed(bytesJustRead);
//   Frame frame;
//   while (decoder.next(frame) == FrameDecoder::Status::Frame) handle(frame);
//   if (decoder.failed()) dropConnection();
//
// Memory stays bounded as long as the caller drains next() after each feed():
// the decoder then holds at most one partial frame plus one read's worth of
// bytes. A header is checked as soon as its 16 bytes are present, so a frame
// that declares an oversized body fails before its body is waited for.
class FrameDecoder {
  public:
    enum class Status {
        Frame,     // `frame` holds the next frame
        NeedMore,  // no complete frame is buffered yet
        Error,     // the stream is broken; see error()
    };

    // Adds bytes received from the stream. Ignored once the decoder failed.
    void feed(std::span<const uint8_t> bytes);

    // Takes the next complete frame. Once it returns Error it always will.
    Status next(Frame& frame);

    bool failed() const { return error_ != CodecError::None; }
    CodecError error() const { return error_; }

    // Bytes received but not yet returned as frames.
    size_t buffered() const { return buffer_.size() - start_; }

  private:
    Status fail(CodecError error);

    std::vector<uint8_t> buffer_;
    size_t start_ = 0;  // first byte of buffer_ not yet consumed
    CodecError error_ = CodecError::None;
};

}  // namespace berth::relay
