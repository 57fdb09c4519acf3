#include "platform/UserDatabase.h"

#include <grp.h>
#include <pwd.h>

#include <charconv>
#include <fstream>
#include <functional>
#include <vector>

#include "platform/DeviceRoot.h"

namespace berth {

namespace {

// Splits one line of a colon-separated database file.
std::vector<std::string_view> fields(std::string_view line) {
    std::vector<std::string_view> out;
    size_t start = 0;
    while (true) {
        size_t colon = line.find(':', start);
        out.push_back(line.substr(start, colon == std::string_view::npos ? colon : colon - start));
        if (colon == std::string_view::npos) return out;
        start = colon + 1;
    }
}

std::optional<uint32_t> number(std::string_view text) {
    uint32_t value = 0;
    auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), value);
    if (ec != std::errc() || end != text.data() + text.size() || text.empty()) return std::nullopt;
    return value;
}

// The first well-formed passwd line for which `match` holds. Lines with too
// few fields or non-numeric ids are skipped, as the system's parser does.
std::optional<UserRecord> scanPasswd(const std::function<bool(const UserRecord&)>& match) {
    std::ifstream in(DeviceRoot::resolve("/etc/passwd"));
    std::string line;
    while (std::getline(in, line)) {
        if (line.empty() || line[0] == '#') continue;
        auto f = fields(line);
        if (f.size() < 7 || f[0].empty()) continue;
        auto uid = number(f[2]), gid = number(f[3]);
        if (!uid || !gid) continue;
        UserRecord record{std::string(f[0]), *uid, *gid, {}};
        if (!f[5].empty()) record.home = DeviceRoot::resolve(f[5]);
        if (match(record)) return record;
    }
    return std::nullopt;
}

std::optional<UserRecord> fromPasswd(const struct passwd* pw) {
    if (!pw) return std::nullopt;
    return UserRecord{pw->pw_name ? pw->pw_name : "", pw->pw_uid, pw->pw_gid,
                      pw->pw_dir ? std::filesystem::path(pw->pw_dir) : std::filesystem::path()};
}

std::vector<char> lookupBuffer() {
    return std::vector<char>(16384);
}

}  // namespace

std::optional<UserRecord> UserDatabase::userById(uid_t uid) {
    if (!DeviceRoot::isHost())
        return scanPasswd([uid](const UserRecord& r) { return r.uid == uid; });
    struct passwd pw, *result = nullptr;
    std::vector<char> buffer = lookupBuffer();
    if (getpwuid_r(uid, &pw, buffer.data(), buffer.size(), &result) != 0) return std::nullopt;
    return fromPasswd(result);
}

std::optional<UserRecord> UserDatabase::userByName(std::string_view name) {
    if (!DeviceRoot::isHost())
        return scanPasswd([name](const UserRecord& r) { return r.name == name; });
    struct passwd pw, *result = nullptr;
    std::vector<char> buffer = lookupBuffer();
    std::string key(name);
    if (getpwnam_r(key.c_str(), &pw, buffer.data(), buffer.size(), &result) != 0)
        return std::nullopt;
    return fromPasswd(result);
}

std::optional<gid_t> UserDatabase::groupIdByName(std::string_view name) {
    if (DeviceRoot::isHost()) {
        struct group gr, *result = nullptr;
        std::vector<char> buffer = lookupBuffer();
        std::string key(name);
        if (getgrnam_r(key.c_str(), &gr, buffer.data(), buffer.size(), &result) != 0 || !result)
            return std::nullopt;
        return result->gr_gid;
    }
    std::ifstream in(DeviceRoot::resolve("/etc/group"));
    std::string line;
    while (std::getline(in, line)) {
        if (line.empty() || line[0] == '#') continue;
        auto f = fields(line);
        if (f.size() < 3 || f[0] != name) continue;
        if (auto gid = number(f[2])) return *gid;
    }
    return std::nullopt;
}

}  // namespace berth
