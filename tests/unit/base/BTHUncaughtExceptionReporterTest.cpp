#include "BTHUncaughtExceptionReporter.h"

#include <gtest/gtest.h>
#include <pthread.h>

#include <stdexcept>

namespace berth {
namespace {

BTHCaughtException caught() {
    try {
        throw std::out_of_range("index 7 past the end");
    } catch (...) {
        return BTHCaughtException::from(std::current_exception());
    }
}

TEST(BTHUncaughtExceptionReporterTest, ReportNamesThreadExceptionReasonAndStack) {
    pthread_setname_np(pthread_self(), "listener");
    BTHCaughtException e = caught();
    e.callStackSymbols = Value(Value::Array{Value("frame one"), Value("frame two")});
    EXPECT_EQ(BTHUncaughtExceptionReport(e),
              "** INTERNAL ERROR: Uncaught Exception **\n"
              "Exception: <listener> std::out_of_range: index 7 past the end\n"
              "Stack:\nframe one\nframe two");
}

TEST(BTHUncaughtExceptionReporterTest, ReportingEndsTheProcessWithTheReportOnStandardError) {
    BTHCaughtException e = caught();
    EXPECT_DEATH(BTHReportUncaughtException(e),
                 "Uncaught Exception \\*\\*\nException: .*std::out_of_range: index 7 past the end");
}

}  // namespace
}  // namespace berth
