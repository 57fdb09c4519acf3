// Directory creation, temporary directories, listings and existence tests.
#include "BTHFileManager.h"

#include <fcntl.h>

#include <cctype>

#include "TestSupport.h"
#include "platform/ProtectionClass.h"
#include "platform/UniqueFd.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using namespace test;

int32_t classOf(const stdfs::path& path) {
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
    int32_t value = -100;
    EXPECT_EQ(protection::getClass(fd.get(), &value, [] { return false; }), 0) << path;
    return value;
}

constexpr const char* kCreateName =
    "-[BTHFileManager createDirectoryAtURL:withIntermediateDirectories:mode:owner:class:error:]";

TEST(BTHFileManagerCreateDirectory, CreatesMissingParentsWithModeOwnerAndClass) {
    BERTH_REQUIRE_ROOT();
    ScratchDir dir;
    const mode_t oldMask = ::umask(0);
    BTHErrorRef error;
    const stdfs::path leaf = dir / "a/b/c";
    ASSERT_TRUE(manager().createDirectoryAtURL(leaf, true, 0751, 501, 3, &error));
    ::umask(oldMask);
    EXPECT_FALSE(error);
    for (const char* p : {"a", "a/b", "a/b/c"}) {
        struct stat st = lstatOf(dir / p);
        EXPECT_TRUE(S_ISDIR(st.st_mode)) << p;
        EXPECT_EQ(st.st_mode & 07777, 0751u) << p;
    }
    // Owner and class go on the directory asked for, not on its parents.
    EXPECT_EQ(lstatOf(leaf).st_uid, 501u);
    EXPECT_EQ(lstatOf(leaf).st_gid, 501u);
    EXPECT_EQ(lstatOf(dir / "a").st_uid, 0u);
    EXPECT_EQ(classOf(leaf), 3);
    EXPECT_EQ(classOf(dir / "a/b"), 0);
}

TEST(BTHFileManagerCreateDirectory, ExistingDirectoryKeepsItsModeButTakesOwnerAndClass) {
    BERTH_REQUIRE_ROOT();
    ScratchDir dir;
    const stdfs::path existing = dir / "existing";
    ASSERT_EQ(::mkdir(existing.c_str(), 0700), 0);
    ASSERT_EQ(::chmod(existing.c_str(), 0700), 0);
    for (bool intermediates : {true, false}) {
        BTHErrorRef error;
        ASSERT_TRUE(manager().createDirectoryAtURL(existing, intermediates, 0755, 501,
                                                   intermediates ? 4 : 2, &error));
        struct stat st = lstatOf(existing);
        EXPECT_EQ(st.st_mode & 07777, 0700u);
        EXPECT_EQ(st.st_uid, 501u);
        EXPECT_EQ(st.st_gid, 501u);
        EXPECT_EQ(classOf(existing), intermediates ? 4 : 2);
    }
    // Owner 0 and class -1 leave both alone.
    ASSERT_EQ(::chown(existing.c_str(), 7, 8), 0);
    ASSERT_TRUE(manager().createDirectoryAtURL(existing, false, 0755, nullptr));
    EXPECT_EQ(lstatOf(existing).st_uid, 7u);
    EXPECT_EQ(lstatOf(existing).st_gid, 8u);
    EXPECT_EQ(classOf(existing), 2);
}

