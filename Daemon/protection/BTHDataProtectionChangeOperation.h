// One change of the protection class of a data container's user data
// ("Documents", "Library", "tmp", "Merchantry"): a walk that re-classes the
// items the change type selects, directories after their contents.
//
// Changing the class of an item fails while the device is locked (an item
// of the class unreadable while locked answers EPERM). Such a pass stops and,
// when the operation may retry, re-queues the operation on the lock-state
// queue, which runs only while the device is unlocked; the operation then
// runs again from the start, as often as it meets a locked device. Before
// the first re-run the retry-start callback runs (the caller holds the app
// terminated from there on). The completion is called exactly once, when
// the operation is over.
//
// Each pass holds the container's identifier lock for reading and first
// checks that the container is still where it was when the request was
// accepted: a container replaced or moved in between fails the pass with
// 10 (the newer container has a request of its own).
#pragma once

#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <vector>

#include "BTHError.h"
#include "BTHFileManager.h"
#include "BTHMetadata.h"

namespace berth {

class BTHDataProtectionChangeOperation
    : public std::enable_shared_from_this<BTHDataProtectionChangeOperation> {
  public:
    // Bits of the change type.
    enum ChangeType : int32_t {
        kChangeDirectories = 1,  // set the class of directories
        kChangeFiles = 2,        // set the class of regular files
        kKeepStrongerFiles = 4,  // leave files whose class is numerically lower
    };

    using RetryStartBlock = std::function<void()>;
    using CompletionBlock = std::function<void(bool wasLocked, const BTHErrorRef& error)>;

    static std::shared_ptr<BTHDataProtectionChangeOperation>
    dataProtectionChangeOperationWithContainerMetadata(std::shared_ptr<const BTHMetadata> metadata,
                                                       int32_t newClass, bool retryIfLocked,
                                                       int32_t changeType);

    void setRetryStartBlock(RetryStartBlock block) { retryStartBlock_ = std::move(block); }
    void setCompletionBlock(CompletionBlock block) { completionBlock_ = std::move(block); }

    // Runs one pass now; completes, or re-queues itself for the next unlock.
    void performChangeOperation();

    // One pass over the container. True on success, and also when the pass
    // stopped on a locked item (then *needRetry is true and no error is
    // given); false with the error otherwise.
    bool runChangeOperation(bool* needRetry, BTHErrorRef* error);

    BTHDataProtectionChangeOperation(std::shared_ptr<const BTHMetadata> metadata, int32_t newClass,
                                     bool retryIfLocked, int32_t changeType);

  private:
    bool changeItems(const std::vector<std::filesystem::path>& items, BTHErrorRef* failure);
    bool changeEntry(const BTHWalkEntry& entry, BTHErrorRef* failure);
    void retryAfterUnlock();

    std::shared_ptr<const BTHMetadata> dataContainerMetadata_;
    int32_t newDataProtectionClass_;
    bool retryIfLocked_;
    bool retried_ = false;
    int32_t operationType_;
    RetryStartBlock retryStartBlock_;
    CompletionBlock completionBlock_;
};

}  // namespace berth
