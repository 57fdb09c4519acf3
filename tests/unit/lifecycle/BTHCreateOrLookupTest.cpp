// Creation builds and syncs outside the all-identifiers lock and takes the
// lock again only to check and rename: concurrent creations of one
// identifier must still end with one container that every caller gets, and
// the losers' staging directories must not stay behind. A staged tree that
// cannot be synced fails the creation before anything is live.
#include <thread>

#include "BTHClientConnection.h"
#include "BTHFaultInjection.h"
#include "BTHGlobalConfiguration.h"
#include "BTHMetadata.h"
#include "ScratchDeviceRoot.h"
#include "TestSupport.h"
#include "core/BTHContainerClass.h"
#include "core/ErrorCodes.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;

[[maybe_unused]] const auto& kRoot = test::installScratchDeviceRoot();

constexpr uid_t kMobile = 501;

BTHClientConnection& client() {
    return *BTHClientConnection::sharedClientConnection();
}

stdfs::path classDirectory(uint64_t containerClass) {
    return *BTHGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(
        kMobile, containerClass, false);
}

// The containers on disk in the class directory whose metadata names
// `identifier`.
std::vector<stdfs::path> containersOf(uint64_t containerClass, const std::string& identifier) {
    std::vector<stdfs::path> found;
    for (const auto& entry : stdfs::directory_iterator(classDirectory(containerClass))) {
        BTHMetadataRef record =
            BTHMetadata::readAndValidateMetadataAtUrl(entry.path(), kMobile, true, nullptr);
        if (record && record->identifier() == identifier) found.push_back(entry.path());
    }
    return found;
}

std::vector<std::string> stagingLeftovers() {
    std::vector<std::string> names;
    std::error_code ignored;
    for (const auto& entry : stdfs::directory_iterator(
             BTHGlobalConfiguration::sharedInstance().stagingDirectory(), ignored))
        names.push_back(entry.path().filename().string());
    return names;
}

class BTHCreateOrLookup : public ::testing::Test {
  protected:
    void SetUp() override { BERTH_REQUIRE_ROOT(); }
    void TearDown() override {
        BTHFaultInjectionArm("");
        test::waitForDeathRowQueue();
    }
};

TEST_F(BTHCreateOrLookup, ConcurrentCreatesOfOneIdentifierMakeOneContainer) {
    constexpr int kThreads = 8;
    for (uint64_t containerClass :
         {BTHContainerClassDataApplication, BTHContainerClassSharedAppGroup}) {
        const std::string identifier = "sys.kelp.race." + std::to_string(containerClass);
        std::vector<BTHMetadataRef> results(kThreads);
        std::vector<uint64_t> codes(kThreads, 0);
        std::vector<std::thread> threads;
        for (int t = 0; t < kThreads; ++t) {
            threads.emplace_back([&, t] {
                results[t] = client().createOrLookupContainerForUser(
                    kMobile, identifier, true, containerClass, false, true, &codes[t]);
            });
        }
        for (std::thread& thread : threads) thread.join();

        int made = 0;
        for (int t = 0; t < kThreads; ++t) {
            ASSERT_TRUE(results[t]) << "thread " << t << " failed with " << codes[t];
            EXPECT_EQ(results[t]->uuid(), results[0]->uuid());
            EXPECT_EQ(results[t]->url(), results[0]->url());
            if (!results[t]->existed()) ++made;
        }
        EXPECT_EQ(made, 1);
        EXPECT_EQ(containersOf(containerClass, identifier),
                  std::vector<stdfs::path>{results[0]->url()});
        // The losers built and synced a container each; it went to death row.
        EXPECT_TRUE(stagingLeftovers().empty());
    }
}

TEST_F(BTHCreateOrLookup, StagedTreeThatCannotBeSyncedIsNotMadeLive) {
    const std::string identifier = "sys.kelp.unsynced";
    BTHFaultInjectionArm("create.sync-staged");
    uint64_t code = 0;
    EXPECT_FALSE(client().createOrLookupContainerForUser(
        kMobile, identifier, true, BTHContainerClassDataApplication, false, true, &code));
    EXPECT_EQ(code, uint64_t{BTHErrorWriteFailed});
    EXPECT_TRUE(containersOf(BTHContainerClassDataApplication, identifier).empty());
    EXPECT_TRUE(stagingLeftovers().empty());

    // Nothing of the failure stays in the way of the next attempt.
    BTHFaultInjectionArm("");
    BTHMetadataRef made = client().createOrLookupContainerForUser(
        kMobile, identifier, true, BTHContainerClassDataApplication, false, true, &code);
    ASSERT_TRUE(made);
    EXPECT_FALSE(made->existed());
}

}  // namespace
}  // namespace berth
