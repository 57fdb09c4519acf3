// Reading a process's control group and telling from it how the process was
// started: the text of /proc/<pid>/cgroup, the two shapes of group that
// carry an identity, and the ownership that makes a group believable,
// checked on real groups.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include "CgroupSupport.h"
#include "TestSupport.h"
#include "platform/LaunchCgroup.h"
#include "platform/ProcessCgroup.h"

namespace berth {
namespace {

namespace fs = std::filesystem;
using Kind = CgroupOrigin::Kind;

const std::string kLaunch = "0123456789abcdef0123456789abcdef";

TEST(ProcessCgroupTest, TheUnifiedLineOfProcCgroup) {
    // A hybrid system: one line per hierarchy, the unified one last.
    EXPECT_EQ(unifiedCgroupIn("9:name=systemd:/user.slice\n4:memory:/x\n0::/a/b.service\n"),
              "a/b.service");
    EXPECT_EQ(unifiedCgroupIn("0::/\n"), "");
    EXPECT_EQ(unifiedCgroupIn("0::/only"), "only");
    // Only the unified hierarchy counts, and only a line that starts with it.
    EXPECT_FALSE(unifiedCgroupIn("1:cpu:/a\n"));
    EXPECT_FALSE(unifiedCgroupIn("10::/a\n"));
    EXPECT_FALSE(unifiedCgroupIn(""));
}

TEST(ProcessCgroupTest, UnitNames) {
    std::string why;
    for (const char* good : {"a.service", "getty@tty1.service", "run-u7.scope",
                             "dbus-:1.2-org.example@0.service", "x\\x2dy.service"})
        EXPECT_TRUE(isServiceUnitName(good, &why)) << good;
    for (const char* bad : {"", ".service", "a.slice", "a.socket", "a/b.service", "@x.service",
                            "a@b@c.service", "a b.service", ".hidden.service"})
        EXPECT_FALSE(isServiceUnitName(bad, &why)) << bad;
    EXPECT_NE(why.find("is not the name of a service or scope unit"), std::string::npos) << why;
    EXPECT_FALSE(isServiceUnitName(std::string(250, 'a') + ".service", &why));
}

TEST(ProcessCgroupTest, WhatAGroupSaysAboutHowItsProcessesStarted) {
    struct Row {
        std::string path;
        Kind kind;
        std::string name;  // the identifier or the unit
        size_t trustedDepth;
    };
    const std::vector<Row> rows = {
        {"berthd.launch/com.example.app/" + kLaunch, Kind::Launch, "com.example.app", 3},
        {"system.slice/berthd.launch/com.example.app/" + kLaunch, Kind::Other, "", 0},
        // Not exactly parent/identifier/launch.
        {"berthd.launch/com.example.app", Kind::Other, "", 0},
        {"berthd.launch/com.example.app/" + kLaunch + "/deeper", Kind::Other, "", 0},
        {"berthd.launch/com.example.app/" + kLaunch.substr(1), Kind::Other, "", 0},
        {"berthd.launch/com.example.app/0123456789ABCDEF0123456789ABCDEF", Kind::Other, "", 0},
        {"berthd.launch/cgroup.procs/" + kLaunch, Kind::Other, "", 0},
        {"berthd.launch/.hidden/" + kLaunch, Kind::Other, "", 0},
        // Units: the first component that is not a slice, below it the
        // unit's own groups.
        {"system.slice/lanternd.service", Kind::Unit, "lanternd.service", 1},
        {"system.slice/system-getty.slice/getty@tty1.service", Kind::Unit, "getty@tty1.service", 2},
        {"system.slice/lanternd.service/worker/fake.service", Kind::Unit, "lanternd.service", 1},
        {"init.scope", Kind::Unit, "init.scope", 0},
        // A user's own manager is a system unit; what it runs is below it.
        {"user.slice/user-501.slice/user@501.service/app.slice/evil.service", Kind::Unit,
         "user@501.service", 2},
        {"user.slice/user-501.slice/session-2.scope", Kind::Unit, "session-2.scope", 2},
        {"system.slice/cron.socket", Kind::Other, "", 0},
        // Below a group that is neither slice nor unit, a unit's name means
        // nothing.
        {"berthd.launch/fake.service", Kind::Other, "", 0},
        {"machine/system.slice/fake.service", Kind::Other, "", 0},
        {"user.slice", Kind::Other, "", 0},
        {"", Kind::Other, "", 0},
        {"system.slice//a.service", Kind::Other, "", 0},
        {"system.slice/../a.service", Kind::Other, "", 0},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.path);
        const CgroupOrigin origin = classifyCgroup(row.path, "berthd.launch");
        EXPECT_EQ(origin.kind, row.kind);
        EXPECT_EQ(row.kind == Kind::Unit ? origin.unit : origin.identifier, row.name);
        EXPECT_EQ(origin.trustedDepth, row.trustedDepth);
        if (row.kind == Kind::Launch) {
            EXPECT_EQ(origin.launch, kLaunch);
        }
    }
    // A deeper parent.
    const CgroupOrigin nested = classifyCgroup("a/b/com.example.app/" + kLaunch, "a/b");
    EXPECT_EQ(nested.kind, Kind::Launch);
    EXPECT_EQ(nested.trustedDepth, 4u);
}

class TrustedCgroupTest : public ::testing::Test {
  protected:
    void SetUp() override {
        BERTH_REQUIRE_ROOT();
        std::string why;
        cgroups_ = LaunchCgroup::locate(parent_, &why);
        if (!cgroups_) GTEST_SKIP() << why;
        if (const std::string unusable = test::launchCgroupsUnusable(*cgroups_);
            !unusable.empty()) {
            cgroups_.reset();
            GTEST_SKIP() << unusable;
        }
    }
    void TearDown() override {
        if (cgroups_) test::removeCgroupTree(cgroups_->parentPath());
    }

