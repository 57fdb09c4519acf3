// berth-launch against a real daemon (root, bubblewrap, cgroup v2): what the
// launched program can and cannot see and touch, whose user it runs as, who
// the daemon takes it and its children for, the programs it refuses to run,
// a termination assertion that kills it and refuses its relaunch until
// invalidated, and the errors that name a missing prerequisite.
#include <fcntl.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/ptrace.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include <cstdlib>
#include <fstream>

#include "BTHApplicationTerminationAssertion.h"
#include "CgroupSupport.h"
#include "DaemonSupport.h"
#include "platform/CodeSigningRegistry.h"
#include "platform/LaunchCgroup.h"
#include "platform/LaunchRecord.h"
#include "platform/RelaunchBlock.h"
#include "upcall/BerthUpcall.h"

namespace berth {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using test::deviceRoot;

const fs::path kLauncher = BERTH_LAUNCH_BINARY_PATH;
const fs::path kClient = BERTH_IDENTITY_CLIENT_PATH;
const std::string kCgroupParent = "berth-test.launch." + std::to_string(::getpid());

// A launcher started in the background, its output collected in files.
class Launch {
  public:
    explicit Launch(std::vector<std::string> args) {
        args.insert(args.begin(), kLauncher.string());
        std::vector<char*> argv;
        for (std::string& arg : args) argv.push_back(arg.data());
        argv.push_back(nullptr);
        UniqueFd err(::open((outputs_ / "err").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600));
        UniqueFd out(::open((outputs_ / "out").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600));
        pid_ = ::fork();
        if (pid_ == 0) {
            ::dup2(out.get(), STDOUT_FILENO);
            ::dup2(err.get(), STDERR_FILENO);
            ::execv(argv[0], argv.data());
            _exit(127);
        }
    }
    ~Launch() {
        if (pid_ > 0 && !status_) {
            ::kill(pid_, SIGKILL);
            wait();
        }
    }
    test::Outcome wait() {
        int status = 0;
        if (!status_ && ::waitpid(pid_, &status, 0) == pid_)
            status_ = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
        return {status_.value_or(-1), test::readFile(outputs_ / "out"),
                test::readFile(outputs_ / "err")};
    }

  private:
    test::ScratchDir outputs_;
    pid_t pid_ = -1;
    std::optional<int> status_;
};

std::optional<fs::path> findBubblewrap() {
    for (const char* directory : {"/usr/bin", "/bin", "/usr/local/bin"})
        if (::access((fs::path(directory) / "bwrap").c_str(), X_OK) == 0)
            return fs::path(directory) / "bwrap";
    return std::nullopt;
}

class BerthLaunchTest : public test::DaemonFixture {
  protected:
    void SetUp() override {
        DaemonFixture::SetUp();
        if (HasFatalFailure() || IsSkipped()) return;
        const std::optional<fs::path> bwrap = findBubblewrap();
        if (!bwrap) GTEST_SKIP() << "bubblewrap (bwrap) is not installed";
        const test::Outcome sandbox =
            test::run(*bwrap, {"--ro-bind", "/", "/", "--proc", "/proc", "--dev", "/dev",
                               "--unshare-pid", "--", "/usr/bin/true"});
        if (sandbox.status != 0)
            GTEST_SKIP() << "bubblewrap cannot make a sandbox here: " << sandbox.err;
        std::string why;
        cgroups_ = LaunchCgroup::locate(kCgroupParent, &why);
        if (!cgroups_) GTEST_SKIP() << why;
        if (const std::string unusable = test::launchCgroupsUnusable(*cgroups_);
            !unusable.empty()) {
            cgroups_.reset();
            GTEST_SKIP() << unusable;
        }
        // The launcher, the daemon and this program's termination service
        // share a scratch parent group.
        ::setenv("BERTH_LAUNCH_CGROUP", kCgroupParent.c_str(), 1);
        // The persona walks down to its containers through the root, and to
        // the programs' bundles.
        fs::permissions(deviceRoot(), fs::perms(0755));
        fs::permissions(bundles_.path(), fs::perms(0755));
        ASSERT_NO_FATAL_FAILURE(start({{"BERTH_LAUNCH_CGROUP", kCgroupParent}}));
    }

    void TearDown() override {
        if (cgroups_) test::removeCgroupTree(cgroups_->parentPath());
        DaemonFixture::TearDown();
    }

