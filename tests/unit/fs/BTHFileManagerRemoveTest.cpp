// Removal of items and trees: missing items, immutable files and
// directories, items that cannot go, links, and a tree whose app swaps a
// subdirectory for a link while it is being removed.
#include <fcntl.h>
#include <sys/resource.h>

#include "TestSupport.h"
#include "platform/FileFlags.h"
#include "platform/UniqueFd.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using namespace test;

constexpr const char* kRemoveName = "-[BTHFileManager removeItemAtURL:error:]";

bool lexists(const stdfs::path& path) {
    struct stat st;
    return ::lstat(path.c_str(), &st) == 0;
}

bool setAppendOnly(const stdfs::path& path) {
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
    unsigned flags = 0;
    return fd && fileflags::get(fd.get(), &flags) == 0 &&
           fileflags::set(fd.get(), flags | fileflags::kAppend) == 0;
}

std::string removeFailure(const stdfs::path& path, int errnum) {
    return "removefile of " + path.string() + " failed: " + strerror(errnum);
}

TEST(BTHFileManagerRemove, MissingItemsAreNotAFailure) {
    ScratchDir dir;
    BTHErrorRef error;
    EXPECT_TRUE(manager().removeItemAtURL(dir / "missing", &error));
    EXPECT_TRUE(manager().removeItemAtURL(dir / "missing/parent/too", &error));
    EXPECT_FALSE(error);

    EXPECT_FALSE(manager().removeItemAtURL("", &error));
    expectPOSIXError(error, EFAULT, "nil url passed to -removeItemAtURL:error:");
}

TEST(BTHFileManagerRemove, RemovesWholeTreesIncludingItemsWithoutPermissions) {
    ScratchDir dir;
    const stdfs::path tree = dir / "tree";
    stdfs::create_directories(tree / "a/b/c");
    writeFile(tree / "a/file", "x");
    writeFile(tree / "a/b/c/file", "y");
    ASSERT_EQ(::mkfifo((tree / "a/fifo").c_str(), 0600), 0);
    ASSERT_EQ(::chmod((tree / "a/b/c/file").c_str(), 0), 0);
    ASSERT_EQ(::chmod((tree / "a/b").c_str(), 0), 0);
    BTHErrorRef error;
    EXPECT_TRUE(manager().removeItemAtURL(tree, &error)) << (error ? error->description() : "");
    EXPECT_FALSE(lexists(tree));

    const stdfs::path single = dir / "single";
    writeFile(single, "z");
    EXPECT_TRUE(manager().removeItemAtURL(single, &error));
    EXPECT_FALSE(lexists(single));
}

TEST(BTHFileManagerRemove, LinksAreRemovedNeverFollowed) {
    ScratchDir dir;
    ScratchDir outside;
    writeFile(outside / "keep", "k");
    stdfs::create_directories(dir / "tree/sub");
    stdfs::create_directory_symlink(outside.path(), dir / "tree/sub/to-outside");
    stdfs::create_directory_symlink(outside.path(), dir / "root-link");
    BTHErrorRef error;
    EXPECT_TRUE(manager().removeItemAtURL(dir / "tree", &error));
    EXPECT_TRUE(manager().removeItemAtURL(dir / "root-link", &error));
    EXPECT_FALSE(lexists(dir / "tree"));
    EXPECT_FALSE(lexists(dir / "root-link"));
    EXPECT_EQ(readFile(outside / "keep"), "k");

    // A link inside the path itself is not gone through.
    stdfs::create_directory_symlink(outside.path(), dir / "via");
    EXPECT_FALSE(manager().removeItemAtURL(dir / "via/keep", &error));
    expectPOSIXError(error, ELOOP);
    EXPECT_EQ(readFile(outside / "keep"), "k");
}

TEST(BTHFileManagerRemove, ImmutableFilesAreUnflaggedAndRemoved) {
    BERTH_REQUIRE_ROOT();
    ScratchDir dir;
    const stdfs::path tree = dir / "tree";
    stdfs::create_directories(tree / "deep/er");
    for (const char* f : {"top", "deep/er/frozen"}) {
        writeFile(tree / f, "x");
        ASSERT_TRUE(setImmutable(tree / f, true)) << "file system without immutable flag";
    }
    LogCapture log;
    BTHErrorRef error;
    EXPECT_TRUE(manager().removeItemAtURL(tree, &error)) << (error ? error->description() : "");
    EXPECT_FALSE(error);
    EXPECT_FALSE(lexists(tree));
    for (const char* f : {"top", "deep/er/frozen"}) {
        const std::string line = "Unset UF_IMMUTABLE on " + (tree / f).string();
        EXPECT_EQ(log.count(BTHLogLevelNotice, line), 1u) << line;
    }
    for (const auto& line : log.lines())
        EXPECT_TRUE(line.level != BTHLogLevelNotice || line.function == kRemoveName)
            << line.function;

    // An immutable file given directly goes the same way.
    writeFile(dir / "alone", "x");
    ASSERT_TRUE(setImmutable(dir / "alone", true));
    EXPECT_TRUE(manager().removeItemAtURL(dir / "alone", &error));
    EXPECT_FALSE(lexists(dir / "alone"));
}

