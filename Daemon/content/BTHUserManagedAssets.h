// User-managed assets: an application's data container gets, when first
// asked, one directory under its "Library" for assets its user manages
// ("sys.kelp.UserManagedAssets." and six unique characters, mode 0755, owned
// by the user). Its name is remembered in the container's metadata, so
// later requests are answered with the same directory; items inside it are
// deleted by moving them to death row.
//
// The item to delete is named by a path relative to the assets directory
// that the client chose: it gets the checks that staged shared content
// gets (no ".." component, proven inside the directory once every link is
// resolved, moved from a directory opened beneath the container), and the
// assets directory itself is not an item inside it.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>

#include "BTHClientConnection.h"

namespace berth {

inline constexpr const char* kBTHUserManagedAssetsPrefix = "sys.kelp.UserManagedAssets.";

// The assets directory of the data container (class 2) of `identifier` for
// `userId`, made on first use, under the container's identifier lock. None
// with the code through `error`: 11 for a missing identifier, an unknown
// container, or a remembered directory that no longer exists or whose
// remembered name is not one plain name (it is not made again), 6 when the directory cannot be
// made, given its mode or its owner (it stays in place), the metadata write's code, 45 when the
// cache cannot take the changed record, 40 on an exception.
std::optional<std::filesystem::path> userManagedAssetsURLForUser(
    uid_t userId, const std::optional<std::string>& identifier, uint64_t* error);

// Moves the item at `relativePath` inside the assets directory of
// `identifier`'s data container to death row (not emptied here), under the
// container's identifier lock. Codes through `error`: 11 for a missing
// argument, an unknown container or one without an assets directory, 38 for
// a ".." component, 10 for a path not proven inside the assets directory
// (the directory itself included), 41 when the move fails, 40 on an
// exception. A missing item is not a failure.
void deleteUserManagedAssetForUser(BTHClientConnection& client, uid_t userId,
                                   const std::optional<std::string>& identifier,
                                   const std::optional<std::string>& relativePath, uint64_t* error);

}  // namespace berth
