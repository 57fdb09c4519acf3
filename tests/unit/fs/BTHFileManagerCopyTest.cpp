// Copies and same-volume moves: what a copy keeps, missing sources, error
// texts, a source tree whose app swaps a subdirectory for a link while it is
// being copied, chains deeper than the descriptor limit, and a directory
// moved away above the levels the copy holds open.
#include <fcntl.h>
#include <poll.h>
#include <sys/acl.h>
#include <sys/fanotify.h>
#include <sys/xattr.h>

#include <sstream>

#include "TestSupport.h"
#include "platform/FileFlags.h"
#include "platform/UniqueFd.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using namespace test;

unsigned flagsOf(const stdfs::path& path) {
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    unsigned flags = 0;
    if (fd) fileflags::get(fd.get(), &flags);
    return flags & fileflags::kCopied;
}

void setFlags(const stdfs::path& path, unsigned flags) {
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    unsigned present = 0;
    ASSERT_EQ(fileflags::get(fd.get(), &present), 0);
    ASSERT_EQ(fileflags::set(fd.get(), (present & ~fileflags::kCopied) | flags), 0) << path;
}

std::string contentsOf(const stdfs::path& path) {
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_NOATIME | O_NOFOLLOW | O_CLOEXEC));
    std::string data;
    char buffer[65536];
    for (ssize_t n; fd && (n = ::read(fd.get(), buffer, sizeof buffer)) > 0;)
        data.append(buffer, size_t(n));
    return data;
}

// Everything a copy must keep of one item, as text.
std::string describe(const stdfs::path& path) {
    struct stat st;
    if (::lstat(path.c_str(), &st) != 0) return "missing";
    std::ostringstream out;
    out << std::oct << st.st_mode << std::dec << " " << st.st_uid << ":" << st.st_gid
        << " m=" << st.st_mtim.tv_sec << "." << st.st_mtim.tv_nsec;
    // Listing a directory or reading a link touches its access time; file
    // data is read without touching it.
    if (!S_ISDIR(st.st_mode) && !S_ISLNK(st.st_mode))
        out << " a=" << st.st_atim.tv_sec << "." << st.st_atim.tv_nsec;
    if (S_ISREG(st.st_mode)) out << " data=" << std::hash<std::string>{}(contentsOf(path));
    if (S_ISLNK(st.st_mode)) out << " ->" << stdfs::read_symlink(path).string();
    out << " flags=" << flagsOf(path);
    char names[4096];
    ssize_t n = ::llistxattr(path.c_str(), names, sizeof names);
    std::map<std::string, std::string> attributes;
    for (ssize_t at = 0; at < n; at += ssize_t(strlen(names + at)) + 1) {
        char value[4096];
        ssize_t len = ::lgetxattr(path.c_str(), names + at, value, sizeof value);
        attributes[names + at] = std::string(value, size_t(std::max<ssize_t>(len, 0)));
    }
    for (const auto& [name, value] : attributes)
        out << " " << name << "=" << std::hash<std::string>{}(value);
    return out.str();
}

std::map<std::string, std::string> describeTree(const stdfs::path& root) {
    std::map<std::string, std::string> items{{".", describe(root)}};
    for (const auto& e : stdfs::recursive_directory_iterator(root))
        items[e.path().lexically_relative(root).string()] = describe(e.path());
    return items;
}

// Distinct times in the past day with the access time after the
// modification time, so that reading an item (to describe it or copy it)
// leaves its access time alone under the usual relative-atime mounts.
void setTimes(const stdfs::path& path, int distinct) {
    const time_t now = ::time(nullptr);
    const struct timespec times[2] = {{now - 1000 + distinct, 111}, {now - 2000 + distinct, 222}};
    ASSERT_EQ(::utimensat(AT_FDCWD, path.c_str(), times, AT_SYMLINK_NOFOLLOW), 0) << path;
}

void setAcl(const stdfs::path& path, acl_type_t type, const char* text) {
    acl_t acl = acl_from_text(text);
    ASSERT_NE(acl, nullptr);
    EXPECT_EQ(acl_set_file(path.c_str(), type, acl), 0) << path << " " << strerror(errno);
    acl_free(acl);
}

