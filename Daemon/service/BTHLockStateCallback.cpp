#include "BTHLockStateCallback.h"

#include "BTHLog.h"

namespace berth {

namespace {
constexpr int kLocked = 1;
constexpr int kUnlocked = 0;
}  // namespace

BTHLockStateCallback::BTHLockStateCallback(std::shared_ptr<WorkQueue> lockStateQueue,
                                           std::function<int()> query)
    : queue_(std::move(lockStateQueue)), query_(std::move(query)) {}

void BTHLockStateCallback::run() {
    BTH_FUNCTION("lockStateCallback");
    const int state = query_();
    BTHLogDebug("LockState=%d", state);
    if (state == kLocked) {
        if (cached_ != kLocked) queue_->suspend();
        cached_ = kLocked;
    } else if (state == kUnlocked) {
        if (cached_ == kLocked) queue_->resume();
        cached_ = kUnlocked;
    }
}

}  // namespace berth
