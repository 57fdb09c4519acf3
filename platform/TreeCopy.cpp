#include "platform/TreeCopy.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "platform/FileFlags.h"
#include "platform/SafeFs.h"
#include "platform/TreeRemoval.h"
#include "platform/UniqueFd.h"

namespace berth::fs {

namespace {

constexpr int kAttemptsPerItem = 4;

// How many of the innermost directory levels keep their source and
// destination open (two descriptors each); the copy's descriptors stay
// bounded whatever the depth of the tree.
constexpr size_t kOpenLevels = 32;

bool changedSinceLstat(int err) {
    return err == ELOOP || err == ENOTDIR || err == ESTALE;
}

int copyData(int from, int to) {
    bool useRange = true;
    for (;;) {
        ssize_t n = -1;
        if (useRange) {
            n = ::copy_file_range(from, nullptr, to, nullptr, 1 << 20, 0);
            if (n < 0 &&
                (errno == EXDEV || errno == EINVAL || errno == ENOSYS || errno == EOPNOTSUPP)) {
                useRange = false;
                continue;
            }
        } else {
            char buffer[1 << 16];
            n = ::read(from, buffer, sizeof buffer);
            for (ssize_t done = 0; n > 0 && done < n;) {
                ssize_t w = ::write(to, buffer + done, static_cast<size_t>(n - done));
                if (w < 0 && errno != EINTR) return errno;
                if (w > 0) done += w;
            }
        }
        if (n == 0) return 0;
        if (n < 0 && errno != EINTR) return errno;
    }
}

int copyExtendedAttributes(int from, int to) {
    ssize_t size = ::flistxattr(from, nullptr, 0);
    if (size < 0) return errno == EOPNOTSUPP ? 0 : errno;
    std::vector<char> names(static_cast<size_t>(size) + 1);
    size = ::flistxattr(from, names.data(), names.size());
    if (size < 0) return errno;
    for (ssize_t at = 0; at < size;) {
        const char* name = names.data() + at;
        at += static_cast<ssize_t>(std::char_traits<char>::length(name)) + 1;
        ssize_t length = ::fgetxattr(from, name, nullptr, 0);
        if (length < 0) return errno;
        std::vector<char> value(static_cast<size_t>(length));
        length = ::fgetxattr(from, name, value.data(), value.size());
        if (length < 0) return errno;
        if (::fsetxattr(to, name, value.data(), static_cast<size_t>(length), 0) != 0) return errno;
    }
    return 0;
}

// Owner first (a change of owner drops set-id bits and file capabilities),
// then attributes, mode and times; flags last, as they may forbid the rest.
int copyMetadata(int from, int to, const struct stat& st) {
    if (::fchown(to, st.st_uid, st.st_gid) != 0) return errno;
    if (int err = copyExtendedAttributes(from, to)) return err;
    if (::fchmod(to, st.st_mode & 07777) != 0) return errno;
    const struct timespec times[2] = {st.st_atim, st.st_mtim};
    if (::futimens(to, times) != 0) return errno;
    unsigned flags = 0;
    if (int err = fileflags::get(from, &flags))
        return err == ENOTTY || err == EOPNOTSUPP ? 0 : err;  // a file system without flags
    flags &= fileflags::kCopied;
    if (flags == 0) return 0;
    unsigned present = 0;
    if (int err = fileflags::get(to, &present)) return err;
    return fileflags::set(to, present | flags);
}

// Owner, mode and times of an item that cannot be opened safely (a link, a
// special file), set through its directory without following a link.
int copyMetadataAt(int dirFd, const char* name, const struct stat& st) {
    if (::fchownat(dirFd, name, st.st_uid, st.st_gid, AT_SYMLINK_NOFOLLOW) != 0) return errno;
    if (!S_ISLNK(st.st_mode))
        if (int err = chmodAtNoFollow(dirFd, name, st.st_mode & 07777)) return err;
    const struct timespec times[2] = {st.st_atim, st.st_mtim};
    return ::utimensat(dirFd, name, times, AT_SYMLINK_NOFOLLOW) == 0 ? 0 : errno;
}

// A directory being copied: its source and destination and the names in the
// source still to copy (read in full on entering: a copy into itself adds to
// the directory it reads). Among the innermost levels both
// directories stay open; a level further up is parked: both are closed, and
// when the copy comes back to it they are opened again as the child's ".."
// and accepted only if they are the very directories left.
struct Level {
    UniqueFd src;
    UniqueFd dst;
    struct stat srcSt {};  // the source's lstat: its attributes, and who it is
    struct stat dstSt {};  // who the destination is
    std::vector<std::string> names;
    size_t next = 0;

