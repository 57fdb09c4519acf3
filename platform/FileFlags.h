// The file flags the daemon cares about: immutable (the item can be neither
// changed nor removed, even by root, until the flag is cleared) and
// append-only. Kept by the file system as inode flags; only regular files and
// directories carry them (a symbolic link or a device has none).
#pragma once

#include <sys/stat.h>

namespace berth::fileflags {

// The platform's user-immutable and append-only flags.
extern const unsigned kImmutable;
extern const unsigned kAppend;
// The flags a copy carries over.
extern const unsigned kCopied;

// Flags of the open regular file or directory `fd`. 0 on success, else the
// error number.
int get(int fd, unsigned* flags);
int set(int fd, unsigned flags);

// Flags of `name` in `dirFd`, which must still be the item `expected` (from
// an lstat the caller decided on). A link or other special item has no
// flags: get answers 0 flags, set fails with EOPNOTSUPP.
int getAt(int dirFd, const char* name, const struct stat& expected, unsigned* flags);
int setAt(int dirFd, const char* name, const struct stat& expected, unsigned flags);

}  // namespace berth::fileflags
