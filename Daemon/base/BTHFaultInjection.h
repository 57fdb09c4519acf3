// Test-only fault points. A test that starts the daemon names the points to
// arm in the environment variable BERTH_TEST_FAULTS (comma-separated), which
// start-up reads once; in-process tests arm them directly. Nothing else can
// arm them, so a running daemon started without the variable never takes a
// fault path. Unarmed, a fault point costs one relaxed atomic load.
//
// Two kinds of points:
//   BTHFaultActive("create.metadata-write")  the operation fails there as if
//                                            the system call had failed
//   BTHCrashPoint("replace.after-journal")   the process kills itself with
//                                            SIGKILL there, leaving its
//                                            on-disk state as a crash would
#pragma once

#include <string_view>

namespace berth {

inline constexpr const char* kBTHFaultEnvironmentVariable = "BERTH_TEST_FAULTS";

// Arms the points named in BERTH_TEST_FAULTS; called once by start-up.
void BTHFaultInjectionLoadFromEnvironment();

// Arms exactly the comma-separated `names` (empty disarms everything).
void BTHFaultInjectionArm(std::string_view names);

bool BTHFaultActive(std::string_view point);

// Dies with SIGKILL when `point` is armed.
void BTHCrashPoint(std::string_view point);

}  // namespace berth
