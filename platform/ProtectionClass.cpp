#include "platform/ProtectionClass.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <optional>
#include <string>

#include "platform/KeyBagState.h"
#include "platform/SafeFs.h"
#include "platform/UniqueFd.h"

namespace berth::protection {

namespace {

// Stored as four little-endian bytes so the files mean the same on any host.
void encode(int32_t value, unsigned char out[4]) {
    const auto u = static_cast<uint32_t>(value);
    for (int i = 0; i < 4; ++i) out[i] = static_cast<unsigned char>(u >> (8 * i));
}

int32_t decode(const unsigned char in[4]) {
    uint32_t u = 0;
    for (int i = 0; i < 4; ++i) u |= static_cast<uint32_t>(in[i]) << (8 * i);
    return static_cast<int32_t>(u);
}

// The item's own class: 0 and a value, 0 and nothing when it has none, or an
// error number.
int ownClass(int fd, std::optional<int32_t>* out) {
    unsigned char bytes[4];
    ssize_t n = ::fgetxattr(fd, kAttributeName, bytes, sizeof bytes);
    if (n < 0) {
        if (errno == ENODATA) {
            out->reset();
            return 0;
        }
        return errno == ERANGE ? EINVAL : errno;
    }
    if (n != 4) return EINVAL;
    *out = decode(bytes);
    return 0;
}

// The class the ancestors of directory `dirFd` hand down (the directory's own
// class included).
int classFromDirectory(int dirFd, int32_t* out) {
    UniqueFd current(::fcntl(dirFd, F_DUPFD_CLOEXEC, 0));
    if (!current) return errno;
    for (;;) {
        std::optional<int32_t> own;
        if (int err = ownClass(current.get(), &own)) return err;
        if (own) {
            *out = *own;
            return 0;
        }
        UniqueFd parent(::openat(current.get(), "..", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        if (!parent) return errno;
        struct stat here, above;
        if (::fstat(current.get(), &here) != 0 || ::fstat(parent.get(), &above) != 0) return errno;
        if (fs::sameItem(here, above)) {  // the file system's root: nothing above
            *out = 0;
            return 0;
        }
        current = std::move(parent);
    }
}

// The directory holding the non-directory `fd`: found by the name the kernel
// keeps for the descriptor, and accepted only if the item is still there.
UniqueFd parentOfFile(int fd, const struct stat& st) {
    char buffer[4096];
    const std::string link = "/proc/self/fd/" + std::to_string(fd);
    ssize_t n = ::readlink(link.c_str(), buffer, sizeof buffer - 1);
    if (n <= 0) return {};
    std::string name;
    UniqueFd parent = fs::openParentNoFollow(std::string(buffer, static_cast<size_t>(n)), &name);
    if (!parent) return {};
    struct stat there;
    if (::fstatat(parent.get(), name.c_str(), &there, AT_SYMLINK_NOFOLLOW) != 0 ||
        !fs::sameItem(there, st)) {
        errno = ESTALE;
        return {};
    }
    return UniqueFd(::openat(parent.get(), ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
}

int effectiveClass(int fd, int32_t* out) {
    std::optional<int32_t> own;
    if (int err = ownClass(fd, &own)) return err;
    if (own) {
        *out = *own;
        return 0;
    }
    struct stat st;
    if (::fstat(fd, &st) != 0) return errno;
    if (S_ISDIR(st.st_mode)) {
        UniqueFd parent(::openat(fd, "..", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        if (!parent) return errno;
        struct stat above;
        if (::fstat(parent.get(), &above) != 0) return errno;
        if (fs::sameItem(st, above)) {
            *out = 0;
            return 0;
        }
        return classFromDirectory(parent.get(), out);
    }
    UniqueFd parent = parentOfFile(fd, st);
    if (!parent) return errno;
    return classFromDirectory(parent.get(), out);
}

bool locked(const LockQuery& isLocked) {
    return isLocked ? isLocked() : keybag::deviceIsLocked();
}

}  // namespace

int getClass(int fd, int32_t* protectionClass, const LockQuery& isLocked) {
    int32_t value = 0;
    if (int err = effectiveClass(fd, &value)) return err;
    if (value == kClassUnreadableWhileLocked && locked(isLocked)) return EPERM;
    *protectionClass = value;
    return 0;
}

int setClass(int fd, int32_t protectionClass, const LockQuery& isLocked) {
    int32_t current = 0;
    if (int err = effectiveClass(fd, &current)) return err;
    if (current == kClassUnreadableWhileLocked && locked(isLocked)) return EPERM;
    unsigned char bytes[4];
    encode(protectionClass, bytes);
    return ::fsetxattr(fd, kAttributeName, bytes, sizeof bytes, 0) == 0 ? 0 : errno;
}

}  // namespace berth::protection
