// The XML property-list format, read only. A small reader of exactly the XML
// that property lists use: no external entities, no internal document-type
// subset, no namespaces. Nesting is followed with an explicit stack.

#include <charconv>
#include <cstring>

#include "core/Base64.h"
#include "platform/PropertyListInternal.h"

namespace berth::plist {

namespace {

using detail::Budget;

bool isSpace(char c) {
    return c == ' ' || c == '\t' || c == '\n' || c == '\r';
}

bool isNameChar(char c) {
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '_' ||
           c == ':' || c == '.' || c == '-';
}

std::string_view trim(std::string_view s) {
    while (!s.empty() && isSpace(s.front())) s.remove_prefix(1);
    while (!s.empty() && isSpace(s.back())) s.remove_suffix(1);
    return s;
}

// Parses an unsigned number in `base` that must span all of `s`.
bool parseUnsigned(std::string_view s, int base, uint64_t* out) {
    if (s.empty()) return false;
    auto [end, ec] = std::from_chars(s.data(), s.data() + s.size(), *out, base);
    return ec == std::errc() && end == s.data() + s.size();
}

bool parseInteger(std::string_view text, Value* out) {
    std::string_view s = trim(text);
    bool negative = false;
    if (!s.empty() && (s.front() == '-' || s.front() == '+')) {
        negative = s.front() == '-';
        s.remove_prefix(1);
    }
    int base = 10;
    if (s.size() > 2 && s[0] == '0' && (s[1] == 'x' || s[1] == 'X')) {
        base = 16;
        s.remove_prefix(2);
    }
    uint64_t magnitude;
    if (!parseUnsigned(s, base, &magnitude)) return false;
    if (!negative) {
        *out = magnitude <= uint64_t{INT64_MAX} ? Value(static_cast<int64_t>(magnitude))
                                                : Value(magnitude);
        return true;
    }
    if (magnitude > uint64_t{INT64_MAX} + 1) return false;
    *out = Value(static_cast<int64_t>(0 - magnitude));
    return true;
}

bool parseReal(std::string_view text, Value* out) {
    std::string_view s = trim(text);
    if (s.size() > 1 && s.front() == '+' && s[1] != '-') s.remove_prefix(1);
    double d;
    auto [end, ec] = std::from_chars(s.data(), s.data() + s.size(), d);
    if (s.empty() || ec != std::errc() || end != s.data() + s.size()) return false;
    *out = Value(d);
    return true;
}

// Days from 1970-01-01 to the given date of the proleptic Gregorian calendar.
int64_t daysFromCivil(int64_t y, unsigned m, unsigned d) {
    y -= m <= 2;
    const int64_t era = (y >= 0 ? y : y - 399) / 400;
    const unsigned yoe = static_cast<unsigned>(y - era * 400);
    const unsigned doy = (153 * (m > 2 ? m - 3 : m + 9) + 2) / 5 + d - 1;
    const unsigned doe = yoe * 365 + yoe / 4 - yoe / 100 + doy;
    return era * 146097 + static_cast<int64_t>(doe) - 719468;
}

unsigned daysInMonth(unsigned y, unsigned m) {
    static constexpr unsigned kDays[] = {31, 28, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31};
    const bool leap = (y % 4 == 0 && y % 100 != 0) || y % 400 == 0;
    return m == 2 && leap ? 29 : kDays[m - 1];
}

// YYYY-MM-DDTHH:MM:SS, optionally a fraction of a second, then Z (UTC).
bool parseDate(std::string_view text, Value* out) {
    std::string_view s = trim(text);
    if (s.size() < 20 || s[4] != '-' || s[7] != '-' || s[10] != 'T' || s[13] != ':' ||
        s[16] != ':' || s.back() != 'Z')
        return false;
    uint64_t year, month, day, hour, minute, second;
    if (!parseUnsigned(s.substr(0, 4), 10, &year) || !parseUnsigned(s.substr(5, 2), 10, &month) ||
        !parseUnsigned(s.substr(8, 2), 10, &day) || !parseUnsigned(s.substr(11, 2), 10, &hour) ||
        !parseUnsigned(s.substr(14, 2), 10, &minute) ||
        !parseUnsigned(s.substr(17, 2), 10, &second))
        return false;
    if (month < 1 || month > 12 || day < 1 || day > daysInMonth(year, month) || hour > 23 ||
        minute > 59 || second > 59)
        return false;
    double fraction = 0;
    std::string_view rest = s.substr(19, s.size() - 20);
    if (!rest.empty()) {
        if (rest.size() < 2 || rest.size() > 20 || rest.front() != '.') return false;
        for (char c : rest.substr(1))
            if (c < '0' || c > '9') return false;
        const std::string decimal = "0" + std::string(rest);
        std::from_chars(decimal.data(), decimal.data() + decimal.size(), fraction);
    }
    const int64_t days = daysFromCivil(static_cast<int64_t>(year), month, day);
    const double seconds = static_cast<double>(
        days * 86400 + static_cast<int64_t>(hour * 3600 + minute * 60 + second));
    *out = Value(Value::Date{seconds + fraction});
    return true;
}

// Standard base64; whitespace anywhere is ignored, padding is optional.
bool parseBase64(std::string_view text, Value::Data* out) {
    uint32_t bits = 0;
    int held = 0;
    size_t digits = 0, padding = 0;
    for (char c : text) {
        if (isSpace(c)) continue;
        if (c == '=') {
            ++padding;
            continue;
        }
        const int digit = base64Digit(c);
        if (digit < 0 || padding > 0) return false;
        ++digits;
        bits = (bits << 6) | static_cast<uint32_t>(digit);
        held += 6;
        if (held >= 8) {
            held -= 8;
            out->push_back(static_cast<uint8_t>(bits >> held));
            bits &= (1u << held) - 1;
        }
    }
    if (digits % 4 == 1 || padding > 2) return false;
    return padding == 0 || (digits + padding) % 4 == 0;
}

class XmlReader {
  public:
    XmlReader(std::span<const uint8_t> bytes, const Limits& limits, std::string* why)
        : in_(reinterpret_cast<const char*>(bytes.data()), bytes.size()),
          limits_(limits),
          budget_(limits),
          why_(why) {}

