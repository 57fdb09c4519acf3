// The tree walk as the daemon's callers use it: every entry to a callback
// that answers whether to go on.
#include "BTHFileManager+Internal.h"
#include "BTHFileManager.h"
#include "platform/TreeWalk.h"

namespace berth {

using filemanager::errorText;

bool BTHFileManager::traverseDirectory(const std::filesystem::path& root, BTHErrorRef* error,
                                       const WalkCallback& callback) {
    BTH_FUNCTION("-[BTHFileManager _traverseDirectory:error:withBlock:]");
    if (root.empty()) {
        BTHSetError(error, BTHMakePOSIXError(ENOENT, "fts_open failed for %s with error %s", root,
                                             errorText(ENOENT)));
        return false;
    }
    fs::TreeWalk walk(root);
    bool result = true;
    while (const BTHWalkEntry* entry = walk.next()) {
        BTHErrorRef slot;
        result = callback(*entry, &slot);
        if (!result) {
            BTHSetError(error, std::move(slot));
            return false;
        }
    }
    if (walk.error() != 0) {
        // An item that could not be looked at, or a directory that could not
        // be read to its end, ends the walk.
        BTHSetError(error, BTHMakePOSIXError(walk.error(), "Error for path %s: %s", root,
                                             errorText(walk.error())));
        return false;
    }
    return result;
}

}  // namespace berth
