// Property-list serialization: the binary format "bplist00" (written and
// read) and the XML format (read only).
//
// Stored files live inside directories that apps own, so the reader treats
// its input as hostile: it bounds the input size, the nesting depth, the
// number of values and the bytes of text and data it produces, rejects object
// references that form a cycle or point outside the object table, and never
// recurses, so no input can crash, hang or exhaust the process. Shared
// references (one object used in several places) are legal in the binary
// format; every use counts against the bounds, so a small file cannot expand
// into a huge value.
//
// What the reader accepts:
// - binary: version "bplist00"; booleans, integers of 1, 2, 4 and 8 bytes
//   (8 signed) and of 16 bytes when the value fits 64 unsigned bits, reals of
//   4 and 8 bytes, dates, data, ASCII and UTF-16 strings, arrays, and
//   dictionaries with string keys. Null, fill, UID, set and later-version
//   objects are rejected.
// - XML: an optional XML declaration, comments, processing instructions and
//   a document type without internal subset, then one value, wrapped in
//   <plist> or bare; <dict>, <key>, <array>, <string>, <integer> (decimal or
//   0x hexadecimal, -2^63 to 2^64-1), <real>, <true/>, <false/>,
//   <date> (YYYY-MM-DDTHH:MM:SS[.fraction]Z, UTC) and <data> (base64,
//   whitespace ignored), the empty-element forms, the five predefined
//   entities, character references and CDATA sections. Text must be UTF-8.
// In both formats a dictionary with a repeated key is rejected.
//
// Read values are typed as follows: integers are Int64 when they fit, else
// UInt64 (Value compares integers by value, so the kind a value was written
// with does not matter); dates are seconds since 1970; strings are UTF-8.
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
    // Values in the result, dictionary keys included and a shared object
    // counted at every use; also the largest object table a binary file may
    // declare.
    size_t maxObjects = 1u << 20;
    // Bytes of strings, keys and data in the result, counted at every use.
    size_t maxValueBytes = 64u << 20;
};

// Parses a binary or XML property list. On failure returns nullopt and, when
// `why` is given, a short reason.
std::optional<Value> parse(std::span<const uint8_t> bytes, std::string* why = nullptr,
                           const Limits& limits = {});

// Serializes `value` as a binary property list (format version 1.0).
// Non-negative integers take the smallest of 1, 2, 4 and 8 bytes, negative
// ones 8, and integers above INT64_MAX are kept as unsigned 128-bit integers
// so they read back unchanged. Strings are ASCII when they are, else UTF-16.
// Dictionary keys are written in order and equal strings are stored once, so
// equal values give identical bytes.
//
// Only what parse() accepts with the default limits is written: null and
// UUID values (which have no property-list form), strings that are not
// UTF-8, and values nested, counted or sized beyond the default limits give
// nullopt, with the reason in `why`.
std::optional<std::vector<uint8_t>> serializeBinary(const Value& value, std::string* why = nullptr);

}  // namespace berth::plist
