// Arbitrary bytes to the property-list reader. Apps can put anything in the
// state files inside their containers: no input may crash, hang or exhaust
// the reader, and whatever it accepts must be writable and read back as the
// same value, so the daemon can always store again what it loaded.
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "platform/PropertyList.h"

namespace {

using berth::Value;

// Value equality, except that NaN equals NaN and dates may differ by the
// rounding of moving them between the two epochs.
bool sameValue(const Value& a, const Value& b) {
    if (a.kind() == Value::Kind::Double && b.kind() == Value::Kind::Double) {
        const double x = *a.doubleValue(), y = *b.doubleValue();
        return x == y || (std::isnan(x) && std::isnan(y));
    }
    if (a.isDate() && b.isDate()) {
        const double x = a.date()->secondsSince1970, y = b.date()->secondsSince1970;
        const double scale = std::fmax(std::fmax(std::fabs(x), std::fabs(y)), 1e9);
        return x == y || (std::isnan(x) && std::isnan(y)) || std::fabs(x - y) <= scale * 1e-15;
    }
    if (a.isArray() && b.isArray()) {
        if (a.size() != b.size()) return false;
        for (size_t i = 0; i < a.size(); ++i)
            if (!sameValue((*a.arrayValue())[i], (*b.arrayValue())[i])) return false;
        return true;
    }
    if (a.isDictionary() && b.isDictionary()) {
        if (a.size() != b.size()) return false;
        for (const auto& [key, value] : *a.dictionaryValue()) {
            const Value* other = b.find(key);
            if (!other || !sameValue(value, *other)) return false;
        }
        return true;
    }
    return a == b;
}

[[noreturn]] void finding(const char* what, const std::string& detail) {
    std::fprintf(stderr, "%s: %s\n", what, detail.c_str());
    std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string why;
    std::optional<Value> value = berth::plist::parse({data, size}, &why);
    if (!value) return 0;
    std::optional<std::vector<uint8_t>> bytes = berth::plist::serializeBinary(*value, &why);
    if (!bytes) finding("an accepted value does not serialize", why);
    std::optional<Value> back = berth::plist::parse(*bytes, &why);
    if (!back) finding("a serialized value does not parse", why);
    if (!sameValue(*value, *back))
        finding("the value changed on the round trip",
                value->description() + "\n    became\n" + back->description());
    return 0;
}
