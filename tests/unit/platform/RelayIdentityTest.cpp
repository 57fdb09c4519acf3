// Who the relay says a peer is, against real processes: copies of this test
// program act as clients (signed in the scratch root's registry or not, run
// by root or by another user, in launch groups and units or not) and
// connect, exec, fork and exit while the server asks for their identity on
// every request. The registry here has no racy window, so a connection
// keeps the identity it was given from its first request on, and every
// change below must still reach the very next request.
#include <fcntl.h>
#include <grp.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>

#include "CgroupSupport.h"
#include "RelayTestServer.h"
#include "ScratchDeviceRoot.h"
#include "platform/CodeSigningRegistry.h"

namespace berth {
namespace {

using test::dict;
using test::RelayTestServer;

// ---------------------------------------------------------------------------
// The client role. When this program is started with BERTH_RELAY_ROLE set it
// does not run the tests: it connects to BERTH_RELAY_SOCKET (or keeps the
// connection on descriptor BERTH_RELAY_FD it inherited) and obeys one command
// per line of standard input, answering each on standard output:
//   send <tag>   sends a request {"Tag": tag} and waits for its reply -> "ok"
//   exec         execs BERTH_RELAY_EXEC in the same role, keeping the socket
//   fork-exit    forks; the parent prints "forked <child pid>" and exits, the
//                child goes on reading commands
// It exits at the end of its input.

int connectedSocket() {
    if (const char* inherited = std::getenv("BERTH_RELAY_FD")) return std::atoi(inherited);
    const int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);  // inherited across exec on purpose
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, std::getenv("BERTH_RELAY_SOCKET"), sizeof address.sun_path - 1);
    if (::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) _exit(3);
    return fd;
}

void answer(const std::string& line) {
    std::printf("%s\n", line.c_str());
    std::fflush(stdout);
}

[[noreturn]] void runClientRole() {
    const int fd = connectedSocket();
    answer("connected");
    char line[256];
    while (std::fgets(line, sizeof line, stdin)) {
        std::string command(line);
        if (!command.empty() && command.back() == '\n') command.pop_back();
        if (command.rfind("send ", 0) == 0) {
            const uint64_t tag = std::strtoull(command.c_str() + 5, nullptr, 10);
            if (!test::writeAll(
                    fd, test::frameBytes(relay::FrameKind::Request, tag, dict({{"Tag", tag}}))))
                _exit(4);
            answer(test::readFrames(fd, 1).size() == 1 ? "ok" : "no reply");
        } else if (command == "exec") {
            const std::string fdText = std::to_string(fd);
            ::setenv("BERTH_RELAY_FD", fdText.c_str(), 1);
            const char* path = std::getenv("BERTH_RELAY_EXEC");
            ::execl(path, path, nullptr);
            _exit(5);
        } else if (command == "fork-exit") {
            const pid_t child = ::fork();
            if (child != 0) {
                answer("forked " + std::to_string(child));
                _exit(0);
            }
        }
    }
    _exit(0);
}

// Runs before anything else of the program when it is a client.
[[maybe_unused]] const bool kIsClient = [] {
    if (std::getenv("BERTH_RELAY_ROLE")) runClientRole();
    return false;
}();

[[maybe_unused]] const auto& kRoot = test::installScratchDeviceRoot();

// ---------------------------------------------------------------------------

const std::string kLaunchParent = "berth-test.identity." + std::to_string(::getpid());

// How a client is started: as which user, in which control group.
struct Start {
    std::optional<uid_t> user = {};
    int groupFd = -1;
};

