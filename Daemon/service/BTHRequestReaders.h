// The readers every command handler uses to take values out of a request.
// A missing key, or a value of another kind, reads as the type's empty
// answer: none for strings, UUIDs and objects, 0 for integers, false for
// booleans.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "BTHClientConnection.h"
#include "core/Uuid.h"
#include "core/Value.h"

namespace berth {

std::optional<std::string> BTHRequestString(const Value& request, std::string_view key);
std::optional<Uuid> BTHRequestUUID(const Value& request, std::string_view key);
// "Identifier", or the client's own identifier when the request names none.
std::optional<std::string> BTHRequestIdentifier(const Value& request,
                                                const BTHClientConnection& client);
// Any value as a property-list object (null and UUID values are not
// property-list objects and read as none).
std::optional<Value> BTHRequestObject(const Value& request, std::string_view key);
uint64_t BTHRequestUInt64(const Value& request, std::string_view key);
bool BTHRequestBool(const Value& request, std::string_view key);

}  // namespace berth
