// Holding an application terminated while the daemon changes the files of
// its containers behind its back: taking the assertion ends every process of
// the application and keeps it from being launched again until the assertion
// is invalidated.
#pragma once

#include <memory>
#include <string>

#include "platform/ApplicationTermination.h"

namespace berth {

// Terminates an application and keeps it from being relaunched until
// invalidate(); creation blocks until the termination service confirms.
class BTHApplicationTerminationAssertion {
  public:
    // reason: 0 installation, 1 cache deletion, 255 critical (any other
    // value is a programming error of the caller and stops the daemon).
    // Returns null if the assertion could not be taken.
    static std::unique_ptr<BTHApplicationTerminationAssertion> initWithBundleIdentifier(
        const std::string& identifier, int reason);
    ~BTHApplicationTerminationAssertion();  // must have been invalidated
    void invalidate();                      // idempotent
    BTHApplicationTerminationAssertion(const BTHApplicationTerminationAssertion&) = delete;
    BTHApplicationTerminationAssertion& operator=(const BTHApplicationTerminationAssertion&) =
        delete;

    // The termination service assertions are taken from: the one set here,
    // else the platform's (made on first use). Set it before the first
    // assertion (start-up, or a test's set-up); null returns to the
    // platform's.
    static void setTerminationService(std::shared_ptr<ApplicationTerminationService> service);
    static std::shared_ptr<ApplicationTerminationService> terminationService();

    // Lifts relaunch blocks a previous daemon process left behind: its
    // assertions died with it. Called at start-up, before any assertion.
    static void clearStaleRelaunchBlocks();

  private:
    // Only initWithBundleIdentifier makes instances.
    struct Acquired {
        explicit Acquired() = default;
    };

  public:
    BTHApplicationTerminationAssertion(Acquired,
                                       std::shared_ptr<ApplicationTerminationService> service,
                                       std::shared_ptr<TerminationAssertionHandle> assertion)
        : service_(std::move(service)), _termAssertion(std::move(assertion)) {}

  private:
    std::shared_ptr<ApplicationTerminationService> service_;
    // Present from a successful creation until invalidate().
    std::shared_ptr<TerminationAssertionHandle> _termAssertion;
};

}  // namespace berth