// A client process started from `executable` in the client role, driven
// through pipes. Killed and reaped when the object goes, if still running.
class ClientProcess {
  public:
    ClientProcess(const std::filesystem::path& executable, const std::filesystem::path& socket,
                  const std::filesystem::path& execTarget = {}, Start start = {}) {
        int toChild[2], fromChild[2];
        if (::pipe2(toChild, O_CLOEXEC) != 0 || ::pipe2(fromChild, O_CLOEXEC) != 0) return;
        pid_ = ::fork();
        if (pid_ == 0) {
            if (start.groupFd >= 0 && LaunchCgroup::join(start.groupFd) != 0) _exit(125);
            if (start.user && (::setgroups(0, nullptr) != 0 || ::setgid(*start.user) != 0 ||
                               ::setuid(*start.user) != 0))
                _exit(126);
            ::dup2(toChild[0], STDIN_FILENO);
            ::dup2(fromChild[1], STDOUT_FILENO);
            ::setenv("BERTH_RELAY_ROLE", "client", 1);
            ::setenv("BERTH_RELAY_SOCKET", socket.c_str(), 1);
            ::unsetenv("BERTH_RELAY_FD");
            if (!execTarget.empty()) ::setenv("BERTH_RELAY_EXEC", execTarget.c_str(), 1);
            ::execl(executable.c_str(), executable.c_str(), nullptr);
            _exit(127);
        }
        ::close(toChild[0]);
        ::close(fromChild[1]);
        input_ = ::fdopen(toChild[1], "w");
        output_ = ::fdopen(fromChild[0], "r");
    }
    ~ClientProcess() {
        if (input_) std::fclose(input_);
        if (output_) std::fclose(output_);
        if (pid_ > 0 && !reaped_) {
            ::kill(pid_, SIGKILL);
            ::waitpid(pid_, nullptr, 0);
        }
    }

    pid_t pid() const { return pid_; }

    // Sends a command line, returns the answer line ("" at end of output).
    std::string command(const std::string& line) {
        std::fprintf(input_, "%s\n", line.c_str());
        std::fflush(input_);
        return readLine();
    }
    std::string readLine() {
        char buffer[256];
        if (!std::fgets(buffer, sizeof buffer, output_)) return "";
        std::string text(buffer);
        if (!text.empty() && text.back() == '\n') text.pop_back();
        return text;
    }
    // Waits for the process started here to exit.
    void reap() {
        ::waitpid(pid_, nullptr, 0);
        reaped_ = true;
    }

  private:
    pid_t pid_ = -1;
    FILE* input_ = nullptr;
    FILE* output_ = nullptr;
    bool reaped_ = false;
};

Value entitlementsAllowing(const char* key) {
    return dict({{key, true}});
}

// `identity` of process `pid` no longer bound to its socket, so without
// signing identifier and entitlements, for the reason `why`.
void expectUnbound(const RelayPeerIdentity& identity, pid_t pid, const std::string& why) {
    EXPECT_EQ(identity.pid, pid);
    EXPECT_FALSE(identity.processStillBound);
    EXPECT_FALSE(identity.signingIdentifier);
    EXPECT_FALSE(identity.entitlements);
    EXPECT_NE(identity.signingError.find(why), std::string::npos) << identity.signingError;
}

class RelayIdentityTest : public ::testing::Test {
  protected:
    void SetUp() override {
        BERTH_REQUIRE_ROOT();
        unsigned_ = std::filesystem::read_symlink("/proc/self/exe");
        signed_ = bin_ / "signed-client";
        std::filesystem::copy_file(unsigned_, signed_);
        std::filesystem::permissions(signed_, std::filesystem::perms(0755));
        sign(entitlementsAllowing("sys.kelp.private.Berth.allowed"));

        server_ = std::make_unique<RelayTestServer>(
            [this](const RelayEvent& event, RelayReply&) {
                const Value* tag = event.message().find("Tag");
                std::lock_guard lock(mutex_);
                seen_[tag ? *tag->uint64Value() : 0] = event.connection()->peerIdentity();
            },
            RelayLimits{}, registry_);
    }

    void sign(const Value& entitlements) {
        std::string why;
        ASSERT_EQ(registry_->sign(signed_, "sys.kelp.test.client", entitlements, &why), 0) << why;
    }

    RelayPeerIdentity seen(uint64_t tag) {
        std::lock_guard lock(mutex_);
        return seen_.at(tag);
    }

    test::ScratchDir bin_;
    std::filesystem::path unsigned_;
    std::filesystem::path signed_;
    std::shared_ptr<CodeSigningRegistry> registry_ =
        std::make_shared<CodeSigningRegistry>(CodeSigningRegistry::Options{
            .directory = {}, .launchCgroupParent = kLaunchParent, .racyWindow = {}});
    std::unique_ptr<RelayTestServer> server_;
    std::mutex mutex_;
    std::map<uint64_t, RelayPeerIdentity> seen_;
};

