// Proving that a client-named path stays inside a container, and opening
// what it names so that the item checked is the item used.
#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <vector>

#include "BTHFileManager+Internal.h"
#include "BTHFileManager.h"
#include "platform/SafeFs.h"

namespace berth {

using filemanager::errorText;

namespace {

// The platform's limit on a path: link texts and real paths longer than
// this are refused rather than cut.
constexpr size_t kMaxPathLength = 1024;

// "/" first for an absolute path, then one entry per name; empty names
// ("a//b", a trailing "/") are dropped.
std::vector<std::string> pathComponents(const std::string& path) {
    std::vector<std::string> components;
    if (!path.empty() && path.front() == '/') components.emplace_back("/");
    size_t start = 0;
    while (start <= path.size()) {
        size_t end = path.find('/', start);
        if (end == std::string::npos) end = path.size();
        if (end > start) components.push_back(path.substr(start, end - start));
        start = end + 1;
    }
    return components;
}

// The first `count` components as a path.
std::string joinComponents(const std::vector<std::string>& components, size_t begin, size_t end) {
    std::string path;
    for (size_t i = begin; i < end; ++i) {
        if (components[i] == "/") {
            path = "/";
            continue;
        }
        if (!path.empty() && path.back() != '/') path += '/';
        path += components[i];
    }
    return path;
}

// Without a leading "/private", which is where "/var" and its siblings
// really live.
std::string withoutPrivatePrefix(const std::string& path) {
    return path.rfind("/private/", 0) == 0 ? path.substr(8) : path;
}

// `path` without trailing slashes ("/" stays).
std::string pathWithoutTrailingSlashes(const std::filesystem::path& path) {
    std::string text = path.string();
    while (text.size() > 1 && text.back() == '/') text.pop_back();
    return text;
}

// The index of the first component that counts when real paths are
// compared: past "/" and a transparent "private".
size_t firstComparedComponent(const std::vector<std::string>& components) {
    return components.size() > 1 && components[1] == "private" ? 2 : 1;
}

long openat2(int dirFd, const char* path, int flags, uint64_t resolve) {
    open_how how{};
    how.flags = static_cast<uint64_t>(flags) | O_CLOEXEC;
    how.resolve = resolve;
    return ::syscall(SYS_openat2, dirFd, path, &how, sizeof how);
}

}  // namespace

bool BTHFileManager::_validateSymlink(const std::string* path, int32_t startingDepth,
                                      int32_t* endingDepth) {
    if (!path) return false;
    int32_t depth = startingDepth;
    for (const std::string& component : pathComponents(*path)) {
        if (component == "..")
            --depth;
        else if (component != "." && component != "/")
            ++depth;
        if (depth < startingDepth) return false;
    }
    if (endingDepth) *endingDepth = depth;
    return true;
}

std::optional<std::filesystem::path> BTHFileManager::_realPathForURL(
    const std::filesystem::path& url, bool allowNonExistentPathComponents) {
    BTH_FUNCTION("-[BTHFileManager _realPathForURL:allowNonExistentPathComponents:]");
    // realpath(3) may write up to PATH_MAX bytes; the platform's shorter
    // limit is applied to the result.
    std::vector<char> buffer(PATH_MAX + 1, '\0');
    if (::realpath(url.c_str(), buffer.data())) {
        std::string real(buffer.data());
        if (real.size() < kMaxPathLength) return std::filesystem::path(real);
        errno = ENAMETOOLONG;
    }
    const int err = errno;
    if (err == ENOENT && allowNonExistentPathComponents)
        return _realPathWhatExistsInPath(url.string());
    BTHLogError("Failed to realpath %s : %s at %s", url, errorText(err), buffer.data());
    return std::nullopt;
}

std::optional<std::filesystem::path> BTHFileManager::_realPathWhatExistsInPath(
    const std::string& path) {
    BTH_FUNCTION("-[BTHFileManager _realPathWhatExistsInPath:]");
    const std::vector<std::string> components = pathComponents(path);
    const size_t n = components.size();
    if (n <= 1) return std::nullopt;
    for (size_t k = n; k >= 2; --k) {
        const std::filesystem::path prefix = joinComponents(components, 0, k);
        if (!itemExistsAtURL(prefix)) continue;
        std::optional<std::filesystem::path> real = _realPathForURL(prefix, false);
        if (!real) continue;
        const std::string remainder = joinComponents(components, k, n);
        BTHLogDebug("Realpathed %@ ; appending non-existing components %@", *real, remainder);
        return remainder.empty() ? *real : *real / remainder;
    }
    return std::nullopt;
}

std::optional<std::filesystem::path> BTHFileManager::realPathForURL(
    const std::optional<std::filesystem::path>& suspicious,
    const std::optional<std::filesystem::path>& base) {
    BTH_FUNCTION("-[BTHFileManager realPathForURL:ifChildOfURL:]");
    if (!suspicious || !base) {
        BTHLogError("The base path %@ and/or suspicious path %@ were nil", base, suspicious);
        return std::nullopt;
    }
    // A NUL byte would end the path the kernel sees before the path checked.
    if (suspicious->string().find('\0') != std::string::npos ||
        base->string().find('\0') != std::string::npos) {
        BTHLogError("The suspicious path %@ or base path %@ contains a NUL byte", *suspicious,
                    *base);
        return std::nullopt;
    }
    const std::string basePath = withoutPrivatePrefix(base->string());
    const std::string path = withoutPrivatePrefix(suspicious->string());
    if (path.rfind(basePath, 0) != 0) {
        BTHLogError("supiscious path %@ does not contain base path %@ as a prefix", path, basePath);
        return std::nullopt;
    }
    const std::vector<std::string> components = pathComponents(path);
    for (const std::string& component : components) {
        if (component == "..") {
            BTHLogError("The suspicious path %@ contains '..' paths, which are invalid", path);
            return std::nullopt;
        }
    }

    char linkText[kMaxPathLength] = {};
    const ssize_t linkLength = ::readlink(path.c_str(), linkText, sizeof linkText);
    if (linkLength < 0 && errno != EINVAL && errno != ENOENT) {
        BTHLogError("Readlink failed: %s", errorText(errno));
        return std::nullopt;
    }
    if (linkLength >= static_cast<ssize_t>(sizeof linkText)) {
        BTHLogError("Readlink failed: %s", errorText(ENAMETOOLONG));
        return std::nullopt;
    }
    if (linkLength >= 0) {
        const std::string text(linkText, linkLength);
        if (!text.empty() && text.front() == '/') {
            BTHLogError("Rejecting %@ -> %s, as absolute symlinks are not allowed", path, text);
            return std::nullopt;
        }
        int32_t baseDepth = 0;
        if (!_validateSymlink(&basePath, 0, &baseDepth)) {
            BTHLogError("Failed to retrieve depth of %@", basePath);
            return std::nullopt;
        }
        std::string below = path.substr(basePath.size());
        if (below.empty() || below.front() != '/') below.insert(below.begin(), '/');
        std::vector<std::string> belowComponents = pathComponents(below);
        belowComponents.pop_back();  // the link's own name
        belowComponents.push_back(text);
        const std::string combined = joinComponents(belowComponents, 0, belowComponents.size());
        if (!_validateSymlink(&combined, baseDepth, nullptr)) {
            BTHLogError("Rejecting %@ -> %@, as it is points outside or to the base %@", path,
                        combined, basePath);
            return std::nullopt;
        }
    }

    std::optional<std::filesystem::path> realBase = _realPathForURL(basePath, false);
    if (!realBase) {
        BTHLogError("Failed to retrieve realpath for base path %@ ", basePath);
        return std::nullopt;
    }
    std::optional<std::filesystem::path> real = _realPathForURL(path, true);
    if (!real) {
        BTHLogError("Failed to retrieve realpath for suspicious path %@", path);
        return std::nullopt;
    }

    // A link that passed the depth check still has its real path compared:
    // its text may lead to a further link that leaves the base.
    const std::vector<std::string> rb = pathComponents(realBase->string());
    const std::vector<std::string> rs = pathComponents(real->string());
    if (rb.size() < 2 || rs.size() < 2) {
        BTHLogError(
            "Rejecting %@ with base %@ because real component counts don't make sense (reals %@ "
            "; %@)",
            path, basePath, *real, *realBase);
        return std::nullopt;
    }
    const size_t i = firstComparedComponent(rb);
    const size_t j = firstComparedComponent(rs);
    if (rb.size() - i > rs.size() - j) {
        BTHLogError(
            "Rejecting %@ with base %@ because base component count is greater than child "
            "component count (reals %@ ; %@)",
            path, basePath, *real, *realBase);
        return std::nullopt;
    }
    for (size_t k = 0; i + k < rb.size(); ++k) {
        if (rb[i + k] != rs[j + k]) {
            BTHLogError(
                "Rejecting %@ with base %@ (reals %@ ; %@) because components diverge at %@ != %@",
                path, basePath, *real, *realBase, rb[i + k], rs[j + k]);
            return std::nullopt;
        }
    }
    return real;
}

namespace {

// The directory at `realDir`, a real path at or below `realBase`, opened
// (O_PATH) beneath the base's own descriptor with no link followed, no magic
// link and no other file system on the way. Invalid with errno EXDEV when
// `realDir` is not below the base, else with the open's error.
UniqueFd openDirectoryBeneath(const std::filesystem::path& realBase,
                              const std::filesystem::path& realDir) {
    const std::string relative = realDir.lexically_relative(realBase).string();
    const std::vector<std::string> parts = pathComponents(relative);
    if (parts.empty() || parts.front() == "..") {
        errno = EXDEV;
        return {};
    }
    UniqueFd baseFd = fs::openNoFollow(realBase, O_PATH | O_DIRECTORY);
    if (!baseFd) return {};
    long dir =
        openat2(baseFd.get(), relative.c_str(), O_PATH | O_DIRECTORY,
                RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS | RESOLVE_NO_XDEV);
    if (dir < 0 && errno == ENOSYS) {
        // Kernels before 5.6: the same refusal of every link, component by
        // component from the root down.
        return fs::openNoFollow(realDir, O_PATH | O_DIRECTORY);
    }
    if (dir < 0) return {};
    return UniqueFd(static_cast<int>(dir));
}

}  // namespace

std::optional<BTHFileManager::ContainedItem> BTHFileManager::openContainedItem(
    const std::filesystem::path& suspicious, const std::filesystem::path& base) {
    std::optional<std::filesystem::path> real = realPathForURL(suspicious, base);
    std::optional<std::filesystem::path> realBase =
        real ? _realPathForURL(withoutPrivatePrefix(base.string()), false) : std::nullopt;
    // The base itself is not an item inside it.
    if (!real || !realBase || *real == *realBase) {
        errno = EXDEV;
        return std::nullopt;
    }
    // Both real paths are free of links and ".."; what lies between them is
    // opened beneath the base's own descriptor, refusing any link that has
    // appeared since.
    UniqueFd parent = openDirectoryBeneath(*realBase, real->parent_path());
    if (!parent) return std::nullopt;
    return ContainedItem{std::move(parent), real->filename().string(), *real};
}

std::optional<BTHFileManager::ContainedItem> BTHFileManager::openContainedEntry(
    const std::filesystem::path& suspicious, const std::filesystem::path& base) {
    if (!realPathForURL(suspicious, base)) {
        errno = EXDEV;
        return std::nullopt;
    }
    // Free of ".." now, so the lexical form names the same entry; "." and
    // trailing slashes go.
    const std::filesystem::path entry =
        withoutPrivatePrefix(suspicious.lexically_normal().string());
    const std::filesystem::path basePath = withoutPrivatePrefix(base.lexically_normal().string());
    std::filesystem::path parentPath;
    std::string name;
    if (!fs::splitParent(entry, &parentPath, &name) ||
        parentPath.string().size() < pathWithoutTrailingSlashes(basePath).size()) {
        errno = EXDEV;  // the base itself is not an entry inside it
        return std::nullopt;
    }
    std::optional<std::filesystem::path> realParent = realPathForURL(parentPath, basePath);
    std::optional<std::filesystem::path> realBase =
        realParent ? _realPathForURL(basePath, false) : std::nullopt;
    if (!realParent || !realBase) {
        errno = EXDEV;
        return std::nullopt;
    }
    UniqueFd parent = openDirectoryBeneath(*realBase, *realParent);
    if (!parent) return std::nullopt;
    return ContainedItem{std::move(parent), name, *realParent / name};
}

bool BTHFileManager::moveContainedItem(const ContainedItem& source, const ContainedItem& dest,
                                       BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHFileManager moveContainedItem:toItem:error:]");
    if (::renameat(source.parent.get(), source.name.c_str(), dest.parent.get(),
                   dest.name.c_str()) == 0)
        return true;
    const int err = errno;
    BTHSetError(error, BTHMakePOSIXError(err, "rename of %@ to %@ failed: %s", source.realPath,
                                         dest.realPath, errorText(err)));
    return false;
}

}  // namespace berth
