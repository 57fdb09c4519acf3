// Tells with one read that a process still runs the program image it ran
// when the image was opened: exec gives a process a new address space and
// exit releases the old one, and the old one, seen through the process's
// memory file opened before, then reads as gone.
//
// An address space stays alive while anything shares it: the process's own
// threads, a process it created sharing its memory (which can rewrite that
// process's code anyway, and so speaks for it already), or a privileged
// reader of it for the length of one read. unchanged() is therefore exact
// for whoever relies on it to stand for "this process has not exec'd and
// is alive", except that a replaced image may read as alive for as long as
// such a sharer keeps it: callers pair it with a check of the file the
// image was loaded from.
//
// Opening the memory file needs the right to attach to the process; where
// the kernel's policy refuses it to root as well, no image is had and the
// caller checks /proc instead.
#pragma once

#include <cstdint>

#include "platform/UniqueFd.h"

namespace berth {

class ProcessImage {
  public:
    ProcessImage() = default;

    // The image of the process whose /proc directory is open at
    // `procDirectory` (opened while that process lived). Invalid when it
    // cannot be opened.
    static ProcessImage of(int procDirectory);

    bool valid() const { return static_cast<bool>(memory_); }

    // True when the process still runs the image it ran when this was
    // opened; false when it exec'd or exited, or when that cannot be told.
    bool unchanged() const;

  private:
    UniqueFd memory_;
    // Where the image's own copy of the kernel's shared page (vDSO) lies, as
    // its auxiliary vector said when it was opened; 0 when not said.
    uint64_t probe_ = 0;
};

}  // namespace berth
