// Operations that meet a second file system: moves across file systems,
// and walks and removals that must not enter a mount inside their tree. The
// test process gets a private mount namespace, so its tmpfs mounts are seen
// by nobody else and vanish with it.
#include <sched.h>
#include <sys/mount.h>
#include <sys/xattr.h>

#include "TestSupport.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using namespace test;
using Kind = BTHWalkEntry::Kind;
using Kinds = std::map<std::string, std::vector<Kind>>;

class BTHFileManagerCrossDevice : public ::testing::Test {
  protected:
    static void SetUpTestSuite() {
        if (::geteuid() != 0) return;
        if (::unshare(CLONE_NEWNS) != 0 ||
            ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0)
            namespaceError_ = strerror(errno);
        else
            privateNamespace_ = true;
    }

    void SetUp() override {
        BERTH_REQUIRE_ROOT();
        if (!privateNamespace_) GTEST_SKIP() << "no private mount namespace: " << namespaceError_;
    }

    void TearDown() override {
        for (auto it = mounts_.rbegin(); it != mounts_.rend(); ++it)
            ::umount2(it->c_str(), MNT_DETACH);
    }

    void mountTmpfs(const stdfs::path& at, const char* options = "mode=0755") {
        stdfs::create_directories(at);
        ASSERT_EQ(::mount("tmpfs", at.c_str(), "tmpfs", 0, options), 0) << strerror(errno);
        mounts_.push_back(at);
    }

    void bindMount(const stdfs::path& from, const stdfs::path& at) {
        ASSERT_EQ(::mount(from.c_str(), at.c_str(), nullptr, MS_BIND, nullptr), 0)
            << strerror(errno);
        mounts_.push_back(at);
    }

    ScratchDir dir_;
    std::vector<stdfs::path> mounts_;
    static inline bool privateNamespace_ = false;
    static inline std::string namespaceError_;
};

// The kinds of entries the walk of `root` delivered, by relative path.
Kinds walked(const stdfs::path& root) {
    Kinds seen;
    BTHErrorRef error;
    EXPECT_TRUE(manager().traverseDirectory(root, &error, [&](const BTHWalkEntry& e, BTHErrorRef*) {
        seen[e.path.lexically_relative(root).string()].push_back(e.kind);
        return true;
    }));
    return seen;
}

void buildSource(const stdfs::path& source) {
    stdfs::create_directories(source / "sub");
    writeFile(source / "sub/file", "contents");
    ASSERT_EQ(::chown((source / "sub/file").c_str(), 501, 502), 0);
    ASSERT_EQ(::chmod((source / "sub/file").c_str(), 0604), 0);
    ASSERT_EQ(
        ::setxattr((source / "sub").c_str(), "trusted.berth.protection_class", "\x04\0\0\0", 4, 0),
        0);
    stdfs::create_symlink("sub/file", source / "link");
}

TEST_F(BTHFileManagerCrossDevice, MoveCopiesThenRemovesTheSource) {
    const stdfs::path source = dir_ / "source", volume = dir_ / "volume";
    buildSource(source);
    mountTmpfs(volume);
    const stdfs::path dest = volume / "moved";
    ASSERT_NE(::rename(source.c_str(), dest.c_str()), 0);
    ASSERT_EQ(errno, EXDEV);

    BTHErrorRef error;
    ASSERT_TRUE(manager().moveItemAtURL(source, dest, &error))
        << (error ? error->description() : "");
    EXPECT_FALSE(stdfs::exists(stdfs::symlink_status(source)));
    EXPECT_EQ(readFile(dest / "sub/file"), "contents");
    const struct stat file = lstatOf(dest / "sub/file");
    EXPECT_EQ(file.st_uid, 501u);
    EXPECT_EQ(file.st_gid, 502u);
    EXPECT_EQ(file.st_mode & 07777, 0604u);
    char value[4] = {};
    EXPECT_EQ(::getxattr((dest / "sub").c_str(), "trusted.berth.protection_class", value, 4), 4);
    EXPECT_EQ(value[0], 4);
    EXPECT_EQ(stdfs::read_symlink(dest / "link"), "sub/file");
}