// A tree with one of each kind of item and every attribute a copy keeps.
void buildRichTree(const stdfs::path& root) {
    stdfs::create_directories(root / "sub/empty");
    std::string data(300000, '\0');
    for (size_t i = 0; i < data.size(); ++i) data[i] = char(i * 7 + i / 977);
    writeFile(root / "file", data);
    writeFile(root / "sub/frozen", "frozen");
    writeFile(root / "sub/journal", "append only");
    ASSERT_EQ(::symlink("../nowhere/dangling", (root / "sub/link").c_str()), 0);
    ASSERT_EQ(::mkfifo((root / "fifo").c_str(), 0600), 0);

    ASSERT_EQ(::chown((root / "file").c_str(), 501, 502), 0);
    ASSERT_EQ(::chmod((root / "file").c_str(), 0640), 0);
    ASSERT_EQ(::lchown((root / "sub/link").c_str(), 503, 504), 0);
    ASSERT_EQ(::chown((root / "fifo").c_str(), 7, 8), 0);
    ASSERT_EQ(::chmod((root / "fifo").c_str(), 0604), 0);
    ASSERT_EQ(::chown((root / "sub").c_str(), 502, 503), 0);
    ASSERT_EQ(::chmod((root / "sub").c_str(), 02750), 0);
    ASSERT_EQ(::setxattr((root / "file").c_str(), "user.note", "hello", 5, 0), 0);
    ASSERT_EQ(
        ::setxattr((root / "sub").c_str(), "trusted.berth.protection_class", "\x03\0\0\0", 4, 0),
        0);
    setAcl(root / "file", ACL_TYPE_ACCESS, "u::rw-,u:501:rw-,g::r--,m::rw-,o::---");
    setAcl(root / "sub", ACL_TYPE_DEFAULT, "u::rwx,g::r-x,g:502:rwx,m::rwx,o::---");
    for (const char* p : {"file", "sub/frozen", "sub/journal", "sub/link", "fifo", "sub/empty"})
        setTimes(root / p, p[0] + p[1]);
    setTimes(root / "sub", 300);
    setTimes(root, 400);
    setFlags(root / "sub/frozen", fileflags::kImmutable);
    setFlags(root / "sub/journal", fileflags::kAppend);
}

void clearFlags(const stdfs::path& root) {
    for (const char* p : {"sub/frozen", "sub/journal"})
        if (stdfs::exists(root / p)) setFlags(root / p, 0);
}

TEST(BTHFileManagerCopy, KeepsDataModeOwnerTimesAttributesAclsFlagsAndLinks) {
    BERTH_REQUIRE_ROOT();
    ScratchDir dir;
    const stdfs::path source = dir / "source", dest = dir / "dest";
    buildRichTree(source);
    const auto before = describeTree(source);
    const auto linkAccess = lstatOf(source / "sub/link").st_atim;
    BTHErrorRef error;
    const bool copied = manager().copyItemAtURL(source, dest, &error);
    const auto copiedLinkAccess = lstatOf(dest / "sub/link").st_atim;
    const auto after = describeTree(dest);
    clearFlags(source);
    clearFlags(dest);
    ASSERT_TRUE(copied) << (error ? error->description() : "");
    EXPECT_EQ(after, before);
    EXPECT_EQ(after.size(), 8u);
    EXPECT_EQ(copiedLinkAccess.tv_sec, linkAccess.tv_sec);
    EXPECT_EQ(copiedLinkAccess.tv_nsec, linkAccess.tv_nsec);
}

TEST(BTHFileManagerCopy, MissingSourcesAndFailuresCarryTheirTexts) {
    ScratchDir dir;
    BTHErrorRef error;
    const stdfs::path missing = dir / "missing", dest = dir / "dest";
    EXPECT_TRUE(manager().copyItemIfExistsAtURL(missing, dest, &error));
    EXPECT_TRUE(manager().moveItemIfExistsAtURL(missing, dest, &error));
    EXPECT_FALSE(error);
    EXPECT_FALSE(stdfs::exists(dest));

    const std::string what = missing.string() + " to " + dest.string() + " failed: ";
    EXPECT_FALSE(manager().copyItemAtURL(missing, dest, &error));
    expectPOSIXError(error, ENOENT, "copyfile of " + what + strerror(ENOENT),
                     "-[BTHFileManager _copyItemAtURL:toURL:failIfSrcMissing:error:]");
    EXPECT_FALSE(manager().moveItemAtURL(missing, dest, &error));
    expectPOSIXError(error, ENOENT, "rename of " + what + strerror(ENOENT),
                     "-[BTHFileManager _moveItemAtURL:toURL:failIfSrcMissing:error:]");
    EXPECT_FALSE(stdfs::exists(dest));

    // The existence check of the "if exists" forms does not go through links.
    ScratchDir outside;
    writeFile(outside / "item", "x");
    stdfs::create_directory_symlink(outside.path(), dir / "via");
    EXPECT_FALSE(manager().moveItemIfExistsAtURL(dir / "via/item", dest, &error));
    expectPOSIXError(error, ELOOP,
                     "stat of " + (dir / "via/item").string() + " failed: " + strerror(ELOOP));
    EXPECT_TRUE(stdfs::exists(outside / "item"));
}

