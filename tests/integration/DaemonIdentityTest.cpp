// Whom the daemon serves with which entitlements when its clients are
// another user than root (uid 501): an unsigned program that connects and
// then execs a signed one, a thousand times over and against a busy
// listener; a signed program started by the user, with and without code
// preloaded into it; a launched program and what it forks and execs; a
// process of a bound unit; and the user's attempts to join a launch or to
// write its record.
#include <fcntl.h>
#include <grp.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>

#include <atomic>
#include <cstring>
#include <mutex>
#include <thread>

#include "CgroupSupport.h"
#include "DaemonSupport.h"
#include "core/RelayCodec.h"
#include "platform/CodeSigningRegistry.h"
#include "platform/LaunchCgroup.h"
#include "platform/LaunchRecord.h"

namespace berth::test {
namespace {

namespace fs = std::filesystem;

const fs::path kClient = BERTH_IDENTITY_CLIENT_PATH;
const fs::path kPreload = BERTH_TEST_PRELOAD_PATH;
constexpr uid_t kAppUser = 501;
const std::string kParent = "berth-test.daemon-identity." + std::to_string(::getpid());
const std::string kSignedAs = "sys.kelp.identity.signed";

// How a client runs: as which user, in which group, with which extra
// environment.
struct Start {
    std::optional<uid_t> user = {};
    int groupFd = -1;
    std::vector<std::string> environment = {};
};

// Runs `argv` as `start` says and gives its status and standard output.
Outcome runClient(const std::vector<std::string>& argv, const Start& start = {}) {
    int out[2];
    if (::pipe2(out, O_CLOEXEC) != 0) return {};
    std::vector<char*> args;
    for (const std::string& arg : argv) args.push_back(const_cast<char*>(arg.c_str()));
    args.push_back(nullptr);
    std::vector<std::string> environment = {"PATH=/usr/bin:/bin"};
    environment.insert(environment.end(), start.environment.begin(), start.environment.end());
    std::vector<char*> envp;
    for (std::string& entry : environment) envp.push_back(entry.data());
    envp.push_back(nullptr);
    const pid_t pid = ::fork();
    if (pid == 0) {
        if (start.groupFd >= 0 && LaunchCgroup::join(start.groupFd) != 0) _exit(125);
        if (start.user && (::setgroups(0, nullptr) != 0 || ::setgid(*start.user) != 0 ||
                           ::setuid(*start.user) != 0))
            _exit(126);
        ::dup2(out[1], STDOUT_FILENO);
        ::execve(args[0], args.data(), envp.data());
        _exit(127);
    }
    ::close(out[1]);
    Outcome outcome;
    char buffer[4096];
    for (ssize_t n; (n = ::read(out[0], buffer, sizeof buffer)) != 0;) {
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) break;
        outcome.out.append(buffer, static_cast<size_t>(n));
    }
    ::close(out[0]);
    int status = 0;
    ::waitpid(pid, &status, 0);
    outcome.status = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    return outcome;
}

class DaemonIdentityTest : public DaemonFixture {
  protected:
    void SetUp() override {
        DaemonFixture::SetUp();
        if (HasFatalFailure() || IsSkipped()) return;
        std::string why;
        cgroups_ = LaunchCgroup::locate(kParent, &why);
        if (cgroups_)
            cgroupsUnusable_ = launchCgroupsUnusable(*cgroups_);
        else
            cgroupsUnusable_ = why;
        ::setenv("BERTH_LAUNCH_CGROUP", kParent.c_str(), 1);
        ASSERT_NO_FATAL_FAILURE(start({{"BERTH_LAUNCH_CGROUP", kParent}}));
        socket_ = daemon_->requestSocket().string();
        // The app user reaches the socket, as on a device, and the programs.
        for (fs::path dir = daemon_->requestSocket().parent_path();
             dir != deviceRoot().parent_path(); dir = dir.parent_path())
            fs::permissions(dir, fs::perms::others_exec, fs::perm_options::add);
        fs::permissions(bin_.path(), fs::perms(0755));
        for (const char* name : {"unsigned-client", "signed-client"}) {
            fs::copy_file(kClient, bin_ / name);
            fs::permissions(bin_ / name, fs::perms(0755));
        }
        unsigned_ = bin_ / "unsigned-client";
        signed_ = bin_ / "signed-client";
        ASSERT_EQ(CodeSigningRegistry().sign(
                      signed_, kSignedAs, dict({{"sys.kelp.private.Berth.allowed", true}}), &why),
                  0)
            << why;
    }

