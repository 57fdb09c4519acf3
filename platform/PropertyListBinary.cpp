// The binary property-list format, version "bplist00":
//
//   "bplist00" | objects | offset table | trailer (32 bytes)
//
// The trailer gives the byte size of an offset-table entry and of an object
// reference, the number of objects, the top object's number and where the
// offset table starts. Each object begins with a marker byte: the high four
// bits are its type, the low four bits its size, or 0xF followed by an
// integer object holding the size. Arrays and dictionaries hold object
// numbers (references), dictionaries all keys first, then all values.

#include <bit>
#include <cstring>
#include <unordered_map>

#include "platform/PropertyListInternal.h"

namespace berth::plist {

namespace {

using detail::Budget;

constexpr size_t kHeaderSize = 8;
constexpr size_t kTrailerSize = 32;

enum Type : uint8_t {
    kSimple = 0x0,
    kInteger = 0x1,
    kReal = 0x2,
    kDate = 0x3,
    kData = 0x4,
    kAsciiString = 0x5,
    kUtf16String = 0x6,
    kArray = 0xA,
    kDictionary = 0xD,
};
constexpr uint8_t kFalse = 0x08;
constexpr uint8_t kTrue = 0x09;

uint64_t readBigEndian(const uint8_t* p, size_t size) {
    uint64_t v = 0;
    for (size_t i = 0; i < size; ++i) v = (v << 8) | p[i];
    return v;
}

bool isPowerOfTwoUpTo8(uint8_t size) {
    return size == 1 || size == 2 || size == 4 || size == 8;
}

// One binary property list being decoded. All positions are checked against
// the region they must lie in before anything is read there.
class BinaryReader {
  public:
    BinaryReader(std::span<const uint8_t> bytes, const Limits& limits, std::string* why)
        : in_(bytes), limits_(limits), budget_(limits), why_(why) {}

    std::optional<Value> read();

  private:
    // An array or dictionary whose elements are being decoded.
    struct Frame {
        uint64_t object;
        bool isDictionary;
        uint64_t count;
        size_t refs;  // position of the first reference (the keys' for a dictionary)
        uint64_t next = 0;
        Value::Array array{};
        Value::Dictionary dictionary{};
        std::string key{};  // the key of the element being decoded
    };
    // An object's marker and where its contents start.
    struct Object {
        uint8_t type;
        uint8_t info;  // the low four bits of the marker
        uint64_t count;
        size_t contents;
    };

    bool fail(const char* reason) {
        if (why_) *why_ = reason;
        return false;
    }
    bool readTrailer();
    bool reference(size_t position, uint64_t* object);
    bool locate(uint64_t object, Object* out);
    bool readCount(size_t position, uint64_t* count, size_t* end);
    bool fits(size_t position, uint64_t count, size_t unit);
    bool visit(uint64_t object, std::vector<Frame>& stack, Value* leaf, bool* pushed);
    bool readLeaf(const Object& o, Value* out);
    bool readString(const Object& o, std::string* out);
    bool readKey(uint64_t object, std::string* out);
    bool attach(std::vector<Frame>& stack, Value value, Value* result);

    std::span<const uint8_t> in_;
    const Limits& limits_;
    Budget budget_;
    std::string* why_;