    // The directories the daemon gives `identifier` of persona 501.
    static upcall::Reply containersOf(const std::string& identifier,
                                      std::vector<std::string> groups = {}) {
        upcall::Request request;
        request.signingIdentifier = identifier;
        request.persona = 501;
        request.groups = std::move(groups);
        upcall::CallFailure failure;
        auto answer = upcall::call(
            request, (deviceRoot() / "run/berthd/sys.kelp.berthd.upcall").string(), &failure);
        EXPECT_TRUE(answer && answer->reply.success) << failure.error << failure.detail;
        return answer ? answer->reply : upcall::Reply{};
    }

    // A copy of `program` in the bundle directory of `identifier`, owned by
    // root, signed as `identifier` with `entitlements` unless `sign` is false.
    fs::path bundled(const std::string& identifier, const fs::path& program,
                     const std::string& name, bool sign = true,
                     const Value& entitlements = Value::dictionary()) {
        const fs::path bundle = bundles_ / identifier;
        fs::create_directories(bundle);
        fs::permissions(bundle, fs::perms(0755));
        fs::copy_file(fs::canonical(program), bundle / name, fs::copy_options::overwrite_existing);
        fs::permissions(bundle / name, fs::perms(0755));
        std::string why;
        if (sign) {
            EXPECT_EQ(CodeSigningRegistry().sign(bundle / name, identifier, entitlements, &why), 0)
                << why;
        }
        return bundle / name;
    }

    // The arguments that launch `script` in a shell signed as `identifier`.
    std::vector<std::string> launchArgs(const std::string& identifier, const std::string& script,
                                        std::vector<std::string> extra = {}) {
        std::vector<std::string> args = {"--identifier", identifier, "--persona", "501"};
        args.insert(args.end(), extra.begin(), extra.end());
        args.insert(args.end(),
                    {"--", bundled(identifier, "/bin/sh", "sh").string(), "-c", script, "sh"});
        return args;
    }

