// Staging shared content on a scratch root: the entitlement and lookup
// answers, every way a client-chosen path can try to leave the system-group
// container (each refused with the outside left as it was), the access
// control lists of what was moved, and a path swapped for a link while
// requests run.
#include "BTHSharedContent.h"

#include <sys/stat.h>

#include "BTHCodeSigningMapping.h"
#include "BTHContainerCache.h"
#include "ScratchDeviceRoot.h"
#include "TestSupport.h"
#include "core/BTHContainerClass.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using test::dict;

[[maybe_unused]] const auto& kRoot = test::installScratchDeviceRoot();

constexpr const char* kGroup = "systemgroup.sys.kelp.staging";
constexpr const char* kCaller = "sys.kelp.stager";

class BTHSharedContentTest : public ::testing::Test {
  protected:
    void SetUp() override {
        BERTH_REQUIRE_ROOT();
        BTHCodeSigningMapping* mapping = BTHCodeSigningMapping::sharedInstance();
        ASSERT_TRUE(mapping);
        const Value groups = BTHStringListValue({kGroup});
        ASSERT_EQ(mapping->processCodeSigningInfo(
                      dict({{kBTHEntitlementsKey, dict({{kBTHSystemGroupsEntitlement, groups}})}}),
                      kCaller, std::nullopt),
                  1u);
        uint64_t code = BTHErrorSuccess;
        const BTHMetadataRef container =
            BTHClientConnection::sharedClientConnection()->createOrLookupContainerForUser(
                kBTHSystemUserId, std::string(kGroup), true, BTHContainerClassSharedSystemGroup,
                false, true, &code);
        ASSERT_TRUE(container) << code;
        container_ = container->url();
        // A fresh tree for every test inside the container, and one outside.
        tree_ = container_ / "tree";
        stdfs::remove_all(tree_);
        stdfs::create_directories(tree_ / "dir");
        test::writeFile(tree_ / "dir" / "file", "inside");
        outside_.emplace();
        stdfs::create_directories(outside_->path() / "inner");
        test::writeFile(outside_->path() / "secret", "outside");
        test::writeFile(outside_->path() / "inner" / "secret", "outside");
        ASSERT_EQ(::chown((outside_->path() / "secret").c_str(), 1234, 1234), 0);
    }

    // Stages as `caller`; the code (1 on success) and the returned path.
    std::pair<uint64_t, std::optional<stdfs::path>> stage(const std::string& source,
                                                          const std::string& dest,
                                                          const std::string& caller = kCaller,
                                                          const std::string& group = kGroup) {
        BTHClientConnection client(caller, 0, false, std::nullopt);
        uint64_t code = BTHErrorSuccess;
        auto staged = stageSharedContentForIdentifier(client, group, source, dest, &code);
        return {code, staged};
    }

    // The outside tree is exactly as the test made it.
    void expectOutsideUntouched() {
        EXPECT_EQ(test::readFile(outside_->path() / "secret"), "outside");
        EXPECT_EQ(test::readFile(outside_->path() / "inner" / "secret"), "outside");
        EXPECT_EQ(test::lstatOf(outside_->path() / "secret").st_uid, 1234u);
        EXPECT_EQ(test::namesIn(outside_->path()), (std::set<std::string>{"inner", "secret"}));
    }

    stdfs::path container_;
    stdfs::path tree_;
    std::optional<test::ScratchDir> outside_;
};

TEST_F(BTHSharedContentTest, MovesTheItemAndGivesItTheGroupsLists) {
    const auto [code, staged] = stage("tree/dir", "tree/moved");
    ASSERT_EQ(code, 1u);
    EXPECT_EQ(staged, container_ / "tree/moved");
    EXPECT_FALSE(stdfs::exists(tree_ / "dir"));
    EXPECT_EQ(test::readFile(tree_ / "moved" / "file"), "inside");
    // Standardized as an item below a system container's top: owner -2:-2,
    // nothing for owner and others.
    for (const stdfs::path& item : {tree_ / "moved", tree_ / "moved" / "file"}) {
        const struct stat st = test::lstatOf(item);
        EXPECT_EQ(st.st_uid, kBTHNobodyUserId) << item;
        EXPECT_EQ(st.st_gid, kBTHNobodyUserId) << item;
        EXPECT_EQ(st.st_mode & 0707, 0u) << item;
    }
}

