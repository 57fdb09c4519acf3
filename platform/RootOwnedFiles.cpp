#include "platform/RootOwnedFiles.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "core/Uuid.h"
#include "platform/DeviceRoot.h"

namespace berth {

namespace {

bool isBelow(const std::filesystem::path& path, const std::filesystem::path& root) {
    const std::string p = path.string(), r = root.string();
    if (r == "/") return p.size() > 1 && p[0] == '/';
    return p.size() > r.size() && p.compare(0, r.size(), r) == 0 && p[r.size()] == '/';
}

bool readAll(int fd, std::vector<uint8_t>& bytes, size_t limit) {
    uint8_t buffer[16384];
    for (;;) {
        ssize_t n = ::read(fd, buffer, sizeof buffer);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) return false;
        if (n == 0) return true;
        if (bytes.size() + static_cast<size_t>(n) > limit) {
            errno = EFBIG;
            return false;
        }
        bytes.insert(bytes.end(), buffer, buffer + n);
    }
}

bool writeAll(int fd, std::span<const uint8_t> bytes) {
    size_t done = 0;
    while (done < bytes.size()) {
        ssize_t n = ::write(fd, bytes.data() + done, bytes.size() - done);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) return false;
        done += static_cast<size_t>(n);
    }
    return true;
}

}  // namespace

bool isRootsAlone(const struct stat& status) {
    return status.st_uid == 0 && (status.st_mode & (S_IWGRP | S_IWOTH)) == 0;
}

UniqueFd openRootOwnedDirectory(const std::filesystem::path& directory, bool create,
                                std::string* why, int* error, mode_t mode, IdentityBasis* basis) {
    const std::filesystem::path target = directory.lexically_normal();
    const std::filesystem::path& root = DeviceRoot::path();
    const std::filesystem::path prefix = isBelow(target, root) ? root : "/";
    std::filesystem::path walked = prefix;
    auto failed = [&](int errnum, std::string text) {
        *error = errnum;
        *why = std::move(text);
        return UniqueFd();
    };
    UniqueFd current(::open(prefix.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!current) return failed(errno, "cannot open " + prefix.string());
    for (const auto& component : target.lexically_relative(prefix)) {
        if (component == "." || component.empty()) continue;
        if (component == "..") return failed(EINVAL, target.string() + " may not contain \"..\"");
        walked /= component;
        const int flags = O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
        UniqueFd next(::openat(current.get(), component.c_str(), flags));
        if (!next && errno == ENOENT && create &&
            (::mkdirat(current.get(), component.c_str(), mode) == 0 || errno == EEXIST))
            next.reset(::openat(current.get(), component.c_str(), flags));
        struct stat status {};
        if (!next || ::fstat(next.get(), &status) != 0) {
            const int errnum = errno;
            return failed(errnum, "cannot open " + walked.string() + ": " + strerror(errnum));
        }
        if (!isRootsAlone(status)) return failed(EPERM, walked.string() + " is not root's alone");
        if (basis) basis->record(walked, status);
        current = std::move(next);
    }
    UniqueFd opened(::openat(current.get(), ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!opened) {
        const int errnum = errno;
        return failed(errnum, "cannot open " + walked.string() + ": " + strerror(errnum));
    }
    return opened;
}

std::optional<std::vector<uint8_t>> readRootOwnedFile(int dirFd, const std::string& name,
                                                      size_t limit, std::string* why, bool* missing,
                                                      struct stat* checked) {
    if (missing) *missing = false;
    UniqueFd fd(
        ::openat(dirFd, name.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    struct stat status {};
    if (!fd || ::fstat(fd.get(), &status) != 0) {
        const int error = errno;
        if (missing) *missing = error == ENOENT;
        *why = error == ELOOP ? "is a symbolic link" : strerror(error);
        return std::nullopt;
    }
    if (!S_ISREG(status.st_mode)) {
        *why = "is not a regular file";
        return std::nullopt;
    }
    if (!isRootsAlone(status)) {
        *why = "is not root's alone (owner or mode)";
        return std::nullopt;
    }
    if (checked) *checked = status;
    std::vector<uint8_t> bytes;
    if (!readAll(fd.get(), bytes, limit)) {
        *why = std::string("cannot be read: ") + strerror(errno);
        return std::nullopt;
    }
    return bytes;
}

int replaceFileAtomically(int dirFd, const std::string& name, std::span<const uint8_t> bytes) {
    const std::string temp = "." + name + "." + Uuid::random().string() + ".tmp";
    UniqueFd fd(
        ::openat(dirFd, temp.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0644));
    if (!fd) return errno;
    int error = 0;
    if (::fchmod(fd.get(), 0644) != 0 || !writeAll(fd.get(), bytes) || ::fsync(fd.get()) != 0)
        error = errno;
    fd.reset();
    if (error == 0 && ::renameat(dirFd, temp.c_str(), dirFd, name.c_str()) != 0) error = errno;
    if (error != 0) {
        ::unlinkat(dirFd, temp.c_str(), 0);
        return error;
    }
    return ::fsync(dirFd) == 0 ? 0 : errno;
}

}  // namespace berth
