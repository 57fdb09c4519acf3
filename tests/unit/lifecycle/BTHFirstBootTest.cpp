// The first start after boot on a scratch root: orphaned data and transient
// containers to death row, system containers installed from the backup the
// system prepared (and nothing a user planted there), and the retry test's
// last round.
#include <sys/stat.h>

#include "BTHClientConnection.h"
#include "BTHContainerCache.h"
#include "BTHGlobalConfiguration.h"
#include "BTHSystemContainerInstallation.h"
#include "ScratchDeviceRoot.h"
#include "TestSupport.h"
#include "core/BTHContainerClass.h"
#include "core/Uuid.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using test::dict;

[[maybe_unused]] const auto& kRoot = test::installScratchDeviceRoot();

class BTHFirstBootTest : public ::testing::Test {
  protected:
    void SetUp() override {
        BERTH_REQUIRE_ROOT();
        test::writeDeviceProperties(dict({}));
        stdfs::remove_all(backupBase());
        stdfs::remove_all(deathRow());
        stdfs::create_directories(deathRow());
    }
    void TearDown() override {
        test::writeDeviceProperties(dict({}));
        stdfs::remove_all(backupBase());
        test::waitForDeathRowQueue();
    }

    BTHClientConnection& client() { return *BTHClientConnection::sharedClientConnection(); }
    static stdfs::path deathRow() {
        return BTHGlobalConfiguration::sharedInstance().deathrowDirectory();
    }
    static stdfs::path backupBase() {
        return kRoot / "private/var/mobile/Library/Backup/SystemContainers";
    }
    static stdfs::path classDirectory(uid_t user, uint64_t containerClass) {
        return *BTHGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(
            user, containerClass, false);
    }
    BTHMetadataRef container(uid_t user, const std::string& identifier, uint64_t containerClass) {
        uint64_t code = BTHErrorSuccess;
        BTHMetadataRef made = client().createOrLookupContainerForUser(
            user, identifier, true, containerClass, false, true, &code);
        EXPECT_TRUE(made) << code;
        return made;
    }
    // A directory as the system prepares it: root's, written by root only.
    static void prepare(const stdfs::path& directory) {
        stdfs::create_directories(directory);
        ::chmod(directory.c_str(), 0755);
    }
    // How many items death row holds, each in a directory of its own.
    static size_t onDeathRow() { return test::namesIn(deathRow()).size(); }
};

TEST_F(BTHFirstBootTest, OrphansGoToDeathRowAndContainersStay) {
    const uid_t mobile = BTHGlobalConfiguration::sharedInstance().currentMobileUserId();
    const BTHMetadataRef app =
        container(mobile, "first.boot.app", BTHContainerClassDataApplication);
    const BTHMetadataRef system =
        container(kBTHSystemUserId, "sys.kelp.quarryd", BTHContainerClassDataSystem);
    ASSERT_TRUE(app && system);
    const stdfs::path apps = classDirectory(mobile, BTHContainerClassDataApplication);
    stdfs::create_directories(apps / "not-a-container");
    const stdfs::path noMetadata = apps / Uuid::random().string();
    stdfs::create_directories(noMetadata);
    // A link named like a container that leads to a real one is no container.
    const stdfs::path link = apps / Uuid::random().string();
    stdfs::create_directory_symlink(app->url(), link);

    test::LogCapture log;
    client().rebootBerthCleanup();
    EXPECT_TRUE(stdfs::exists(app->url() / kBTHMetadataFileName));
    EXPECT_TRUE(stdfs::exists(system->url() / kBTHMetadataFileName)) << "a well-known name";
    EXPECT_FALSE(stdfs::exists(apps / "not-a-container"));
    EXPECT_FALSE(stdfs::exists(noMetadata));
    EXPECT_FALSE(stdfs::exists(stdfs::symlink_status(link)));
    EXPECT_TRUE(log.contains(
        3, "Deleting orphaned data missing a metadata file at: " + noMetadata.string()));
    EXPECT_FALSE(log.contains(3, "INTERNAL BUILD REQUEST")) << "not an internal build";
    EXPECT_GE(onDeathRow(), 3u);
}