    test::ScratchDir bundles_;
    std::optional<LaunchCgroup> cgroups_;
};

TEST_F(BerthLaunchTest, TheProgramSeesOnlyItsContainersAsThePersona) {
    const upcall::Reply other = containersOf("com.example.other");
    test::writeFile(fs::path(*other.dataContainer) / "secret", "other's");
    const upcall::Reply own = containersOf("com.example.sandboxed", {"group.example.shared"});
    ASSERT_EQ(own.groups.size(), 1u);
    const fs::path group = own.groups[0].second;
    test::writeFile(group / "shared", "from the group");
    ::chmod((group / "shared").c_str(), 0644);

    // Each line: a check and what it found.
    const std::string script =
        "echo uid=$(id -u) gid=$(id -g)\n"
        "echo home=$HOME tmpdir=$TMPDIR\n"
        "echo data > \"$BERTH_DATA_CONTAINER/written\" && echo data-writable\n"
        "echo tmp > \"$TMPDIR/written\" && echo tmp-writable\n"
        "echo group=$(cat \"$1/shared\")\n"
        "echo group > \"$1/written\" && echo group-writable\n"
        "ls \"$2\" >/dev/null 2>&1 && echo other-listed\n"
        "cat \"$2/secret\" 2>/dev/null && echo other-read\n"
        "ls \"$3\" >/dev/null 2>&1 && echo tree-listed\n"
        "echo class=$(ls \"$4\")\n";
    std::vector<std::string> args =
        launchArgs("com.example.sandboxed", script, {"--group", "group.example.shared"});
    args.insert(args.end(), {group.string(), *other.dataContainer,
                             (deviceRoot() / "private/var/containers").string(),
                             fs::path(*own.dataContainer).parent_path().string()});
    const test::Outcome outcome = Launch(args).wait();
    ASSERT_EQ(outcome.status, 0) << outcome.err;
    const std::string expected =
        "uid=501 gid=501\n"
        "home=" +
        *own.home + " tmpdir=" + *own.tmp +
        "\n"
        "data-writable\ntmp-writable\ngroup=from the group\ngroup-writable\n"
        "class=" +
        fs::path(*own.dataContainer).filename().string() + "\n";
    EXPECT_EQ(outcome.out, expected) << outcome.err;
    // What it wrote is the persona's.
    for (const fs::path& written : {fs::path(*own.dataContainer) / "written",
                                    fs::path(*own.tmp) / "written", group / "written"}) {
        EXPECT_EQ(test::lstatOf(written).st_uid, 501u) << written;
    }
    // The launch group goes with the program.
    EXPECT_FALSE(fs::exists(cgroups_->pathOf("com.example.sandboxed")));
}

TEST_F(BerthLaunchTest, EvenARootPersonaRunsWithoutCapabilities) {
    std::vector<std::string> args =
        launchArgs("com.example.rooted", "id -u; grep -E '^Cap(Eff|Prm|Bnd)' /proc/self/status");
    args[3] = "0";  // the persona
    const test::Outcome outcome = Launch(args).wait();
    ASSERT_EQ(outcome.status, 0) << outcome.err;
    EXPECT_EQ(outcome.out,
              "0\nCapPrm:\t0000000000000000\nCapEff:\t0000000000000000\n"
              "CapBnd:\t0000000000000000\n");
}

TEST_F(BerthLaunchTest, AContainerSwappedForALinkIsNeverBound) {
    // Another process of the app's user swaps its group container for a link
    // to another app's container. The daemon's look-up already refuses it
    // (success 0); the launcher would too (it opens every path without
    // following links). Either way nothing runs.
    const upcall::Reply other = containersOf("com.example.victim");
    const upcall::Reply own = containersOf("com.example.swapper", {"group.example.swapped"});
    ASSERT_EQ(own.groups.size(), 1u);
    const fs::path group = own.groups[0].second;
    fs::rename(group, group.string() + ".aside");
    fs::create_directory_symlink(*other.dataContainer, group);
    const test::Outcome outcome =
        Launch(launchArgs("com.example.swapper", "echo ran", {"--group", "group.example.swapped"}))
            .wait();
    EXPECT_EQ(outcome.status, 125);
    EXPECT_EQ(outcome.out, "");
    EXPECT_NE(outcome.err.find("berth-launch: "), std::string::npos) << outcome.err;
    fs::remove(group);
    fs::rename(group.string() + ".aside", group);
}

// The host pids of the processes launched for `identifier`.
std::vector<pid_t> launchedPids(const LaunchCgroup& cgroups, const std::string& identifier) {
    std::vector<pid_t> pids;
    std::error_code error;
    for (const auto& launch : fs::directory_iterator(cgroups.parentPath() / identifier, error)) {
        std::ifstream procs(launch.path() / "cgroup.procs");
        for (pid_t pid = 0; procs >> pid;) pids.push_back(pid);
    }
    return pids;
}

// Whether a process of uid 501 outside the launch can attach to `pid`.
bool attachableByTheUser(pid_t pid) {
    const pid_t child = ::fork();
    if (child == 0) {
        if (::setgroups(0, nullptr) != 0 || ::setgid(501) != 0 || ::setuid(501) != 0) _exit(2);
        if (::ptrace(PTRACE_ATTACH, pid, nullptr, nullptr) != 0) _exit(1);
        ::ptrace(PTRACE_DETACH, pid, nullptr, nullptr);
        _exit(0);
    }
    int status = 0;
    ::waitpid(child, &status, 0);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) != 2) << "cannot become uid 501";
    return WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

// The service's sysctl drop-in is what keeps the user's other programs from
// attaching to a launched app and speaking with its identity.
TEST_F(BerthLaunchTest, WithTheDropInAnotherProcessOfTheUserCannotAttachToALaunchedApp) {
    const fs::path scope = "/proc/sys/kernel/yama/ptrace_scope";
    if (!fs::exists(scope))
        GTEST_SKIP() << "this kernel has no Yama security module (" << scope
                     << " is missing): the drop-in sets nothing here";
    const std::string before = test::readFile(scope);
    struct Restore {
        fs::path scope;
        std::string value;
        ~Restore() { std::ofstream(scope) << value; }
    } restore{scope, before};

    const std::string identifier = "com.example.attached";
    const fs::path started = fs::path(*containersOf(identifier).dataContainer) / "started";
    Launch running(
        launchArgs(identifier, "echo yes > \"$BERTH_DATA_CONTAINER/started\"; exec sleep 600"));
    ASSERT_TRUE(test::eventually([&] { return fs::exists(started); }, 20s));
    const std::vector<pid_t> pids = launchedPids(*cgroups_, identifier);
    ASSERT_FALSE(pids.empty());

    std::ofstream(scope) << "0\n";
    if (!attachableByTheUser(pids.front()))
        GTEST_SKIP() << "the user cannot attach to the app even without the drop-in here "
                        "(the sandbox keeps it apart), so the drop-in makes no difference";
    const test::Outcome applied = test::run(
        "/sbin/sysctl", {"-p", std::string(BERTH_SOURCE_DIR) + "/packaging/berthd.sysctl"});
    ASSERT_EQ(applied.status, 0) << applied.err;
    for (const pid_t pid : pids) EXPECT_FALSE(attachableByTheUser(pid)) << "pid " << pid;
}

