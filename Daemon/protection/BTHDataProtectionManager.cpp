#include "BTHDataProtectionManager.h"

#include <memory>

#include "BTHApplicationTerminationAssertion.h"
#include "BTHClientConnection.h"
#include "BTHContainerCache.h"
#include "BTHDataProtectionChangeOperation.h"
#include "BTHError.h"
#include "BTHLocks.h"
#include "BTHLog.h"
#include "core/BTHContainerClass.h"

namespace berth {

namespace {

constexpr const char* kContentProtectionClassKey = "sys.kelp.Lading.ContentProtectionClass";

int32_t currentClassOf(const BTHMetadata& container) {
    const Value* stored =
        container.info() ? container.info()->find(kContentProtectionClassKey) : nullptr;
    const std::optional<int64_t> number = stored ? stored->int64Value() : std::nullopt;
    return number ? static_cast<int32_t>(*number) : 0;
}

// What a request keeps between its acceptance and its completion: the
// assertion that holds the app terminated while a deferred change runs.
struct RequestState {
    std::unique_ptr<BTHApplicationTerminationAssertion> assertion;
    ~RequestState() {
        if (assertion) assertion->invalidate();
    }
};

// The completion of an accepted request: logs a failure, releases the app,
// records the class on success, and hands the code on.
void finishRequest(const BTHMetadata& container, int32_t requestedClass, bool retryIfLocked,
                   RequestState& state, bool wasLocked, const BTHErrorRef& error,
                   const std::function<void(uint64_t)>& completion) {
    BTH_FUNCTION(
        "-[BTHDataProtectionManager "
        "setDataProtectionOnDataContainerForUser:identifier:containerClass:dataProtectionClass:"
        "isSecondOrThirdPartyApp:retryIfLocked:withCompletion:]_block_invoke");
    uint64_t code = BTHErrorSuccess;
    if (error) {
        BTHLogError("Failed to set data protection on container with identifier %@ at %@ to %d: %@",
                    container.identifier(), container.url(), requestedClass, error);
        code = error->code64();
    }
    if (wasLocked && retryIfLocked)
        BTHLogError("Unexpectedly got completion block called with wasLocked");
    if (state.assertion) {
        state.assertion->invalidate();
        state.assertion.reset();
    }
    if (!error && !wasLocked) {
        uint64_t infoError = BTHErrorSuccess;
        BTHClientConnection::sharedClientConnection()->setInfoValue(
            Value(int64_t{requestedClass}), std::string(kContentProtectionClassKey),
            container.uid(), container.uuid(), container.identifier(), container.containerClass(),
            true, &infoError);
        if (infoError != BTHErrorSuccess)
            BTHLogError("Failed to set protection class info for %@ at %@ to %d : %llu",
                        container.identifier(), container.url(), requestedClass, infoError);
    }
    completion(code);
}

}  // namespace

BTHDataProtectionManager& BTHDataProtectionManager::defaultManager() {
    static BTHDataProtectionManager manager;
    return manager;
}

void BTHDataProtectionManager::setDataProtectionOnDataContainerForUser(
    uid_t userId, const std::optional<std::string>& identifier, uint64_t containerClass,
    int32_t dataProtectionClass, bool isSecondOrThirdPartyApp, bool retryIfLocked,
    std::function<void(uint64_t)> completion) {
    BTH_FUNCTION(
        "-[BTHDataProtectionManager "
        "setDataProtectionOnDataContainerForUser:identifier:containerClass:dataProtectionClass:"
        "isSecondOrThirdPartyApp:retryIfLocked:withCompletion:]");
    std::shared_ptr<BTHDataProtectionChangeOperation> operation;
    const BTHErrorRef refusal = BTHRunUnderExceptionRule(bthFunctionName, __LINE__, [&] {
        if (!identifier || !BTHContainerClassIsData(containerClass)) {
            return BTHMakeError(BTHErrorInvalidArgument, nullptr,
                                "Can't act on an invalid object: userId: %u, ID: %@, class: %ld",
                                userId, identifier, containerClass);
        }
        BTHErrorRef cacheError;
        const BTHMetadataRef found = BTHContainerCache::sharedInstance().containerForUser(
            userId, containerClass, *identifier, false, &cacheError);
        if (!found) {
            return BTHMakeError(BTHErrorNotFound, cacheError,
                                "No Container with userId: %u, identifier: %@, Class: %ld", userId,
                                identifier, containerClass);
        }
        // A snapshot: the pass compares the container's place then with
        // its place when it runs. The cached record is changed in place
        // under its identifier lock (a finished change records its class in
        // the info), so it is copied under that lock.
        std::shared_ptr<const BTHMetadata> container;
        {
            BTHIdentifierLockGuard lock(found->uuid().string(), false);
            container = std::make_shared<const BTHMetadata>(*found);
        }
        const int32_t currentClass = currentClassOf(*container);
        if (dataProtectionClass == currentClass) return BTHErrorRef();
        if (dataProtectionClass == 2)
            return BTHMakeError(BTHErrorInvalidParameter, nullptr,
                                "Data protection class %d is not allowed", dataProtectionClass);
        if (isSecondOrThirdPartyApp && dataProtectionClass != 0 && dataProtectionClass != 1 &&
            dataProtectionClass != 3)
            return BTHMakeError(BTHErrorInvalidParameter, nullptr,
                                "Data protection class %d is invalid for 2nd and 3rd party apps",
                                dataProtectionClass);
        using Operation = BTHDataProtectionChangeOperation;
        const bool lowering =
            dataProtectionClass < currentClass || (dataProtectionClass < 3 && currentClass == 0);
        const int32_t changeType = lowering
                                       ? Operation::kChangeDirectories | Operation::kChangeFiles |
                                             Operation::kKeepStrongerFiles
                                       : Operation::kChangeDirectories;
        operation = Operation::dataProtectionChangeOperationWithContainerMetadata(
            container, dataProtectionClass, retryIfLocked, changeType);
        auto state = std::make_shared<RequestState>();
        operation->setRetryStartBlock([state, container] {
            state->assertion = BTHApplicationTerminationAssertion::initWithBundleIdentifier(
                container->identifier(), 0);
        });
        operation->setCompletionBlock([state, container, dataProtectionClass, retryIfLocked,
                                       completion](bool wasLocked, const BTHErrorRef& error) {
            finishRequest(*container, dataProtectionClass, retryIfLocked, *state, wasLocked, error,
                          completion);
        });
        return BTHErrorRef();
    });
    if (refusal) {
        completion(refusal->code64());
        return;
    }
    if (!operation) {
        completion(BTHErrorSuccess);  // the container already has the class
        return;
    }
    operation->performChangeOperation();
}

}  // namespace berth