    uint8_t offsetSize_ = 0;
    uint8_t refSize_ = 0;
    uint64_t objectCount_ = 0;
    uint64_t topObject_ = 0;
    size_t offsetTable_ = 0;  // also the end of the objects' region
    std::vector<bool> onPath_;
};

bool BinaryReader::readTrailer() {
    if (in_.size() < kHeaderSize + 1 + 1 + kTrailerSize) return fail("truncated binary plist");
    const uint8_t* t = in_.data() + in_.size() - kTrailerSize;
    offsetSize_ = t[6];
    refSize_ = t[7];
    objectCount_ = readBigEndian(t + 8, 8);
    topObject_ = readBigEndian(t + 16, 8);
    const uint64_t tableOffset = readBigEndian(t + 24, 8);
    if (!isPowerOfTwoUpTo8(offsetSize_)) return fail("bad offset size in trailer");
    if (!isPowerOfTwoUpTo8(refSize_)) return fail("bad reference size in trailer");
    if (objectCount_ == 0) return fail("no objects");
    if (objectCount_ > limits_.maxObjects) return fail("too many objects");
    if (refSize_ < 8 && objectCount_ > (uint64_t{1} << (8 * refSize_)))
        return fail("reference size too small for the object count");
    if (topObject_ >= objectCount_) return fail("top object out of range");
    const size_t tableEnd = in_.size() - kTrailerSize;
    if (tableOffset <= kHeaderSize || tableOffset > tableEnd)
        return fail("bad offset table offset");
    offsetTable_ = static_cast<size_t>(tableOffset);
    if (objectCount_ > (tableEnd - offsetTable_) / offsetSize_)
        return fail("truncated offset table");
    return true;
}

bool BinaryReader::reference(size_t position, uint64_t* object) {
    *object = readBigEndian(in_.data() + position, refSize_);
    return *object < objectCount_ || fail("object reference out of range");
}

// True when `count` items of `unit` bytes starting at `position` lie within
// the objects' region.
bool BinaryReader::fits(size_t position, uint64_t count, size_t unit) {
    return position <= offsetTable_ && count <= (offsetTable_ - position) / unit;
}

// Reads the size that follows a marker with size bits 0xF: an integer object
// of 1, 2, 4 or 8 bytes holding a non-negative value.
bool BinaryReader::readCount(size_t position, uint64_t* count, size_t* end) {
    if (!fits(position, 1, 1)) return fail("truncated object");
    const uint8_t marker = in_[position];
    if ((marker >> 4) != kInteger || (marker & 0xF) > 3) return fail("bad object size");
    const size_t size = size_t{1} << (marker & 0xF);
    if (!fits(position + 1, size, 1)) return fail("truncated object");
    *count = readBigEndian(in_.data() + position + 1, size);
    if (*count > uint64_t{INT64_MAX}) return fail("bad object size");
    *end = position + 1 + size;
    return true;
}

bool BinaryReader::locate(uint64_t object, Object* out) {
    const size_t entry = offsetTable_ + static_cast<size_t>(object) * offsetSize_;
    const uint64_t offset = readBigEndian(in_.data() + entry, offsetSize_);
    if (offset < kHeaderSize || offset >= offsetTable_) return fail("object offset out of range");
    const size_t at = static_cast<size_t>(offset);
    out->type = in_[at] >> 4;
    out->info = in_[at] & 0xF;
    out->count = out->info;
    out->contents = at + 1;
    const bool sized = out->type == kData || out->type == kAsciiString ||
                       out->type == kUtf16String || out->type == kArray || out->type == kDictionary;
    if (sized && out->info == 0xF) return readCount(at + 1, &out->count, &out->contents);
    return true;
}

bool BinaryReader::readString(const Object& o, std::string* out) {
    out->clear();
    if (o.type == kAsciiString) {
        if (!fits(o.contents, o.count, 1)) return fail("truncated string");
        const uint8_t* p = in_.data() + o.contents;
        for (uint64_t i = 0; i < o.count; ++i)
            if (p[i] >= 0x80) return fail("non-ASCII byte in ASCII string");
        if (!budget_.addBytes(o.count)) return fail("too much text and data");
        out->assign(reinterpret_cast<const char*>(p), static_cast<size_t>(o.count));
        return true;
    }
    if (!fits(o.contents, o.count, 2)) return fail("truncated string");
    const uint8_t* p = in_.data() + o.contents;
    for (uint64_t i = 0; i < o.count; ++i) {
        char32_t cp = static_cast<char32_t>(readBigEndian(p + 2 * i, 2));
        if (cp >= 0xDC00 && cp <= 0xDFFF) return fail("unpaired surrogate in string");
        if (cp >= 0xD800 && cp <= 0xDBFF) {
            if (i + 1 == o.count) return fail("unpaired surrogate in string");
            const char32_t low = static_cast<char32_t>(readBigEndian(p + 2 * (i + 1), 2));
            if (low < 0xDC00 || low > 0xDFFF) return fail("unpaired surrogate in string");
            cp = 0x10000 + ((cp - 0xD800) << 10) + (low - 0xDC00);
            ++i;
        }
        detail::appendUtf8(*out, cp);
    }
    if (!budget_.addBytes(out->size())) return fail("too much text and data");
    return true;
}

bool BinaryReader::readLeaf(const Object& o, Value* out) {
    const uint8_t* p = in_.data() + o.contents;
    switch (o.type) {
        case kSimple:
            if (o.info != (kFalse & 0xF) && o.info != (kTrue & 0xF))
                return fail("unsupported object type");
            *out = Value(o.info == (kTrue & 0xF));
            return true;
        case kInteger: {
            if (o.info > 4) return fail("bad integer size");
            const size_t size = size_t{1} << o.info;
            if (!fits(o.contents, size, 1)) return fail("truncated integer");
            if (size == 16) {
                if (readBigEndian(p, 8) != 0) return fail("integer beyond 64 bits");
                *out = Value(readBigEndian(p + 8, 8));
            } else {
                // 1, 2 and 4 bytes are unsigned; 8 bytes are signed.
                *out = Value(static_cast<int64_t>(readBigEndian(p, size)));
            }
            return true;
        }
        case kReal:
        case kDate: {
            if (o.info != 2 && o.info != 3) return fail("bad real size");
            if (o.type == kDate && o.info != 3) return fail("bad date size");
            const size_t size = size_t{1} << o.info;
            if (!fits(o.contents, size, 1)) return fail("truncated real");
            const uint64_t bits = readBigEndian(p, size);
            const double d = size == 4 ? std::bit_cast<float>(static_cast<uint32_t>(bits))
                                       : std::bit_cast<double>(bits);
            *out =
                o.type == kDate ? Value(Value::Date{d + detail::kSecondsFrom1970To2001}) : Value(d);
            return true;
        }
        case kData:
            if (!fits(o.contents, o.count, 1)) return fail("truncated data");
            if (!budget_.addBytes(o.count)) return fail("too much text and data");
            *out = Value(Value::Data(p, p + o.count));
            return true;
        case kAsciiString:
        case kUtf16String: {
            std::string s;
            if (!readString(o, &s)) return false;
            *out = Value(std::move(s));
            return true;
        }
        default:
            return fail("unsupported object type");
    }
}

bool BinaryReader::readKey(uint64_t object, std::string* out) {
    Object o;
    if (!locate(object, &o)) return false;
    if (o.type != kAsciiString && o.type != kUtf16String)
        return fail("dictionary key is not a string");
    if (!budget_.addValues(1)) return fail("too many values");
    return readString(o, out);
}

// Decodes `object`: a leaf goes to *leaf, an array or dictionary becomes a
// new frame on `stack` (*pushed). Objects on the current path are refused.
bool BinaryReader::visit(uint64_t object, std::vector<Frame>& stack, Value* leaf, bool* pushed) {
    *pushed = false;
    if (onPath_[object]) return fail("cyclic object reference");
    if (!budget_.addValues(1)) return fail("too many values");
    Object o;
    if (!locate(object, &o)) return false;
    if (o.type != kArray && o.type != kDictionary) return readLeaf(o, leaf);

    if (stack.size() >= limits_.maxDepth) return fail("nested too deeply");
    const bool isDictionary = o.type == kDictionary;
    const uint64_t refs = isDictionary ? 2 * o.count : o.count;
    if (o.count > (uint64_t{1} << 62) || !fits(o.contents, refs, refSize_))
        return fail("truncated container");
    // Each element is at least one more value; refusing here also bounds
    // the memory reserved below.
    if (refs > budget_.valuesLeft()) return fail("too many values");
    Frame frame{
        .object = object, .isDictionary = isDictionary, .count = o.count, .refs = o.contents};
    if (!isDictionary) frame.array.reserve(static_cast<size_t>(o.count));
    stack.push_back(std::move(frame));
    onPath_[object] = true;
    *pushed = true;
    return true;
}

// Hands a finished value to the frame on top of `stack`, or to *result when
// it is the top object.
bool BinaryReader::attach(std::vector<Frame>& stack, Value value, Value* result) {
    if (stack.empty()) {
        *result = std::move(value);
        return true;
    }
    Frame& parent = stack.back();
    if (!parent.isDictionary) {
        parent.array.push_back(std::move(value));
        return true;
    }
    if (!parent.dictionary.emplace(std::move(parent.key), std::move(value)).second)
        return fail("repeated dictionary key");
    return true;
}

std::optional<Value> BinaryReader::read() {
    if (!readTrailer()) return std::nullopt;
    onPath_.assign(static_cast<size_t>(objectCount_), false);
    std::vector<Frame> stack;
    Value result, leaf;
    bool pushed;
    if (!visit(topObject_, stack, &result, &pushed)) return std::nullopt;
    while (!stack.empty()) {
        Frame& frame = stack.back();
        if (frame.next == frame.count) {
            Value done = frame.isDictionary ? Value(std::move(frame.dictionary))
                                            : Value(std::move(frame.array));
            onPath_[frame.object] = false;
            stack.pop_back();
            if (!attach(stack, std::move(done), &result)) return std::nullopt;
            continue;
        }
        const uint64_t i = frame.next++;
        uint64_t child;
        if (frame.isDictionary) {
            uint64_t key;
            if (!reference(frame.refs + i * refSize_, &key) || !readKey(key, &frame.key))
                return std::nullopt;
            if (frame.dictionary.count(frame.key)) {
                fail("repeated dictionary key");
                return std::nullopt;
            }
            if (!reference(frame.refs + (frame.count + i) * refSize_, &child)) return std::nullopt;
        } else if (!reference(frame.refs + i * refSize_, &child)) {
            return std::nullopt;
        }
        if (!visit(child, stack, &leaf, &pushed)) return std::nullopt;
        if (!pushed && !attach(stack, std::move(leaf), &result)) return std::nullopt;
    }
    return result;
}

// ---------------------------------------------------------------------------
// Writer

size_t bytesFor(uint64_t v) {
    return v <= 0xFF ? 1 : v <= 0xFFFF ? 2 : v <= 0xFFFFFFFF ? 4 : 8;
}

// One object of the file: a value or a dictionary key, and for arrays and
// dictionaries the numbers of their elements (keys first).
struct WriterObject {
    const Value* value = nullptr;
    const std::string* key = nullptr;
    std::vector<uint64_t> children{};
};

class BinaryWriter {
  public:
    explicit BinaryWriter(std::string* why) : why_(why), budget_(limits_) {}

