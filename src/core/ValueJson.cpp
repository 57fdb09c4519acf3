#include "core/ValueJson.h"

#include "core/Base64.h"

#include <cmath>
#include <cstdint>
#include <limits>
#include <nlohmann/json.hpp>
#include <set>
#include <vector>

#include "core/RelayCodec.h"

namespace berth {

namespace {

using Json = nlohmann::json;

// Wrappers may add one JSON level per Value level (a dictionary inside
// {"dictionary": ...}) plus one around a scalar; deeper text cannot be a
// value the wire could carry, so parsing stops there.
constexpr int kMaxJsonDepth = 2 * relay::kMaxDepth + 1;

constexpr const char* kWrapperNames[] = {"uint64", "int64", "double",    "date",
                                         "uuid",   "data",  "dictionary"};

bool isWrapperName(std::string_view name) {
    for (const char* wrapper : kWrapperNames) {
        if (name == wrapper) return true;
    }
    return false;
}

std::optional<Value::Data> base64Decode(std::string_view text) {
    if (text.size() % 4 != 0) return std::nullopt;
    size_t padding = 0;
    if (!text.empty() && text.back() == '=') padding = text[text.size() - 2] == '=' ? 2 : 1;
    Value::Data out;
    out.reserve(text.size() / 4 * 3);
    for (size_t i = 0; i < text.size(); i += 4) {
        bool last = i + 4 == text.size();
        size_t digits = last ? 4 - padding : 4;
        uint32_t group = 0;
        for (size_t k = 0; k < 4; ++k) {
            int d = k < digits ? base64Digit(text[i + k]) : 0;
            if (d < 0) return std::nullopt;
            group = (group << 6) | static_cast<uint32_t>(d);
        }
        size_t bytes = digits - 1;
        if (bytes < 3 && (group & ((1u << (8 * (3 - bytes))) - 1)) != 0) return std::nullopt;
        for (size_t k = 0; k < bytes; ++k)
            out.push_back(static_cast<uint8_t>(group >> (16 - 8 * k)));
    }
    return out;
}

Json finiteOrName(double d) {
    if (std::isnan(d)) return "nan";
    if (std::isinf(d)) return d > 0 ? "inf" : "-inf";
    return d;
}

std::optional<double> numberOrName(const Json& j) {
    if (j.is_number()) return j.get<double>();
    if (!j.is_string()) return std::nullopt;
    const auto& s = j.get_ref<const std::string&>();
    if (s == "nan") return std::numeric_limits<double>::quiet_NaN();
    if (s == "inf") return std::numeric_limits<double>::infinity();
    if (s == "-inf") return -std::numeric_limits<double>::infinity();
    return std::nullopt;
}

Json toJson(const Value& value) {
    switch (value.kind()) {
        case Value::Kind::Null:
            return nullptr;
        case Value::Kind::Bool:
            return *value.boolValue();
        case Value::Kind::UInt64:
            return *value.uint64Value();
        case Value::Kind::Int64: {
            int64_t i = *value.int64Value();
            // A plain non-negative integer would read back as uint64.
            return i < 0 ? Json(i) : Json{{"int64", i}};
        }
        case Value::Kind::Double: {
            double d = *value.doubleValue();
            return std::isfinite(d) ? Json(d) : Json{{"double", finiteOrName(d)}};
        }
        case Value::Kind::Date:
            return Json{{"date", finiteOrName(value.date()->secondsSince1970)}};
        case Value::Kind::Uuid:
            return Json{{"uuid", value.uuid()->string()}};
        case Value::Kind::Data:
            return Json{{"data", base64Encode(*value.data())}};
        case Value::Kind::String:
            return *value.string();
        case Value::Kind::Array: {
            Json array = Json::array();
            for (const Value& element : *value.arrayValue()) array.push_back(toJson(element));
            return array;
        }
        case Value::Kind::Dictionary: {
            Json object = Json::object();
            for (const auto& [key, element] : *value.dictionaryValue())
                object[key] = toJson(element);
            if (object.size() == 1 && isWrapperName(object.begin().key())) {
                return Json{{"dictionary", std::move(object)}};
            }
            return object;
        }
    }
    return nullptr;
}

std::string escapePointerToken(const std::string& token) {
    std::string out;
    for (char c : token) {
        if (c == '~') {
            out += "~0";
        } else if (c == '/') {
            out += "~1";
        } else {
            out.push_back(c);
        }
    }
    return out;
}

// Converts parsed JSON to a Value, remembering where it went wrong.
class Reader {
  public:
    bool read(const Json& j, Value& out) { return convert(j, 0, out); }
    const std::string& error() const { return error_; }

  private:
    // `depth` counts the Value containers enclosing `j`.
    bool convert(const Json& j, int depth, Value& out) {
        switch (j.type()) {
            case Json::value_t::null:
                out = Value();
                return true;
            case Json::value_t::boolean:
                out = Value(j.get<bool>());
                return true;
            case Json::value_t::string:
                out = Value(j.get<std::string>());
                return true;
            case Json::value_t::number_unsigned:
                out = Value(j.get<uint64_t>());
                return true;
            case Json::value_t::number_integer: {
                int64_t i = j.get<int64_t>();
                out = i < 0 ? Value(i) : Value(static_cast<uint64_t>(i));  // "-0" is 0
                return true;
            }
            case Json::value_t::number_float:
                out = Value(j.get<double>());
                return true;
            case Json::value_t::array:
                return convertArray(j, depth, out);
            case Json::value_t::object:
                if (j.size() == 1 && isWrapperName(j.begin().key())) {
                    return convertWrapper(j.begin().key(), j.begin().value(), depth, out);
                }
                return convertObject(j, depth, out);
            default:
                return fail("not a JSON value");
        }
    }

