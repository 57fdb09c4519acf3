// The password and group databases of the device. On the host ("/" as device
// root) they are the system's own (NSS); on a scratch device root they are
// the root's etc/passwd and etc/group files, whose home directories are
// device paths and so resolve under the device root.
#pragma once

#include <sys/types.h>

#include <filesystem>
#include <optional>
#include <string>
#include <string_view>

namespace berth {

struct UserRecord {
    std::string name;
    uid_t uid = 0;
    gid_t gid = 0;
    std::filesystem::path home;  // as the host sees it (under the device root)
};

class UserDatabase {
  public:
    static std::optional<UserRecord> userById(uid_t uid);
    static std::optional<UserRecord> userByName(std::string_view name);
    static std::optional<gid_t> groupIdByName(std::string_view name);
};

}  // namespace berth
