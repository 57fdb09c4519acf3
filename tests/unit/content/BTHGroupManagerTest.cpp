// Group containers through the real processing, cache and client object on
// a scratch root: paths created on demand per class, counts recomputed from
// the mapping, the last reference staging the container, reconciliation.
#include "BTHGroupManager.h"

#include "BTHContainerCache.h"
#include "BTHGlobalConfiguration.h"
#include "ScratchDeviceRoot.h"
#include "TestSupport.h"
#include "core/BTHContainerClass.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using test::dict;
using Strings = std::vector<std::string>;

[[maybe_unused]] const auto& kRoot = test::installScratchDeviceRoot();

Value entitlements(const char* key, const Strings& groups) {
    return dict({{kBTHEntitlementsKey, dict({{key, BTHStringListValue(groups)}})}});
}

class BTHGroupManagerTest : public ::testing::Test {
  protected:
    void SetUp() override {
        BERTH_REQUIRE_ROOT();
        stdfs::remove_all(BTHCodeSigningMapping::mappingFileURL());
        mapping_ = BTHCodeSigningMapping::create();
        ASSERT_TRUE(mapping_);
        groups_.emplace(mapping_.get());
        mapping_->setHooks(BTHMakeCodeSigningHooks(*groups_));
        mobile_ = BTHGlobalConfiguration::sharedInstance().currentMobileUserId();
    }

    void grant(const std::string& identifier, const Strings& list,
               const char* key = kBTHApplicationGroupsEntitlement) {
        ASSERT_EQ(
            mapping_->processCodeSigningInfo(entitlements(key, list), identifier, std::nullopt),
            1u);
    }

    // The group containers of `identifier` for `user`, created on demand.
    BTHGroupManager::GroupPaths paths(uid_t user, const std::string& identifier) {
        uint64_t code = BTHErrorSuccess;
        auto found = groups_->groupContainerPathsForUser(user, *client_, identifier, &code);
        EXPECT_TRUE(found) << code;
        return found.value_or(BTHGroupManager::GroupPaths{});
    }

    std::unique_ptr<BTHCodeSigningMapping> mapping_;
    std::optional<BTHGroupManager> groups_;
    std::shared_ptr<BTHClientConnection> client_ =
        std::make_shared<BTHClientConnection>("some.caller", 501, false, std::nullopt);
    uid_t mobile_ = 0;
};

TEST_F(BTHGroupManagerTest, SharedGroupStaysUntilItsLastReferenceGoes) {
    grant("one.app", {"group.shared", "group.one"});
    grant("two.app", {"group.shared"});
    const auto one = paths(mobile_, "one.app");
    ASSERT_EQ(one.size(), 2u);
    EXPECT_TRUE(client_->allowGroupIdLookup());
    // The same group is the same container for every member, under class 7.
    EXPECT_EQ(paths(mobile_, "two.app").at("group.shared"), one.at("group.shared"));
    const stdfs::path classDirectory =
        *BTHGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(
            mobile_, BTHContainerClassSharedAppGroup, false);
    for (const auto& [group, path] : one)
        EXPECT_EQ(stdfs::path(path).parent_path(), classDirectory);

    test::LogCapture log;
    grant("one.app", {});
    EXPECT_TRUE(log.contains(
        7, "Reference count for user: " + std::to_string(mobile_) + ", ID: group.shared is 2"));
    EXPECT_TRUE(log.contains(5, "Last reference to group container group.one for " +
                                    std::to_string(mobile_) + " is going away; removing it."));
    EXPECT_TRUE(stdfs::exists(one.at("group.shared")));
    EXPECT_FALSE(stdfs::exists(one.at("group.one")));

    // The last member's removal takes the shared group with it.
    mapping_->removeCodeSigningDictionariesForIdentifierAndItsChildren("two.app");
    EXPECT_FALSE(stdfs::exists(one.at("group.shared")));
    const auto counts = groups_->copyReferenceCountSetOfType(BTHGroupTypeApplication);
    ASSERT_TRUE(counts);
    EXPECT_TRUE(counts->empty());
}

TEST_F(BTHGroupManagerTest, SystemGroupsBelongToUser499AndCountUnderTheFallbackKey) {
    grant("sys.daemon", {"systemgroup.sys.kelp.test"}, kBTHSystemGroupContainersEntitlement);
    const auto found = paths(kBTHSystemUserId, "sys.daemon");
    ASSERT_EQ(found.size(), 1u);
    EXPECT_NE(found.begin()->second.find("Shared/SystemGroup"), std::string::npos);
    EXPECT_TRUE(paths(mobile_, "sys.daemon").empty());  // no application groups
    const auto counts = groups_->copyReferenceCountSetOfType(BTHGroupTypeSystem);
    EXPECT_EQ(counts->at("systemgroup.sys.kelp.test"), 1);

    // A group listed twice by one identifier counts twice, and a second
    // identifier keeps it when the first drops it.
    grant("sys.other", {"systemgroup.sys.kelp.test", "systemgroup.sys.kelp.test"},
          kBTHSystemGroupsEntitlement);
    grant("sys.daemon", {}, kBTHSystemGroupContainersEntitlement);
    EXPECT_TRUE(stdfs::exists(found.begin()->second));
}

TEST_F(BTHGroupManagerTest, ReconciliationStagesOnlyUnreferencedGroups) {
    grant("kept.app", {"group.kept"});
    const auto kept = paths(mobile_, "kept.app");
    // A group container no entitlement names (left by an older release).
    uint64_t code = 0;
    const BTHMetadataRef stray =
        BTHClientConnection::sharedClientConnection()->createOrLookupContainerForUser(
            mobile_, std::string("group.stray"), true, BTHContainerClassSharedAppGroup, false, true,
            &code);
    ASSERT_TRUE(stray) << code;
    test::LogCapture log;
    groups_->reconcileGroupContainersOfType(BTHGroupTypeApplication);
    EXPECT_TRUE(log.contains(
        3, "Removing group container with identifier group.stray for " + std::to_string(mobile_)));
    EXPECT_FALSE(stdfs::exists(stray->url()));
    EXPECT_TRUE(stdfs::exists(kept.at("group.kept")));
}

TEST_F(BTHGroupManagerTest, QueriesRefuseAMissingIdentifierAndAnswerEmptyForNoGroups) {
    uint64_t code = BTHErrorSuccess;
    EXPECT_FALSE(groups_->groupContainerPathsForUser(mobile_, *client_, std::nullopt, &code));
    EXPECT_EQ(code, BTHErrorInvalidArgument);
    code = BTHErrorSuccess;
    EXPECT_FALSE(groups_->groupContainerIdentifiersForUser(mobile_, std::nullopt, &code));
    EXPECT_EQ(code, BTHErrorInvalidArgument);
    code = BTHErrorSuccess;
    EXPECT_EQ(groups_->groupContainerIdentifiersForUser(mobile_, "nobody.app", &code), Strings{});
    EXPECT_EQ(code, BTHErrorSuccess);
    grant("listed.app", {"b", "a"});
    EXPECT_EQ(groups_->groupContainerIdentifiersForUser(0, "listed.app", &code),
              (Strings{"b", "a"}));
}

}  // namespace
}  // namespace berth
