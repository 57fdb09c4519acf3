#include "platform/SandboxMappingStore.h"

#include <limits.h>

#include "TestSupport.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using namespace std::string_literals;

constexpr uid_t kUser = 501;
constexpr uint64_t kData = 1;

using test::namesIn;

class SandboxMappingStoreTest : public ::testing::Test {
  protected:
    stdfs::path entryDirectory(uid_t user, uint64_t itemType) const {
        return store_.directory() / std::to_string(user) / std::to_string(itemType);
    }

    test::ScratchDir scratch_;
    SandboxMappingStore store_{scratch_ / "run/berthd/sandbox"};
};

TEST_F(SandboxMappingStoreTest, SetLookUpReplaceAndRemove) {
    // Removing from a store that does not exist yet succeeds and makes
    // nothing.
    EXPECT_EQ(store_.setUserStateItem(kUser, kData, "a.app", std::nullopt), 0);
    EXPECT_FALSE(stdfs::exists(store_.directory()));
    EXPECT_FALSE(store_.lookup(kUser, kData, "a.app"));

    // Launchers must be able to read the store whatever the daemon's umask.
    const mode_t previousMask = ::umask(077);
    const int created = store_.setUserStateItem(kUser, kData, "a.app", "/containers/Data/A"s);
    ::umask(previousMask);
    ASSERT_EQ(created, 0);
    EXPECT_EQ(store_.lookup(kUser, kData, "a.app"), "/containers/Data/A");
    const stdfs::path link = entryDirectory(kUser, kData) / "a.app";
    EXPECT_TRUE(stdfs::is_symlink(link));
    for (const stdfs::path& d :
         {store_.directory(), store_.directory() / "501", entryDirectory(kUser, kData)})
        EXPECT_EQ(test::lstatOf(d).st_mode & 07777, 0755u) << d;

    // Entries are per user and per item type.
    EXPECT_FALSE(store_.lookup(502, kData, "a.app"));
    EXPECT_FALSE(store_.lookup(kUser, 2, "a.app"));

    ASSERT_EQ(store_.setUserStateItem(kUser, kData, "a.app", "/containers/Data/B"s), 0);
    EXPECT_EQ(store_.lookup(kUser, kData, "a.app"), "/containers/Data/B");
    EXPECT_EQ(namesIn(entryDirectory(kUser, kData)), std::set<std::string>{"a.app"});

    EXPECT_EQ(store_.setUserStateItem(kUser, kData, "a.app", std::nullopt), 0);
    EXPECT_FALSE(store_.lookup(kUser, kData, "a.app"));
    EXPECT_EQ(store_.setUserStateItem(kUser, kData, "a.app", std::nullopt), 0);
    EXPECT_TRUE(namesIn(entryDirectory(kUser, kData)).empty());
}

TEST_F(SandboxMappingStoreTest, EveryIdentifierIsOneDistinctPlainNameOrRefused) {
    const std::pair<std::string, std::string> cases[] = {
        {"sys.kelp.app", "sys.kelp.app"},
        {".", "%2E"},
        {"..", "%2E."},
        {".hidden", "%2Ehidden"},
        {"a/b", "a%2Fb"},
        {"/", "%2F"},
        {"%2F", "%252F"},
        {"%2E.", "%252E."},
        {"../../etc", "%2E.%2F..%2Fetc"},
        {"a\0b"s, "a%00b"},
        {"a.", "a."},
        {std::string(NAME_MAX, 'x'), std::string(NAME_MAX, 'x')},
    };
    std::set<std::string> names;
    for (const auto& [identifier, name] : cases) {
        EXPECT_EQ(SandboxMappingStore::encodeIdentifier(identifier), name) << identifier;
        ASSERT_EQ(store_.setUserStateItem(kUser, kData, identifier, "/p/" + name), 0) << identifier;
        names.insert(name);
    }
    for (const auto& [identifier, name] : cases)
        EXPECT_EQ(store_.lookup(kUser, kData, identifier), "/p/" + name) << identifier;
    // Every identifier has its own entry, and nothing was made elsewhere.
    EXPECT_EQ(namesIn(entryDirectory(kUser, kData)), names);
    EXPECT_EQ(namesIn(store_.directory()), std::set<std::string>{"501"});
    EXPECT_EQ(namesIn(store_.directory() / "501"), std::set<std::string>{"1"});

    // No name at all, or one past the limit (also through an escape).
    const std::pair<std::string, int> refused[] = {
        {"", EINVAL},
        {std::string(NAME_MAX + 1, 'x'), ENAMETOOLONG},
        {std::string(NAME_MAX - 1, 'x') + "/", ENAMETOOLONG}};
    for (const auto& [identifier, error] : refused) {
        EXPECT_EQ(store_.setUserStateItem(kUser, kData, identifier, "/p"s), error);
        EXPECT_EQ(store_.setUserStateItem(kUser, kData, identifier, std::nullopt), error);
        EXPECT_FALSE(store_.lookup(kUser, kData, identifier));
    }
    EXPECT_EQ(namesIn(entryDirectory(kUser, kData)), names);
}

