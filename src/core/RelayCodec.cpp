#include "core/RelayCodec.h"

#include <algorithm>
#include <bit>
#include <cstring>

namespace berth::relay {

namespace {

enum Tag : uint8_t {
    kTagNull = 0x00,
    kTagFalse = 0x01,
    kTagTrue = 0x02,
    kTagInt64 = 0x03,
    kTagUInt64 = 0x04,
    kTagDouble = 0x05,
    kTagString = 0x06,
    kTagData = 0x07,
    kTagDate = 0x08,
    kTagUuid = 0x09,
    kTagArray = 0x0A,
    kTagDictionary = 0x0B,
};

// Smallest encodings, used to refuse counts the remaining bytes cannot hold
// before anything is reserved for them.
constexpr size_t kMinElementSize = 1;    // a tag
constexpr size_t kMinEntrySize = 4 + 1;  // an empty key and a tag

void putU32(std::vector<uint8_t>& out, uint32_t v) {
    for (int i = 0; i < 4; ++i) out.push_back(static_cast<uint8_t>(v >> (8 * i)));
}

void putU64(std::vector<uint8_t>& out, uint64_t v) {
    for (int i = 0; i < 8; ++i) out.push_back(static_cast<uint8_t>(v >> (8 * i)));
}

uint32_t getU32(const uint8_t* p) {
    uint32_t v = 0;
    for (int i = 3; i >= 0; --i) v = (v << 8) | p[i];
    return v;
}

uint64_t getU64(const uint8_t* p) {
    uint64_t v = 0;
    for (int i = 7; i >= 0; --i) v = (v << 8) | p[i];
    return v;
}

class Encoder {
  public:
    explicit Encoder(std::vector<uint8_t>& out) : out_(out), base_(out.size()) {}

    bool encode(const Value& value, int depth) {
        if (++valueCount_ > kMaxValueCount) return fail(CodecError::TooManyValues);
        switch (value.kind()) {
            case Value::Kind::Null:
                return putTag(kTagNull, 0);
            case Value::Kind::Bool:
                return putTag(*value.boolValue() ? kTagTrue : kTagFalse, 0);
            case Value::Kind::Int64:
                if (!putTag(kTagInt64, 8)) return false;
                putU64(out_, static_cast<uint64_t>(*value.int64Value()));
                return true;
            case Value::Kind::UInt64:
                if (!putTag(kTagUInt64, 8)) return false;
                putU64(out_, *value.uint64Value());
                return true;
            case Value::Kind::Double:
                if (!putTag(kTagDouble, 8)) return false;
                putU64(out_, std::bit_cast<uint64_t>(*value.doubleValue()));
                return true;
            case Value::Kind::Date:
                if (!putTag(kTagDate, 8)) return false;
                putU64(out_, std::bit_cast<uint64_t>(value.date()->secondsSince1970));
                return true;
            case Value::Kind::Uuid: {
                if (!putTag(kTagUuid, 16)) return false;
                const auto& bytes = value.uuid()->bytes();
                out_.insert(out_.end(), bytes.begin(), bytes.end());
                return true;
            }
            case Value::Kind::String:
                return putTag(kTagString, 0) && putText(*value.string());
            case Value::Kind::Data: {
                const auto& data = *value.data();
                if (!putTag(kTagData, 4 + data.size())) return false;
                putU32(out_, static_cast<uint32_t>(data.size()));
                out_.insert(out_.end(), data.begin(), data.end());
                return true;
            }
            case Value::Kind::Array:
                return encodeArray(*value.arrayValue(), depth);
            case Value::Kind::Dictionary:
                return encodeDictionary(*value.dictionaryValue(), depth);
        }
        return fail(CodecError::UnknownTag);
    }

    CodecError error() const { return error_; }

  private:
    bool encodeArray(const Value::Array& array, int depth) {
        if (depth + 1 > kMaxDepth) return fail(CodecError::TooDeep);
        if (!putTag(kTagArray, 4)) return false;
        putU32(out_, static_cast<uint32_t>(array.size()));
        for (const Value& element : array) {
            if (!encode(element, depth + 1)) return false;
        }
        return true;
    }

