// Shared helpers of the test programs: scratch directories, a view of what
// the daemon logged, waiting, child processes, error checks, and the root
// check of tests that need privileges.
#pragma once

#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "BTHError.h"
#include "BTHFileManager.h"
#include "core/Value.h"
#include "platform/UniqueFd.h"

namespace berth::test {

// A fresh directory under /tmp (or under `parent`), removed with everything
// in it (immutable flags cleared) when the object goes.
class ScratchDir {
  public:
    explicit ScratchDir(const std::filesystem::path& parent = "/tmp");
    ~ScratchDir();
    ScratchDir(const ScratchDir&) = delete;
    ScratchDir& operator=(const ScratchDir&) = delete;

    const std::filesystem::path& path() const { return path_; }
    std::filesystem::path operator/(const std::string& name) const { return path_ / name; }

  private:
    std::filesystem::path path_;
};

// Every line the daemon logs while this object lives (level, function and
// message), including lines that the level threshold would write.
class LogCapture {
  public:
    struct Line {
        int level;
        std::string function;
        std::string message;
    };

    explicit LogCapture(int threshold = 7);
    ~LogCapture();

    std::vector<Line> lines() const;
    // True when some line of `level` contains `text`.
    bool contains(int level, const std::string& text) const;
    size_t count(int level, const std::string& text) const;

    // Called by the sink.
    void record(const std::string& formatted);

  private:
    mutable std::mutex mutex_;
    std::vector<Line> lines_;
};

// Writes `text` to `path`, creating or replacing it.
void writeFile(const std::filesystem::path& path, const std::string& text);
std::string readFile(const std::filesystem::path& path);
// Waits until the death-row queue has run everything submitted to it so far:
// a test program must not end while that queue still works on the scratch
// root its statics are about to remove.
void waitForDeathRowQueue();
// Replaces the device-property file of the device root with `properties`
// ("InternalBuild", "MultiUser", ...).
void writeDeviceProperties(const Value& properties);

// Sets or clears the immutable flag of `path` (not following a link).
bool setImmutable(const std::filesystem::path& path, bool on);

// A Unix socket of `type` connected to `path`; on failure invalid, with errno
// telling why.
UniqueFd connectUnix(const std::filesystem::path& path, int type = SOCK_STREAM);

// lstat of `path`, failing the test when there is none.
struct stat lstatOf(const std::filesystem::path& path);
// The names in a directory.
std::set<std::string> namesIn(const std::filesystem::path& directory);

// Builds `depth` nested directories named `name` below the existing `top`,
// with a file "f" in every `fileEvery`-th level (0: none), without ever
// holding a path longer than one name: the chain may be deeper than any path
// allows. Gives the bottom directory, open.
UniqueFd makeDirectoryChain(const std::filesystem::path& top, int depth, int fileEvery = 0,
                            const std::string& name = "d");

// How many descriptors this process has open.
int openDescriptorCount();

// Lowers this process's descriptor limit for the scope's life.
class DescriptorLimit {
  public:
    explicit DescriptorLimit(rlim_t limit);
    ~DescriptorLimit();
    DescriptorLimit(const DescriptorLimit&) = delete;
    DescriptorLimit& operator=(const DescriptorLimit&) = delete;

  private:
    struct rlimit saved_ {};
};

inline BTHFileManager& manager() {
    return BTHFileManager::defaultManager();
}

inline Value dict(Value::Dictionary members) {
    return Value(std::move(members));
}

// Equality that also demands the same integer kinds and the same bits of
// floating-point numbers and dates, which Value's own == ignores.
::testing::AssertionResult identical(const Value& a, const Value& b, const std::string& at = "/");

// An error of `code` in the POSIX domain, with this description and function
// when they are given.
void expectPOSIXError(const BTHErrorRef& error, int code, const std::string& description = {},
                      const std::string& function = {});

// Waits until `condition` holds; false when `limit` passed first. The limit
// is there only so a broken program fails instead of hanging.
bool eventually(const std::function<bool()>& condition,
                std::chrono::milliseconds limit = std::chrono::seconds(60));

// Runs `body` in a forked child (as `user`, groups and all, when given) and
// gives its exit status, or 128 + the signal that ended it.
int inChild(const std::function<int()>& body, std::optional<uid_t> user = std::nullopt);

// A one-shot signal between threads.
class Event {
  public:
    void set();
    bool isSet() const;
    // False when `limit` passed first.
    bool wait(std::chrono::milliseconds limit = std::chrono::seconds(60));

  private:
    mutable std::mutex mutex_;
    std::condition_variable changed_;
    bool set_ = false;
};

// The app owning `tree` swapping its directory "victim" (and victim/inner)
// for links into `outside` (and outside/inner), over and over, while it lives.
class LinkSwapper {
  public:
    LinkSwapper(const std::filesystem::path& tree, const std::filesystem::path& outside);
    ~LinkSwapper();

  private:
    std::atomic<bool> stop_{false};
    std::thread thread_;
};

// Death tests of programs with threads re-run the test program in the child.
class ThreadsafeDeathTest : public ::testing::Test {
  protected:
    void SetUp() override { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
};

}  // namespace berth::test

// A death test whose statement would hang if the fault were not detected:
// the alarm ends the child then, and the test fails instead of hanging.
#define EXPECT_DEATH_BOUNDED(statement, regex) \
    EXPECT_DEATH(                              \
        {                                      \
            ::alarm(30);                       \
            statement;                         \
        },                                     \
        regex)

// Skips the current test, with the reason, when not running as root.
#define BERTH_REQUIRE_ROOT()                                               \
    do {                                                                   \
        if (::geteuid() != 0) GTEST_SKIP() << "needs root (run as uid 0)"; \
    } while (0)