TEST_F(RelayIdentityTest, ASignedPeerIsIdentifiedAfreshOnEveryRequest) {
    ClientProcess client(signed_, server_->path());
    ASSERT_EQ(client.readLine(), "connected");
    ASSERT_EQ(client.command("send 1"), "ok");

    RelayPeerIdentity first = seen(1);
    EXPECT_TRUE(first.processStillBound) << first.signingError;
    EXPECT_EQ(first.pid, client.pid());
    EXPECT_EQ(first.effectiveUserId, 0u);
    EXPECT_EQ(first.groupId, 0u);
    EXPECT_EQ(first.signingIdentifier, "sys.kelp.test.client");
    EXPECT_EQ(first.entitlements, entitlementsAllowing("sys.kelp.private.Berth.allowed"));

    // Entitlements changed in the registry apply to the next request of a
    // connection already open.
    sign(entitlementsAllowing("sys.kelp.private.Berth.dataMigration"));
    ASSERT_EQ(client.command("send 2"), "ok");
    EXPECT_EQ(seen(2).entitlements, entitlementsAllowing("sys.kelp.private.Berth.dataMigration"));
}

TEST_F(RelayIdentityTest, ARememberedIdentityEndsWithAnExecOfAnotherProgram) {
    // A signed client sends two requests (the second served from the
    // remembered identity), then execs `target`; its next request is `tag`.
    auto execAfterRemembered = [&](ClientProcess& client, uint64_t tag) {
        EXPECT_EQ(client.readLine(), "connected");
        for (uint64_t sent : {tag - 2, tag - 1})
            EXPECT_EQ(client.command("send " + std::to_string(sent)), "ok");
        EXPECT_EQ(seen(tag - 1).signingIdentifier, "sys.kelp.test.client");
        EXPECT_EQ(client.command("exec"), "connected");
        EXPECT_EQ(client.command("send " + std::to_string(tag)), "ok");
        return seen(tag);
    };

    // Re-executing its own file it stays what it was: the file bound at
    // accept is the one it runs.
    ClientProcess same(signed_, server_->path(), signed_);
    const RelayPeerIdentity reexec = execAfterRemembered(same, 3);
    EXPECT_EQ(reexec.signingIdentifier, "sys.kelp.test.client") << reexec.signingError;

    // Anything else ends it, for good.
    ClientProcess other(signed_, server_->path(), unsigned_);
    expectUnbound(execAfterRemembered(other, 6), other.pid(), "another executable");
    ASSERT_EQ(other.command("send 7"), "ok");
    expectUnbound(seen(7), other.pid(), "another executable");
}

TEST_F(RelayIdentityTest, ABinaryReplacedOnDiskAfterConnectIsNotTrustedWithTheOldSignature) {
    ClientProcess client(signed_, server_->path(), signed_);
    ASSERT_EQ(client.readLine(), "connected");
    ASSERT_EQ(client.command("send 1"), "ok");
    ASSERT_EQ(seen(1).signingIdentifier, "sys.kelp.test.client");

    // New contents at the signed path, the way an update lands: the running
    // process keeps the old file, which is no longer the one signed there.
    const std::filesystem::path update = bin_ / "update";
    std::filesystem::copy_file(unsigned_, update);
    std::ofstream(update, std::ofstream::app) << "changed";
    std::filesystem::permissions(update, std::filesystem::perms(0755));
    std::filesystem::rename(update, signed_);
    ASSERT_EQ(client.command("send 2"), "ok");
    const RelayPeerIdentity replaced = seen(2);
    EXPECT_FALSE(replaced.signingIdentifier);
    EXPECT_FALSE(replaced.entitlements);
    EXPECT_NE(replaced.signingError.find("deleted or replaced"), std::string::npos)
        << replaced.signingError;

    // Running the new file under the signed path is not the signature
    // either, and neither is the old one moved back somewhere else.
    ASSERT_EQ(client.command("exec"), "connected");
    ASSERT_EQ(client.command("send 3"), "ok");
    expectUnbound(seen(3), client.pid(), "another executable");
}