    void TearDown() override {
        if (cgroups_) removeCgroupTree(cgroups_->parentPath());
        for (const fs::path& group : extraGroups_) removeCgroupTree(group);
        DaemonFixture::TearDown();
    }

    // Skips the test where launch groups cannot be made.
    bool cgroupsUsable() {
        if (cgroupsUnusable_.empty()) return true;
        cgroups_.reset();
        return false;
    }

    ScratchDir bin_;
    fs::path unsigned_;
    fs::path signed_;
    std::string socket_;
    std::optional<LaunchCgroup> cgroups_;
    std::string cgroupsUnusable_;
    std::vector<fs::path> extraGroups_;
};

// Connections opened and closed by another thread, a few thousand a second,
// so that the listener has others to accept while a try connects.
class Burst {
  public:
    explicit Burst(const std::string& socket)
        : thread_([this, socket] {
              while (!stop_) {
                  for (int i = 0; i < 8; ++i) {
                      UniqueFd fd = connectUnix(socket);
                      ++connections_;
                  }
                  std::this_thread::sleep_for(std::chrono::milliseconds(1));
              }
          }) {}
    ~Burst() {
        stop_ = true;
        thread_.join();
    }
    size_t connections() const { return connections_; }

  private:
    std::atomic<bool> stop_{false};
    std::atomic<size_t> connections_{0};
    std::thread thread_;
};

// Keeps the daemon stopped (SIGSTOP) while it lives: connections are queued
// but not accepted.
class Suspended {
  public:
    explicit Suspended(pid_t pid) : pid_(pid) { ::kill(pid_, SIGSTOP); }
    ~Suspended() { resume(); }
    void resume() {
        if (std::exchange(stopped_, false)) ::kill(pid_, SIGCONT);
    }

