#include "platform/ServiceCheckIn.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "platform/DeviceRoot.h"
#include "platform/SafeFs.h"
#include "platform/ServiceManager.h"

namespace berth {
namespace {

std::optional<ServiceCheckIn> fail(int code, std::string reason, int* error, std::string* why) {
    if (error) *error = code;
    if (why) *why = std::move(reason);
    return std::nullopt;
}

std::string describeErrno(const std::string& what, int code) {
    return what + ": " + std::strerror(code);
}

// Takes the endpoint's lock without waiting. The lock lives as long as the
// returned descriptor.
UniqueFd lockEndpoint(int dirFd, const std::string& name, int* error, std::string* why) {
    const std::string lockName = name + ".lock";
    UniqueFd lock = fs::openAtNoFollow(dirFd, lockName.c_str(), O_RDWR | O_CREAT, 0600);
    struct stat status {};
    if (!lock || ::fstat(lock.get(), &status) != 0) {
        *error = errno;
        *why = describeErrno("cannot open the lock file " + lockName, errno);
        return {};
    }
    if (!S_ISREG(status.st_mode)) {
        *error = EINVAL;
        *why = "the lock file " + lockName + " is not a regular file";
        return {};
    }
    if (::flock(lock.get(), LOCK_EX | LOCK_NB) != 0) {
        *error = errno == EWOULDBLOCK ? EADDRINUSE : errno;
        *why = errno == EWOULDBLOCK
                   ? "another process has checked in " + name + " (it holds " + lockName + ")"
                   : describeErrno("cannot lock " + lockName, errno);
        return {};
    }
    return lock;
}

// Removes whatever a previous holder left at `name`, which is stale since
// its lock is free. A directory there is not ours to remove.
int removeStaleEndpoint(int dirFd, const std::string& name) {
    struct stat status {};
    if (::fstatat(dirFd, name.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0)
        return errno == ENOENT ? 0 : errno;
    if (S_ISDIR(status.st_mode)) return EISDIR;
    return ::unlinkat(dirFd, name.c_str(), 0) == 0 || errno == ENOENT ? 0 : errno;
}

// Binds `fd` to `name` inside the directory open at `dirFd`. The address goes
// through the directory descriptor, so it is short whatever the root's path
// and cannot be redirected by a link swapped into the path.
int bindInDirectory(int fd, int dirFd, const std::string& name) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    const std::string path = "/proc/self/fd/" + std::to_string(dirFd) + "/" + name;
    if (path.size() >= sizeof address.sun_path) return ENAMETOOLONG;
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
    if (::bind(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) return errno;
    return 0;
}

}  // namespace

std::filesystem::path ServiceCheckIn::runtimeDirectory() {
    return DeviceRoot::resolve("/run/berthd");
}

namespace {

// A socket the service manager passed must be what the endpoint is: a
// listening Unix socket of the endpoint's type. It is made non-blocking and
// close-on-exec like one the daemon binds itself. 0 or an errno.
int checkPassedSocket(int fd, int socketType) {
    int domain = 0, type = 0, listening = 0;
    socklen_t length = sizeof domain;
    if (::getsockopt(fd, SOL_SOCKET, SO_DOMAIN, &domain, &length) != 0) return errno;
    length = sizeof type;
    if (::getsockopt(fd, SOL_SOCKET, SO_TYPE, &type, &length) != 0) return errno;
    length = sizeof listening;
    if (::getsockopt(fd, SOL_SOCKET, SO_ACCEPTCONN, &listening, &length) != 0) return errno;
    if (domain != AF_UNIX || type != socketType || !listening) return EPROTOTYPE;
    const int flags = ::fcntl(fd, F_GETFL);
    if (flags < 0 || ::fcntl(fd, F_SETFL, flags | O_NONBLOCK) != 0 ||
        ::fcntl(fd, F_SETFD, FD_CLOEXEC) != 0)
        return errno;
    return 0;
}

}  // namespace

std::optional<ServiceCheckIn> ServiceCheckIn::claim(const std::string& name, int socketType,
                                                    mode_t mode, int* error, std::string* why,
                                                    const std::filesystem::path& directory) {
    if (name.empty() || name.find('/') != std::string::npos || name == "." || name == "..")
        return fail(EINVAL, "invalid endpoint name \"" + name + "\"", error, why);
    if (socketType != SOCK_STREAM && socketType != SOCK_SEQPACKET)
        return fail(EINVAL, "endpoints are stream or sequenced-packet sockets", error, why);
    const std::filesystem::path dir = directory.empty() ? runtimeDirectory() : directory;

    if (int made = fs::makePath(dir, 0755); made != 0 && made != EEXIST)
        return fail(made, describeErrno("cannot create " + dir.string(), made), error, why);
    UniqueFd dirFd = fs::openNoFollow(dir, O_RDONLY | O_DIRECTORY);
    if (!dirFd) return fail(errno, describeErrno("cannot open " + dir.string(), errno), error, why);

    int code = 0;
    std::string reason;
    UniqueFd lock = lockEndpoint(dirFd.get(), name, &code, &reason);
    if (!lock) return fail(code, reason, error, why);

    if (UniqueFd passed = ServiceManager::takeActivatedSocket(name)) {
        if ((code = checkPassedSocket(passed.get(), socketType)) != 0)
            return fail(code, describeErrno("the passed socket " + name + " is unusable", code),
                        error, why);
        return ServiceCheckIn(std::move(lock), std::move(passed), dir / name);
    }
    if ((code = removeStaleEndpoint(dirFd.get(), name)) != 0)
        return fail(code, describeErrno("cannot remove the stale endpoint " + name, code), error,
                    why);
    UniqueFd socket(::socket(AF_UNIX, socketType | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
    if (!socket) return fail(errno, describeErrno("socket", errno), error, why);
    if ((code = bindInDirectory(socket.get(), dirFd.get(), name)) != 0)
        return fail(code, describeErrno("cannot bind " + name, code), error, why);
    if ((code = fs::chmodAtNoFollow(dirFd.get(), name.c_str(), mode)) != 0)
        return fail(code, describeErrno("cannot set the mode of " + name, code), error, why);
    if (::listen(socket.get(), SOMAXCONN) != 0)
        return fail(errno, describeErrno("cannot listen on " + name, errno), error, why);
    return ServiceCheckIn(std::move(lock), std::move(socket), dir / name);
}

}  // namespace berth
