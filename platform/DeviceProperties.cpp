#include "platform/DeviceProperties.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <optional>
#include <vector>

#include "platform/DeviceRoot.h"
#include "platform/PropertyList.h"
#include "platform/UniqueFd.h"

namespace berth {

namespace {

constexpr size_t kMaxPropertiesSize = 1 << 20;

std::optional<Value> readProperties() {
    const auto path = DeviceRoot::resolve("/etc/berthd/DeviceProperties.plist");
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
    if (!fd) return std::nullopt;
    struct stat st;
    if (::fstat(fd.get(), &st) != 0 || !S_ISREG(st.st_mode) ||
        static_cast<size_t>(st.st_size) > kMaxPropertiesSize)
        return std::nullopt;
    std::vector<uint8_t> bytes(static_cast<size_t>(st.st_size));
    size_t got = 0;
    while (got < bytes.size()) {
        ssize_t n = ::read(fd.get(), bytes.data() + got, bytes.size() - got);
        if (n <= 0) return std::nullopt;
        got += static_cast<size_t>(n);
    }
    return plist::parse(bytes);
}

bool boolProperty(const char* key) {
    std::optional<Value> properties = readProperties();
    if (!properties) return false;
    const Value* v = properties->find(key);
    return v && v->boolValue() && *v->boolValue();
}

}  // namespace

bool DeviceProperties::isInternalBuild() {
    return boolProperty("InternalBuild");
}

bool DeviceProperties::isMultiUser() {
    return boolProperty("MultiUser");
}

uint32_t DeviceProperties::multiUserFlags() {
    return isMultiUser() ? (1u << 31) : 0;
}

}  // namespace berth
