// Removal of items and trees, with the immutable fix: an item that cannot be
// removed because it is immutable has the flag cleared and is unlinked.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "BTHFileManager+Internal.h"
#include "BTHFileManager.h"
#include "platform/FileFlags.h"
#include "platform/TreeRemoval.h"

namespace berth {

using filemanager::errorText;

namespace {

constexpr const char* kRemoveName = "-[BTHFileManager removeItemAtURL:error:]";

// The first error number a removal records; 0 until then. ENOENT counts as
// recorded, so a vanished item seen first hides later errors.
struct RemovalErrorContext {
    int32_t errnum = 0;
    void record(int value) {
        if (errnum == 0) errnum = value;
    }
};

// Handles one item the removal could not remove; always goes on with the rest.
fs::RemovalAnswer removalErrorCallback(const fs::RemovalFailure& failure,
                                       RemovalErrorContext* context) {
    BTH_FUNCTION(kRemoveName);
    const int errnum = failure.errnum;
    const std::string path = failure.path.string();
    if (errnum == ENOENT) {
        context->record(errnum);
        return fs::RemovalAnswer::Proceed;
    }
    BTHLogError("removefile hit error for %s : %s", path, errorText(errnum));
    if (errnum != EPERM) {
        context->record(errnum);
        return fs::RemovalAnswer::Proceed;
    }

    // EPERM: perhaps the immutable flag. Cleared on the item the lstat saw
    // (a link has no flags of its own to clear), then the item is unlinked.
    struct stat st;
    if (::fstatat(failure.parentFd, failure.name, &st, AT_SYMLINK_NOFOLLOW) != 0) {
        BTHLogError("Failed to stat %s before unsetting UF_IMMUTABLE: %s", path, errorText(errno));
        context->record(EPERM);
        return fs::RemovalAnswer::Proceed;
    }
    unsigned flags = 0;
    if (fileflags::getAt(failure.parentFd, failure.name, st, &flags) != 0 ||
        !(flags & fileflags::kImmutable)) {
        context->record(EPERM);
        return fs::RemovalAnswer::Proceed;
    }
    if (int err =
            fileflags::setAt(failure.parentFd, failure.name, st, flags & ~fileflags::kImmutable)) {
        BTHLogError("Failed to lchflags %s: %s", path, errorText(err));
        context->record(EPERM);
        return fs::RemovalAnswer::Proceed;
    }
    BTHLogNotice("Unset UF_IMMUTABLE on %s", path);
    if (::unlinkat(failure.parentFd, failure.name, 0) == 0) return fs::RemovalAnswer::Proceed;
    BTHLogError("unlink of %s failed: %s", path, errorText(errno));
    context->record(EPERM);
    return fs::RemovalAnswer::Proceed;
}

}  // namespace

bool BTHFileManager::removeItemAtURL(const std::filesystem::path& url, BTHErrorRef* error) {
    BTH_FUNCTION(kRemoveName);
    if (url.empty()) {
        BTHSetError(error, BTHMakePOSIXError(EFAULT, "nil url passed to -removeItemAtURL:error:"));
        return false;
    }
    RemovalErrorContext context;
    const int err = fs::removeTree(url, [&context](const fs::RemovalFailure& failure) {
        return removalErrorCallback(failure, &context);
    });
    if (err != 0 && err != ENOENT) {
        BTHSetError(error,
                    BTHMakePOSIXError(err, "removefile of %@ failed: %s", url, errorText(err)));
        return false;
    }
    if (context.errnum == 0 || context.errnum == ENOENT) return true;
    BTHSetError(error, BTHMakePOSIXError(context.errnum, "removefile of %@ failed: %s", url,
                                         errorText(context.errnum)));
    return false;
}

}  // namespace berth
