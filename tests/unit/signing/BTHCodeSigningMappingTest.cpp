#include "BTHCodeSigningMapping.h"

#include <fcntl.h>

#include "BTHPropertyListFile.h"
#include "ScratchDeviceRoot.h"
#include "TestSupport.h"
#include "platform/UniqueFd.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;

[[maybe_unused]] const auto& kRoot = test::installScratchDeviceRoot();

// Code-signing information whose entitlements hold `key` = `value` (nothing
// for a null value).
Value info(const char* key = nullptr, Value value = nullptr) {
    Value entitlements = Value::dictionary();
    if (key && !value.isNull()) entitlements.set(key, std::move(value));
    return test::dict(
        {{kBTHEntitlementsKey, std::move(entitlements)}, {"SigningIdentifier", "opaque and kept"}});
}

BTHCodeSigningEntryRef entry(std::optional<Value> codeSigningInfo, uint64_t dataClass = 2) {
    return std::make_shared<BTHCodeSigningEntry>(std::move(codeSigningInfo), dataClass);
}

using Children = std::optional<std::vector<std::string>>;

TEST(BTHCodeSigningEntryTest, StoredFormRoundTripsAndKeepsAbsentChildrenApartFromEmpty) {
    BTHCodeSigningEntry absent(info(), 4), empty = absent, listed = absent, blank;
    empty.setChildBundleIdentifiers(std::vector<std::string>{});
    listed.setChildBundleIdentifiers(std::vector<std::string>{"b.child", "a.child"});
    listed.setInvalid(true);
    for (const BTHCodeSigningEntry* e : {&absent, &empty, &listed, &blank}) {
        const Value stored = e->serialize();
        EXPECT_EQ(stored.find("ChildBundleIds") != nullptr,
                  e->childBundleIdentifiers() != Children());
        EXPECT_EQ(stored.find("CodeSigningInfo") != nullptr, e->codeSigningInfo().has_value());
        EXPECT_TRUE(stored.find("Placeholder") && stored.find("Placeholder")->isBool());
        EXPECT_TRUE(stored.find("DataContainerClass"));
        EXPECT_EQ(BTHCodeSigningEntry::fromSerializedDictionary(stored), *e) << e->description();
    }
    EXPECT_FALSE(BTHCodeSigningEntry::fromSerializedDictionary(absent.serialize()) ==
                 BTHCodeSigningEntry::fromSerializedDictionary(empty.serialize()));
}

TEST(BTHCodeSigningEntryTest, FlagsReadAsTruthValuesAndMissingKeysAsFalseOrZero) {
    const std::pair<Value, bool> cases[] = {
        {true, true},        {false, false},
        {int64_t{1}, true},  {uint64_t{7}, true},
        {int64_t{0}, false}, {0.5, true},
        {0.0, false},        {"YES", false},
        {"1", false},        {Value::dictionary(), false},
        {nullptr, false},
    };
    for (const auto& [value, expected] : cases) {
        Value stored = Value::dictionary();
        for (const char* key : {"Invalid", "Placeholder", "RegisteredByCaller"})
            if (!value.isNull()) stored.set(key, value);
        const auto e = BTHCodeSigningEntry::fromSerializedDictionary(stored);
        EXPECT_EQ(e.isInvalid(), expected) << value.description();
        EXPECT_EQ(e.isPlaceholder(), expected) << value.description();
        EXPECT_EQ(e.isRegisteredByCaller(), expected) << value.description();
        EXPECT_EQ(e.dataContainerClass(), 0u);
    }
    Value stored = Value::dictionary();
    stored.set("DataContainerClass", int64_t{13});
    stored.set("CodeSigningInfo", "not a dictionary");
    const auto e = BTHCodeSigningEntry::fromSerializedDictionary(stored);
    EXPECT_EQ(e.dataContainerClass(), 13u);
    EXPECT_FALSE(e.codeSigningInfo());
}

TEST(BTHCodeSigningEntryTest, EqualityAndDescriptionCoverEveryField) {
    // Read back with the other integer kind, the same information is equal.
    const BTHCodeSigningEntry base(info("k", uint64_t{5}), 2), reread(info("k", int64_t{5}), 2);
    EXPECT_EQ(base, reread);
    EXPECT_EQ(base.hash(), reread.hash());
    const std::function<void(BTHCodeSigningEntry&)> changes[] = {
        [](auto& e) { e.setCodeSigningInfo(std::nullopt); },
        [](auto& e) { e.setCodeSigningInfo(info("k", 6)); },
        [](auto& e) { e.setChildBundleIdentifiers(std::vector<std::string>{}); },
        [](auto& e) { e.setInvalid(true); },
        [](auto& e) { e.setPlaceholder(true); },
        [](auto& e) { e.setRegisteredByCaller(true); },
        [](auto& e) { e.setDataContainerClass(4); },
    };
    for (size_t i = 0; i < std::size(changes); ++i) {
        BTHCodeSigningEntry changed = base;
        changes[i](changed);
        EXPECT_FALSE(changed == base) << "change " << i;
    }

    BTHCodeSigningEntry children;
    children.setChildBundleIdentifiers(std::vector<std::string>{"child"});
    children.setPlaceholder(true);
    children.setDataContainerClass(2);
    EXPECT_EQ(children.description(),
              "<BTHCodeSigningEntry invalid: N, placeholder: Y, regByCaller: N, dataClass: 2, "
              "childBundles: (\n    child\n), CSinfo: (null)>");
}

