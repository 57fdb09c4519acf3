#include "platform/RelayTransaction.h"

#include <atomic>

#include "platform/ThreadPool.h"

namespace berth {
namespace {

// The one busy counter of the process.
std::atomic<uint64_t> gOpenTransactions{0};

}  // namespace

void RelayTransaction::begin() {
    gOpenTransactions.fetch_add(1, std::memory_order_relaxed);
}

void RelayTransaction::end() {
    uint64_t open = gOpenTransactions.load(std::memory_order_relaxed);
    do {
        if (open == 0) abortWithMessage("relay: a transaction was ended that was never begun");
    } while (!gOpenTransactions.compare_exchange_weak(open, open - 1, std::memory_order_relaxed));
}

uint64_t RelayTransaction::count() {
    return gOpenTransactions.load(std::memory_order_relaxed);
}

}  // namespace berth
