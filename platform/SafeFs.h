// Link-safe file handling. The directories the daemon works in belong to
// apps, which may swap any component for a symbolic link at any moment, so a
// path is opened with no symbolic link followed anywhere in it, and the
// caller then acts on the descriptor it got (never on the path again).
//
// The device root's own path is trusted (it is the administrator's choice and
// may itself contain links); below it, and everywhere for paths outside it,
// no component may be a symbolic link.
//
// Functions returning UniqueFd give an invalid fd with errno set on failure;
// functions returning int give 0 on success and an error number otherwise.
#pragma once

#include <dirent.h>
#include <sys/stat.h>
#include <sys/types.h>

#include <filesystem>
#include <string>

#include "platform/UniqueFd.h"

namespace berth::fs {

// Opens `path` with `flags` (O_NOFOLLOW and O_CLOEXEC are added). Fails with
// ELOOP when any component below the trusted prefix is a symbolic link.
UniqueFd openNoFollow(const std::filesystem::path& path, int flags, mode_t mode = 0);

// Opens `name`, a single component, relative to the directory `dirFd` without
// following a link there.
UniqueFd openAtNoFollow(int dirFd, const char* name, int flags, mode_t mode = 0);

// Splits `path` into its parent directory and its last component, ignoring
// trailing slashes. False (errno EINVAL) for a path without a last component
// or whose last component is "." or "..".
bool splitParent(const std::filesystem::path& path, std::filesystem::path* parent,
                 std::string* name);

// Opens the parent directory of `path` (O_PATH, no link followed) and gives
// the last component in `name`: the pair every *at call needs to act on the
// item itself.
UniqueFd openParentNoFollow(const std::filesystem::path& path, std::string* name);

// lstat of `path` reached without following a link in any component: a link
// as the last component is described, not followed.
int lstatNoFollow(const std::filesystem::path& path, struct stat* st);

// 0 when an item (a link included, itself) is at `path`, reached without
// following a link on the way; else the errno value, as lstatNoFollow()
// gives it.
int existsNoFollow(const std::filesystem::path& path);

// Opens the directory `name` in `dirFd` for reading, provided it is still the
// item `expected` (same device and inode). A link there, or a different item,
// fails: ELOOP/ENOTDIR from the open, ESTALE for a different item.
UniqueFd openDirectoryChecked(int dirFd, const char* name, const struct stat& expected);

// Opens the regular file or directory `name` in `dirFd` read-only, provided
// it is still the item `expected`; ESTALE for a different item.
UniqueFd openItemChecked(int dirFd, const char* name, const struct stat& expected);

inline bool sameItem(const struct stat& a, const struct stat& b) {
    return a.st_dev == b.st_dev && a.st_ino == b.st_ino;
}

// Creates `path` and each missing parent with `mode`, one component at a
// time relative to the directory above it; no existing component may be a
// link. 0 when created, EEXIST when the last component already exists (of
// whatever kind), otherwise the error number of the component that failed.
int makePath(const std::filesystem::path& path, mode_t mode);

// Renames `from` to `to`, each reached without following a link in any
// component (a link as the last component of `from` is renamed itself).
int renameNoFollow(const std::filesystem::path& from, const std::filesystem::path& to);

// Sets the mode of `name` in `dirFd` without following a link (the item is
// opened O_PATH and changed through that descriptor).
int chmodAtNoFollow(int dirFd, const char* name, mode_t mode);

// Reads a directory from a descriptor of its own (the caller's stays open
// and usable for *at calls). Entries "." and ".." are skipped.
class DirReader {
  public:
    // Takes a duplicate of `dirFd`, rewound to the start.
    explicit DirReader(int dirFd);
    ~DirReader();
    DirReader(const DirReader&) = delete;
    DirReader& operator=(const DirReader&) = delete;

    bool valid() const { return dir_ != nullptr; }
    // The next entry, or null at the end (errno 0) or on a read error (errno
    // set).
    const struct dirent* next();

  private:
    DIR* dir_ = nullptr;
};

}  // namespace berth::fs
