// Staging shared content: a system service hands an item it prepared inside
// a system-group container it is entitled to over to another place in the
// same container, as a member of the group would find it (the group's
// access control lists, owner -2:-2).
//
// Both places are named by paths relative to the container that the client
// chose, so both are proven inside the container, every link resolved, and
// the move happens through directory descriptors opened beneath the
// container: nothing outside it is read, changed or moved.
#pragma once

#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>

#include "BTHClientConnection.h"

namespace berth {

// Moves the item at `sourceRelativePath` to `destRelativePath` inside the
// system-group container of `identifier`, under the container's identifier
// lock, after giving the source tree the standard access control lists.
// Returns the destination, or none with the code through `error`: 11 for a
// missing argument, 38 for a ".." component, 55 when the client's
// system groups lack `identifier`, 21 without such a container, 10 for a
// path that is not proven inside it (the container itself included), 63
// when the access control lists fail, 64 when the move fails, 40 on an
// exception.
std::optional<std::filesystem::path> stageSharedContentForIdentifier(
    const BTHClientConnection& client, const std::optional<std::string>& identifier,
    const std::optional<std::string>& sourceRelativePath,
    const std::optional<std::string>& destRelativePath, uint64_t* error);

// `relative` appended to `url` as text: a leading "/" does not make it
// absolute, and nothing is removed or resolved.
std::filesystem::path BTHAppendRelativePath(const std::filesystem::path& url,
                                            const std::string& relative);

}  // namespace berth
