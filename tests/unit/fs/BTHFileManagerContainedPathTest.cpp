// Contained paths: what a client may name inside a container, what it may
// not, the line each refusal writes, and the opening of a contained item
// while another thread swaps its directory for a link leading out.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <thread>

#include "TestSupport.h"

namespace berth {
namespace {

namespace fs = std::filesystem;
using test::LogCapture;
using test::ScratchDir;

// base/ holds a/file, and links of every kind; outside/ holds a secret;
// basement/ shares base's name as a prefix.
class ContainedPathTest : public ::testing::Test {
  protected:
    void SetUp() override {
        fs::create_directories(base() / "a");
        fs::create_directories(root_ / "outside");
        fs::create_directories(root_ / "basement");
        test::writeFile(base() / "a/file", "inside");
        test::writeFile(root_ / "outside/secret", "secret");
        test::writeFile(root_ / "basement/x", "neighbour");
        const std::pair<const char*, const char*> links[] = {
            {"abs", "/etc"},
            {"a/up2", "../../outside"},
            {"a/sibling", "../b"},
            {"a/toBase", ".."},
            {"a/hop", "../hop2"},
            {"hop2", "../outside"},
            {"dirlink", "../outside"},
            {"inlink", "a"},
            {"magic", "../../../../../../../../proc/self/root"},
        };
        for (const auto& [name, text] : links) fs::create_symlink(text, base() / name);
    }

    fs::path base() const { return root_ / "base"; }
    fs::path real(const fs::path& path) const { return fs::weakly_canonical(path); }

