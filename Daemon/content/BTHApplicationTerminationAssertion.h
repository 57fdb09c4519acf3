// Holding an application terminated while the daemon changes its files
// behind its back: taking the assertion terminates the application and keeps
// it from being relaunched until the assertion is invalidated.
#pragma once

#include <memory>
#include <string>

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

  private:
    explicit BTHApplicationTerminationAssertion(std::string identifier);

    std::string identifier_;
    // Whether the assertion is held (until invalidate()).
    bool termAssertion_ = false;
};

}  // namespace berth
