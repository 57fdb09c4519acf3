#include "core/Base64.h"

#include <algorithm>

namespace berth {

namespace {

constexpr char kBase64Alphabet[] =
    "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

}  // namespace

std::string base64Encode(const std::vector<uint8_t>& data) {
    std::string out;
    out.reserve((data.size() + 2) / 3 * 4);
    for (size_t i = 0; i < data.size(); i += 3) {
        size_t n = std::min<size_t>(3, data.size() - i);
        uint32_t group = uint32_t{data[i]} << 16;
        if (n > 1) group |= uint32_t{data[i + 1]} << 8;
        if (n > 2) group |= data[i + 2];
        for (size_t k = 0; k < 4; ++k) {
            out.push_back(k <= n ? kBase64Alphabet[(group >> (18 - 6 * k)) & 0x3F] : '=');
        }
    }
    return out;
}

int base64Digit(char c) {
    if (c >= 'A' && c <= 'Z') return c - 'A';
    if (c >= 'a' && c <= 'z') return c - 'a' + 26;
    if (c >= '0' && c <= '9') return c - '0' + 52;
    if (c == '+') return 62;
    if (c == '/') return 63;
    return -1;
}

// Strict: padded to a multiple of four, no whitespace, and the bits that
// padding leaves over are zero, so every byte string has one spelling.

}  // namespace berth
