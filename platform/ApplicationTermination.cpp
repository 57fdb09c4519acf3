#include "platform/ApplicationTermination.h"

#include <cstring>

namespace berth {

const char* BTHTerminationReasonName(TerminationReason reason) {
    switch (reason) {
        case TerminationReason::Installation:
            return "installation";
        case TerminationReason::CacheDeletion:
            return "cache deletion";
        case TerminationReason::Critical:
            return "critical";
    }
    return "unknown";
}

class CgroupApplicationTermination::Assertion : public TerminationAssertionHandle {
  public:
    using TerminationAssertionHandle::TerminationAssertionHandle;
    bool held = false;         // guarded by the service's mutex
    bool invalidated = false;  // guarded by the service's mutex
};

CgroupApplicationTermination::CgroupApplicationTermination(Options options)
    : options_(std::move(options)), blocks_(options_.blockDirectory) {}

std::shared_ptr<TerminationAssertionHandle> CgroupApplicationTermination::createAssertion(
    const std::string& identifier, TerminationReason reason, AcquisitionHandler handler) {
    auto assertion = std::make_shared<Assertion>(identifier, reason);
    std::string why;
    if (!LaunchCgroup::validName(identifier, &why)) {
        const TerminationError error{EINVAL, why};
        handler(&error);
        return assertion;
    }
    if (const int code = hold(identifier, reason)) {
        const TerminationError error{code, "cannot write the relaunch block in " +
                                               blocks_.directory().string() + ": " +
                                               std::strerror(code)};
        handler(&error);
        return assertion;
    }
    {
        std::lock_guard lock(mutex_);
        assertion->held = true;
    }
    const TerminationError error = terminate(identifier);
    handler(error.code ? &error : nullptr);
    return assertion;
}

void CgroupApplicationTermination::invalidate(
    const std::shared_ptr<TerminationAssertionHandle>& handle) {
    auto* assertion = dynamic_cast<Assertion*>(handle.get());
    if (!assertion) return;
    bool held = false;
    {
        std::lock_guard lock(mutex_);
        if (assertion->invalidated) return;
        assertion->invalidated = true;
        held = std::exchange(assertion->held, false);
    }
    if (held) release(assertion->identifier());
}

int CgroupApplicationTermination::hold(const std::string& identifier, TerminationReason reason) {
    std::lock_guard lock(mutex_);
    int& count = holds_[identifier];
    if (count == 0) {
        if (const int code = blocks_.set(identifier, BTHTerminationReasonName(reason))) {
            holds_.erase(identifier);
            return code;
        }
    }
    ++count;
    return 0;
}

void CgroupApplicationTermination::release(const std::string& identifier) {
    std::lock_guard lock(mutex_);
    auto found = holds_.find(identifier);
    if (found == holds_.end() || --found->second > 0) return;
    holds_.erase(found);
    blocks_.clear(identifier);
}

TerminationError CgroupApplicationTermination::terminate(const std::string& identifier) const {
    std::string why;
    bool unmounted = false;
    const std::optional<LaunchCgroup> cgroups =
        LaunchCgroup::locate(options_.cgroupParent, &why, &unmounted);
    // Without a cgroup v2 hierarchy berth-launch starts nothing, so nothing
    // of the application can be running.
    if (!cgroups) return unmounted ? TerminationError{} : TerminationError{EINVAL, why};
    const int code = cgroups->killAll(identifier, options_.killLimit, options_.useKillFile);
    if (code == 0) return {};
    if (code == ETIMEDOUT)
        return {code, "processes of " + identifier + " are still running " +
                          std::to_string(options_.killLimit.count()) + " ms after SIGKILL (" +
                          cgroups->pathOf(identifier).string() + ")"};
    return {code, "cannot kill the processes of " + cgroups->pathOf(identifier).string() + ": " +
                      std::strerror(code)};
}

}  // namespace berth
