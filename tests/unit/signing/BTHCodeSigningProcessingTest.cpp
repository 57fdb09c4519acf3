// Processing code-signing information into entries, what a change implies
// (group changes told before the mapping holds the new entry, a withdrawn
// system container staged once), removal with children, invalidation, the
// queries and the move of information cached in bundle containers.
#include <fcntl.h>

#include "BTHClientConnection.h"
#include "BTHCodeSigningMapping.h"
#include "BTHContainerCache.h"
#include "BTHPropertyListFile.h"
#include "ScratchDeviceRoot.h"
#include "TestSupport.h"
#include "core/BTHContainerClass.h"
#include "platform/UniqueFd.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using test::dict;
using Strings = std::vector<std::string>;
using Groups = std::optional<Strings>;

[[maybe_unused]] const auto& kRoot = test::installScratchDeviceRoot();

Value info(Value entitlements) {
    return dict({{kBTHEntitlementsKey, std::move(entitlements)}});
}
Value groups(const Strings& list) {
    return info(dict({{kBTHApplicationGroupsEntitlement, BTHStringListValue(list)}}));
}

// One call of the group manager's change handling, as processing made it.
struct GroupChange {
    Groups oldIds;
    Groups newIds;
    BTHGroupType type;
    // What the mapping held for the identifier while the manager ran.
    bool mappingStillOld;
};

class BTHCodeSigningProcessingTest : public ::testing::Test {
  protected:
    void SetUp() override {
        BERTH_REQUIRE_ROOT();
        stdfs::remove_all(file_);
        mapping_ = BTHCodeSigningMapping::create();
        ASSERT_TRUE(mapping_);
        BTHCodeSigningHooks hooks;
        hooks.stageForDelete = [this](uid_t user, const Uuid& uuid, const std::string& identifier,
                                      uint64_t containerClass) {
            staged_.push_back(identifier);
            uint64_t code = BTHErrorSuccess;
            BTHClientConnection::sharedClientConnection()->stageForDeleteContainersWithUsers(
                {user}, {uuid}, std::vector<std::optional<std::string>>{identifier},
                {Value(containerClass)}, false, &code);
            return code;
        };
        hooks.groupContainerIdsChanged = [this](Groups oldIds, const Groups& newIds,
                                                BTHGroupType type) {
            changes_.push_back({oldIds, newIds, type,
                                mapping_->appGroupIdentifiersForIdentifier(current_) == oldIds ||
                                    type == BTHGroupTypeSystem});
        };
        mapping_->setHooks(hooks);
    }

    uint64_t process(const std::string& identifier, std::optional<Value> information,
                     std::optional<Value> options = std::nullopt) {
        current_ = identifier;
        return mapping_->processCodeSigningInfo(information, identifier, options);
    }

    const BTHCodeSigningEntry* stored(const std::string& identifier) {
        auto found = mapping_->codeSigningMappingDict().find(identifier);
        return found == mapping_->codeSigningMappingDict().end() ? nullptr : found->second.get();
    }

    // Whether `change` rewrote the file (see the mapping store's tests).
    bool rewrites(const std::function<void()>& change) {
        UniqueFd old(::open(file_.c_str(), O_RDONLY | O_CLOEXEC));
        struct stat before {
        }, after{};
        ::fstat(old.get(), &before);
        change();
        return ::stat(file_.c_str(), &after) == 0 && (!old || after.st_ino != before.st_ino);
    }

    Value fileContents() {
        std::optional<Value> contents = BTH_dictionaryWithContentsOfURL(file_, 0, nullptr);
        return contents.value_or(Value::dictionary());
    }

    const stdfs::path file_ = BTHCodeSigningMapping::mappingFileURL();
    std::unique_ptr<BTHCodeSigningMapping> mapping_;
    std::vector<GroupChange> changes_;
    Strings staged_;
    std::string current_;
};