    const std::string parent_ = "berth-test.cgroup." + std::to_string(::getpid());
    std::optional<LaunchCgroup> cgroups_;
};

TEST_F(TrustedCgroupTest, AProcessIsFoundInItsGroupThroughItsPidfd) {
    std::optional<LaunchGroup> launch = cgroups_->createLaunch("com.example.found");
    ASSERT_TRUE(launch) << strerror(errno);
    EXPECT_TRUE(isLaunchName(launch->name)) << launch->name;
    EXPECT_EQ(launch->path, parent_ + "/com.example.found/" + launch->name);
    int ready[2];
    ASSERT_EQ(::pipe(ready), 0);
    const pid_t pid = ::fork();
    if (pid == 0) {
        if (LaunchCgroup::join(launch->fd.get()) != 0) _exit(1);
        (void)!::write(ready[1], "x", 1);
        ::pause();
        _exit(0);
    }
    char byte;
    ASSERT_EQ(::read(ready[0], &byte, 1), 1);
    UniqueFd pidfd(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)));
    ASSERT_TRUE(pidfd);
    std::string why;
    EXPECT_EQ(cgroupOfProcess(pid, pidfd.get(), &why), launch->path) << why;
    // A pid that another process than the pidfd's holds (as after reuse)
    // does not answer for it.
    UniqueFd ownPidfd(static_cast<int>(::syscall(SYS_pidfd_open, ::getpid(), 0)));
    EXPECT_FALSE(cgroupOfProcess(pid, ownPidfd.get(), &why));
    EXPECT_NE(why.find("pidfd refers to pid"), std::string::npos) << why;
    EXPECT_EQ(classifyCgroup(launch->path, parent_).kind, Kind::Launch);
    EXPECT_TRUE(cgroups_->holdsProcesses(launch->path, launch->id));
    EXPECT_FALSE(cgroups_->holdsProcesses(launch->path, launch->id + 1));

    ::kill(pid, SIGKILL);
    ::waitpid(pid, nullptr, 0);
    // Reaped: the pidfd no longer answers for the pid.
    EXPECT_FALSE(cgroupOfProcess(pid, pidfd.get(), &why));
    EXPECT_TRUE(
        test::eventually([&] { return !cgroups_->holdsProcesses(launch->path, launch->id); }));
    ::close(ready[0]);
    ::close(ready[1]);
}

