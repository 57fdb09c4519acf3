// The link-safe toolkit: no link followed in any component, items checked
// against what lstat saw. (Making paths is covered through directory
// creation in the file manager's tests.)
#include "platform/SafeFs.h"

#include <fcntl.h>

#include "ScratchDeviceRoot.h"
#include "TestSupport.h"
#include "platform/DeviceRoot.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using test::ScratchDir;

TEST(SafeFsTest, OpeningAndRenamingRefuseLinksInAnyComponent) {
    ScratchDir dir;
    ScratchDir outside;
    test::writeFile(outside / "target", "t");
    stdfs::create_directory_symlink(outside.path(), dir / "dirlink");
    stdfs::create_symlink(outside / "target", dir / "filelink");

    for (const auto& [path, flags] : {std::pair{dir / "dirlink/target", O_RDONLY},
                                      {dir / "dirlink", O_RDONLY | O_DIRECTORY},
                                      {dir / "filelink", O_RDONLY}}) {
        EXPECT_FALSE(fs::openNoFollow(path, flags)) << path;
        EXPECT_EQ(errno, ELOOP) << path;
    }

    // A link as the last component is described and renamed itself.
    struct stat st;
    ASSERT_EQ(fs::lstatNoFollow(dir / "filelink", &st), 0);
    EXPECT_TRUE(S_ISLNK(st.st_mode));
    EXPECT_EQ(fs::lstatNoFollow(dir / "dirlink/target", &st), ELOOP);
    EXPECT_EQ(fs::existsNoFollow(dir / "filelink"), 0);
    EXPECT_EQ(fs::existsNoFollow(dir / "dirlink/target"), ELOOP);
    EXPECT_EQ(fs::existsNoFollow(dir / "missing"), ENOENT);
    EXPECT_EQ(fs::renameNoFollow(dir / "filelink", dir / "renamed"), 0);
    EXPECT_TRUE(stdfs::is_symlink(dir / "renamed"));
    EXPECT_EQ(fs::renameNoFollow(dir / "dirlink/target", dir / "stolen"), ELOOP);
    EXPECT_EQ(fs::renameNoFollow(dir / "renamed", dir / "dirlink/moved"), ELOOP);
    EXPECT_EQ(test::readFile(outside / "target"), "t");

    // chmod by name changes the item, never a link's target.
    const mode_t before = test::lstatOf(outside / "target").st_mode;
    UniqueFd parent = fs::openNoFollow(dir.path(), O_PATH | O_DIRECTORY);
    EXPECT_NE(fs::chmodAtNoFollow(parent.get(), "renamed", 0600), 0);
    EXPECT_EQ(test::lstatOf(outside / "target").st_mode, before);
}

TEST(SafeFsTest, CheckedOpensRefuseAnItemOtherThanTheOneSeen) {
    ScratchDir dir;
    stdfs::create_directories(dir / "d");
    test::writeFile(dir / "f", "");
    UniqueFd parent = fs::openNoFollow(dir.path(), O_RDONLY | O_DIRECTORY);
    struct stat seen;
    ASSERT_EQ(::fstatat(parent.get(), "d", &seen, AT_SYMLINK_NOFOLLOW), 0);
    EXPECT_TRUE(fs::openDirectoryChecked(parent.get(), "d", seen));

    // Replaced by another directory, then by a link: both refused.
    stdfs::rename(dir / "d", dir / "old");
    stdfs::create_directories(dir / "d");
    EXPECT_FALSE(fs::openDirectoryChecked(parent.get(), "d", seen));
    EXPECT_EQ(errno, ESTALE);
    stdfs::remove(dir / "d");
    stdfs::create_directory_symlink(dir / "old", dir / "d");
    EXPECT_FALSE(fs::openDirectoryChecked(parent.get(), "d", seen));
    EXPECT_TRUE(errno == ELOOP || errno == ENOTDIR) << strerror(errno);

    ASSERT_EQ(::fstatat(parent.get(), "f", &seen, AT_SYMLINK_NOFOLLOW), 0);
    EXPECT_TRUE(fs::openItemChecked(parent.get(), "f", seen));
    ASSERT_EQ(::mkfifo((dir / "fifo").c_str(), 0600), 0);
    ASSERT_EQ(::fstatat(parent.get(), "fifo", &seen, AT_SYMLINK_NOFOLLOW), 0);
    EXPECT_FALSE(fs::openItemChecked(parent.get(), "fifo", seen));  // never opened
}

// The daemon keeps its root open; opens beneath it still refuse links and
// never climb out of it.
TEST(SafeFsTest, OpensBeneathAKeptDeviceRootStillRefuseLinksAndStayInside) {
    const stdfs::path& root = test::installScratchDeviceRoot();
    if (DeviceRoot::path() != root) GTEST_SKIP() << "this process fixed its device root earlier";
    ASSERT_TRUE(DeviceRoot::keepOpen());
    const int kept = DeviceRoot::descriptor();
    ASSERT_GE(kept, 0);
    ASSERT_TRUE(DeviceRoot::keepOpen());
    EXPECT_EQ(DeviceRoot::descriptor(), kept);

    stdfs::create_directories(root / "private/var/kept/dir");
    test::writeFile(root / "private/var/kept/dir/file", "f");
    stdfs::create_directory_symlink(root / "private/var/kept/dir", root / "private/var/kept/link");
    EXPECT_TRUE(fs::openNoFollow(root / "private/var/kept/dir/file", O_RDONLY));
    EXPECT_FALSE(fs::openNoFollow(root / "private/var/kept/link/file", O_RDONLY));
    EXPECT_EQ(errno, ELOOP);
    EXPECT_FALSE(fs::openNoFollow(root / "private/../../etc/passwd", O_RDONLY));
    EXPECT_EQ(errno, EXDEV);
    struct stat st;
    EXPECT_EQ(fs::lstatNoFollow(root / "private/var/kept/link", &st), 0);
    EXPECT_TRUE(S_ISLNK(st.st_mode));
}

}  // namespace
}  // namespace berth
