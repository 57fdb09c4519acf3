// Shared helpers of the test programs: scratch directories, a view of what
// the daemon logged, and the root check of tests that need privileges.
#pragma once

#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <mutex>
#include <string>
#include <vector>

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

// Sets or clears the immutable flag of `path` (not following a link).
bool setImmutable(const std::filesystem::path& path, bool on);

}  // namespace berth::test

// Skips the current test, with the reason, when not running as root.
#define BERTH_REQUIRE_ROOT()                                               \
    do {                                                                   \
        if (::geteuid() != 0) GTEST_SKIP() << "needs root (run as uid 0)"; \
    } while (0)
