// The code-signing migrations through the real cache, client object and
// store on a scratch root: group lists of data containers, the legacy
// entitlements file and cached information of bundle containers become
// entries; their old copies go only once the mapping holding them is
// written; a second run changes nothing.
#include "BTHCodeSigningMigration.h"

#include "BTHContainerCache.h"
#include "BTHFaultInjection.h"
#include "BTHGlobalConfiguration.h"
#include "BTHMetadata.h"
#include "BTHMigrationStatus.h"
#include "BTHPropertyListFile.h"
#include "ScratchDeviceRoot.h"
#include "TestSupport.h"
#include "core/BTHContainerClass.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using test::dict;
using Strings = std::vector<std::string>;

[[maybe_unused]] const auto& kRoot = test::installScratchDeviceRoot();

class BTHCodeSigningMigrationTest : public ::testing::Test {
  protected:
    void SetUp() override {
        BERTH_REQUIRE_ROOT();
        library_ = BTHGlobalConfiguration::sharedInstance().libraryDirectory();
        for (const char* name : {kBTHCodeSigningMappingFileName, "bth_migration_status.plist",
                                 kBTHLegacyEntitlementsFileName})
            stdfs::remove(library_ / name);
        mapping_ = BTHCodeSigningMapping::create();
        ASSERT_TRUE(mapping_);
        groups_.emplace(mapping_.get());
        mapping_->setHooks(BTHMakeCodeSigningHooks(*groups_));
    }

    void TearDown() override { BTHFaultInjectionArm(""); }

    void migrate() {
        BTHCodeSigningMigration(*mapping_, *groups_)
            .performAllCodeSigningMigrationAndReconciliation();
    }

    // A container of (user, class) holding `value` under the info `key`.
    BTHMetadataRef containerWithInfo(uid_t user, uint64_t containerClass,
                                     const std::string& identifier, const char* key,
                                     const Value& value) {
        auto& client = *BTHClientConnection::sharedClientConnection();
        uint64_t code = BTHErrorSuccess;
        BTHMetadataRef made = client.createOrLookupContainerForUser(
            user, identifier, true, containerClass, false, true, &code);
        EXPECT_TRUE(made) << code;
        if (!made) return nullptr;
        client.setInfoValue(value, std::string(key), made->uid(), made->uuid(), identifier,
                            containerClass, true, &code);
        EXPECT_EQ(code, BTHErrorSuccess);
        return made;
    }

    // The info value `key` as the container's metadata file now holds it.
    std::optional<Value> storedInfo(const BTHMetadataRef& container, const char* key) {
        auto file =
            BTH_dictionaryWithContentsOfURL(container->url() / kBTHMetadataFileName, 0, nullptr);
        const Value* info = file ? file->find(kBTHMetadataInfoKey) : nullptr;
        const Value* value = info ? info->find(key) : nullptr;
        return value ? std::optional<Value>(*value) : std::nullopt;
    }

    const BTHCodeSigningEntry* entry(const std::string& identifier) {
        auto& entries = mapping_->codeSigningMappingDict();
        const auto found = entries.find(identifier);
        return found == entries.end() ? nullptr : found->second.get();
    }

    std::string mappingFileBytes() const {
        return test::readFile(library_ / kBTHCodeSigningMappingFileName);
    }

    stdfs::path library_;
    std::unique_ptr<BTHCodeSigningMapping> mapping_;
    std::optional<BTHGroupManager> groups_;
};