TEST_F(BerthLaunchTest, AnAssertionKillsTheProgramAndHoldsItUntilInvalidated) {
    const std::string identifier = "com.example.held";
    const fs::path started = fs::path(*containersOf(identifier).dataContainer) / "started";
    Launch running(
        launchArgs(identifier, "echo yes > \"$BERTH_DATA_CONTAINER/started\"; exec sleep 600"));
    ASSERT_TRUE(test::eventually([&] { return fs::exists(started); }, 20s));

    auto assertion = BTHApplicationTerminationAssertion::initWithBundleIdentifier(identifier, 0);
    ASSERT_TRUE(assertion);
    EXPECT_FALSE(cgroups_->populated(identifier));
    const test::Outcome killed = running.wait();
    EXPECT_EQ(killed.status, 128 + SIGKILL) << killed.err;

    const test::Outcome refused = Launch(launchArgs(identifier, "echo ran")).wait();
    EXPECT_EQ(refused.status, 125);
    EXPECT_EQ(refused.out, "");
    EXPECT_NE(refused.err.find(identifier + " is held terminated by berthd (installation)"),
              std::string::npos)
        << refused.err;
    // Another application is not held.
    EXPECT_EQ(Launch(launchArgs("com.example.free", "echo ran")).wait().out, "ran\n");

    assertion->invalidate();
    const test::Outcome again = Launch(launchArgs(identifier, "echo ran")).wait();
    EXPECT_EQ(again.status, 0) << again.err;
    EXPECT_EQ(again.out, "ran\n");
}

TEST_F(BerthLaunchTest, ADaemonStartLiftsTheBlocksOfItsPredecessor) {
    // A daemon that died holding an assertion left its block behind.
    ASSERT_EQ(RelaunchBlocks().set("com.example.orphaned", "installation"), 0);
    const test::Outcome refused = Launch({"--identifier", "com.example.orphaned", "--persona",
                                          "501", "--", "/bin/echo", "ran"})
                                      .wait();
    EXPECT_EQ(refused.status, 125) << refused.err;
    ASSERT_NO_FATAL_FAILURE(start({{"BERTH_LAUNCH_CGROUP", kCgroupParent}}));
    const test::Outcome launched = Launch(launchArgs("com.example.orphaned", "echo ran")).wait();
    EXPECT_EQ(launched.status, 0) << launched.err;
    EXPECT_EQ(launched.out, "ran\n");
}

TEST_F(BerthLaunchTest, ItsOwnStatusOrTheProgramsComesBack) {
    EXPECT_EQ(Launch(launchArgs("com.example.status", "exit 7")).wait().status, 7);
    const test::Outcome missing =
        Launch({"--identifier", "com.example.status", "--persona", "501", "--", "/no/such/program"})
            .wait();
    EXPECT_EQ(missing.status, 127);
    EXPECT_NE(missing.err.find("program not found: /no/such/program"), std::string::npos);
    const test::Outcome unknownUser =
        Launch({"--identifier", "com.example.status", "--persona", "777", "--", "/bin/true"})
            .wait();
    EXPECT_EQ(unknownUser.status, 125);
    EXPECT_NE(unknownUser.err.find("no user with uid 777"), std::string::npos);
    const test::Outcome badName =
        Launch({"--identifier", "../escape", "--persona", "501", "--", "/bin/true"}).wait();
    EXPECT_EQ(badName.status, 64);
    EXPECT_NE(badName.err.find("cannot name a control group"), std::string::npos);
}

