// The uncaught-exception reporter: on internal builds an exception caught at
// an operation's boundary ends the process with a crash report, so the fault
// is seen rather than served around.
#pragma once

#include <string>

#include "BTHError.h"

namespace berth {

// The report: "** INTERNAL ERROR: Uncaught Exception **", the thread's name,
// the exception's name and reason, and its call stack.
std::string BTHUncaughtExceptionReport(const BTHCaughtException& exception);

// Writes the report as the crash annotation (standard error and the system
// log, never the rotating log) and aborts. One thread reports even when
// several fail at once.
[[noreturn]] void BTHReportUncaughtException(const BTHCaughtException& exception);

}  // namespace berth
