// The change watch that lets a remembered identity skip its stats: every kind
// of change to a watched item or its path is seen by the next question, and
// traffic among other names of the same directories is not.
#include "platform/ChangeWatch.h"

#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <functional>
#include <thread>
#include <vector>

#include "TestSupport.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using test::ScratchDir;

class ChangeWatchTest : public ::testing::Test {
  protected:
    void SetUp() override {
        watch_ = ChangeWatch::make();
        ASSERT_TRUE(watch_);
        stdfs::create_directories(dir_ / "a/b");
        test::writeFile(item(), "entry");
        test::writeFile(dir_ / "a/b/other", "other");
    }

    stdfs::path item() const { return dir_ / "a/b/item"; }

    // A moment with `item()` watched, nothing changed since.
    uint64_t watched() {
        const uint64_t moment = watch_->now();
        EXPECT_TRUE(watch_->watch(item()));
        EXPECT_TRUE(watch_->unchangedSince(moment));
        return moment;
    }

    ScratchDir dir_;
    std::unique_ptr<ChangeWatch> watch_;
};

TEST_F(ChangeWatchTest, EveryChangeOfTheItemOrItsPathIsSeenByTheNextQuestion) {
    std::vector<std::pair<const char*, std::function<void()>>> changes = {
        {"write", [&] { test::writeFile(item(), "rewritten"); }},
        {"truncate", [&] { ASSERT_EQ(::truncate(item().c_str(), 1), 0); }},
        {"chmod", [&] { stdfs::permissions(item(), stdfs::perms(0600)); }},
        {"another file renamed over it",
         [&] {
             test::writeFile(dir_ / "a/b/new", "entry");
             stdfs::rename(dir_ / "a/b/new", item());
         }},
        {"removed and made again",
         [&] {
             stdfs::remove(item());
             test::writeFile(item(), "entry");
         }},
        {"its directory renamed away and back",
         [&] {
             stdfs::rename(dir_ / "a/b", dir_ / "a/c");
             stdfs::rename(dir_ / "a/c", dir_ / "a/b");
         }},
        {"a directory further up replaced",
         [&] {
             stdfs::rename(dir_ / "a", dir_ / "old");
             stdfs::create_directories(dir_ / "a/b");
             test::writeFile(item(), "entry");
         }},
        {"a directory on the way made writable",
         [&] { stdfs::permissions(dir_ / "a", stdfs::perms(0777)); }},
    };
    if (::geteuid() == 0)
        changes.emplace_back("chown", [&] { ASSERT_EQ(::chown(item().c_str(), 0, 1), 0); });
    for (const auto& [what, change] : changes) {
        const uint64_t moment = watched();
        change();
        EXPECT_FALSE(watch_->unchangedSince(moment)) << what;
        // Seen once is seen for good: the moment stays behind.
        EXPECT_FALSE(watch_->unchangedSince(moment)) << what;
    }
}

TEST_F(ChangeWatchTest, OtherNamesInTheSameDirectoriesAreNoChange) {
    const uint64_t moment = watched();
    test::writeFile(dir_ / "a/b/other", "rewritten");
    test::writeFile(dir_ / "a/b/fresh", "fresh");
    stdfs::remove(dir_ / "a/b/fresh");
    stdfs::create_directory(dir_ / "a/sibling");
    stdfs::permissions(dir_ / "a/sibling", stdfs::perms(0700));
    // Reading the item changes nothing either.
    EXPECT_EQ(test::readFile(item()), "entry");
    EXPECT_TRUE(watch_->unchangedSince(moment));
}

TEST_F(ChangeWatchTest, AWatchOfNamesOnlySeesTheItemGoButNotItsContentsOrModes) {
    watch_ = ChangeWatch::make(nullptr, ChangeWatch::Kind::kNamesOnly);
    ASSERT_TRUE(watch_);
    uint64_t moment = watched();
    test::writeFile(item(), "rewritten");
    stdfs::permissions(item(), stdfs::perms(0600));
    stdfs::permissions(dir_ / "a", stdfs::perms(0777));
    EXPECT_TRUE(watch_->unchangedSince(moment));

    const std::vector<std::pair<const char*, std::function<void()>>> changes = {
        {"removed and made again",
         [&] {
             stdfs::remove(item());
             test::writeFile(item(), "entry");
         }},
        {"another file renamed over it",
         [&] {
             test::writeFile(dir_ / "a/b/new", "entry");
             stdfs::rename(dir_ / "a/b/new", item());
         }},
        {"a directory on the way replaced by a link to it",
         [&] {
             stdfs::rename(dir_ / "a", dir_ / "moved");
             stdfs::create_directory_symlink(dir_ / "moved", dir_ / "a");
         }},
    };
    for (const auto& [what, change] : changes) {
        moment = watched();
        change();
        EXPECT_FALSE(watch_->unchangedSince(moment)) << what;
    }
}