    bool isOpen() const { return static_cast<bool>(src); }

    void park() {
        src.reset();
        dst.reset();
    }

    // Opens the parked level again through its child's "..". ESTALE when
    // either is no longer the directory parked: the child was moved away, and
    // the copy would go on somewhere else.
    int unpark(const Level& child) {
        if (int err = reopenParent(child.src.get(), srcSt, &src)) return err;
        return reopenParent(child.dst.get(), dstSt, &dst);
    }

  private:
    static int reopenParent(int child, const struct stat& expected, UniqueFd* parent) {
        UniqueFd fd(::openat(child, "..", O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
        struct stat st;
        if (!fd || ::fstat(fd.get(), &st) != 0) return errno;
        if (!sameItem(st, expected)) return ESTALE;
        *parent = std::move(fd);
        return 0;
    }
};

// Copies depth first with an explicit stack of levels, so neither the
// descriptors nor the stack it uses grow with the depth of the tree.
class Copier {
  public:
    int copy(int srcParent, const std::string& srcName, int dstParent, const std::string& dstName);
    bool createdRoot() const { return createdRoot_; }

  private:
    // Copies one item; a directory is entered (its level pushed), its
    // contents copied by the caller's loop.
    int copyEntry(int srcParent, const std::string& srcName, int dstParent,
                  const std::string& dstName, bool isRoot);
    int copyFile(int srcParent, const char* srcName, int dstParent, const char* dstName,
                 const struct stat& st, bool isRoot);
    int enterDirectory(int srcParent, const char* srcName, int dstParent, const char* dstName,
                       const struct stat& st, bool isRoot);
    // The directory's attributes, once its contents are in; then back to its
    // parent, opened again if it was parked.
    int leaveDirectory();
    int copyLink(int srcParent, const char* srcName, int dstParent, const char* dstName,
                 const struct stat& st, bool isRoot);
    int copySpecial(int dstParent, const char* dstName, const struct stat& st, bool isRoot);

    // Makes room for a new non-directory: a non-directory in the way goes.
    static int clearWay(int dstParent, const char* dstName);

    // The directories being copied, outermost first.
    std::vector<Level> levels_;
    // Directories this copy made: met again in the source (a copy into
    // itself), they are not copied again.
    std::set<std::pair<dev_t, ino_t>> made_;
    bool createdRoot_ = false;
};

int Copier::clearWay(int dstParent, const char* dstName) {
    struct stat st;
    if (::fstatat(dstParent, dstName, &st, AT_SYMLINK_NOFOLLOW) != 0) return errno;
    if (S_ISDIR(st.st_mode)) return EISDIR;
    return ::unlinkat(dstParent, dstName, 0) == 0 ? 0 : errno;
}

int Copier::copy(int srcParent, const std::string& srcName, int dstParent,
                 const std::string& dstName) {
    if (int err = copyEntry(srcParent, srcName, dstParent, dstName, true)) return err;
    while (!levels_.empty()) {
        Level& level = levels_.back();
        if (level.next == level.names.size()) {
            if (int err = leaveDirectory()) return err;
            continue;
        }
        // Taken out, as entering a directory grows the stack under `level`.
        const std::string name = std::move(level.names[level.next++]);
        if (int err = copyEntry(level.src.get(), name, level.dst.get(), name, false)) return err;
    }
    return 0;
}

int Copier::copyEntry(int srcParent, const std::string& srcName, int dstParent,
                      const std::string& dstName, bool isRoot) {
    const char* sname = srcName.c_str();
    const char* dname = dstName.c_str();
    int err = 0;
    for (int attempt = 0; attempt < kAttemptsPerItem; ++attempt) {
        struct stat st;
        if (::fstatat(srcParent, sname, &st, AT_SYMLINK_NOFOLLOW) != 0) return errno;
        if (S_ISREG(st.st_mode))
            err = copyFile(srcParent, sname, dstParent, dname, st, isRoot);
        else if (S_ISDIR(st.st_mode))
            err = enterDirectory(srcParent, sname, dstParent, dname, st, isRoot);
        else if (S_ISLNK(st.st_mode))
            err = copyLink(srcParent, sname, dstParent, dname, st, isRoot);
        else
            err = copySpecial(dstParent, dname, st, isRoot);
        // An item swapped since its lstat is looked at again, and copied as
        // what it is now.
        if (!changedSinceLstat(err)) return err;
    }
    return EAGAIN;  // kept changing under the copy
}

int Copier::copyFile(int srcParent, const char* srcName, int dstParent, const char* dstName,
                     const struct stat& st, bool isRoot) {
    UniqueFd from = openItemChecked(srcParent, srcName, st);
    if (!from) return errno;
    UniqueFd to = openAtNoFollow(dstParent, dstName, O_WRONLY | O_CREAT | O_EXCL, 0600);
    if (!to && errno == EEXIST) {
        if (int err = clearWay(dstParent, dstName)) return err == ENOENT ? EEXIST : err;
        to = openAtNoFollow(dstParent, dstName, O_WRONLY | O_CREAT | O_EXCL, 0600);
    }
    if (!to) return errno;
    if (isRoot) createdRoot_ = true;
    if (int err = copyData(from.get(), to.get())) return err;
    return copyMetadata(from.get(), to.get(), st);
}

int Copier::enterDirectory(int srcParent, const char* srcName, int dstParent, const char* dstName,
                           const struct stat& st, bool isRoot) {
    if (made_.count({st.st_dev, st.st_ino})) return 0;
    Level level;
    level.src = openDirectoryChecked(srcParent, srcName, st);
    if (!level.src) return errno;
    level.srcSt = st;
    // Made private to root until its contents and attributes are in.
    if (::mkdirat(dstParent, dstName, 0700) == 0) {
        if (isRoot) createdRoot_ = true;
    } else if (errno != EEXIST) {
        return errno;
    }
    level.dst = openAtNoFollow(dstParent, dstName, O_RDONLY | O_DIRECTORY);
    if (!level.dst) return errno == ELOOP || errno == ENOTDIR ? EEXIST : errno;
    if (::fstat(level.dst.get(), &level.dstSt) != 0) return errno;
    made_.insert({level.dstSt.st_dev, level.dstSt.st_ino});
    {
        DirReader reader(level.src.get());
        if (!reader.valid()) return errno;
        while (const struct dirent* entry = reader.next()) level.names.emplace_back(entry->d_name);
        if (errno != 0) return errno;
    }
    levels_.push_back(std::move(level));
    if (levels_.size() > kOpenLevels) levels_[levels_.size() - 1 - kOpenLevels].park();
    return 0;
}

int Copier::leaveDirectory() {
    Level& level = levels_.back();
    if (int err = copyMetadata(level.src.get(), level.dst.get(), level.srcSt)) return err;
    if (levels_.size() > 1) {
        Level& parent = levels_[levels_.size() - 2];
        if (!parent.isOpen())
            if (int err = parent.unpark(level)) return err;
    }
    levels_.pop_back();
    return 0;
}

int Copier::copyLink(int srcParent, const char* srcName, int dstParent, const char* dstName,
                     const struct stat& st, bool isRoot) {
    std::string target(static_cast<size_t>(st.st_size) + 1, '\0');
    ssize_t n = ::readlinkat(srcParent, srcName, target.data(), target.size());
    if (n < 0) return errno == EINVAL ? ESTALE : errno;  // no longer a link
    if (static_cast<size_t>(n) != static_cast<size_t>(st.st_size)) return ESTALE;
    target.resize(static_cast<size_t>(n));
    if (::symlinkat(target.c_str(), dstParent, dstName) != 0) {
        if (errno != EEXIST) return errno;
        if (int err = clearWay(dstParent, dstName)) return err == ENOENT ? EEXIST : err;
        if (::symlinkat(target.c_str(), dstParent, dstName) != 0) return errno;
    }
    if (isRoot) createdRoot_ = true;
    return copyMetadataAt(dstParent, dstName, st);
}

int Copier::copySpecial(int dstParent, const char* dstName, const struct stat& st, bool isRoot) {
    const mode_t mode = st.st_mode & (S_IFMT | 0600);
    if (::mknodat(dstParent, dstName, mode, st.st_rdev) != 0) {
        if (errno != EEXIST) return errno;
        if (int err = clearWay(dstParent, dstName)) return err == ENOENT ? EEXIST : err;
        if (::mknodat(dstParent, dstName, mode, st.st_rdev) != 0) return errno;
    }
    if (isRoot) createdRoot_ = true;
    return copyMetadataAt(dstParent, dstName, st);
}

}  // namespace

int copyTree(const std::filesystem::path& source, const std::filesystem::path& dest) {
    std::string srcName, dstName;
    UniqueFd srcParent = openParentNoFollow(source, &srcName);
    if (!srcParent) return errno;
    UniqueFd dstParent = openParentNoFollow(dest, &dstName);
    if (!dstParent) return errno;
    Copier copier;
    const int err = copier.copy(srcParent.get(), srcName, dstParent.get(), dstName);
    if (err != 0 && copier.createdRoot()) removeTree(dest);
    return err;
}

}  // namespace berth::fs
