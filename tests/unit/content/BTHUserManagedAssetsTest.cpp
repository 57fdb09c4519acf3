// User-managed assets on a scratch root: the directory made once and
// remembered (metadata file and cache), its removal answered without a new
// one, and deletion of items inside it: every path that tries to leave the
// directory refused with the outside left as it was, including while a
// component is being swapped for a link.
#include "BTHUserManagedAssets.h"

#include <sys/stat.h>

#include "BTHContainerCache.h"
#include "BTHGlobalConfiguration.h"
#include "ScratchDeviceRoot.h"
#include "TestSupport.h"
#include "core/BTHContainerClass.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;

[[maybe_unused]] const auto& kRoot = test::installScratchDeviceRoot();

class BTHUserManagedAssetsTest : public ::testing::Test {
  protected:
    void SetUp() override {
        BERTH_REQUIRE_ROOT();
        mobile_ = BTHGlobalConfiguration::sharedInstance().currentMobileUserId();
        identifier_ = "sys.kelp.assets." + std::to_string(++serial_);
        uint64_t code = BTHErrorSuccess;
        const BTHMetadataRef container =
            BTHClientConnection::sharedClientConnection()->createOrLookupContainerForUser(
                mobile_, identifier_, true, BTHContainerClassDataApplication, false, true, &code);
        ASSERT_TRUE(container) << code;
        container_ = container->url();
        outside_.emplace();
        stdfs::create_directories(outside_->path() / "inner");
        test::writeFile(outside_->path() / "secret", "outside");
        test::writeFile(outside_->path() / "inner" / "secret", "outside");
    }

    std::pair<uint64_t, std::optional<stdfs::path>> assets(
        const std::optional<std::string>& identifier) {
        uint64_t code = BTHErrorSuccess;
        auto url = userManagedAssetsURLForUser(mobile_, identifier, &code);
        return {code, url};
    }

    uint64_t remove(const std::string& relativePath) {
        uint64_t code = BTHErrorSuccess;
        deleteUserManagedAssetForUser(*BTHClientConnection::sharedClientConnection(), mobile_,
                                      identifier_, relativePath, &code);
        return code;
    }

    void expectOutsideUntouched() {
        EXPECT_EQ(test::readFile(outside_->path() / "secret"), "outside");
        EXPECT_EQ(test::readFile(outside_->path() / "inner" / "secret"), "outside");
        EXPECT_EQ(test::namesIn(outside_->path()), (std::set<std::string>{"inner", "secret"}));
    }

    static inline int serial_ = 0;
    uid_t mobile_ = 0;
    std::string identifier_;
    stdfs::path container_;
    std::optional<test::ScratchDir> outside_;
};

TEST_F(BTHUserManagedAssetsTest, TheDirectoryIsMadeOnceAndRememberedUntilRemoved) {
    const auto [code, first] = assets(identifier_);
    ASSERT_EQ(code, 1u);
    ASSERT_TRUE(first);
    EXPECT_EQ(first->parent_path(), container_ / "Library");
    const std::string name = first->filename().string();
    EXPECT_EQ(name.rfind(kBTHUserManagedAssetsPrefix, 0), 0u);
    EXPECT_EQ(name.size(), std::string(kBTHUserManagedAssetsPrefix).size() + 6);
    const struct stat st = test::lstatOf(*first);
    EXPECT_TRUE(S_ISDIR(st.st_mode));
    EXPECT_EQ(st.st_mode & 07777, 0755u);
    EXPECT_EQ(st.st_uid, mobile_);
    EXPECT_EQ(st.st_gid, mobile_);

    // Remembered in the metadata file, so a cache built from disk knows it.
    BTHContainerCache::sharedInstance().resetForTesting();
    EXPECT_EQ(assets(identifier_).second, first);

    stdfs::remove(*first);
    test::LogCapture log;
    EXPECT_EQ(assets(identifier_).first, BTHErrorInvalidArgument);
    EXPECT_TRUE(log.contains(3, "User Managed Assets path does not exist: " + first->string()));
    EXPECT_EQ(test::namesIn(container_ / "Library").count(name), 0u);
    for (const auto& entry : stdfs::directory_iterator(container_ / "Library"))
        EXPECT_NE(entry.path().filename().string().rfind(kBTHUserManagedAssetsPrefix, 0), 0u);
}

TEST_F(BTHUserManagedAssetsTest, UnknownContainersAndMissingArguments) {
    EXPECT_EQ(assets(std::nullopt).first, BTHErrorInvalidArgument);
    test::LogCapture log;
    EXPECT_EQ(assets(std::string("sys.kelp.assets.none")).first, BTHErrorInvalidArgument);
    EXPECT_TRUE(log.contains(3,
                             "Failed to create app data container for user managed assets path for "
                             "sys.kelp.assets.none"));
    // No directory yet: nothing to delete from.
    EXPECT_EQ(remove("a"), BTHErrorInvalidArgument);
    EXPECT_TRUE(log.contains(3, "No userManagedAssetsDirName or URL in container metadata object"));
    uint64_t code = BTHErrorSuccess;
    deleteUserManagedAssetForUser(*BTHClientConnection::sharedClientConnection(), mobile_,
                                  identifier_, std::nullopt, &code);
    EXPECT_EQ(code, uint64_t{BTHErrorInvalidArgument});
}