TEST_F(RelayIdentityTest, ASignatureWithdrawnOrMovedAwayAppliesToTheNextRequest) {
    ClientProcess client(signed_, server_->path());
    ASSERT_EQ(client.readLine(), "connected");
    uint64_t tag = 1;
    auto identifierNow = [&] {
        EXPECT_EQ(client.command("send " + std::to_string(tag)), "ok");
        return seen(tag++).signingIdentifier;
    };
    ASSERT_EQ(identifierNow(), "sys.kelp.test.client");
    ASSERT_EQ(identifierNow(), "sys.kelp.test.client");

    ASSERT_EQ(registry_->remove(signed_), 0);
    EXPECT_FALSE(identifierNow());
    sign(entitlementsAllowing("sys.kelp.private.Berth.allowed"));
    EXPECT_EQ(identifierNow(), "sys.kelp.test.client");

    // The program moved to another path (its entry names the old one).
    const std::filesystem::path moved = bin_ / "moved-client";
    std::filesystem::rename(signed_, moved);
    EXPECT_FALSE(identifierNow());
    std::filesystem::rename(moved, signed_);

    // A registry directory others could write into stops counting at once.
    const std::filesystem::path directory = registry_->directory();
    std::filesystem::permissions(directory, std::filesystem::perms::others_write,
                                 std::filesystem::perm_options::add);
    EXPECT_FALSE(identifierNow());
    std::filesystem::permissions(directory, std::filesystem::perms::others_write,
                                 std::filesystem::perm_options::remove);
    EXPECT_EQ(identifierNow(), "sys.kelp.test.client");
}

TEST_F(RelayIdentityTest, AnUnsignedPeerThatExecsASignedProgramGainsNothing) {
    ClientProcess client(unsigned_, server_->path(), signed_);
    ASSERT_EQ(client.readLine(), "connected");
    ASSERT_EQ(client.command("send 1"), "ok");
    RelayPeerIdentity before = seen(1);
    EXPECT_TRUE(before.processStillBound) << before.signingError;
    EXPECT_FALSE(before.signingIdentifier);
    EXPECT_FALSE(before.entitlements);

    ASSERT_EQ(client.command("exec"), "connected");
    ASSERT_EQ(client.command("send 2"), "ok");
    expectUnbound(seen(2), client.pid(), "another executable");
}

TEST_F(RelayIdentityTest, ASocketOutlivingTheProcessThatConnectedCarriesNoIdentity) {
    ClientProcess client(signed_, server_->path());
    ASSERT_EQ(client.readLine(), "connected");
    ASSERT_EQ(client.command("send 1"), "ok");
    ASSERT_EQ(seen(1).signingIdentifier, "sys.kelp.test.client");

    // The connecting process hands the socket to a child (running the same
    // signed program) and exits.
    const std::string forked = client.command("fork-exit");
    ASSERT_EQ(forked.rfind("forked ", 0), 0u) << forked;
    client.reap();
    ASSERT_EQ(client.command("send 2"), "ok");
    expectUnbound(seen(2), client.pid(), "exited");
}

// ---------------------------------------------------------------------------
// Peers of another user than root: who they were started as.

constexpr uid_t kAppUser = 501;

class StartedIdentityTest : public RelayIdentityTest {
  protected:
    void SetUp() override {
        RelayIdentityTest::SetUp();
        if (IsSkipped() || HasFatalFailure()) return;
        std::string why;
        cgroups_ = LaunchCgroup::locate(kLaunchParent, &why);
        if (!cgroups_) GTEST_SKIP() << why;
        if (const std::string unusable = test::launchCgroupsUnusable(*cgroups_);
            !unusable.empty()) {
            cgroups_.reset();
            GTEST_SKIP() << unusable;
        }
        // The app user reaches the programs and the socket.
        std::filesystem::permissions(bin_.path(), std::filesystem::perms(0755));
        std::filesystem::permissions(server_->path().parent_path(), std::filesystem::perms(0755));
    }

    void TearDown() override {
        if (cgroups_) test::removeCgroupTree(cgroups_->parentPath());
        for (const std::filesystem::path& group : extraGroups_) test::removeCgroupTree(group);
    }

    // A client of the app user in the group open at `groupFd`, connected.
    std::unique_ptr<ClientProcess> startClient(const std::filesystem::path& program, int groupFd,
                                               const std::filesystem::path& execTarget = {}) {
        auto client = std::make_unique<ClientProcess>(program, server_->path(), execTarget,
                                                      Start{kAppUser, groupFd});
        EXPECT_EQ(client->readLine(), "connected");
        return client;
    }

    // What the server saw of request `tag`, sent now by `client`.
    RelayPeerIdentity identityOf(ClientProcess& client, uint64_t tag) {
        EXPECT_EQ(client.command("send " + std::to_string(tag)), "ok");
        return seen(tag);
    }