TEST_F(ChangeWatchTest, AFloodOfOtherEventsCountsAsAChangeRatherThanBeingReadWithoutEnd) {
    const uint64_t moment = watched();
    // Alternating names, since the kernel folds an event into an identical
    // one just before it.
    test::writeFile(dir_ / "a/b/second", "second");
    for (int i = 0; i < 5000; ++i)
        stdfs::permissions(dir_ / (i % 2 ? "a/b/other" : "a/b/second"), stdfs::perms(0600));
    EXPECT_FALSE(watch_->unchangedSince(moment));
    // Once the queue is read to its end, the watch stands for a new moment.
    uint64_t after = watch_->now();
    for (uint64_t next; (next = watch_->now()) != after;) after = next;
    EXPECT_TRUE(watch_->unchangedSince(after));
}

TEST_F(ChangeWatchTest, ATicketAnswersForItsOwnPathWhateverElseChanged) {
    stdfs::create_directories(dir_ / "x");
    test::writeFile(dir_ / "x/item", "x");
    ChangeWatch::Ticket mine, other;
    const uint64_t moment = watch_->now();
    ASSERT_TRUE(watch_->watch(item(), &mine));
    ASSERT_TRUE(watch_->watch(dir_ / "x/item", &other));

    test::writeFile(dir_ / "x/item", "rewritten");
    EXPECT_FALSE(watch_->unchangedSince(moment));
    EXPECT_TRUE(watch_->unchangedSince(mine, moment));
    EXPECT_FALSE(watch_->unchangedSince(other, moment));
    // A change on the way, still queued when the ticket is asked about.
    stdfs::rename(dir_ / "a/b", dir_ / "a/c");
    EXPECT_FALSE(watch_->unchangedSince(mine, moment));

    // A flood among other names counts for every ticket.
    stdfs::rename(dir_ / "a/c", dir_ / "a/b");
    const uint64_t later = watch_->now();
    ASSERT_TRUE(watch_->watch(item(), &mine));
    test::writeFile(dir_ / "x/p", "p");
    test::writeFile(dir_ / "x/q", "q");
    for (int i = 0; i < 5000; ++i)
        stdfs::permissions(dir_ / (i % 2 ? "x/p" : "x/q"), stdfs::perms(0600));
    EXPECT_FALSE(watch_->unchangedSince(mine, later));
}

TEST_F(ChangeWatchTest, ANameSeenGoneMustBeWatchedAgainToCount) {
    uint64_t moment = watched();
    stdfs::remove(item());
    EXPECT_FALSE(watch_->unchangedSince(moment));
    // Back again and watched anew from a new moment: its changes count.
    test::writeFile(item(), "entry");
    moment = watched();
    test::writeFile(dir_ / "a/b/new", "x");
    stdfs::rename(dir_ / "a/b/new", item());
    EXPECT_FALSE(watch_->unchangedSince(moment));
}

TEST_F(ChangeWatchTest, WhatCannotBeWatchedIsSaidSo) {
    EXPECT_FALSE(watch_->watch(dir_ / "a/missing"));
    EXPECT_FALSE(watch_->watch("relative/path"));
}

// Threads asking while others drain the queue never miss a change that was
// complete before they asked (run under ThreadSanitizer too).
TEST_F(ChangeWatchTest, AChangeCompletedBeforeAskingIsSeenWhoeverReadsTheQueue) {
    const uint64_t moment = watched();
    std::atomic<bool> changed{false}, stop{false};
    std::atomic<int> missed{0};
    std::vector<std::thread> askers;
    for (int i = 0; i < 4; ++i) {
        askers.emplace_back([&] {
            while (!stop) {
                const bool before = changed.load();
                if (!watch_->unchangedSince(moment) || !before) continue;
                ++missed;  // the change was complete and still not seen
            }
        });
    }
    // Traffic among other names keeps the queue busy meanwhile.
    for (int i = 0; i < 200; ++i) test::writeFile(dir_ / "a/b/other", std::to_string(i));
    test::writeFile(item(), "changed");
    changed = true;
    for (int i = 0; i < 200; ++i) test::writeFile(dir_ / "a/b/other", std::to_string(i));
    stop = true;
    for (auto& thread : askers) thread.join();
    EXPECT_EQ(missed.load(), 0);
    EXPECT_FALSE(watch_->unchangedSince(moment));
}

}  // namespace
}  // namespace berth
