#include "platform/TreeRemoval.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <string>
#include <vector>

#include "platform/SafeFs.h"

namespace berth::fs {

namespace {

// How often an item that changed between its lstat and the act on it is
// looked at again before its failure is reported.
constexpr int kAttemptsPerItem = 4;

class Remover {
  public:
    explicit Remover(const RemovalErrorCallback& onError) : onError_(onError) {}

    // False when the callback asked to stop.
    bool removeEntry(int parentFd, const std::string& name, const std::filesystem::path& path,
                     bool isRoot);
    int result() const { return firstError_; }

  private:
    bool removeContents(int dirFd, int parentFd, const std::string& name,
                        const std::filesystem::path& path);
    bool fail(int parentFd, const std::string& name, const std::filesystem::path& path, int errnum);

    const RemovalErrorCallback& onError_;
    dev_t rootDevice_ = 0;
    int firstError_ = 0;
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
                          bool isRoot) {
    const char* cname = name.c_str();
    int err = 0;
    for (int attempt = 0; attempt < kAttemptsPerItem; ++attempt) {
        struct stat st;
        if (::fstatat(parentFd, cname, &st, AT_SYMLINK_NOFOLLOW) != 0)
            return fail(parentFd, name, path, errno);
        if (isRoot) rootDevice_ = st.st_dev;

        if (!S_ISDIR(st.st_mode)) {
            if (::unlinkat(parentFd, cname, 0) == 0) return true;
            err = errno;
            if (err == EISDIR) continue;  // became a directory since the lstat
            return fail(parentFd, name, path, err);
        }

        if (st.st_dev != rootDevice_) return fail(parentFd, name, path, EXDEV);
        UniqueFd dir = openDirectoryChecked(parentFd, cname, st);
        if (!dir) {
            err = errno;
            // Swapped for a link or another item since the lstat: look again.
            if (err == ELOOP || err == ENOTDIR || err == ESTALE) continue;
            // Unreadable: reported, and its removal still tried (it may be empty).
            if (!fail(parentFd, name, path, err)) return false;
        } else if (!removeContents(dir.get(), parentFd, name, path)) {
            return false;
        }
        if (::unlinkat(parentFd, cname, AT_REMOVEDIR) == 0) return true;
        err = errno;
        if (err == ENOTDIR) continue;  // no longer a directory: look again
        return fail(parentFd, name, path, err);
    }
    return fail(parentFd, name, path, err);
}

bool Remover::removeContents(int dirFd, int parentFd, const std::string& name,
                             const std::filesystem::path& path) {
    std::vector<std::string> names;
    {
        DirReader reader(dirFd);
        if (!reader.valid()) return fail(parentFd, name, path, errno);
        while (const struct dirent* entry = reader.next()) names.emplace_back(entry->d_name);
        if (errno != 0) return fail(parentFd, name, path, errno);
    }
    for (const std::string& child : names)
        if (!removeEntry(dirFd, child, path / child, false)) return false;
    return true;
}

}  // namespace

int removeTree(const std::filesystem::path& path, const RemovalErrorCallback& onError) {
    std::string name;
    UniqueFd parent = openParentNoFollow(path, &name);
    if (!parent) return errno;
    Remover remover(onError);
    remover.removeEntry(parent.get(), name, path, true);
    return remover.result();
}

}  // namespace berth::fs
