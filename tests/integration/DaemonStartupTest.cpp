// Start-up of the real daemon on a scratch device root: the once-per-boot
// marker, refusal to start beside another instance, the upcall socket's
// error replies, and the request socket's intake.
#include <signal.h>
#include <sys/socket.h>

#include <cstring>

#include "BTHDaemon.h"
#include "DaemonSupport.h"
#include "core/ErrorCodes.h"
#include "platform/NamedSemaphore.h"
#include "platform/ServiceCheckIn.h"

namespace berth {
namespace {

using test::DaemonProcess;

const std::filesystem::path& root() {
    return test::deviceRoot();
}

std::string logText() {
    return test::readFile(root() / "private/var/root/Library/Logs/Berth/berthd.log");
}

size_t occurrences(const std::string& text, const std::string& what) {
    size_t n = 0;
    for (size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) ++n;
    return n;
}

// The daemon is started by each test itself.
class DaemonStartupTest : public test::DaemonFixture {};

// The "ReplyError" of `message` sent over `connection`.
uint64_t replyError(BerthConnection& connection, Value message) {
    BerthError error;
    auto reply = connection.request(message, std::chrono::seconds(10), &error);
    EXPECT_FALSE(error) << error.message;
    return reply ? test::code(*reply) : 0;
}

Value command(uint64_t n) {
    return test::dict({{"Command", n}});
}

TEST_F(DaemonStartupTest, FirstBootWorkRunsOncePerBoot) {
    const std::string before = logText();
    {
        DaemonProcess daemon(root());
        ASSERT_TRUE(daemon.waitUntilServing()) << daemon.standardError();
        EXPECT_TRUE(NamedSemaphore::exists(kBTHFirstBootSemaphoreName));
        daemon.stop(SIGTERM);
    }
    {
        DaemonProcess daemon(root());
        ASSERT_TRUE(daemon.waitUntilServing()) << daemon.standardError();
        daemon.stop(SIGKILL);
    }
    const std::string added = logText().substr(before.size());
    EXPECT_EQ(occurrences(added, "berthd performing first boot initialization"), 1u) << added;
    EXPECT_EQ(occurrences(added, "berthd first boot cleanup complete"), 1u) << added;
}

TEST_F(DaemonStartupTest, UpcallCheckInFailureExitsWith255AndLeavesNoMarker) {
    // Another holder of the upcall endpoint: the daemon must not start.
    int error = 0;
    auto holder = ServiceCheckIn::claim(kBTHUpcallServiceName, SOCK_SEQPACKET, 0600, &error);
    ASSERT_TRUE(holder) << strerror(error);
    DaemonProcess daemon(root());
    EXPECT_EQ(daemon.waitForExit(), 255);
    EXPECT_FALSE(NamedSemaphore::exists(kBTHFirstBootSemaphoreName));
    EXPECT_NE(logText().find("Failed to initialize kernel upcall interface. THIS IS BAD! Exiting."),
              std::string::npos);
}

TEST_F(DaemonStartupTest, SecondInstanceExitsAndTheFirstKeepsServing) {
    DaemonProcess first(root());
    ASSERT_TRUE(first.waitUntilServing()) << first.standardError();
    DaemonProcess second(root());
    EXPECT_EQ(second.waitForExit(), 255);
    auto connection = BerthConnection::connect(first.requestSocket());
    ASSERT_TRUE(connection);
    EXPECT_EQ(replyError(*connection, command(30)), uint64_t{BTHErrorInvalidCommand});
    first.stop(SIGKILL);

    // A socket left by a killed instance is replaced by the next one.
    DaemonProcess third(root());
    ASSERT_TRUE(third.waitUntilServing()) << third.standardError();
}

TEST_F(DaemonStartupTest, RequestsFromAnUnsignedCallerReachOnlyOpenCommands) {
    ASSERT_NO_FATAL_FAILURE(start());
    // This test program has no signature: no identifier, no entitlements.
    EXPECT_EQ(replyError(*connection_, command(1)), uint64_t{BTHErrorNotEntitled});
    EXPECT_EQ(replyError(*connection_, command(24)), uint64_t{BTHErrorNotEntitled});
    EXPECT_EQ(replyError(*connection_, command(30)), uint64_t{BTHErrorInvalidCommand});
    EXPECT_EQ(replyError(*connection_, command(uint64_t{1} << 33)),
              uint64_t{BTHErrorInvalidCommand});
    // Command 0 is open to every caller: its handler answers (here refusing
    // the missing user).
    EXPECT_EQ(replyError(*connection_, Value::dictionary()), uint64_t{BTHErrorInvalidParameter});
    EXPECT_NE(logText().find("missing required entitlement: sys.kelp.private.Berth.allowed"),
              std::string::npos);
}

}  // namespace
}  // namespace berth
