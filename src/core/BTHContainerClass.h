// Container classes. A class is an unsigned 64-bit number; 0 "Undefined" and
// 14 "MAX" are not valid. The name of a class is also the relative path of
// its class directory.
//
//   bundle classes 1, 3, 5, 8     global, user 33 only
//   system classes 12, 13         global, user 499 only
//   per-user classes 2, 4, 6, 7, 9, 10, 11
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <string_view>

namespace berth {

enum BTHContainerClass : uint64_t {
    BTHContainerClassUndefined = 0,
    BTHContainerClassBundleApplication = 1,
    BTHContainerClassDataApplication = 2,
    BTHContainerClassBundleSprocketPlugin = 3,
    BTHContainerClassDataSprocketPlugin = 4,
    BTHContainerClassBundleVPNPlugin = 5,
    BTHContainerClassDataVPNPlugin = 6,
    BTHContainerClassSharedAppGroup = 7,
    BTHContainerClassBundleFramework = 8,
    BTHContainerClassDataRelayService = 9,
    BTHContainerClassDataInternalDaemon = 10,
    BTHContainerClassDataTempDir = 11,
    BTHContainerClassDataSystem = 12,
    BTHContainerClassSharedSystemGroup = 13,
    BTHContainerClassMAX = 14,
};

// Fixed user ids.
inline constexpr uid_t kBTHRootUserId = 0;
inline constexpr uid_t kBTHCallerUserId = 1;  // "the caller's own user" in a request
inline constexpr uid_t kBTHBundleUserId = 33;
inline constexpr uid_t kBTHSystemUserId = 499;
inline constexpr uid_t kBTHLegacyMobileUserId = 501;
// The owner of the items inside system containers, which the system's
// processes reach through the "systemusers" access control entries rather
// than through ownership: the unprivileged "nobody" user and group.
inline constexpr uid_t kBTHNobodyUserId = 65534;

// The class name ("Data/Application"), "Undefined" for 0, "MAX" for 14 and
// an empty view for any other invalid value.
std::string_view BTHContainerClassName(uint64_t containerClass);

inline constexpr bool BTHContainerClassIsValid(uint64_t c) {
    return c >= 1 && c <= 13;
}
inline constexpr bool BTHContainerClassIsBundle(uint64_t c) {
    return c == 1 || c == 3 || c == 5 || c == 8;
}
inline constexpr bool BTHContainerClassIsSystem(uint64_t c) {
    return c == 12 || c == 13;
}
inline constexpr bool BTHContainerClassIsGlobal(uint64_t c) {
    return BTHContainerClassIsBundle(c) || BTHContainerClassIsSystem(c);
}
inline constexpr bool BTHContainerClassIsPerUser(uint64_t c) {
    return BTHContainerClassIsValid(c) && !BTHContainerClassIsGlobal(c);
}
// The classes holding an app's, plug-in's, group's or service's data (not a
// bundle, not a system container).
inline constexpr bool BTHContainerClassIsData(uint64_t c) {
    return c == 2 || c == 4 || c == 6 || c == 7 || c == 9 || c == 10 || c == 11;
}

// The file inside every container that holds its metadata record. The file
// operations leave it alone when they standardize a container's contents, so
// it is part of the layout every layer knows.
inline constexpr const char* kBTHMetadataFileName = ".sys.kelp.berth.metadata.plist";

// The only user a global class admits (33 or 499); for per-user and invalid
// classes, nullopt-like 0.
inline constexpr uid_t BTHContainerClassGlobalUser(uint64_t c) {
    return BTHContainerClassIsBundle(c) ? kBTHBundleUserId
                                        : (BTHContainerClassIsSystem(c) ? kBTHSystemUserId : 0);
}

}  // namespace berth
