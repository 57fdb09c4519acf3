// Disk usage of a tree (agreement with du, hard links, links never followed,
// a link swapped in while the walk runs), the leftovers listing, and the
// protection-class operations on single items.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>

#include <cstdio>
#include <cstring>
#include <set>
#include <thread>

#include "TestSupport.h"
#include "platform/ProtectionClass.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using namespace test;

// A file of `size` bytes of real data (no holes).
void writeBytes(const stdfs::path& path, size_t size) {
    writeFile(path, std::string(size, 'b'));
}

uint64_t allocated(const stdfs::path& path) {
    return static_cast<uint64_t>(lstatOf(path).st_blocks) * 512;
}

// What GNU du reports for the tree, in bytes.
uint64_t duBytes(const stdfs::path& root) {
    const std::string command = "du -s -B1 '" + root.string() + "'";
    FILE* pipe = ::popen(command.c_str(), "r");
    if (!pipe) return 0;
    unsigned long long bytes = 0;
    if (std::fscanf(pipe, "%llu", &bytes) != 1) bytes = 0;
    ::pclose(pipe);
    return bytes;
}

// The blocks of the directories themselves (du counts them; a container's
// usage does not).
uint64_t directoryBlocks(const stdfs::path& root) {
    uint64_t total = allocated(root);
    for (const auto& entry : stdfs::recursive_directory_iterator(root))
        if (entry.is_directory() && !entry.is_symlink()) total += allocated(entry.path());
    return total;
}

TEST(BTHDiskUsage, AgreesWithDuLessTheDirectoriesOwnBlocks) {
    ScratchDir dir;
    const stdfs::path root = dir / "tree";
    stdfs::create_directories(root / "a/b/c");
    stdfs::create_directories(root / "empty");
    stdfs::create_directories(root / "Library/Caches");
    writeBytes(root / "one", 1);
    writeBytes(root / "a/big", 200000);
    writeBytes(root / "a/b/c/page", 4096);
    writeBytes(root / "Library/Caches/linked", 12000);
    stdfs::create_hard_link(root / "Library/Caches/linked", root / "a/b/second-link");
    stdfs::create_hard_link(root / "Library/Caches/linked", root / "third-link");
    stdfs::create_symlink("one", root / "link-to-one");
    {  // A sparse file: its length is far beyond what it occupies.
        UniqueFd fd(::open((root / "sparse").c_str(), O_CREAT | O_WRONLY | O_CLOEXEC, 0644));
        ASSERT_TRUE(fd);
        ASSERT_EQ(::ftruncate(fd.get(), 64 << 20), 0);
        ASSERT_EQ(::pwrite(fd.get(), "x", 1, 1 << 20), 1);
    }
    ASSERT_EQ(::mkfifo((root / "a/fifo").c_str(), 0600), 0);

    const uint64_t usage = manager().diskUsageForURL(root);
    EXPECT_EQ(usage, duBytes(root) - directoryBlocks(root));
    EXPECT_LT(usage, uint64_t{2} << 20);  // allocation, not the sparse file's length
}

TEST(BTHDiskUsage, CountsAFileWithSeveralLinksOncePerCall) {
    ScratchDir dir;
    stdfs::create_directories(dir / "sub");
    writeBytes(dir / "file", 8192);
    stdfs::create_hard_link(dir / "file", dir / "sub/again");
    stdfs::create_hard_link(dir / "file", dir / "again");
    LogCapture log;
    EXPECT_EQ(manager().diskUsageForURL(dir.path()), allocated(dir / "file"));
    EXPECT_EQ(log.count(7, "Skipping hardlinked file at"), 2u);
    // A second call counts it again: the set of counted files is per call.
    EXPECT_EQ(manager().diskUsageForURL(dir.path()), allocated(dir / "file"));
}