    bool encodeDictionary(const Value::Dictionary& dictionary, int depth) {
        if (depth + 1 > kMaxDepth) return fail(CodecError::TooDeep);
        if (!putTag(kTagDictionary, 4)) return false;
        putU32(out_, static_cast<uint32_t>(dictionary.size()));
        // The map's order is the unsigned bytewise order the wire requires.
        for (const auto& [key, element] : dictionary) {
            if (!putText(key) || !encode(element, depth + 1)) return false;
        }
        return true;
    }

    // A length-prefixed UTF-8 text (string payload or dictionary key).
    bool putText(const std::string& text) {
        if (!isValidUtf8(text)) return fail(CodecError::InvalidUtf8);
        if (!reserve(4 + text.size())) return false;
        putU32(out_, static_cast<uint32_t>(text.size()));
        out_.insert(out_.end(), text.begin(), text.end());
        return true;
    }

    bool putTag(uint8_t tag, size_t payloadSize) {
        if (!reserve(1 + payloadSize)) return false;
        out_.push_back(tag);
        return true;
    }

    // Refuses to grow the body beyond what a peer accepts; checked before
    // appending so an oversized value is never copied.
    bool reserve(size_t more) {
        size_t used = out_.size() - base_;
        if (more > kMaxBodySize - used) return fail(CodecError::BodyTooLarge);
        return true;
    }

    bool fail(CodecError error) {
        error_ = error;
        return false;
    }

    std::vector<uint8_t>& out_;
    size_t base_;
    size_t valueCount_ = 0;
    CodecError error_ = CodecError::None;
};

class Decoder {
  public:
    explicit Decoder(std::span<const uint8_t> body) : p_(body.data()), remaining_(body.size()) {}

    bool decodeTop(Value& value) {
        if (!decode(value, 0)) return false;
        if (remaining_ != 0) return fail(CodecError::TrailingBytes);
        return true;
    }

    CodecError error() const { return error_; }

  private:
    // `depth` is the number of containers enclosing the value being read.
    bool decode(Value& value, int depth) {
        if (!take(1)) return false;
        uint8_t tag = p_[-1];
        switch (tag) {
            case kTagNull:
                value = Value();
                return true;
            case kTagFalse:
            case kTagTrue:
                value = Value(tag == kTagTrue);
                return true;
            case kTagInt64:
                if (!take(8)) return false;
                value = Value(static_cast<int64_t>(getU64(p_ - 8)));
                return true;
            case kTagUInt64:
                if (!take(8)) return false;
                value = Value(getU64(p_ - 8));
                return true;
            case kTagDouble:
                if (!take(8)) return false;
                value = Value(std::bit_cast<double>(getU64(p_ - 8)));
                return true;
            case kTagDate:
                if (!take(8)) return false;
                value = Value(Value::Date{std::bit_cast<double>(getU64(p_ - 8))});
                return true;
            case kTagUuid: {
                if (!take(16)) return false;
                Uuid::Bytes bytes;
                std::memcpy(bytes.data(), p_ - 16, 16);
                value = Value(Uuid(bytes));
                return true;
            }
            case kTagString: {
                std::string_view text;
                if (!takeText(text)) return false;
                value = Value(std::string(text));
                return true;
            }
            case kTagData: {
                uint32_t size;
                if (!takeU32(size) || !take(size)) return false;
                value = Value(Value::Data(p_ - size, p_));
                return true;
            }
            case kTagArray:
                return decodeArray(value, depth);
            case kTagDictionary:
                return decodeDictionary(value, depth);
            default:
                return fail(CodecError::UnknownTag);
        }
    }

    bool decodeArray(Value& value, int depth) {
        uint32_t count;
        if (!openContainer(depth, kMinElementSize, count)) return false;
        Value::Array array;
        array.reserve(count);
        for (uint32_t i = 0; i < count; ++i) {
            if (!decode(array.emplace_back(), depth + 1)) return false;
        }
        value = Value(std::move(array));
        return true;
    }

    bool decodeDictionary(Value& value, int depth) {
        uint32_t count;
        if (!openContainer(depth, kMinEntrySize, count)) return false;
        Value::Dictionary dictionary;
        std::string_view previous;
        for (uint32_t i = 0; i < count; ++i) {
            std::string_view key;
            if (!takeText(key)) return false;
            if (i > 0 && !bytewiseLess(previous, key)) return fail(CodecError::KeysOutOfOrder);
            previous = key;
            Value element;
            if (!decode(element, depth + 1)) return false;
            // Keys arrive ascending, so each entry goes at the end in constant time.
            dictionary.emplace_hint(dictionary.end(), std::string(key), std::move(element));
        }
        value = Value(std::move(dictionary));
        return true;
    }

