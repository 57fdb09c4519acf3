// The tree walk: order and kinds of the entries, what each entry lets a
// callback reach, ending on the callback's answer, missing and unreadable
// items.
#include <fcntl.h>

#include "TestSupport.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using namespace test;
using Kind = BTHWalkEntry::Kind;

struct Visit {
    std::string path;  // relative to the walk's parent directory
    Kind kind;
    int level;
    int errnum;
};

std::vector<Visit> walkAll(const stdfs::path& root, bool* ok, BTHErrorRef* error,
                           const std::function<void(const BTHWalkEntry&)>& check = {}) {
    std::vector<Visit> visits;
    *ok = manager().traverseDirectory(root, error, [&](const BTHWalkEntry& e, BTHErrorRef*) {
        visits.push_back(
            {e.path.lexically_relative(root.parent_path()).string(), e.kind, e.level, e.errnum});
        if (check) check(e);
        return true;
    });
    return visits;
}

size_t indexOf(const std::vector<Visit>& visits, const std::string& path, Kind kind) {
    for (size_t i = 0; i < visits.size(); ++i)
        if (visits[i].path == path && visits[i].kind == kind) return i;
    ADD_FAILURE() << "no visit of " << path << " kind " << int(kind);
    return visits.size();
}

TEST(BTHFileManagerWalk, DeliversEveryItemOnceWithItsKindLevelAndWhereItLives) {
    ScratchDir dir;
    ScratchDir outside;
    writeFile(outside / "not-visited", "");
    const stdfs::path root = dir / "root";
    stdfs::create_directories(root / "sub/deeper");
    stdfs::create_directories(root / "empty");
    writeFile(root / "file", "x");
    writeFile(root / "sub/deeper/file", "y");
    stdfs::create_directory_symlink(outside.path(), root / "sub/link");
    ASSERT_EQ(::mkfifo((root / "fifo").c_str(), 0600), 0);

    bool ok = false;
    BTHErrorRef error;
    int checked = 0;
    const auto visits = walkAll(root, &ok, &error, [&](const BTHWalkEntry& e) {
        // The entry's lstat, parent descriptor and name all describe the
        // same item; an entered directory comes with its own descriptor.
        struct stat there, viaPath;
        ASSERT_EQ(::fstatat(e.parentFd, e.name.c_str(), &there, AT_SYMLINK_NOFOLLOW), 0);
        ASSERT_EQ(::lstat(e.path.c_str(), &viaPath), 0);
        EXPECT_EQ(there.st_ino, e.st.st_ino);
        EXPECT_EQ(viaPath.st_ino, e.st.st_ino);
        if (e.kind == Kind::DirectoryPre || e.kind == Kind::DirectoryPost) {
            struct stat self;
            ASSERT_EQ(::fstat(e.fd, &self), 0);
            EXPECT_EQ(self.st_ino, e.st.st_ino);
        } else {
            EXPECT_EQ(e.fd, -1);
        }
        ++checked;
    });
    ASSERT_TRUE(ok) << (error ? error->description() : "");
    EXPECT_EQ(checked, int(visits.size()));

    std::map<std::string, std::vector<Kind>> kinds;
    for (const auto& v : visits) kinds[v.path].push_back(v.kind);
    const std::map<std::string, std::vector<Kind>> expected = {
        {"root", {Kind::DirectoryPre, Kind::DirectoryPost}},
        {"root/sub", {Kind::DirectoryPre, Kind::DirectoryPost}},
        {"root/sub/deeper", {Kind::DirectoryPre, Kind::DirectoryPost}},
        {"root/empty", {Kind::DirectoryPre, Kind::DirectoryPost}},
        {"root/file", {Kind::File}},
        {"root/sub/deeper/file", {Kind::File}},
        {"root/sub/link", {Kind::Symlink}},
        {"root/fifo", {Kind::Other}},
    };
    EXPECT_EQ(kinds, expected);

    // Root first and last; every directory's contents between its visits.
    EXPECT_EQ(visits.front().path, "root");
    EXPECT_EQ(visits.back().path, "root");
    EXPECT_LT(indexOf(visits, "root/sub", Kind::DirectoryPre),
              indexOf(visits, "root/sub/deeper/file", Kind::File));
    EXPECT_LT(indexOf(visits, "root/sub/deeper/file", Kind::File),
              indexOf(visits, "root/sub/deeper", Kind::DirectoryPost));
    EXPECT_LT(indexOf(visits, "root/sub/deeper", Kind::DirectoryPost),
              indexOf(visits, "root/sub", Kind::DirectoryPost));
    for (const auto& v : visits)
        EXPECT_EQ(v.level, int(std::count(v.path.begin(), v.path.end(), '/'))) << v.path;
}

TEST(BTHFileManagerWalk, EndsOnTheCallbacksAnswerWithItsError) {
    ScratchDir dir;
    stdfs::create_directories(dir / "root/a/b/c");
    writeFile(dir / "root/a/b/c/file", "");
    int calls = 0;
    BTHErrorRef error;
    const BTHErrorRef mine = BTHCreatePOSIXError("test", 1, EIO, "stop here");
    EXPECT_FALSE(manager().traverseDirectory(dir / "root", &error,
                                             [&](const BTHWalkEntry&, BTHErrorRef* slot) {
                                                 if (++calls < 3) return true;
                                                 *slot = mine;
                                                 return false;
                                             }));
    EXPECT_EQ(calls, 3);
    EXPECT_EQ(error, mine);

    // A root that is a link is delivered as a link and nothing else.
    stdfs::create_directory_symlink(dir / "root", dir / "link");
    bool ok = false;
    const auto visits = walkAll(dir / "link", &ok, &error);
    EXPECT_TRUE(ok);
    ASSERT_EQ(visits.size(), 1u);
    EXPECT_EQ(visits[0].kind, Kind::Symlink);
}

