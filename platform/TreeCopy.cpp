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

class Copier {
  public:
    int copyEntry(int srcParent, const std::string& srcName, int dstParent,
                  const std::string& dstName, bool isRoot);
    bool createdRoot() const { return createdRoot_; }

  private:
    int copyFile(int srcParent, const char* srcName, int dstParent, const char* dstName,
                 const struct stat& st, bool isRoot);
    int copyDirectory(int srcParent, const char* srcName, int dstParent, const char* dstName,
                      const struct stat& st, bool isRoot);
    int copyLink(int srcParent, const char* srcName, int dstParent, const char* dstName,
                 const struct stat& st, bool isRoot);
    int copySpecial(int dstParent, const char* dstName, const struct stat& st, bool isRoot);

    // Makes room for a new non-directory: a non-directory in the way goes.
    static int clearWay(int dstParent, const char* dstName);

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
            err = copyDirectory(srcParent, sname, dstParent, dname, st, isRoot);
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

int Copier::copyDirectory(int srcParent, const char* srcName, int dstParent, const char* dstName,
                          const struct stat& st, bool isRoot) {
    if (made_.count({st.st_dev, st.st_ino})) return 0;
    UniqueFd from = openDirectoryChecked(srcParent, srcName, st);
    if (!from) return errno;
    // Made private to root until its contents and attributes are in.
    if (::mkdirat(dstParent, dstName, 0700) == 0) {
        if (isRoot) createdRoot_ = true;
    } else if (errno != EEXIST) {
        return errno;
    }
    UniqueFd to = openAtNoFollow(dstParent, dstName, O_RDONLY | O_DIRECTORY);
    if (!to) return errno == ELOOP || errno == ENOTDIR ? EEXIST : errno;
    struct stat made;
    if (::fstat(to.get(), &made) != 0) return errno;
    made_.insert({made.st_dev, made.st_ino});

    std::vector<std::string> names;
    {
        DirReader reader(from.get());
        if (!reader.valid()) return errno;
        while (const struct dirent* entry = reader.next()) names.emplace_back(entry->d_name);
        if (errno != 0) return errno;
    }
    for (const std::string& name : names)
        if (int err = copyEntry(from.get(), name, to.get(), name, false)) {
            // A child that changed kind under us is this directory's business
            // no more: report it as a plain failure, not as a change here.
            return changedSinceLstat(err) ? EAGAIN : err;
        }
    return copyMetadata(from.get(), to.get(), st);
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
    const int err = copier.copyEntry(srcParent.get(), srcName, dstParent.get(), dstName, true);
    if (err != 0 && copier.createdRoot()) removeTree(dest);
    return err;
}

}  // namespace berth::fs