TEST_F(BTHFirstBootTest, TransientContainersNeverSurviveAReboot) {
    const uid_t mobile = BTHGlobalConfiguration::sharedInstance().currentMobileUserId();
    uint64_t code = BTHErrorSuccess;
    const BTHMetadataRef transient = client().createOrLookupContainerForUser(
        mobile, std::string("first.boot.transient"), true, BTHContainerClassDataApplication, true,
        true, &code);
    ASSERT_TRUE(transient) << code;
    client().rebootBerthCleanup();
    EXPECT_FALSE(stdfs::exists(transient->url()));
}

TEST_F(BTHFirstBootTest, OrphansOnAnInternalBuildAreReportedBeforeTheyGo) {
    test::writeDeviceProperties(dict({{"InternalBuild", true}}));
    const stdfs::path groups = classDirectory(kBTHSystemUserId, BTHContainerClassSharedSystemGroup);
    stdfs::create_directories(groups / "planted");
    test::writeFile(groups / "planted/evidence", "x");
    test::LogCapture log;
    client().rebootBerthCleanup();
    EXPECT_FALSE(stdfs::exists(groups / "planted"));
    EXPECT_TRUE(log.contains(3, "***INTERNAL BUILD REQUEST"));
    EXPECT_TRUE(log.contains(3, "evidence"));
    EXPECT_TRUE(log.contains(3, "***END INTERNAL BUILD REQUEST"));
}

TEST_F(BTHFirstBootTest, NoBackupInstallsNothing) {
    test::LogCapture log;
    BTHMoveSystemContainersIntoPlace(client());
    EXPECT_FALSE(log.contains(5, "Installing system"));
    EXPECT_FALSE(log.contains(5, "Restoring container for"));
}

TEST_F(BTHFirstBootTest, PreparedFilesReplaceLiveOnesAndTheBackupGoes) {
    const BTHMetadataRef live =
        container(kBTHSystemUserId, "sys.kelp.lanternd", BTHContainerClassDataSystem);
    ASSERT_TRUE(live);
    test::writeFile(live->url() / "settings", "old");
    test::writeFile(live->url() / "untouched", "stays");
    prepare(backupBase() / "Data/sys.kelp.lanternd");
    test::writeFile(backupBase() / "Data/sys.kelp.lanternd/settings", "restored");
    prepare(backupBase() / "Shared/systemgroup.sys.kelp.tidewater");
    test::writeFile(backupBase() / "Shared/systemgroup.sys.kelp.tidewater/tide", "high");

    test::LogCapture log;
    BTHMoveSystemContainersIntoPlace(client());
    EXPECT_EQ(test::readFile(live->url() / "settings"), "restored");
    EXPECT_EQ(test::readFile(live->url() / "untouched"), "stays");
    // A system group container without a live one is made, under its fixed name.
    const stdfs::path tide = classDirectory(kBTHSystemUserId, BTHContainerClassSharedSystemGroup) /
                             "systemgroup.sys.kelp.tidewater";
    EXPECT_EQ(test::readFile(tide / "tide"), "high");
    EXPECT_TRUE(stdfs::exists(tide / kBTHMetadataFileName));
    EXPECT_TRUE(log.contains(5, "Installing system containers"));
    EXPECT_TRUE(log.contains(5, "Installing system group containers"));
    EXPECT_FALSE(stdfs::exists(backupBase())) << "removed on builds that are not internal";
}

