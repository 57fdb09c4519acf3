#include "BTHAsyncWork.h"

#include "platform/RelayTransaction.h"

namespace berth {

void BTHPerformAsyncWork(const std::shared_ptr<WorkQueue>& queue, std::function<void()> work) {
    auto transaction = std::make_shared<RelayTransaction::Guard>();
    queue->async([transaction, work = std::move(work)]() mutable {
        work();
        // The transaction closes when this item (and its copy of the guard) is
        // gone, whether the work returned or threw.
    });
}

const std::shared_ptr<WorkQueue>& BTHDeathRowQueue() {
    static const std::shared_ptr<WorkQueue> queue =
        WorkQueue::makeSerial("sys.kelp.berthd.deathrow", QueuePriority::background);
    return queue;
}

const std::shared_ptr<WorkQueue>& BTHLockStateQueue() {
    static const std::shared_ptr<WorkQueue> queue =
        WorkQueue::makeSerial("sys.kelp.berthd.lockstate");
    return queue;
}

}  // namespace berth