TEST(BTHFileManagerCreateDirectory, FailuresCarryTheirCallAndErrorNumber) {
    BERTH_REQUIRE_ROOT();
    ScratchDir dir;
    BTHErrorRef error;
    const stdfs::path orphan = dir / "missing/child";
    EXPECT_FALSE(manager().createDirectoryAtURL(orphan, false, 0755, &error));
    expectPOSIXError(error, ENOENT, "mkdir of " + orphan.string() + " failed: " + strerror(ENOENT),
                     kCreateName);
    EXPECT_FALSE(stdfs::exists(dir / "missing"));

    writeFile(dir / "file", "x");
    const stdfs::path underFile = dir / "file/child";
    error.reset();
    EXPECT_FALSE(manager().createDirectoryAtURL(underFile, true, 0755, &error));
    expectPOSIXError(error, ENOTDIR,
                     "mkpath_np of " + underFile.string() + " failed: " + strerror(ENOTDIR),
                     kCreateName);

    // A file already at the path passes the creation step; the class step
    // then cannot open it as a directory.
    error.reset();
    EXPECT_TRUE(manager().createDirectoryAtURL(dir / "file", true, 0755, &error));
    EXPECT_FALSE(manager().createDirectoryAtURLWithClass(dir / "file", true, 0755, 3, &error));
    expectPOSIXError(error, ENOTDIR,
                     "opendir of " + (dir / "file").string() + " failed: " + strerror(ENOTDIR),
                     kCreateName);

    // An immutable directory refuses its class.
    ASSERT_EQ(::mkdir((dir / "frozen").c_str(), 0755), 0);
    ASSERT_TRUE(setImmutable(dir / "frozen", true));
    error.reset();
    EXPECT_FALSE(manager().createDirectoryAtURLWithClass(dir / "frozen", false, 0755, 3, &error));
    expectPOSIXError(
        error, EPERM,
        "Failed to setclass(3) on directory " + (dir / "frozen").string() + ": " + strerror(EPERM),
        kCreateName);
}

TEST(BTHFileManagerCreateDirectory, NeverCreatesOrChangesAnythingThroughALink) {
    BERTH_REQUIRE_ROOT();
    ScratchDir dir;
    ScratchDir outside;
    ASSERT_EQ(::symlink(outside.path().c_str(), (dir / "link").c_str()), 0);
    BTHErrorRef error;
    EXPECT_FALSE(manager().createDirectoryAtURL(dir / "link/new/deeper", true, 0755, &error));
    expectPOSIXError(error, ELOOP);
    EXPECT_FALSE(manager().createDirectoryAtURL(dir / "link/new", false, 0755, &error));
    expectPOSIXError(error, ELOOP);
    EXPECT_FALSE(stdfs::exists(outside / "new"));

    // A link as the last component is taken as existing, but neither owner
    // nor class reach its target.
    const struct stat before = lstatOf(outside.path());
    EXPECT_TRUE(manager().createDirectoryAtURL(dir / "link", false, 0755, 501, &error));
    EXPECT_EQ(lstatOf(outside.path()).st_uid, before.st_uid);
    EXPECT_FALSE(manager().createDirectoryAtURLWithClass(dir / "link", false, 0755, 3, &error));
    expectPOSIXError(error, ELOOP);
    EXPECT_EQ(classOf(outside.path()), 0);
}

TEST(BTHFileManagerTemporaryDirectory, MakesAFreshPrivateDirectoryPerCall) {
    ScratchDir dir;
    BTHErrorRef error = BTHCreatePOSIXError("earlier", 1, EIO, "left over");
    std::set<std::string> names;
    for (int i = 0; i < 20; ++i) {
        auto made = manager().createTemporaryDirectoryInDirectoryURL(dir.path(), &error);
        ASSERT_TRUE(made);
        EXPECT_FALSE(error);  // cleared, even on success
        EXPECT_TRUE(made->isDirectory);
        EXPECT_EQ(made->path.parent_path(), dir.path());
        const std::string name = made->path.filename();
        ASSERT_EQ(name.size(), 11u) << name;
        EXPECT_EQ(name.substr(0, 5), "temp.");
        for (char c : name.substr(5)) EXPECT_TRUE(std::isalnum(static_cast<unsigned char>(c)));
        struct stat st = lstatOf(made->path);
        EXPECT_TRUE(S_ISDIR(st.st_mode));
        EXPECT_EQ(st.st_mode & 077, 0u);
        names.insert(name);
    }
    EXPECT_EQ(names.size(), 20u);

    auto prefixed =
        manager().createTemporaryDirectoryInDirectoryURL(dir.path(), "sys.kelp.Assets.", &error);
    ASSERT_TRUE(prefixed);
    EXPECT_EQ(prefixed->path.filename().string().rfind("sys.kelp.Assets.", 0), 0u);

    EXPECT_FALSE(manager().createTemporaryDirectoryInDirectoryURL(dir / "missing", &error));
    expectPOSIXError(
        error, ENOENT,
        "Failed to create temp dir at path " + (dir / "missing/temp.XXXXXX").string() + " : " +
            strerror(ENOENT),
        "-[BTHFileManager createTemporaryDirectoryInDirectoryURL:withNamePrefix:error:]");
}

