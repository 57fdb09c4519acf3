#include "BTHPathStrings.h"

#include <cstring>

namespace berth {

bool containsDotDotPathComponents(std::string_view path) {
    while (!path.empty()) {
        const size_t slash = path.find('/');
        if (path.substr(0, slash) == "..") return true;
        if (slash == std::string_view::npos) break;
        path.remove_prefix(slash + 1);
    }
    return false;
}

std::optional<std::string> stringWithFileSystemRepresentation(const char* bytes) {
    if (!bytes) return std::nullopt;
    return std::string(bytes);
}

std::optional<std::string> stringWithFileSystemRepresentation(const char* bytes, size_t length) {
    if (length == 0) return std::string();
    if (!bytes || std::memchr(bytes, '\0', length)) return std::nullopt;
    return std::string(bytes, length);
}

}  // namespace berth