    bool convertArray(const Json& j, int depth, Value& out) {
        if (depth + 1 > relay::kMaxDepth) return fail("nesting too deep");
        Value::Array array;
        array.reserve(j.size());
        for (size_t i = 0; i < j.size(); ++i) {
            path_.push_back(std::to_string(i));
            if (!convert(j[i], depth + 1, array.emplace_back())) return false;
            path_.pop_back();
        }
        out = Value(std::move(array));
        return true;
    }

    bool convertObject(const Json& j, int depth, Value& out) {
        if (depth + 1 > relay::kMaxDepth) return fail("nesting too deep");
        Value::Dictionary dictionary;
        for (const auto& [key, member] : j.items()) {
            path_.push_back(escapePointerToken(key));
            Value element;
            if (!convert(member, depth + 1, element)) return false;
            path_.pop_back();
            dictionary.emplace(key, std::move(element));
        }
        out = Value(std::move(dictionary));
        return true;
    }

    bool convertWrapper(const std::string& kind, const Json& j, int depth, Value& out) {
        path_.push_back(escapePointerToken(kind));
        bool ok = convertWrapped(kind, j, depth, out);
        path_.pop_back();
        return ok;
    }

    bool convertWrapped(const std::string& kind, const Json& j, int depth, Value& out) {
        if (kind == "uint64") {
            if (!j.is_number_unsigned() && !(j.is_number_integer() && j.get<int64_t>() == 0)) {
                return fail("expected an integer from 0 to 18446744073709551615");
            }
            out = Value(j.get<uint64_t>());
        } else if (kind == "int64") {
            bool fits = j.is_number_integer() &&
                        (!j.is_number_unsigned() ||
                         j.get<uint64_t>() <= uint64_t{std::numeric_limits<int64_t>::max()});
            if (!fits) {
                return fail("expected an integer from -9223372036854775808 to 9223372036854775807");
            }
            out = Value(j.get<int64_t>());
        } else if (kind == "double" || kind == "date") {
            auto d = numberOrName(j);
            if (!d) return fail("expected a number, \"nan\", \"inf\" or \"-inf\"");
            out = kind == "double" ? Value(*d) : Value(Value::Date{*d});
        } else if (kind == "uuid") {
            auto uuid = j.is_string() ? Uuid::parse(j.get_ref<const std::string&>()) : std::nullopt;
            if (!uuid) return fail("expected a UUID string");
            out = Value(*uuid);
        } else if (kind == "data") {
            auto data =
                j.is_string() ? base64Decode(j.get_ref<const std::string&>()) : std::nullopt;
            if (!data) return fail("invalid base64");
            out = Value(std::move(*data));
        } else {
            if (!j.is_object()) return fail("expected an object");
            return convertObject(j, depth, out);
        }
        return true;
    }

    bool fail(const std::string& reason) {
        error_.clear();
        for (const auto& token : path_) error_ += "/" + token;
        error_ += error_.empty() ? reason : ": " + reason;
        return false;
    }

    std::vector<std::string> path_;
    std::string error_;
};

// Thrown from the parser callback to stop at the first member that the typed
// form refuses; caught in valueFromJson and never seen outside this file.
struct Refused {
    std::string reason;
};

// Rejects duplicate member names (JSON parsers keep the last silently) and
// runaway nesting while the text is parsed.
class ParseGuard {
  public:
    bool operator()(int, Json::parse_event_t event, Json& parsed) {
        switch (event) {
            case Json::parse_event_t::object_start:
                members_.emplace_back();
                [[fallthrough]];
            case Json::parse_event_t::array_start:
                if (++depth_ > kMaxJsonDepth) throw Refused{"nesting too deep"};
                break;
            case Json::parse_event_t::object_end:
                members_.pop_back();
                [[fallthrough]];
            case Json::parse_event_t::array_end:
                --depth_;
                break;
            case Json::parse_event_t::key:
                if (!members_.back().insert(parsed.get<std::string>()).second) {
                    throw Refused{"duplicate member \"" + parsed.get<std::string>() + "\""};
                }
                break;
            case Json::parse_event_t::value:
                break;
        }
        return true;
    }

  private:
    int depth_ = 0;
    std::vector<std::set<std::string>> members_;
};

}  // namespace

std::string valueToJson(const Value& value, int indent) {
    return toJson(value).dump(indent, ' ', false, Json::error_handler_t::replace);
}

std::optional<Value> valueFromJson(std::string_view text, std::string* error) {
    Json parsed;
    try {
        ParseGuard guard;
        parsed = Json::parse(text.begin(), text.end(), std::ref(guard));
    } catch (const Refused& refused) {
        if (error) *error = refused.reason;
        return std::nullopt;
    } catch (const Json::exception& e) {
        if (error) {
            // Drop the library's "[json.exception.parse_error.101] " prefix.
            std::string_view what = e.what();
            size_t end = what.find("] ");
            *error = std::string(end == std::string_view::npos ? what : what.substr(end + 2));
        }
        return std::nullopt;
    }
    Reader reader;
    Value value;
    if (!reader.read(parsed, value)) {
        if (error) *error = reader.error();
        return std::nullopt;
    }
    return value;
}

}  // namespace berth
