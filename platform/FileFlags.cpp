#include "platform/FileFlags.h"

#include <linux/fs.h>
#include <sys/ioctl.h>

#include <cerrno>

#include "platform/SafeFs.h"

namespace berth::fileflags {

const unsigned kImmutable = FS_IMMUTABLE_FL;
const unsigned kAppend = FS_APPEND_FL;
const unsigned kCopied = FS_IMMUTABLE_FL | FS_APPEND_FL;

namespace {

bool carriesFlags(const struct stat& st) {
    return S_ISREG(st.st_mode) || S_ISDIR(st.st_mode);
}

}  // namespace

int get(int fd, unsigned* flags) {
    int value = 0;  // the kernel reads and writes an int, whatever the ioctl's type says
    if (::ioctl(fd, FS_IOC_GETFLAGS, &value) != 0) return errno;
    *flags = static_cast<unsigned>(value);
    return 0;
}

int set(int fd, unsigned flags) {
    int value = static_cast<int>(flags);
    return ::ioctl(fd, FS_IOC_SETFLAGS, &value) == 0 ? 0 : errno;
}

int getAt(int dirFd, const char* name, const struct stat& expected, unsigned* flags) {
    if (!carriesFlags(expected)) {
        *flags = 0;
        return 0;
    }
    UniqueFd fd = fs::openItemChecked(dirFd, name, expected);
    if (!fd) return errno;
    return get(fd.get(), flags);
}

int setAt(int dirFd, const char* name, const struct stat& expected, unsigned flags) {
    if (!carriesFlags(expected)) return EOPNOTSUPP;
    UniqueFd fd = fs::openItemChecked(dirFd, name, expected);
    if (!fd) return errno;
    return set(fd.get(), flags);
}

}  // namespace berth::fileflags