TEST_F(BTHCodeSigningProcessingTest, TheSameInformationTwiceChangesAndWritesNothing) {
    const Value options = dict({{kBTHDataContainerClassOption, uint64_t{2}}});
    EXPECT_TRUE(rewrites([&] { EXPECT_EQ(process("a.app", groups({"G", "H"}), options), 1u); }));
    ASSERT_EQ(changes_.size(), 1u);
    EXPECT_EQ(changes_[0].oldIds, Groups());
    EXPECT_EQ(changes_[0].newIds, Groups(Strings{"G", "H"}));
    EXPECT_TRUE(changes_[0].mappingStillOld);
    EXPECT_EQ(stored("a.app")->dataContainerClass(), 2u);

    changes_.clear();
    EXPECT_FALSE(rewrites([&] { EXPECT_EQ(process("a.app", groups({"G", "H"}), options), 1u); }));
    EXPECT_TRUE(changes_.empty());

    // Only the caller-registered mark differs: a change, and the group steps
    // run again while the mapping still holds the old entry.
    EXPECT_TRUE(rewrites([&] {
        EXPECT_EQ(process("a.app", groups({"G"}), dict({{kBTHRegByCallerOption, true}})), 1u);
    }));
    ASSERT_EQ(changes_.size(), 1u);
    EXPECT_EQ(changes_[0].oldIds, Groups(Strings{"G", "H"}));
    EXPECT_TRUE(changes_[0].mappingStillOld);
    EXPECT_TRUE(mapping_->identifierHasCallerRegisteredEntitlements("a.app"));
    EXPECT_EQ(mapping_->dataContainerTypeForIdentifier("a.app"), 0u);
}

// The answer is asked for on every request of a signed caller and may be
// remembered, but never past a change of the mapping.
TEST_F(BTHCodeSigningProcessingTest, ACallersOwnEntitlementsNeedProcessingWheneverTheyWouldChange) {
    const Value own = dict({{kBTHApplicationGroupsEntitlement, BTHStringListValue({"G"})}});
    const Value other = dict({{kBTHApplicationGroupsEntitlement, BTHStringListValue({"H"})}});
    auto needNone = [&](const Value& entitlements) {
        return mapping_->callerEntitlementsNeedNoProcessing(entitlements, "c.app");
    };
    EXPECT_FALSE(needNone(own));  // no entry yet
    ASSERT_EQ(mapping_->processCallerRegisteredEntitlements(own, "c.app"), 1u);
    EXPECT_TRUE(needNone(own));
    EXPECT_TRUE(needNone(own));
    EXPECT_FALSE(needNone(other));
    EXPECT_FALSE(mapping_->callerEntitlementsNeedNoProcessing(own, "d.app"));

    ASSERT_EQ(process("c.app", std::nullopt), 1u);  // the entry went
    EXPECT_FALSE(needNone(own));
    ASSERT_EQ(mapping_->processCallerRegisteredEntitlements(own, "c.app"), 1u);
    EXPECT_TRUE(needNone(own));
    ASSERT_EQ(mapping_->processCallerRegisteredEntitlements(other, "c.app"), 1u);
    EXPECT_FALSE(needNone(own));
    EXPECT_TRUE(needNone(other));

    // Information the installer reported stands, whatever the caller has.
    ASSERT_EQ(process("c.app", groups({"I"})), 1u);
    EXPECT_TRUE(needNone(own));
    ASSERT_EQ(process("c.app", std::nullopt), 1u);
    EXPECT_FALSE(needNone(own));
}

TEST_F(BTHCodeSigningProcessingTest, NoInformationRemovesAKnownIdentifierAndIgnoresAnUnknownOne) {
    EXPECT_EQ(process("ghost", std::nullopt), 1u);
    EXPECT_FALSE(stdfs::exists(file_));
    EXPECT_TRUE(changes_.empty());

    ASSERT_EQ(process("a.app", groups({"G"})), 1u);
    changes_.clear();
    EXPECT_TRUE(rewrites([&] { EXPECT_EQ(process("a.app", std::nullopt), 1u); }));
    EXPECT_FALSE(stored("a.app"));
    EXPECT_FALSE(fileContents().find("a.app"));
    ASSERT_EQ(changes_.size(), 1u);
    EXPECT_EQ(changes_[0].oldIds, Groups(Strings{"G"}));
    EXPECT_EQ(changes_[0].newIds, Groups());
}