TEST_F(BTHSharedContentTest, RefusesArgumentsCallersAndMissingContainers) {
    BTHClientConnection client(std::string(kCaller), 0, false, std::nullopt);
    uint64_t code = BTHErrorSuccess;
    EXPECT_FALSE(stageSharedContentForIdentifier(client, kGroup, std::nullopt, "x", &code));
    EXPECT_EQ(code, uint64_t{BTHErrorInvalidArgument});

    test::LogCapture log;
    // Not entitled even though the container exists; no identifier at all
    // is entitled to nothing.
    EXPECT_EQ(stage("tree/dir", "tree/x", "sys.kelp.other").first, BTHErrorNotEntitled);
    EXPECT_TRUE(log.contains(
        3, std::string("sys.kelp.other not entitled for system group container ") + kGroup));
    BTHClientConnection anonymous(std::nullopt, 0, true, std::nullopt);
    code = BTHErrorSuccess;
    stageSharedContentForIdentifier(anonymous, kGroup, "tree/dir", "tree/x", &code);
    EXPECT_EQ(code, uint64_t{BTHErrorNotEntitled});

    // Entitled to a group whose container does not exist.
    BTHCodeSigningMapping* mapping = BTHCodeSigningMapping::sharedInstance();
    ASSERT_EQ(mapping->processCodeSigningInfo(
                  dict({{kBTHEntitlementsKey,
                         dict({{kBTHSystemGroupsEntitlement,
                                BTHStringListValue({kGroup, "systemgroup.sys.kelp.none"})}})}}),
                  kCaller, std::nullopt),
              1u);
    EXPECT_EQ(stage("a", "b", kCaller, "systemgroup.sys.kelp.none").first, BTHErrorNotFound);
    EXPECT_TRUE(log.contains(
        3, "System group container with identifier systemgroup.sys.kelp.none not found"));
    EXPECT_TRUE(stdfs::exists(tree_ / "dir" / "file"));
}

TEST_F(BTHSharedContentTest, PathsThatLeaveTheContainerAreRefusedAndTouchNothing) {
    const stdfs::path out = outside_->path();
    stdfs::create_symlink(out, tree_ / "absolute");                        // absolute link
    stdfs::create_symlink("../../../../../../../../..", tree_ / "climb");  // climbs out
    // A relative link that stays in depth but leads to a link that leaves.
    stdfs::create_symlink(out, tree_ / "dir" / "exit");
    stdfs::create_symlink("dir/exit", tree_ / "chain");
    stdfs::create_symlink("/proc/self/root" + out.string(), tree_ / "magic");

    const struct {
        std::string source;
        std::string dest;
        uint64_t code;
        std::string log;
    } cases[] = {
        {"../secret", "tree/x", BTHErrorInvalidParameter, "Paths can't contain dots"},
        {"tree/dir/..", "tree/x", BTHErrorInvalidParameter, "Paths can't contain dots"},
        {"tree/../tree/dir", "tree/x", BTHErrorInvalidParameter, "Paths can't contain dots"},
        {"tree/dir", "..", BTHErrorInvalidParameter, "Paths can't contain dots"},
        {"tree/absolute/secret", "tree/x", BTHErrorInvalidPath, "Invalid source URL"},
        {"tree/absolute", "tree/x", BTHErrorInvalidPath, "Invalid source URL"},
        {"tree/climb/secret", "tree/x", BTHErrorInvalidPath, "Invalid source URL"},
        {"tree/chain/secret", "tree/x", BTHErrorInvalidPath, "Invalid source URL"},
        {"tree/chain/inner", "tree/x", BTHErrorInvalidPath, "Invalid source URL"},
        {"tree/magic/secret", "tree/x", BTHErrorInvalidPath, "Invalid source URL"},
        {"tree/dir", "tree/absolute/planted", BTHErrorInvalidPath, "Invalid dest URL"},
        {"tree/dir", "tree/chain/planted", BTHErrorInvalidPath, "Invalid dest URL"},
        {"tree/dir", "tree/magic/planted", BTHErrorInvalidPath, "Invalid dest URL"},
        // The container itself is not an item inside it, either way.
        {"", "tree/x", BTHErrorInvalidPath, "Invalid source URL"},
        {"/.", "tree/x", BTHErrorInvalidPath, "Invalid source URL"},
        {"tree/dir", "", BTHErrorInvalidPath, "Invalid dest URL"},
        {std::string(5000, 'a'), "tree/x", BTHErrorInvalidPath, "Invalid source URL"},
        {std::string("tree/dir\0/x", 11), "tree/x", BTHErrorInvalidPath, "Invalid source URL"},
    };
    for (const auto& entry : cases) {
        test::LogCapture log;
        EXPECT_EQ(stage(entry.source, entry.dest).first, entry.code)
            << entry.source << " -> " << entry.dest;
        EXPECT_TRUE(log.contains(3, entry.log)) << entry.source << " -> " << entry.dest;
        expectOutsideUntouched();
        EXPECT_EQ(test::readFile(tree_ / "dir" / "file"), "inside") << entry.source;
    }
}

