#include "BTHApplicationTerminationAssertion.h"

#include <semaphore.h>

#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <mutex>

#include "BTHLog.h"

namespace berth {

namespace {

// The service set for the whole daemon (or a test), and its guard.
std::mutex gServiceMutex;
std::shared_ptr<ApplicationTerminationService> gService;

// What the creator and the acquisition handler share: the handler may run
// on another thread and after the creator stopped waiting for it.
struct Acquisition {
    sem_t completion;
    std::atomic<bool> acquired{true};
    ~Acquisition() { sem_destroy(&completion); }
};

TerminationReason serviceReason(int reason) {
    BTH_FUNCTION("_GangwayApplicationTerminationReasonStringForReason");
    switch (reason) {
        case 0:
            return TerminationReason::Installation;
        case 1:
            return TerminationReason::CacheDeletion;
        case 255:
            return TerminationReason::Critical;
    }
    BTHLogError("Unknown reason: %d", reason);
    std::abort();
}

}  // namespace

void BTHApplicationTerminationAssertion::setTerminationService(
    std::shared_ptr<ApplicationTerminationService> service) {
    std::lock_guard lock(gServiceMutex);
    gService = std::move(service);
}

std::shared_ptr<ApplicationTerminationService>
BTHApplicationTerminationAssertion::terminationService() {
    std::lock_guard lock(gServiceMutex);
    if (!gService) gService = std::make_shared<CgroupApplicationTermination>();
    return gService;
}

void BTHApplicationTerminationAssertion::clearStaleRelaunchBlocks() {
    BTH_FUNCTION("+[BTHApplicationTerminationAssertion clearStaleRelaunchBlocks]");
    auto service = std::dynamic_pointer_cast<CgroupApplicationTermination>(terminationService());
    if (!service) return;
    if (const int code = service->clearStaleBlocks())
        BTHLogError("Failed to clear stale relaunch blocks: %s", std::strerror(code));
}

std::unique_ptr<BTHApplicationTerminationAssertion>
BTHApplicationTerminationAssertion::initWithBundleIdentifier(const std::string& identifier,
                                                             int reason) {
    BTH_FUNCTION("-[BTHApplicationTerminationAssertion initWithBundleIdentifier:reason:]");
    auto acquisition = std::make_shared<Acquisition>();
    if (sem_init(&acquisition->completion, 0, 0) != 0) {
        BTHLogError("Failed to create completion semaphore: %s", std::strerror(errno));
        return nullptr;
    }
    const TerminationReason serviceReasonValue = serviceReason(reason);
    std::shared_ptr<ApplicationTerminationService> service = terminationService();
    std::shared_ptr<TerminationAssertionHandle> assertion = service->createAssertion(
        identifier, serviceReasonValue, [acquisition, identifier](const TerminationError* error) {
            BTH_FUNCTION("-[BTHApplicationTerminationAssertion initWithBundleIdentifier:reason:]");
            if (error) {
                BTHLogError("Failed to acquire termination assertion for %@ : %@", identifier,
                            error->description + " (" + std::strerror(error->code) + ")");
                acquisition->acquired = false;
            }
            sem_post(&acquisition->completion);
        });
    if (!assertion) {
        BTHLogError("Failed to get GangwayApplicationTerminationAssertion");
        return nullptr;
    }
    while (sem_wait(&acquisition->completion) != 0 && errno == EINTR) {
    }
    if (!acquisition->acquired) {
        service->invalidate(assertion);
        return nullptr;
    }
    return std::make_unique<BTHApplicationTerminationAssertion>(Acquired{}, std::move(service),
                                                                std::move(assertion));
}

BTHApplicationTerminationAssertion::~BTHApplicationTerminationAssertion() {
    BTH_FUNCTION("-[BTHApplicationTerminationAssertion dealloc]");
    if (_termAssertion) {
        BTHLogError("Assertion failed: nil == _termAssertion");
        std::abort();
    }
}

void BTHApplicationTerminationAssertion::invalidate() {
    if (!_termAssertion) return;
    service_->invalidate(_termAssertion);
    _termAssertion.reset();
}

}  // namespace berth