TEST_F(BTHCodeSigningProcessingTest, ChildrenAreLinkedToTheirParentAndRemovedWithIt) {
    // A parent without entry stays unknown.
    ASSERT_EQ(process("orphan.ext", info(Value::dictionary()),
                      dict({{kBTHParentBundleIDOption, "no.parent"}})),
              1u);
    EXPECT_TRUE(stored("orphan.ext"));
    EXPECT_FALSE(stored("no.parent"));

    ASSERT_EQ(process("p.app", groups({"P"})), 1u);
    for (const char* child : {"p.app.one", "p.app.two"})
        ASSERT_EQ(process(child, groups({child}), dict({{kBTHParentBundleIDOption, "p.app"}})), 1u);
    EXPECT_EQ(stored("p.app")->childBundleIdentifiers(), Groups(Strings{"p.app.one", "p.app.two"}));
    // The file holds the link too, written with the child.
    EXPECT_EQ(fileContents().find("p.app")->find("ChildBundleIds")->size(), 2u);
    // Its own parent is refused as a parent.
    ASSERT_EQ(process("p.app", groups({"P"}), dict({{kBTHParentBundleIDOption, "p.app"}})), 1u);
    EXPECT_EQ(stored("p.app")->childBundleIdentifiers()->size(), 2u);

    // A child whose entry has gone leaves the list at the parent's next
    // processing.
    ASSERT_EQ(process("p.app.one", std::nullopt), 1u);
    ASSERT_EQ(process("p.app", groups({"P", "Q"})), 1u);
    EXPECT_EQ(stored("p.app")->childBundleIdentifiers(), Groups(Strings{"p.app.two"}));

    changes_.clear();
    mapping_->removeCodeSigningDictionariesForIdentifierAndItsChildren("p.app");
    EXPECT_FALSE(stored("p.app"));
    EXPECT_FALSE(stored("p.app.two"));
    EXPECT_EQ(fileContents().size(), 1u);  // orphan.ext
    ASSERT_EQ(changes_.size(), 2u);
    EXPECT_EQ(changes_[0].oldIds, Groups(Strings{"p.app.two"}));
    EXPECT_EQ(changes_[1].oldIds, Groups(Strings{"P", "Q"}));
}

TEST_F(BTHCodeSigningProcessingTest, GroupEntitlementsOfEveryShapeAreReadOrIgnoredWithALogLine) {
    Value many = Value::array();
    for (int i = 0; i < 10000; ++i) many.push("group." + std::to_string(i));
    const struct {
        const char* name;
        Value value;
        Groups expected;
        const char* log;  // null: nothing logged
    } cases[] = {
        {"list", BTHStringListValue({"B", "A", "B"}), Strings{"B", "A"}, nullptr},
        {"single string", "G", Strings{"G"}, nullptr},
        {"number", 7, std::nullopt, "does not contain supported types; ignoring."},
        {"dictionary", dict({{"G", true}}), std::nullopt, "does not contain supported types"},
        {"mixed list", Value(Value::Array{"G", 1}), std::nullopt, "contains non-string values"},
        {"ten thousand", many, std::nullopt, "lists 10000 groups, more than 1000; ignoring."},
        {"paths", BTHStringListValue({"ok", "../up", "a/b", "..", ".", ""}), Strings{"ok"},
         "names the unusable group identifier ../up; ignoring it."},
    };
    for (const auto& c : cases) {
        test::LogCapture log;
        ASSERT_EQ(process("shape.app", info(dict({{kBTHApplicationGroupsEntitlement, c.value}}))),
                  1u);
        EXPECT_EQ(mapping_->appGroupIdentifiersForIdentifier("shape.app"), c.expected) << c.name;
        if (c.log) {
            EXPECT_TRUE(log.contains(3, c.log)) << c.name;
        } else {
            EXPECT_EQ(log.count(3, "Entitlement"), 0u) << c.name;
        }
    }
    // Code-signing information or options of the wrong kind are refused.
    EXPECT_EQ(process("shape.app", Value("not a dictionary")), BTHErrorInvalidArgument);
    EXPECT_EQ(process("shape.app", info(Value()), Value(Value::Array{})), BTHErrorInvalidArgument);
    EXPECT_EQ(mapping_->processCodeSigningInfo(info(Value()), std::nullopt, std::nullopt),
              BTHErrorIdentifierMissing);
    // Entitlements that are not a dictionary grant nothing.
    ASSERT_EQ(process("shape.app", info("entitlements as a string")), 1u);
    EXPECT_FALSE(mapping_->appGroupIdentifiersForIdentifier("shape.app"));
}

