// The Linux termination service against real control groups (root, cgroup
// v2): every process of the application's launch group dies, forks
// included, with the kernel's kill file and without it; the relaunch block
// stays while any assertion on the identifier holds. And finding the cgroup2
// mount in mountinfo texts of pure and hybrid systems.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>

#include <fstream>

#include "CgroupSupport.h"
#include "TestSupport.h"
#include "platform/ApplicationTermination.h"

namespace berth {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

TEST(ApplicationTerminationTest, TheCgroup2MountComesFromMountinfo) {
    const std::string hybrid =
        "35 30 0:31 / /sys/fs/cgroup/memory rw,nosuid - cgroup cgroup rw,memory\n"
        "40 30 0:37 / /sys/fs/cgroup/unified rw,relatime - cgroup2 cgroup2 rw\n";
    EXPECT_EQ(BTHCgroup2MountIn(hybrid), fs::path("/sys/fs/cgroup/unified"));
    EXPECT_EQ(BTHCgroup2MountIn("29 1 0:26 / /sys/fs/cgroup rw shared:4 - cgroup2 cgroup2 rw\n"),
              fs::path("/sys/fs/cgroup"));
    EXPECT_EQ(BTHCgroup2MountIn("29 1 0:26 / /mnt/cg\\040two rw - cgroup2 none rw\n"),
              fs::path("/mnt/cg two"));
    EXPECT_FALSE(BTHCgroup2MountIn("35 30 0:31 / /sys/fs/cgroup/memory rw - cgroup cgroup rw\n"));
    EXPECT_FALSE(BTHCgroup2MountIn(""));
}

TEST(ApplicationTerminationTest, IdentifiersThatCannotNameAGroupAreRefused) {
    for (const char* bad : {"", ".", "..", ".hidden", "a/b", "cgroup.procs", "a\nb"}) {
        std::string why;
        EXPECT_FALSE(LaunchCgroup::validName(bad, &why)) << bad;
        EXPECT_NE(why.find("cannot name a control group"), std::string::npos);
    }
    std::string why;
    EXPECT_TRUE(LaunchCgroup::validName("com.example.app", &why));
}

// A scratch parent group and block directory per test, removed afterwards.
class CgroupTerminationTest : public ::testing::TestWithParam<bool> {
  protected:
    void SetUp() override {
        BERTH_REQUIRE_ROOT();
        std::string why;
        parent_ = "berth-test.termination." + std::to_string(::getpid());
        cgroups_ = LaunchCgroup::locate(parent_, &why);
        if (!cgroups_) GTEST_SKIP() << why;
        if (const std::string unusable = test::launchCgroupsUnusable(*cgroups_);
            !unusable.empty()) {
            cgroups_.reset();
            GTEST_SKIP() << unusable;
        }
        CgroupApplicationTermination::Options options;
        options.cgroupParent = parent_;
        options.blockDirectory = blocks_ / "terminated";
        options.killLimit = 10s;
        options.useKillFile = GetParam();
        service_ = std::make_unique<CgroupApplicationTermination>(options);
    }

    void TearDown() override {
        if (!cgroups_) return;
        for (pid_t pid : children_) {
            ::kill(pid, SIGKILL);
            ::waitpid(pid, nullptr, 0);
        }
        // Forks of the children too: anything left would hold the test's
        // output open.
        test::removeCgroupTree(cgroups_->parentPath());
    }

    // A process in a launch group of the identifier that forks a grandchild,
    // both sleeping until killed.
    pid_t startInGroup(const std::string& identifier) {
        std::optional<LaunchGroup> launch = cgroups_->createLaunch(identifier);
        EXPECT_TRUE(launch) << strerror(errno);
        const int group = launch ? launch->fd.get() : -1;
        const pid_t pid = ::fork();
        if (pid == 0) {
            if (LaunchCgroup::join(group) != 0) _exit(1);
            if (::fork() == 0) ::pause();
            ::pause();
            _exit(0);
        }
        children_.push_back(pid);
        EXPECT_TRUE(test::eventually([&] { return cgroups_->populated(identifier); }));
        return pid;
    }

