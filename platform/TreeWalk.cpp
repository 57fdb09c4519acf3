#include "platform/TreeWalk.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>

namespace berth::fs {

namespace {

// How often an item that changed between its lstat and its opening is looked
// at again before it counts as unreadable.
constexpr int kAttemptsPerItem = 4;

// How many of the innermost directories are kept open (two descriptors
// each); the walk's descriptors stay bounded whatever the depth of the tree.
constexpr size_t kOpenDirectories = 32;

WalkEntry::Kind kindOf(const struct stat& st) {
    if (S_ISDIR(st.st_mode)) return WalkEntry::Kind::DirectoryPre;
    if (S_ISREG(st.st_mode)) return WalkEntry::Kind::File;
    if (S_ISLNK(st.st_mode)) return WalkEntry::Kind::Symlink;
    return WalkEntry::Kind::Other;
}

}  // namespace

// A directory being walked. While it is among the innermost directories it
// is open and read as it goes; deeper in the tree it is parked: its
// remaining names are read in advance and it is closed, and it is opened
// again through its child's ".." (and checked to be the same directory) when
// the walk comes back to it.
struct TreeWalk::Frame {
    UniqueFd dir;
    std::optional<DirReader> reader;
    std::vector<std::string> parked;  // the names still to visit, once parked
    size_t nextParked = 0;
    int parkedError = 0;  // why reading ahead stopped short, reported in turn
    WalkEntry entry;      // the directory's own entry, for its post-order visit

    Frame(UniqueFd fd, WalkEntry e) : dir(std::move(fd)), entry(std::move(e)) {
        reader.emplace(dir.get());
        entry.fd = dir.get();
    }

    bool isOpen() const { return static_cast<bool>(dir); }

    // Reads the rest of the directory (unless done before) and closes it.
    void park() {
        if (reader) {
            errno = 0;
            while (const struct dirent* d = reader->next()) parked.emplace_back(d->d_name);
            parkedError = errno;
            reader.reset();
        }
        dir.reset();
        entry.fd = -1;
    }

    // Opens the parked directory again as the parent of `child`; false when
    // that is no longer the directory that was parked.
    bool unpark(int child) {
        UniqueFd parent(::openat(child, "..", O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
        struct stat st;
        if (!parent || ::fstat(parent.get(), &st) != 0) return false;
        if (!sameItem(st, entry.st)) {
            errno = ESTALE;
            return false;
        }
        dir = std::move(parent);
        entry.fd = dir.get();
        return true;
    }

    // The next name, or false at the end (errno 0) or on a read error.
    bool nextName(std::string* name) {
        if (reader) {
            const struct dirent* d = reader->next();
            if (d) *name = d->d_name;
            return d != nullptr;
        }
        if (nextParked < parked.size()) {
            *name = std::move(parked[nextParked++]);
            return true;
        }
        errno = parkedError;
        return false;
    }
};

TreeWalk::TreeWalk(std::filesystem::path root) : root_(std::move(root)) {}

TreeWalk::~TreeWalk() = default;

const WalkEntry* TreeWalk::stop(int errnum, const std::filesystem::path& path) {
    error_ = errnum;
    errorPath_ = path;
    done_ = true;
    stack_.clear();
    return nullptr;
}

bool TreeWalk::isAncestor(const struct stat& st) const {
    for (const auto& frame : stack_)
        if (sameItem(frame->entry.st, st)) return true;
    return false;
}

const WalkEntry* TreeWalk::next() {
    if (done_) return nullptr;
    finished_.reset();
    if (pending_) {
        current_ = std::move(*pending_);
        pending_.reset();
        return &current_;
    }
    if (!started_) {
        started_ = true;
        std::filesystem::path parent;
        if (!splitParent(root_, &parent, &rootName_)) return stop(errno, root_);
        rootParent_ = openNoFollow(parent, O_RDONLY | O_DIRECTORY);
        if (!rootParent_) return stop(errno, root_);
        return visit(rootParent_.get(), rootName_, root_, 0);
    }
    while (!stack_.empty()) {
        Frame& top = *stack_.back();
        std::string name;
        if (top.nextName(&name)) {
            const std::filesystem::path path = top.entry.path / name;
            return visit(top.dir.get(), name, path, top.entry.level + 1);
        }
        if (errno != 0) return stop(errno, top.entry.path);
        finished_ = std::move(stack_.back());
        stack_.pop_back();
        if (!stack_.empty() && !stack_.back()->isOpen() &&
            !stack_.back()->unpark(finished_->dir.get()))
            return stop(errno, stack_.back()->entry.path);
        current_ = finished_->entry;
        // The parent may have been parked and opened again since.
        current_.parentFd = stack_.empty() ? rootParent_.get() : stack_.back()->dir.get();
        current_.kind = WalkEntry::Kind::DirectoryPost;
        return &current_;
    }
    done_ = true;
    return nullptr;
}

const WalkEntry* TreeWalk::visit(int parentFd, const std::string& name,
                                 const std::filesystem::path& path, int level) {
    WalkEntry entry;
    entry.path = path;
    entry.level = level;
    entry.parentFd = parentFd;
    entry.name = name;
    for (int attempt = 0;; ++attempt) {
        if (::fstatat(parentFd, name.c_str(), &entry.st, AT_SYMLINK_NOFOLLOW) != 0)
            return stop(errno, path);
        if (level == 0) rootDevice_ = entry.st.st_dev;
        entry.kind = kindOf(entry.st);
        if (entry.kind != WalkEntry::Kind::DirectoryPre) {
            current_ = std::move(entry);
            return &current_;
        }
        if (isAncestor(entry.st)) {
            entry.kind = WalkEntry::Kind::DirectoryCycle;
            current_ = std::move(entry);
            return &current_;
        }
        if (entry.st.st_dev != rootDevice_) {
            // Another file system: delivered, not entered.
            current_ = entry;
            WalkEntry post = std::move(entry);
            post.kind = WalkEntry::Kind::DirectoryPost;
            pending_ = std::move(post);
            return &current_;
        }
        UniqueFd dir = openDirectoryChecked(parentFd, name.c_str(), entry.st);
        if (dir) {
            stack_.push_back(std::make_unique<Frame>(std::move(dir), entry));
            if (!stack_.back()->reader->valid()) {
                const int err = errno;
                stack_.pop_back();
                entry.errnum = err;
                break;
            }
            if (stack_.size() > kOpenDirectories)
                stack_[stack_.size() - 1 - kOpenDirectories]->park();
            current_ = stack_.back()->entry;
            return &current_;
        }
        entry.errnum = errno;
        const bool changed = errno == ELOOP || errno == ENOTDIR || errno == ESTALE;
        if (!changed || attempt + 1 == kAttemptsPerItem) break;
    }
    // Unreadable: its pre-order visit, then the same directory as unreadable.
    current_ = entry;
    current_.errnum = 0;
    entry.kind = WalkEntry::Kind::Unreadable;
    pending_ = std::move(entry);
    return &current_;
}

}  // namespace berth::fs
