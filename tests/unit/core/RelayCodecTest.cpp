#include "core/RelayCodec.h"

#include <bit>
#include <limits>

#include "TestSupport.h"

namespace berth::relay {
namespace {

using Bytes = std::vector<uint8_t>;
using test::identical;

Bytes encode(const Value& v) {
    Bytes out;
    CodecError error = CodecError::None;
    EXPECT_TRUE(encodeValue(v, out, &error)) << describe(error);
    return out;
}

CodecError decodeError(const Bytes& body) {
    Value v;
    CodecError error = CodecError::None;
    EXPECT_FALSE(decodeValue(body, v, &error));
    return error;
}

Bytes u32(uint32_t v) {
    return {uint8_t(v), uint8_t(v >> 8), uint8_t(v >> 16), uint8_t(v >> 24)};
}

Bytes cat(std::initializer_list<Bytes> parts) {
    Bytes out;
    for (const auto& p : parts) out.insert(out.end(), p.begin(), p.end());
    return out;
}

Bytes stringBody(const std::string& s) {
    return cat({{0x06}, u32(s.size()), Bytes(s.begin(), s.end())});
}

// Nested arrays `levels` deep around a null.
Bytes nestedArrays(int levels) {
    Bytes out;
    for (int i = 0; i < levels; ++i) out.insert(out.end(), {0x0A, 1, 0, 0, 0});
    out.push_back(0x00);
    return out;
}

Value everyKind() {
    Value inner = Value::dictionary();
    inner.set("", Value::array());
    inner.set("empty", Value::dictionary());
    Value root = Value::dictionary();
    root.set("null", Value());
    root.set("false", false);
    root.set("true", true);
    root.set("int64 min", std::numeric_limits<int64_t>::min());
    root.set("int64 max", std::numeric_limits<int64_t>::max());
    root.set("int64 zero", int64_t{0});
    root.set("uint64 max", std::numeric_limits<uint64_t>::max());
    root.set("uint64 zero", uint64_t{0});
    root.set("double", 2.5);
    root.set("negative zero", -0.0);
    root.set("infinity", -std::numeric_limits<double>::infinity());
    root.set("nan payload", std::bit_cast<double>(uint64_t{0x7FF800000000BEEF}));
    root.set("date", Value(Value::Date{-1.25e9}));
    root.set("uuid", *Uuid::parse("1B4E28BA-2FA1-11D2-883F-0016D3CCA427"));
    root.set("nil uuid", Uuid());
    root.set("empty string", "");
    root.set(std::string("nul\0key", 7), std::string("a\0b\0", 4));
    root.set("unicode \xF0\x9F\x9A\xA2", "\xE2\x82\xAC \xF4\x8F\xBF\xBF");
    root.set("data", Value(Value::Data{0, 0xFF, 0, 0x80}));
    root.set("empty data", Value(Value::Data{}));
    root.set("nested", Value(Value::Array{inner, Value(Value::Array{}), Value(int64_t{-1})}));
    return root;
}

TEST(RelayCodecTest, EveryKindRoundTripsWithItsExactKind) {
    Value original = everyKind();
    Bytes body = encode(original);
    Value decoded;
    ASSERT_TRUE(decodeValue(body, decoded));
    EXPECT_TRUE(identical(original, decoded));
    // A uint64 and an int64 of the same number stay apart.
    Value small;
    ASSERT_TRUE(decodeValue(encode(Value(int64_t{5})), small));
    EXPECT_EQ(small.kind(), Value::Kind::Int64);
    ASSERT_TRUE(decodeValue(encode(Value(uint64_t{5})), small));
    EXPECT_EQ(small.kind(), Value::Kind::UInt64);
    // Canonical: the decoded value encodes to the same bytes.
    EXPECT_EQ(encode(decoded), body);
}

// The byte layouts written down in docs/protocol.md, so a client written
// from that page agrees with this codec.
TEST(RelayCodecTest, EncodingMatchesTheDocumentedLayout) {
    EXPECT_EQ(encode(Value()), Bytes{0x00});
    EXPECT_EQ(encode(Value(false)), Bytes{0x01});
    EXPECT_EQ(encode(Value(true)), Bytes{0x02});
    EXPECT_EQ(encode(Value(int64_t{-2})),
              (Bytes{0x03, 0xFE, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}));
    EXPECT_EQ(encode(Value(uint64_t{0x0102})), (Bytes{0x04, 0x02, 0x01, 0, 0, 0, 0, 0, 0}));
    EXPECT_EQ(encode(Value(1.0)), (Bytes{0x05, 0, 0, 0, 0, 0, 0, 0xF0, 0x3F}));
    EXPECT_EQ(encode(Value("h\xC3\xA9")), (Bytes{0x06, 3, 0, 0, 0, 'h', 0xC3, 0xA9}));
    EXPECT_EQ(encode(Value(Value::Data{7})), (Bytes{0x07, 1, 0, 0, 0, 7}));
    EXPECT_EQ(encode(Value(Value::Date{-1.0})), (Bytes{0x08, 0, 0, 0, 0, 0, 0, 0xF0, 0xBF}));
    Bytes uuid = encode(*Uuid::parse("00112233-4455-6677-8899-AABBCCDDEEFF"));
    EXPECT_EQ(uuid, (Bytes{0x09, 0x00, 0x11, 0x22, 0x33, 0x44, 0x55, 0x66, 0x77, 0x88, 0x99, 0xAA,
                           0xBB, 0xCC, 0xDD, 0xEE, 0xFF}));
    EXPECT_EQ(encode(Value(Value::Array{Value(), Value(true)})),
              (Bytes{0x0A, 2, 0, 0, 0, 0x00, 0x02}));

    Value request = Value::dictionary();
    request.set("Command", uint64_t{1});
    Bytes frame;
    ASSERT_TRUE(encodeFrame({FrameKind::Request, 0x1122334455667788, request}, frame));
    Bytes expected = {'B', 'R', 1,    1,   0x88, 0x77, 0x66, 0x55, 0x44, 0x33, 0x22, 0x11, 25,  0,
                      0,   0,   0x0B, 1,   0,    0,    0,    7,    0,    0,    0,    'C',  'o', 'm',
                      'm', 'a', 'n',  'd', 0x04, 1,    0,    0,    0,    0,    0,    0,    0};
    EXPECT_EQ(frame, expected);
}

TEST(RelayCodecTest, DictionaryKeysMustBeStrictlyAscendingUnsignedBytes) {
    // The encoder orders "z" (0x7A) before "\xC3\xA9" (0xC3): unsigned order.
    Value dict = Value::dictionary();
    dict.set("\xC3\xA9", 1);
    dict.set("z", 2);
    dict.set("za", 3);
    Bytes body = encode(dict);
    Value decoded;
    ASSERT_TRUE(decodeValue(body, decoded));
    EXPECT_TRUE(identical(dict, decoded));

    auto entry = [](const std::string& key) {
        return cat({u32(key.size()), Bytes(key.begin(), key.end()), {0x00}});
    };
    // Duplicates are caught beyond the first pair too.
    for (const std::vector<std::string>& keys : std::vector<std::vector<std::string>>{
             {"a", "a"}, {"b", "a"}, {"ab", "a"}, {"\xC3\xA9", "z"}, {"a", "b", "b"}}) {
        Bytes body = cat({{0x0B}, u32(keys.size())});
        for (const auto& key : keys) body = cat({body, entry(key)});
        EXPECT_EQ(decodeError(body), CodecError::KeysOutOfOrder) << keys.front();
    }
    // A key with a NUL differs from its prefix.
    ASSERT_TRUE(
        decodeValue(cat({{0x0B}, u32(2), entry("a"), entry(std::string("a\0", 2))}), decoded));
    EXPECT_EQ(decoded.size(), 2u);
}

TEST(RelayCodecTest, MalformedBodiesAreRejectedWithTheirReason) {
    for (int tag = 0x0C; tag <= 0xFF; ++tag) {
        EXPECT_EQ(decodeError({uint8_t(tag)}), CodecError::UnknownTag) << tag;
    }
    EXPECT_EQ(decodeError({0x0A, 1, 0, 0, 0, 0x0C}), CodecError::UnknownTag);
    EXPECT_EQ(decodeError({}), CodecError::Truncated);
    EXPECT_EQ(decodeError({0x00, 0x00}), CodecError::TrailingBytes);
    EXPECT_EQ(decodeError(cat({encode(Value("x")), {0x00}})), CodecError::TrailingBytes);

    // Every strict prefix of a valid body is truncated, never something else.
    Bytes body = encode(everyKind());
    for (size_t n = 0; n < body.size(); ++n) {
        EXPECT_EQ(decodeError(Bytes(body.begin(), body.begin() + n)), CodecError::Truncated) << n;
    }
}

TEST(RelayCodecTest, DeclaredLengthsAndCountsAreCheckedAgainstTheBytesPresent) {
    // Each declares far more than the body holds; none may allocate for it.
    EXPECT_EQ(decodeError(cat({{0x06}, u32(0xFFFFFFFF), {'a'}})), CodecError::Truncated);
    EXPECT_EQ(decodeError(cat({{0x07}, u32(0xFFFFFFFF)})), CodecError::Truncated);
    EXPECT_EQ(decodeError(cat({{0x0A}, u32(0xFFFFFFFF), {0x00}})), CodecError::Truncated);
    EXPECT_EQ(decodeError(cat({{0x0B}, u32(0xFFFFFFFF), u32(0), {0x00}})), CodecError::Truncated);
    // A dictionary key's length is checked too.
    EXPECT_EQ(decodeError(cat({{0x0B}, u32(1), u32(0x7FFFFFFF), {0x00}})), CodecError::Truncated);
    // Counts that the bytes could hold but that exceed the value budget.
    Bytes many = cat({{0x0A}, u32(kMaxValueCount)});
    many.resize(many.size() + kMaxValueCount, 0x00);
    EXPECT_EQ(decodeError(many), CodecError::TooManyValues);
    many = cat({{0x0A}, u32(kMaxValueCount - 1)});
    many.resize(many.size() + kMaxValueCount - 1, 0x00);
    Value decoded;
    EXPECT_TRUE(decodeValue(many, decoded));
    // The budget covers the whole tree, not only one container.
    Bytes split =
        cat({{0x0A}, u32(2), {0x0A}, u32(kMaxValueCount / 2), {0x0A}, u32(kMaxValueCount / 2)});
    split.resize(split.size() + kMaxValueCount, 0x00);
    EXPECT_EQ(decodeError(split), CodecError::TooManyValues);
}

TEST(RelayCodecTest, LimitsHoldOnBothSides) {
    Value deep;
    for (int i = 0; i < kMaxDepth; ++i) deep = Value(Value::Array{deep});
    Value decoded;
    ASSERT_TRUE(decodeValue(encode(deep), decoded));
    EXPECT_TRUE(decodeValue(nestedArrays(kMaxDepth), decoded));
    EXPECT_EQ(decodeError(nestedArrays(kMaxDepth + 1)), CodecError::TooDeep);
    // Hostile depth far beyond the limit fails without recursing into it.
    EXPECT_EQ(decodeError(nestedArrays(500000)), CodecError::TooDeep);

    Bytes out = {0xAA};
    CodecError error = CodecError::None;
    EXPECT_FALSE(encodeValue(Value(Value::Array{deep}), out, &error));
    EXPECT_EQ(error, CodecError::TooDeep);
    EXPECT_EQ(out, Bytes{0xAA}) << "a failed encode leaves the output as it was";

    // A data value that fills the body exactly fits; one byte more does not.
    Value fits(Value::Data(kMaxBodySize - 5, 0x61));
    EXPECT_EQ(encode(fits).size(), kMaxBodySize);
    Value tooBig(Value::Data(kMaxBodySize - 4, 0x61));
    EXPECT_FALSE(encodeValue(tooBig, out, &error));
    EXPECT_EQ(error, CodecError::BodyTooLarge);
    EXPECT_FALSE(encodeFrame({FrameKind::Reply, 1, tooBig}, out, &error));
    EXPECT_EQ(out, Bytes{0xAA});
    EXPECT_EQ(decodeError(Bytes(kMaxBodySize + 1, 0)), CodecError::BodyTooLarge);

    Value wide(Value::Array(kMaxValueCount, Value()));
    EXPECT_FALSE(encodeValue(wide, out, &error));
    EXPECT_EQ(error, CodecError::TooManyValues);
}

TEST(RelayCodecTest, StringsAndKeysMustBeValidUtf8) {
    const std::vector<std::string> invalid = {
        "\x80",              // lone continuation byte
        "\xC0\x80",          // overlong NUL
        "\xC1\xBF",          // overlong ASCII
        "\xE0\x9F\xBF",      // overlong three-byte form
        "\xED\xA0\x80",      // surrogate U+D800
        "\xED\xBF\xBF",      // surrogate U+DFFF
        "\xF0\x8F\xBF\xBF",  // overlong four-byte form
        "\xF4\x90\x80\x80",  // above U+10FFFF
        "\xF5\x80\x80\x80",  // lead byte beyond the range
        "\xE2\x82",          // truncated at the end
        "\xE2\x28\xA1",      // bad continuation
        "a\xFF",
    };
    for (const auto& text : invalid) {
        EXPECT_FALSE(isValidUtf8(text)) << ::testing::PrintToString(text);
        EXPECT_EQ(decodeError(stringBody(text)), CodecError::InvalidUtf8);
        Bytes keyed = cat({{0x0B}, u32(1), u32(text.size()), Bytes(text.begin(), text.end()), {0}});
        EXPECT_EQ(decodeError(keyed), CodecError::InvalidUtf8);
        Bytes out;
        CodecError error = CodecError::None;
        EXPECT_FALSE(encodeValue(Value(text), out, &error));
        EXPECT_EQ(error, CodecError::InvalidUtf8);
        Value dict = Value::dictionary();
        dict.set(text, 1);
        EXPECT_FALSE(encodeValue(dict, out, &error));
        EXPECT_TRUE(out.empty());
    }
    const std::vector<std::string> valid = {
        std::string("\0", 1), "\x7F",         "\xC2\x80",
        "\xDF\xBF",           "\xE0\xA0\x80", "\xED\x9F\xBF",
        "\xEE\x80\x80",       "\xEF\xBF\xBF", "\xF0\x90\x80\x80",
        "\xF4\x8F\xBF\xBF",
    };
    for (const auto& text : valid) {
        EXPECT_TRUE(isValidUtf8(text)) << ::testing::PrintToString(text);
        Value decoded;
        ASSERT_TRUE(decodeValue(stringBody(text), decoded));
        EXPECT_EQ(*decoded.string(), text);
    }
}

// Three frames of different kinds, back to back as on a socket.
Bytes threeFrames(std::vector<Frame>& frames) {
    Value request = Value::dictionary();
    request.set("Command", uint64_t{3});
    request.set("Identifier", "sys.kelp.app");
    Value reply = Value::dictionary();
    reply.set("ReplyError", uint64_t{1});
    reply.set("ReplyUUIDsArray", Value(Value::Array{Value(Uuid()), Value(Uuid::random())}));
    frames = {{FrameKind::Request, 1, request},
              {FrameKind::Reply, UINT64_MAX, reply},
              {FrameKind::Message, 0, Value::dictionary()}};
    Bytes stream;
    for (const auto& f : frames) EXPECT_TRUE(encodeFrame(f, stream));
    return stream;
}

void expectFrames(FrameDecoder& decoder, const std::vector<Frame>& expected, size_t& seen) {
    Frame frame;
    FrameDecoder::Status status;
    while ((status = decoder.next(frame)) == FrameDecoder::Status::Frame) {
        ASSERT_LT(seen, expected.size());
        EXPECT_EQ(frame.kind, expected[seen].kind);
        EXPECT_EQ(frame.messageId, expected[seen].messageId);
        EXPECT_TRUE(identical(frame.body, expected[seen].body));
        ++seen;
    }
    EXPECT_EQ(status, FrameDecoder::Status::NeedMore) << describe(decoder.error());
}

TEST(RelayCodecTest, FramesArriveWhole) {
    std::vector<Frame> frames;
    Bytes stream = threeFrames(frames);
    std::span<const uint8_t> all(stream);

    // Split into two reads at every byte boundary.
    for (size_t cut = 0; cut <= stream.size(); ++cut) {
        FrameDecoder decoder;
        size_t seen = 0;
        decoder.feed(all.first(cut));
        expectFrames(decoder, frames, seen);
        decoder.feed(all.subspan(cut));
        expectFrames(decoder, frames, seen);
        EXPECT_EQ(seen, frames.size()) << "cut at " << cut;
        EXPECT_EQ(decoder.buffered(), 0u);
    }

    // One byte per read: each frame shows up exactly when its last byte arrives,
    // not earlier and not one read later (a peer would wait forever for it).
    std::vector<size_t> ends;
    for (const auto& f : frames) {
        Bytes one;
        ASSERT_TRUE(encodeFrame(f, one));
        ends.push_back((ends.empty() ? 0 : ends.back()) + one.size());
    }
    FrameDecoder decoder;
    size_t seen = 0;
    for (size_t i = 0; i < stream.size(); ++i) {
        decoder.feed(all.subspan(i, 1));
        expectFrames(decoder, frames, seen);
        size_t complete =
            std::count_if(ends.begin(), ends.end(), [&](size_t e) { return e <= i + 1; });
        ASSERT_EQ(seen, complete) << "after byte " << i;
    }
}

TEST(RelayCodecTest, BrokenStreamsFailAtOnceAndStayFailed) {
    std::vector<Frame> frames;
    Bytes good = threeFrames(frames);
    struct Case {
        const char* what;
        size_t offset;
        uint8_t byte;
        size_t bytesNeeded;  // the error shows once this many bytes arrived
        CodecError error;
    };
    const Case cases[] = {
        {"magic", 0, 'X', 1, CodecError::BadMagic},
        {"magic", 1, 'X', 2, CodecError::BadMagic},
        {"version", 2, 2, 3, CodecError::BadVersion},
        {"kind 0", 3, 0, 4, CodecError::BadKind},
        {"kind 4", 3, 4, 4, CodecError::BadKind},
        {"length", 15, 0x01, kHeaderSize, CodecError::BodyTooLarge},  // 16 MiB and more
    };
    for (const auto& c : cases) {
        Bytes stream = good;
        stream[c.offset] = c.byte;
        FrameDecoder decoder;
        Frame frame;
        decoder.feed(std::span<const uint8_t>(stream).first(c.bytesNeeded - 1));
        EXPECT_EQ(decoder.next(frame), FrameDecoder::Status::NeedMore) << c.what;
        decoder.feed(std::span<const uint8_t>(stream).subspan(c.bytesNeeded - 1, 1));
        EXPECT_EQ(decoder.next(frame), FrameDecoder::Status::Error) << c.what;
        EXPECT_EQ(decoder.error(), c.error) << c.what;
        decoder.feed(std::span<const uint8_t>(stream).subspan(c.bytesNeeded));
        EXPECT_EQ(decoder.next(frame), FrameDecoder::Status::Error) << c.what;
        EXPECT_EQ(decoder.buffered(), 0u) << "a failed decoder keeps nothing";
    }

    // The largest legal declared length waits for its body; one more fails.
    Bytes header = {'B', 'R', 1, 1, 0, 0, 0, 0, 0, 0, 0, 0};
    Bytes atLimit = cat({header, u32(kMaxBodySize)});
    Bytes overLimit = cat({header, u32(kMaxBodySize + 1)});
    FrameDecoder waiting, refusing;
    Frame frame;
    waiting.feed(atLimit);
    EXPECT_EQ(waiting.next(frame), FrameDecoder::Status::NeedMore);
    refusing.feed(overLimit);
    EXPECT_EQ(refusing.next(frame), FrameDecoder::Status::Error);
    EXPECT_EQ(refusing.error(), CodecError::BodyTooLarge);

    // A bad body after good frames: the good ones come out, then the error.
    Bytes stream = good;
    Bytes bad = cat({header, u32(2), {0x00, 0x00}});
    stream.insert(stream.end(), bad.begin(), bad.end());
    FrameDecoder decoder;
    decoder.feed(stream);
    int delivered = 0;
    FrameDecoder::Status status;
    while ((status = decoder.next(frame)) == FrameDecoder::Status::Frame) ++delivered;
    EXPECT_EQ(delivered, 3);
    EXPECT_EQ(status, FrameDecoder::Status::Error);
    EXPECT_EQ(decoder.error(), CodecError::TrailingBytes);
}

}  // namespace
}  // namespace berth::relay
