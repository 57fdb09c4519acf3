// Recursive, link-safe copy of a file, link or directory tree.
//
// Both trees are worked on through directory descriptors: each source item
// is opened relative to its parent's descriptor with O_NOFOLLOW and accepted
// only if it is the item its lstat described; each destination item is
// created relative to the destination directory's descriptor, never through
// a link. A link in the source is copied as a link, whenever it appeared.
//
// Kept: data, mode, owner and group, access and modification times,
// extended attributes (ACLs included, as the file system keeps them as
// extended attributes) and the immutable and append-only flags, which are
// set last. Special files (fifos, sockets, devices) are made anew with their
// mode, owner and times. A destination item in the way is replaced, except a
// directory, which is merged into.
//
// The copy holds a bounded number of descriptors, and a bounded stack,
// whatever the depth of the tree: only the innermost directories of the
// source and the destination stay open; a level further up has its names
// read in advance and is closed, and on the way back both directories are
// reached again as their child's "..", which must be the very directory left
// (a directory moved meanwhile ends the copy with ESTALE rather than lead it
// somewhere else).
#pragma once

#include <filesystem>

namespace berth::fs {

// Copies `source` to `dest`. Returns 0, or the error number of the first
// item that failed; the copy stops there, and a destination tree that this
// call created is removed again.
int copyTree(const std::filesystem::path& source, const std::filesystem::path& dest);

}  // namespace berth::fs
