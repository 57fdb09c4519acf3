// Group commit of directory changes: a wait returns only after a sync that
// started after the change was noted, concurrent waiters share syncs, a failed
// sync fails exactly the waits it was to cover, and directories are kept
// apart. The sync itself is a recording stand-in; the real one is checked on
// a scratch directory at the end.
#include <fcntl.h>

#include "BTHDirectorySync.h"
#include "TestSupport.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;

// Records each sync (directory, first) in order; a sync may be held at a
// gate until the test opens it, and may be told to fail.
class RecordingSync {
  public:
    struct Call {
        std::string directory;
        bool first;
    };

    BTHDirectorySync::SyncFunction function() {
        return [this](const stdfs::path& directory, bool first) {
            std::unique_lock<std::mutex> lock(mutex_);
            calls_.push_back({directory.string(), first});
            ++started_;
            changed_.notify_all();
            changed_.wait(lock, [&] { return !held_; });
            const int result = failNext_;
            failNext_ = 0;
            return result;
        };
    }

    void hold() { setHeld(true); }
    void release() { setHeld(false); }
    void failNext(int err) {
        std::lock_guard<std::mutex> lock(mutex_);
        failNext_ = err;
    }
    // Waits until `count` syncs have started.
    bool waitForStarts(size_t count) {
        std::unique_lock<std::mutex> lock(mutex_);
        return changed_.wait_for(lock, std::chrono::seconds(10), [&] { return started_ >= count; });
    }
    std::vector<Call> calls() {
        std::lock_guard<std::mutex> lock(mutex_);
        return calls_;
    }

  private:
    void setHeld(bool held) {
        std::lock_guard<std::mutex> lock(mutex_);
        held_ = held;
        changed_.notify_all();
    }

    std::mutex mutex_;
    std::condition_variable changed_;
    std::vector<Call> calls_;
    size_t started_ = 0;
    bool held_ = false;
    int failNext_ = 0;
};

const stdfs::path kClass = "/root/Containers/Data/Application";
const stdfs::path kOtherClass = "/root/Containers/Data/SprocketPlugin";

TEST(BTHDirectorySyncTest, EachWaitNeedsASyncStartedAfterItsChange) {
    RecordingSync recorder;
    BTHDirectorySync sync(recorder.function());

    // Nothing noted: nothing to wait for.
    EXPECT_EQ(sync.lastChange(kClass), 0u);
    EXPECT_TRUE(sync.waitUntilDurable(kClass, 0, nullptr));
    EXPECT_TRUE(recorder.calls().empty());

    const uint64_t first = sync.noteChange(kClass);
    EXPECT_TRUE(sync.waitUntilDurable(kClass, first, nullptr));
    ASSERT_EQ(recorder.calls().size(), 1u);
    EXPECT_TRUE(recorder.calls()[0].first);  // the directory's first sync
    // Already covered: no second sync.
    EXPECT_TRUE(sync.waitUntilDurable(kClass, first, nullptr));
    EXPECT_EQ(recorder.calls().size(), 1u);

    // A change noted while a sync runs is not covered by that sync.
    const uint64_t second = sync.noteChange(kClass);
    recorder.hold();
    std::thread running([&] { EXPECT_TRUE(sync.waitUntilDurable(kClass, second, nullptr)); });
    ASSERT_TRUE(recorder.waitForStarts(2));
    const uint64_t third = sync.noteChange(kClass);
    EXPECT_EQ(sync.lastChange(kClass), third);
    std::thread late([&] { EXPECT_TRUE(sync.waitUntilDurable(kClass, third, nullptr)); });
    recorder.release();
    running.join();
    late.join();
    const auto calls = recorder.calls();
    ASSERT_EQ(calls.size(), 3u);
    EXPECT_FALSE(calls[1].first);
    EXPECT_FALSE(calls[2].first);
}

TEST(BTHDirectorySyncTest, ConcurrentWaitersShareOneSync) {
    RecordingSync recorder;
    BTHDirectorySync sync(recorder.function());
    constexpr int kWaiters = 8;
    std::vector<uint64_t> changes;
    for (int i = 0; i < kWaiters; ++i) changes.push_back(sync.noteChange(kClass));

    // Whoever starts the sync covers every change noted before it; the
    // others wait for it or find their change already durable.
    std::vector<std::thread> waiters;
    std::atomic<int> succeeded{0};
    for (int i = 0; i < kWaiters; ++i) {
        waiters.emplace_back([&, i] {
            if (sync.waitUntilDurable(kClass, changes[i], nullptr)) ++succeeded;
        });
    }
    for (std::thread& waiter : waiters) waiter.join();
    EXPECT_EQ(succeeded, kWaiters);
    EXPECT_EQ(recorder.calls().size(), 1u);
}

