// "berthctl upcall": sends a process-containers request the way the kernel
// does when it starts a process, and prints what the daemon answered. Must
// run as root: the daemon answers only the kernel's part.
#pragma once

#include <iosfwd>
#include <string>

#include "upcall/BerthUpcall.h"

namespace berth::ctl {

struct UpcallOptions {
    upcall::Request request;
    std::string socket;  // empty: the daemon's upcall socket
    bool json = false;
};

// Returns the exit status (ExitStatus.h): success when the answer's success
// item is 1, failure for an error reply or success 0, transport when the
// daemon could not be asked or answered something unreadable.
int runUpcall(const UpcallOptions& options, std::ostream& out, std::ostream& err);

}  // namespace berth::ctl
