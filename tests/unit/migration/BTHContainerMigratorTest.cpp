// The container migrator on a scratch root: old per-user directories and log
// files, the bundle containers' old place, the access-list check, well-known
// system containers moved to their fixed names, and the data migration's
// one-time steps.
#include "BTHContainerMigrator.h"

#include "BTHClientConnection.h"
#include "BTHContainerCache.h"
#include "BTHFileManager.h"
#include "BTHGlobalConfiguration.h"
#include "BTHLog.h"
#include "ScratchDeviceRoot.h"
#include "TestSupport.h"
#include "core/BTHContainerClass.h"
#include "core/Uuid.h"
#include "platform/DeviceRoot.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using test::dict;

[[maybe_unused]] const auto& kRoot = test::installScratchDeviceRoot();

class BTHContainerMigratorTest : public ::testing::Test {
  protected:
    void SetUp() override {
        BERTH_REQUIRE_ROOT();
        test::writeDeviceProperties(dict({}));
        BTHSetLogFileCount(1);
        BTHGlobalConfiguration& configuration = BTHGlobalConfiguration::sharedInstance();
        stdfs::remove(configuration.libraryDirectory() / "bth_migration_status.plist");
        for (const uint64_t c : {BTHContainerClassDataSystem, BTHContainerClassSharedSystemGroup})
            stdfs::remove_all(*configuration.globalContainerBaseURLWithContentClass(c, false));
        stdfs::remove_all(configuration.bundleDirectory());
        stdfs::remove_all(DeviceRoot::resolve(kBTHOldBundleContainersPath));
        BTHContainerCache::sharedInstance().resetForTesting();
        status_ = BTHMigrationStatus::make();
        ASSERT_TRUE(status_);
    }
    void TearDown() override { test::writeDeviceProperties(dict({})); }

    bool upgrade() {
        BTHErrorRef error;
        return BTHContainerMigrator::sharedInstance().performSynchronousBuildUpgradeMigration(
            *status_, &error);
    }

    stdfs::path mobileHome() const { return kRoot / "private/var/mobile"; }

    std::unique_ptr<BTHMigrationStatus> status_;
};

TEST_F(BTHContainerMigratorTest, OldLogFilesMoveUpOneNumberWithinTheFileCount) {
    const stdfs::path oldLogs = mobileHome() / "Library/Logs/Berth";
    stdfs::create_directories(oldLogs);
    stdfs::create_directories(mobileHome() / "Library/Berth/stale");
    test::writeFile(oldLogs / "berthd.log.0", "zero");
    test::writeFile(oldLogs / "berthd.log.1", "one");
    test::writeFile(oldLogs / "berthd.log", "current");
    const stdfs::path logs = BTHGlobalConfiguration::sharedInstance().logDirectory();
    stdfs::remove(logs / "berthd.log.1");
    stdfs::remove(logs / "berthd.1");

    test::LogCapture log;
    EXPECT_TRUE(upgrade());
    EXPECT_EQ(test::readFile(logs / "berthd.log.1"), "zero");
    EXPECT_EQ(test::readFile(logs / "berthd.1"), "current") << "a name without a number is 0";
    EXPECT_FALSE(stdfs::exists(logs / "berthd.log.2")) << "beyond the file count of 1";
    EXPECT_FALSE(stdfs::exists(oldLogs));
    EXPECT_FALSE(stdfs::exists(mobileHome() / "Library/Berth"));
    EXPECT_TRUE(log.contains(5, "Migrated log files on"));
}

TEST_F(BTHContainerMigratorTest, AMultiUserDeviceKeepsTheUsersOldDirectories) {
    test::writeDeviceProperties(dict({{"MultiUser", true}}));
    const stdfs::path oldLogs = mobileHome() / "Library/Logs/Berth";
    stdfs::create_directories(oldLogs);
    test::writeFile(oldLogs / "berthd.log.0", "kept");
    EXPECT_TRUE(upgrade());
    EXPECT_EQ(test::readFile(oldLogs / "berthd.log.0"), "kept");
    stdfs::remove_all(oldLogs);
}

TEST_F(BTHContainerMigratorTest, BundleContainersMoveFromTheUsersAreaAndTheChecksStillRun) {
    const stdfs::path old = DeviceRoot::resolve(kBTHOldBundleContainersPath);
    const std::string uuid = Uuid::random().string();
    stdfs::create_directories(old / "Application" / uuid);
    test::writeFile(old / "Application" / uuid / "payload", "app");
    test::LogCapture log;
    EXPECT_TRUE(upgrade());
    EXPECT_FALSE(stdfs::exists(old));
    EXPECT_EQ(test::readFile(BTHGlobalConfiguration::sharedInstance().bundleDirectory() /
                             "Application" / uuid / "payload"),
              "app");
    EXPECT_TRUE(log.contains(5, "Moving bundle containers from user to system location"));
    // No system container directory exists: nothing needs new access lists.
    EXPECT_TRUE(log.contains(5, "No system containers requiring ACL migration"));
    EXPECT_TRUE(status_->hasMigrationOccurredForType(kBTHACLMigrationKey));
}