TEST(BTHFileManagerWalk, AMissingRootFailsWithoutACallback) {
    ScratchDir dir;
    for (const stdfs::path& root : {dir / "missing", dir / "missing/below"}) {
        bool ok = true;
        BTHErrorRef error;
        EXPECT_TRUE(walkAll(root, &ok, &error).empty());
        EXPECT_FALSE(ok);
        expectPOSIXError(error, ENOENT, "Error for path " + root.string() + ": " + strerror(ENOENT),
                         "-[BTHFileManager _traverseDirectory:error:withBlock:]");
    }
}

TEST(BTHFileManagerWalk, AnUnreadableDirectoryIsDeliveredAndTheWalkGoesOn) {
    BERTH_REQUIRE_ROOT();
    ScratchDir dir;
    ASSERT_EQ(::chmod(dir.path().c_str(), 0755), 0);
    const stdfs::path root = dir / "root";
    stdfs::create_directories(root / "closed/inside");
    writeFile(root / "after", "");
    ASSERT_EQ(::chmod((root / "closed").c_str(), 0), 0);
    // As an unprivileged user: the closed directory cannot be opened.
    const int status = inChild(
        [&] {
            bool ok = false;
            BTHErrorRef error;
            const auto visits = walkAll(root, &ok, &error);
            if (!ok) return 1;
            std::vector<std::pair<std::string, Kind>> closed;
            bool sawAfter = false;
            for (const auto& v : visits) {
                if (v.path.rfind("root/closed", 0) == 0) closed.emplace_back(v.path, v.kind);
                if (v.kind == Kind::Unreadable && v.errnum != EACCES) return 4;
                sawAfter |= v.path == "root/after";
            }
            const std::vector<std::pair<std::string, Kind>> expected = {
                {"root/closed", Kind::DirectoryPre}, {"root/closed", Kind::Unreadable}};
            if (closed != expected) return 2;
            return sawAfter ? 0 : 3;
        },
        65534);
    EXPECT_EQ(status, 0);
}

// An app can nest its directories deeper than the daemon has descriptors:
// the walk still delivers every item, each with descriptors that lead to
// it, and holds only a bounded number of descriptors at any depth.
TEST(BTHFileManagerWalk, ChainsDeeperThanTheDescriptorLimitAreWalkedWithFewDescriptors) {
    ScratchDir dir;
    const stdfs::path tree = dir / "deep";
    stdfs::create_directories(tree);
    constexpr int kDepth = 1500;  // an unbounded walk would need 3,000 descriptors
    makeDirectoryChain(tree, kDepth, 500);

    const int idle = openDescriptorCount();
    int most = idle, pre = 0, post = 0, files = 0, deepest = 0, misplaced = 0;
    BTHErrorRef error;
    bool ok = false;
    {
        DescriptorLimit tight(200);
        ok = manager().traverseDirectory(tree, &error, [&](const BTHWalkEntry& e, BTHErrorRef*) {
            struct stat st {};
            // What the entry hands over must be the item itself.
            if (::fstatat(e.parentFd, e.name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0 ||
                !fs::sameItem(st, e.st))
                ++misplaced;
            if (e.fd >= 0 && (::fstat(e.fd, &st) != 0 || !fs::sameItem(st, e.st))) ++misplaced;
            pre += e.kind == Kind::DirectoryPre;
            post += e.kind == Kind::DirectoryPost;
            files += e.kind == Kind::File;
            deepest = std::max(deepest, e.level);
            if (e.level % 250 == 0) most = std::max(most, openDescriptorCount());
            return true;
        });
    }
    EXPECT_TRUE(ok) << (error ? error->description() : "");
    EXPECT_EQ(pre, kDepth + 1);
    EXPECT_EQ(post, kDepth + 1);
    EXPECT_EQ(files, kDepth / 500);
    EXPECT_EQ(deepest, kDepth);
    EXPECT_EQ(misplaced, 0);
    EXPECT_LT(most - idle, 100) << "descriptors held at depth";
}

// Coming back up through directories it no longer holds open, the walk
// reaches each again through its child; a child moved elsewhere meanwhile
// leads to another directory, and the walk ends instead of going on there.
TEST(BTHFileManagerWalk, ADirectoryMovedAwayBelowTheOpenOnesEndsTheWalk) {
    ScratchDir dir;
    const stdfs::path tree = dir / "deep";
    stdfs::create_directories(tree);
    stdfs::create_directories(dir / "elsewhere");
    makeDirectoryChain(tree, 200);
    stdfs::path level50 = tree;
    for (int i = 0; i < 50; ++i) level50 /= "d";
    const stdfs::path moved = dir / "elsewhere" / "d";

    bool ok = true;
    BTHErrorRef error;
    int postBelow = 0, postAbove = 0;
    walkAll(tree, &ok, &error, [&](const BTHWalkEntry& e) {
        if (e.level == 200 && e.kind == Kind::DirectoryPre) stdfs::rename(level50, moved);
        if (e.kind == Kind::DirectoryPost) ++(e.level > 50 ? postBelow : postAbove);
    });
    EXPECT_FALSE(ok);
    EXPECT_TRUE(stdfs::exists(moved / "d"));
    EXPECT_EQ(postBelow, 150);
    EXPECT_EQ(postAbove, 0) << "the walk went on above the moved directory";
}

}  // namespace
}  // namespace berth
