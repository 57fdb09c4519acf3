#include "BTHUncaughtExceptionReporter.h"

#include <pthread.h>
#include <syslog.h>
#include <unistd.h>

#include <cstdlib>
#include <mutex>

namespace berth {

namespace {

std::mutex& exceptionReportLock() {
    static std::mutex lock;
    return lock;
}

std::string currentThreadName() {
    char name[64] = {};
    if (pthread_getname_np(pthread_self(), name, sizeof name) != 0) return {};
    return name;
}

}  // namespace

std::string BTHUncaughtExceptionReport(const BTHCaughtException& exception) {
    std::string report = "** INTERNAL ERROR: Uncaught Exception **\n";
    report += "Exception: ";
    if (std::string thread = currentThreadName(); !thread.empty()) report += "<" + thread + "> ";
    if (!exception.name.empty()) report += exception.name + ": ";
    report += exception.reason;
    report += "\nStack:\n";
    bool first = true;
    for (const Value& frame : *exception.callStackSymbols.arrayValue()) {
        if (!first) report += "\n";
        first = false;
        report += frame.string() ? *frame.string() : frame.description();
    }
    return report;
}

void BTHReportUncaughtException(const BTHCaughtException& exception) {
    const std::string report = BTHUncaughtExceptionReport(exception);
    // Taken and never released: the first failing thread writes the report
    // and aborts; any other waits here until the process is gone.
    exceptionReportLock().lock();
    ssize_t ignored = ::write(STDERR_FILENO, report.data(), report.size());
    (void)ignored;
    ignored = ::write(STDERR_FILENO, "\n", 1);
    syslog(LOG_CRIT, "%s", report.c_str());
    std::abort();
}

}  // namespace berth
