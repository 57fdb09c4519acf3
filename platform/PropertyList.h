// Property-list serialization: the binary format "bplist00" (written and
// read) and the XML format (read only).
//
// Stored files live inside directories that apps own, so the reader treats
// its input as hostile: it bounds the input size, the nesting depth and the
// number of objects, rejects object references that form a cycle or point
// outside the object table, and never recurses more deeply than the depth
// bound, so no input can crash, hang or exhaust the process.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "core/Value.h"

namespace berth::plist {

struct Limits {
    size_t maxBytes = 32u << 20;  // larger inputs are rejected unread
    size_t maxDepth = 256;        // arrays and dictionaries nested deeper are rejected
    size_t maxObjects = 1u << 20;
};

// Parses a binary or XML property list. On failure returns nullopt and, when
// `why` is given, a short reason.
std::optional<Value> parse(std::span<const uint8_t> bytes, std::string* why = nullptr,
                           const Limits& limits = {});

// Serializes `value` as a binary property list (format version 1.0).
// Integers above INT64_MAX are kept as unsigned 128-bit integers so they read
// back unchanged. Null and UUID values have no property-list form: nullopt,
// with the reason in `why`.
std::optional<std::vector<uint8_t>> serializeBinary(const Value& value, std::string* why = nullptr);

}  // namespace berth::plist
