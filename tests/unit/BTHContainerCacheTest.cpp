#include "BTHContainerCache.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cctype>
#include <thread>

#include "BTHContainerClass.h"
#include "BTHFileManager.h"
#include "BTHGlobalConfiguration.h"
#include "ScratchDeviceRoot.h"
#include "TestSupport.h"

namespace berth {
namespace {

namespace fs = std::filesystem;
using test::LogCapture;
using Strings = std::vector<std::string>;

const fs::path& root() {
    static const fs::path& path = test::installScratchDeviceRoot();
    return path;
}
const bool kRootInstalled = !root().empty();

constexpr uid_t kMobile = 501;
constexpr uint64_t kData = BTHContainerClassDataApplication;       // "Data/Application"
constexpr uint64_t kPlugin = BTHContainerClassDataSprocketPlugin;  // "Data/SprocketPlugin"
constexpr uint64_t kVPN = BTHContainerClassDataVPNPlugin;          // "Data/VPNPlugin"

BTHContainerCache& cache() {
    return BTHContainerCache::sharedInstance();
}

// The class directory, created (as the cache's build creates it).
fs::path classDirectory(uid_t user, uint64_t containerClass, bool transient = false) {
    return *BTHGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(
        user, containerClass, transient);
}

// A container directory under a fresh UUID name holding a valid metadata
// file, made behind the cache's back.
BTHMetadataRef makeContainer(uid_t user, uint64_t containerClass, const std::string& identifier,
                             bool transient = false) {
    const fs::path url = classDirectory(user, containerClass, transient) / Uuid::random().string();
    fs::create_directory(url);
    auto record = std::make_shared<BTHMetadata>(user, Uuid::random(), containerClass, identifier,
                                                std::nullopt, url, std::nullopt);
    BTHErrorRef error;
    EXPECT_TRUE(record->writeMetadataToDisk(&error)) << (error ? error->description() : "");
    return record;
}

void expectError(const BTHErrorRef& error, int32_t code, const std::string& message) {
    ASSERT_NE(error, nullptr) << message;
    EXPECT_TRUE(error->isBTHError(code)) << error->description();
    EXPECT_EQ(error->localizedDescription(), message);
}

// Lines of `level` whose message is exactly `message`.
size_t countLines(const LogCapture& log, int level, const std::string& message) {
    size_t n = 0;
    for (const LogCapture::Line& line : log.lines())
        if (line.level == level && line.message == message) ++n;
    return n;
}

size_t rebuilds(const LogCapture& log, const std::string& mapName) {
    return countLines(log, BTHLogLevelDebug, "Rebuilding container class cache: " + mapName);
}

Strings identifiersOf(uid_t user, uint64_t containerClass, bool transient = false) {
    BTHErrorRef error;
    auto identifiers =
        cache().allContainerIdentifiersForUser(user, containerClass, transient, &error);
    EXPECT_TRUE(identifiers.has_value()) << (error ? error->description() : "");
    return identifiers.value_or(Strings{});
}

class BTHContainerCacheTest : public ::testing::Test {
  protected:
    void SetUp() override {
        BERTH_REQUIRE_ROOT();
        ASSERT_TRUE(kRootInstalled);
        cache().resetForTesting();
        // Every class directory used here starts empty (a link or file left
        // by a test is removed, not followed).
        for (uint64_t containerClass : {kData, kPlugin, kVPN})
            for (bool transient : {false, true})
                fs::remove_all(classDirectory(kMobile, containerClass, transient));
    }
};

TEST_F(BTHContainerCacheTest, FirstLookUpBuildsTheMapAndLaterLookUpsNeverListAgain) {
    BTHMetadataRef a = makeContainer(kMobile, kData, "com.example.a");
    LogCapture log;
    BTHErrorRef error;
    BTHMetadataRef found = cache().containerForUser(kMobile, kData, "com.example.a", false, &error);
    ASSERT_NE(found, nullptr) << (error ? error->description() : "");
    EXPECT_EQ(*found, *a);
    EXPECT_EQ(rebuilds(log, "501-Data/Application"), 1u);
    EXPECT_EQ(countLines(log, BTHLogLevelDebug,
                         "Cache: Data/Application: Found Identifier: com.example.a"),
              1u);

    // A container made behind the cache's back is not seen: the directory is
    // not listed again, and the miss is not logged.
    makeContainer(kMobile, kData, "com.example.b");
    EXPECT_EQ(cache().containerForUser(kMobile, kData, "com.example.b", false, &error), nullptr);
    expectError(error, BTHErrorNotFound,
                "Cache: Data/Application: Container Not Found with ID: com.example.b");
    EXPECT_EQ(cache().containerForUser(kMobile, kData, "com.example.a", false, nullptr), found);
    EXPECT_EQ(rebuilds(log, "501-Data/Application"), 1u);

    // The transient map is separate, built on its own.
    EXPECT_EQ(cache().containerForUser(kMobile, kData, "com.example.a", true, &error), nullptr);
    expectError(error, BTHErrorNotFound,
                "Cache: Data/Application(transient): Container Not Found with ID: com.example.a");
    EXPECT_EQ(rebuilds(log, "501-Data/Application(transient)"), 1u);
    EXPECT_FALSE(log.contains(BTHLogLevelError, "Not Found"));

    cache().resetForTesting();
    EXPECT_NE(cache().containerForUser(kMobile, kData, "com.example.b", false, nullptr), nullptr);
    EXPECT_EQ(rebuilds(log, "501-Data/Application"), 2u);
}

TEST_F(BTHContainerCacheTest, BadClassesAndUsersFailWith47BeforeTouchingTheDisk) {
    struct Row {
        uid_t user;
        uint64_t containerClass;
        std::string message;     // of the look-up, listing and removal
        std::string addMessage;  // of the addition
    };
    const Row rows[] = {
        {501, 1, "Invalid cache get-userId 501 for class 1", ""},
        {499, 3, "Invalid cache get-userId 499 for class 3", ""},
        {501, 12, "Invalid cache get-userId 501 for class 12", ""},
        {33, 13, "Invalid cache get-userId 33 for class 13", ""},
        {501, 0, "Invalid Content Class: 0", "Invalid Metadata Content Class: 0"},
        {501, 14, "Invalid Content Class: 14", "Invalid Metadata Content Class: 14"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.message);
        std::optional<fs::path> directory;
        if (BTHContainerClassIsGlobal(row.containerClass)) {
            directory =
                classDirectory(BTHContainerClassGlobalUser(row.containerClass), row.containerClass);
            fs::remove_all(*directory);
        }
        const std::string addMessage = row.addMessage.empty() ? row.message : row.addMessage;
        auto record =
            std::make_shared<BTHMetadata>(row.user, Uuid::random(), row.containerClass,
                                          "com.example.bad", std::nullopt, "/", std::nullopt);
        LogCapture log;
        BTHErrorRef error;
        EXPECT_EQ(cache().containerForUser(row.user, row.containerClass, "x", false, &error),
                  nullptr);
        expectError(error, BTHErrorCacheInvalidInput, row.message);
        EXPECT_FALSE(cache().allContainersForUser(row.user, row.containerClass, false, &error));
        expectError(error, BTHErrorCacheInvalidInput, row.message);
        EXPECT_FALSE(
            cache().allContainerIdentifiersForUser(row.user, row.containerClass, true, &error));
        expectError(error, BTHErrorCacheInvalidInput, row.message);
        EXPECT_FALSE(
            cache().removeContainerForUser(row.user, row.containerClass, "x", false, &error));
        expectError(error, BTHErrorCacheInvalidInput, row.message);
        EXPECT_FALSE(cache().addContainerMetadata(record, row.user, "/c", false, &error));
        expectError(error, BTHErrorCacheInvalidInput, addMessage);

        // Each failure is logged once, and nothing else is.
        size_t errorLines = 0;
        for (const LogCapture::Line& line : log.lines())
            errorLines += line.level == BTHLogLevelError;
        EXPECT_EQ(errorLines, 5u);
        EXPECT_EQ(log.count(BTHLogLevelError, row.message), addMessage == row.message ? 5u : 4u);
        EXPECT_EQ(log.count(BTHLogLevelDebug, "Rebuilding"), 0u);
        if (directory) {
            EXPECT_FALSE(fs::exists(fs::symlink_status(*directory))) << *directory;
        }
    }

    // Records and urls the cache cannot hold.
    auto record = std::make_shared<BTHMetadata>(kMobile, Uuid::random(), kData, "com.example.a",
                                                std::nullopt, "/", std::nullopt);
    const std::pair<std::string, std::string> urls[] = {
        {"relative/dir", "Invalid input: URL: relative/dir"}, {"", "Invalid input: URL: "}};
    BTHErrorRef error;
    for (const auto& [url, message] : urls) {
        EXPECT_FALSE(cache().addContainerMetadata(record, kMobile, url, false, &error));
        expectError(error, BTHErrorCacheInvalidInput, message);
    }
    EXPECT_FALSE(cache().addContainerMetadata(nullptr, kMobile, "/c", false, &error));
    expectError(error, BTHErrorCacheInvalidInput, "Invalid metadata Identifier: (null)");
    EXPECT_EQ(record->url(), "/");
}

TEST_F(BTHContainerCacheTest, MissingMetadataFileGives44OnLookUpAndIsLeftOutOfTheListing) {
    BTHMetadataRef a = makeContainer(kMobile, kData, "com.example.a");
    BTHMetadataRef b = makeContainer(kMobile, kData, "com.example.b");
    ASSERT_NE(cache().containerForUser(kMobile, kData, "com.example.a", false, nullptr), nullptr);
    const fs::path metadataFile = BTHMetadata::metadataFileURL(a->url());
    ASSERT_TRUE(fs::remove(metadataFile));

    LogCapture log;
    const std::string message =
        "Cache: Data/Application: INCONSISTENT-No Metadata at: " + metadataFile.string();
    BTHErrorRef error;
    EXPECT_EQ(cache().containerForUser(kMobile, kData, "com.example.a", false, &error), nullptr);
    expectError(error, BTHErrorCacheInconsistent, message);

    error.reset();
    auto all = cache().allContainersForUser(kMobile, kData, false, &error);
    ASSERT_TRUE(all.has_value());
    EXPECT_EQ(error, nullptr);
    ASSERT_EQ(all->size(), 1u);
    EXPECT_EQ((*all)[0]->identifier(), "com.example.b");
    EXPECT_EQ(log.count(BTHLogLevelError, message), 2u);
    EXPECT_EQ(countLines(log, BTHLogLevelDebug,
                         "Cache: Data/Application: ALL Found Identifier: com.example.b"),
              1u);
    // The identifiers are not checked against the disk, and the entry stays:
    // once its file is back it is found again without a rebuild.
    EXPECT_EQ(identifiersOf(kMobile, kData), (Strings{"com.example.a", "com.example.b"}));
    ASSERT_TRUE(a->writeMetadataToDisk(nullptr));
    EXPECT_NE(cache().containerForUser(kMobile, kData, "com.example.a", false, nullptr), nullptr);
    EXPECT_EQ(log.count(BTHLogLevelDebug, "Rebuilding"), 0u);
}

TEST_F(BTHContainerCacheTest, BuildHoldsOneEntryPerIdentifierAndSkipsWhatDoesNotValidate) {
    BTHMetadataRef first = makeContainer(kMobile, kData, "com.example.dup");
    BTHMetadataRef second = makeContainer(kMobile, kData, "com.example.dup");
    const fs::path directory = classDirectory(kMobile, kData);
    test::writeFile(directory / "stray-file", "x");
    fs::create_directory(directory / "no-metadata");
    // A container of another class, and one of another user, in this directory.
    BTHMetadataRef misplaced = makeContainer(kMobile, kData, "com.example.misplaced");
    misplaced->setContainerClass(kPlugin);
    ASSERT_TRUE(misplaced->writeMetadataToDisk(nullptr));
    BTHMetadataRef foreign = makeContainer(kMobile, kData, "com.example.foreign");
    foreign->setUid(502);
    ASSERT_TRUE(foreign->writeMetadataToDisk(nullptr));

    auto all = cache().allContainersForUser(kMobile, kData, false, nullptr);
    ASSERT_TRUE(all.has_value());
    ASSERT_EQ(all->size(), 1u);
    // The later of the two in listing order wins.
    auto listing =
        BTHFileManager::defaultManager().urlsForItemsInDirectoryAtURL(directory, nullptr);
    ASSERT_TRUE(listing.has_value());
    auto position = [&](const fs::path& url) {
        return std::find_if(listing->begin(), listing->end(),
                            [&](const BTHFileURL& item) { return item.path == url; });
    };
    const BTHMetadataRef& winner =
        position(first->url()) < position(second->url()) ? second : first;
    EXPECT_EQ(*(*all)[0], *winner);
    EXPECT_EQ(identifiersOf(kMobile, kData), Strings{"com.example.dup"});
}

TEST_F(BTHContainerCacheTest, AddToANeverUsedClassBuildsItsMapFirst) {
    BTHMetadataRef other = makeContainer(kMobile, kPlugin, "com.example.other");
    // Made on disk, then added, as creation does: held once, as the added object.
    BTHMetadataRef created = makeContainer(kMobile, kPlugin, "com.example.created");
    const fs::path url = created->url();
    created->setUrl("/stale");

    LogCapture log;
    BTHErrorRef error;
    ASSERT_TRUE(cache().addContainerMetadata(created, kMobile, url, false, &error))
        << (error ? error->description() : "");
    EXPECT_EQ(created->url(), url);
    EXPECT_EQ(rebuilds(log, "501-Data/SprocketPlugin"), 1u);
    EXPECT_EQ(countLines(log, BTHLogLevelDebug,
                         "Cache: Data/SprocketPlugin: Added Identifier: com.example.created"),
              1u);
    EXPECT_EQ(identifiersOf(kMobile, kPlugin),
              (Strings{"com.example.created", "com.example.other"}));
    EXPECT_EQ(cache().containerForUser(kMobile, kPlugin, "com.example.created", false, nullptr),
              created);

    // A new record under the same identifier replaces the entry.
    BTHMetadataRef replacement = makeContainer(kMobile, kPlugin, "com.example.created");
    ASSERT_TRUE(
        cache().addContainerMetadata(replacement, kMobile, replacement->url(), false, nullptr));
    EXPECT_EQ(identifiersOf(kMobile, kPlugin),
              (Strings{"com.example.created", "com.example.other"}));
    EXPECT_EQ(cache().containerForUser(kMobile, kPlugin, "com.example.created", false, nullptr),
              replacement);
    // Nothing went to the transient map.
    EXPECT_EQ(identifiersOf(kMobile, kPlugin, true), Strings{});
}

TEST_F(BTHContainerCacheTest, UuidLookUpMatchesTheUpperCaseStringAndSetsTheFlagOfItsMap) {
    BTHMetadataRef live = makeContainer(kMobile, kData, "com.example.app");
    BTHMetadataRef transient = makeContainer(kMobile, kData, "com.example.app", true);

    BTHMetadataRef found =
        cache().containerForUser(kMobile, kData, "com.example.app", live->uuid().string());
    ASSERT_NE(found, nullptr);
    EXPECT_EQ(found->uuid(), live->uuid());
    EXPECT_FALSE(found->transient());
    BTHMetadataRef foundTransient =
        cache().containerForUser(kMobile, kData, "com.example.app", transient->uuid().string());
    ASSERT_NE(foundTransient, nullptr);
    EXPECT_EQ(foundTransient->uuid(), transient->uuid());
    EXPECT_TRUE(foundTransient->transient());

    // The flag follows the map, whatever the record said before.
    found->setTransient(true);
    foundTransient->setTransient(false);
    EXPECT_FALSE(cache()
                     .containerForUser(kMobile, kData, "com.example.app", live->uuid().string())
                     ->transient());
    EXPECT_TRUE(cache()
                    .containerForUser(kMobile, kData, "com.example.app", transient->uuid().string())
                    ->transient());

    std::string lower = live->uuid().string();
    std::transform(lower.begin(), lower.end(), lower.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    EXPECT_EQ(cache().containerForUser(kMobile, kData, "com.example.app", lower), nullptr);
    EXPECT_EQ(cache().containerForUser(kMobile, kData, "com.example.app", Uuid::random().string()),
              nullptr);
    EXPECT_EQ(cache().containerForUser(kMobile, kData, "com.example.none", live->uuid().string()),
              nullptr);
}

TEST_F(BTHContainerCacheTest, RemoveDropsOnlyTheEntryOfItsMapAndAbsentIsNoError) {
    BTHMetadataRef a = makeContainer(kMobile, kData, "com.example.a");
    BTHMetadataRef b = makeContainer(kMobile, kData, "com.example.b");
    LogCapture log;
    BTHErrorRef error;
    ASSERT_TRUE(cache().removeContainerForUser(kMobile, kData, "com.example.a", false, &error));
    EXPECT_EQ(cache().containerForUser(kMobile, kData, "com.example.a", false, nullptr), nullptr);
    EXPECT_TRUE(fs::exists(BTHMetadata::metadataFileURL(a->url())));  // the disk is not touched
    EXPECT_TRUE(cache().removeContainerForUser(kMobile, kData, "com.example.a", false, &error));
    EXPECT_TRUE(cache().removeContainerForUser(kMobile, kData, "com.example.b", true, &error));
    EXPECT_EQ(error, nullptr);
    EXPECT_EQ(identifiersOf(kMobile, kData), Strings{"com.example.b"});
    EXPECT_EQ(countLines(log, BTHLogLevelDebug,
                         "Cache: Data/Application: Removed Identifier: com.example.a"),
              2u);
    EXPECT_EQ(countLines(log, BTHLogLevelDebug,
                         "Cache: Data/Application(transient): Removed Identifier: com.example.b"),
              1u);
}

TEST_F(BTHContainerCacheTest, UnlistableClassDirectoryGives43AndNoMap) {
    // A valid container behind the link shows the link is not followed.
    test::ScratchDir elsewhere;
    const fs::path linked = elsewhere / Uuid::random().string();
    fs::create_directory(linked);
    ASSERT_TRUE(BTHMetadata(kMobile, Uuid::random(), kVPN, "com.example.linked", std::nullopt,
                            linked, std::nullopt)
                    .writeMetadataToDisk(nullptr));
    struct Row {
        bool transient;
        bool symlink;
        std::string message;
    };
    const Row rows[] = {
        {false, false, "Cache: 501-Data/VPNPlugin: Failed to rebuild"},
        {true, true, "Cache: 501-Data/VPNPlugin(transient): Failed to rebuild"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.message);
        const fs::path directory = classDirectory(kMobile, kVPN, row.transient);
        fs::remove_all(directory);
        if (row.symlink)
            fs::create_directory_symlink(elsewhere.path(), directory);
        else
            test::writeFile(directory, "not a directory");

        LogCapture log;
        auto record = std::make_shared<BTHMetadata>(
            kMobile, Uuid::random(), kVPN, "com.example.new", std::nullopt, "/c", std::nullopt);
        BTHErrorRef errors[5];
        EXPECT_EQ(cache().containerForUser(kMobile, kVPN, "com.example.linked", row.transient,
                                           &errors[0]),
                  nullptr);
        EXPECT_FALSE(cache().allContainersForUser(kMobile, kVPN, row.transient, &errors[1]));
        EXPECT_FALSE(
            cache().allContainerIdentifiersForUser(kMobile, kVPN, row.transient, &errors[2]));
        EXPECT_FALSE(
            cache().addContainerMetadata(record, kMobile, "/c", row.transient, &errors[3]));
        EXPECT_FALSE(cache().removeContainerForUser(kMobile, kVPN, "x", row.transient, &errors[4]));
        for (const BTHErrorRef& error : errors) {
            expectError(error, BTHErrorCacheRebuildFailed, row.message);
            ASSERT_NE(error->underlyingError(), nullptr);
            EXPECT_EQ(error->underlyingError()->domain(), kBTHPOSIXErrorDomain);
        }
        EXPECT_EQ(log.count(BTHLogLevelError, row.message), 5u);
        // Every use tried again: a failed build leaves no map behind.
        EXPECT_EQ(
            rebuilds(log, row.transient ? "501-Data/VPNPlugin(transient)" : "501-Data/VPNPlugin"),
            5u);

        fs::remove(directory);
        BTHMetadataRef later = makeContainer(kMobile, kVPN, "com.example.later", row.transient);
        BTHMetadataRef found =
            cache().containerForUser(kMobile, kVPN, "com.example.later", row.transient, nullptr);
        ASSERT_NE(found, nullptr);
        EXPECT_EQ(found->uuid(), later->uuid());
    }
}

TEST_F(BTHContainerCacheTest, ConcurrentFirstUsersShareOneBuild) {
    constexpr int kContainers = 50;
    constexpr int kThreads = 4;
    for (int i = 0; i < kContainers; ++i)
        makeContainer(kMobile, kData, "com.example." + std::to_string(i));
    LogCapture log;
    std::vector<size_t> seen(kThreads);
    {
        std::vector<std::jthread> threads;
        for (int t = 0; t < kThreads; ++t)
            threads.emplace_back([&, t] {
                auto all = cache().allContainersForUser(kMobile, kData, false, nullptr);
                seen[t] = all ? all->size() : 0;
            });
    }
    EXPECT_EQ(seen, std::vector<size_t>(kThreads, kContainers));
    EXPECT_EQ(rebuilds(log, "501-Data/Application"), 1u);
}

}  // namespace
}  // namespace berth
