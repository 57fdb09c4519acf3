// Stores that only root may have written: the code-signing registry and the
// launch records. What they say decides who a process is, so a reader
// believes a file only when nobody but root could have put it there: every
// directory from just below the device root down to the file's, and the file
// itself, belongs to root and is writable by nobody else, and no component is
// a symbolic link.
#pragma once

#include <sys/stat.h>

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "platform/IdentityBasis.h"
#include "platform/UniqueFd.h"

namespace berth {

// Owned by uid 0 and writable by neither group nor others.
bool isRootsAlone(const struct stat& status);

// Opens `directory` for reading, walking from the device root (or from "/"
// for a directory outside it) one component at a time without following
// links, and refusing every component that is not root's alone (EPERM). With
// `create`, missing components are made with mode `mode`. On failure the
// descriptor is invalid, `*error` holds the errno value and `*why` the
// reason. Each component that was trusted is recorded in `basis`, if given.
UniqueFd openRootOwnedDirectory(const std::filesystem::path& directory, bool create,
                                std::string* why, int* error, mode_t mode = 0755,
                                IdentityBasis* basis = nullptr);

// The bytes of `name` in the directory `dirFd`, which must be a regular file
// reached without a link, root's alone and at most `limit` bytes long.
// nullopt with the reason otherwise; `*missing` (when given) tells a file
// that is not there from one that does not count. `*status` (when given)
// receives the file's status as it was checked, before it was read.
std::optional<std::vector<uint8_t>> readRootOwnedFile(int dirFd, const std::string& name,
                                                      size_t limit, std::string* why,
                                                      bool* missing = nullptr,
                                                      struct stat* status = nullptr);

// Replaces `name` in `dirFd` with `bytes` (mode 0644) so that a reader, or
// the next boot after a crash, finds either the old file or the new one
// whole: a temporary file in the same directory, fsync, rename, fsync of the
// directory. 0 or the errno value.
int replaceFileAtomically(int dirFd, const std::string& name, std::span<const uint8_t> bytes);

}  // namespace berth
