// Link-safe opening of paths. The directories the daemon works in belong to
// apps, which may swap any component for a symbolic link at any moment, so a
// path is opened with no symbolic link followed anywhere in it, and the
// caller then acts on the descriptor it got (never on the path again).
//
// The device root's own path is trusted (it is the administrator's choice and
// may itself contain links); below it, and everywhere for paths outside it,
// no component may be a symbolic link.
#pragma once

#include <sys/types.h>

#include <filesystem>

#include "platform/UniqueFd.h"

namespace berth::fs {

// Opens `path` with `flags` (O_NOFOLLOW and O_CLOEXEC are added). Fails with
// ELOOP when any component below the trusted prefix is a symbolic link.
// Returns an invalid fd with errno set on failure.
UniqueFd openNoFollow(const std::filesystem::path& path, int flags, mode_t mode = 0);

// Opens `name`, a single component, relative to the directory `dirFd` without
// following a link there. errno is set on failure.
UniqueFd openAtNoFollow(int dirFd, const char* name, int flags, mode_t mode = 0);

}  // namespace berth::fs