TEST_F(BTHFirstBootTest, AnInternalBuildKeepsTheBackupTree) {
    test::writeDeviceProperties(dict({{"InternalBuild", true}}));
    prepare(backupBase() / "Data/sys.kelp.quarryd");
    test::writeFile(backupBase() / "Data/sys.kelp.quarryd/q", "1");
    BTHMoveSystemContainersIntoPlace(client());
    EXPECT_TRUE(stdfs::exists(backupBase() / "Data.inprogress/sys.kelp.quarryd"));
    EXPECT_FALSE(stdfs::exists(backupBase() / "Data"));
    // A later boot with nothing new prepared installs nothing again.
    test::LogCapture log;
    BTHMoveSystemContainersIntoPlace(client());
    EXPECT_FALSE(log.contains(5, "Installing system containers"));
}

TEST_F(BTHFirstBootTest, WhatAUserCouldHavePlantedIsNeverInstalled) {
    const BTHMetadataRef live =
        container(kBTHSystemUserId, "sys.kelp.quarryd", BTHContainerClassDataSystem);
    ASSERT_TRUE(live);
    test::ScratchDir outside;
    test::writeFile(outside.path() / "secret", "outside");
    prepare(backupBase() / "Data/sys.kelp.quarryd");
    stdfs::create_symlink(outside.path() / "secret", backupBase() / "Data/sys.kelp.quarryd/link");
    test::writeFile(backupBase() / "Data/sys.kelp.quarryd/plain", "fine");
    // A prepared container the mobile user owns could hold anything.
    prepare(backupBase() / "Data/sys.kelp.lanternd");
    ASSERT_EQ(::chown((backupBase() / "Data/sys.kelp.lanternd").c_str(), 501, 501), 0);
    test::writeFile(backupBase() / "Data/sys.kelp.lanternd/planted", "evil");
    test::writeDeviceProperties(dict({{"InternalBuild", true}}));  // keep the tree to look at

    test::LogCapture log;
    BTHMoveSystemContainersIntoPlace(client());
    EXPECT_EQ(test::readFile(live->url() / "plain"), "fine");
    EXPECT_FALSE(stdfs::exists(stdfs::symlink_status(live->url() / "link")));
    EXPECT_TRUE(stdfs::is_symlink(backupBase() / "Data.inprogress.failed/sys.kelp.quarryd/link"));
    EXPECT_EQ(test::readFile(outside.path() / "secret"), "outside");
    EXPECT_TRUE(log.contains(3, "Refusing to install the link"));
    EXPECT_TRUE(log.contains(3, "Refusing prepared system containers at"));
    EXPECT_FALSE(stdfs::exists(classDirectory(kBTHSystemUserId, BTHContainerClassDataSystem) /
                               "sys.kelp.lanternd/planted"));
}

TEST_F(BTHFirstBootTest, AnInterruptedInstallationGoesOnAtTheNextFirstStart) {
    // As a start killed after the rename left it.
    prepare(backupBase() / "Data.inprogress/sys.kelp.lanternd");
    test::writeFile(backupBase() / "Data.inprogress/sys.kelp.lanternd/late", "arrives");
    BTHMoveSystemContainersIntoPlace(client());
    EXPECT_EQ(test::readFile(classDirectory(kBTHSystemUserId, BTHContainerClassDataSystem) /
                             "sys.kelp.lanternd/late"),
              "arrives");
    EXPECT_FALSE(stdfs::exists(backupBase()));
}

TEST_F(BTHFirstBootTest, RetryTestWithNoCrashesSucceedsAndRemovesItsContainer) {
    uint64_t code = 0;
    client().retryTestForUser(BTHGlobalConfiguration::sharedInstance().currentMobileUserId(), 0,
                              &code);
    EXPECT_EQ(code, BTHErrorSuccess);
    const BTHMetadataRef left = BTHContainerCache::sharedInstance().containerForUser(
        BTHGlobalConfiguration::sharedInstance().currentMobileUserId(),
        BTHContainerClassDataApplication, "sys.kelp.retryTest", false, nullptr);
    EXPECT_FALSE(left);
}

}  // namespace
}  // namespace berth