TEST_F(BTHFileManagerCrossDevice, ASourceThatWillNotGoIsLoggedAndTheMoveStillSucceeds) {
    const stdfs::path source = dir_ / "source", volume = dir_ / "volume";
    buildSource(source);
    writeFile(source / "frozen", "f");
    ASSERT_TRUE(setImmutable(source / "frozen", true));
    mountTmpfs(volume);
    LogCapture log;
    BTHErrorRef error;
    EXPECT_TRUE(manager().moveItemAtURL(source, volume / "moved", &error));
    EXPECT_FALSE(error);
    EXPECT_TRUE(log.contains(
        BTHLogLevelError, "Failed to remove source " + source.string() + " : " + strerror(EPERM)));
    EXPECT_EQ(readFile(volume / "moved/frozen"), "f");
    EXPECT_TRUE(stdfs::exists(source / "frozen"));
    EXPECT_FALSE(stdfs::exists(source / "sub"));  // the rest of the source went
    setImmutable(volume / "moved/frozen", false);
}

TEST_F(BTHFileManagerCrossDevice, AFailedCopyFailsTheMoveAndLeavesTheSourceAlone) {
    const stdfs::path source = dir_ / "source", volume = dir_ / "volume";
    buildSource(source);
    const std::string big(1 << 20, 'b');
    writeFile(source / "sub/big", big);
    mountTmpfs(volume, "size=64k,mode=0755");
    const stdfs::path dest = volume / "moved";
    BTHErrorRef error;
    EXPECT_FALSE(manager().moveItemAtURL(source, dest, &error));
    expectPOSIXError(
        error, ENOSPC,
        "copyfile of " + source.string() + " to " + dest.string() + " failed: " + strerror(ENOSPC),
        "-[BTHFileManager _copyItemAtURL:toURL:failIfSrcMissing:error:]");
    EXPECT_EQ(readFile(source / "sub/big"), big);
    EXPECT_EQ(readFile(source / "sub/file"), "contents");
    EXPECT_FALSE(stdfs::exists(stdfs::symlink_status(dest)));  // no half copy left behind
}

TEST_F(BTHFileManagerCrossDevice, WalkAndRemovalStayOnTheirOwnFileSystem) {
    const stdfs::path root = dir_ / "root";
    stdfs::create_directories(root / "plain");
    writeFile(root / "plain/file", "");
    mountTmpfs(root / "mnt");
    writeFile(root / "mnt/inside", "other file system");

    const Kinds expected = {
        {".", {Kind::DirectoryPre, Kind::DirectoryPost}},
        {"plain", {Kind::DirectoryPre, Kind::DirectoryPost}},
        {"plain/file", {Kind::File}},
        {"mnt", {Kind::DirectoryPre, Kind::DirectoryPost}},
    };
    EXPECT_EQ(walked(root), expected);
    BTHErrorRef error;
    EXPECT_FALSE(manager().removeItemAtURL(root, &error));
    expectPOSIXError(error, EXDEV);
    EXPECT_EQ(readFile(root / "mnt/inside"), "other file system");
    EXPECT_FALSE(stdfs::exists(root / "plain"));
}

TEST_F(BTHFileManagerCrossDevice, ADirectoryMountedInsideItselfIsACycleNotEntered) {
    const stdfs::path root = dir_ / "root";
    stdfs::create_directories(root / "sub/loop");
    writeFile(root / "file", "");
    bindMount(root, root / "sub/loop");
    const Kinds expected = {
        {".", {Kind::DirectoryPre, Kind::DirectoryPost}},
        {"file", {Kind::File}},
        {"sub", {Kind::DirectoryPre, Kind::DirectoryPost}},
        {"sub/loop", {Kind::DirectoryCycle}},
    };
    EXPECT_EQ(walked(root), expected);
}

}  // namespace
}  // namespace berth