TEST(BTHDirectorySyncTest, FailedSyncFailsTheWaitsItCoversAndALaterWaitRetries) {
    RecordingSync recorder;
    BTHDirectorySync sync(recorder.function());
    const uint64_t change = sync.noteChange(kClass);
    recorder.failNext(EIO);
    BTHErrorRef error;
    EXPECT_FALSE(sync.waitUntilDurable(kClass, change, &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->isPOSIXError(EIO));

    // The next wait does not take the old failure for its answer.
    EXPECT_TRUE(sync.waitUntilDurable(kClass, change, nullptr));
    const auto calls = recorder.calls();
    ASSERT_EQ(calls.size(), 2u);
    EXPECT_TRUE(calls[1].first);  // the failed one did not count as the first
}

TEST(BTHDirectorySyncTest, AWaitBehindAFailedSyncThatDidNotCoverItStartsItsOwn) {
    RecordingSync recorder;
    BTHDirectorySync sync(recorder.function());
    const uint64_t early = sync.noteChange(kClass);
    recorder.hold();
    recorder.failNext(EIO);
    std::thread failing([&] { EXPECT_FALSE(sync.waitUntilDurable(kClass, early, nullptr)); });
    ASSERT_TRUE(recorder.waitForStarts(1));
    const uint64_t late = sync.noteChange(kClass);
    std::thread behind([&] { EXPECT_TRUE(sync.waitUntilDurable(kClass, late, nullptr)); });
    recorder.release();
    failing.join();
    behind.join();
    EXPECT_EQ(recorder.calls().size(), 2u);
}

TEST(BTHDirectorySyncTest, DirectoriesAreSyncedApart) {
    RecordingSync recorder;
    BTHDirectorySync sync(recorder.function());
    const uint64_t change = sync.noteChange(kClass);
    EXPECT_EQ(sync.noteChange(kOtherClass), 1u);
    EXPECT_TRUE(sync.waitUntilDurable(kClass, change, nullptr));
    // The other directory's change is still pending, and its wait syncs it.
    EXPECT_TRUE(sync.waitUntilDurable(kOtherClass, 1, nullptr));
    const auto calls = recorder.calls();
    ASSERT_EQ(calls.size(), 2u);
    EXPECT_EQ(calls[0].directory, kClass.string());
    EXPECT_EQ(calls[1].directory, kOtherClass.string());
    EXPECT_TRUE(calls[1].first);
}

TEST(BTHDirectorySyncTest, EverySpellingOfADirectoryCountsItsChangesTogether) {
    BTHDirectorySync sync(RecordingSync().function());
    uint64_t noted = 0;
    for (const char* spelling :
         {"/root/Containers/Data/Application", "/root/Containers/Data/Application/",
          "/root//Containers/./Data/Application",
          "/root/Containers/Data/Sprocket/../Application"}) {
        SCOPED_TRACE(spelling);
        EXPECT_EQ(sync.noteChange(spelling), ++noted);
        EXPECT_EQ(sync.lastChange(kClass), noted);
    }
    EXPECT_EQ(sync.lastChange("/root/Containers/Data/Application/."), noted);
    EXPECT_EQ(sync.lastChange("/root/Containers/Data/Applications"), 0u);
    EXPECT_EQ(sync.lastChange("/root/Containers/Data"), 0u);
}

TEST(BTHDirectorySyncTest, RealSyncOfADirectoryAndOfWhatIsNotOne) {
    test::ScratchDir scratch;
    stdfs::create_directory(scratch / "class");
    EXPECT_EQ(BTHDirectorySync::syncDirectory(scratch / "class"), 0);
    EXPECT_EQ(BTHDirectorySync::syncDirectory(scratch / "missing"), ENOENT);
    // Link-safe: a link in place of the directory is not followed.
    stdfs::create_directory_symlink(scratch / "class", scratch / "link");
    EXPECT_EQ(BTHDirectorySync::syncDirectory(scratch / "link"), ELOOP);

    // The shared instance syncs real directories, its first time with their
    // ancestors.
    BTHDirectorySync& shared = BTHDirectorySync::sharedInstance();
    const uint64_t change = shared.noteChange(scratch / "class");
    EXPECT_TRUE(shared.waitUntilDurable(scratch / "class", change, nullptr));
    const uint64_t gone = shared.noteChange(scratch / "missing");
    BTHErrorRef error;
    EXPECT_FALSE(shared.waitUntilDurable(scratch / "missing", gone, &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->isPOSIXError(ENOENT));
}

}  // namespace
}  // namespace berth