TEST_F(BTHUserManagedAssetsTest, DeletesItemsInsideAndRefusesEveryWayOut) {
    const stdfs::path directory = *assets(identifier_).second;
    const stdfs::path out = outside_->path();
    stdfs::create_directories(directory / "sub");
    test::writeFile(directory / "a", "asset");
    test::writeFile(directory / "sub" / "b", "asset");
    test::writeFile(container_ / "Library" / "sibling", "app data");
    stdfs::create_symlink(out, directory / "absolute");
    stdfs::create_symlink("../../../../../../../../..", directory / "climb");
    stdfs::create_symlink("..", directory / "up");  // the container's "Library"
    stdfs::create_symlink(out, directory / "sub" / "exit");
    stdfs::create_symlink("sub/exit", directory / "chain");
    stdfs::create_symlink("/proc/self/root" + out.string(), directory / "magic");
    stdfs::create_symlink("sub", directory / "rel");

    const struct {
        std::string path;
        uint64_t code;
    } refused[] = {
        {"../sibling", BTHErrorInvalidParameter},
        {"sub/../../sibling", BTHErrorInvalidParameter},
        {"..", BTHErrorInvalidParameter},
        {"", BTHErrorInvalidPath},
        {".", BTHErrorInvalidPath},
        {"/", BTHErrorInvalidPath},
        {"absolute/secret", BTHErrorInvalidPath},
        {"absolute", BTHErrorInvalidPath},
        {"climb/secret", BTHErrorInvalidPath},
        {"up/sibling", BTHErrorInvalidPath},
        {"chain/secret", BTHErrorInvalidPath},
        {"chain/inner/secret", BTHErrorInvalidPath},
        {"magic/secret", BTHErrorInvalidPath},
        {"sub/exit/secret", BTHErrorInvalidPath},
        {std::string("a\0/x", 4), BTHErrorInvalidPath},
        {std::string(5000, 'a'), BTHErrorInvalidPath},
    };
    for (const auto& entry : refused) {
        EXPECT_EQ(remove(entry.path), entry.code) << entry.path;
        expectOutsideUntouched();
        EXPECT_EQ(test::readFile(container_ / "Library" / "sibling"), "app data") << entry.path;
        EXPECT_TRUE(stdfs::is_directory(directory)) << entry.path;
    }

    // Items inside go to death row, a link as the item itself (its target
    // is not followed); a missing one is not a failure.
    const stdfs::path deathRow = BTHGlobalConfiguration::sharedInstance().deathrowDirectory();
    const size_t before = test::namesIn(deathRow).size();
    for (const char* path : {"a", "sub/b", "rel", "missing"}) EXPECT_EQ(remove(path), 1u) << path;
    EXPECT_TRUE(stdfs::is_directory(directory / "sub"));
    EXPECT_EQ(remove("/sub/./"), 1u);
    EXPECT_EQ(test::namesIn(directory),
              (std::set<std::string>{"absolute", "chain", "climb", "magic", "up"}));
    EXPECT_EQ(test::namesIn(deathRow).size(), before + 5);
    expectOutsideUntouched();
}

// The name is kept in a metadata file inside the app's own container: one
// that is not a single plain name (written there by the app, say) leads
// nowhere, neither for the path nor for deletion.
TEST_F(BTHUserManagedAssetsTest, ARememberedNameThatIsNotOnePlainNameIsNotFollowed) {
    ASSERT_EQ(assets(identifier_).first, 1u);
    const std::string climb = outside_->path().lexically_relative(container_ / "Library").string();
    for (const std::string& name :
         {outside_->path().string(), climb, std::string(".."), std::string("."), std::string()}) {
        BTHMetadataRef record = BTHContainerCache::sharedInstance().containerForUser(
            mobile_, BTHContainerClassDataApplication, identifier_, false, nullptr);
        ASSERT_TRUE(record);
        record->setUserManagedAssetsDirName(name);
        ASSERT_TRUE(record->writeMetadataToDisk(nullptr));
        BTHContainerCache::sharedInstance().resetForTesting();
        EXPECT_EQ(assets(identifier_).first, BTHErrorInvalidArgument) << name;
        for (const char* path : {"secret", "inner/secret", "inner", ""})
            EXPECT_EQ(remove(path), BTHErrorInvalidArgument) << name << " " << path;
        expectOutsideUntouched();
    }
}

TEST_F(BTHUserManagedAssetsTest, AComponentSwappedForALinkNeverLeadsOutside) {
    const stdfs::path directory = *assets(identifier_).second;
    constexpr int kFiles = 150;
    stdfs::create_directories(directory / "victim" / "inner");
    for (int i = 0; i < kFiles; ++i) {
        test::writeFile(directory / "victim" / "inner" / std::to_string(i), "inside");
        test::writeFile(outside_->path() / "inner" / std::to_string(i), "outside");
    }
    {
        test::LinkSwapper swapper(directory, outside_->path());
        for (int i = 0; i < kFiles; ++i) {
            const uint64_t code = remove("victim/inner/" + std::to_string(i));
            EXPECT_TRUE(code == 1 || code == BTHErrorInvalidPath ||
                        code == BTHErrorMoveToDeathRowFailed)
                << code;
        }
    }
    // Whatever the swapping refused is still inside and goes now; the
    // outside files all stay.
    for (int i = 0; i < kFiles; ++i) {
        EXPECT_EQ(remove("victim/inner/" + std::to_string(i)), 1u) << i;
        EXPECT_EQ(test::readFile(outside_->path() / "inner" / std::to_string(i)), "outside") << i;
    }
    EXPECT_TRUE(test::namesIn(directory / "victim" / "inner").empty());
    EXPECT_EQ(test::namesIn(outside_->path() / "inner").size(), kFiles + 1u);
}

}  // namespace
}  // namespace berth
