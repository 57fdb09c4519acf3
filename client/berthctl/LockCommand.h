// "berthctl lock" and "berthctl unlock": the key bag's lock state, which the
// daemon follows (protection-class changes wait for an unlock).
#pragma once

#include <iosfwd>

namespace berth::ctl {

// Writes the lock state of the device root (1 locked, 0 unlocked) and
// reports it. Returns the exit status (ExitStatus.h).
int runSetLockState(bool locked, bool json, std::ostream& out, std::ostream& err);

}  // namespace berth::ctl
