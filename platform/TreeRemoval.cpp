#include "platform/TreeRemoval.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <string>
#include <vector>

#include "platform/SafeFs.h"

namespace berth::fs {

namespace {

// How often an item that changed between its lstat and the act on it is
// looked at again before its failure is reported.
constexpr int kAttemptsPerItem = 4;

// Directories deeper than this below the root are not entered where they
// are: they are moved up into the root and taken apart from there. So the
// removal holds at most this many directory descriptors and stack frames,
// however deep a chain an app has built.
constexpr int kMaxDepth = 48;

struct Entry {
    std::string name;
    unsigned char type;  // d_type: DT_UNKNOWN when the file system does not tell
};

class Remover {
  public:
    explicit Remover(const RemovalErrorCallback& onError) : onError_(onError) {}

    // False when the callback asked to stop.
    bool removeEntry(int parentFd, const std::string& name, const std::filesystem::path& path,
                     unsigned char type, int depth);
    int result() const { return firstError_; }

  private:
    // Removes the directory `name` in `parentFd`, which lstat saw as `st`.
    // Returns 0 when done, -1 to look at the item again, else false's
    // meaning through `*goOn`.
    int removeDirectory(int parentFd, const std::string& name, const std::filesystem::path& path,
                        const struct stat& st, int depth, bool* goOn);
    bool removeContents(int dirFd, int parentFd, const std::string& name,
                        const std::filesystem::path& path, int depth);
    // Moves a directory too deep to enter into the root, under a fresh name.
    bool relocate(int dirFd, const std::string& name, const std::filesystem::path& path);
    bool fail(int parentFd, const std::string& name, const std::filesystem::path& path, int errnum);

    const RemovalErrorCallback& onError_;
    dev_t rootDevice_ = 0;
    int rootFd_ = -1;
    std::filesystem::path rootPath_;
    bool relocated_ = false;
    unsigned long relocations_ = 0;
    int firstError_ = 0;

