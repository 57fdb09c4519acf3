// Several open files and directories made durable at once.
//
// Their syncs are submitted together (io_uring, where the kernel offers it),
// so a journaling file system commits them in one transaction and the caller
// waits once, not once per item. Without io_uring they run one after the
// other.
#pragma once

#include <span>

namespace berth {

// fsync of every descriptor in `fds`; 0 once all are durable, else the error
// number of the first that failed (all are still attempted).
int syncTogether(std::span<const int> fds);

}  // namespace berth
