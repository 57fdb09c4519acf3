// Base64 (the standard alphabet, with padding), shared by the XML property
// lists and the typed JSON form, whose decoders differ only in what they
// tolerate around the digits.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace berth {

// The value of one base64 digit, or -1 for any other character.
int base64Digit(char c);

// The padded base64 text of `data`.
std::string base64Encode(const std::vector<uint8_t>& data);

}  // namespace berth