    std::optional<std::vector<uint8_t>> write(const Value& root);

  private:
    bool fail(const std::string& reason) {
        if (why_) *why_ = reason;
        return false;
    }
    bool number(const Value& root);
    bool add(const Value& v, size_t depth, uint64_t* object);
    uint64_t addString(const std::string& s);
    bool emit(const WriterObject& o);
    bool emitString(const std::string& s);
    void emitUnsigned(uint64_t v);
    void emitMarker(uint8_t type, uint64_t count);
    void emitBigEndian(uint64_t v, size_t size);

    std::string* why_;
    const Limits limits_;
    Budget budget_;
    std::vector<WriterObject> objects_;
    std::vector<std::pair<uint64_t, size_t>> pending_;  // containers to number, with depth
    std::unordered_map<std::string_view, uint64_t> strings_;
    size_t refSize_ = 1;
    std::vector<uint8_t> out_;
};

uint64_t BinaryWriter::addString(const std::string& s) {
    auto [it, added] = strings_.emplace(s, objects_.size());
    if (added) objects_.push_back({});
    return it->second;
}

// Gives `v` an object number; arrays and dictionaries are queued so their
// elements get numbers in turn.
bool BinaryWriter::add(const Value& v, size_t depth, uint64_t* object) {
    if (!budget_.addValues(1)) return fail("too many values");
    switch (v.kind()) {
        case Value::Kind::Null:
            return fail("null has no property-list form");
        case Value::Kind::Uuid:
            return fail("UUID has no property-list form");
        case Value::Kind::String:
            if (!budget_.addBytes(v.size())) return fail("too much text and data");
            if (!detail::isValidUtf8(*v.string())) return fail("string is not UTF-8");
            *object = addString(*v.string());
            objects_[*object].value = &v;
            return true;
        case Value::Kind::Data:
            if (!budget_.addBytes(v.size())) return fail("too much text and data");
            break;
        case Value::Kind::Array:
        case Value::Kind::Dictionary:
            if (depth > limits_.maxDepth) return fail("nested too deeply");
            pending_.emplace_back(objects_.size(), depth);
            break;
        default:
            break;
    }
    *object = objects_.size();
    objects_.push_back({.value = &v});
    return true;
}

bool BinaryWriter::number(const Value& root) {
    uint64_t top;
    if (!add(root, 1, &top)) return false;
    while (!pending_.empty()) {
        auto [object, depth] = pending_.back();
        pending_.pop_back();
        const Value& v = *objects_[object].value;
        std::vector<uint64_t> children;
        children.reserve(v.size() * (v.isDictionary() ? 2 : 1));
        uint64_t child;
        if (const Value::Array* a = v.arrayValue()) {
            for (const Value& element : *a) {
                if (!add(element, depth + 1, &child)) return false;
                children.push_back(child);
            }
        } else {
            const Value::Dictionary& d = *v.dictionaryValue();
            for (const auto& [key, value] : d) {
                if (!budget_.addValues(1)) return fail("too many values");
                if (!budget_.addBytes(key.size())) return fail("too much text and data");
                if (!detail::isValidUtf8(key)) return fail("dictionary key is not UTF-8");
                child = addString(key);
                if (!objects_[child].value) objects_[child].key = &key;
                children.push_back(child);
            }
            for (const auto& [key, value] : d) {
                if (!add(value, depth + 1, &child)) return false;
                children.push_back(child);
            }
        }
        objects_[object].children = std::move(children);
    }
    return true;
}

void BinaryWriter::emitBigEndian(uint64_t v, size_t size) {
    for (size_t i = size; i-- > 0;) out_.push_back(static_cast<uint8_t>(v >> (8 * i)));
}

void BinaryWriter::emitUnsigned(uint64_t v) {
    const size_t size = bytesFor(v);
    out_.push_back(static_cast<uint8_t>(kInteger << 4 | std::countr_zero(size)));
    emitBigEndian(v, size);
}

void BinaryWriter::emitMarker(uint8_t type, uint64_t count) {
    if (count < 0xF) {
        out_.push_back(static_cast<uint8_t>(type << 4 | count));
        return;
    }
    out_.push_back(static_cast<uint8_t>(type << 4 | 0xF));
    emitUnsigned(count);
}

bool BinaryWriter::emitString(const std::string& s) {
    bool ascii = true;
    for (unsigned char c : s) ascii = ascii && c < 0x80;
    if (ascii) {
        emitMarker(kAsciiString, s.size());
        out_.insert(out_.end(), s.begin(), s.end());
        return true;
    }
    std::vector<uint16_t> units;
    size_t at = 0;
    char32_t cp;
    while (at < s.size()) {
        if (!detail::decodeUtf8(s, &at, &cp)) return fail("string is not UTF-8");
        if (cp >= 0x10000) {
            units.push_back(static_cast<uint16_t>(0xD800 + ((cp - 0x10000) >> 10)));
            units.push_back(static_cast<uint16_t>(0xDC00 + ((cp - 0x10000) & 0x3FF)));
        } else {
            units.push_back(static_cast<uint16_t>(cp));
        }
    }
    emitMarker(kUtf16String, units.size());
    for (uint16_t u : units) emitBigEndian(u, 2);
    return true;
}

bool BinaryWriter::emit(const WriterObject& o) {
    if (o.key) return emitString(*o.key);
    const Value& v = *o.value;
    switch (v.kind()) {
        case Value::Kind::Bool:
            out_.push_back(*v.boolValue() ? kTrue : kFalse);
            return true;
        case Value::Kind::Int64:
        case Value::Kind::UInt64: {
            const bool negative = v.kind() == Value::Kind::Int64 && *v.int64Value() < 0;
            const uint64_t bits = *v.uint64Value();
            if (negative) {
                out_.push_back(kInteger << 4 | 3);
                emitBigEndian(bits, 8);
            } else if (bits > uint64_t{INT64_MAX}) {
                out_.push_back(kInteger << 4 | 4);
                emitBigEndian(0, 8);
                emitBigEndian(bits, 8);
            } else {
                emitUnsigned(bits);
            }
            return true;
        }
        case Value::Kind::Double:
            out_.push_back(kReal << 4 | 3);
            emitBigEndian(std::bit_cast<uint64_t>(*v.doubleValue()), 8);
            return true;
        case Value::Kind::Date:
            out_.push_back(kDate << 4 | 3);
            emitBigEndian(std::bit_cast<uint64_t>(v.date()->secondsSince1970 -
                                                  detail::kSecondsFrom1970To2001),
                          8);
            return true;
        case Value::Kind::Data:
            emitMarker(kData, v.size());
            out_.insert(out_.end(), v.data()->begin(), v.data()->end());
            return true;
        case Value::Kind::String:
            return emitString(*v.string());
        case Value::Kind::Array:
        case Value::Kind::Dictionary: {
            const bool isDictionary = v.isDictionary();
            emitMarker(isDictionary ? kDictionary : kArray,
                       isDictionary ? o.children.size() / 2 : o.children.size());
            for (uint64_t child : o.children) emitBigEndian(child, refSize_);
            return true;
        }
        default:
            return fail("value has no property-list form");
    }
}

std::optional<std::vector<uint8_t>> BinaryWriter::write(const Value& root) {
    if (!number(root)) return std::nullopt;
    refSize_ = bytesFor(objects_.size() - 1);
    std::vector<uint64_t> offsets;
    offsets.reserve(objects_.size());
    out_.assign({'b', 'p', 'l', 'i', 's', 't', '0', '0'});
    for (const WriterObject& o : objects_) {
        offsets.push_back(out_.size());
        if (!emit(o)) return std::nullopt;
    }
    const uint64_t tableOffset = out_.size();
    const size_t offsetSize = bytesFor(offsets.back());
    for (uint64_t offset : offsets) emitBigEndian(offset, offsetSize);
    out_.insert(out_.end(), 6, 0);  // unused, sort version
    out_.push_back(static_cast<uint8_t>(offsetSize));
    out_.push_back(static_cast<uint8_t>(refSize_));
    emitBigEndian(objects_.size(), 8);
    emitBigEndian(0, 8);  // the top object is always the first
    emitBigEndian(tableOffset, 8);
    if (out_.size() > limits_.maxBytes) {
        fail("property list too large");
        return std::nullopt;
    }
    return std::move(out_);
}

}  // namespace

namespace detail {

std::optional<Value> parseBinary(std::span<const uint8_t> bytes, const Limits& limits,
                                 std::string* why) {
    return BinaryReader(bytes, limits, why).read();
}

}  // namespace detail

std::optional<std::vector<uint8_t>> serializeBinary(const Value& value, std::string* why) {
    return BinaryWriter(why).write(value);
}

}  // namespace berth::plist
