#include "platform/SandboxMappingStore.h"

#include <fcntl.h>
#include <limits.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <string_view>
#include <vector>

#include "platform/DeviceRoot.h"
#include "platform/SafeFs.h"
#include "platform/UniqueFd.h"

namespace berth {

namespace {

constexpr mode_t kDirectoryMode = 0755;
constexpr int kDirectoryFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
// Longest link target read back; a recorded path is a container path, far
// below this.
constexpr size_t kMaximumTargetLength = 1 << 16;

void appendEscaped(std::string& out, unsigned char c) {
    static constexpr char kHex[] = "0123456789ABCDEF";
    out += '%';
    out += kHex[c >> 4];
    out += kHex[c & 0xF];
}

// Opens the directory `name` in `dirFd`, never through a link. With `create`
// a missing directory is made (mode 0755 whatever the umask); another creator
// winning the race is as good.
UniqueFd openSubdirectory(int dirFd, const std::string& name, bool create) {
    UniqueFd fd(::openat(dirFd, name.c_str(), kDirectoryFlags));
    if (fd || errno != ENOENT || !create) return fd;
    const bool made = ::mkdirat(dirFd, name.c_str(), kDirectoryMode) == 0;
    if (!made && errno != EEXIST) return UniqueFd();
    fd.reset(::openat(dirFd, name.c_str(), kDirectoryFlags));
    if (fd && made) ::fchmod(fd.get(), kDirectoryMode);
    return fd;
}

// The directory of one user's entries of one item type: <uid>/<item type>.
// Invalid with errno set when it is missing (and not to be created) or
// cannot be opened.
UniqueFd openEntryDirectory(const std::filesystem::path& base, uid_t user, uint64_t itemType,
                            bool create) {
    UniqueFd root = fs::openNoFollow(base, kDirectoryFlags);
    if (!root && errno == ENOENT && create) {
        const int made = fs::makePath(base, kDirectoryMode);
        if (made != 0 && made != EEXIST) {
            errno = made;
            return UniqueFd();
        }
        root = fs::openNoFollow(base, kDirectoryFlags);
        if (root && made == 0) ::fchmod(root.get(), kDirectoryMode);
    }
    if (!root) return root;
    UniqueFd userDirectory = openSubdirectory(root.get(), std::to_string(user), create);
    if (!userDirectory) return userDirectory;
    return openSubdirectory(userDirectory.get(), std::to_string(itemType), create);
}

// 0 when `identifier` has a usable entry name, put in `name`.
int entryName(const std::string& identifier, std::string* name) {
    if (identifier.empty()) return EINVAL;
    *name = SandboxMappingStore::encodeIdentifier(identifier);
    return name->size() > NAME_MAX ? ENAMETOOLONG : 0;
}

// A name no entry can have (entries never begin with "."), unique to the
// calling thread, so concurrent setters never share one. A name left behind
// by a setter that died is reused by the next thread with its id.
std::string temporaryName() {
    return ".tmp." + std::to_string(::getpid()) + "." + std::to_string(::gettid());
}

// Points `name` in `dirFd` at `target`, atomically replacing what was there.
int replaceLink(int dirFd, const std::string& name, const std::string& target) {
    const std::string temporary = temporaryName();
    if (::symlinkat(target.c_str(), dirFd, temporary.c_str()) != 0) {
        if (errno != EEXIST) return errno;
        if (::unlinkat(dirFd, temporary.c_str(), 0) != 0 ||
            ::symlinkat(target.c_str(), dirFd, temporary.c_str()) != 0)
            return errno;
    }
    if (::renameat(dirFd, temporary.c_str(), dirFd, name.c_str()) == 0) return 0;
    const int error = errno;
    ::unlinkat(dirFd, temporary.c_str(), 0);
    return error;
}

}  // namespace

SandboxMappingStore& SandboxMappingStore::shared() {
    static SandboxMappingStore store(DeviceRoot::resolve("/run/berthd/sandbox"));
    return store;
}

SandboxMappingStore::SandboxMappingStore(std::filesystem::path directory)
    : directory_(std::move(directory)) {}

std::string SandboxMappingStore::encodeIdentifier(const std::string& identifier) {
    std::string encoded;
    encoded.reserve(identifier.size());
    for (size_t i = 0; i < identifier.size(); ++i) {
        const unsigned char c = static_cast<unsigned char>(identifier[i]);
        if (c == '%' || c == '/' || c == '\0' || (i == 0 && c == '.'))
            appendEscaped(encoded, c);
        else
            encoded += static_cast<char>(c);
    }
    return encoded;
}

int SandboxMappingStore::setUserStateItem(uid_t user, uint64_t itemType,
                                          const std::string& identifier,
                                          const std::optional<std::string>& path) {
    std::string name;
    if (const int invalid = entryName(identifier, &name)) return invalid;
    UniqueFd directory = openEntryDirectory(directory_, user, itemType, path.has_value());
    if (!directory) return !path && errno == ENOENT ? 0 : errno;
    if (path) return replaceLink(directory.get(), name, *path);
    if (::unlinkat(directory.get(), name.c_str(), 0) == 0 || errno == ENOENT) return 0;
    return errno;
}

std::optional<std::string> SandboxMappingStore::lookup(uid_t user, uint64_t itemType,
                                                       const std::string& identifier) const {
    std::string name;
    if (entryName(identifier, &name) != 0) return std::nullopt;
    UniqueFd directory = openEntryDirectory(directory_, user, itemType, false);
    if (!directory) return std::nullopt;
    std::vector<char> buffer(PATH_MAX);
    while (buffer.size() <= kMaximumTargetLength) {
        const ssize_t length =
            ::readlinkat(directory.get(), name.c_str(), buffer.data(), buffer.size());
        if (length < 0) return std::nullopt;
        if (static_cast<size_t>(length) < buffer.size()) return std::string(buffer.data(), length);
        buffer.resize(buffer.size() * 2);
    }
    return std::nullopt;
}

}  // namespace berth