    ScratchDir scratch_;
    fs::path root_ = fs::canonical(scratch_.path());
};

struct Refusal {
    const char* suspicious;  // below the base; "" is the base itself
    const char* line;        // part of the one error line it writes
};

TEST_F(ContainedPathTest, EveryWayOutIsRefusedWithItsOwnLine) {
    const Refusal refusals[] = {
        {"/..", "contains '..' paths"},
        {"/../outside/secret", "contains '..' paths"},
        {"/a/..", "contains '..' paths"},
        {"/a/../../outside", "contains '..' paths"},
        {"/a/file/..", "contains '..' paths"},
        {"ment/x", "components diverge at base != basement"},
        {"/abs", "as absolute symlinks are not allowed"},
        {"/a/up2", "as it is points outside or to the base"},
        {"/magic", "as it is points outside or to the base"},
        {"/a/hop", "components diverge"},           // the second link leaves
        {"/dirlink/secret", "components diverge"},  // a link mid-path
    };
    for (const Refusal& refusal : refusals) {
        SCOPED_TRACE(refusal.suspicious);
        LogCapture log;
        EXPECT_FALSE(test::manager().realPathForURL(base().string() + refusal.suspicious, base()));
        const auto lines = log.lines();
        ASSERT_EQ(lines.size(), 1u);
        EXPECT_EQ(lines[0].level, BTHLogLevelError);
        EXPECT_NE(lines[0].message.find(refusal.line), std::string::npos) << lines[0].message;
    }
}

TEST_F(ContainedPathTest, WhatStaysInsideResolvesToItsRealPath) {
    const std::pair<const char*, const char*> accepted[] = {
        {"", ""},  // the base itself
        {"/a/file", "/a/file"},
        {"/inlink/file", "/a/file"},               // a link that stays inside
        {"/a/toBase", ""},                         // climbs back to the base only
        {"/a/sibling", "/a/sibling"},              // dangling: the link itself
        {"/new/deeper/name", "/new/deeper/name"},  // not made yet
        {"/-rf", "/-rf"},
        {"//a///file", "/a/file"},
    };
    for (const auto& [suspicious, expected] : accepted) {
        SCOPED_TRACE(suspicious);
        auto result = test::manager().realPathForURL(base().string() + suspicious, base());
        ASSERT_TRUE(result);
        EXPECT_EQ(*result, base().string() + expected);
    }
}

TEST_F(ContainedPathTest, MissingPathsNulBytesAndOverlongLinksAreRefused) {
    EXPECT_FALSE(test::manager().realPathForURL(std::nullopt, base()));
    EXPECT_FALSE(test::manager().realPathForURL(base() / "a", std::nullopt));
    EXPECT_FALSE(test::manager().realPathForURL(base() / "missing", base() / "missing"));
    using namespace std::string_literals;
    EXPECT_FALSE(test::manager().realPathForURL(base().string() + "/a\0/../../outside"s, base()));
    EXPECT_FALSE(
        test::manager().realPathForURL(base().string() + "/x\0../outside/secret"s, base()));
    fs::create_symlink(std::string(1100, 'x'), base() / "long");
    EXPECT_FALSE(test::manager().realPathForURL(base() / "long", base()));
    // Paths the kernel cannot resolve are never taken for the base.
    std::string deep = base().string();
    for (int i = 0; i < 600; ++i) deep += "/d";
    auto result = test::manager().realPathForURL(deep, base());
    if (result) {
        EXPECT_EQ(result->string().rfind(base().string() + "/", 0), 0u);
    }
}

TEST_F(ContainedPathTest, ThePrivatePrefixIsTransparent) {
    // "/private/<x>" names "<x>": stripped before anything is compared.
    const std::string privateBase = "/private" + base().string();
    auto viaBase = test::manager().realPathForURL(base() / "a", privateBase);
    ASSERT_TRUE(viaBase);
    EXPECT_EQ(*viaBase, base() / "a");
    auto viaBoth = test::manager().realPathForURL(privateBase + "/a/file", privateBase);
    ASSERT_TRUE(viaBoth);
    EXPECT_EQ(*viaBoth, base() / "a/file");
}

TEST(ContainedPathDepthTest, DepthFollowsNamesAndClimbs) {
    const struct {
        const char* path;
        int32_t start;
        bool valid;
        int32_t end;
    } cases[] = {
        {"/a/b", 0, true, 2},       {"/a/../..", 0, false, 0}, {"a/./b/", 3, true, 5},
        {"/a/..", 2, true, 2},      {"..", 0, false, 0},       {"", 4, true, 4},
        {"/a//b/../c", 0, true, 2},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.path);
        const std::string path = c.path;
        int32_t end = -99;
        EXPECT_EQ(BTHFileManager::_validateSymlink(&path, c.start, &end), c.valid);
        if (c.valid) {
            EXPECT_EQ(end, c.end);
        }
    }
    EXPECT_FALSE(BTHFileManager::_validateSymlink(nullptr, 0, nullptr));
}

TEST_F(ContainedPathTest, TheOpenedItemIsTheCheckedOne) {
    auto item = test::manager().openContainedItem(base() / "inlink/file", base());
    ASSERT_TRUE(item) << strerror(errno);
    EXPECT_EQ(item->name, "file");
    EXPECT_EQ(item->realPath, base() / "a/file");
    UniqueFd file(::openat(item->parent.get(), item->name.c_str(), O_RDONLY | O_CLOEXEC));
    ASSERT_TRUE(file);
    char text[16] = {};
    EXPECT_EQ(::read(file.get(), text, sizeof text), 6);
    EXPECT_STREQ(text, "inside");

    EXPECT_FALSE(test::manager().openContainedItem(base() / "dirlink/secret", base()));
    EXPECT_EQ(errno, EXDEV);
    EXPECT_FALSE(test::manager().openContainedItem(base(), base()));
    EXPECT_EQ(errno, EXDEV);
}

// An entry is named itself: links before its last name are resolved, a link
// as its last name is the entry; moving two entries renames between their
// directories.
TEST_F(ContainedPathTest, AnEntryIsItsOwnLastNameAndMovesWhereItWasChecked) {
    const struct {
        const char* suspicious;
        const char* name;
        const char* realPath;  // below the base
    } entries[] = {
        {"/inlink/file", "file", "a/file"},      // the directory through a link
        {"/a/sibling", "sibling", "a/sibling"},  // a link stays the entry
        {"/a/./file", "file", "a/file"},         // "." goes
        {"/a/new", "new", "a/new"},              // not there yet
        {"/-rf", "-rf", "-rf"},                  // only a name
    };
    for (const auto& e : entries) {
        auto entry = test::manager().openContainedEntry(base().string() + e.suspicious, base());
        ASSERT_TRUE(entry) << e.suspicious << ": " << strerror(errno);
        EXPECT_EQ(entry->name, e.name) << e.suspicious;
        EXPECT_EQ(entry->realPath, base() / e.realPath) << e.suspicious;
    }
    for (const char* refused : {"", "/", "/.", "/a/up2/secret", "/dirlink/x", "/a/hop/secret",
                                "/abs/passwd", "/../base/a"}) {
        EXPECT_FALSE(test::manager().openContainedEntry(base().string() + refused, base()))
            << refused;
        EXPECT_EQ(errno, EXDEV) << refused;
    }
    // Its directory missing: proven inside, but nothing to open.
    EXPECT_FALSE(test::manager().openContainedEntry(base() / "none/x", base()));
    EXPECT_EQ(errno, ENOENT);

    auto from = test::manager().openContainedEntry(base() / "inlink/file", base());
    auto to = test::manager().openContainedEntry(base() / "moved", base());
    ASSERT_TRUE(from && to);
    BTHErrorRef error;
    ASSERT_TRUE(test::manager().moveContainedItem(*from, *to, &error)) << error;
    EXPECT_EQ(test::readFile(base() / "moved"), "inside");
    EXPECT_FALSE(fs::exists(base() / "a/file"));
    EXPECT_FALSE(test::manager().moveContainedItem(*from, *to, &error));
    test::expectPOSIXError(error, ENOENT);
    EXPECT_EQ(test::readFile(root_ / "outside/secret"), "secret");
}

// The directory of a checked item swapped for a link out between check and
// use, over and over: the open fails or reaches the inside file, never the
// secret.
TEST_F(ContainedPathTest, ASwapBetweenCheckAndUseNeverLeadsOut) {
    fs::create_directories(base() / "swap");
    test::writeFile(base() / "swap/secret", "inside");
    fs::create_symlink("../outside", base() / "swapLink");
    struct stat outside = test::lstatOf(root_ / "outside/secret");
    std::atomic<bool> stop{false};
    std::thread swapper([&] {
        const fs::path dir = base() / "swap", link = base() / "swapLink";
        while (!stop) ::renameat2(AT_FDCWD, dir.c_str(), AT_FDCWD, link.c_str(), RENAME_EXCHANGE);
    });
    int opened = 0;
    for (int i = 0; i < 3000; ++i) {
        auto item = test::manager().openContainedItem(base() / "swap/secret", base());
        if (!item) continue;
        UniqueFd file(
            ::openat(item->parent.get(), item->name.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
        if (!file) continue;
        struct stat st;
        ASSERT_EQ(::fstat(file.get(), &st), 0);
        ASSERT_FALSE(st.st_dev == outside.st_dev && st.st_ino == outside.st_ino)
            << "reached the outside file on try " << i;
        ++opened;
    }
    stop = true;
    swapper.join();
    EXPECT_GT(opened, 0);
}

}  // namespace
}  // namespace berth