TEST_F(TrustedCgroupTest, EveryLevelAndItsProcsFileMustBeRootsAlone) {
    std::optional<LaunchGroup> launch = cgroups_->createLaunch("com.example.owned");
    ASSERT_TRUE(launch) << strerror(errno);
    const fs::path group = cgroups_->mount() / launch->path;
    std::string why;
    UniqueFd opened = openTrustedCgroup(cgroups_->mount(), launch->path, 3, &why);
    ASSERT_TRUE(opened) << why;
    struct stat status {};
    ASSERT_EQ(::fstat(opened.get(), &status), 0);
    EXPECT_EQ(status.st_ino, launch->id);

    struct Case {
        fs::path item;
        bool chownIt;  // else chmod g+w
        const char* why;
    };
    for (const Case& c : {Case{group / "cgroup.procs", true, "can be moved into"},
                          Case{group.parent_path() / "cgroup.procs", true, "can be moved into"},
                          Case{group.parent_path(), true, "is not root's alone"},
                          Case{cgroups_->parentPath(), false, "is not root's alone"}}) {
        SCOPED_TRACE(c.item);
        struct stat before {};
        ASSERT_EQ(::stat(c.item.c_str(), &before), 0);
        if (c.chownIt)
            ASSERT_EQ(::chown(c.item.c_str(), 501, 501), 0);
        else
            ASSERT_EQ(::chmod(c.item.c_str(), before.st_mode | S_IWGRP), 0);
        why.clear();
        EXPECT_FALSE(openTrustedCgroup(cgroups_->mount(), launch->path, 3, &why));
        EXPECT_NE(why.find(c.why), std::string::npos) << why;
        ASSERT_EQ(::chown(c.item.c_str(), 0, 0), 0);
        ASSERT_EQ(::chmod(c.item.c_str(), before.st_mode & 07777), 0);
        EXPECT_TRUE(openTrustedCgroup(cgroups_->mount(), launch->path, 3, &why)) << why;
    }
    // Levels below the trusted depth are not looked at; more than the path
    // holds is refused.
    ASSERT_EQ(::chown((group / "cgroup.procs").c_str(), 501, 501), 0);
    EXPECT_TRUE(openTrustedCgroup(cgroups_->mount(), launch->path, 2, &why)) << why;
    EXPECT_FALSE(openTrustedCgroup(cgroups_->mount(), launch->path, 4, &why));
    EXPECT_FALSE(openTrustedCgroup(cgroups_->mount(), parent_ + "/com.example.none", 2, &why));
}

TEST_F(TrustedCgroupTest, ALaunchGroupIsNeverMadeTwice) {
    std::optional<LaunchGroup> first = cgroups_->createLaunch("com.example.twice");
    std::optional<LaunchGroup> second = cgroups_->createLaunch("com.example.twice");
    ASSERT_TRUE(first && second);
    EXPECT_NE(first->name, second->name);
    EXPECT_NE(first->id, second->id);
    // The identifier's group stays while a launch group is in it.
    EXPECT_EQ(cgroups_->remove("com.example.twice"), EBUSY);
    EXPECT_EQ(cgroups_->removeLaunch("com.example.twice", first->name), 0);
    EXPECT_EQ(cgroups_->removeLaunch("com.example.twice", second->name), 0);
    EXPECT_EQ(cgroups_->remove("com.example.twice"), 0);
}

}  // namespace
}  // namespace berth