TEST_F(BTHCodeSigningMigrationTest, GroupListsBecomeInvalidEntriesOfTheirDataClass) {
    const Value groups = BTHStringListValue({"group.a", "group.b"});
    auto plugin = containerWithInfo(kBTHLegacyMobileUserId, BTHContainerClassDataSprocketPlugin,
                                    "old.plugin", kBTHLegacyGroupContainerIDsKey, groups);
    // An identifier the store already knows keeps its entry; its list goes.
    ASSERT_EQ(
        mapping_->processCodeSigningInfo(
            dict({{kBTHEntitlementsKey, dict({{"some.right", true}})}}), "known.app", std::nullopt),
        1u);
    const BTHCodeSigningEntry knownBefore = *entry("known.app");
    auto known =
        containerWithInfo(kBTHLegacyMobileUserId, BTHContainerClassDataApplication, "known.app",
                          kBTHLegacyGroupContainerIDsKey, BTHStringListValue({"group.c"}));
    ASSERT_TRUE(plugin && known);

    test::LogCapture log;
    migrate();
    const BTHCodeSigningEntry* made = entry("old.plugin");
    ASSERT_TRUE(made);
    EXPECT_TRUE(made->isInvalid());
    EXPECT_EQ(made->dataContainerClass(), uint64_t{BTHContainerClassDataSprocketPlugin});
    ASSERT_TRUE(made->entitlements());
    EXPECT_EQ(*made->entitlements(), dict({{kBTHApplicationGroupsEntitlement, groups}}));
    EXPECT_EQ(*entry("known.app"), knownBefore);
    EXPECT_FALSE(storedInfo(plugin, kBTHLegacyGroupContainerIDsKey));
    EXPECT_FALSE(storedInfo(known, kBTHLegacyGroupContainerIDsKey));
    EXPECT_TRUE(log.contains(5, "Migrating app group entitlements for old.plugin"));
    EXPECT_TRUE(log.contains(
        5,
        "Deleting app group entitlements for known.app because we already have them in mapping"));
    // The entry is on disk, not only in memory.
    auto reloaded = BTHCodeSigningMapping::create();
    ASSERT_TRUE(reloaded);
    EXPECT_TRUE(reloaded->codeSigningMappingDict().contains("old.plugin"));
    EXPECT_TRUE(BTHMigrationStatus::make()->hasMigrationOccurredForType(kBTHGroupIdMigrationKey));
}

TEST_F(BTHCodeSigningMigrationTest, AFailedMappingWriteKeepsTheOldCopiesAndRunsAgain) {
    auto data =
        containerWithInfo(kBTHLegacyMobileUserId, BTHContainerClassDataApplication, "retry.app",
                          kBTHLegacyGroupContainerIDsKey, BTHStringListValue({"group.r"}));
    ASSERT_TRUE(data);
    ASSERT_TRUE(BTH_writeToURL(dict({{"legacy.app", dict({{"x", true}})}}),
                               library_ / kBTHLegacyEntitlementsFileName, kBTHStateFileWriteOptions,
                               nullptr));
    BTHFaultInjectionArm("mapping.write");
    test::LogCapture log;
    migrate();
    EXPECT_TRUE(log.contains(
        3, "Failed to write code signing mapping to disk following group id migration:"));
    EXPECT_TRUE(log.contains(
        3, "Failed to write code signing mapping to disk following legacy migration:"));
    EXPECT_TRUE(storedInfo(data, kBTHLegacyGroupContainerIDsKey));
    EXPECT_TRUE(stdfs::exists(library_ / kBTHLegacyEntitlementsFileName));
    EXPECT_FALSE(BTHMigrationStatus::make()->hasMigrationOccurredForType(kBTHGroupIdMigrationKey));

    // The next data migration, with the store restarted from its file.
    BTHFaultInjectionArm("");
    mapping_ = BTHCodeSigningMapping::create();
    groups_.emplace(mapping_.get());
    migrate();
    EXPECT_TRUE(entry("retry.app") && entry("legacy.app"));
    EXPECT_FALSE(storedInfo(data, kBTHLegacyGroupContainerIDsKey));
    EXPECT_FALSE(stdfs::exists(library_ / kBTHLegacyEntitlementsFileName));
}

TEST_F(BTHCodeSigningMigrationTest, LegacyFileGivesEntriesWithTheirMarksAndIsRemoved) {
    const Value legacy = dict({
        {"sys.kelp.Berth.ChildPluginBundleIDs",
         dict({{"parent.app", BTHStringListValue({"parent.app.widget"})}})},
        {"sys.kelp.Berth.EntitlementsRegisteredByCaller", dict({{"parent.app", true}})},
        {"sys.kelp.Berth.PlaceholderEntitlements", dict({{"holder.app", Value(uint64_t{1})}})},
        {"parent.app", dict({{"right.one", true}})},
        {"holder.app", dict({{"right.two", true}})},
        {"broken.app", Value("not entitlements")},
    });
    ASSERT_TRUE(BTH_writeToURL(legacy, library_ / kBTHLegacyEntitlementsFileName,
                               kBTHStateFileWriteOptions, nullptr));
    test::LogCapture log;
    migrate();
    const BTHCodeSigningEntry* parent = entry("parent.app");
    ASSERT_TRUE(parent);
    EXPECT_TRUE(parent->isRegisteredByCaller());
    EXPECT_FALSE(parent->isInvalid());
    EXPECT_EQ(parent->childBundleIdentifiers(), Strings{"parent.app.widget"});
    EXPECT_EQ(*parent->entitlements(), dict({{"right.one", true}}));
    const BTHCodeSigningEntry* holder = entry("holder.app");
    ASSERT_TRUE(holder);
    EXPECT_TRUE(holder->isPlaceholder());
    EXPECT_TRUE(holder->isInvalid()) << "no registered-by-caller mark";
    EXPECT_FALSE(entry("broken.app"));
    EXPECT_FALSE(stdfs::exists(library_ / kBTHLegacyEntitlementsFileName));
    EXPECT_TRUE(log.contains(5, "Legacy entitlement migration completed"));
}