    // Reads a container's count after checking its depth; the count must fit
    // in the remaining bytes and the value budget before anything is reserved.
    bool openContainer(int depth, size_t minElementSize, uint32_t& count) {
        if (depth + 1 > kMaxDepth) return fail(CodecError::TooDeep);
        if (!takeU32(count)) return false;
        if (count > remaining_ / minElementSize) return fail(CodecError::Truncated);
        if (count > budget_) return fail(CodecError::TooManyValues);
        budget_ -= count;
        return true;
    }

    static bool bytewiseLess(std::string_view a, std::string_view b) {
        int order = std::memcmp(a.data(), b.data(), std::min(a.size(), b.size()));
        return order < 0 || (order == 0 && a.size() < b.size());
    }

    bool takeText(std::string_view& text) {
        uint32_t size;
        if (!takeU32(size) || !take(size)) return false;
        text = std::string_view(reinterpret_cast<const char*>(p_ - size), size);
        if (!isValidUtf8(text)) return fail(CodecError::InvalidUtf8);
        return true;
    }

    bool takeU32(uint32_t& v) {
        if (!take(4)) return false;
        v = getU32(p_ - 4);
        return true;
    }

    // Advances past `size` bytes when they are present.
    bool take(size_t size) {
        if (size > remaining_) return fail(CodecError::Truncated);
        p_ += size;
        remaining_ -= size;
        return true;
    }

    bool fail(CodecError error) {
        error_ = error;
        return false;
    }