    std::optional<LaunchCgroup> cgroups_;
    std::vector<std::filesystem::path> extraGroups_;
};

// The peer is alive and served, but as nobody, for the reason `why`.
void expectNobody(const RelayPeerIdentity& identity, const std::string& why) {
    EXPECT_TRUE(identity.processStillBound) << identity.signingError;
    EXPECT_EQ(identity.effectiveUserId, kAppUser);
    EXPECT_FALSE(identity.signingIdentifier);
    EXPECT_FALSE(identity.entitlements);
    EXPECT_NE(identity.signingError.find(why), std::string::npos) << identity.signingError;
}

TEST_F(StartedIdentityTest, ASignedProgramOfAnotherUserIsNobodyOutsideALaunch) {
    auto client = startClient(signed_, -1);
    expectNobody(identityOf(*client, 1), "neither launched by berth-launch nor");
}

TEST_F(StartedIdentityTest, ALaunchedProcessKeepsItsIdentityWhateverItExecsUntilItExits) {
    std::optional<test::RecordedLaunch> launch =
        test::recordLaunch(*cgroups_, "sys.kelp.test.client", signed_, kAppUser);
    ASSERT_TRUE(launch) << strerror(errno);
    auto client = startClient(signed_, launch->group.fd.get(), unsigned_);
    const RelayPeerIdentity first = identityOf(*client, 1);
    EXPECT_TRUE(first.processStillBound) << first.signingError;
    EXPECT_EQ(first.effectiveUserId, kAppUser);
    EXPECT_EQ(first.signingIdentifier, "sys.kelp.test.client");
    EXPECT_EQ(first.entitlements, entitlementsAllowing("sys.kelp.private.Berth.allowed"));

    // An app's children are the app, whatever program they run.
    ASSERT_EQ(client->command("exec"), "connected");
    EXPECT_EQ(identityOf(*client, 2).signingIdentifier, "sys.kelp.test.client");

    // Re-signing with other entitlements applies to the next request.
    sign(entitlementsAllowing("sys.kelp.private.Berth.dataMigration"));
    EXPECT_EQ(identityOf(*client, 3).entitlements,
              entitlementsAllowing("sys.kelp.private.Berth.dataMigration"));

    // A socket passed on by a process that exited speaks for nobody.
    const std::string forked = client->command("fork-exit");
    ASSERT_EQ(forked.rfind("forked ", 0), 0u) << forked;
    client->reap();
    expectUnbound(identityOf(*client, 4), client->pid(), "exited");
}

