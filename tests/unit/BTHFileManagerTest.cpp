// Directory creation, temporary directories, listings and existence tests.
#include "BTHFileManager.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <set>

#include "TestSupport.h"
#include "platform/ProtectionClass.h"
#include "platform/UniqueFd.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using test::ScratchDir;

BTHFileManager& manager() {
    return BTHFileManager::defaultManager();
}

struct stat lstatOf(const stdfs::path& path) {
    struct stat st {};
    EXPECT_EQ(::lstat(path.c_str(), &st), 0) << path;
    return st;
}

int32_t classOf(const stdfs::path& path) {
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
    int32_t value = -100;
    EXPECT_EQ(protection::getClass(fd.get(), &value, [] { return false; }), 0) << path;
    return value;
}

void expectPOSIXError(const BTHErrorRef& error, int code, const std::string& description,
                      const std::string& function) {
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->isPOSIXError(code)) << error->description();
    EXPECT_EQ(error->localizedDescription(), description);
    EXPECT_EQ(error->functionName(), function);
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

    test::writeFile(dir / "file", "x");
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
    ASSERT_TRUE(test::setImmutable(dir / "frozen", true));
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
    EXPECT_TRUE(error && error->isPOSIXError(ELOOP));
    EXPECT_FALSE(manager().createDirectoryAtURL(dir / "link/new", false, 0755, &error));
    EXPECT_TRUE(error && error->isPOSIXError(ELOOP));
    EXPECT_FALSE(stdfs::exists(outside / "new"));

    // A link as the last component is taken as existing, but neither owner
    // nor class reach its target.
    const struct stat before = lstatOf(outside.path());
    EXPECT_TRUE(manager().createDirectoryAtURL(dir / "link", false, 0755, 501, &error));
    EXPECT_EQ(lstatOf(outside.path()).st_uid, before.st_uid);
    EXPECT_FALSE(manager().createDirectoryAtURLWithClass(dir / "link", false, 0755, 3, &error));
    EXPECT_TRUE(error && error->isPOSIXError(ELOOP));
    EXPECT_EQ(classOf(outside.path()), 0);
}

}  // namespace
}  // namespace berth
