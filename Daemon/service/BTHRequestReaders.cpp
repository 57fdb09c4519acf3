#include "BTHRequestReaders.h"

namespace berth {

namespace {

bool isPropertyListObject(const Value& v) {
    switch (v.kind()) {
        case Value::Kind::Null:
        case Value::Kind::Uuid:
            return false;
        case Value::Kind::Array:
            for (const Value& e : *v.arrayValue())
                if (!isPropertyListObject(e)) return false;
            return true;
        case Value::Kind::Dictionary:
            for (const auto& [k, e] : *v.dictionaryValue())
                if (!isPropertyListObject(e)) return false;
            return true;
        default:
            return true;
    }
}

}  // namespace

std::optional<std::string> BTHRequestString(const Value& request, std::string_view key) {
    const Value* v = request.find(key);
    if (!v || !v->string()) return std::nullopt;
    return *v->string();
}

std::optional<Uuid> BTHRequestUUID(const Value& request, std::string_view key) {
    const Value* v = request.find(key);
    if (!v || !v->uuid()) return std::nullopt;
    return *v->uuid();
}

std::optional<std::string> BTHRequestIdentifier(const Value& request,
                                                const BTHClientConnection& client) {
    if (auto identifier = BTHRequestString(request, "Identifier")) return identifier;
    return client.clientBundleIdentifier();
}

std::optional<Value> BTHRequestObject(const Value& request, std::string_view key) {
    const Value* v = request.find(key);
    if (!v || !isPropertyListObject(*v)) return std::nullopt;
    return *v;
}

uint64_t BTHRequestUInt64(const Value& request, std::string_view key) {
    const Value* v = request.find(key);
    return v && v->isInteger() ? *v->uint64Value() : 0;
}

bool BTHRequestBool(const Value& request, std::string_view key) {
    const Value* v = request.find(key);
    return v && v->boolValue() && *v->boolValue();
}

}  // namespace berth