TEST_F(BTHCodeSigningMigrationTest, UnreadableLegacyFileStaysAndNothingIsMigrated) {
    test::writeFile(library_ / kBTHLegacyEntitlementsFileName, "this is not a property list");
    test::LogCapture log;
    migrate();
    EXPECT_TRUE(log.contains(3, "but we unexpectedly cant read it"));
    EXPECT_TRUE(stdfs::exists(library_ / kBTHLegacyEntitlementsFileName));
    EXPECT_TRUE(mapping_->codeSigningMappingDict().empty());
}

TEST_F(BTHCodeSigningMigrationTest, CachedBundleInformationTakesTheDataClassOfItsBundleClass) {
    const Value cached = dict({{"Entitlements", dict({{"right.cached", true}})},
                               {"SignerIdentity", Value("Berth Test Signer")}});
    auto vpn = containerWithInfo(kBTHBundleUserId, BTHContainerClassBundleVPNPlugin, "cached.vpn",
                                 kBTHCachedCodeSigningInfoKey, cached);
    auto framework = containerWithInfo(kBTHBundleUserId, BTHContainerClassBundleFramework,
                                       "cached.framework", kBTHCachedCodeSigningInfoKey, cached);
    ASSERT_TRUE(vpn && framework);
    migrate();
    const BTHCodeSigningEntry* vpnEntry = entry("cached.vpn");
    ASSERT_TRUE(vpnEntry);
    EXPECT_EQ(vpnEntry->dataContainerClass(), uint64_t{BTHContainerClassDataVPNPlugin});
    EXPECT_FALSE(vpnEntry->isInvalid());
    EXPECT_EQ(*vpnEntry->entitlements(), dict({{"right.cached", true}}));
    ASSERT_TRUE(vpnEntry->codeSigningInfo());
    EXPECT_TRUE(vpnEntry->codeSigningInfo()->find("SignerIdentity"));
    ASSERT_TRUE(entry("cached.framework"));
    EXPECT_EQ(entry("cached.framework")->dataContainerClass(),
              uint64_t{BTHContainerClassUndefined});
    EXPECT_FALSE(storedInfo(vpn, kBTHCachedCodeSigningInfoKey));
    EXPECT_FALSE(storedInfo(framework, kBTHCachedCodeSigningInfoKey));
    EXPECT_TRUE(
        BTHMigrationStatus::make()->hasMigrationOccurredForType(kBTHCodeSigningMigrationKey));
}

TEST_F(BTHCodeSigningMigrationTest, ASecondRunChangesNothingButReconciles) {
    containerWithInfo(kBTHLegacyMobileUserId, BTHContainerClassDataVPNPlugin, "twice.app",
                      kBTHLegacyGroupContainerIDsKey, BTHStringListValue({"group.t"}));
    containerWithInfo(kBTHBundleUserId, BTHContainerClassBundleApplication, "twice.bundle",
                      kBTHCachedCodeSigningInfoKey,
                      dict({{"Entitlements", dict({{"right", true}})}}));
    migrate();
    const std::string first = mappingFileBytes();
    ASSERT_FALSE(first.empty());
    test::LogCapture log;
    migrate();
    EXPECT_EQ(mappingFileBytes(), first);
    EXPECT_FALSE(log.contains(5, "Performing group ID migration"));
    EXPECT_FALSE(log.contains(5, "Performing code signing migration"));
}

}  // namespace
}  // namespace berth