class BTHCodeSigningMappingTest : public ::testing::Test {
  protected:
    void SetUp() override {
        BERTH_REQUIRE_ROOT();
        stdfs::remove_all(file_);
        mapping_ = BTHCodeSigningMapping::create();
        ASSERT_TRUE(mapping_);
    }

    BTHErrorRef set(std::vector<BTHCodeSigningEntryRef> values,
                    std::vector<std::string> identifiers) {
        return mapping_->setCodeSigningDictionaryValues(values, identifiers);
    }

    // Whether `change` rewrote the file. An atomic write renames a new file
    // into place; the old one stays open here, so its inode cannot be reused
    // and an unchanged inode means no write.
    bool rewrites(const std::function<void()>& change) {
        UniqueFd old(::open(file_.c_str(), O_RDONLY | O_CLOEXEC));
        struct stat before {
        }, after{};
        ::fstat(old.get(), &before);
        change();
        return ::stat(file_.c_str(), &after) == 0 && after.st_ino != before.st_ino;
    }

    Value fileContents() {
        BTHErrorRef error;
        std::optional<Value> stored = BTH_dictionaryWithContentsOfURL(file_, 0, &error);
        EXPECT_TRUE(stored) << error;
        return stored.value_or(Value());
    }

    const stdfs::path file_ = BTHCodeSigningMapping::mappingFileURL();
    std::unique_ptr<BTHCodeSigningMapping> mapping_;
};

TEST_F(BTHCodeSigningMappingTest, NoFileStartsEmptyAndTheFirstChangeWritesExactlyTheEntries) {
    test::LogCapture log;
    mapping_ = BTHCodeSigningMapping::create();
    ASSERT_TRUE(mapping_);
    EXPECT_TRUE(mapping_->codeSigningMappingDict().empty());
    EXPECT_TRUE(log.contains(5, "No code signing info file found.  We will create one now"));
    // Removing what is not there changes nothing and creates nothing.
    EXPECT_FALSE(set({entry(std::nullopt)}, {"ghost"}));
    EXPECT_FALSE(stdfs::exists(file_));

    auto parent = entry(info());
    parent->setChildBundleIdentifiers(std::vector<std::string>{});
    auto child = entry(info("x", 1), 4);
    ASSERT_FALSE(set({parent, child}, {"p.app", "p.app.ext"}));
    EXPECT_TRUE(log.contains(7,
                             "Staging Code Signing Mapping for ID: p.app.ext : "
                             "<BTHCodeSigningEntry invalid: N"));
    Value expected = Value::dictionary();
    expected.set("p.app", parent->serialize());
    expected.set("p.app.ext", child->serialize());
    EXPECT_EQ(fileContents(), expected);
    EXPECT_EQ(test::readFile(file_).substr(0, 8), "bplist00");

    auto reloaded = BTHCodeSigningMapping::create();
    ASSERT_TRUE(reloaded);
    ASSERT_EQ(reloaded->codeSigningMappingDict().size(), 2u);
    EXPECT_EQ(*reloaded->codeSigningMappingDict().at("p.app"), *parent);
    EXPECT_EQ(*reloaded->codeSigningMappingDict().at("p.app.ext"), *child);
}

// Information holding a date the file keeps only to within its precision
// (seconds since 2001) is kept in memory as the file holds it, so the next
// start finds the same entry and the same information changes nothing.
TEST_F(BTHCodeSigningMappingTest, ProcessedInformationIsKeptAsTheFileHoldsIt) {
    const Value reported = info("sys.kelp.test.date", Value(Value::Date{1e-300}));
    ASSERT_EQ(mapping_->processCodeSigningInfo(reported, std::string("d.app"), std::nullopt),
              BTHErrorSuccess);
    auto reloaded = BTHCodeSigningMapping::create();
    ASSERT_TRUE(reloaded);
    EXPECT_EQ(*reloaded->codeSigningMappingDict().at("d.app"),
              *mapping_->codeSigningMappingDict().at("d.app"));
    EXPECT_FALSE(rewrites([&] {
        EXPECT_EQ(mapping_->processCodeSigningInfo(reported, std::string("d.app"), std::nullopt),
                  BTHErrorSuccess);
    }));
}

