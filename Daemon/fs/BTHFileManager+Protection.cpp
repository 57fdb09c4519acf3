// Reading and setting the file-protection class of single items. Each item
// is opened without following a link and acted on through that descriptor,
// so a link planted where a file was fails the call instead of handing the
// link's target a new class.
#include <fcntl.h>

#include <cerrno>

#include "BTHFileManager+Internal.h"
#include "BTHFileManager.h"
#include "platform/ProtectionClass.h"
#include "platform/SafeFs.h"

namespace berth {

using filemanager::errorText;

namespace {

UniqueFd openItem(const std::filesystem::path& url, BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHFileManager openItem]");
    UniqueFd fd = fs::openNoFollow(url, O_RDONLY | O_NONBLOCK);
    if (!fd) {
        const int err = errno;
        BTHSetError(error, BTHMakePOSIXError(err, "Failed to open %s : %s", url, errorText(err)));
    }
    return fd;
}

}  // namespace

bool BTHFileManager::dataProtectionClassOfItemAtURL(const std::filesystem::path& url,
                                                    int32_t* protectionClass, BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHFileManager dataProtectionClassOfItemAtURL:class:error:]");
    UniqueFd fd = openItem(url, error);
    if (!fd) return false;
    int32_t value = 0;
    if (int err = protection::getClass(fd.get(), &value)) {
        BTHSetError(error, BTHMakePOSIXError(err, "Failed to getclass of file %s: %s", url,
                                             errorText(err)));
        return false;
    }
    if (protectionClass) *protectionClass = value;
    return true;
}

bool BTHFileManager::setDataProtectionClassOfItemAtURL(const std::filesystem::path& url,
                                                       int32_t protectionClass,
                                                       const ProtectionPredicate& predicate,
                                                       BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHFileManager setDataProtectionClassOfItemAtURL:toClass:ifPredicate:error:]");
    UniqueFd fd = openItem(url, error);
    if (!fd) return false;
    if (predicate) {
        int32_t current = 0;
        if (int err = protection::getClass(fd.get(), &current)) {
            BTHSetError(error, BTHMakePOSIXError(err, "Failed to getclass of file %s: %s", url,
                                                 errorText(err)));
            return false;
        }
        if (!predicate(current)) return true;
    }
    if (int err = protection::setClass(fd.get(), protectionClass)) {
        BTHSetError(error, BTHMakePOSIXError(err, "Failed to setclass(%d) on file %s: %s",
                                             protectionClass, url, errorText(err)));
        return false;
    }
    return true;
}

}  // namespace berth
