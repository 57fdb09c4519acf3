#include "platform/ProcessImage.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>

namespace berth {

ProcessImage ProcessImage::of(int procDirectory) {
    ProcessImage image;
    if (procDirectory >= 0)
        image.memory_.reset(::openat(procDirectory, "mem", O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
    return image;
}

bool ProcessImage::unchanged() const {
    if (!memory_) return false;
    // One byte at address 0, which no program maps: a live image answers
    // "no such address" (or the byte, should one map it); a released one
    // answers with nothing at all. Anything else tells nothing.
    char byte;
    const ssize_t count = ::pread(memory_.get(), &byte, 1, 0);
    return count == 1 || (count < 0 && errno == EIO);
}

}  // namespace berth