    std::optional<Value> read() {
        Value result;
        if (!readDocument(&result)) return std::nullopt;
        return result;
    }

  private:
    struct Tag {
        std::string_view name;
        bool closing = false;
        bool empty = false;  // <name/>
    };
    // An open <dict> or <array>.
    struct Frame {
        bool isDictionary;
        Value::Array array{};
        Value::Dictionary dictionary{};
        std::optional<std::string> key{};  // read, its value not yet
    };

    bool fail(const char* reason) {
        if (why_) *why_ = reason;
        return false;
    }
    bool atEnd() const { return pos_ >= in_.size(); }
    bool lookingAt(std::string_view s) const { return in_.substr(pos_).starts_with(s); }
    void skipSpace() {
        while (!atEnd() && isSpace(in_[pos_])) ++pos_;
    }
    bool skipPast(std::string_view terminator) {
        const size_t at = in_.find(terminator, pos_);
        if (at == std::string_view::npos) return fail("unterminated markup");
        pos_ = at + terminator.size();
        return true;
    }

    bool readDocument(Value* result);
    bool skipMisc(bool inProlog);
    bool skipDocumentType();
    bool readName(std::string_view* name);
    bool readTag(Tag* tag);
    bool nextTag(Tag* tag);
    bool readText(std::string_view element, std::string* out);
    bool readReference(std::string* out);
    bool readScalar(const Tag& tag, Value* out);
    bool readValue(Tag first, Value* result);
    bool complete(std::vector<Frame>& stack, Value value, Value* result);

