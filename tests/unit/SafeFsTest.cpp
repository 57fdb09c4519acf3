// The link-safe toolkit: no link followed in any component, items checked
// against what lstat saw, paths made one component at a time.
#include "platform/SafeFs.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <set>
#include <string>

#include "TestSupport.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using test::ScratchDir;

TEST(SafeFsTest, SplitParentNamesTheLastComponent) {
    struct Case {
        const char* path;
        const char* parent;
        const char* name;
    };
    for (const Case& c : {Case{"/a/b", "/a", "b"}, Case{"/a/b//", "/a", "b"}, Case{"/a", "/", "a"},
                          Case{"rel", ".", "rel"}}) {
        stdfs::path parent;
        std::string name;
        ASSERT_TRUE(fs::splitParent(c.path, &parent, &name)) << c.path;
        EXPECT_EQ(parent, c.parent) << c.path;
        EXPECT_EQ(name, c.name) << c.path;
    }
    for (const char* bad : {"/", "", "/a/..", "/a/."}) {
        stdfs::path parent;
        std::string name;
        EXPECT_FALSE(fs::splitParent(bad, &parent, &name)) << bad;
        EXPECT_EQ(errno, EINVAL);
    }
}

TEST(SafeFsTest, MakePathCreatesEachMissingComponentAndNeverGoesThroughALink) {
    ScratchDir dir;
    ScratchDir outside;
    const mode_t oldMask = ::umask(0);
    EXPECT_EQ(fs::makePath(dir / "a/b/c", 0711), 0);
    ::umask(oldMask);
    struct stat st;
    ASSERT_EQ(::lstat((dir / "a/b").c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0711u);
    EXPECT_EQ(fs::makePath(dir / "a/b/c", 0755), EEXIST);
    test::writeFile(dir / "file", "");
    EXPECT_EQ(fs::makePath(dir / "file", 0755), EEXIST);  // whatever is there
    EXPECT_EQ(fs::makePath(dir / "file/below", 0755), ENOTDIR);

    stdfs::create_directory_symlink(outside.path(), dir / "link");
    EXPECT_EQ(fs::makePath(dir / "link/x/y", 0755), ELOOP);
    EXPECT_EQ(fs::makePath(dir / "link/x", 0755), ELOOP);
    EXPECT_TRUE(stdfs::is_empty(outside.path()));
}

TEST(SafeFsTest, OpeningAndRenamingRefuseLinksInAnyComponent) {
    ScratchDir dir;
    ScratchDir outside;
    test::writeFile(outside / "target", "t");
    stdfs::create_directory_symlink(outside.path(), dir / "dirlink");
    stdfs::create_symlink(outside / "target", dir / "filelink");

    EXPECT_FALSE(fs::openNoFollow(dir / "dirlink/target", O_RDONLY));
    EXPECT_EQ(errno, ELOOP);
    EXPECT_FALSE(fs::openNoFollow(dir / "dirlink", O_RDONLY | O_DIRECTORY));
    EXPECT_EQ(errno, ELOOP);
    EXPECT_FALSE(fs::openNoFollow(dir / "filelink", O_RDONLY));
    EXPECT_EQ(errno, ELOOP);

    // A link as the last component is described and renamed itself.
    struct stat st;
    ASSERT_EQ(fs::lstatNoFollow(dir / "filelink", &st), 0);
    EXPECT_TRUE(S_ISLNK(st.st_mode));
    EXPECT_EQ(fs::lstatNoFollow(dir / "dirlink/target", &st), ELOOP);
    EXPECT_EQ(fs::renameNoFollow(dir / "filelink", dir / "renamed"), 0);
    EXPECT_TRUE(stdfs::is_symlink(dir / "renamed"));
    EXPECT_EQ(fs::renameNoFollow(dir / "dirlink/target", dir / "stolen"), ELOOP);
    EXPECT_EQ(fs::renameNoFollow(dir / "renamed", dir / "dirlink/moved"), ELOOP);
    EXPECT_EQ(test::readFile(outside / "target"), "t");

    // chmod by name changes the item, never a link's target.
    const struct stat before = [&] {
        struct stat s;
        ::stat((outside / "target").c_str(), &s);
        return s;
    }();
    UniqueFd parent = fs::openNoFollow(dir.path(), O_PATH | O_DIRECTORY);
    EXPECT_NE(fs::chmodAtNoFollow(parent.get(), "renamed", 0600), 0);
    ASSERT_EQ(::stat((outside / "target").c_str(), &st), 0);
    EXPECT_EQ(st.st_mode, before.st_mode);
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

TEST(SafeFsTest, DirReaderSkipsDotEntriesAndLeavesTheCallersDescriptorAlone) {
    ScratchDir dir;
    for (const char* f : {"a", ".hidden", "b"}) test::writeFile(dir / f, "");
    UniqueFd fd = fs::openNoFollow(dir.path(), O_RDONLY | O_DIRECTORY);
    for (int pass = 0; pass < 2; ++pass) {  // each reader starts from the beginning
        fs::DirReader reader(fd.get());
        ASSERT_TRUE(reader.valid());
        std::set<std::string> seen;
        while (const struct dirent* e = reader.next()) seen.insert(e->d_name);
        EXPECT_EQ(errno, 0);
        EXPECT_EQ(seen, (std::set<std::string>{"a", ".hidden", "b"}));
    }
    struct stat st;
    EXPECT_EQ(::fstatat(fd.get(), "a", &st, 0), 0);
}

}  // namespace
}  // namespace berth