TEST(BTHFileManagerRemove, ImmutableDirectoryFailsWithEPERMAndTheRestStillGoes) {
    BERTH_REQUIRE_ROOT();
    ScratchDir dir;
    const stdfs::path tree = dir / "tree";
    stdfs::create_directories(tree / "frozen");
    stdfs::create_directories(tree / "other/sub");
    writeFile(tree / "other/sub/file", "x");
    writeFile(tree / "sibling", "x");
    ASSERT_TRUE(setImmutable(tree / "frozen", true));
    LogCapture log;
    BTHErrorRef error;
    EXPECT_FALSE(manager().removeItemAtURL(tree, &error));
    expectPOSIXError(error, EPERM, removeFailure(tree, EPERM), kRemoveName);

    // The flag was cleared, its unlink failed and was logged; everything else went.
    const std::string frozen = (tree / "frozen").string();
    EXPECT_TRUE(log.contains(BTHLogLevelNotice, "Unset UF_IMMUTABLE on " + frozen));
    EXPECT_TRUE(log.contains(BTHLogLevelError, "unlink of " + frozen + " failed: "));
    EXPECT_TRUE(log.contains(BTHLogLevelError,
                             "removefile hit error for " + frozen + " : " + strerror(EPERM)));
    EXPECT_TRUE(lexists(tree / "frozen"));
    EXPECT_FALSE(lexists(tree / "other"));
    EXPECT_FALSE(lexists(tree / "sibling"));

    // With the flag gone, a second removal finishes the job.
    EXPECT_TRUE(manager().removeItemAtURL(tree, &error));
    EXPECT_FALSE(lexists(tree));
}

TEST(BTHFileManagerRemove, AnItemThatIsNotImmutableKeepsItsEPERM) {
    BERTH_REQUIRE_ROOT();
    ScratchDir dir;
    const stdfs::path tree = dir / "tree";
    stdfs::create_directories(tree);
    writeFile(tree / "log", "x");
    ASSERT_TRUE(setAppendOnly(tree / "log"));
    LogCapture log;
    BTHErrorRef error;
    EXPECT_FALSE(manager().removeItemAtURL(tree, &error));
    expectPOSIXError(error, EPERM);
    EXPECT_EQ(log.count(BTHLogLevelNotice, "Unset UF_IMMUTABLE"), 0u);
    EXPECT_TRUE(lexists(tree / "log"));

    // Clean up what the scratch directory cannot.
    UniqueFd fd(::open((tree / "log").c_str(), O_RDONLY | O_CLOEXEC));
    unsigned flags = 0;
    ASSERT_EQ(fileflags::get(fd.get(), &flags), 0);
    ASSERT_EQ(fileflags::set(fd.get(), flags & ~fileflags::kAppend), 0);
}

// The app owning a tree swaps one of its subdirectories for a link to a
// directory outside the tree, over and over, while the daemon removes the
// tree. Whatever the removal answers, nothing outside may go.
TEST(BTHFileManagerRemove, ASubdirectorySwappedForALinkMidRemovalNeverLeadsOutside) {
    BERTH_REQUIRE_ROOT();
    ScratchDir dir;
    ScratchDir outside;
    // The canary has the victim's shape, so a removal led through the link
    // finds names to remove there.
    constexpr int kCanaryFiles = 200;
    const std::vector<stdfs::path> canaries = [&] {
        std::vector<stdfs::path> files;
        stdfs::create_directories(outside / "canary/inner");
        for (int i = 0; i < kCanaryFiles; ++i)
            for (const char* d : {"canary/", "canary/inner/"})
                files.push_back(outside / (d + ("f" + std::to_string(i * 5))));
        for (const auto& f : files) writeFile(f, "c");
        return files;
    }();

    constexpr int kRounds = 6;
    constexpr int kFilesPerDirectory = 800;
    int removedTrees = 0;
    for (int round = 0; round < kRounds; ++round) {
        const stdfs::path tree = dir / ("tree" + std::to_string(round));
        for (const char* d : {"a", "victim", "victim/inner", "z"}) {
            stdfs::create_directories(tree / d);
            for (int i = 0; i < kFilesPerDirectory; ++i)
                writeFile(tree / d / ("f" + std::to_string(i)), "");
        }
        {
            const LinkSwapper app(tree, outside / "canary");
            BTHErrorRef error;
            if (manager().removeItemAtURL(tree, &error)) ++removedTrees;
        }
        for (const auto& f : canaries)
            ASSERT_TRUE(lexists(f)) << "round " << round << " removed " << f;
        std::error_code ec;
        stdfs::remove_all(tree, ec);
    }
    // Informational: how often the app's swaps made the removal fail.
    RecordProperty("TreesRemovedWhole", removedTrees);
}

// An app can build a directory chain far deeper than any path or descriptor
// budget allows; the removal still takes it apart, with few descriptors.
TEST(BTHFileManagerRemove, ChainsDeeperThanAnyPathAreRemovedWithFewDescriptors) {
    ScratchDir dir;
    const stdfs::path tree = dir / "deep";
    stdfs::create_directories(tree);
    makeDirectoryChain(tree, 3000, 500);
    BTHErrorRef error;
    bool removed = false;
    {
        DescriptorLimit tight(200);
        removed = manager().removeItemAtURL(tree, &error);
    }
    EXPECT_TRUE(removed) << (error ? error->description() : "");
    EXPECT_FALSE(lexists(tree));
}

}  // namespace
}  // namespace berth
