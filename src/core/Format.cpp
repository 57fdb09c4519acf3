#include "core/Format.h"

#include <cinttypes>
#include <cstdio>

namespace berth {

int64_t FormatArg::asSigned() const {
    switch (kind_) {
        case Kind::Signed:
            return signed_;
        case Kind::Unsigned:
            return static_cast<int64_t>(unsigned_);
        case Kind::Double:
            return static_cast<int64_t>(double_);
        case Kind::Pointer:
            return static_cast<int64_t>(reinterpret_cast<uintptr_t>(pointer_));
        case Kind::Text:
            return 0;
    }
    return 0;
}

uint64_t FormatArg::asUnsigned() const {
    return static_cast<uint64_t>(asSigned());
}

double FormatArg::asDouble() const {
    switch (kind_) {
        case Kind::Signed:
            return static_cast<double>(signed_);
        case Kind::Unsigned:
            return static_cast<double>(unsigned_);
        case Kind::Double:
            return double_;
        default:
            return 0;
    }
}

std::string FormatArg::asText() const {
    char buffer[64];
    switch (kind_) {
        case Kind::Signed:
            snprintf(buffer, sizeof buffer, "%" PRId64, signed_);
            return buffer;
        case Kind::Unsigned:
            snprintf(buffer, sizeof buffer, "%" PRIu64, unsigned_);
            return buffer;
        case Kind::Double:
            snprintf(buffer, sizeof buffer, "%g", double_);
            return buffer;
        case Kind::Pointer:
            if (!pointer_) return "(null)";
            snprintf(buffer, sizeof buffer, "%p", pointer_);
            return buffer;
        case Kind::Text:
            return text_;
    }
    return {};
}

namespace {

struct Conversion {
    std::string flags;
    std::string width;
    std::string precision;  // including the dot, if any
    std::string length;
    char letter = 0;
};

// Parses one conversion starting after '%'; returns the index after it, or
// npos if the format ends inside the conversion.
size_t parseConversion(std::string_view f, size_t i, Conversion& conversion) {
    while (i < f.size() && std::string_view("-+ #0'").find(f[i]) != std::string_view::npos)
        conversion.flags.push_back(f[i++]);
    while (i < f.size() && isdigit(static_cast<unsigned char>(f[i])))
        conversion.width.push_back(f[i++]);
    if (i < f.size() && f[i] == '.') {
        conversion.precision.push_back(f[i++]);
        while (i < f.size() && isdigit(static_cast<unsigned char>(f[i])))
            conversion.precision.push_back(f[i++]);
    }
    while (i < f.size() && std::string_view("hlqjzt").find(f[i]) != std::string_view::npos)
        conversion.length.push_back(f[i++]);
    if (i >= f.size()) return std::string_view::npos;
    conversion.letter = f[i];
    return i + 1;
}

// Bits kept by an integer conversion with this length modifier, as C would
// read an argument of the matching type.
int integerBits(const std::string& length) {
    if (length == "hh") return 8;
    if (length == "h") return 16;
    if (length.empty()) return 32;
    return 64;
}

std::string formatInteger(const Conversion& conversion, const FormatArg& arg) {
    const int bits = integerBits(conversion.length);
    const bool isSigned = conversion.letter == 'd' || conversion.letter == 'i';
    const std::string base = "%" + conversion.flags + conversion.width + conversion.precision;
    char buffer[128];
    if (isSigned) {
        int64_t v = arg.asSigned();
        if (bits == 8) v = static_cast<int8_t>(v);
        if (bits == 16) v = static_cast<int16_t>(v);
        if (bits == 32) v = static_cast<int32_t>(v);
        snprintf(buffer, sizeof buffer, (base + "lld").c_str(), static_cast<long long>(v));
    } else {
        uint64_t v = arg.asUnsigned();
        if (bits < 64) v &= (uint64_t{1} << bits) - 1;
        snprintf(buffer, sizeof buffer, (base + "ll" + conversion.letter).c_str(),
                 static_cast<unsigned long long>(v));
    }
    return buffer;
}

std::string formatText(const Conversion& conversion, const std::string& text) {
    if (conversion.width.empty() && conversion.precision.empty()) return text;
    int size =
        snprintf(nullptr, 0,
                 ("%" + conversion.flags + conversion.width + conversion.precision + "s").c_str(),
                 text.c_str());
    std::string out(static_cast<size_t>(size) + 1, '\0');
    snprintf(out.data(), out.size(),
             ("%" + conversion.flags + conversion.width + conversion.precision + "s").c_str(),
             text.c_str());
    out.resize(static_cast<size_t>(size));
    return out;
}

std::string formatOne(const Conversion& conversion, const FormatArg& arg) {
    char buffer[512];
    switch (conversion.letter) {
        case 'd':
        case 'i':
        case 'u':
        case 'x':
        case 'X':
        case 'o':
            if (arg.kind() == FormatArg::Kind::Text) return formatText(conversion, arg.asText());
            return formatInteger(conversion, arg);
        case 'c':
            return std::string(1, static_cast<char>(arg.asSigned()));
        case 'f':
        case 'F':
        case 'g':
        case 'G':
        case 'e':
        case 'E':
            snprintf(buffer, sizeof buffer,
                     ("%" + conversion.flags + conversion.width + conversion.precision +
                      conversion.letter)
                         .c_str(),
                     arg.asDouble());
            return buffer;
        case 'p':
            if (!arg.asPointer() && arg.kind() == FormatArg::Kind::Pointer) return "0x0";
            snprintf(buffer, sizeof buffer, "%p", arg.asPointer());
            return buffer;
        case 's':
        case '@':
        default:
            return formatText(conversion, arg.asText());
    }
}

}  // namespace

std::string formatv(std::string_view format, std::span<const FormatArg> args) {
    std::string out;
    out.reserve(format.size() + 32);
    size_t next = 0;
    for (size_t i = 0; i < format.size();) {
        char c = format[i];
        if (c != '%') {
            out.push_back(c);
            ++i;
            continue;
        }
        if (i + 1 < format.size() && format[i + 1] == '%') {
            out.push_back('%');
            i += 2;
            continue;
        }
        Conversion conversion;
        size_t end = parseConversion(format, i + 1, conversion);
        if (end == std::string_view::npos) {
            out.append(format.substr(i));
            break;
        }
        if (next < args.size()) out += formatOne(conversion, args[next]);
        ++next;
        i = end;
    }
    return out;
}

}  // namespace berth
