#include "platform/SafeFs.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <string>
#include <vector>

#include "platform/DeviceRoot.h"

#ifndef SYS_fchmodat2
#define SYS_fchmodat2 452
#endif

namespace berth::fs {

namespace {

long openat2Call(int dirFd, const char* path, int flags, mode_t mode, uint64_t resolve) {
    struct open_how how {};
    how.flags = static_cast<uint64_t>(flags);
    how.mode = (flags & (O_CREAT | O_TMPFILE)) ? mode : 0;
    how.resolve = resolve;
    return syscall(SYS_openat2, dirFd, path, &how, sizeof how);
}

std::vector<std::string> componentsOf(const std::filesystem::path& relative) {
    std::vector<std::string> parts;
    for (const auto& part : relative)
        if (!part.empty() && part != "/" && part != ".") parts.push_back(part.string());
    return parts;
}

// One component at a time, for kernels without openat2.
UniqueFd walkComponents(int startFd, const std::filesystem::path& relative, int flags,
                        mode_t mode) {
    UniqueFd current(::fcntl(startFd, F_DUPFD_CLOEXEC, 0));
    if (!current) return {};
    std::vector<std::string> parts = componentsOf(relative);
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

// The directory the untrusted part of `path` starts from (the device root
// when `path` lies below it, else "/" or the working directory), and that
// untrusted part.
UniqueFd openTrustedStart(const std::filesystem::path& path, std::string* relative) {
    const std::filesystem::path& root = DeviceRoot::path();
    *relative = path.string();
    if (!DeviceRoot::isHost() && isBelow(path, root)) {
        *relative = relative->substr(root.string().size() + 1);
        return UniqueFd(::open(root.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    }
    return UniqueFd(::open(path.is_absolute() ? "/" : ".", O_PATH | O_DIRECTORY | O_CLOEXEC));
}

// The error of a component that would not open as a directory: ELOOP when it
// is a link (as the whole-path open reports), else ENOTDIR.
int linkOrNotDirectory(int dirFd, const char* name) {
    struct stat st;
    if (::fstatat(dirFd, name, &st, AT_SYMLINK_NOFOLLOW) == 0 && S_ISLNK(st.st_mode)) return ELOOP;
    return ENOTDIR;
}

}  // namespace

UniqueFd openNoFollow(const std::filesystem::path& path, int flags, mode_t mode) {
    flags |= O_NOFOLLOW | O_CLOEXEC;
    const std::filesystem::path& root = DeviceRoot::path();
    int base = -1;
    UniqueFd ownBase;
    std::string relative = path.string();
    if (!DeviceRoot::isHost() && isBelow(path, root)) {
        base = DeviceRoot::descriptor();
        if (base < 0) {
            ownBase.reset(::open(root.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
            if (!ownBase) return {};
            base = ownBase.get();
        }
        relative = relative.substr(root.string().size() + 1);
    }
    const int dirFd = base >= 0 ? base : AT_FDCWD;
    const uint64_t resolve =
        RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS | (base >= 0 ? RESOLVE_BENEATH : 0);
    long fd = openat2Call(dirFd, relative.c_str(), flags, mode, resolve);
    if (fd >= 0) return UniqueFd(static_cast<int>(fd));
    if (errno == ENOTDIR && (flags & O_DIRECTORY)) {
        // A link where a directory was asked for is reported as a link.
        long item =
            openat2Call(dirFd, relative.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC, 0, resolve);
        struct stat st;
        const bool isLink =
            item >= 0 && ::fstat(static_cast<int>(item), &st) == 0 && S_ISLNK(st.st_mode);
        if (item >= 0) ::close(static_cast<int>(item));
        errno = isLink ? ELOOP : ENOTDIR;
        return {};
    }
    if (errno != ENOSYS) return {};
    if (base >= 0) return walkComponents(base, relative, flags, mode);
    UniqueFd slash(::open("/", O_PATH | O_DIRECTORY | O_CLOEXEC));
    return walkComponents(slash.get(), relative, flags, mode);
}

UniqueFd openAtNoFollow(int dirFd, const char* name, int flags, mode_t mode) {
    return UniqueFd(::openat(dirFd, name, flags | O_NOFOLLOW | O_CLOEXEC, mode));
}

bool splitParent(const std::filesystem::path& path, std::filesystem::path* parent,
                 std::string* name) {
    std::string text = path.string();
    while (text.size() > 1 && text.back() == '/') text.pop_back();
    const size_t slash = text.rfind('/');
    std::string last = slash == std::string::npos ? text : text.substr(slash + 1);
    if (last.empty() || last == "." || last == "..") {
        errno = EINVAL;
        return false;
    }
    if (slash == std::string::npos)
        *parent = ".";
    else
        *parent = slash == 0 ? std::string("/") : text.substr(0, slash);
    *name = std::move(last);
    return true;
}

UniqueFd openParentNoFollow(const std::filesystem::path& path, std::string* name) {
    std::filesystem::path parent;
    if (!splitParent(path, &parent, name)) return {};
    return openNoFollow(parent, O_PATH | O_DIRECTORY);
}

int lstatNoFollow(const std::filesystem::path& path, struct stat* st) {
    std::string name;
    UniqueFd parent = openParentNoFollow(path, &name);
    if (!parent) return errno;
    return ::fstatat(parent.get(), name.c_str(), st, AT_SYMLINK_NOFOLLOW) == 0 ? 0 : errno;
}

int existsNoFollow(const std::filesystem::path& path) {
    // An O_PATH open of a last link opens the link itself.
    return openNoFollow(path, O_PATH) ? 0 : errno;
}

namespace {

// `fd` if it is the item `expected` describes; else invalid, errno ESTALE.
UniqueFd ifSameItem(UniqueFd fd, const struct stat& expected) {
    if (!fd) return {};
    struct stat st;
    if (::fstat(fd.get(), &st) != 0) return {};
    if (!sameItem(st, expected)) {
        errno = ESTALE;
        return {};
    }
    return fd;
}

}  // namespace

UniqueFd openDirectoryChecked(int dirFd, const char* name, const struct stat& expected) {
    return ifSameItem(openAtNoFollow(dirFd, name, O_RDONLY | O_DIRECTORY | O_NONBLOCK), expected);
}

UniqueFd openItemChecked(int dirFd, const char* name, const struct stat& expected) {
    // Only files and directories: opening a device node could act on a device.
    if (!S_ISREG(expected.st_mode) && !S_ISDIR(expected.st_mode)) {
        errno = EINVAL;
        return {};
    }
    return ifSameItem(openAtNoFollow(dirFd, name, O_RDONLY | O_NONBLOCK | O_NOCTTY), expected);
}

int makePath(const std::filesystem::path& path, mode_t mode) {
    std::string relative;
    UniqueFd current = openTrustedStart(path, &relative);
    if (!current) return errno;
    const std::vector<std::string> parts = componentsOf(relative);
    if (parts.empty()) return EEXIST;
    for (size_t i = 0; i < parts.size(); ++i) {
        const char* name = parts[i].c_str();
        if (parts[i] == "..") return EINVAL;
        const bool last = i + 1 == parts.size();
        if (last) return ::mkdirat(current.get(), name, mode) == 0 ? 0 : errno;
        UniqueFd next = openAtNoFollow(current.get(), name, O_PATH | O_DIRECTORY);
        if (!next && errno == ENOENT) {
            // Another creator may win the race; the open below then finds its
            // directory, which is as good as ours.
            if (::mkdirat(current.get(), name, mode) != 0 && errno != EEXIST) return errno;
            next = openAtNoFollow(current.get(), name, O_PATH | O_DIRECTORY);
        }
        if (!next) return errno == ENOTDIR ? linkOrNotDirectory(current.get(), name) : errno;
        current = std::move(next);
    }
    return 0;
}

int renameNoFollow(const std::filesystem::path& from, const std::filesystem::path& to) {
    std::string fromName, toName;
    UniqueFd fromParent = openParentNoFollow(from, &fromName);
    if (!fromParent) return errno;
    UniqueFd toParent = openParentNoFollow(to, &toName);
    if (!toParent) return errno;
    return ::renameat(fromParent.get(), fromName.c_str(), toParent.get(), toName.c_str()) == 0
               ? 0
               : errno;
}

int chmodAtNoFollow(int dirFd, const char* name, mode_t mode) {
    if (::syscall(SYS_fchmodat2, dirFd, name, mode, AT_SYMLINK_NOFOLLOW) == 0) return 0;
    if (errno != ENOSYS) return errno;
    UniqueFd fd = openAtNoFollow(dirFd, name, O_PATH);
    if (!fd) return errno;
    struct stat st;
    if (::fstat(fd.get(), &st) != 0) return errno;
    if (S_ISLNK(st.st_mode)) return EOPNOTSUPP;
    const std::string viaProc = "/proc/self/fd/" + std::to_string(fd.get());
    return ::chmod(viaProc.c_str(), mode) == 0 ? 0 : errno;
}

DirReader::DirReader(int dirFd) {
    UniqueFd own(::openat(dirFd, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!own) return;
    dir_ = ::fdopendir(own.get());
    if (dir_) own.release();
}

DirReader::~DirReader() {
    if (dir_) ::closedir(dir_);
}

const struct dirent* DirReader::next() {
    if (!dir_) {
        errno = EBADF;
        return nullptr;
    }
    for (;;) {
        errno = 0;
        const struct dirent* entry = ::readdir(dir_);
        if (!entry) return nullptr;
        const char* n = entry->d_name;
        if (n[0] == '.' && (n[1] == '\0' || (n[1] == '.' && n[2] == '\0'))) continue;
        return entry;
    }
}

}  // namespace berth::fs
