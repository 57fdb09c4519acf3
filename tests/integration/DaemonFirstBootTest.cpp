// The first start after boot against later starts, and the retry test: a
// daemon that exits on purpose, answered by a client that comes back.
#include "DaemonSupport.h"
#include "core/Commands.h"
#include "libberth/BerthMaintenance.h"
#include "platform/NamedSemaphore.h"

namespace berth::test {
namespace {

namespace fs = std::filesystem;

constexpr const char* kSelf = "sys.kelp.firstboot.tester";

class DaemonFirstBootTest : public DaemonFixture {
  protected:
    void SetUp() override {
        DaemonFixture::SetUp();
        if (IsSkipped() || HasFatalFailure()) return;
        signSelf(kSelf, dict({{kBTHEntitlementAllowed, true}}));
        writeDeviceProperties(dict({}));
    }
    void TearDown() override {
        writeDeviceProperties(dict({}));
        DaemonFixture::TearDown();
    }

    // One round of the retry test on the running daemon.
    bool retryRound(uint64_t crashes, ContainerError* failure) {
        return BerthMaintenance(*connection_, std::chrono::seconds(20))
            .retryTest(501, crashes, failure);
    }
};

TEST_F(DaemonFirstBootTest, OnlyTheFirstStartAfterBootCleansUpOrphans) {
    ASSERT_NO_FATAL_FAILURE(start());
    const fs::path stray = deviceRoot() / kDataClassDirectory / "stray-after-start";
    fs::create_directories(stray);
    // A restart of the daemon in the same boot leaves it.
    ASSERT_NO_FATAL_FAILURE(start());
    EXPECT_TRUE(fs::exists(stray));
    EXPECT_EQ(daemonLog().find("Deleting orphaned data"), std::string::npos);
    // A reboot does not.
    NamedSemaphore::remove("berthd.fb_check");
    ASSERT_NO_FATAL_FAILURE(start());
    EXPECT_FALSE(fs::exists(stray));
    EXPECT_TRUE(deathRowEmpties());
}

TEST_F(DaemonFirstBootTest, RetryTestExitsTwiceThenSucceedsOnInternalBuilds) {
    writeDeviceProperties(dict({{"InternalBuild", true}}));
    int exits = 0;
    for (;;) {
        ASSERT_NO_FATAL_FAILURE(start());
        ContainerError failure;
        if (retryRound(2, &failure)) break;
        ASSERT_FALSE(failure.isReplyError()) << failure.describe();
        EXPECT_EQ(failure.transport.code, BerthError::Code::ConnectionClosed);
        EXPECT_EQ(daemon_->waitForExit(), 0) << "the test's exit is an orderly one";
        ASSERT_LT(++exits, 5) << "the countdown never ends";
    }
    EXPECT_EQ(exits, 2);
    const std::string log = daemonLog();
    EXPECT_NE(log.find("Crashes Remaining in retry test: 2"), std::string::npos);
    EXPECT_NE(log.find("Crashes Remaining in retry test: 0"), std::string::npos);
    EXPECT_NE(log.find("Returning Successfully"), std::string::npos);
    // The test's container is gone once it succeeded.
    EXPECT_EQ(code(call(create(2, 501, "sys.kelp.retryTest", false, false))), 21u);
}

TEST_F(DaemonFirstBootTest, RetryTestDoesNothingElsewhere) {
    ASSERT_NO_FATAL_FAILURE(start());
    ContainerError failure;
    EXPECT_TRUE(retryRound(2, &failure)) << failure.describe();
    EXPECT_NE(daemonLog().find("People really shouldn't be calling this on non-internal installs!"),
              std::string::npos);
    EXPECT_EQ(code(call(create(2, 501, "sys.kelp.retryTest", false, false))), 21u);
}

}  // namespace
}  // namespace berth::test
