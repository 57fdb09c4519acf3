// The message formatter. Every log line and error text of the system is
// written as a printf-style format with "%@" for objects, so the texts in the
// code read exactly as they are defined. This formatter accepts those formats
// verbatim and is type-safe: each argument is captured with its type, so a
// mismatch between a conversion and an argument can never read stray memory.
//
// Conversions: %@ takes any describable argument (anything with a
// description() member, strings, paths, UUIDs, integers, shared or optional
// holders of those; an empty holder prints "(null)"). %d %i %u %x %X %o %c
// take integers with the usual length modifiers (hh h l ll z j t q), which
// truncate as C would; %f %g %e take numbers; %s takes a C string, a string
// or a path; %p takes a pointer; %% is a percent sign. Flags, width and
// precision work as in printf. An argument of the wrong family is converted
// (a number under %s prints its digits); a missing argument prints nothing.
#pragma once

#include <concepts>
#include <cstdint>
#include <filesystem>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <type_traits>

#include "core/Uuid.h"

namespace berth {

template <typename T>
concept Describable = requires(const T& t) {
    { t.description() } -> std::convertible_to<std::string>;
};

// One captured argument.
class FormatArg {
  public:
    enum class Kind { Signed, Unsigned, Double, Text, Pointer };

    template <typename T>
    requires(std::is_integral_v<T>&& std::is_signed_v<T>) FormatArg(T v)
        : kind_(Kind::Signed), signed_(v) {}
    template <typename T>
    requires(std::is_integral_v<T>&& std::is_unsigned_v<T> && !std::is_same_v<T, bool>)
        FormatArg(T v)
        : kind_(Kind::Unsigned), unsigned_(v) {}
    FormatArg(bool v) : kind_(Kind::Signed), signed_(v ? 1 : 0) {}
    FormatArg(double v) : kind_(Kind::Double), double_(v) {}
    FormatArg(float v) : kind_(Kind::Double), double_(v) {}
    FormatArg(const char* s) : kind_(s ? Kind::Text : Kind::Pointer), text_(s ? s : "(null)") {}
    FormatArg(char* s) : FormatArg(static_cast<const char*>(s)) {}
    FormatArg(const std::string& s) : kind_(Kind::Text), text_(s) {}
    FormatArg(std::string_view s) : kind_(Kind::Text), text_(s) {}
    FormatArg(const std::filesystem::path& p) : kind_(Kind::Text), text_(p.string()) {}
    FormatArg(const Uuid& u) : kind_(Kind::Text), text_(u.string()) {}
    FormatArg(std::nullptr_t) : kind_(Kind::Pointer), text_("(null)") {}
    FormatArg(const void* p) : kind_(Kind::Pointer), pointer_(p), text_(p ? "" : "(null)") {}
    template <Describable T>
    FormatArg(const T& object) : kind_(Kind::Text), text_(object.description()) {}
    template <typename T>
    FormatArg(const std::shared_ptr<T>& holder)
        : FormatArg(holder ? FormatArg(*holder) : FormatArg(nullptr)) {}
    template <typename T>
    FormatArg(const std::optional<T>& holder)
        : FormatArg(holder ? FormatArg(*holder) : FormatArg(nullptr)) {}

    Kind kind() const { return kind_; }
    int64_t asSigned() const;
    uint64_t asUnsigned() const;
    double asDouble() const;
    // The text of %@ and %s.
    std::string asText() const;
    const void* asPointer() const { return pointer_; }

  private:
    Kind kind_;
    int64_t signed_ = 0;
    uint64_t unsigned_ = 0;
    double double_ = 0;
    const void* pointer_ = nullptr;
    std::string text_;
};

std::string formatv(std::string_view format, std::span<const FormatArg> args);

template <typename... Args>
std::string format(std::string_view fmt, const Args&... args) {
    if constexpr (sizeof...(Args) == 0) {
        return formatv(fmt, {});
    } else {
        const FormatArg captured[] = {FormatArg(args)...};
        return formatv(fmt, captured);
    }
}

}  // namespace berth
