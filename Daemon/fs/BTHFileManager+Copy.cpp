// Copies and moves. A move is a rename; across file systems it is a copy
// followed by the removal of the source.
#include <sys/stat.h>

#include <cerrno>

#include "BTHFileManager+Internal.h"
#include "BTHFileManager.h"
#include "platform/SafeFs.h"
#include "platform/TreeCopy.h"
#include "platform/TreeRemoval.h"

namespace berth {

using filemanager::errorText;

bool BTHFileManager::copyItemAtURL(const std::filesystem::path& source,
                                   const std::filesystem::path& dest, BTHErrorRef* error) {
    return copyItem(source, dest, true, error);
}

bool BTHFileManager::copyItemIfExistsAtURL(const std::filesystem::path& source,
                                           const std::filesystem::path& dest, BTHErrorRef* error) {
    return copyItem(source, dest, false, error);
}

bool BTHFileManager::moveItemAtURL(const std::filesystem::path& source,
                                   const std::filesystem::path& dest, BTHErrorRef* error) {
    return moveItem(source, dest, true, error);
}

bool BTHFileManager::moveItemIfExistsAtURL(const std::filesystem::path& source,
                                           const std::filesystem::path& dest, BTHErrorRef* error) {
    return moveItem(source, dest, false, error);
}

bool BTHFileManager::copyItem(const std::filesystem::path& source,
                              const std::filesystem::path& dest, bool failIfSrcMissing,
                              BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHFileManager _copyItemAtURL:toURL:failIfSrcMissing:error:]");
    if (!failIfSrcMissing) {
        struct stat st;
        if (int err = fs::lstatNoFollow(source, &st)) {
            if (err == ENOENT) return true;
            BTHSetError(error,
                        BTHMakePOSIXError(err, "stat of %@ failed: %s", source, errorText(err)));
            return false;
        }
    }
    if (int err = fs::copyTree(source, dest)) {
        BTHSetError(error, BTHMakePOSIXError(err, "copyfile of %@ to %@ failed: %s", source, dest,
                                             errorText(err)));
        return false;
    }
    return true;
}

bool BTHFileManager::moveItem(const std::filesystem::path& source,
                              const std::filesystem::path& dest, bool failIfSrcMissing,
                              BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHFileManager _moveItemAtURL:toURL:failIfSrcMissing:error:]");
    if (!failIfSrcMissing) {
        struct stat st;
        if (int err = fs::lstatNoFollow(source, &st)) {
            if (err == ENOENT) return true;
            BTHSetError(error,
                        BTHMakePOSIXError(err, "stat of %@ failed: %s", source, errorText(err)));
            return false;
        }
    }
    const int err = fs::renameNoFollow(source, dest);
    if (err == 0) return true;
    if (err != EXDEV) {
        BTHSetError(error, BTHMakePOSIXError(err, "rename of %@ to %@ failed: %s", source, dest,
                                             errorText(err)));
        return false;
    }
    // Another file system: the copy stands once made; a source that will
    // not go is only reported.
    if (!copyItem(source, dest, true, error)) return false;
    if (int removeErr = fs::removeTree(source))
        BTHLogError("Failed to remove source %@ : %s", source, errorText(removeErr));
    return true;
}

}  // namespace berth