    friend int fs::removeTree(const std::filesystem::path&, const RemovalErrorCallback&);
};

bool Remover::fail(int parentFd, const std::string& name, const std::filesystem::path& path,
                   int errnum) {
    if (onError_) {
        if (onError_(RemovalFailure{parentFd, name.c_str(), path, errnum}) ==
            RemovalAnswer::Proceed)
            return true;
        firstError_ = errnum;
        return false;
    }
    if (firstError_ == 0) firstError_ = errnum;
    return true;
}

bool Remover::removeEntry(int parentFd, const std::string& name, const std::filesystem::path& path,
                          unsigned char type, int depth) {
    const char* cname = name.c_str();
    // What the directory listing says is not a directory is unlinked at
    // once: unlinkat never follows a link and never removes a directory, so
    // a lying or stale type can only make it fail.
    if (type != DT_DIR && type != DT_UNKNOWN) {
        if (::unlinkat(parentFd, cname, 0) == 0) return true;
        if (errno != EISDIR && errno != EPERM) return fail(parentFd, name, path, errno);
    }
    int err = 0;
    for (int attempt = 0; attempt < kAttemptsPerItem; ++attempt) {
        struct stat st;
        if (::fstatat(parentFd, cname, &st, AT_SYMLINK_NOFOLLOW) != 0)
            return fail(parentFd, name, path, errno);
        if (!S_ISDIR(st.st_mode)) {
            if (::unlinkat(parentFd, cname, 0) == 0) return true;
            err = errno;
            if (err == EISDIR) continue;  // became a directory since the lstat
            return fail(parentFd, name, path, err);
        }
        bool goOn = true;
        const int state = removeDirectory(parentFd, name, path, st, depth, &goOn);
        if (state == 0) return goOn;
        err = state;
    }
    return fail(parentFd, name, path, err);
}

int Remover::removeDirectory(int parentFd, const std::string& name,
                             const std::filesystem::path& path, const struct stat& st, int depth,
                             bool* goOn) {
    const char* cname = name.c_str();
    if (st.st_dev != rootDevice_) {
        *goOn = fail(parentFd, name, path, EXDEV);
        return 0;
    }
    if (depth >= kMaxDepth) {
        *goOn = relocate(parentFd, name, path);
        return 0;
    }
    UniqueFd dir = openDirectoryChecked(parentFd, cname, st);
    if (!dir) {
        const int err = errno;
        // Swapped for a link or another item since the lstat: look again.
        if (err == ELOOP || err == ENOTDIR || err == ESTALE) return err;
        // Unreadable: reported, and its removal still tried (it may be empty).
        if (!fail(parentFd, name, path, err)) {
            *goOn = false;
            return 0;
        }
    } else if (!removeContents(dir.get(), parentFd, name, path, depth)) {
        *goOn = false;
        return 0;
    }
    dir.reset();
    if (::unlinkat(parentFd, cname, AT_REMOVEDIR) == 0) return 0;
    const int err = errno;
    if (err == ENOTDIR) return err;  // no longer a directory: look again
    *goOn = fail(parentFd, name, path, err);
    return 0;
}

bool Remover::relocate(int dirFd, const std::string& name, const std::filesystem::path& path) {
    for (int attempt = 0; attempt < 8; ++attempt) {
        char fresh[64];
        std::snprintf(fresh, sizeof fresh, ".berth-deep-%lu", relocations_++);
        if (::renameat2(dirFd, name.c_str(), rootFd_, fresh, RENAME_NOREPLACE) == 0) {
            relocated_ = true;
            return true;
        }
        if (errno != EEXIST) break;
    }
    return fail(dirFd, name, path, errno);
}

bool Remover::removeContents(int dirFd, int parentFd, const std::string& name,
                             const std::filesystem::path& path, int depth) {
    std::vector<Entry> entries;
    {
        DirReader reader(dirFd);
        if (!reader.valid()) return fail(parentFd, name, path, errno);
        while (const struct dirent* entry = reader.next())
            entries.push_back(Entry{entry->d_name, entry->d_type});
        if (errno != 0) return fail(parentFd, name, path, errno);
    }
    for (const Entry& child : entries) {
        // The common case, a file that goes at once, needs no path: paths are
        // made only for items that take the careful route (and may fail).
        if (child.type != DT_DIR && child.type != DT_UNKNOWN &&
            ::unlinkat(dirFd, child.name.c_str(), 0) == 0)
            continue;
        if (!removeEntry(dirFd, child.name, path / child.name, DT_UNKNOWN, depth + 1)) return false;
    }
    return true;
}

}  // namespace

int removeTree(const std::filesystem::path& path, const RemovalErrorCallback& onError) {
    std::string name;
    UniqueFd parent = openParentNoFollow(path, &name);
    if (!parent) return errno;
    Remover remover(onError);
    struct stat st;
    if (::fstatat(parent.get(), name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) {
        remover.fail(parent.get(), name, path, errno);
        return remover.result();
    }
    remover.rootDevice_ = st.st_dev;
    if (!S_ISDIR(st.st_mode)) {
        remover.removeEntry(parent.get(), name, path, DT_UNKNOWN, 0);
        return remover.result();
    }
    UniqueFd root = openDirectoryChecked(parent.get(), name.c_str(), st);
    if (!root) {
        // Swapped or unreadable: the general path looks again and reports.
        remover.removeEntry(parent.get(), name, path, DT_DIR, 0);
        return remover.result();
    }
    remover.rootFd_ = root.get();
    // Each pass takes apart what it can reach; subtrees moved up into the
    // root during a pass are taken apart by the next one.
    do {
        remover.relocated_ = false;
        if (!remover.removeContents(root.get(), parent.get(), name, path, 0))
            return remover.result();
    } while (remover.relocated_);
    if (::unlinkat(parent.get(), name.c_str(), AT_REMOVEDIR) != 0)
        remover.fail(parent.get(), name, path, errno);
    return remover.result();
}

}  // namespace berth::fs