TEST_F(BerthLaunchTest, AMissingPrerequisiteIsNamed) {
    // Not root.
    const test::Outcome notRoot = test::run(kLauncher, launchArgs("com.example.pre", "true"), 501);
    EXPECT_EQ(notRoot.status, 125);
    EXPECT_NE(notRoot.err.find("must run as root"), std::string::npos) << notRoot.err;

    // No bubblewrap on the search path.
    const std::string path = std::getenv("PATH") ? std::getenv("PATH") : "";
    ::setenv("PATH", "/nonexistent", 1);
    const test::Outcome noBwrap = test::run(kLauncher, launchArgs("com.example.pre", "true"));
    ::setenv("PATH", path.c_str(), 1);
    EXPECT_EQ(noBwrap.status, 125);
    EXPECT_NE(noBwrap.err.find("bubblewrap is not installed"), std::string::npos) << noBwrap.err;

    // No daemon.
    daemon_.reset();
    const test::Outcome noDaemon = test::run(kLauncher, launchArgs("com.example.pre", "true"));
    EXPECT_EQ(noDaemon.status, 125);
    EXPECT_NE(noDaemon.err.find("berthd is not running on the device root"), std::string::npos)
        << noDaemon.err;
}

TEST_F(BerthLaunchTest, TheAppAndWhatItForksAndExecsAreWhoItWasLaunchedAs) {
    const std::string identifier = "com.example.identity";
    const fs::path app = bundled(identifier, kClient, "app", true,
                                 test::dict({{"sys.kelp.private.Berth.allowed", true}}));
    const fs::path helper = bundled(identifier, kClient, "helper", false);
    // The app asks through the socket the sandbox gives it, forks, and its
    // child execs an unsigned program of the bundle that connects on its own.
    const test::Outcome outcome =
        Launch({"--identifier", identifier, "--persona", "501", "--", app.string(), "ask", "who",
                "fork", "exec", helper.string(), "connect", "/run/berthd/sys.kelp.berthd", "ask",
                "who"})
            .wait();
    ASSERT_EQ(outcome.status, 0) << outcome.err << outcome.out;
    EXPECT_EQ(outcome.out,
              "served\nidentifier " + identifier + "\nserved\nidentifier " + identifier + "\n");
    // The launch leaves no record and no group behind.
    EXPECT_TRUE(LaunchRecords().launches().empty());
    EXPECT_FALSE(fs::exists(cgroups_->pathOf(identifier)));

    // The same program started by the user directly is nobody.
    const fs::path socket = deviceRoot() / "run/berthd/sys.kelp.berthd";
    EXPECT_EQ(test::run(app, {"connect", socket.string(), "ask"}, 501).out, "refused\n");
}

TEST_F(BerthLaunchTest, OnlyAProgramSignedAsTheApplicationAndRootsAloneIsLaunched) {
    const fs::path unsignedProgram = bundled("com.example.plain", "/bin/true", "true", false);
    const fs::path other = bundled("com.example.other", "/bin/true", "true");
    const fs::path changed = bundled("com.example.changed", "/bin/true", "true");
    std::ofstream(changed, std::ofstream::app) << "\n";
    const fs::path writable = bundled("com.example.writable", "/bin/true", "true");
    fs::permissions(writable, fs::perms(0775));
    struct Case {
        std::string identifier;
        fs::path program;
        std::string why;
    };
    for (const Case& c :
         {Case{"com.example.plain", unsignedProgram,
               "no signature for " + unsignedProgram.string()},
          Case{"com.example.impostor", other,
               "is signed as com.example.other, not com.example.impostor"},
          Case{"com.example.changed", changed, "do not match its signature"},
          Case{"com.example.writable", writable, "can be changed by users other than root"}}) {
        SCOPED_TRACE(c.identifier);
        const test::Outcome refused =
            Launch({"--identifier", c.identifier, "--persona", "501", "--", c.program.string()})
                .wait();
        EXPECT_EQ(refused.status, 125);
        EXPECT_NE(refused.err.find(c.why), std::string::npos) << refused.err;
    }
    EXPECT_TRUE(LaunchRecords().launches().empty());
}

TEST_F(BerthLaunchTest, ALaunchWhoseLauncherDiedLeavesNoUsableRecord) {
    // A launcher killed with its program leaves a record and an empty group;
    // the next launch clears them.
    std::optional<LaunchGroup> group = cgroups_->createLaunch("com.example.orphan");
    ASSERT_TRUE(group);
    const fs::path program = bundled("com.example.orphan", "/bin/true", "true");
    ASSERT_EQ(LaunchRecords().write(
                  group->name, {"com.example.orphan", program, {}, 501, group->path, group->id}),
              0);
    EXPECT_EQ(Launch(launchArgs("com.example.next", "echo ran")).wait().out, "ran\n");
    EXPECT_TRUE(LaunchRecords().launches().empty());
    EXPECT_FALSE(fs::exists(cgroups_->mount() / group->path));
}

}  // namespace
}  // namespace berth
