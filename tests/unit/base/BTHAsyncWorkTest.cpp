#include "BTHAsyncWork.h"

#include <gtest/gtest.h>

#include <future>

#include "platform/RelayTransaction.h"

namespace berth {
namespace {

TEST(BTHAsyncWorkTest, TheDaemonCountsAsBusyUntilTheWorkHasRun) {
    auto queue = WorkQueue::makeSerial("sys.kelp.berthd.deathrow");
    const uint64_t idle = RelayTransaction::count();
    queue->suspend();  // hold the work so "pending" can be observed
    std::promise<uint64_t> seenWhileRunning;
    BTHPerformAsyncWork(queue, [&] { seenWhileRunning.set_value(RelayTransaction::count()); });
    EXPECT_EQ(RelayTransaction::count(), idle + 1) << "pending work keeps a transaction open";
    queue->resume();
    EXPECT_EQ(seenWhileRunning.get_future().get(), idle + 1);
    queue->sync([] {});  // the item, and its transaction, are done
    EXPECT_EQ(RelayTransaction::count(), idle);
}

}  // namespace
}  // namespace berth