TEST_F(SandboxMappingStoreTest, LinksInTheStoreDirectoriesAreNeverFollowed) {
    ASSERT_EQ(store_.setUserStateItem(kUser, kData, "a.app", "/p/a"s), 0);
    const stdfs::path elsewhere = scratch_ / "elsewhere";
    stdfs::create_directories(elsewhere / "1");
    stdfs::remove_all(store_.directory() / "501");
    stdfs::create_directory_symlink(elsewhere, store_.directory() / "501");

    EXPECT_NE(store_.setUserStateItem(kUser, kData, "b.app", "/p/b"s), 0);
    EXPECT_NE(store_.setUserStateItem(kUser, kData, "a.app", std::nullopt), 0);
    EXPECT_FALSE(store_.lookup(kUser, kData, "a.app"));
    EXPECT_TRUE(namesIn(elsewhere / "1").empty());

    // The same for the item type's directory.
    stdfs::remove(store_.directory() / "501");
    stdfs::create_directory(store_.directory() / "501");
    stdfs::create_directory_symlink(elsewhere / "1", store_.directory() / "501/1");
    EXPECT_NE(store_.setUserStateItem(kUser, kData, "b.app", "/p/b"s), 0);
    EXPECT_TRUE(namesIn(elsewhere / "1").empty());
}

TEST_F(SandboxMappingStoreTest, ConcurrentSettersLeaveOneWholeEntryAndReadersNeverSeeAGap) {
    ASSERT_EQ(store_.setUserStateItem(kUser, kData, "a.app", "/p/initial"s), 0);
    constexpr int kWriters = 4, kRounds = 1000;
    std::atomic<bool> done{false};
    std::atomic<int> badReads{0};
    std::thread reader([&] {
        while (!done) {
            std::optional<std::string> seen = store_.lookup(kUser, kData, "a.app");
            if (!seen || seen->rfind("/p/", 0) != 0) ++badReads;
        }
    });
    std::vector<std::thread> writers;
    std::atomic<int> failures{0};
    for (int w = 0; w < kWriters; ++w)
        writers.emplace_back([&, w] {
            for (int i = 0; i < kRounds; ++i) {
                const std::string path = "/p/" + std::to_string(w) + "/" + std::to_string(i);
                if (store_.setUserStateItem(kUser, kData, "a.app", path) != 0) ++failures;
            }
        });
    for (std::thread& t : writers) t.join();
    done = true;
    reader.join();

    EXPECT_EQ(failures, 0);
    EXPECT_EQ(badReads, 0);
    const std::optional<std::string> last = store_.lookup(kUser, kData, "a.app");
    ASSERT_TRUE(last);
    // The last rename to land is some writer's last set.
    const std::string lastRound = std::string("/").append(std::to_string(kRounds - 1));
    EXPECT_TRUE(last->size() > lastRound.size() &&
                last->compare(last->size() - lastRound.size(), lastRound.size(), lastRound) == 0)
        << *last;
    // No temporary link is left behind.
    EXPECT_EQ(namesIn(entryDirectory(kUser, kData)), std::set<std::string>{"a.app"});
}

}  // namespace
}  // namespace berth
