// berthctl's maintenance commands against a real daemon: the data migration,
// and the retry test repeated across the daemon's exits.
#include <atomic>
#include <thread>

#include "DaemonSupport.h"
#include "core/Commands.h"
#include "platform/CodeSigningRegistry.h"

namespace berth::test {
namespace {

namespace fs = std::filesystem;

const fs::path kBerthctl = BERTHCTL_BINARY_PATH;

class BerthctlMaintenanceDaemonTest : public DaemonFixture {
  protected:
    void SetUp() override {
        DaemonFixture::SetUp();
        if (IsSkipped() || HasFatalFailure()) return;
        writeDeviceProperties(dict({}));
        std::string why;
        ASSERT_EQ(CodeSigningRegistry().sign(kBerthctl, "sys.kelp.berthctl",
                                             dict({{kBTHEntitlementAllowed, true}}), &why),
                  0)
            << why;
    }
    void TearDown() override {
        writeDeviceProperties(dict({}));
        DaemonFixture::TearDown();
    }
};

TEST_F(BerthctlMaintenanceDaemonTest, MigrateRunsTheDataMigration) {
    ASSERT_NO_FATAL_FAILURE(start());
    const Outcome outcome =
        run(kBerthctl, {"migrate", "--socket", daemon_->requestSocket().string()});
    EXPECT_EQ(outcome.status, 0) << outcome.err;
    EXPECT_EQ(outcome.out, "data migration done\n");
    EXPECT_NE(daemonLog().find("Performing Data Migration on"), std::string::npos);
}

// berthctl comes back after each exit; here the test plays the service
// manager that starts the daemon again.
TEST_F(BerthctlMaintenanceDaemonTest, RepeatsTheRetryTestAcrossExits) {
    writeDeviceProperties(dict({{"InternalBuild", true}}));
    ASSERT_NO_FATAL_FAILURE(start());
    const fs::path socket = daemon_->requestSocket();
    connection_.reset();
    std::atomic<bool> done{false};
    std::thread manager([&] {
        while (!done) {
            if (daemon_->waitForExit(std::chrono::milliseconds(100))) {
                daemon_.reset();
                daemon_.emplace(deviceRoot());
                daemon_->waitUntilServing();
            }
        }
    });
    const Outcome outcome = run(BERTHCTL_BINARY_PATH, {"--json", "retry-test", "--crashes", "2",
                                                       "--socket", socket.string()});
    done = true;
    manager.join();
    EXPECT_EQ(outcome.status, 0) << outcome.err;
    EXPECT_EQ(outcome.out, "{\"exits\":2}\n");
}

}  // namespace
}  // namespace berth::test
