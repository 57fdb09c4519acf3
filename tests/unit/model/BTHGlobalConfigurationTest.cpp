#include "BTHGlobalConfiguration.h"

#include <sys/xattr.h>

#include "ScratchDeviceRoot.h"
#include "TestSupport.h"
#include "core/BTHContainerClass.h"

namespace berth {
namespace {

const std::filesystem::path& root() {
    static const std::filesystem::path& path = test::installScratchDeviceRoot();
    return path;
}
const bool kRootInstalled = !root().empty();

using test::lstatOf;

// The protection class stored on the item itself (not inherited), or -1.
int32_t storedProtectionClass(const std::filesystem::path& path) {
    int32_t value = -1;
    if (::lgetxattr(path.c_str(), "trusted.berth.protection_class", &value, sizeof value) !=
        sizeof value)
        return -1;
    return value;
}

void expectDirectory(const std::filesystem::path& path, uid_t owner) {
    const struct stat st = lstatOf(path);
    EXPECT_TRUE(S_ISDIR(st.st_mode)) << path;
    EXPECT_EQ(st.st_mode & 07777, 0755u) << path;
    EXPECT_EQ(st.st_uid, owner) << path;
}

class BTHGlobalConfigurationTest : public ::testing::Test {
  protected:
    void SetUp() override { BERTH_REQUIRE_ROOT(); }
    BTHGlobalConfiguration& config() { return BTHGlobalConfiguration::sharedInstance(); }
};

TEST_F(BTHGlobalConfigurationTest, GlobalDirectoriesLiveUnderTheDeviceRoot) {
    ASSERT_TRUE(kRootInstalled);
    const auto caches = root() / "private/var/root/Library/Caches/sys.kelp.berthd";
    EXPECT_EQ(config().stagingDirectory(), caches / "Staging");
    EXPECT_EQ(config().deathrowDirectory(), caches / "Dead");
    EXPECT_EQ(config().transientDirectory(), caches / "Temp");
    EXPECT_EQ(config().replaceDirectory(), root() / "private/var/root/Library/Berth/Replace");
    EXPECT_EQ(config().bundleDirectory(), root() / "private/var/containers/Bundle");
    EXPECT_EQ(config().logDirectory(), root() / "private/var/root/Library/Logs/Berth");
    for (auto dir : {caches / "Staging", caches / "Dead", config().replaceDirectory(),
                     config().bundleDirectory(), config().logDirectory()})
        expectDirectory(dir, 0);
    // The library, caches and log directories carry protection class 4.
    EXPECT_EQ(storedProtectionClass(config().cachesDirectory()), 4);
    EXPECT_EQ(storedProtectionClass(config().libraryDirectory()), 4);
    EXPECT_EQ(storedProtectionClass(config().logDirectory()), 4);
}

TEST_F(BTHGlobalConfigurationTest, TransientBundleDirectoryBelongsToTheBundleUser) {
    const auto dir = config().transientBundleDirectory();
    EXPECT_EQ(dir, root() / "private/var/ladingd/Library/Caches/sys.kelp.berthd");
    for (auto level : {dir.parent_path().parent_path(), dir.parent_path(), dir})
        expectDirectory(level, kBTHBundleUserId);
}

TEST_F(BTHGlobalConfigurationTest, ClassDirectoriesForEveryKindOfClass) {
    // Global classes ignore the user they are asked for.
    const struct {
        uid_t user;
        uint64_t containerClass;
        bool transient;
        std::filesystem::path expected;
        uid_t owner;
    } cases[] = {
        {501, BTHContainerClassDataApplication, false,
         root() / "private/var/mobile/Containers/Data/Application", 501},
        {501, BTHContainerClassBundleApplication, false,
         root() / "private/var/containers/Bundle/Application", kBTHBundleUserId},
        {0, BTHContainerClassDataSystem, true,
         root() / "private/var/root/Library/Caches/sys.kelp.berthd/Temp/Data/System", 0},
        {33, BTHContainerClassBundleFramework, true,
         config().transientBundleDirectory() / "Bundle/Framework", kBTHBundleUserId},
        {502, BTHContainerClassDataTempDir, true,
         root() / "private/var/other/Library/Caches/sys.kelp.berthd/Temp/Data/TempDir", 502},
    };
    for (const auto& c : cases) {
        auto url = config().containerDirectoryURLForUser(c.user, c.containerClass, c.transient);
        ASSERT_TRUE(url) << c.expected;
        EXPECT_EQ(*url, c.expected);
        expectDirectory(*url, c.owner);
    }
    EXPECT_EQ(lstatOf(cases[0].expected).st_gid, 501u);
    expectDirectory(cases[0].expected.parent_path().parent_path(), 501);

    for (uint64_t invalid : {0, 14, 15}) {
        EXPECT_FALSE(config().containerDirectoryURLForUser(501, invalid, false)) << invalid;
        EXPECT_FALSE(config().globalContainerBaseURLWithContentClass(invalid, false)) << invalid;
    }
    EXPECT_FALSE(
        config().globalContainerBaseURLWithContentClass(BTHContainerClassDataApplication, false));
}

TEST_F(BTHGlobalConfigurationTest, BaseURLDoesNotCreateTheClassDirectory) {
    auto base =
        config().globalContainerBaseURLWithContentClass(BTHContainerClassBundleVPNPlugin, false);
    ASSERT_TRUE(base);
    EXPECT_EQ(*base, root() / "private/var/containers/Bundle/VPNPlugin");
    EXPECT_FALSE(std::filesystem::exists(*base));
}

TEST_F(BTHGlobalConfigurationTest, RemovedDirectoriesComeBackOnTheNextRequest) {
    const auto dead = config().deathrowDirectory();
    std::filesystem::remove_all(dead);
    ASSERT_FALSE(std::filesystem::exists(dead));
    EXPECT_EQ(config().deathrowDirectory(), dead);
    expectDirectory(dead, 0);

    auto user = config().getPerUserConfigurationForUserId(501);
    const auto base = *user->userBaseDirectory();
    std::filesystem::remove_all(base);
    EXPECT_EQ(*user->userBaseDirectory(), base);
    expectDirectory(base, 501);
}

TEST_F(BTHGlobalConfigurationTest, UnknownUsersHaveNoPaths) {
    test::LogCapture log;
    auto user = config().getPerUserConfigurationForUserId(777);
    ASSERT_TRUE(user);
    EXPECT_FALSE(user->userHomeDirectory());
    EXPECT_FALSE(user->userBaseDirectory());
    EXPECT_FALSE(user->existsUserBaseDirectory());
    EXPECT_FALSE(
        config().containerDirectoryURLForUser(777, BTHContainerClassDataApplication, false));
    EXPECT_TRUE(log.contains(3, "Failed to getpwuid for uid: 777"));
}

TEST_F(BTHGlobalConfigurationTest, PerUserPathsAndTheClassCheck) {
    test::LogCapture log;
    auto user = config().getPerUserConfigurationForCurrentMobileUser();
    EXPECT_EQ(user->userId(), 501u);
    const auto home = root() / "private/var/mobile";
    EXPECT_EQ(*user->systemContainerBackupDirectory(),
              home / "Library/Backup/SystemContainers/Data");
    EXPECT_EQ(*user->systemGroupContainerBackupDirectory(),
              home / "Library/Backup/SystemContainers/Shared");
    EXPECT_FALSE(std::filesystem::exists(home / "Library/Backup"));
    EXPECT_EQ(*user->oldLoggingPath(), home / "Library/Logs/Berth");
    EXPECT_TRUE(user->existsUserBaseDirectory());
    EXPECT_FALSE(
        user->containerDirectoryURLForContentClass(BTHContainerClassBundleApplication, false));
    EXPECT_TRUE(log.contains(3, "Invalid class for a per user container directory: 1"));
}

TEST_F(BTHGlobalConfigurationTest, ConcurrentFirstRequestsShareOneConfiguration) {
    std::vector<std::shared_ptr<BTHPerUserConfiguration>> got(16);
    std::vector<std::thread> threads;
    for (auto& g : got)
        threads.emplace_back([&] { g = config().getPerUserConfigurationForUserId(502); });
    for (auto& t : threads) t.join();
    for (auto& g : got) EXPECT_EQ(g, got[0]);
}

TEST_F(BTHGlobalConfigurationTest, MigrationFilesAndUserEnumeration) {
    EXPECT_FALSE(config().migrationFileExistsWithName("bth_migration_status.plist"));
    test::writeFile(config().libraryDirectory() / "bth_migration_status.plist", "x");
    EXPECT_TRUE(config().migrationFileExistsWithName("bth_migration_status.plist"));
    std::vector<uid_t> visited;
    config().enumerateUsers([&](uid_t uid) { visited.push_back(uid); });
    EXPECT_EQ(visited, std::vector<uid_t>{501});
    EXPECT_EQ(BTHGlobalConfiguration::appUserDataItemNames(),
              (std::vector<std::string>{"Documents", "Library", "tmp", "Merchantry"}));
}

}  // namespace
}  // namespace berth
