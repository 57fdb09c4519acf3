// The application-termination service: ends every process of an application
// and holds it from being launched again until the hold is released.
//
// An assertion is taken for an application identifier and a reason; the
// service reports once, through the acquisition handler, whether it holds:
// success means that no process of the application runs any more and that
// berth-launch refuses to start it. Invalidating the assertion releases the
// hold; the application may run again once no assertion for it is left.
//
// On Linux the processes of an application are those of its launch cgroup
// (platform/LaunchCgroup.h) and the hold is a relaunch block
// (platform/RelaunchBlock.h).
#pragma once

#include <chrono>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>

#include "platform/LaunchCgroup.h"
#include "platform/RelaunchBlock.h"

namespace berth {

enum class TerminationReason { Installation, CacheDeletion, Critical };

// "installation", "cache deletion", "critical".
const char* BTHTerminationReasonName(TerminationReason reason);

// Why an assertion could not be acquired.
struct TerminationError {
    int code = 0;  // an errno
    std::string description;
};

// One assertion of a service. Only the service that made it may invalidate
// it.
class TerminationAssertionHandle {
  public:
    TerminationAssertionHandle(std::string identifier, TerminationReason reason)
        : identifier_(std::move(identifier)), reason_(reason) {}
    virtual ~TerminationAssertionHandle() = default;
    const std::string& identifier() const { return identifier_; }
    TerminationReason reason() const { return reason_; }

  private:
    std::string identifier_;
    TerminationReason reason_;
};

class ApplicationTerminationService {
  public:
    // Called once per assertion: with null when it holds, else with why not.
    // It may run on any thread, before or after createAssertion returns.
    using AcquisitionHandler = std::function<void(const TerminationError* error)>;

    virtual ~ApplicationTerminationService() = default;

    // Starts acquiring an assertion on `identifier`. Null when none could be
    // made at all (the handler is then never called).
    virtual std::shared_ptr<TerminationAssertionHandle> createAssertion(
        const std::string& identifier, TerminationReason reason, AcquisitionHandler handler) = 0;

    // Releases `assertion`, acquired or not; a second call does nothing.
    virtual void invalidate(const std::shared_ptr<TerminationAssertionHandle>& assertion) = 0;
};

// The Linux service: kills the application's launch cgroup and blocks its
// relaunch. Acquisition runs on the caller's thread and has reported before
// createAssertion returns. Several assertions on one identifier share one
// block, lifted when the last of them is invalidated.
class CgroupApplicationTermination : public ApplicationTerminationService {
  public:
    struct Options {
        // Relative to the cgroup2 mount; see LaunchCgroup.
        std::string cgroupParent = LaunchCgroup::configuredParent();
        std::filesystem::path blockDirectory = RelaunchBlocks::defaultDirectory();
        // How long the processes may take to go after SIGKILL (a process in
        // uninterruptible sleep) before acquisition fails.
        std::chrono::milliseconds killLimit = std::chrono::seconds(30);
        // False: kill the listed processes one by one even where the kernel
        // has the group's kill file (what kernels before 5.14 do).
        bool useKillFile = true;
    };

    CgroupApplicationTermination() : CgroupApplicationTermination(Options{}) {}
    explicit CgroupApplicationTermination(Options options);

    std::shared_ptr<TerminationAssertionHandle> createAssertion(
        const std::string& identifier, TerminationReason reason,
        AcquisitionHandler handler) override;
    void invalidate(const std::shared_ptr<TerminationAssertionHandle>& assertion) override;

    // Lifts every block left in the block directory (start-up of the daemon,
    // when no assertion of this process can exist yet).
    int clearStaleBlocks() const { return blocks_.clearAll(); }

  private:
    class Assertion;
    // Takes the hold of `identifier`, writing its block on the first. 0 or
    // an errno.
    int hold(const std::string& identifier, TerminationReason reason);
    void release(const std::string& identifier);
    TerminationError terminate(const std::string& identifier) const;

    Options options_;
    RelaunchBlocks blocks_;
    std::mutex mutex_;
    std::map<std::string, int> holds_;  // guarded by mutex_
};

}  // namespace berth
