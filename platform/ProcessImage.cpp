#include "platform/ProcessImage.h"

#include <elf.h>
#include <fcntl.h>
#include <unistd.h>

#include <cerrno>

namespace berth {

namespace {

// The address of the vDSO in the auxiliary vector open at `auxv`; 0 when it
// names none.
uint64_t vdsoAddress(int auxv) {
    uint64_t words[2 * 64];
    const ssize_t count = auxv >= 0 ? ::read(auxv, words, sizeof words) : -1;
    for (ssize_t i = 0; count > 0 && i + 1 < count / 8; i += 2) {
        if (words[i] == AT_NULL) break;
        if (words[i] == AT_SYSINFO_EHDR) return words[i + 1];
    }
    return 0;
}

}  // namespace

ProcessImage ProcessImage::of(int procDirectory) {
    ProcessImage image;
    if (procDirectory < 0) return image;
    image.memory_.reset(::openat(procDirectory, "mem", O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
    if (!image.memory_) return image;
    // Read after the memory file is opened: should the process have exec'd
    // in between, the address is another image's, and the probe merely
    // answers through the slower path below.
    const UniqueFd auxv(::openat(procDirectory, "auxv", O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
    image.probe_ = vdsoAddress(auxv.get());
    return image;
}

bool ProcessImage::unchanged() const {
    if (!memory_) return false;
    // One byte of the vDSO, a page always present that the process does not
    // write: a live image answers with it, a released one with nothing at
    // all. Where the page is not (unmapped, or no address known, probing 0)
    // a live image answers "no such address" instead, after the kernel took
    // the process's memory map for writing to look for a stack to grow.
    // Anything else tells nothing.
    char byte;
    const ssize_t count = ::pread(memory_.get(), &byte, 1, static_cast<off_t>(probe_));
    return count == 1 || (count < 0 && errno == EIO);
}

}  // namespace berth
