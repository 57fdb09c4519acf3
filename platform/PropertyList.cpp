#include "platform/PropertyList.h"

namespace berth::plist {

std::optional<Value> parse(std::span<const uint8_t>, std::string* why, const Limits&) {
    if (why) *why = "property-list reader not built yet";
    return std::nullopt;
}

std::optional<std::vector<uint8_t>> serializeBinary(const Value&, std::string* why) {
    if (why) *why = "property-list writer not built yet";
    return std::nullopt;
}

}  // namespace berth::plist
