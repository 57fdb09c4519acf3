// Start-up and the main loop of berthd.
//
// The daemon opens its rotating log, creates its queues, does the
// once-per-boot and every-launch work of the container store, starts the
// upcall service, follows the device lock state, and only then opens the
// request listener, so no request is ever served against a store still being
// set up. It never exits on its own after that; its stored state survives
// being stopped at any point.
#pragma once

#include <cstdint>
#include <memory>

#include "platform/WorkQueue.h"

namespace berth {

inline constexpr const char* kBTHServiceName = "sys.kelp.berthd";
inline constexpr const char* kBTHUpcallServiceName = "sys.kelp.berthd.upcall";
inline constexpr const char* kBTHFirstBootSemaphoreName = "berthd.fb_check";

// The daemon's entry point: returns -1 when it cannot start, else runs the
// main run loop forever.
int BTHDaemonMain();

}  // namespace berth
