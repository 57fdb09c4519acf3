// Recursive removal of a file, link or directory tree, link-safe.
//
// The tree is taken apart through directory descriptors: each directory is
// opened relative to the descriptor of its parent with O_NOFOLLOW and
// accepted only if it is the item that lstat saw (same device and inode);
// each entry is unlinked relative to the descriptor of the directory holding
// it. A link is removed, never followed, so a component swapped for a link
// mid-removal can make items fail, never make anything outside the tree go.
// Directories on another file system are not entered (EXDEV).
//
// Each item that cannot be removed is handed to the error callback with the
// directory descriptor holding it, its name, its path and the error number.
// The callback may act on the item (through that descriptor) and answers
// whether to go on.
#pragma once

#include <filesystem>
#include <functional>

namespace berth::fs {

struct RemovalFailure {
    int parentFd;  // the directory holding the item
    const char* name;
    const std::filesystem::path& path;
    int errnum;
};

enum class RemovalAnswer { Proceed, Stop };
using RemovalErrorCallback = std::function<RemovalAnswer(const RemovalFailure&)>;

// Removes `path` and everything beneath it. With a callback, an item the
// callback answered Proceed for is passed over and does not fail the call; a
// Stop answer ends the removal with that item's error number. Without a
// callback, items that fail are passed over and the first error number is
// returned at the end. Returns 0 when nothing failed; the error number of
// the path's parent when that cannot be opened (ENOENT for a missing one).
int removeTree(const std::filesystem::path& path, const RemovalErrorCallback& onError = {});

}  // namespace berth::fs
