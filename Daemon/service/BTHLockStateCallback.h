// The lock-state callback: keeps the lock-state queue suspended exactly while
// the device is locked, so protection-class changes submitted to it wait for
// the next unlock. Runs on the main queue only (the cached state has one
// writer).
#pragma once

#include <functional>
#include <memory>

#include "platform/WorkQueue.h"

namespace berth {

class BTHLockStateCallback {
  public:
    // `query` answers the key bag's current lock state.
    BTHLockStateCallback(std::shared_ptr<WorkQueue> lockStateQueue, std::function<int()> query);

    // Reads the state; on 1 (locked) suspends the queue unless the last state
    // seen was locked; on 0 (unlocked) resumes it if the last state seen was
    // locked; any other state changes nothing. Suspends and resumes thus
    // alternate, starting with a suspend.
    void run();

    // The last state seen: 3 before the first run.
    int cachedLockState() const { return cached_; }

  private:
    std::shared_ptr<WorkQueue> queue_;
    std::function<int()> query_;
    int cached_ = 3;
};

}  // namespace berth