TEST_F(BTHCodeSigningMappingTest, OnlyRealChangesWriteAndABatchWritesOnce) {
    ASSERT_FALSE(set({entry(info("k", "v")), entry(info())}, {"a.app", "b.app"}));
    // Equal values (other objects), a removal of an unknown identifier, and
    // arrays of different lengths write nothing.
    EXPECT_FALSE(rewrites([&] {
        EXPECT_FALSE(set({entry(info("k", "v")), nullptr}, {"a.app", "unknown"}));
        BTHErrorRef error = set({entry(std::nullopt), entry(info())}, {"a.app"});
        ASSERT_TRUE(error && error->isBTHError(BTHErrorMappingInvalidInput));
        EXPECT_EQ(error->localizedDescription(),
                  "Can't act on an invalid input: values count: 2, IDs count: 1");
    }));
    EXPECT_EQ(mapping_->codeSigningMappingDict().size(), 2u);

    test::LogCapture log;
    EXPECT_TRUE(rewrites([&] {
        EXPECT_FALSE(set({entry(info("k", "v")), entry(info(), 9)}, {"a.app", "b.app"}));
    }));
    EXPECT_EQ(log.count(7, "Staging Code Signing Mapping for ID:"), 1u);
    EXPECT_EQ(log.count(7, "Wrote code signing mappings to disk after set"), 1u);
    EXPECT_EQ(fileContents().find("b.app")->find("DataContainerClass")->uint64Value(), 9u);

    // A value without code-signing information removes the identifier.
    EXPECT_TRUE(rewrites([&] { EXPECT_FALSE(set({entry(std::nullopt)}, {"a.app"})); }));
    EXPECT_FALSE(mapping_->codeSigningMappingDict().count("a.app"));
    EXPECT_FALSE(fileContents().find("a.app"));
}

TEST_F(BTHCodeSigningMappingTest, AFailedWriteReportsAndKeepsTheChangeInMemory) {
    ASSERT_TRUE(stdfs::create_directory(file_));  // the new file cannot be renamed over it
    test::LogCapture log;
    BTHErrorRef error = set({entry(info())}, {"a.app"});
    ASSERT_TRUE(error && error->isBTHError(BTHErrorMappingWriteFailed));
    EXPECT_TRUE(error->underlyingError());
    EXPECT_TRUE(log.contains(3, "Failed to write entitlement mapping file at " + file_.string()));
    EXPECT_TRUE(log.contains(3, "Error writing code signing mappings to disk after set : "));
    EXPECT_TRUE(mapping_->codeSigningMappingDict().count("a.app"));
}

TEST_F(BTHCodeSigningMappingTest, AnUnreadableFileLeavesNoStoreAndTheFileAsItIs) {
    for (const std::string contents : {"not a property list", "<plist><array/></plist>"}) {
        test::writeFile(file_, contents);
        test::LogCapture log;
        EXPECT_FALSE(BTHCodeSigningMapping::create()) << contents;
        EXPECT_TRUE(log.contains(
            3, "Failed to read code signing mapping file at " + file_.string() + " : "));
        EXPECT_TRUE(log.contains(3, "Unable to read mapping file from disk.  This is bad"));
        EXPECT_EQ(test::readFile(file_), contents);
    }
}

TEST_F(BTHCodeSigningMappingTest, QueriesAnswerFromTheStoredEntry) {
    const struct {
        const char* identifier;
        Value systemContainer;  // null: no such entitlement
        bool expected;
    } cases[] = {
        {"granted", true, true},   {"granted.number", 1, true}, {"refused", false, false},
        {"string", "true", false}, {"absent", nullptr, false},
    };
    for (const auto& c : cases)
        ASSERT_FALSE(set({entry(info(kBTHSystemContainerEntitlement, c.systemContainer), 10)},
                         {c.identifier}));
    auto byCaller = entry(info(), 0);
    byCaller->setRegisteredByCaller(true);
    ASSERT_FALSE(set({byCaller}, {"caller"}));

    for (const auto& c : cases) {
        EXPECT_EQ(mapping_->identifierHasSystemContainer(c.identifier), c.expected) << c.identifier;
        EXPECT_EQ(mapping_->dataContainerTypeForIdentifier(c.identifier), 10u);
        EXPECT_FALSE(mapping_->identifierHasCallerRegisteredEntitlements(c.identifier));
    }
    EXPECT_FALSE(mapping_->identifierHasSystemContainer("unknown"));
    EXPECT_EQ(mapping_->dataContainerTypeForIdentifier("unknown"), 0u);
    EXPECT_TRUE(mapping_->identifierHasCallerRegisteredEntitlements("caller"));
    // Asked from work already on the queue, a query runs there rather than
    // wait on itself.
    EXPECT_TRUE(mapping_->codeSignQueue()->sync(
        [&] { return mapping_->identifierHasSystemContainer("granted"); }));
}

}  // namespace
}  // namespace berth
