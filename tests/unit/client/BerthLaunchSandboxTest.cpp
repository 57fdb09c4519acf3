// The sandbox's command line: what is bound where and how, the parent
// directories made reachable for the persona, and the hand-over to the
// launcher's own program that drops to the persona.
#include <gtest/gtest.h>

#include <algorithm>

#include "Sandbox.h"

namespace berth::launch {
namespace {

// The positions of `sequence` in `args`, as a run of consecutive items.
std::vector<size_t> positionsOf(const std::vector<std::string>& args,
                                const std::vector<std::string>& sequence) {
    std::vector<size_t> found;
    for (auto at = args.begin();
         (at = std::search(at, args.end(), sequence.begin(), sequence.end())) != args.end(); ++at)
        found.push_back(at - args.begin());
    return found;
}

TEST(BerthLaunchSandboxTest, AncestorsFromTheTop) {
    EXPECT_EQ(ancestorsOf("/a/b/c"), (std::vector<std::string>{"/a", "/a/b"}));
    EXPECT_TRUE(ancestorsOf("/a").empty());
}

TEST(BerthLaunchSandboxTest, ContainersAreBoundFromTheirDescriptorsBelowReachableParents) {
    SandboxPlan plan;
    plan.bindings = {{7, "/tmp/root/var/mobile/Containers/Data/Application/X", true},
                     {8, "/tmp/root/var/mobile/Containers/Shared/AppGroup/Y", true},
                     {9, "/opt/app/bin", false}};
    plan.helperFd = 10;
    plan.uid = 501;
    plan.gid = 502;
    plan.environment = {{"HOME", "/tmp/root/var/mobile"}};
    plan.workingDirectory = "/tmp/root/var/mobile/Containers/Data/Application/X";
    plan.program = {"/opt/app/bin/app", "--flag"};
    const std::vector<std::string> args = bubblewrapArguments(plan);

    const std::vector<size_t> data =
        positionsOf(args, {"--bind-fd", "7", "/tmp/root/var/mobile/Containers/Data/Application/X"});
    const std::vector<size_t> group =
        positionsOf(args, {"--bind-fd", "8", "/tmp/root/var/mobile/Containers/Shared/AppGroup/Y"});
    ASSERT_EQ(data.size(), 1u);
    ASSERT_EQ(group.size(), 1u);
    EXPECT_EQ(positionsOf(args, {"--ro-bind-fd", "9", "/opt/app/bin"}).size(), 1u);
    EXPECT_EQ(positionsOf(args, {"--ro-bind-fd", "10", kHelperPath}).size(), 1u);
    // Each parent is made once, mode 0755, before what is bound below it;
    // /tmp itself is the sandbox's fresh tmpfs and is not made again.
    for (const char* parent :
         {"/tmp/root", "/tmp/root/var/mobile/Containers", "/tmp/root/var/mobile/Containers/Data",
          "/tmp/root/var/mobile/Containers/Shared/AppGroup", "/opt", "/opt/app"}) {
        const std::vector<size_t> made = positionsOf(args, {"--perms", "0755", "--dir", parent});
        ASSERT_EQ(made.size(), 1u) << parent;
    }
    EXPECT_LT(positionsOf(args, {"--dir", "/tmp/root/var/mobile/Containers/Data"})[0], data[0]);
    EXPECT_TRUE(positionsOf(args, {"--dir", "/tmp"}).empty());
    EXPECT_LT(positionsOf(args, {"--tmpfs", "/tmp"})[0], data[0]);
    // Nothing of the host's file system but the system's directories.
    EXPECT_TRUE(positionsOf(args, {"--ro-bind", "/", "/"}).empty());
    EXPECT_TRUE(positionsOf(args, {"--bind", "/", "/"}).empty());
    EXPECT_EQ(positionsOf(args, {"--clearenv"}).size(), 1u);
    EXPECT_EQ(positionsOf(args, {"--setenv", "HOME", "/tmp/root/var/mobile"}).size(), 1u);
    EXPECT_EQ(positionsOf(args, {"--chdir", plan.workingDirectory}).size(), 1u);
    // The command: the helper becomes the persona, then runs the program.
    const std::vector<std::string> tail = {"--",  kHelperPath, "--as-persona",     "501",
                                           "502", "--",        "/opt/app/bin/app", "--flag"};
    ASSERT_GE(args.size(), tail.size());
    EXPECT_TRUE(std::equal(tail.begin(), tail.end(), args.end() - tail.size()));
}

TEST(BerthLaunchSandboxTest, TheCheckedProgramAndTheRequestSocketAreBoundFromDescriptors) {
    SandboxPlan plan;
    plan.bindings = {{9, "/opt/app/bin", false}};
    plan.helperFd = 10;
    plan.programFd = 11;
    plan.requestSocketFd = 12;
    plan.program = {"/opt/app/bin/app"};
    const std::vector<std::string> args = bubblewrapArguments(plan);
    // The program's own file comes after its directory, so it is the file
    // whose signature was checked that runs, read-only.
    const std::vector<size_t> directory = positionsOf(args, {"--ro-bind-fd", "9", "/opt/app/bin"});
    const std::vector<size_t> program =
        positionsOf(args, {"--ro-bind-fd", "11", "/opt/app/bin/app"});
    ASSERT_EQ(directory.size(), 1u);
    ASSERT_EQ(program.size(), 1u);
    EXPECT_LT(directory[0], program[0]);
    EXPECT_EQ(positionsOf(args, {"--perms", "0755", "--dir", "/run/berthd", "--bind-fd", "12",
                                 kRequestSocketPath})
                  .size(),
              1u);
    EXPECT_LT(positionsOf(args, {"--dir", "/run"})[0],
              positionsOf(args, {"--dir", "/run/berthd"})[0]);

    // Without them, nothing is bound in their place.
    plan.programFd = plan.requestSocketFd = -1;
    const std::vector<std::string> bare = bubblewrapArguments(plan);
    EXPECT_TRUE(positionsOf(bare, {"/opt/app/bin/app"}).size() == 1u);  // the command only
    EXPECT_TRUE(positionsOf(bare, {kRequestSocketPath}).empty());
}

}  // namespace
}  // namespace berth::launch
