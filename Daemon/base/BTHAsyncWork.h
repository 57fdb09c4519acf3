// The asynchronous-work routine: background work (emptying death row,
// protection changes waiting for unlock) keeps the daemon counted as busy from
// the moment it is submitted until it has run, so an orderly stop never cuts
// it short.
#pragma once

#include <functional>
#include <memory>

#include "platform/WorkQueue.h"

namespace berth {

// Opens a transaction, submits `work` to `queue`, and returns at once; the
// transaction closes when `work` has run.
void BTHPerformAsyncWork(const std::shared_ptr<WorkQueue>& queue, std::function<void()> work);

}  // namespace berth
