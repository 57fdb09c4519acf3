// Feeds arbitrary bytes to the relay codec as a hostile peer would send them.
//
// Input: up to 8 bytes seed the sizes of the reads, the rest is the stream.
// Checked on every input:
//  - the incremental decoder yields the same frames and the same error
//    whether the stream arrives in random-sized pieces or in one;
//  - every frame it yields re-encodes to exactly the bytes it came from;
//  - the whole stream read as one body either fails or re-encodes to itself;
//  - nothing crashes, and with -malloc_limit_mb nothing allocates beyond it.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <span>
#include <vector>

#include "core/RelayCodec.h"

using namespace berth;
using namespace berth::relay;

namespace {

void check(bool condition) {
    if (!condition) __builtin_trap();
}

uint64_t nextRandom(uint64_t& state) {
    state ^= state << 13;
    state ^= state >> 7;
    state ^= state << 17;
    return state;
}

struct Outcome {
    size_t frames = 0;
    CodecError error = CodecError::None;
};

// Drains `decoder`; each frame must re-encode to the stream's bytes at `pos`.
void drain(FrameDecoder& decoder, std::span<const uint8_t> stream, size_t& pos, Outcome& outcome) {
    Frame frame;
    FrameDecoder::Status status;
    while ((status = decoder.next(frame)) == FrameDecoder::Status::Frame) {
        check(stream.size() - pos >= kHeaderSize);
        const uint8_t* length = stream.data() + pos + 12;
        uint32_t bodySize =
            length[0] | length[1] << 8 | length[2] << 16 | uint32_t{length[3]} << 24;
        size_t frameSize = kHeaderSize + bodySize;
        check(stream.size() - pos >= frameSize);
        std::vector<uint8_t> again;
        check(encodeFrame(frame, again));
        check(again.size() == frameSize &&
              std::memcmp(again.data(), stream.data() + pos, frameSize) == 0);
        pos += frameSize;
        ++outcome.frames;
    }
    if (status == FrameDecoder::Status::Error) {
        check(decoder.failed());
        outcome.error = decoder.error();
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    uint64_t seed = 0x9E3779B97F4A7C15ULL;
    size_t seedBytes = size < 8 ? size : 8;
    for (size_t i = 0; i < seedBytes; ++i) seed ^= uint64_t{data[i]} << (8 * i);
    if (seed == 0) seed = 1;
    std::span<const uint8_t> stream(data + seedBytes, size - seedBytes);

    // In pieces of 1 to 64 bytes, mostly small.
    FrameDecoder pieces;
    Outcome inPieces;
    size_t pos = 0;
    for (size_t offset = 0; offset < stream.size() && !pieces.failed();) {
        uint64_t r = nextRandom(seed);
        size_t chunk = 1 + (r & 7) * ((r >> 3) & 7);
        if (chunk > stream.size() - offset) chunk = stream.size() - offset;
        pieces.feed(stream.subspan(offset, chunk));
        offset += chunk;
        drain(pieces, stream, pos, inPieces);
        check(pieces.failed() ? pieces.buffered() == 0 : pieces.buffered() == offset - pos);
    }

    // All at once.
    FrameDecoder whole;
    Outcome atOnce;
    size_t wholePos = 0;
    whole.feed(stream);
    drain(whole, stream, wholePos, atOnce);
    check(atOnce.frames == inPieces.frames && atOnce.error == inPieces.error);
    if (whole.failed()) {
        Frame frame;
        whole.feed(stream);
        check(whole.next(frame) == FrameDecoder::Status::Error && whole.buffered() == 0);
    }

    // The same bytes as one body, without the framing in the way.
    Value value;
    if (decodeValue(stream, value)) {
        std::vector<uint8_t> again;
        check(encodeValue(value, again));
        check(again.size() == stream.size() &&
              std::memcmp(again.data(), stream.data(), again.size()) == 0);
    }
    return 0;
}