TEST_F(BTHCodeSigningProcessingTest, SystemGroupsFallBackAndKeepOnlyPrefixedIdentifiers) {
    ASSERT_EQ(process("sys.one", info(dict({{kBTHSystemGroupsEntitlement, Value::array()},
                                            {kBTHSystemGroupContainersEntitlement,
                                             BTHStringListValue({"systemgroup.x", "plain.y"})}}))),
              1u);
    // No application groups before or after: the manager hears only of the
    // system groups, unfiltered...
    ASSERT_EQ(changes_.size(), 1u);
    EXPECT_EQ(changes_[0].type, BTHGroupTypeSystem);
    EXPECT_EQ(changes_[0].newIds, Groups(Strings{"systemgroup.x", "plain.y"}));
    // ... while the query drops the one without prefix, with one line.
    test::LogCapture log;
    EXPECT_EQ(mapping_->systemGroupIdentifiersForIdentifier("sys.one"),
              Groups(Strings{"systemgroup.x"}));
    EXPECT_EQ(log.count(3, "System group ID plain.y does not have proper prefix, ignoring."), 1u);
    // The iteration counts what the entitlements say, fallback included.
    std::map<std::string, Groups> seen;
    mapping_->iterateGroupIdsWithKey(
        kBTHSystemGroupsEntitlement, kBTHSystemGroupContainersEntitlement,
        [&](const std::string& id, const Groups& list) { seen[id] = list; });
    EXPECT_EQ(seen["sys.one"], Groups(Strings{"systemgroup.x", "plain.y"}));
}

TEST_F(BTHCodeSigningProcessingTest, ClientQueriesHidePlaceholderAndInvalidEntries) {
    ASSERT_EQ(process("placeholder.app", groups({"G"}), dict({{kBTHPlaceholderOption, true}})), 1u);
    ASSERT_EQ(process("valid.app", groups({"G"})), 1u);
    ASSERT_TRUE(
        mapping_->invalidateCodeSigningInfoForIdentifierAndItsChildren("valid.app", nullptr));
    for (const char* id : {"placeholder.app", "valid.app"}) {
        EXPECT_FALSE(mapping_->getCodeSigningInfoForIdentifier(id)) << id;
        EXPECT_TRUE(mapping_->codeSigningInfoExistForIdentifier(id)) << id;
        EXPECT_EQ(mapping_->appGroupIdentifiersForIdentifier(id), Groups(Strings{"G"})) << id;
    }
    // Reported again, the entry is valid again.
    ASSERT_EQ(process("valid.app", groups({"G"})), 1u);
    EXPECT_EQ(mapping_->getCodeSigningInfoForIdentifier("valid.app"), groups({"G"}));
    EXPECT_FALSE(mapping_->codeSigningInfoExistForIdentifier("never.seen"));
}