TEST(BTHFileManagerCopy, SameVolumeMoveRenamesAndAReplacedCopyTargetIsNeverFollowed) {
    ScratchDir dir;
    ScratchDir outside;
    stdfs::create_directories(dir / "a/inner");
    writeFile(dir / "a/inner/file", "payload");
    const ino_t before = lstatOf(dir / "a").st_ino;
    BTHErrorRef error;
    ASSERT_TRUE(manager().moveItemAtURL(dir / "a", dir / "b", &error));
    EXPECT_EQ(lstatOf(dir / "b").st_ino, before);  // renamed, not copied
    EXPECT_FALSE(stdfs::exists(dir / "a"));

    // A link standing where a copied file goes is replaced, not written through.
    writeFile(outside / "victim", "untouched");
    stdfs::create_directories(dir / "c/inner");
    stdfs::create_symlink(outside / "victim", dir / "c/inner/file");
    ASSERT_TRUE(manager().copyItemAtURL(dir / "b", dir / "c", &error));
    EXPECT_EQ(readFile(dir / "c/inner/file"), "payload");
    EXPECT_FALSE(stdfs::is_symlink(dir / "c/inner/file"));
    EXPECT_EQ(readFile(outside / "victim"), "untouched");
}

// The app owning a tree swaps one of its subdirectories for a link to a
// directory outside the tree while the daemon copies the tree: whatever the
// copy answers, nothing from outside may appear in the copy.
TEST(BTHFileManagerCopy, ASubdirectorySwappedForALinkMidCopyIsCopiedAsALink) {
    BERTH_REQUIRE_ROOT();
    ScratchDir dir;
    ScratchDir outside;
    stdfs::create_directories(outside / "secret/inner");
    for (int i = 0; i < 100; ++i) {
        writeFile(outside / ("secret/f" + std::to_string(i * 5)), "secret");
        writeFile(outside / ("secret/inner/f" + std::to_string(i * 5)), "secret");
    }
    constexpr int kRounds = 6;
    constexpr int kFilesPerDirectory = 600;
    const stdfs::path tree = dir / "tree";
    for (const char* d : {"a", "victim", "victim/inner", "z"}) {
        stdfs::create_directories(tree / d);
        for (int i = 0; i < kFilesPerDirectory; ++i)
            writeFile(tree / d / ("f" + std::to_string(i)), "mine");
    }
    int linksCopied = 0;
    for (int round = 0; round < kRounds; ++round) {
        const stdfs::path dest = dir / ("copy" + std::to_string(round));
        {
            const LinkSwapper app(tree, outside / "secret");
            BTHErrorRef error;
            manager().copyItemAtURL(tree, dest, &error);
        }
        if (!stdfs::exists(dest)) continue;
        for (const auto& e : stdfs::recursive_directory_iterator(dest)) {
            if (e.is_symlink()) {
                ++linksCopied;
                continue;
            }
            if (e.is_regular_file()) {
                ASSERT_EQ(readFile(e.path()), "mine")
                    << "round " << round << ": " << e.path() << " came from outside";
            }
        }
        std::error_code ec;
        stdfs::remove_all(dest, ec);
    }
    RecordProperty("LinksCopied", linksCopied);
}

