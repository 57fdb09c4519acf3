#include "platform/ExecutableIdentity.h"

#include <fcntl.h>
#include <openssl/evp.h>
#include <signal.h>
#include <sys/syscall.h>
#include <time.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <memory>
#include <vector>

namespace berth {

namespace {

void setWhy(std::string* why, std::string text) {
    if (why) *why = std::move(text);
}

std::string procPath(pid_t pid, const char* leaf) {
    return "/proc/" + std::to_string(pid) + "/" + leaf;
}

struct DigestContextFree {
    void operator()(EVP_MD_CTX* context) const { EVP_MD_CTX_free(context); }
};
using DigestContext = std::unique_ptr<EVP_MD_CTX, DigestContextFree>;

DigestContext newSha256Context() {
    DigestContext context(EVP_MD_CTX_new());
    if (context && EVP_DigestInit_ex(context.get(), EVP_sha256(), nullptr) != 1) context.reset();
    return context;
}

std::optional<Sha256Digest> finish(EVP_MD_CTX* context) {
    Sha256Digest digest{};
    unsigned int length = 0;
    if (EVP_DigestFinal_ex(context, digest.data(), &length) != 1 || length != digest.size())
        return std::nullopt;
    return digest;
}

// The "Pid:" line of a pidfd's fdinfo; nullopt when `fd` is not a pidfd.
std::optional<pid_t> pidOfPidfd(int fd) {
    UniqueFd info(
        ::open(("/proc/self/fdinfo/" + std::to_string(fd)).c_str(), O_RDONLY | O_CLOEXEC));
    if (!info) return std::nullopt;
    char buffer[4096];
    size_t used = 0;
    for (;;) {
        ssize_t n = ::read(info.get(), buffer + used, sizeof buffer - 1 - used);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) break;
        used += static_cast<size_t>(n);
        if (used == sizeof buffer - 1) break;
    }
    buffer[used] = '\0';
    for (const char* line = buffer; line && *line; line = std::strchr(line, '\n')) {
        if (*line == '\n') ++line;
        if (std::strncmp(line, "Pid:", 4) != 0) continue;
        char* end = nullptr;
        long pid = std::strtol(line + 4, &end, 10);
        if (end == line + 4) return std::nullopt;
        return static_cast<pid_t>(pid);
    }
    return std::nullopt;
}

int64_t nanoseconds(const struct timespec& t) {
    return static_cast<int64_t>(t.tv_sec) * 1'000'000'000 + t.tv_nsec;
}

}  // namespace

FileVersion FileVersion::of(const struct stat& status) {
    return {status.st_dev,
            status.st_ino,
            status.st_size,
            nanoseconds(status.st_mtim),
            nanoseconds(status.st_ctim),
            status.st_mode,
            status.st_uid,
            status.st_gid};
}

bool FileVersion::changedWithin(std::chrono::nanoseconds window) const {
    struct timespec now {};
    ::clock_gettime(CLOCK_REALTIME, &now);
    return ctimeNs + window.count() > nanoseconds(now);
}

Sha256Digest sha256(std::span<const uint8_t> bytes) {
    Sha256Digest digest{};
    unsigned int length = 0;
    EVP_Digest(bytes.data(), bytes.size(), digest.data(), &length, EVP_sha256(), nullptr);
    return digest;
}

std::optional<Sha256Digest> sha256OfFile(int fd, std::string* why) {
    DigestContext context = newSha256Context();
    if (!context) {
        setWhy(why, "SHA-256 is unavailable");
        return std::nullopt;
    }
    std::vector<uint8_t> buffer(256 * 1024);
    off_t offset = 0;
    for (;;) {
        ssize_t n = ::pread(fd, buffer.data(), buffer.size(), offset);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) {
            setWhy(why, std::string("read failed: ") + strerror(errno));
            return std::nullopt;
        }
        if (n == 0) break;
        EVP_DigestUpdate(context.get(), buffer.data(), static_cast<size_t>(n));
        offset += n;
    }
    std::optional<Sha256Digest> digest = finish(context.get());
    if (!digest) setWhy(why, "SHA-256 failed");
    return digest;
}

std::string hexString(const Sha256Digest& digest) {
    static constexpr char kHex[] = "0123456789abcdef";
    std::string text;
    text.reserve(digest.size() * 2);
    for (uint8_t byte : digest) {
        text.push_back(kHex[byte >> 4]);
        text.push_back(kHex[byte & 0xF]);
    }
    return text;
}

bool pidfdRefersTo(int pidfd, pid_t pid, std::string* why) {
    std::optional<pid_t> holder = pidOfPidfd(pidfd);
    if (!holder) {
        setWhy(why, "descriptor " + std::to_string(pidfd) + " is not a pidfd");
        return false;
    }
    if (*holder != pid) {
        setWhy(why,
               "pidfd refers to pid " + std::to_string(*holder) + ", not " + std::to_string(pid));
        return false;
    }
    if (::syscall(SYS_pidfd_send_signal, pidfd, 0, nullptr, 0) != 0) {
        setWhy(why, "process " + std::to_string(pid) + " has exited");
        return false;
    }
    return true;
}