TEST_F(BTHContainerMigratorTest, ABundleMoveThatFailsEndsTheMigration) {
    const stdfs::path old = DeviceRoot::resolve(kBTHOldBundleContainersPath);
    stdfs::create_directories(old / "Application");
    // A non-empty bundle directory cannot be renamed over.
    test::writeFile(BTHGlobalConfiguration::sharedInstance().bundleDirectory() / "present", "");
    test::LogCapture log;
    EXPECT_FALSE(upgrade());
    EXPECT_TRUE(log.contains(3, "Failed to migrate to new bundle containers location"));
    EXPECT_FALSE(log.contains(5, "No system containers requiring ACL migration"));
    EXPECT_TRUE(stdfs::exists(old));
}

TEST_F(BTHContainerMigratorTest, WellKnownSystemContainersMoveToTheirFixedNames) {
    auto& client = *BTHClientConnection::sharedClientConnection();
    uint64_t code = BTHErrorSuccess;
    const BTHMetadataRef lantern = client.createOrLookupContainerForUser(
        kBTHSystemUserId, std::string("sys.kelp.lanternd"), true, BTHContainerClassDataSystem,
        false, true, &code);
    const BTHMetadataRef quarry = client.createOrLookupContainerForUser(
        kBTHSystemUserId, std::string("sys.kelp.quarryd"), true, BTHContainerClassDataSystem, false,
        true, &code);
    ASSERT_TRUE(lantern && quarry);
    const stdfs::path fixed = lantern->url();
    ASSERT_EQ(fixed.filename(), "sys.kelp.lanternd");
    // As an older release left it: under a UUID name.
    const stdfs::path old = fixed.parent_path() / Uuid::random().string();
    stdfs::rename(fixed, old);
    test::writeFile(old / "state", "kept");
    BTHContainerCache::sharedInstance().resetForTesting();

    test::LogCapture log;
    EXPECT_TRUE(upgrade());
    EXPECT_EQ(test::readFile(fixed / "state"), "kept");
    EXPECT_FALSE(stdfs::exists(old));
    EXPECT_TRUE(log.contains(3, "Migrating well-known container sys.kelp.lanternd from"));
    EXPECT_FALSE(log.contains(3, "Migrating well-known container sys.kelp.quarryd"));
    const BTHMetadataRef found = BTHContainerCache::sharedInstance().containerForUser(
        kBTHSystemUserId, BTHContainerClassDataSystem, "sys.kelp.lanternd", false, nullptr);
    ASSERT_TRUE(found);
    EXPECT_EQ(found->url(), fixed);
    // System containers exist, so their access lists stay due.
    EXPECT_FALSE(status_->hasMigrationOccurredForType(kBTHACLMigrationKey));
}

TEST_F(BTHContainerMigratorTest, DataMigrationOwnsBundlesOnceAndThenOnlyRepeatsCodeSigning) {
    const stdfs::path bundles = BTHGlobalConfiguration::sharedInstance().bundleDirectory();
    stdfs::create_directories(bundles / "Application/x");
    test::writeFile(bundles / "Application/x/binary", "");
    ASSERT_EQ(::chown((bundles / "Application/x/binary").c_str(), 0, 0), 0);

    test::LogCapture log;
    BTHErrorRef error;
    ASSERT_TRUE(
        BTHContainerMigrator::sharedInstance().performDataMigratorMigrationWithError(&error))
        << (error ? error->description() : "");
    EXPECT_EQ(test::lstatOf(bundles / "Application/x/binary").st_uid, kBTHBundleUserId);
    EXPECT_EQ(test::lstatOf(bundles / "Application/x/binary").st_gid, kBTHBundleUserId);
    EXPECT_TRUE(log.contains(5, "Changing ownership of bundle container content."));
    auto status = BTHMigrationStatus::make();
    EXPECT_TRUE(status->hasMigrationOccurredForType(kBTHBundleMigrationKey));
    EXPECT_TRUE(status->hasMigrationOccurredForType(kBTHACLMigrationKey))
        << "no system container directory: the access lists count as done";

    test::LogCapture again;
    ASSERT_TRUE(
        BTHContainerMigrator::sharedInstance().performDataMigratorMigrationWithError(&error));
    EXPECT_FALSE(again.contains(5, "Changing ownership of bundle container content."));
    EXPECT_TRUE(again.contains(5, "Performing Data Migration on"));
}

}  // namespace
}  // namespace berth
