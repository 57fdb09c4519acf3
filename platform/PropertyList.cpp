#include "platform/PropertyList.h"

#include <cstring>

#include "platform/PropertyListInternal.h"

namespace berth::plist {

namespace {

bool startsWith(std::span<const uint8_t> bytes, const char* prefix) {
    const size_t n = std::strlen(prefix);
    return bytes.size() >= n && std::memcmp(bytes.data(), prefix, n) == 0;
}

}  // namespace

std::optional<Value> parse(std::span<const uint8_t> bytes, std::string* why, const Limits& limits) {
    if (bytes.size() > limits.maxBytes) {
        if (why) *why = "input too large";
        return std::nullopt;
    }
    if (startsWith(bytes, "bplist00")) return detail::parseBinary(bytes, limits, why);
    if (startsWith(bytes, "bplist")) {
        if (why) *why = "unsupported binary property-list version";
        return std::nullopt;
    }
    return detail::parseXml(bytes, limits, why);
}

namespace detail {

void appendUtf8(std::string& out, char32_t cp) {
    if (cp < 0x80) {
        out += static_cast<char>(cp);
    } else if (cp < 0x800) {
        out += static_cast<char>(0xC0 | (cp >> 6));
        out += static_cast<char>(0x80 | (cp & 0x3F));
    } else if (cp < 0x10000) {
        out += static_cast<char>(0xE0 | (cp >> 12));
        out += static_cast<char>(0x80 | ((cp >> 6) & 0x3F));
        out += static_cast<char>(0x80 | (cp & 0x3F));
    } else {
        out += static_cast<char>(0xF0 | (cp >> 18));
        out += static_cast<char>(0x80 | ((cp >> 12) & 0x3F));
        out += static_cast<char>(0x80 | ((cp >> 6) & 0x3F));
        out += static_cast<char>(0x80 | (cp & 0x3F));
    }
}

bool decodeUtf8(std::string_view text, size_t* at, char32_t* codePoint) {
    const auto byte = [&](size_t i) { return static_cast<uint8_t>(text[i]); };
    const size_t i = *at;
    const uint8_t lead = byte(i);
    size_t length;
    char32_t cp, minimum;
    if (lead < 0x80) {
        *codePoint = lead;
        *at = i + 1;
        return true;
    } else if ((lead & 0xE0) == 0xC0) {
        length = 2, cp = lead & 0x1F, minimum = 0x80;
    } else if ((lead & 0xF0) == 0xE0) {
        length = 3, cp = lead & 0x0F, minimum = 0x800;
    } else if ((lead & 0xF8) == 0xF0) {
        length = 4, cp = lead & 0x07, minimum = 0x10000;
    } else {
        return false;
    }
    if (text.size() - i < length) return false;
    for (size_t k = 1; k < length; ++k) {
        if ((byte(i + k) & 0xC0) != 0x80) return false;
        cp = (cp << 6) | (byte(i + k) & 0x3F);
    }
    if (cp < minimum || cp > 0x10FFFF || (cp >= 0xD800 && cp <= 0xDFFF)) return false;
    *codePoint = cp;
    *at = i + length;
    return true;
}

bool isValidUtf8(std::string_view text) {
    size_t at = 0;
    char32_t cp;
    while (at < text.size())
        if (!decodeUtf8(text, &at, &cp)) return false;
    return true;
}

}  // namespace detail

}  // namespace berth::plist
