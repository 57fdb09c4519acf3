// Installation of system containers prepared by the operating system's
// installation or restore, at the first start after boot.
//
// The current device user's "Library/Backup/SystemContainers" holds "Data"
// (one directory per system container, named by its identifier) and
// "Shared" (the same for system group containers). Each is first renamed to
// its ".inprogress" name, from which a start interrupted part-way goes on
// installing at the next first start; every prepared container is created or looked
// up for user 499 and its files are moved in, replacing files of the same
// name. A file that cannot be installed is moved aside into
// "<backup>.failed/<identifier>". The whole backup tree is removed at the
// end, except on internal builds.
//
// The backup tree lies in a user's home, so only what the system could have
// put there is installed: the backup directories and every prepared
// container must be real directories owned by root that no one else may
// write, and a symbolic link among the prepared files is moved aside, never
// installed. Everything refused is logged.
#pragma once

#include "BTHClientConnection.h"

namespace berth {

void BTHMoveSystemContainersIntoPlace(BTHClientConnection& client);

// One prepared container directory `prepared` of `containerClass` (12 or 13).
void _moveSystemContainerIntoPlace(const std::filesystem::path& prepared,
                                   BTHClientConnection& client, uint64_t containerClass);

// Moves `item` to `directory`/`name`, creating `directory` first.
void _moveFailedPathAside(const std::filesystem::path& item, const std::filesystem::path& directory,
                          const std::string& name);

}  // namespace berth