TEST(BTHFileManagerListing, ListsVisibleNamesAndFlagsDirectories) {
    ScratchDir dir;
    stdfs::create_directories(dir / "sub");
    stdfs::create_directories(dir / ".hidden-dir");
    writeFile(dir / "file", "");
    writeFile(dir / ".hidden", "");
    stdfs::create_directory_symlink(dir / "sub", dir / "dirlink");
    LogCapture log;
    BTHErrorRef error;
    auto items = manager().urlsForItemsInDirectoryAtURL(dir.path(), &error);
    ASSERT_TRUE(items);
    std::vector<BTHFileURL> sorted = *items;
    std::sort(sorted.begin(), sorted.end(),
              [](const BTHFileURL& a, const BTHFileURL& b) { return a.path < b.path; });
    const std::vector<BTHFileURL> expected = {
        {dir / "dirlink", false}, {dir / "file", false}, {dir / "sub", true}};
    EXPECT_EQ(sorted, expected);

    // A missing directory fails quietly; any other failure is logged.
    EXPECT_FALSE(manager().urlsForItemsInDirectoryAtURL(dir / "missing", &error));
    expectPOSIXError(error, ENOENT);
    EXPECT_TRUE(log.lines().empty());
    EXPECT_FALSE(manager().urlsForItemsInDirectoryAtURL(dir / "file", &error));
    expectPOSIXError(error, ENOTDIR);
    const std::string line =
        "opendir of " + (dir / "file").string() + " failed: " + strerror(ENOTDIR);
    ASSERT_EQ(log.count(BTHLogLevelError, line), 1u);
    EXPECT_EQ(log.lines().back().function, "_IterateDirectory");
}

TEST(BTHFileManagerExistence, TheTwoTestsAgreeOnlyWhenTheAnswerIsKnown) {
    BERTH_REQUIRE_ROOT();
    ScratchDir dir;
    ASSERT_EQ(::chmod(dir.path().c_str(), 0755), 0);
    writeFile(dir / "file", "");
    stdfs::create_symlink(dir / "nowhere", dir / "dangling");
    for (const char* present : {"file", "dangling"}) {
        EXPECT_TRUE(manager().itemExistsAtURL(dir / present)) << present;
        EXPECT_FALSE(manager().itemDoesNotExistAtURL(dir / present)) << present;
    }
    LogCapture log;
    EXPECT_FALSE(manager().itemExistsAtURL(dir / "missing"));
    EXPECT_TRUE(manager().itemDoesNotExistAtURL(dir / "missing"));
    EXPECT_TRUE(log.lines().empty());

    // Behind a directory the caller may not search: neither answer is true,
    // and both say why.
    stdfs::create_directories(dir / "closed");
    writeFile(dir / "closed/item", "");
    ASSERT_EQ(::chmod((dir / "closed").c_str(), 0700), 0);
    const stdfs::path hidden = dir / "closed/item";
    EXPECT_EQ(inChild(
                  [&] {
                      LogCapture childLog;
                      if (manager().itemExistsAtURL(hidden)) return 1;
                      if (manager().itemDoesNotExistAtURL(hidden)) return 2;
                      const std::string line = "Failed to determine if " + hidden.string() +
                                               " exists: " + strerror(EACCES);
                      return childLog.count(BTHLogLevelError, line) == 2 ? 0 : 3;
                  },
                  65534),
              0);
}

}  // namespace
}  // namespace berth