    const uint8_t* p_;
    size_t remaining_;
    size_t budget_ = kMaxValueCount - 1;  // the top-level value is the first
    CodecError error_ = CodecError::None;
};

// Checks as much of a header as is present; true when nothing seen is wrong.
bool checkHeaderPrefix(const uint8_t* p, size_t size, CodecError& error) {
    if ((size > 0 && p[0] != kRelayMagic0) || (size > 1 && p[1] != kRelayMagic1)) {
        error = CodecError::BadMagic;
    } else if (size > 2 && p[2] != kRelayVersion) {
        error = CodecError::BadVersion;
    } else if (size > 3 && (p[3] < static_cast<uint8_t>(FrameKind::Request) ||
                            p[3] > static_cast<uint8_t>(FrameKind::Message))) {
        error = CodecError::BadKind;
    } else if (size >= kHeaderSize && getU32(p + 12) > kMaxBodySize) {
        error = CodecError::BodyTooLarge;
    } else {
        return true;
    }
    return false;
}

}  // namespace

const char* describe(CodecError error) {
    switch (error) {
        case CodecError::None:
            return "no error";
        case CodecError::BadMagic:
            return "not a relay stream";
        case CodecError::BadVersion:
            return "unsupported relay version";
        case CodecError::BadKind:
            return "unknown frame kind";
        case CodecError::BodyTooLarge:
            return "body too large";
        case CodecError::Truncated:
            return "truncated value";
        case CodecError::TrailingBytes:
            return "bytes after the value";
        case CodecError::UnknownTag:
            return "unknown value tag";
        case CodecError::InvalidUtf8:
            return "string is not valid UTF-8";
        case CodecError::TooDeep:
            return "nesting too deep";
        case CodecError::TooManyValues:
            return "too many values";
        case CodecError::KeysOutOfOrder:
            return "dictionary keys duplicated or out of order";
    }
    return "unknown codec error";
}

bool isValidUtf8(std::string_view text) {
    const auto* p = reinterpret_cast<const uint8_t*>(text.data());
    const uint8_t* end = p + text.size();
    while (p < end) {
        uint8_t lead = *p;
        if (lead < 0x80) {
            ++p;
            continue;
        }
        size_t length;
        uint8_t low = 0x80, high = 0xBF;  // allowed range of the second byte
        if (lead >= 0xC2 && lead <= 0xDF) {
            length = 2;
        } else if (lead >= 0xE0 && lead <= 0xEF) {
            length = 3;
            if (lead == 0xE0) low = 0xA0;   // overlong
            if (lead == 0xED) high = 0x9F;  // surrogates
        } else if (lead >= 0xF0 && lead <= 0xF4) {
            length = 4;
            if (lead == 0xF0) low = 0x90;   // overlong
            if (lead == 0xF4) high = 0x8F;  // above U+10FFFF
        } else {
            return false;
        }
        if (static_cast<size_t>(end - p) < length) return false;
        if (p[1] < low || p[1] > high) return false;
        for (size_t i = 2; i < length; ++i) {
            if (p[i] < 0x80 || p[i] > 0xBF) return false;
        }
        p += length;
    }
    return true;
}

bool encodeValue(const Value& value, std::vector<uint8_t>& out, CodecError* error) {
    size_t original = out.size();
    Encoder encoder(out);
    if (encoder.encode(value, 0)) return true;
    out.resize(original);
    if (error) *error = encoder.error();
    return false;
}

bool decodeValue(std::span<const uint8_t> body, Value& value, CodecError* error) {
    CodecError failure = CodecError::None;
    if (body.size() > kMaxBodySize) {
        failure = CodecError::BodyTooLarge;
    } else {
        Decoder decoder(body);
        Value decoded;
        if (decoder.decodeTop(decoded)) {
            value = std::move(decoded);
            return true;
        }
        failure = decoder.error();
    }
    if (error) *error = failure;
    return false;
}

bool encodeFrame(const Frame& frame, std::vector<uint8_t>& out, CodecError* error) {
    return encodeFrame(frame.kind, frame.messageId, frame.body, out, error);
}

bool encodeFrame(FrameKind kind, uint64_t messageId, const Value& body, std::vector<uint8_t>& out,
                 CodecError* error) {
    // Room for a typical reply at once rather than growing byte by byte;
    // doubling still, for callers that append many frames to one buffer.
    constexpr size_t kTypicalFrame = 512;
    size_t original = out.size();
    if (out.capacity() < original + kTypicalFrame)
        out.reserve(std::max(original + kTypicalFrame, 2 * out.capacity()));
    out.push_back(kRelayMagic0);
    out.push_back(kRelayMagic1);
    out.push_back(kRelayVersion);
    out.push_back(static_cast<uint8_t>(kind));
    putU64(out, messageId);
    putU32(out, 0);  // body length, filled in below
    size_t bodyStart = out.size();
    if (!encodeValue(body, out, error)) {
        out.resize(original);
        return false;
    }
    auto length = static_cast<uint32_t>(out.size() - bodyStart);
    for (int i = 0; i < 4; ++i) out[bodyStart - 4 + i] = static_cast<uint8_t>(length >> (8 * i));
    return true;
}

void FrameDecoder::feed(std::span<const uint8_t> bytes) {
    if (failed()) return;
    // Drop consumed bytes once they are at least half the buffer, so every
    // byte is moved a bounded number of times.
    if (start_ == buffer_.size()) {
        buffer_.clear();
        start_ = 0;
    } else if (start_ > 0 && start_ >= buffer_.size() / 2) {
        buffer_.erase(buffer_.begin(), buffer_.begin() + static_cast<ptrdiff_t>(start_));
        start_ = 0;
    }
    buffer_.insert(buffer_.end(), bytes.begin(), bytes.end());
}

FrameDecoder::Status FrameDecoder::next(Frame& frame) {
    if (failed()) return Status::Error;
    const uint8_t* header = buffer_.data() + start_;
    size_t available = buffered();
    CodecError error = CodecError::None;
    if (!checkHeaderPrefix(header, std::min(available, kHeaderSize), error)) return fail(error);
    if (available < kHeaderSize) return Status::NeedMore;

    uint32_t bodySize = getU32(header + 12);
    if (available - kHeaderSize < bodySize) return Status::NeedMore;

    Value body;
    if (!decodeValue({header + kHeaderSize, bodySize}, body, &error)) return fail(error);
    frame.kind = static_cast<FrameKind>(header[3]);
    frame.messageId = getU64(header + 4);
    frame.body = std::move(body);
    start_ += kHeaderSize + bodySize;
    return Status::Frame;
}

FrameDecoder::Status FrameDecoder::fail(CodecError error) {
    error_ = error;
    buffer_.clear();
    buffer_.shrink_to_fit();
    start_ = 0;
    return Status::Error;
}

}  // namespace berth::relay
