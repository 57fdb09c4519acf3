#include "platform/LaunchCgroup.h"

#include <dirent.h>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <fstream>
#include <memory>
#include <sstream>
#include <thread>
#include <vector>

#include "core/Uuid.h"
#include "platform/SafeFs.h"

namespace berth {

namespace {

// Undoes the octal escapes (\040 for a space, ...) of a mountinfo field.
std::string unescape(std::string_view field) {
    std::string out;
    for (size_t i = 0; i < field.size(); ++i) {
        if (field[i] == '\\' && i + 3 < field.size()) {
            const std::string_view digits = field.substr(i + 1, 3);
            if (digits.size() == 3 && digits.find_first_not_of("01234567") == std::string::npos) {
                out += static_cast<char>(std::stoi(std::string(digits), nullptr, 8));
                i += 3;
                continue;
            }
        }
        out += field[i];
    }
    return out;
}

// The whole content of `name` in `dirFd` (small kernel files).
std::optional<std::string> readAt(int dirFd, const char* name) {
    UniqueFd fd(::openat(dirFd, name, O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
    if (!fd) return std::nullopt;
    std::string text;
    char buffer[4096];
    ssize_t n;
    while ((n = ::read(fd.get(), buffer, sizeof buffer)) > 0) text.append(buffer, n);
    if (n < 0) return std::nullopt;
    return text;
}

int writeAt(int dirFd, const char* name, const std::string& text) {
    UniqueFd fd(::openat(dirFd, name, O_WRONLY | O_NOFOLLOW | O_CLOEXEC));
    if (!fd) return errno;
    if (::write(fd.get(), text.data(), text.size()) != static_cast<ssize_t>(text.size()))
        return errno ? errno : EIO;
    return 0;
}

// "populated 1" in the group's events file.
bool populatedAt(int groupFd) {
    const std::optional<std::string> events = readAt(groupFd, "cgroup.events");
    if (!events) return false;
    std::istringstream lines(*events);
    std::string key;
    int value = 0;
    while (lines >> key >> value)
        if (key == "populated") return value != 0;
    return false;
}

// Sends SIGKILL to every process the group lists now.
void killListed(int groupFd) {
    const std::optional<std::string> procs = readAt(groupFd, "cgroup.procs");
    if (!procs) return;
    std::istringstream pids(*procs);
    pid_t pid = 0;
    while (pids >> pid)
        if (pid > 0) ::kill(pid, SIGKILL);
}

// Sends SIGKILL to every process the group and its launch groups list now.
// Launch groups are leaves: only root can make groups there.
void killListedWithLaunches(int groupFd) {
    killListed(groupFd);
    UniqueFd forReading(::openat(groupFd, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    std::unique_ptr<DIR, int (*)(DIR*)> stream(forReading ? ::fdopendir(forReading.get()) : nullptr,
                                               ::closedir);
    if (!stream) return;
    forReading.release();
    while (const struct dirent* item = ::readdir(stream.get())) {
        if (item->d_type != DT_DIR || item->d_name[0] == '.') continue;
        UniqueFd launch(
            ::openat(groupFd, item->d_name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
        if (launch) killListed(launch.get());
    }
}

// 32 random lower-case hexadecimal digits.
std::string randomLaunchName() {
    static constexpr char kHex[] = "0123456789abcdef";
    std::string name;
    const Uuid random = Uuid::random();
    for (uint8_t byte : random.bytes()) {
        name.push_back(kHex[byte >> 4]);
        name.push_back(kHex[byte & 0xF]);
    }
    return name;
}

// Waits up to `wait` for the events file to change.
void awaitEvents(int groupFd, std::chrono::milliseconds wait) {
    UniqueFd events(::openat(groupFd, "cgroup.events", O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
    if (!events) {
        std::this_thread::sleep_for(wait);
        return;
    }
    char buffer[64];
    [[maybe_unused]] ssize_t ignored = ::read(events.get(), buffer, sizeof buffer);
    struct pollfd entry {
        events.get(), POLLPRI, 0
    };
    ::poll(&entry, 1, static_cast<int>(wait.count()));
}

UniqueFd openGroup(const std::filesystem::path& path) {
    return UniqueFd(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
}

}  // namespace

std::optional<std::filesystem::path> BTHCgroup2MountIn(std::string_view mountinfo) {
    std::istringstream lines{std::string(mountinfo)};
    std::string line;
    while (std::getline(lines, line)) {
        std::istringstream fields(line);
        std::vector<std::string> before;
        std::string field;
        while (fields >> field && field != "-") before.push_back(field);
        std::string fstype;
        if (field != "-" || !(fields >> fstype) || fstype != "cgroup2" || before.size() < 5)
            continue;
        return std::filesystem::path(unescape(before[4]));
    }
    return std::nullopt;
}

std::string LaunchCgroup::configuredParent() {
    const char* configured = std::getenv("BERTH_LAUNCH_CGROUP");
    return configured && *configured ? configured : kDefaultParent;
}

std::optional<std::filesystem::path> LaunchCgroup::cgroup2Mount(std::string* why) {
    std::ifstream in("/proc/self/mountinfo");
    std::stringstream mountinfo;
    mountinfo << in.rdbuf();
    std::optional<std::filesystem::path> mount = BTHCgroup2MountIn(mountinfo.str());
    if (!mount)
        *why =
            "no cgroup v2 (unified) hierarchy is mounted (no cgroup2 entry in "
            "/proc/self/mountinfo)";
    return mount;
}

std::optional<LaunchCgroup> LaunchCgroup::locate(const std::string& parent, std::string* why,
                                                 bool* unmounted) {
    if (unmounted) *unmounted = false;
    const std::filesystem::path relative(parent);
    bool valid = !parent.empty() && relative.is_relative();
    for (const auto& part : relative) valid = valid && part != "..";
    if (!valid) {
        *why = "the launch cgroup parent \"" + parent +
               "\" is not a relative path inside the cgroup2 hierarchy";
        return std::nullopt;
    }
    const std::optional<std::filesystem::path> mount = cgroup2Mount(why);
    if (!mount) {
        if (unmounted) *unmounted = true;
        return std::nullopt;
    }
    std::string normal = relative.lexically_normal().string();
    while (normal.size() > 1 && normal.back() == '/') normal.pop_back();
    return LaunchCgroup(*mount, normal);
}

bool LaunchCgroup::validName(std::string_view identifier, std::string* why) {
    const bool valid = !identifier.empty() && identifier.size() <= 255 && identifier[0] != '.' &&
                       identifier.find('/') == std::string_view::npos &&
                       identifier.find('\n') == std::string_view::npos &&
                       identifier.find('\0') == std::string_view::npos &&
                       identifier.rfind("cgroup.", 0) != 0;
    if (!valid)
        *why = "the identifier \"" + std::string(identifier) + "\" cannot name a control group";
    return valid;
}

UniqueFd LaunchCgroup::create(const std::string& identifier) const {
    std::string why;
    if (!validName(identifier, &why)) {
        errno = EINVAL;
        return {};
    }
    const int made = fs::makePath(parent_, 0755);
    if (made != 0 && made != EEXIST) {
        errno = made;
        return {};
    }
    UniqueFd parent = openGroup(parent_);
    if (!parent) return {};
    if (::mkdirat(parent.get(), identifier.c_str(), 0755) != 0 && errno != EEXIST) return {};
    return fs::openAtNoFollow(parent.get(), identifier.c_str(), O_RDONLY | O_DIRECTORY);
}

std::optional<LaunchGroup> LaunchCgroup::createLaunch(const std::string& identifier) const {
    // A launcher of the same identifier that ends meanwhile may remove the
    // identifier's group between its making here and the launch group's:
    // then the identifier's group is made again.
    for (int attempt = 0; attempt < 8; ++attempt) {
        const UniqueFd group = create(identifier);
        if (!group) return std::nullopt;
        LaunchGroup launch;
        launch.name = randomLaunchName();
        if (::mkdirat(group.get(), launch.name.c_str(), 0755) != 0) {
            if (errno == ENOENT) continue;
            return std::nullopt;
        }
        launch.fd = fs::openAtNoFollow(group.get(), launch.name.c_str(), O_RDONLY | O_DIRECTORY);
        struct stat status {};
        if (!launch.fd || ::fstat(launch.fd.get(), &status) != 0) return std::nullopt;
        launch.id = status.st_ino;
        launch.path = relative_ + "/" + identifier + "/" + launch.name;
        return launch;
    }
    errno = ENOENT;
    return std::nullopt;
}

int LaunchCgroup::removeLaunch(const std::string& identifier, const std::string& launch) const {
    std::string why;
    if (!validName(identifier, &why) || !validName(launch, &why)) return EINVAL;
    UniqueFd group = openGroup(pathOf(identifier));
    if (!group) return errno;
    return ::unlinkat(group.get(), launch.c_str(), AT_REMOVEDIR) == 0 ? 0 : errno;
}

bool LaunchCgroup::holdsProcesses(const std::string& path, uint64_t id) const {
    const UniqueFd group = openGroup(mount_ / path);
    struct stat status {};
    return group && ::fstat(group.get(), &status) == 0 && status.st_ino == id &&
           populatedAt(group.get());
}

int LaunchCgroup::join(int groupFd) {
    return writeAt(groupFd, "cgroup.procs", std::to_string(::getpid()));
}

int LaunchCgroup::killAll(const std::string& identifier, std::chrono::milliseconds limit,
                          bool useKillFile) const {
    std::string why;
    if (!validName(identifier, &why)) return EINVAL;
    UniqueFd group = openGroup(pathOf(identifier));
    if (!group) return errno == ENOENT ? 0 : errno;
    const auto deadline = std::chrono::steady_clock::now() + limit;
    const bool killFile = useKillFile && ::faccessat(group.get(), "cgroup.kill", F_OK, 0) == 0 &&
                          writeAt(group.get(), "cgroup.kill", "1") == 0;
    while (populatedAt(group.get())) {
        if (!killFile) killListedWithLaunches(group.get());
        if (std::chrono::steady_clock::now() >= deadline) return ETIMEDOUT;
        awaitEvents(group.get(), std::chrono::milliseconds(20));
    }
    return 0;
}

bool LaunchCgroup::populated(const std::string& identifier) const {
    UniqueFd group = openGroup(pathOf(identifier));
    return group && populatedAt(group.get());
}

int LaunchCgroup::remove(const std::string& identifier) const {
    std::string why;
    if (!validName(identifier, &why)) return EINVAL;
    UniqueFd parent = openGroup(parent_);
    if (!parent) return errno;
    return ::unlinkat(parent.get(), identifier.c_str(), AT_REMOVEDIR) == 0 ? 0 : errno;
}

}  // namespace berth