    // Takes an assertion; the error text when acquisition failed.
    std::shared_ptr<TerminationAssertionHandle> take(const std::string& identifier,
                                                     std::optional<std::string>* failure) {
        int calls = 0;
        auto assertion = service_->createAssertion(identifier, TerminationReason::CacheDeletion,
                                                   [&](const TerminationError* error) {
                                                       ++calls;
                                                       if (error) *failure = error->description;
                                                   });
        EXPECT_EQ(calls, 1) << "acquisition reported before createAssertion returned, once";
        return assertion;
    }

    std::optional<std::string> blockOf(const std::string& identifier) const {
        return RelaunchBlocks(blocks_ / "terminated").reasonFor(identifier);
    }

    std::string parent_;
    std::optional<LaunchCgroup> cgroups_;
    test::ScratchDir blocks_;
    std::unique_ptr<CgroupApplicationTermination> service_;
    std::vector<pid_t> children_;
};

TEST_P(CgroupTerminationTest, EveryProcessOfTheGroupDiesAndTheBlockHolds) {
    const pid_t pid = startInGroup("com.example.running");
    const pid_t bystander = startInGroup("com.example.other");
    std::optional<std::string> failure;
    auto assertion = take("com.example.running", &failure);
    ASSERT_TRUE(assertion);
    EXPECT_FALSE(failure) << *failure;
    // Once acquired, nothing of the application runs, its fork included.
    EXPECT_FALSE(cgroups_->populated("com.example.running"));
    int status = 0;
    ASSERT_EQ(::waitpid(pid, &status, 0), pid);
    EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL) << status;
    std::erase(children_, pid);
    EXPECT_EQ(blockOf("com.example.running"), "cache deletion");
    // Another application is left alone.
    EXPECT_TRUE(cgroups_->populated("com.example.other"));
    EXPECT_EQ(::waitpid(bystander, &status, WNOHANG), 0);
    EXPECT_FALSE(blockOf("com.example.other"));

    service_->invalidate(assertion);
    EXPECT_FALSE(blockOf("com.example.running"));
}

TEST_P(CgroupTerminationTest, TheBlockLastsUntilTheLastAssertionGoes) {
    std::optional<std::string> failure;
    // Never launched: nothing to kill, still held.
    auto first = take("com.example.idle", &failure);
    auto second = take("com.example.idle", &failure);
    EXPECT_FALSE(failure);
    service_->invalidate(first);
    service_->invalidate(first);  // a second release of the same one counts nothing
    EXPECT_TRUE(blockOf("com.example.idle"));
    service_->invalidate(second);
    EXPECT_FALSE(blockOf("com.example.idle"));
}

TEST_P(CgroupTerminationTest, AnIdentifierThatCannotNameAGroupIsNotAcquired) {
    std::optional<std::string> failure;
    auto assertion = take("../escape", &failure);
    ASSERT_TRUE(failure);
    EXPECT_NE(failure->find("cannot name a control group"), std::string::npos) << *failure;
    service_->invalidate(assertion);
    EXPECT_TRUE(test::namesIn(blocks_.path()).empty());
}

TEST_P(CgroupTerminationTest, StaleBlocksAreClearedAtStartUp) {
    const RelaunchBlocks blocks(blocks_ / "terminated");
    ASSERT_EQ(blocks.set("com.example.a", "installation"), 0);
    ASSERT_EQ(blocks.set("com.example.b", "critical"), 0);
    EXPECT_EQ(blocks.reasonFor("com.example.b"), "critical");
    EXPECT_EQ(service_->clearStaleBlocks(), 0);
    EXPECT_TRUE(test::namesIn(blocks.directory()).empty());
}

INSTANTIATE_TEST_SUITE_P(KillFile, CgroupTerminationTest, ::testing::Bool(), [](const auto& info) {
    return info.param ? "WithKillFile" : "KillingEachListedProcess";
});

}  // namespace
}  // namespace berth