// Each check a launch must pass, broken one at a time on a live connection
// (identity is evaluated per request) and then repaired.
TEST_F(StartedIdentityTest, ALaunchCountsOnlyWithItsOwnRecordInGroupsOnlyRootCanFill) {
    std::optional<test::RecordedLaunch> launch =
        test::recordLaunch(*cgroups_, "sys.kelp.test.client", signed_, kAppUser);
    ASSERT_TRUE(launch) << strerror(errno);
    auto client = startClient(signed_, launch->group.fd.get());
    uint64_t tag = 1;
    ASSERT_EQ(identityOf(*client, tag++).signingIdentifier, "sys.kelp.test.client");

    const LaunchRecords records;
    const std::filesystem::path recordFile = records.directory() / (launch->group.name + ".plist");
    const std::filesystem::path launchGroup = cgroups_->mount() / launch->group.path;
    const std::filesystem::path identifierGroup = launchGroup.parent_path();
    auto rewrite = [&](const std::function<void(LaunchRecord&)>& change) {
        LaunchRecord record = launch->record;
        change(record);
        ASSERT_EQ(records.write(launch->group.name, record), 0);
    };
    auto restore = [&] { rewrite([](LaunchRecord&) {}); };
    struct Case {
        const char* what;
        std::function<void()> breakIt;
        std::function<void()> repair;
        const char* why;
    };
    const std::vector<Case> cases = {
        {"a record of an earlier group of the same name",
         [&] { rewrite([](LaunchRecord& r) { r.cgroupId += 1; }); }, restore,
         "made for another group"},
        {"a record of another identifier",
         [&] { rewrite([](LaunchRecord& r) { r.identifier = "sys.kelp.test.other"; }); }, restore,
         "made for another group"},
        {"a record for another user",
         [&] { rewrite([](LaunchRecord& r) { r.persona = kAppUser + 1; }); }, restore,
         "runs as uid 502, not 501"},
        {"a program changed since it was launched",
         [&] { rewrite([](LaunchRecord& r) { r.digest[0] ^= 1; }); }, restore,
         "no longer signed as it was launched"},
        {"no record", [&] { ASSERT_EQ(records.remove(launch->group.name), 0); }, restore,
         "no launch record"},
        {"a record the user could have written",
         [&] { ASSERT_EQ(::chown(recordFile.c_str(), kAppUser, kAppUser), 0); },
         [&] { ASSERT_EQ(::chown(recordFile.c_str(), 0, 0), 0); }, "is not root's alone"},
        {"a launch group the user can move processes into",
         [&] { ASSERT_EQ(::chown((launchGroup / "cgroup.procs").c_str(), kAppUser, 0), 0); },
         [&] { ASSERT_EQ(::chown((launchGroup / "cgroup.procs").c_str(), 0, 0), 0); },
         "can be moved into"},
        {"an identifier group others can write",
         [&] { ASSERT_EQ(::chmod(identifierGroup.c_str(), 0777), 0); },
         [&] { ASSERT_EQ(::chmod(identifierGroup.c_str(), 0755), 0); }, "is not root's alone"},
        {"the program signed as another identifier since",
         [&] {
             ASSERT_EQ(registry_->sign(signed_, "sys.kelp.test.renamed",
                                       entitlementsAllowing("sys.kelp.private.Berth.allowed")),
                       0);
         },
         [&] { sign(entitlementsAllowing("sys.kelp.private.Berth.allowed")); },
         "no longer signed as it was launched"},
        {"the program's signature withdrawn", [&] { ASSERT_EQ(registry_->remove(signed_), 0); },
         [&] { sign(entitlementsAllowing("sys.kelp.private.Berth.allowed")); }, "no signature for"},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        c.breakIt();
        expectNobody(identityOf(*client, tag++), c.why);
        c.repair();
        EXPECT_EQ(identityOf(*client, tag++).signingIdentifier, "sys.kelp.test.client");
    }
}

TEST_F(StartedIdentityTest, TheProcessesOfABoundUnitAreItsEntry) {
    const std::string name = "berth-test-" + std::to_string(::getpid());
    const std::string unit = name + ".service";
    const std::filesystem::path slice = cgroups_->mount() / (name + ".slice");
    const std::filesystem::path worker = slice / unit / "worker";
    extraGroups_.push_back(slice);
    std::filesystem::create_directories(worker);
    std::string why;
    ASSERT_EQ(registry_->signUnit(unit, "sys.kelp.test.service",
                                  entitlementsAllowing("sys.kelp.private.Berth.allowed"), &why),
              0)
        << why;
    // A group of the unit's own below it, as a service that manages its
    // groups makes: still the unit.
    UniqueFd group(::open(worker.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    ASSERT_TRUE(group);
    auto client = startClient(signed_, group.get());
    uint64_t tag = 1;
    RelayPeerIdentity identity = identityOf(*client, tag++);
    EXPECT_EQ(identity.signingIdentifier, "sys.kelp.test.service") << identity.signingError;
    EXPECT_EQ(identity.entitlements, entitlementsAllowing("sys.kelp.private.Berth.allowed"));

    // A unit delegated to its own user may rearrange its own processes;
    // nobody outside can move one in, so it stays the unit.
    ASSERT_EQ(::chown((slice / unit).c_str(), kAppUser, kAppUser), 0);
    ASSERT_EQ(::chown((slice / unit / "cgroup.procs").c_str(), kAppUser, kAppUser), 0);
    EXPECT_EQ(identityOf(*client, tag++).signingIdentifier, "sys.kelp.test.service");

    // A slice above it that the user could fill is not.
    ASSERT_EQ(::chown((slice / "cgroup.procs").c_str(), kAppUser, kAppUser), 0);
    expectNobody(identityOf(*client, tag++), "can be moved into");
    ASSERT_EQ(::chown((slice / "cgroup.procs").c_str(), 0, 0), 0);
    EXPECT_EQ(identityOf(*client, tag++).signingIdentifier, "sys.kelp.test.service");

    ASSERT_EQ(registry_->removeUnit(unit, &why), 0) << why;
    expectNobody(identityOf(*client, tag++), "no signature for " + unit);
}

}  // namespace
}  // namespace berth
