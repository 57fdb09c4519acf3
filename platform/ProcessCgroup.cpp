#include "platform/ProcessCgroup.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <vector>

#include "platform/ExecutableIdentity.h"
#include "platform/LaunchCgroup.h"
#include "platform/RootOwnedFiles.h"

namespace berth {

namespace {

constexpr size_t kMaxCgroupFile = 64 * 1024;
constexpr size_t kLaunchNameLength = 32;

std::vector<std::string_view> componentsOf(std::string_view path) {
    std::vector<std::string_view> parts;
    while (!path.empty()) {
        const size_t slash = path.find('/');
        parts.push_back(path.substr(0, slash));
        if (slash == std::string_view::npos) break;
        path.remove_prefix(slash + 1);
        if (path.empty()) parts.emplace_back();  // a trailing slash: an empty component
    }
    return parts;
}

bool endsWith(std::string_view text, std::string_view suffix) {
    return text.size() > suffix.size() && text.substr(text.size() - suffix.size()) == suffix;
}

std::optional<std::string> readSmallFile(const std::string& path, std::string* why,
                                         int directory = AT_FDCWD) {
    UniqueFd fd(::openat(directory, path.c_str(), O_RDONLY | O_CLOEXEC));
    if (!fd) {
        *why = "cannot open " + path + ": " + strerror(errno);
        return std::nullopt;
    }
    std::string text;
    char buffer[4096];
    for (;;) {
        const ssize_t n = ::read(fd.get(), buffer, sizeof buffer);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) {
            *why = "cannot read " + path + ": " + strerror(errno);
            return std::nullopt;
        }
        if (n == 0) return text;
        text.append(buffer, static_cast<size_t>(n));
        if (text.size() > kMaxCgroupFile) {
            *why = path + " is too long";
            return std::nullopt;
        }
    }
}

// The group open at `fd` (at `path`) and its "cgroup.procs" are root's
// alone; both are recorded in `basis`, if given.
bool isTrustedLevel(int fd, const std::filesystem::path& path, const std::string& shown,
                    std::string* why, IdentityBasis* basis) {
    struct stat status {};
    if (::fstat(fd, &status) != 0 || !S_ISDIR(status.st_mode) || !isRootsAlone(status)) {
        *why = "the control group " + shown + " is not root's alone";
        return false;
    }
    struct stat procs {};
    if (::fstatat(fd, "cgroup.procs", &procs, AT_SYMLINK_NOFOLLOW) != 0 || !isRootsAlone(procs)) {
        *why = "processes can be moved into " + shown + " by users other than root";
        return false;
    }
    if (basis) {
        basis->record(path, status);
        basis->record(path / "cgroup.procs", procs);
    }
    return true;
}

}  // namespace

std::optional<std::string> unifiedCgroupIn(std::string_view text) {
    while (!text.empty()) {
        const size_t end = text.find('\n');
        const std::string_view line = text.substr(0, end);
        if (line.starts_with("0::/")) return std::string(line.substr(4));
        if (end == std::string_view::npos) break;
        text.remove_prefix(end + 1);
    }
    return std::nullopt;
}

std::optional<std::string> cgroupOfProcess(pid_t pid, int pidfd, std::string* why) {
    if (pid <= 0) {
        *why = "invalid pid " + std::to_string(pid);
        return std::nullopt;
    }
    std::optional<std::string> path = cgroupShownFor(pid, why);
    if (!path) return std::nullopt;
    // Only now is it known that the pid still named the pidfd's process.
    if (!pidfdRefersTo(pidfd, pid, why)) return std::nullopt;
    return path;
}

namespace {

// The unified group in the cgroup file at `path` (relative to `directory`),
// of the process `subject` names in the reason when there is none.
std::optional<std::string> cgroupInFile(int directory, const std::string& path,
                                        const std::string& subject, std::string* why) {
    const std::optional<std::string> text = readSmallFile(path, why, directory);
    if (!text) return std::nullopt;
    std::optional<std::string> group = unifiedCgroupIn(*text);
    if (!group) *why = subject + " is in no cgroup v2 group";
    return group;
}

}  // namespace

std::optional<std::string> cgroupShownFor(pid_t pid, std::string* why) {
    return cgroupInFile(AT_FDCWD, "/proc/" + std::to_string(pid) + "/cgroup",
                        "process " + std::to_string(pid), why);
}

std::optional<std::string> cgroupShownIn(int procDirectory, std::string* why) {
    return cgroupInFile(procDirectory, "cgroup", "the process", why);
}

bool isServiceUnitName(std::string_view name, std::string* why) {
    static constexpr std::string_view kAllowed =
        "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789:-_.\\@";
    const bool valid = !name.empty() && name.size() <= 255 &&
                       name.find_first_not_of(kAllowed) == name.npos && name[0] != '.' &&
                       name[0] != '@' && (endsWith(name, ".service") || endsWith(name, ".scope")) &&
                       name.find('@') == name.rfind('@');
    if (!valid)
        *why = "\"" + std::string(name) +
               "\" is not the name of a service or scope unit (NAME.service, NAME.scope)";
    return valid;
}

bool isLaunchName(std::string_view name) {
    return name.size() == kLaunchNameLength &&
           name.find_first_not_of("0123456789abcdef") == std::string_view::npos;
}

CgroupOrigin classifyCgroup(std::string_view path, std::string_view launchParent) {
    const std::vector<std::string_view> parts = componentsOf(path);
    const std::vector<std::string_view> parent = componentsOf(launchParent);
    CgroupOrigin origin;
    for (std::string_view part : parts)
        if (part.empty() || part == "." || part == "..") return origin;

    if (!parent.empty() && parts.size() == parent.size() + 2 &&
        std::equal(parent.begin(), parent.end(), parts.begin())) {
        const std::string identifier(parts[parent.size()]);
        const std::string_view launch = parts[parent.size() + 1];
        std::string why;
        if (LaunchCgroup::validName(identifier, &why) && isLaunchName(launch)) {
            origin.kind = CgroupOrigin::Kind::Launch;
            origin.identifier = identifier;
            origin.launch = launch;
            origin.trustedDepth = parts.size();
        }
        return origin;
    }
    for (size_t depth = 0; depth < parts.size(); ++depth) {
        if (endsWith(parts[depth], ".slice")) continue;
        std::string why;
        if (isServiceUnitName(parts[depth], &why)) {
            origin.kind = CgroupOrigin::Kind::Unit;
            origin.unit = parts[depth];
            origin.trustedDepth = depth;
        }
        break;
    }
    return origin;
}

UniqueFd openTrustedCgroup(const std::filesystem::path& mount, std::string_view path, size_t depth,
                           std::string* why, IdentityBasis* basis) {
    UniqueFd current(::open(mount.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!current) {
        *why = "cannot open " + mount.string() + ": " + strerror(errno);
        return {};
    }
    std::string shown = "/";
    std::filesystem::path at = mount;
    if (!isTrustedLevel(current.get(), at, shown, why, basis)) return {};
    const std::vector<std::string_view> parts = componentsOf(path);
    if (depth > parts.size()) {
        *why = "the control group /" + std::string(path) + " is not that deep";
        return {};
    }
    for (size_t level = 0; level < depth; ++level) {
        const std::string name(parts[level]);
        shown += (level ? "/" : "") + name;
        UniqueFd next(
            ::openat(current.get(), name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
        if (!next) {
            *why = "cannot open the control group " + shown + ": " + strerror(errno);
            return {};
        }
        at /= name;
        if (!isTrustedLevel(next.get(), at, shown, why, basis)) return {};
        current = std::move(next);
    }
    return current;
}

}  // namespace berth
