#include "core/Value.h"

#include <cinttypes>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <ctime>

namespace berth {

namespace {

size_t mix(size_t seed, size_t h) {
    return seed ^ (h + 0x9E3779B97F4A7C15ULL + (seed << 6) + (seed >> 2));
}

// Integers are compared as mathematical values; this is their common key.
struct IntegerKey {
    bool negative;
    uint64_t magnitudeBits;  // the value itself when non-negative, else the int64 bits
};

// Reals and dates compare as numbers, except that every NaN equals every
// other: a value read back from a stored property list must equal the one
// written, and a value used as a key must equal itself.
bool sameNumber(double a, double b) {
    return a == b || (std::isnan(a) && std::isnan(b));
}

// Agrees with sameNumber(): both zeros alike, all NaNs alike.
size_t numberHash(double d) {
    if (std::isnan(d)) return 0x7FF8;
    return d == 0 ? 0 : std::hash<double>()(d);
}

IntegerKey integerKey(const Value& v) {
    if (v.kind() == Value::Kind::Int64) {
        int64_t i = *v.int64Value();
        return {i < 0, static_cast<uint64_t>(i)};
    }
    return {false, *v.uint64Value()};
}

bool needsQuotes(const std::string& s) {
    if (s.empty()) return true;
    for (unsigned char c : s) {
        if (!(isalnum(c) || c == '_' || c == '.' || c == '/' || c == '-' || c == ':' || c >= 0x80))
            return true;
    }
    return false;
}

void appendQuoted(std::string& out, const std::string& s) {
    out.push_back('"');
    for (char c : s) {
        if (c == '"' || c == '\\') out.push_back('\\');
        if (c == '\n') {
            out += "\\n";
            continue;
        }
        out.push_back(c);
    }
    out.push_back('"');
}

}  // namespace

const char* kindName(Value::Kind kind) {
    switch (kind) {
        case Value::Kind::Null:
            return "null";
        case Value::Kind::Bool:
            return "bool";
        case Value::Kind::Int64:
            return "int64";
        case Value::Kind::UInt64:
            return "uint64";
        case Value::Kind::Double:
            return "double";
        case Value::Kind::String:
            return "string";
        case Value::Kind::Data:
            return "data";
        case Value::Kind::Date:
            return "date";
        case Value::Kind::Uuid:
            return "uuid";
        case Value::Kind::Array:
            return "array";
        case Value::Kind::Dictionary:
            return "dictionary";
    }
    return "unknown";
}

std::optional<uint64_t> Value::uint64Value() const {
    if (auto* i = std::get_if<int64_t>(&storage_)) return static_cast<uint64_t>(*i);
    if (auto* u = std::get_if<uint64_t>(&storage_)) return *u;
    if (auto* d = std::get_if<double>(&storage_)) {
        if (!std::isfinite(*d)) return 0;
        if (*d < 0) return static_cast<uint64_t>(static_cast<int64_t>(std::fmax(*d, -9.2e18)));
        return *d >= 1.8e19 ? UINT64_MAX : static_cast<uint64_t>(*d);
    }
    return std::nullopt;
}

std::optional<int64_t> Value::int64Value() const {
    if (auto* i = std::get_if<int64_t>(&storage_)) return *i;
    if (auto* u = std::get_if<uint64_t>(&storage_)) return static_cast<int64_t>(*u);
    if (auto* d = std::get_if<double>(&storage_)) {
        if (!std::isfinite(*d)) return 0;
        return static_cast<int64_t>(std::fmin(std::fmax(*d, -9.2e18), 9.2e18));
    }
    return std::nullopt;
}

std::optional<double> Value::doubleValue() const {
    if (auto* i = std::get_if<int64_t>(&storage_)) return static_cast<double>(*i);
    if (auto* u = std::get_if<uint64_t>(&storage_)) return static_cast<double>(*u);
    if (auto* d = std::get_if<double>(&storage_)) return *d;
    return std::nullopt;
}

const Value* Value::find(std::string_view key) const {
    auto* dict = dictionaryValue();
    if (!dict) return nullptr;
    auto it = dict->find(key);
    return it == dict->end() ? nullptr : &it->second;
}

void Value::set(std::string key, Value value) {
    if (auto* dict = dictionaryValue()) (*dict)[std::move(key)] = std::move(value);
}

void Value::erase(std::string_view key) {
    if (auto* dict = dictionaryValue()) {
        auto it = dict->find(key);
        if (it != dict->end()) dict->erase(it);
    }
}

void Value::push(Value value) {
    if (auto* array = arrayValue()) array->push_back(std::move(value));
}

size_t Value::size() const {
    if (auto* a = arrayValue()) return a->size();
    if (auto* d = dictionaryValue()) return d->size();
    if (auto* s = string()) return s->size();
    if (auto* b = data()) return b->size();
    return 0;
}

bool operator==(const Value& a, const Value& b) {
    if (a.isInteger() && b.isInteger()) {
        IntegerKey x = integerKey(a), y = integerKey(b);
        return x.negative == y.negative && x.magnitudeBits == y.magnitudeBits;
    }
    if (a.kind() == Value::Kind::Double && b.kind() == Value::Kind::Double)
        return sameNumber(std::get<double>(a.storage_), std::get<double>(b.storage_));
    if (a.kind() == Value::Kind::Date && b.kind() == Value::Kind::Date)
        return sameNumber(a.date()->secondsSince1970, b.date()->secondsSince1970);
    return a.storage_ == b.storage_;
}

size_t Value::hash() const {
    size_t seed = std::hash<int>()(isInteger() ? -1 : static_cast<int>(kind()));
    switch (kind()) {
        case Kind::Null:
            return seed;
        case Kind::Bool:
            return mix(seed, *boolValue());
        case Kind::Int64:
        case Kind::UInt64: {
            IntegerKey key = integerKey(*this);
            return mix(mix(seed, key.negative), std::hash<uint64_t>()(key.magnitudeBits));
        }
        case Kind::Double: {
            return mix(seed, numberHash(std::get<double>(storage_)));
        }
        case Kind::String:
            return mix(seed, std::hash<std::string>()(*string()));
        case Kind::Data:
            return mix(seed, std::hash<std::string_view>()(std::string_view(
                                 reinterpret_cast<const char*>(data()->data()), data()->size())));
        case Kind::Date:
            return mix(seed, numberHash(date()->secondsSince1970));
        case Kind::Uuid:
            return mix(seed, std::hash<berth::Uuid>()(*uuid()));
        case Kind::Array:
            for (const Value& v : *arrayValue()) seed = mix(seed, v.hash());
            return seed;
        case Kind::Dictionary:
            for (const auto& [k, v] : *dictionaryValue())
                seed = mix(mix(seed, std::hash<std::string>()(k)), v.hash());
            return seed;
    }
    return seed;
}

std::string Value::description() const {
    std::string out;
    describe(out, 0, true);
    return out;
}

void Value::describe(std::string& out, int indent, bool topLevel) const {
    char buffer[64];
    switch (kind()) {
        case Kind::Null:
            out += "(null)";
            return;
        case Kind::Bool:
            out += *boolValue() ? "1" : "0";
            return;
        case Kind::Int64:
            snprintf(buffer, sizeof buffer, "%" PRId64, std::get<int64_t>(storage_));
            out += buffer;
            return;
        case Kind::UInt64:
            snprintf(buffer, sizeof buffer, "%" PRIu64, std::get<uint64_t>(storage_));
            out += buffer;
            return;
        case Kind::Double:
            snprintf(buffer, sizeof buffer, "%.17g", std::get<double>(storage_));
            out += buffer;
            return;
        case Kind::String:
            if (topLevel || !needsQuotes(*string()))
                out += *string();
            else
                appendQuoted(out, *string());
            return;
        case Kind::Data:
            out.push_back('<');
            for (size_t i = 0; i < data()->size(); ++i) {
                if (i && i % 4 == 0) out.push_back(' ');
                snprintf(buffer, sizeof buffer, "%02x", (*data())[i]);
                out += buffer;
            }
            out.push_back('>');
            return;
        case Kind::Date: {
            // A date read from an app's file may lie anywhere on the real
            // line: one that no calendar time holds is shown as its seconds.
            const double since1970 = std::floor(date()->secondsSince1970);
            struct tm tm;
            constexpr double kLimit = 1e15;  // far inside time_t, within gmtime's years
            const bool calendar = std::isfinite(since1970) && std::fabs(since1970) < kLimit;
            const time_t seconds = calendar ? static_cast<time_t>(since1970) : 0;
            if (calendar && gmtime_r(&seconds, &tm)) {
                strftime(buffer, sizeof buffer, "%Y-%m-%d %H:%M:%S +0000", &tm);
            } else {
                snprintf(buffer, sizeof buffer, "%g seconds since 1970", date()->secondsSince1970);
            }
            out += buffer;
            return;
        }
        case Kind::Uuid:
            out += uuid()->string();
            return;
        case Kind::Array: {
            const std::string pad(indent * 4 + 4, ' ');
            out += "(\n";
            bool first = true;
            for (const Value& v : *arrayValue()) {
                if (!first) out += ",\n";
                first = false;
                out += pad;
                v.describe(out, indent + 1, false);
            }
            out += "\n" + std::string(indent * 4, ' ') + ")";
            return;
        }
        case Kind::Dictionary: {
            const std::string pad(indent * 4 + 4, ' ');
            out += "{\n";
            for (const auto& [k, v] : *dictionaryValue()) {
                out += pad;
                if (needsQuotes(k))
                    appendQuoted(out, k);
                else
                    out += k;
                out += " = ";
                v.describe(out, indent + 1, false);
                out += ";\n";
            }
            out += std::string(indent * 4, ' ') + "}";
            return;
        }
    }
}

}  // namespace berth
