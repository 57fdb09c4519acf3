// The migration status file: a first start, the fold-in of older marker
// files (kept when the new file cannot be written), completion records, and
// build-upgrade detection with every doubt counted as an upgrade.
#include "BTHMigrationStatus.h"

#include <regex>

#include "BTHFaultInjection.h"
#include "BTHGlobalConfiguration.h"
#include "BTHPropertyListFile.h"
#include "ScratchDeviceRoot.h"
#include "TestSupport.h"
#include "platform/SystemVersion.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using test::dict;

const stdfs::path& kRoot = test::installScratchDeviceRoot();

class BTHMigrationStatusTest : public ::testing::Test {
  protected:
    void SetUp() override {
        library_ = BTHGlobalConfiguration::sharedInstance().libraryDirectory();
        for (const char* name :
             {"bth_migration_status.plist", "bth_bundle_migration_complete.plist",
              "bth_acl2_migration_complete.plist"})
            stdfs::remove(library_ / name);
        setOsRelease("NAME=\"Berth OS\"\nVERSION_ID=12\nBUILD_ID=\"20A100\"\nRELEASE_TYPE=User\n");
    }

    static void setOsRelease(const std::string& text) {
        stdfs::create_directories(kRoot / "etc");
        test::writeFile(kRoot / "etc/os-release", text);
    }

    std::optional<Value> statusFile() const {
        return BTH_dictionaryWithContentsOfURL(library_ / "bth_migration_status.plist", 0, nullptr);
    }

    stdfs::path library_;
};

TEST_F(BTHMigrationStatusTest, AFirstStartIsAnUpgradeAndTheNextOnTheSameBuildIsNot) {
    test::LogCapture log;
    auto first = BTHMigrationStatus::make();
    ASSERT_TRUE(first);
    ASSERT_TRUE(statusFile()) << "the fold-in writes the file even with no marker";
    EXPECT_TRUE(statusFile()->dictionaryValue()->empty());
    EXPECT_TRUE(first->isBuildUpgrade());
    EXPECT_TRUE(log.contains(5, "Did not find last build info"));
    first->writeCurrentBuildInfoToDisk();
    EXPECT_TRUE(log.contains(5, "Saved last build version of 20A100"));

    // Same build, another release type: not an upgrade.
    setOsRelease("BUILD_ID=20A100\nRELEASE_TYPE=Internal\n");
    auto second = BTHMigrationStatus::make();
    ASSERT_TRUE(second);
    EXPECT_FALSE(second->isBuildUpgrade());
    EXPECT_TRUE(log.contains(
        5,
        "Current build version (20A100 / Internal) equal to last version recorded (20A100 / "
        "User); skipping upgrade"));

    setOsRelease("VERSION_ID=13\nRELEASE_TYPE=User\n");  // no build id: the version counts
    EXPECT_TRUE(BTHMigrationStatus::make()->isBuildUpgrade());
    EXPECT_TRUE(log.contains(5, "Detected upgrade from 20A100 (User) to 13 (User)"));
    setOsRelease("NAME=nothing\n");
    EXPECT_TRUE(BTHMigrationStatus::make()->isBuildUpgrade());
    EXPECT_TRUE(log.contains(3, "Could not get current build string; assuming this is an upgrade"));
    stdfs::remove(kRoot / "etc/os-release");
    EXPECT_TRUE(BTHMigrationStatus::make()->isBuildUpgrade());
    EXPECT_TRUE(log.contains(3, "Could not get current build info; assuming this is an upgrade"));
}

TEST_F(BTHMigrationStatusTest, MarkerFilesAreFoldedInAndRemovedOnlyOnceTheFileIsWritten) {
    const Value record =
        dict({{"BTHMigrationVersionNumber", "19A1"}, {"BTHMigrationTime", "then"}});
    const stdfs::path marker = library_ / "bth_acl2_migration_complete.plist";
    ASSERT_TRUE(BTH_writeToURL(record, marker, kBTHStateFileWriteOptions, nullptr));

    // A directory in the new file's place: it cannot be written, the marker
    // stays, and the record is known in memory.
    stdfs::create_directory(library_ / "bth_migration_status.plist");
    {
        test::LogCapture log;
        auto status = BTHMigrationStatus::make();
        ASSERT_FALSE(status) << "a status file that is no dictionary gives no instance";
        EXPECT_TRUE(log.contains(3, "Error reading migration file from disk.  This is bad"));
    }
    stdfs::remove(library_ / "bth_migration_status.plist");
    {
        BTHFaultInjectionArm("migration-status.write");
        auto status = BTHMigrationStatus::make();
        BTHFaultInjectionArm("");
        ASSERT_TRUE(status);
        EXPECT_TRUE(status->hasMigrationOccurredForType("ACLMigration"));
        EXPECT_TRUE(stdfs::exists(marker)) << "the marker went before its record was safe";
    }
    auto status = BTHMigrationStatus::make();
    ASSERT_TRUE(status);
    EXPECT_FALSE(stdfs::exists(marker));
    const std::optional<Value> file = statusFile();
    ASSERT_TRUE(file);
    ASSERT_TRUE(file->find("ACLMigration"));
    EXPECT_EQ(*file->find("ACLMigration"), record);
    EXPECT_FALSE(status->hasMigrationOccurredForType("BundleMigration"));
}

TEST_F(BTHMigrationStatusTest, CompletionIsRecordedWithTheBuildAndTimeAndAnyValueCounts) {
    auto status = BTHMigrationStatus::make();
    ASSERT_TRUE(status);
    test::LogCapture log;
    status->setMigrationCompleteForType("GroupIdMigration");
    const std::string build = BTHMigrationStatus::currentBuildVersion();
    EXPECT_TRUE(log.contains(5, "Migration completed on " + build + " for GroupIdMigration"));
    const std::optional<Value> file = statusFile();
    ASSERT_TRUE(file);
    const Value* record = file->find("GroupIdMigration");
    ASSERT_TRUE(record);
    EXPECT_EQ(*record->find("BTHMigrationVersionNumber")->string(), build);
    EXPECT_TRUE(std::regex_match(*record->find("BTHMigrationTime")->string(),
                                 std::regex(R"(\d{4}-\d\d-\d\d \d\d:\d\d:\d\d [+-]\d{4})")));

    Value withEmpty = *file;
    withEmpty.set("CodeSigningMigration", Value::dictionary());
    ASSERT_TRUE(BTH_writeToURL(withEmpty, library_ / "bth_migration_status.plist",
                               kBTHStateFileWriteOptions, nullptr));
    EXPECT_TRUE(BTHMigrationStatus::make()->hasMigrationOccurredForType("CodeSigningMigration"));
}

TEST(SystemVersionTest, OsReleaseFieldsBecomeTheVersionDictionary) {
    const Value parsed = systemVersionFromOsRelease(
        "# comment\nNAME='Berth OS'\nVERSION_ID=\"1.2\"\nBUILD_ID=\"b\\\"q\"\n=x\nbroken\n"
        "RELEASE_TYPE=Beta\n");
    EXPECT_EQ(parsed, dict({{"Name", "Berth OS"},
                            {"Version", "1.2"},
                            {"BuildVersion", "b\"q"},
                            {"ReleaseType", "Beta"}}));
    EXPECT_EQ(systemVersionFromOsRelease("VERSION_ID=7\nBUILD_ID=\n"),
              dict({{"Version", "7"}, {"BuildVersion", "7"}}));
}

}  // namespace
}  // namespace berth