  private:
    pid_t pid_;
    bool stopped_ = true;
};

// Waits until process `pid` runs `program`.
bool runs(pid_t pid, const fs::path& program) {
    return eventually(
        [&] {
            std::error_code error;
            return fs::read_symlink("/proc/" + std::to_string(pid) + "/exe", error) == program;
        },
        std::chrono::seconds(20));
}

TEST_F(DaemonIdentityTest, ConnectingAndThenExecingASignedProgramNeverLendsItsEntitlements) {
    // The signed program itself is served: root's processes are the program
    // they run, and the client says "served" when it is.
    ASSERT_EQ(runClient({signed_.string(), "connect", socket_, "ask"}).out, "served\n");

    // One try: this unsigned test program, as the app user, connects, asks
    // once first (so the daemon has accepted) or not, and execs the signed
    // program, which asks on the same connection. `started` runs in the
    // parent once the child exists.
    const fs::path program = fs::canonical(signed_);
    auto connectThenExec = [&](bool askFirst, const std::function<void(pid_t)>& started) {
        int out[2];
        if (::pipe2(out, O_CLOEXEC) != 0) return std::string("no pipe");
        const pid_t pid = ::fork();
        if (pid == 0) {
            if (::setgroups(0, nullptr) != 0 || ::setgid(kAppUser) != 0 || ::setuid(kAppUser) != 0)
                _exit(126);
            const int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);  // kept across exec
            sockaddr_un address{};
            address.sun_family = AF_UNIX;
            std::strncpy(address.sun_path, socket_.c_str(), sizeof address.sun_path - 1);
            if (fd < 0 || ::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address))
                _exit(2);
            if (askFirst) {
                std::vector<uint8_t> frame;
                relay::encodeFrame(
                    {relay::FrameKind::Request, 99, dict({{"Command", uint64_t{19}}})}, frame);
                if (::write(fd, frame.data(), frame.size()) != static_cast<ssize_t>(frame.size()))
                    _exit(2);
                relay::FrameDecoder decoder;
                relay::Frame reply;
                uint8_t chunk[4096];
                while (decoder.next(reply) != relay::FrameDecoder::Status::Frame) {
                    const ssize_t n = ::read(fd, chunk, sizeof chunk);
                    if (n <= 0) _exit(2);
                    decoder.feed({chunk, static_cast<size_t>(n)});
                }
                if (code(reply.body) != 55) _exit(3);  // this unsigned program is refused
            }
            ::dup2(out[1], STDOUT_FILENO);
            const std::string fdEntry = "BERTH_IDENTITY_FD=" + std::to_string(fd);
            char* const argv[] = {const_cast<char*>(program.c_str()), const_cast<char*>("ask"),
                                  nullptr};
            char* const envp[] = {const_cast<char*>(fdEntry.c_str()), nullptr};
            ::execve(argv[0], argv, envp);
            _exit(127);
        }
        ::close(out[1]);
        if (pid > 0) started(pid);
        std::string text;
        char buffer[256];
        for (ssize_t n; (n = ::read(out[0], buffer, sizeof buffer)) != 0;) {
            if (n < 0 && errno == EINTR) continue;
            if (n < 0) break;
            text.append(buffer, static_cast<size_t>(n));
        }
        ::close(out[0]);
        int status = 0;
        ::waitpid(pid, &status, 0);
        return WIFEXITED(status) && WEXITSTATUS(status) == 0 ? text
                                                             : "status " + std::to_string(status);
    };

    // A thousand tries in four ways, two at a time.
    constexpr int kTries = 250;
    struct Variant {
        const char* what;
        bool askFirst;
        bool busy;       // another thread keeps the listener busy
        bool suspended;  // the daemon accepts only once the exec is done
    };
    for (const Variant& variant : {Variant{"exec after the daemon accepted", true, false, false},
                                   Variant{"exec at once", false, false, false},
                                   Variant{"exec at once, the listener busy", false, true, false},
                                   Variant{"exec before the daemon accepts", false, false, true}}) {
        SCOPED_TRACE(variant.what);
        std::optional<Burst> burst;
        if (variant.busy) burst.emplace(socket_);
        std::mutex suspending;  // one try at a time stops the daemon
        std::atomic<int> refused = 0;
        std::vector<std::string> others;
        std::mutex othersMutex;
        auto worker = [&](int tries) {
            for (int i = 0; i < tries; ++i) {
                std::unique_lock hold(suspending, std::defer_lock);
                std::optional<Suspended> stopped;
                if (variant.suspended) {
                    hold.lock();
                    stopped.emplace(daemon_->pid());
                }
                const std::string said = connectThenExec(variant.askFirst, [&](pid_t pid) {
                    if (!stopped) return;
                    runs(pid, program);
                    stopped->resume();
                    hold.unlock();
                });
                if (said == "refused\n") {
                    ++refused;
                } else {
                    std::lock_guard lock(othersMutex);
                    others.push_back(said);
                }
            }
        };
        std::thread second(worker, kTries / 2);
        worker(kTries - kTries / 2);
        second.join();
        if (burst) {
            EXPECT_GT(burst->connections(), size_t{kTries}) << "the listener was not busy";
        }
        EXPECT_EQ(refused, kTries);
        EXPECT_TRUE(others.empty()) << others.size() << " tries said " << others.front();
    }
}

TEST_F(DaemonIdentityTest, ASignedProgramTheUserStartsHasNoEntitlementsPreloadedOrNot) {
    const Outcome plain =
        runClient({signed_.string(), "connect", socket_, "ask", "who"}, {.user = kAppUser});
    EXPECT_EQ(plain.status, 0);
    EXPECT_EQ(plain.out.substr(0, plain.out.find("identifier none")), "refused\n") << plain.out;
    EXPECT_NE(plain.out.find("identifier none"), std::string::npos) << plain.out;

    const Start preloaded{.user = kAppUser, .environment = {"LD_PRELOAD=" + kPreload.string()}};
    const Outcome withCode = runClient({signed_.string(), "connect", socket_, "ask"}, preloaded);
    EXPECT_EQ(withCode.out, "preloaded\nrefused\n");

    // Root is trusted: the administrator's own signed program is served,
    // preloaded or not.
    EXPECT_EQ(runClient({signed_.string(), "connect", socket_, "ask"},
                        {.environment = {"LD_PRELOAD=" + kPreload.string()}})
                  .out,
              "preloaded\nserved\n");
}

