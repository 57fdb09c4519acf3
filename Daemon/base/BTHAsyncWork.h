// The asynchronous-work routine and the serial queues background work runs
// on: background work (emptying death row, protection changes waiting for
// unlock) keeps the daemon counted as busy from the moment it is submitted
// until it has run, so an orderly stop never cuts it short.
#pragma once

#include <functional>
#include <memory>

#include "platform/WorkQueue.h"

namespace berth {

// Opens a transaction, submits `work` to `queue`, and returns at once; the
// transaction closes when `work` has run.
void BTHPerformAsyncWork(const std::shared_ptr<WorkQueue>& queue, std::function<void()> work);

// "sys.kelp.berthd.deathrow": serial, background priority; empties death row.
const std::shared_ptr<WorkQueue>& BTHDeathRowQueue();

// "sys.kelp.berthd.lockstate": serial, suspended while the device is locked;
// work that must wait for the device to be unlocked goes here.
const std::shared_ptr<WorkQueue>& BTHLockStateQueue();

}  // namespace berth