TEST_F(BTHSharedContentTest, LinksInsideTheContainerAreFollowedOnlyBeforeTheLastName) {
    stdfs::create_directories(tree_ / "real");
    stdfs::create_symlink("real", tree_ / "alias");
    test::writeFile(tree_ / "real" / "item", "via alias");
    stdfs::create_symlink("dir/file", tree_ / "shortcut");
    // Through an inner link to a directory: the item itself moves.
    ASSERT_EQ(stage("tree/alias/item", "tree/dir/item").first, 1u);
    EXPECT_EQ(test::readFile(tree_ / "dir" / "item"), "via alias");
    // A link as the last name is the item: the link moves, its target stays.
    ASSERT_EQ(stage("tree/shortcut", "tree/moved-link").first, 1u);
    EXPECT_TRUE(stdfs::is_symlink(tree_ / "moved-link"));
    EXPECT_EQ(test::readFile(tree_ / "dir" / "file"), "inside");
    // A source that is missing fails in the lists' walk; one whose directory
    // is missing is not proven to be anywhere.
    EXPECT_EQ(stage("tree/none", "tree/x").first, BTHErrorACLFailed);
    EXPECT_EQ(stage("tree/none/x", "tree/x").first, BTHErrorInvalidPath);
    EXPECT_EQ(stage("tree/dir", "tree/none/x").first, BTHErrorInvalidPath);
}

TEST_F(BTHSharedContentTest, AComponentSwappedForALinkNeverLeadsOutside) {
    // The container's "victim/inner" and the outside's "inner" hold files of
    // the same names; a thread keeps swapping "victim" and "victim/inner"
    // for links to the outside while every file is staged.
    constexpr int kFiles = 150;
    stdfs::create_directories(tree_ / "victim" / "inner");
    for (int i = 0; i < kFiles; ++i) {
        test::writeFile(tree_ / "victim" / "inner" / std::to_string(i), "inside");
        test::writeFile(outside_->path() / "inner" / std::to_string(i), "outside");
    }
    {
        test::LinkSwapper swapper(tree_, outside_->path());
        for (int i = 0; i < kFiles; ++i) {
            const std::string name = std::to_string(i);
            const uint64_t code = stage("tree/victim/inner/" + name, "tree/staged-" + name).first;
            // Refused when a link is in the way at the check, the walk or
            // the move; never anything done outside.
            EXPECT_TRUE(code == 1 || code == BTHErrorInvalidPath || code == BTHErrorACLFailed ||
                        code == BTHErrorStageSharedContentFailed)
                << code;
        }
    }
    // A refused attempt left its file where it was: staged again without the
    // swapping, every inside file ends staged, and no outside one.
    for (int i = 0; i < kFiles; ++i) {
        const std::string name = std::to_string(i);
        const stdfs::path staged = tree_ / ("staged-" + name);
        if (!stdfs::exists(staged)) {
            EXPECT_EQ(stage("tree/victim/inner/" + name, "tree/staged-" + name).first, 1u) << i;
        }
        EXPECT_EQ(test::readFile(staged), "inside") << i;
        const stdfs::path outsideFile = outside_->path() / "inner" / name;
        EXPECT_EQ(test::readFile(outsideFile), "outside") << i;
        EXPECT_EQ(test::lstatOf(outsideFile).st_uid, 0u) << i;
    }
    EXPECT_TRUE(test::namesIn(tree_ / "victim" / "inner").empty());
}

}  // namespace
}  // namespace berth
