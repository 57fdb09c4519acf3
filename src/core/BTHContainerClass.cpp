#include "core/BTHContainerClass.h"

namespace berth {

std::string_view BTHContainerClassName(uint64_t containerClass) {
    static constexpr std::string_view kNames[] = {
        "Undefined",
        "Bundle/Application",
        "Data/Application",
        "Bundle/SprocketPlugin",
        "Data/SprocketPlugin",
        "Bundle/VPNPlugin",
        "Data/VPNPlugin",
        "Shared/AppGroup",
        "Bundle/Framework",
        "Data/RelayService",
        "Data/InternalDaemon",
        "Data/TempDir",
        "Data/System",
        "Shared/SystemGroup",
        "MAX",
    };
    return containerClass < std::size(kNames) ? kNames[containerClass] : std::string_view();
}

}  // namespace berth
