// Pieces shared by the binary and XML property-list formats. Not part of the
// interface; include platform/PropertyList.h instead.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "platform/PropertyList.h"

namespace berth::plist::detail {

// Property-list dates count seconds from 2001-01-01 00:00:00 UTC; Value::Date
// counts from 1970.
inline constexpr double kSecondsFrom1970To2001 = 978307200.0;

// Each format's reader: `bytes` is already known to be within
// limits.maxBytes. Failures set *why (when given) and return nullopt.
std::optional<Value> parseBinary(std::span<const uint8_t> bytes, const Limits& limits,
                                 std::string* why);
std::optional<Value> parseXml(std::span<const uint8_t> bytes, const Limits& limits,
                              std::string* why);

// Charges a reader's output against the limits; once a charge fails every
// later one fails too.
class Budget {
  public:
    explicit Budget(const Limits& limits) : limits_(limits) {}

    // One more value (or dictionary key); false when over the bound.
    bool addValues(size_t count) {
        if (count > limits_.maxObjects - values_) return false;
        values_ += count;
        return true;
    }
    // `count` more bytes of text or data; false when over the bound.
    bool addBytes(size_t count) {
        if (count > limits_.maxValueBytes - bytes_) return false;
        bytes_ += count;
        return true;
    }
    size_t valuesLeft() const { return limits_.maxObjects - values_; }

  private:
    const Limits& limits_;
    size_t values_ = 0;
    size_t bytes_ = 0;
};

// Appends the UTF-8 form of `codePoint`, which must be a Unicode scalar
// value (at most 0x10FFFF, not a surrogate).
void appendUtf8(std::string& out, char32_t codePoint);

// Decodes one scalar value of strict UTF-8 (shortest form, no surrogates, at
// most 0x10FFFF) starting at `text[*at]` and advances *at past it; false on
// malformed input.
bool decodeUtf8(std::string_view text, size_t* at, char32_t* codePoint);

bool isValidUtf8(std::string_view text);

}  // namespace berth::plist::detail
