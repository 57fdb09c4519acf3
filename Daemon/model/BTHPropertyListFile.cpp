#include "BTHPropertyListFile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <vector>

#include "core/Uuid.h"
#include "platform/PropertyList.h"
#include "platform/SafeFs.h"

namespace berth {

namespace {

bool writeAll(int fd, const std::vector<uint8_t>& bytes) {
    size_t done = 0;
    while (done < bytes.size()) {
        ssize_t n = ::write(fd, bytes.data() + done, bytes.size() - done);
        if (n < 0) {
            if (errno == EINTR) continue;
            return false;
        }
        done += static_cast<size_t>(n);
    }
    return true;
}

// Writes `bytes` as `name` inside the open directory `dirFd`, atomically, and
// durably unless `syncLater`. errno tells why on failure; no temporary file is
// left behind.
bool writeAtomically(int dirFd, const std::string& name, const std::vector<uint8_t>& bytes,
                     bool syncLater) {
    const std::string temp = "." + name + "." + Uuid::random().string() + ".tmp";
    UniqueFd fd(
        ::openat(dirFd, temp.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0644));
    if (!fd) return false;
    bool ok = writeAll(fd.get(), bytes) && (syncLater || ::fsync(fd.get()) == 0);
    int saved = errno;
    fd.reset();
    if (ok && ::renameat(dirFd, temp.c_str(), dirFd, name.c_str()) == 0)
        return syncLater || ::fsync(dirFd) == 0;
    saved = errno ? errno : saved;
    ::unlinkat(dirFd, temp.c_str(), 0);
    errno = saved;
    return false;
}

bool writeInPlace(int dirFd, const std::string& name, const std::vector<uint8_t>& bytes) {
    UniqueFd fd(
        ::openat(dirFd, name.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, 0644));
    return fd && writeAll(fd.get(), bytes);
}

}  // namespace

bool BTH_writeToURL(const Value& dictionary, const std::filesystem::path& url, uint32_t options,
                    BTHErrorRef* error) {
    BTH_FUNCTION("BTH_writeToURL:withOptions:error:");
    std::string why;
    std::optional<std::vector<uint8_t>> bytes = plist::serializeBinary(dictionary, &why);
    if (!bytes) {
        BTHSetError(error, BTHCreateError(bthFunctionName, __LINE__, kBTHGeneralErrorDomain,
                                          kBTHPropertyListWriteInvalidError, nullptr, nullptr, 0,
                                          "Property list invalid for format: %@", why));
        return false;
    }
    UniqueFd dir = fs::openNoFollow(url.parent_path(), O_RDONLY | O_DIRECTORY);
    const std::string name = url.filename().string();
    bool ok = dir && ((options & BTHWriteAtomic)
                          ? writeAtomically(dir.get(), name, *bytes, options & BTHWriteSyncLater)
                          : writeInPlace(dir.get(), name, *bytes));
    if (!ok) {
        int errnum = errno;
        BTHSetError(error, BTHMakePOSIXError(errnum, "Failed to write %s: %s", url.c_str(),
                                             strerror(errnum)));
    }
    return ok;
}

std::optional<Value> BTH_dictionaryWithContentsOfURL(const std::filesystem::path& url,
                                                     uint32_t options, BTHErrorRef* error) {
    BTH_FUNCTION("BTH_dictionaryWithContentsOfURL:options:error:");
    static const plist::Limits limits;
    // Non-blocking: an app may leave a FIFO where a state file should be.
    UniqueFd fd = fs::openNoFollow(url, O_RDONLY | O_NONBLOCK);
    struct stat st;
    if (!fd || ::fstat(fd.get(), &st) != 0) {
        int errnum = errno;
        BTHSetError(error, BTHMakePOSIXError(errnum, "Failed to read %s: %s", url.c_str(),
                                             strerror(errnum)));
        return std::nullopt;
    }
    auto corrupt = [&](const std::string& why) {
        BTHSetError(error, BTHCreateError(bthFunctionName, __LINE__, kBTHGeneralErrorDomain,
                                          kBTHPropertyListReadCorruptError, nullptr, nullptr, 0,
                                          "The data couldn't be read because it isn't in the "
                                          "correct format: %@ (%@)",
                                          url, why));
        return std::nullopt;
    };
    if (!S_ISREG(st.st_mode)) return corrupt("not a regular file");
    if (static_cast<uint64_t>(st.st_size) > limits.maxBytes) return corrupt("file too large");
    std::vector<uint8_t> bytes(static_cast<size_t>(st.st_size));
    size_t got = 0;
    while (got < bytes.size()) {
        ssize_t n = ::read(fd.get(), bytes.data() + got, bytes.size() - got);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) {
            int errnum = errno;
            BTHSetError(error, BTHMakePOSIXError(errnum, "Failed to read %s: %s", url.c_str(),
                                                 strerror(errnum)));
            return std::nullopt;
        }
        if (n == 0) break;  // the file shrank under us; parse what is there
        got += static_cast<size_t>(n);
    }
    bytes.resize(got);
    std::string why;
    std::optional<Value> value = plist::parse(bytes, &why, limits);
    if (!value) return corrupt(why);
    if (!value->isDictionary()) return corrupt("top level is not a dictionary");
    (void)options;
    return value;
}

Value BTH_valueAsStored(const Value& value) {
    const std::optional<std::vector<uint8_t>> bytes = plist::serializeBinary(value);
    std::optional<Value> stored = bytes ? plist::parse(*bytes) : std::nullopt;
    return stored ? std::move(*stored) : value;
}

}  // namespace berth