// Walks two directory chains side by side, one level at a time through
// descriptors (no path would reach their bottom), and tells how deep they
// are alike: same mode, owner and modification time, a file "f" at the same
// levels. Stops at the first level that differs or has no "d" below it.
int alikeLevels(const stdfs::path& one, const stdfs::path& other, int* filesSeen) {
    UniqueFd a(::open(one.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    UniqueFd b(::open(other.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    *filesSeen = 0;
    for (int level = 0;; ++level) {
        struct stat sa, sb, fa, fb;
        if (!a || !b || ::fstat(a.get(), &sa) != 0 || ::fstat(b.get(), &sb) != 0) return level - 1;
        if (sa.st_mode != sb.st_mode || sa.st_uid != sb.st_uid ||
            sa.st_mtim.tv_sec != sb.st_mtim.tv_sec || sa.st_mtim.tv_nsec != sb.st_mtim.tv_nsec)
            return level - 1;
        const bool fileA = ::fstatat(a.get(), "f", &fa, AT_SYMLINK_NOFOLLOW) == 0;
        const bool fileB = ::fstatat(b.get(), "f", &fb, AT_SYMLINK_NOFOLLOW) == 0;
        if (fileA != fileB || (fileB && !S_ISREG(fb.st_mode))) return level - 1;
        *filesSeen += fileB;
        a = UniqueFd(::openat(a.get(), "d", O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
        b = UniqueFd(::openat(b.get(), "d", O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
        if (!a && !b) return level;
    }
}

// An app can nest its directories deeper than the daemon has descriptors:
// the copy still takes the whole chain, each directory with its attributes
// (applied after its contents), and holds few descriptors at any depth.
TEST(BTHFileManagerCopy, ChainsDeeperThanTheDescriptorLimitAreCopiedWhole) {
    ScratchDir dir;
    const stdfs::path source = dir / "deep", dest = dir / "copy";
    stdfs::create_directories(source);
    constexpr int kDepth = 1500;  // a copy holding each level open needs over 3,000
    makeDirectoryChain(source, kDepth, 500);

    const int idle = openDescriptorCount();
    std::atomic<bool> copying{true};
    std::atomic<int> most{idle};
    BTHErrorRef error;
    bool copied = false;
    {
        DescriptorLimit tight(200);
        std::thread watcher([&] {
            while (copying) {
                most = std::max(most.load(), openDescriptorCount());
                std::this_thread::sleep_for(std::chrono::microseconds(200));
            }
        });
        copied = manager().copyItemAtURL(source, dest, &error);
        copying = false;
        watcher.join();
    }
    ASSERT_TRUE(copied) << (error ? error->description() : "");
    int files = 0;
    EXPECT_EQ(alikeLevels(source, dest, &files), kDepth);
    EXPECT_EQ(files, kDepth / 500);
    EXPECT_LT(most - idle, 100) << "descriptors held during the copy";
    EXPECT_EQ(openDescriptorCount(), idle);
}

// Coming back up through levels it no longer holds open, the copy reaches
// each again through its child; a source directory moved elsewhere meanwhile
// leads to another directory, and the copy ends instead of going on there,
// taking away the destination it made. The copy is held at the bottom of the
// chain (its opening of the file there waits for an answer) while the app
// moves a directory far above.
TEST(BTHFileManagerCopy, ASourceDirectoryMovedAwayAboveTheOpenLevelsEndsTheCopy) {
    BERTH_REQUIRE_ROOT();
    ScratchDir dir;
    const stdfs::path source = dir / "deep", dest = dir / "copy";
    stdfs::create_directories(source);
    stdfs::create_directories(dir / "elsewhere");
    makeDirectoryChain(source, 200);
    stdfs::path level50 = source;
    for (int i = 0; i < 50; ++i) level50 /= "d";
    stdfs::path bottom = level50;
    for (int i = 50; i < 200; ++i) bottom /= "d";
    writeFile(bottom / "f", "bottom");
    const stdfs::path moved = dir / "elsewhere" / "d";

    UniqueFd watch(::fanotify_init(FAN_CLASS_CONTENT | FAN_CLOEXEC, O_RDONLY));
    if (!watch || ::fanotify_mark(watch.get(), FAN_MARK_ADD, FAN_OPEN_PERM, AT_FDCWD,
                                  (bottom / "f").c_str()) != 0)
        GTEST_SKIP() << "the kernel cannot hold a file's opening (file-access permission events): "
                     << std::strerror(errno);
    std::atomic<bool> movedMeanwhile{false};
    std::thread app([&] {
        struct pollfd ready = {watch.get(), POLLIN, 0};
        if (::poll(&ready, 1, 30000) != 1) return;  // the copy never got there
        struct fanotify_event_metadata event {};
        if (::read(watch.get(), &event, sizeof event) != sizeof event) return;
        UniqueFd opened(event.fd);
        std::error_code ec;
        stdfs::rename(level50, moved, ec);
        movedMeanwhile = !ec;
        const struct fanotify_response answer = {event.fd, FAN_ALLOW};
        EXPECT_EQ(::write(watch.get(), &answer, sizeof answer), ssize_t(sizeof answer));
    });
    BTHErrorRef error;
    const bool copied = manager().copyItemAtURL(source, dest, &error);
    app.join();
    watch.reset();  // no more opening held
    ASSERT_TRUE(movedMeanwhile);
    EXPECT_FALSE(copied) << "the copy went on above the moved directory";
    expectPOSIXError(error, ESTALE);
    EXPECT_FALSE(stdfs::exists(stdfs::symlink_status(dest)));
    // The source is where the app left it, untouched.
    EXPECT_EQ(readFile(moved / bottom.lexically_relative(level50) / "f"), "bottom");
}

}  // namespace
}  // namespace berth
