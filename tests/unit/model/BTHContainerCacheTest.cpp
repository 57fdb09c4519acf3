#include "BTHContainerCache.h"

#include <cctype>
#include <functional>

#include "BTHFileManager.h"
#include "BTHGlobalConfiguration.h"
#include "ScratchDeviceRoot.h"
#include "TestSupport.h"
#include "core/BTHContainerClass.h"

namespace berth {
namespace {

namespace fs = std::filesystem;
using test::LogCapture;
using Strings = std::vector<std::string>;

const bool kRootInstalled = !test::installScratchDeviceRoot().empty();

constexpr uid_t kMobile = 501;
constexpr uint64_t kData = BTHContainerClassDataApplication;       // "Data/Application"
constexpr uint64_t kPlugin = BTHContainerClassDataSprocketPlugin;  // "Data/SprocketPlugin"
constexpr uint64_t kVPN = BTHContainerClassDataVPNPlugin;          // "Data/VPNPlugin"

BTHContainerCache& cache() {
    return BTHContainerCache::sharedInstance();
}

fs::path classDirectory(uid_t user, uint64_t containerClass, bool transient = false) {
    return *BTHGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(
        user, containerClass, transient);
}

// A container of user 501 made on disk behind the cache's back.
BTHMetadataRef makeContainer(uint64_t containerClass, const std::string& identifier,
                             bool transient = false) {
    const fs::path url =
        classDirectory(kMobile, containerClass, transient) / Uuid::random().string();
    fs::create_directory(url);
    auto record = std::make_shared<BTHMetadata>(kMobile, Uuid::random(), containerClass, identifier,
                                                std::nullopt, url, std::nullopt);
    EXPECT_TRUE(record->writeMetadataToDisk(nullptr));
    return record;
}

BTHMetadataRef find(uint64_t containerClass, const std::string& identifier, bool transient = false,
                    BTHErrorRef* error = nullptr) {
    return cache().containerForUser(kMobile, containerClass, identifier, transient, error);
}

Strings identifiersOf(uint64_t containerClass, bool transient = false) {
    return cache()
        .allContainerIdentifiersForUser(kMobile, containerClass, transient, nullptr)
        .value_or(Strings{"(failed)"});
}

void expectError(const BTHErrorRef& error, int32_t code, const std::string& message) {
    ASSERT_NE(error, nullptr) << message;
    EXPECT_TRUE(error->isBTHError(code)) << error->description();
    EXPECT_EQ(error->localizedDescription(), message);
}

// Lines of `level` whose message is exactly `message`.
size_t countLines(const LogCapture& log, int level, const std::string& message) {
    const auto lines = log.lines();
    return std::count_if(lines.begin(), lines.end(), [&](const LogCapture::Line& line) {
        return line.level == level && line.message == message;
    });
}

size_t rebuilds(const LogCapture& log, const std::string& mapName) {
    return countLines(log, BTHLogLevelDebug, "Rebuilding container class cache: " + mapName);
}

// The errors of the five operations that need the class map, in the order
// look-up, listing, identifiers, addition, removal.
std::vector<BTHErrorRef> errorsOfEveryOperation(uid_t user, uint64_t containerClass,
                                                bool transient) {
    auto record = std::make_shared<BTHMetadata>(user, Uuid::random(), containerClass, "com.new",
                                                std::nullopt, "/c", std::nullopt);
    std::vector<BTHErrorRef> errors(5);
    EXPECT_FALSE(cache().containerForUser(user, containerClass, "x", transient, &errors[0]));
    EXPECT_FALSE(cache().allContainersForUser(user, containerClass, transient, &errors[1]));
    EXPECT_FALSE(
        cache().allContainerIdentifiersForUser(user, containerClass, transient, &errors[2]));
    EXPECT_FALSE(cache().addContainerMetadata(record, user, "/c", transient, &errors[3]));
    EXPECT_FALSE(cache().removeContainerForUser(user, containerClass, "x", transient, &errors[4]));
    return errors;
}

class BTHContainerCacheTest : public ::testing::Test {
  protected:
    void SetUp() override {
        BERTH_REQUIRE_ROOT();
        ASSERT_TRUE(kRootInstalled);
        cache().resetForTesting();
        for (uint64_t containerClass : {kData, kPlugin, kVPN})
            for (bool transient : {false, true})
                fs::remove_all(classDirectory(kMobile, containerClass, transient));
    }
};

TEST_F(BTHContainerCacheTest, FirstLookUpBuildsTheMapAndLaterLookUpsNeverListAgain) {
    BTHMetadataRef a = makeContainer(kData, "com.a");
    LogCapture log;
    BTHMetadataRef found = find(kData, "com.a");
    ASSERT_NE(found, nullptr);
    EXPECT_EQ(*found, *a);
    EXPECT_EQ(countLines(log, BTHLogLevelDebug, "Cache: Data/Application: Found Identifier: com.a"),
              1u);

    // Made behind the cache's back: not seen, and the miss is not logged.
    makeContainer(kData, "com.b");
    BTHErrorRef error;
    EXPECT_EQ(find(kData, "com.b", false, &error), nullptr);
    expectError(error, BTHErrorNotFound,
                "Cache: Data/Application: Container Not Found with ID: com.b");
    EXPECT_EQ(find(kData, "com.a"), found);
    EXPECT_EQ(rebuilds(log, "501-Data/Application"), 1u);
    // The transient map is separate.
    EXPECT_EQ(find(kData, "com.a", true, &error), nullptr);
    expectError(error, BTHErrorNotFound,
                "Cache: Data/Application(transient): Container Not Found with ID: com.a");
    EXPECT_EQ(rebuilds(log, "501-Data/Application(transient)"), 1u);
    EXPECT_FALSE(log.contains(BTHLogLevelError, "Not Found"));

    cache().resetForTesting();
    EXPECT_NE(find(kData, "com.b"), nullptr);
    EXPECT_EQ(rebuilds(log, "501-Data/Application"), 2u);
}

TEST_F(BTHContainerCacheTest, BadClassesAndUsersFailWith47BeforeTouchingTheDisk) {
    struct Row {
        uid_t user;
        uint64_t containerClass;
        std::string message;
        std::string addMessage;  // when the addition words it differently
    };
    const Row rows[] = {
        {501, 1, "Invalid cache get-userId 501 for class 1", ""},
        {499, 3, "Invalid cache get-userId 499 for class 3", ""},
        {33, 13, "Invalid cache get-userId 33 for class 13", ""},
        {501, 0, "Invalid Content Class: 0", "Invalid Metadata Content Class: 0"},
        {501, 14, "Invalid Content Class: 14", "Invalid Metadata Content Class: 14"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.message);
        std::optional<fs::path> directory;
        if (BTHContainerClassIsGlobal(row.containerClass)) {
            directory = classDirectory(0, row.containerClass);
            fs::remove_all(*directory);
        }
        LogCapture log;
        const auto errors = errorsOfEveryOperation(row.user, row.containerClass, false);
        for (size_t i = 0; i < errors.size(); ++i)
            expectError(errors[i], BTHErrorCacheInvalidInput,
                        i == 3 && !row.addMessage.empty() ? row.addMessage : row.message);
        EXPECT_EQ(log.lines().size(), 5u);  // each logged once, nothing else
        if (directory) {
            EXPECT_FALSE(fs::exists(fs::symlink_status(*directory)));
        }
    }

    auto record = std::make_shared<BTHMetadata>(kMobile, Uuid::random(), kData, "com.a",
                                                std::nullopt, "/", std::nullopt);
    BTHErrorRef error;
    EXPECT_FALSE(cache().addContainerMetadata(record, kMobile, "relative/dir", false, &error));
    expectError(error, BTHErrorCacheInvalidInput, "Invalid input: URL: relative/dir");
    EXPECT_FALSE(cache().addContainerMetadata(nullptr, kMobile, "/c", false, &error));
    expectError(error, BTHErrorCacheInvalidInput, "Invalid metadata Identifier: (null)");
    EXPECT_EQ(record->url(), "/");
}

TEST_F(BTHContainerCacheTest, AFoundEntryGives44OnceItsPathNoLongerLeadsToItsFileWithoutLinks) {
    BTHMetadataRef a = makeContainer(kData, "com.a");
    const fs::path url = a->url();
    const fs::path moved = url.parent_path() / "moved-away";
    const fs::path classDir = classDirectory(kMobile, kData);
    const fs::path movedClass = classDir.parent_path() / "moved-class";
    // Each change after the entry was found twice (so the second answer came
    // from what was remembered of the first), then put back.
    const std::vector<std::pair<const char*, std::function<void(bool undo)>>> changes = {
        {"container directory renamed away",
         [&](bool undo) { undo ? fs::rename(moved, url) : fs::rename(url, moved); }},
        {"class directory replaced by a link to it",
         [&](bool undo) {
             if (undo) {
                 fs::remove(classDir);
                 fs::rename(movedClass, classDir);
             } else {
                 fs::rename(classDir, movedClass);
                 fs::create_directory_symlink(movedClass, classDir);
             }
         }},
    };
    for (const auto& [what, change] : changes) {
        ASSERT_NE(find(kData, "com.a"), nullptr) << what;
        ASSERT_NE(find(kData, "com.a"), nullptr) << what;
        change(false);
        BTHErrorRef error;
        EXPECT_EQ(find(kData, "com.a", false, &error), nullptr) << what;
        ASSERT_NE(error, nullptr) << what;
        EXPECT_TRUE(error->isBTHError(BTHErrorCacheInconsistent)) << error->description();
        change(true);
        EXPECT_NE(find(kData, "com.a"), nullptr) << what;
    }
}

TEST_F(BTHContainerCacheTest, MissingMetadataFileGives44OnLookUpAndIsLeftOutOfTheListing) {
    BTHMetadataRef a = makeContainer(kData, "com.a");
    makeContainer(kData, "com.b");
    ASSERT_NE(find(kData, "com.a"), nullptr);
    const fs::path metadataFile = BTHMetadata::metadataFileURL(a->url());
    ASSERT_TRUE(fs::remove(metadataFile));

    LogCapture log;
    const std::string message =
        "Cache: Data/Application: INCONSISTENT-No Metadata at: " + metadataFile.string();
    BTHErrorRef error;
    EXPECT_EQ(find(kData, "com.a", false, &error), nullptr);
    expectError(error, BTHErrorCacheInconsistent, message);
    error.reset();
    auto all = cache().allContainersForUser(kMobile, kData, false, &error);
    ASSERT_TRUE(all.has_value());
    EXPECT_EQ(error, nullptr);
    ASSERT_EQ(all->size(), 1u);
    EXPECT_EQ((*all)[0]->identifier(), "com.b");
    EXPECT_EQ(log.count(BTHLogLevelError, message), 2u);

    // The entry stays: once its file is back it is found without a rebuild.
    EXPECT_EQ(identifiersOf(kData), (Strings{"com.a", "com.b"}));
    ASSERT_TRUE(a->writeMetadataToDisk(nullptr));
    EXPECT_NE(find(kData, "com.a"), nullptr);
    EXPECT_EQ(log.count(BTHLogLevelDebug, "Rebuilding"), 0u);
}

TEST_F(BTHContainerCacheTest, BuildHoldsOneEntryPerIdentifierAndSkipsWhatDoesNotValidate) {
    BTHMetadataRef first = makeContainer(kData, "com.dup");
    BTHMetadataRef second = makeContainer(kData, "com.dup");
    const fs::path directory = classDirectory(kMobile, kData);
    test::writeFile(directory / "stray-file", "x");
    fs::create_directory(directory / "no-metadata");
    BTHMetadataRef otherClass = makeContainer(kData, "com.other-class");
    otherClass->setContainerClass(kPlugin);
    BTHMetadataRef otherUser = makeContainer(kData, "com.other-user");
    otherUser->setUid(502);
    ASSERT_TRUE(otherClass->writeMetadataToDisk(nullptr) &&
                otherUser->writeMetadataToDisk(nullptr));

    auto all = cache().allContainersForUser(kMobile, kData, false, nullptr);
    ASSERT_TRUE(all.has_value());
    ASSERT_EQ(all->size(), 1u);
    // The later of the two in listing order wins.
    auto listing =
        BTHFileManager::defaultManager().urlsForItemsInDirectoryAtURL(directory, nullptr);
    ASSERT_TRUE(listing.has_value());
    auto position = [&](const BTHMetadataRef& record) {
        return std::find(listing->begin(), listing->end(), BTHFileURL{record->url(), true});
    };
    EXPECT_EQ(*(*all)[0], position(first) < position(second) ? *second : *first);
}

TEST_F(BTHContainerCacheTest, AddBuildsANeverUsedMapFirstAndAddRemoveChangeOnlyTheirMap) {
    makeContainer(kPlugin, "com.other");
    // Made on disk, then added, as creation does: held once, as the added object.
    BTHMetadataRef created = makeContainer(kPlugin, "com.created");
    const fs::path url = created->url();
    created->setUrl("/stale");
    LogCapture log;
    ASSERT_TRUE(cache().addContainerMetadata(created, kMobile, url, false, nullptr));
    EXPECT_EQ(created->url(), url);
    EXPECT_EQ(rebuilds(log, "501-Data/SprocketPlugin"), 1u);
    EXPECT_EQ(countLines(log, BTHLogLevelDebug,
                         "Cache: Data/SprocketPlugin: Added Identifier: com.created"),
              1u);
    EXPECT_EQ(identifiersOf(kPlugin), (Strings{"com.created", "com.other"}));
    EXPECT_EQ(find(kPlugin, "com.created"), created);

    BTHMetadataRef replacement = makeContainer(kPlugin, "com.created");
    ASSERT_TRUE(
        cache().addContainerMetadata(replacement, kMobile, replacement->url(), false, nullptr));
    EXPECT_EQ(identifiersOf(kPlugin), (Strings{"com.created", "com.other"}));
    EXPECT_EQ(find(kPlugin, "com.created"), replacement);
    EXPECT_EQ(identifiersOf(kPlugin, true), Strings{});

    // Removal leaves the disk alone; an absent identifier is no error.
    BTHErrorRef error;
    EXPECT_TRUE(cache().removeContainerForUser(kMobile, kPlugin, "com.created", false, &error));
    EXPECT_TRUE(cache().removeContainerForUser(kMobile, kPlugin, "com.created", false, &error));
    EXPECT_TRUE(cache().removeContainerForUser(kMobile, kPlugin, "com.other", true, &error));
    EXPECT_EQ(error, nullptr);
    EXPECT_EQ(identifiersOf(kPlugin), Strings{"com.other"});
    EXPECT_TRUE(fs::exists(BTHMetadata::metadataFileURL(replacement->url())));
    EXPECT_EQ(countLines(log, BTHLogLevelDebug,
                         "Cache: Data/SprocketPlugin: Removed Identifier: com.created"),
              2u);
}

TEST_F(BTHContainerCacheTest, UuidLookUpMatchesTheUpperCaseStringAndSetsTheFlagOfItsMap) {
    const std::string live = makeContainer(kData, "com.app")->uuid().string();
    const std::string transient = makeContainer(kData, "com.app", true)->uuid().string();
    auto byUuid = [](const std::string& identifier, const std::string& uuid) {
        return cache().containerForUser(kMobile, kData, identifier, uuid);
    };
    BTHMetadataRef foundLive = byUuid("com.app", live);
    BTHMetadataRef foundTransient = byUuid("com.app", transient);
    ASSERT_TRUE(foundLive && foundTransient);
    EXPECT_EQ(foundLive->uuid().string(), live);
    EXPECT_EQ(foundTransient->uuid().string(), transient);
    // The flag follows the map, whatever the record said before.
    foundLive->setTransient(true);
    foundTransient->setTransient(false);
    EXPECT_FALSE(byUuid("com.app", live)->transient());
    EXPECT_TRUE(byUuid("com.app", transient)->transient());

    std::string lower = live;
    std::transform(lower.begin(), lower.end(), lower.begin(), ::tolower);
    EXPECT_EQ(byUuid("com.app", lower), nullptr);
    EXPECT_EQ(byUuid("com.none", live), nullptr);
}

TEST_F(BTHContainerCacheTest, UnlistableClassDirectoryGives43AndLeavesNoMap) {
    // A valid container behind the link: it must not be found through it.
    test::ScratchDir elsewhere;
    const fs::path linked = elsewhere / Uuid::random().string();
    fs::create_directory(linked);
    ASSERT_TRUE(BTHMetadata(kMobile, Uuid::random(), kVPN, "x", std::nullopt, linked, std::nullopt)
                    .writeMetadataToDisk(nullptr));
    for (const bool transient : {false, true}) {
        const std::string mapName =
            transient ? "501-Data/VPNPlugin(transient)" : "501-Data/VPNPlugin";
        SCOPED_TRACE(mapName);
        const fs::path directory = classDirectory(kMobile, kVPN, transient);
        fs::remove_all(directory);
        if (transient)
            fs::create_directory_symlink(elsewhere.path(), directory);
        else
            test::writeFile(directory, "not a directory");

        LogCapture log;
        const std::string message = "Cache: " + mapName + ": Failed to rebuild";
        for (const BTHErrorRef& error : errorsOfEveryOperation(kMobile, kVPN, transient)) {
            expectError(error, BTHErrorCacheRebuildFailed, message);
            ASSERT_NE(error->underlyingError(), nullptr);
            EXPECT_EQ(error->underlyingError()->domain(), kBTHPOSIXErrorDomain);
        }
        EXPECT_EQ(log.count(BTHLogLevelError, message), 5u);
        EXPECT_EQ(rebuilds(log, mapName), 5u);  // no map was kept

        fs::remove(directory);
        BTHMetadataRef later = makeContainer(kVPN, "com.later", transient);
        BTHMetadataRef found = find(kVPN, "com.later", transient);
        ASSERT_NE(found, nullptr);
        EXPECT_EQ(found->uuid(), later->uuid());
    }
}

}  // namespace
}  // namespace berth