    std::string_view in_;
    size_t pos_ = 0;
    const Limits& limits_;
    Budget budget_;
    std::string* why_;
};

// Skips whitespace, comments and processing instructions (the XML
// declaration among them), and in the prolog a document type declaration.
bool XmlReader::skipMisc(bool inProlog) {
    for (;;) {
        skipSpace();
        if (lookingAt("<?")) {
            if (!skipPast("?>")) return false;
        } else if (lookingAt("<!--")) {
            if (!skipPast("-->")) return false;
        } else if (inProlog && lookingAt("<!DOCTYPE")) {
            if (!skipDocumentType()) return false;
        } else {
            return true;
        }
    }
}

bool XmlReader::skipDocumentType() {
    for (pos_ += 9; !atEnd(); ++pos_) {
        const char c = in_[pos_];
        if (c == '"' || c == '\'') {
            const size_t close = in_.find(c, pos_ + 1);
            if (close == std::string_view::npos) break;
            pos_ = close;
        } else if (c == '[') {
            return fail("document type with internal subset");
        } else if (c == '>') {
            ++pos_;
            return true;
        }
    }
    return fail("unterminated document type");
}

bool XmlReader::readName(std::string_view* name) {
    const size_t start = pos_;
    while (!atEnd() && isNameChar(in_[pos_])) ++pos_;
    if (pos_ == start) return fail("malformed tag");
    *name = in_.substr(start, pos_ - start);
    return true;
}

// Reads a start, end or empty-element tag at '<'. Attributes are checked for
// form and otherwise ignored.
bool XmlReader::readTag(Tag* tag) {
    *tag = Tag{};
    ++pos_;
    if (!atEnd() && in_[pos_] == '/') {
        tag->closing = true;
        ++pos_;
    }
    if (!readName(&tag->name)) return false;
    for (;;) {
        skipSpace();
        if (atEnd()) return fail("unterminated tag");
        if (in_[pos_] == '>') {
            ++pos_;
            return true;
        }
        if (!tag->closing && lookingAt("/>")) {
            pos_ += 2;
            tag->empty = true;
            return true;
        }
        std::string_view attribute;
        if (tag->closing || !readName(&attribute)) return fail("malformed tag");
        skipSpace();
        if (atEnd() || in_[pos_] != '=') return fail("malformed attribute");
        ++pos_;
        skipSpace();
        if (atEnd() || (in_[pos_] != '"' && in_[pos_] != '\'')) return fail("malformed attribute");
        const size_t close = in_.find(in_[pos_], pos_ + 1);
        if (close == std::string_view::npos) return fail("unterminated attribute");
        pos_ = close + 1;
    }
}

// Skips what may stand between elements and reads the next tag.
bool XmlReader::nextTag(Tag* tag) {
    if (!skipMisc(false)) return false;
    if (atEnd()) return fail("unexpected end of input");
    if (in_[pos_] != '<') return fail("text outside of a value");
    return readTag(tag);
}

// Reads a character or entity reference at '&'.
bool XmlReader::readReference(std::string* out) {
    const size_t semicolon = in_.find(';', pos_);
    if (semicolon == std::string_view::npos || semicolon - pos_ > 12)
        return fail("malformed reference");
    const std::string_view name = in_.substr(pos_ + 1, semicolon - pos_ - 1);
    pos_ = semicolon + 1;
    static constexpr std::pair<std::string_view, char> kEntities[] = {
        {"lt", '<'}, {"gt", '>'}, {"amp", '&'}, {"quot", '"'}, {"apos", '\''}};
    for (const auto& [entity, c] : kEntities) {
        if (name == entity) {
            *out += c;
            return true;
        }
    }
    uint64_t cp;
    const bool hex = name.starts_with("#x");
    if (!name.starts_with("#") || !parseUnsigned(name.substr(hex ? 2 : 1), hex ? 16 : 10, &cp) ||
        cp == 0 || cp > 0x10FFFF || (cp >= 0xD800 && cp <= 0xDFFF))
        return fail("malformed reference");
    detail::appendUtf8(*out, static_cast<char32_t>(cp));
    return true;
}

// Reads the text of `element` up to and including its end tag: character
// data, references and CDATA sections; comments are dropped.
bool XmlReader::readText(std::string_view element, std::string* out) {
    for (;;) {
        const size_t next = in_.find_first_of("<&", pos_);
        if (next == std::string_view::npos) return fail("unterminated element");
        out->append(in_.substr(pos_, next - pos_));
        pos_ = next;
        if (in_[pos_] == '&') {
            if (!readReference(out)) return false;
        } else if (lookingAt("<![CDATA[")) {
            const size_t end = in_.find("]]>", pos_ + 9);
            if (end == std::string_view::npos) return fail("unterminated CDATA section");
            out->append(in_.substr(pos_ + 9, end - pos_ - 9));
            pos_ = end + 3;
        } else if (lookingAt("<!--")) {
            if (!skipPast("-->")) return false;
        } else if (lookingAt("</")) {
            Tag tag;
            if (!readTag(&tag)) return false;
            return tag.name == element || fail("mismatched end tag");
        } else {
            return fail("element inside text");
        }
    }
}

bool XmlReader::readScalar(const Tag& tag, Value* out) {
    std::string text;
    if (!tag.empty && !readText(tag.name, &text)) return false;
    if (tag.name == "string") {
        if (!detail::isValidUtf8(text)) return fail("string is not UTF-8");
        if (!budget_.addBytes(text.size())) return fail("too much text and data");
        *out = Value(std::move(text));
        return true;
    }
    if (tag.name == "integer") return parseInteger(text, out) || fail("malformed integer");
    if (tag.name == "real") return parseReal(text, out) || fail("malformed real");
    if (tag.name == "date") return parseDate(text, out) || fail("malformed date");
    if (tag.name == "true" || tag.name == "false") {
        *out = Value(tag.name == "true");
        return trim(text).empty() || fail("text inside boolean");
    }
    if (tag.name == "data") {
        Value::Data data;
        if (!parseBase64(text, &data)) return fail("malformed base64 data");
        if (!budget_.addBytes(data.size())) return fail("too much text and data");
        *out = Value(std::move(data));
        return true;
    }
    return fail("unknown element");
}

// Hands a finished value to the innermost open container, or to *result when
// none is open.
bool XmlReader::complete(std::vector<Frame>& stack, Value value, Value* result) {
    if (stack.empty()) {
        *result = std::move(value);
        return true;
    }
    Frame& parent = stack.back();
    if (!parent.isDictionary) {
        parent.array.push_back(std::move(value));
    } else {
        parent.dictionary.emplace(std::move(*parent.key), std::move(value));
        parent.key.reset();
    }
    return true;
}

// Reads one value that starts with the tag `first`, nested values included.
bool XmlReader::readValue(Tag first, Value* result) {
    std::vector<Frame> stack;
    for (Tag tag = first;;) {
        if (tag.closing) {
            if (stack.empty()) return fail("unexpected end tag");
            Frame& frame = stack.back();
            if (tag.name != (frame.isDictionary ? "dict" : "array"))
                return fail("mismatched end tag");
            if (frame.key) return fail("key without value");
            Value done = frame.isDictionary ? Value(std::move(frame.dictionary))
                                            : Value(std::move(frame.array));
            stack.pop_back();
            if (!complete(stack, std::move(done), result)) return false;
        } else if (!stack.empty() && stack.back().isDictionary && !stack.back().key) {
            if (tag.name != "key") return fail("expected a key");
            std::string key;
            if (!tag.empty && !readText("key", &key)) return false;
            if (!detail::isValidUtf8(key)) return fail("key is not UTF-8");
            if (!budget_.addValues(1)) return fail("too many values");
            if (!budget_.addBytes(key.size())) return fail("too much text and data");
            if (stack.back().dictionary.count(key)) return fail("repeated dictionary key");
            stack.back().key = std::move(key);
        } else {
            if (!budget_.addValues(1)) return fail("too many values");
            Value value;
            if (tag.name == "dict" || tag.name == "array") {
                const bool isDictionary = tag.name == "dict";
                if (!tag.empty) {
                    if (stack.size() >= limits_.maxDepth) return fail("nested too deeply");
                    stack.push_back(Frame{.isDictionary = isDictionary});
                    if (!nextTag(&tag)) return false;
                    continue;
                }
                value = isDictionary ? Value::dictionary() : Value::array();
            } else if (!readScalar(tag, &value)) {
                return false;
            }
            if (!complete(stack, std::move(value), result)) return false;
        }
        if (stack.empty()) return true;
        if (!nextTag(&tag)) return false;
    }
}

bool XmlReader::readDocument(Value* result) {
    if (lookingAt("\xEF\xBB\xBF")) pos_ += 3;
    if (!skipMisc(true)) return false;
    if (atEnd() || in_[pos_] != '<') return fail("not a property list");
    Tag tag;
    if (!readTag(&tag)) return false;
    const bool wrapped = tag.name == "plist" && !tag.closing;
    if (wrapped) {
        if (tag.empty) return fail("property list without a value");
        if (!nextTag(&tag)) return false;
    }
    if (!readValue(tag, result)) return false;
    if (wrapped) {
        if (!nextTag(&tag)) return false;
        if (!tag.closing || tag.name != "plist") return fail("expected </plist>");
    }
    if (!skipMisc(false)) return false;
    return atEnd() || fail("content after the property list");
}

}  // namespace

namespace detail {

std::optional<Value> parseXml(std::span<const uint8_t> bytes, const Limits& limits,
                              std::string* why) {
    return XmlReader(bytes, limits, why).read();
}

}  // namespace detail

}  // namespace berth::plist