TEST_F(DaemonIdentityTest, ALaunchedProgramAndWhatItForksAndExecsAreTheLaunch) {
    if (!cgroupsUsable()) GTEST_SKIP() << cgroupsUnusable_;
    std::optional<RecordedLaunch> launch = recordLaunch(*cgroups_, kSignedAs, signed_, kAppUser);
    ASSERT_TRUE(launch) << strerror(errno);
    // The launched program asks, forks, and its child execs an unsigned
    // program that connects on its own.
    const Outcome outcome =
        runClient({signed_.string(), "connect", socket_, "ask", "who", "fork", "exec",
                   unsigned_.string(), "connect", socket_, "ask", "who"},
                  {.user = kAppUser, .groupFd = launch->group.fd.get()});
    EXPECT_EQ(outcome.status, 0);
    EXPECT_EQ(outcome.out,
              "served\nidentifier " + kSignedAs + "\nserved\nidentifier " + kSignedAs + "\n");

    // Another process of the same user, outside the launch, is nobody.
    EXPECT_EQ(runClient({signed_.string(), "connect", socket_, "ask"}, {.user = kAppUser}).out,
              "refused\n");
}

TEST_F(DaemonIdentityTest, TheUserCanNeitherJoinALaunchNorWriteItsRecord) {
    if (!cgroupsUsable()) GTEST_SKIP() << cgroupsUnusable_;
    std::optional<RecordedLaunch> launch = recordLaunch(*cgroups_, kSignedAs, signed_, kAppUser);
    ASSERT_TRUE(launch) << strerror(errno);
    const fs::path group = cgroups_->mount() / launch->group.path;
    const fs::path records = LaunchRecords().directory();
    const fs::path record = records / (launch->group.name + ".plist");
    const std::string self = std::to_string(::getpid());

    // Every way in, tried as the app user: each must fail with a permission
    // error, and nothing may change.
    const int attempts = inChild(
        [&] {
            int failedAsDenied = 0;
            auto denied = [&](bool failed) {
                failedAsDenied += failed && (errno == EACCES || errno == EPERM);
            };
            for (const fs::path& procs :
                 {group / "cgroup.procs", group.parent_path() / "cgroup.procs",
                  cgroups_->parentPath() / "cgroup.procs"}) {
                UniqueFd fd(::open(procs.c_str(), O_WRONLY | O_CLOEXEC));
                denied(!fd || ::write(fd.get(), self.data(), self.size()) < 0);
            }
            denied(::mkdir((cgroups_->parentPath() / "forged").c_str(), 0755) != 0);
            denied(::mkdir((group.parent_path() / "0123456789abcdef0123456789abcdef").c_str(),
                           0755) != 0);
            UniqueFd created(::open((records / "0123456789abcdef0123456789abcdef.plist").c_str(),
                                    O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644));
            denied(!created);
            UniqueFd existing(::open(record.c_str(), O_WRONLY | O_CLOEXEC));
            denied(!existing);
            denied(::unlink(record.c_str()) != 0);
            return failedAsDenied;
        },
        kAppUser);
    EXPECT_EQ(attempts, 8);
    EXPECT_EQ(LaunchRecords().read(launch->group.name), launch->record);
    EXPECT_FALSE(cgroups_->holdsProcesses(launch->group.path, launch->group.id));
    EXPECT_FALSE(fs::exists(cgroups_->parentPath() / "forged"));
}

TEST_F(DaemonIdentityTest, AProcessOfABoundUnitIsTheUnitsEntry) {
    if (!cgroupsUsable()) GTEST_SKIP() << cgroupsUnusable_;
    const std::string name = "berth-test-" + std::to_string(::getpid());
    const std::string unit = name + ".service";
    const fs::path slice = cgroups_->mount() / (name + ".slice");
    extraGroups_.push_back(slice);
    fs::create_directories(slice / unit);
    UniqueFd group(::open((slice / unit).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    ASSERT_TRUE(group);
    const std::vector<std::string> argv = {unsigned_.string(), "connect", socket_, "ask", "who"};
    const Start inUnit{.user = kAppUser, .groupFd = group.get()};
    EXPECT_EQ(runClient(argv, inUnit).out.substr(0, 8), "refused\n");

    std::string why;
    ASSERT_EQ(
        CodeSigningRegistry().signUnit(unit, "sys.kelp.identity.service",
                                       dict({{"sys.kelp.private.Berth.allowed", true}}), &why),
        0)
        << why;
    EXPECT_EQ(runClient(argv, inUnit).out, "served\nidentifier sys.kelp.identity.service\n");
    // The same program outside the unit is nobody.
    EXPECT_EQ(runClient(argv, {.user = kAppUser}).out.substr(0, 8), "refused\n");
}

}  // namespace
}  // namespace berth::test
