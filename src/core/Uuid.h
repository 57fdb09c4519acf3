// A 16-byte UUID: the identity of containers (internal UUIDs) and the names
// of container directories (directory UUIDs).
#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace berth {

class Uuid {
  public:
    using Bytes = std::array<uint8_t, 16>;

    // The nil UUID (all zero bytes).
    Uuid() : bytes_{} {}
    explicit Uuid(const Bytes& bytes) : bytes_(bytes) {}

    // A fresh random (version 4) UUID from the kernel's random source.
    static Uuid random();

    // Parses the canonical 8-4-4-4-12 hexadecimal form, either case.
    // Anything else (braces, missing dashes, trailing bytes) yields nullopt.
    static std::optional<Uuid> parse(std::string_view text);

    // The canonical upper-case string, e.g. "1B4E28BA-2FA1-11D2-883F-0016D3CCA427".
    std::string string() const;

    const Bytes& bytes() const { return bytes_; }
    bool isNil() const;

    friend bool operator==(const Uuid&, const Uuid&) = default;
    friend auto operator<=>(const Uuid&, const Uuid&) = default;

  private:
    Bytes bytes_;
};

}  // namespace berth

template <>
struct std::hash<berth::Uuid> {
    size_t operator()(const berth::Uuid& uuid) const noexcept;
};
