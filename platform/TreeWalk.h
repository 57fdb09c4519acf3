// A link-safe walk of a directory tree, pre- and post-order, in directory
// order. Links are delivered, never followed; directories on another file
// system are delivered but not entered; each directory is entered through a
// descriptor opened relative to its parent's, checked to be the item its
// lstat described. Every entry carries the descriptor of the directory
// holding it and its name there, so whoever acts on an entry does so without
// resolving its path again.
//
// The walk holds a bounded number of descriptors whatever the depth: only the
// innermost directories stay open; one further up is read ahead and closed,
// and on the way back reached again as its child's "..", which must be the
// very directory left (a directory moved meanwhile ends the walk with
// ESTALE rather than lead it somewhere else).
#pragma once

#include <sys/stat.h>

#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/SafeFs.h"
#include "platform/UniqueFd.h"

namespace berth::fs {

struct WalkEntry {
    enum class Kind {
        DirectoryPre,    // a directory, before its contents
        DirectoryPost,   // the same directory, after its contents
        DirectoryCycle,  // a directory that is one of its own ancestors
        Unreadable,      // a directory that could not be opened or read (after its pre-order visit)
        File,            // a regular file
        Symlink,         // a symbolic link (never followed)
        Other,           // device, fifo, socket
    };

    std::filesystem::path path;
    int level = 0;  // 0 for the root
    Kind kind = Kind::Other;
    struct stat st {};  // lstat information of the item
    int errnum = 0;     // for Unreadable: why
    // The directory holding the item (open for reading) and the item's name
    // in it. For the root, parentFd is the root's own parent.
    int parentFd = -1;
    std::string name;
    // For the pre- and post-order visits of a directory that was entered: the
    // directory itself, open for reading. -1 otherwise.
    int fd = -1;
};

class TreeWalk {
  public:
    explicit TreeWalk(std::filesystem::path root);
    ~TreeWalk();
    TreeWalk(const TreeWalk&) = delete;
    TreeWalk& operator=(const TreeWalk&) = delete;

    // The next entry (valid until the next call), or null when the walk is
    // over: at its end (error() 0) or because an item could not be looked at
    // or a directory could not be read to its end (error() the error number,
    // errorPath() the item).
    const WalkEntry* next();

    int error() const { return error_; }
    const std::filesystem::path& errorPath() const { return errorPath_; }

  private:
    struct Frame;

    const WalkEntry* visit(int parentFd, const std::string& name, const std::filesystem::path& path,
                           int level);
    const WalkEntry* stop(int errnum, const std::filesystem::path& path);
    bool isAncestor(const struct stat& st) const;

    std::filesystem::path root_;
    UniqueFd rootParent_;
    std::string rootName_;
    bool started_ = false;
    bool done_ = false;
    dev_t rootDevice_ = 0;
    std::vector<std::unique_ptr<Frame>> stack_;
    std::unique_ptr<Frame> finished_;   // the directory of the last post-order entry
    std::optional<WalkEntry> pending_;  // delivered by the next call
    WalkEntry current_;
    int error_ = 0;
    std::filesystem::path errorPath_;
};

}  // namespace berth::fs