class BTHCodeSigningContainersTest : public BTHCodeSigningProcessingTest {
  protected:
    BTHMetadataRef container(uid_t user, uint64_t containerClass, const std::string& identifier) {
        uint64_t code = 0;
        auto made = BTHClientConnection::sharedClientConnection()->createOrLookupContainerForUser(
            user, identifier, true, containerClass, false, true, &code);
        EXPECT_TRUE(made) << code;
        return made;
    }
};

TEST_F(BTHCodeSigningContainersTest, AWithdrawnSystemContainerIsStagedOnceAndAGrantCreatesNothing) {
    const Value granted = info(dict({{kBTHSystemContainerEntitlement, true}}));
    ASSERT_EQ(process("sys.service", granted), 1u);
    EXPECT_TRUE(staged_.empty());
    EXPECT_FALSE(BTHContainerCache::sharedInstance().containerForUser(
        kBTHSystemUserId, BTHContainerClassDataSystem, "sys.service", false, nullptr));
    const BTHMetadataRef system =
        container(kBTHSystemUserId, BTHContainerClassDataSystem, "sys.service");
    ASSERT_TRUE(system);

    test::LogCapture log;
    ASSERT_EQ(process("sys.service", info(dict({{kBTHSystemContainerEntitlement, false}}))), 1u);
    EXPECT_EQ(staged_, Strings{"sys.service"});
    EXPECT_FALSE(stdfs::exists(system->url()));
    EXPECT_TRUE(log.contains(3,
                             "Deleting system container for ID: sys.service because it is no "
                             "longer in the entitlements"));
    // Withdrawn already: nothing more to stage.
    ASSERT_EQ(process("sys.service", std::nullopt), 1u);
    EXPECT_EQ(staged_.size(), 1u);
}

TEST_F(BTHCodeSigningContainersTest, CachedInformationOfABundleMovesIntoTheMappingOnFirstQuery) {
    const BTHMetadataRef bundle =
        container(kBTHBundleUserId, BTHContainerClassBundleApplication, "cached.app");
    ASSERT_TRUE(bundle);
    const Value cached = dict({{"Entitlements", dict({{kBTHApplicationGroupsEntitlement, "C"}})},
                               {"TeamIdentifier", "T"}});
    uint64_t code = BTHErrorSuccess;
    BTHClientConnection::sharedClientConnection()->setInfoValue(
        cached, std::string(kBTHCachedCodeSigningInfoKey), kBTHBundleUserId, bundle->uuid(),
        std::string("cached.app"), BTHContainerClassBundleApplication, true, &code);
    ASSERT_EQ(code, 1u);

    test::LogCapture log;
    EXPECT_EQ(mapping_->appGroupIdentifiersForIdentifier("cached.app"), Groups(Strings{"C"}));
    EXPECT_TRUE(log.contains(
        5, "Migrating code signing info from bundle container upon request for cached.app"));
    const Value contents = fileContents();
    const Value* entry = contents.find("cached.app");
    ASSERT_TRUE(entry);
    EXPECT_EQ(entry->find("DataContainerClass")->uint64Value(), 2u);
    EXPECT_EQ(*entry->find("CodeSigningInfo")->find("TeamIdentifier"), Value("T"));
    EXPECT_EQ(log.count(5, "Migrating code signing info"), 1u);

    // An identifier that has neither entry nor bundle is invalidated by
    // nothing; one whose bundle went is.
    ASSERT_EQ(process("gone.app", groups({"G"})), 1u);
    auto byCaller = groups({"R"});
    ASSERT_EQ(process("caller.app", byCaller, dict({{kBTHRegByCallerOption, true}})), 1u);
    EXPECT_EQ(mapping_->invalidateCodeSigningInfoForAppsWithoutBundleContainer(), 1u);
    EXPECT_TRUE(stored("gone.app")->isInvalid());
    EXPECT_FALSE(stored("cached.app")->isInvalid());
    EXPECT_FALSE(stored("caller.app")->isInvalid());
    EXPECT_TRUE(fileContents().find("gone.app")->find("Invalid")->boolValue());
}

}  // namespace
}  // namespace berth
