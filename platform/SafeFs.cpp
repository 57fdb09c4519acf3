#include "platform/SafeFs.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <string>
#include <vector>

#include "platform/DeviceRoot.h"

namespace berth::fs {

namespace {

long openat2Call(int dirFd, const char* path, int flags, mode_t mode, uint64_t resolve) {
    struct open_how how {};
    how.flags = static_cast<uint64_t>(flags);
    how.mode = (flags & (O_CREAT | O_TMPFILE)) ? mode : 0;
    how.resolve = resolve;
    return syscall(SYS_openat2, dirFd, path, &how, sizeof how);
}

// One component at a time, for kernels without openat2.
UniqueFd walkComponents(int startFd, const std::filesystem::path& relative, int flags,
                        mode_t mode) {
    UniqueFd current(::fcntl(startFd, F_DUPFD_CLOEXEC, 0));
    if (!current) return {};
    std::vector<std::string> parts;
    for (const auto& part : relative)
        if (!part.empty() && part != "/" && part != ".") parts.push_back(part.string());
    if (parts.empty()) return UniqueFd(::openat(current.get(), ".", flags | O_CLOEXEC, mode));
    for (size_t i = 0; i + 1 < parts.size(); ++i) {
        if (parts[i] == "..") {
            errno = EXDEV;
            return {};
        }
        UniqueFd next(::openat(current.get(), parts[i].c_str(),
                               O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
        if (!next) return {};
        current = std::move(next);
    }
    return UniqueFd(
        ::openat(current.get(), parts.back().c_str(), flags | O_NOFOLLOW | O_CLOEXEC, mode));
}

bool isBelow(const std::filesystem::path& path, const std::filesystem::path& root) {
    const std::string p = path.string(), r = root.string();
    return p.size() > r.size() && p.compare(0, r.size(), r) == 0 && p[r.size()] == '/';
}

}  // namespace

UniqueFd openNoFollow(const std::filesystem::path& path, int flags, mode_t mode) {
    flags |= O_NOFOLLOW | O_CLOEXEC;
    const std::filesystem::path& root = DeviceRoot::path();
    UniqueFd base;
    std::string relative = path.string();
    if (!DeviceRoot::isHost() && isBelow(path, root)) {
        base.reset(::open(root.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
        if (!base) return {};
        relative = relative.substr(root.string().size() + 1);
    }
    const int dirFd = base ? base.get() : AT_FDCWD;
    const uint64_t resolve = RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS | (base ? RESOLVE_BENEATH : 0);
    long fd = openat2Call(dirFd, relative.c_str(), flags, mode, resolve);
    if (fd >= 0) return UniqueFd(static_cast<int>(fd));
    if (errno != ENOSYS) return {};
    if (base) return walkComponents(base.get(), relative, flags, mode);
    UniqueFd slash(::open("/", O_PATH | O_DIRECTORY | O_CLOEXEC));
    return walkComponents(slash.get(), relative, flags, mode);
}

UniqueFd openAtNoFollow(int dirFd, const char* name, int flags, mode_t mode) {
    return UniqueFd(::openat(dirFd, name, flags | O_NOFOLLOW | O_CLOEXEC, mode));
}

}  // namespace berth::fs