// An app may nest its directories deeper than any path the kernel takes in
// one call: what lies at the bottom is still counted.
TEST(BTHDiskUsage, ReachesTheBottomOfAChainLongerThanAnyPath) {
    ScratchDir dir;
    // 40 names of 250 bytes: a path far beyond what the kernel takes.
    UniqueFd level = makeDirectoryChain(dir.path(), 40, 0, std::string(250, 'n'));
    ASSERT_TRUE(level);
    UniqueFd file(::openat(level.get(), "data", O_WRONLY | O_CREAT | O_CLOEXEC, 0644));
    const std::vector<char> bytes(8192, 'x');
    ASSERT_EQ(::write(file.get(), bytes.data(), bytes.size()), 8192);
    ASSERT_EQ(::fsync(file.get()), 0);
    struct stat st {};
    ASSERT_EQ(::fstat(file.get(), &st), 0);
    ASSERT_GT(st.st_blocks, 0);

    LogCapture log;
    EXPECT_EQ(manager().diskUsageForURL(dir.path()), static_cast<uint64_t>(st.st_blocks) * 512);
    EXPECT_FALSE(log.contains(3, "Failed to open directory"));
}

TEST(BTHDiskUsage, FollowsNoLinkAndReadsNothingBelowAMissingRoot) {
    ScratchDir dir;
    ScratchDir outside;
    writeBytes(outside / "large", 1 << 20);
    stdfs::create_directory_symlink(outside.path(), dir / "root-link");
    stdfs::create_directories(dir / "tree");
    stdfs::create_directory_symlink(outside.path(), dir / "tree/inner-link");
    stdfs::create_symlink(outside / "large", dir / "tree/file-link");

    LogCapture log;
    EXPECT_EQ(manager().diskUsageForURL(dir / "root-link"), 0u);
    EXPECT_TRUE(log.contains(3, "Failed to open directory " + (dir / "root-link").string()));
    // Links inside are counted as the links they are (a few bytes at most).
    EXPECT_LT(manager().diskUsageForURL(dir / "tree"), 8192u);
    EXPECT_EQ(manager().diskUsageForURL(dir / "missing"), 0u);
    EXPECT_EQ(manager().diskUsageForURL(stdfs::path()), 0u);
    EXPECT_TRUE(log.contains(3, "Failed to get path to url"));
}

// An app that swaps one of its directories for a link to somewhere else over
// and over while its container is measured: whatever moment the walk meets,
// nothing outside is ever counted.
TEST(BTHDiskUsage, ALinkSwappedInMidWalkNeverLeadsOutside) {
    ScratchDir dir;
    ScratchDir outside;
    constexpr size_t kOutsideSize = 4 << 20;
    writeBytes(outside / "elsewhere", kOutsideSize);
    // Named like the directory inside, so a walk that resolved a path through
    // the link would find it there.
    stdfs::create_directories(outside / "inner");
    writeBytes(outside / "inner/more", kOutsideSize);
    const stdfs::path root = dir / "container";
    for (int i = 0; i < 40; ++i) {
        stdfs::create_directories(root / ("d" + std::to_string(i)) / "swap/inner");
        writeBytes(root / ("d" + std::to_string(i)) / "swap/inner/own", 4096);
        stdfs::create_directory_symlink(outside.path(), root / ("d" + std::to_string(i)) / "link");
    }
    const uint64_t full = manager().diskUsageForURL(root);
    ASSERT_GT(full, 0u);
    ASSERT_LT(full, kOutsideSize);

    std::atomic<bool> stop{false};
    std::thread swapper([&] {
        while (!stop.load()) {
            for (int i = 0; i < 40; ++i) {
                const stdfs::path d = root / ("d" + std::to_string(i));
                ::renameat2(AT_FDCWD, (d / "swap").c_str(), AT_FDCWD, (d / "link").c_str(),
                            RENAME_EXCHANGE);
            }
        }
    });
    LogCapture log;
    bool sawSwap = false;
    for (int round = 0; round < 200; ++round) {
        const uint64_t usage = manager().diskUsageForURL(root);
        // Entries renamed during a directory read may be listed twice, so
        // the total may shift a little; anything outside would add megabytes.
        EXPECT_LT(usage, kOutsideSize) << "round " << round;
        sawSwap = sawSwap || usage != full;
    }
    stop = true;
    swapper.join();
    EXPECT_TRUE(sawSwap || log.contains(3, "Failed to open directory"))
        << "the swapper never hit the walk; the test proved nothing";
}