std::optional<OpenedExecutable> openProcessExecutable(pid_t pid, int pidfd, std::string* why) {
    if (pid <= 0) {
        setWhy(why, "invalid pid " + std::to_string(pid));
        return std::nullopt;
    }
    const std::string exe = procPath(pid, "exe");
    OpenedExecutable opened;
    opened.fd.reset(::open(exe.c_str(), O_RDONLY | O_CLOEXEC));
    if (!opened.fd || ::fstat(opened.fd.get(), &opened.status) != 0) {
        setWhy(why,
               "cannot open the executable of pid " + std::to_string(pid) + ": " + strerror(errno));
        return std::nullopt;
    }
    if (!S_ISREG(opened.status.st_mode) || opened.status.st_nlink == 0) {
        setWhy(why, "the executable of pid " + std::to_string(pid) +
                        " is not a regular file in place (deleted or replaced)");
        return std::nullopt;
    }
    std::error_code error;
    opened.path = std::filesystem::read_symlink(exe, error);
    if (error || !opened.path.is_absolute()) {
        setWhy(why, "cannot name the executable of pid " + std::to_string(pid));
        return std::nullopt;
    }
    // The name was read after the file was opened; had the process exec'd in
    // between, /proc would now show a different file than the one opened.
    std::optional<ExecutableId> running = runningExecutable(pid, pidfd, why);
    if (!running) return std::nullopt;
    if (*running != opened.id()) {
        setWhy(why, "process " + std::to_string(pid) + " exec'd another executable meanwhile");
        return std::nullopt;
    }
    return opened;
}

std::optional<ExecutableId> runningExecutable(pid_t pid, int pidfd, std::string* why) {
    struct stat status {};
    if (pid <= 0 || ::stat(procPath(pid, "exe").c_str(), &status) != 0) {
        setWhy(why, "process " + std::to_string(pid) + " runs no executable (exited?)");
        return std::nullopt;
    }
    // Only now is it known that the pid still named the pidfd's process.
    if (!pidfdRefersTo(pidfd, pid, why)) return std::nullopt;
    return ExecutableId{status.st_dev, status.st_ino};
}

size_t DigestCache::VersionHash::operator()(const FileVersion& v) const noexcept {
    size_t h = std::hash<uint64_t>()(v.inode);
    for (uint64_t part : {static_cast<uint64_t>(v.device), static_cast<uint64_t>(v.size),
                          static_cast<uint64_t>(v.mtimeNs), static_cast<uint64_t>(v.ctimeNs)})
        h = h * 1099511628211ull ^ std::hash<uint64_t>()(part);
    return h;
}

DigestCache::DigestCache(size_t capacity, std::chrono::nanoseconds racyWindow)
    : capacity_(capacity), racyWindow_(racyWindow) {}

std::optional<Sha256Digest> DigestCache::digestOf(int fd, std::string* why) {
    struct stat before {};
    if (::fstat(fd, &before) != 0 || !S_ISREG(before.st_mode)) {
        setWhy(why, "not a readable regular file");
        return std::nullopt;
    }
    const FileVersion version = FileVersion::of(before);
    if (std::optional<Sha256Digest> known = find(version)) return known;

    std::optional<Sha256Digest> digest = sha256OfFile(fd, why);
    {
        std::lock_guard lock(mutex_);
        ++computations_;
    }
    if (!digest) return std::nullopt;
    struct stat after {};
    if (::fstat(fd, &after) != 0 || FileVersion::of(after) != version) {
        setWhy(why, "the file changed while it was being hashed");
        return std::nullopt;
    }
    if (!version.changedWithin(racyWindow_)) remember(version, *digest);
    return digest;
}

std::optional<Sha256Digest> DigestCache::find(const FileVersion& version) {
    std::lock_guard lock(mutex_);
    auto it = slots_.find(version);
    if (it == slots_.end()) return std::nullopt;
    recency_.splice(recency_.begin(), recency_, it->second.recency);
    return it->second.digest;
}

void DigestCache::remember(const FileVersion& version, const Sha256Digest& digest) {
    std::lock_guard lock(mutex_);
    if (capacity_ == 0 || slots_.contains(version)) return;
    while (slots_.size() >= capacity_) {
        slots_.erase(recency_.back());
        recency_.pop_back();
    }
    recency_.push_front(version);
    slots_.emplace(version, Slot{digest, recency_.begin()});
}

uint64_t DigestCache::computations() const {
    std::lock_guard lock(mutex_);
    return computations_;
}

size_t DigestCache::size() const {
    std::lock_guard lock(mutex_);
    return slots_.size();
}

}  // namespace berth