TEST(BTHDiskUsage, ListsLeftoversWithoutChangingThem) {
    ScratchDir dir;
    stdfs::create_directories(dir / "left/over");
    writeFile(dir / "left/over/file", "x");
    stdfs::create_symlink("nowhere", dir / "left/dangling");
    LogCapture log;
    manager().printDirectoryStructureAtURL(dir / "left");
    std::multiset<std::string> listed;
    for (const LogCapture::Line& line : log.lines())
        if (line.level == 3) listed.insert(line.message);
    std::multiset<std::string> expected;
    for (const char* item : {"left", "left/over", "left/over/file", "left/dangling"})
        expected.insert("\tOrphaned File: " + (dir / item).string());
    EXPECT_EQ(listed, expected);
    EXPECT_TRUE(stdfs::exists(dir / "left/over/file"));
    manager().printDirectoryStructureAtURL(dir / "absent");
    EXPECT_TRUE(log.contains(3, "FTS returned error for " + (dir / "absent").string()));
}

TEST(BTHFileManagerProtection, SetsReadsAndAsksThePredicateFirst) {
    ScratchDir dir;
    stdfs::create_directories(dir / "sub");
    writeFile(dir / "sub/file", "x");
    int32_t value = -1;
    BTHErrorRef error;
    ASSERT_TRUE(manager().setDataProtectionClassOfItemAtURL(dir / "sub", 3, nullptr, &error))
        << error->description();
    ASSERT_TRUE(manager().dataProtectionClassOfItemAtURL(dir / "sub/file", &value, &error));
    EXPECT_EQ(value, 3);  // inherited from the directory

    std::vector<int32_t> asked;
    auto refuse = [&](int32_t current) {
        asked.push_back(current);
        return false;
    };
    ASSERT_TRUE(manager().setDataProtectionClassOfItemAtURL(dir / "sub/file", 4, refuse, &error));
    ASSERT_TRUE(manager().dataProtectionClassOfItemAtURL(dir / "sub/file", &value, &error));
    EXPECT_EQ(value, 3);
    EXPECT_EQ(asked, std::vector<int32_t>{3});
    ASSERT_TRUE(manager().setDataProtectionClassOfItemAtURL(
        dir / "sub/file", 4, [](int32_t) { return true; }, &error));
    ASSERT_TRUE(manager().dataProtectionClassOfItemAtURL(dir / "sub/file", &value, &error));
    EXPECT_EQ(value, 4);
}

TEST(BTHFileManagerProtection, NeverActsThroughALink) {
    ScratchDir dir;
    writeFile(dir / "target", "x");
    stdfs::create_symlink(dir / "target", dir / "link");
    BTHErrorRef error;
    EXPECT_FALSE(manager().setDataProtectionClassOfItemAtURL(dir / "link", 1, nullptr, &error));
    const std::string loop = "Failed to open " + (dir / "link").string() + " : " + strerror(ELOOP);
    expectPOSIXError(error, ELOOP, loop);
    char bytes[4];
    EXPECT_LT(::getxattr((dir / "target").c_str(), protection::kAttributeName, bytes, 4), 0);
    int32_t value = 0;
    EXPECT_FALSE(manager().dataProtectionClassOfItemAtURL(dir / "link", &value, &error));
    expectPOSIXError(error, ELOOP, loop);
    EXPECT_FALSE(manager().dataProtectionClassOfItemAtURL(dir / "missing", &value, &error));
    expectPOSIXError(error, ENOENT,
                     "Failed to open " + (dir / "missing").string() + " : " + strerror(ENOENT));
}

}  // namespace
}  // namespace berth
