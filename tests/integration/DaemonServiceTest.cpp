// The daemon as the service manager runs it: readiness and stop
// notifications, sockets opened on its behalf and handed over, and the
// users and directories that the package's sysusers and tmpfiles files make.
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cstring>

#include "DaemonSupport.h"
#include "platform/UpcallTransport.h"

namespace berth {
namespace {

namespace fs = std::filesystem;
using test::DaemonLaunch;
using test::DaemonProcess;

const fs::path& root() {
    return test::deviceRoot();
}

UniqueFd bindUnix(const fs::path& path, int type) {
    UniqueFd fd(::socket(AF_UNIX, type | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
    fs::remove(path);
    if (!fd || ::bind(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0)
        return UniqueFd();
    return fd;
}

UniqueFd listeningSocket(const fs::path& path, int type) {
    UniqueFd fd = bindUnix(path, type);
    if (fd && ::listen(fd.get(), 16) != 0) return UniqueFd();
    return fd;
}

// Whether the daemon behind `socketPath` answers a request (any reply code).
bool answersRequests(const fs::path& socketPath) {
    BerthError error;
    auto connection = BerthConnection::connect(socketPath, &error);
    if (!connection) return false;
    auto reply = connection->request(test::create(2, 501, "com.example.service", false, false),
                                     std::chrono::seconds(10), &error);
    return reply && reply->find("ReplyError");
}

// The notifications the daemon sent to a test's notify socket.
class NotifySocket {
  public:
    explicit NotifySocket(const fs::path& path) : path_(path), fd_(bindUnix(path, SOCK_DGRAM)) {}

    const fs::path& path() const { return path_; }

    // The next datagram, or empty after `limit`.
    std::string next(std::chrono::milliseconds limit = std::chrono::seconds(30)) {
        timeval timeout{static_cast<time_t>(limit.count() / 1000),
                        static_cast<suseconds_t>(limit.count() % 1000 * 1000)};
        ::setsockopt(fd_.get(), SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
        char buffer[4096];
        const ssize_t n = ::recv(fd_.get(), buffer, sizeof buffer, 0);
        return n > 0 ? std::string(buffer, n) : std::string();
    }

  private:
    fs::path path_;
    UniqueFd fd_;
};

class DaemonServiceTest : public ::testing::Test {
  protected:
    void SetUp() override {
        BERTH_REQUIRE_ROOT();
        fs::remove_all(root() / "run/berthd");
    }
};

TEST_F(DaemonServiceTest, ReadinessComesOnlyOnceAClientCanConnectAndStoppingOnTermination) {
    NotifySocket notify(root() / "notify.socket");
    DaemonProcess daemon(root(), DaemonLaunch{{{"NOTIFY_SOCKET", notify.path().string()}}});

    std::vector<std::string> before;
    for (std::string message = notify.next(); message != "READY=1"; message = notify.next()) {
        ASSERT_FALSE(message.empty()) << "no READY=1; stderr: " << daemon.standardError();
        before.push_back(message);
    }
    // Not one retry: the socket must listen at the moment readiness is said.
    EXPECT_TRUE(test::connectUnix(daemon.requestSocket()).valid());
    EXPECT_TRUE(answersRequests(daemon.requestSocket()));
    ASSERT_GE(before.size(), 2u);
    EXPECT_EQ(before.front().rfind("STATUS=", 0), 0u) << before.front();
    EXPECT_EQ(before.back(), "STATUS=Serving requests");

    ::kill(daemon.pid(), SIGTERM);
    EXPECT_EQ(notify.next(), "STOPPING=1");
    EXPECT_EQ(daemon.waitForExit(), 0);
}

TEST_F(DaemonServiceTest, BothSocketsCanBeHandedOverAndNeitherIsBoundAgain) {
    // Elsewhere than the daemon would bind them, to tell them apart.
    test::ScratchDir sockets;
    const fs::path requestPath = sockets / "request";
    const fs::path upcallPath = sockets / "upcall";
    UniqueFd request = listeningSocket(requestPath, SOCK_STREAM);
    UniqueFd upcall = listeningSocket(upcallPath, SOCK_SEQPACKET);
    ASSERT_TRUE(request && upcall);

    DaemonProcess daemon(root(), DaemonLaunch{{},
                                              {{"sys.kelp.berthd", request.get()},
                                               {"sys.kelp.berthd.upcall", upcall.get()}},
                                              {}});
    ASSERT_TRUE(
        test::eventually([&] { return answersRequests(requestPath); }, std::chrono::seconds(20)))
        << daemon.standardError();

    int error = 0;
    auto client = BTHUpcallClient::connect(upcallPath, &error);
    ASSERT_TRUE(client) << strerror(error);
    auto answer = client->call({}, &error);
    EXPECT_TRUE(answer) << "the passed upcall socket is not served: " << strerror(error);

    EXPECT_FALSE(fs::exists(daemon.requestSocket()));
    EXPECT_FALSE(fs::exists(root() / "run/berthd/sys.kelp.berthd.upcall"));
    EXPECT_EQ(daemon.stop(SIGTERM), 0);
}

TEST_F(DaemonServiceTest, APassedSocketOfTheWrongKindIsRefusedAndReadinessWithheld) {
    test::ScratchDir sockets;
    UniqueFd datagram = bindUnix(sockets / "request", SOCK_DGRAM);
    ASSERT_TRUE(datagram);
    NotifySocket notify(root() / "notify.socket");
    DaemonProcess daemon(root(), DaemonLaunch{{{"NOTIFY_SOCKET", notify.path().string()}},
                                              {{"sys.kelp.berthd", datagram.get()}},
                                              {}});
    std::string status;
    for (std::string message = notify.next(); !message.empty(); message = notify.next()) {
        EXPECT_NE(message, "READY=1");
        if (message.find("No request socket") != std::string::npos) {
            status = message;
            break;
        }
    }
    EXPECT_NE(status.find("the passed socket sys.kelp.berthd is unusable"), std::string::npos)
        << status;
    EXPECT_EQ(notify.next(std::chrono::milliseconds(500)), "");
    EXPECT_FALSE(fs::exists(daemon.requestSocket()));
    EXPECT_FALSE(daemon.waitForExit(std::chrono::milliseconds(0)));
}

TEST_F(DaemonServiceTest, TheServiceManagersSocketActivatorStartsItOnTheFirstConnection) {
    const fs::path activator = "/usr/bin/systemd-socket-activate";
    if (!fs::exists(activator)) GTEST_SKIP() << "systemd-socket-activate is not installed";
    test::ScratchDir sockets;
    const fs::path requestPath = sockets / "request";
    DaemonProcess daemon(
        root(),
        DaemonLaunch{{},
                     {},
                     {activator.string(), "--listen=" + requestPath.string(),
                      "--fdname=sys.kelp.berthd", "--setenv=BERTH_ROOT=" + root().string()}});
    // The activator binds before it listens: a refused connection just means
    // "not yet".
    EXPECT_TRUE(
        test::eventually([&] { return answersRequests(requestPath); }, std::chrono::seconds(20)))
        << daemon.standardError();
    EXPECT_FALSE(fs::exists(daemon.requestSocket()));
}

// What the package's sysusers and tmpfiles files make of an empty root is
// enough for the daemon to start on it and serve.
TEST(DaemonPackageFilesTest, SysusersAndTmpfilesPrepareARootTheDaemonStartsOn) {
    BERTH_REQUIRE_ROOT();
    for (const char* tool : {"/usr/bin/systemd-sysusers", "/usr/bin/systemd-tmpfiles"})
        if (!fs::exists(tool)) GTEST_SKIP() << tool << " is not installed";
    test::ScratchDir fresh;
    fs::create_directory(fresh / "etc");
    const fs::path packaging = fs::path(BERTH_SOURCE_DIR) / "packaging";
    test::Outcome users =
        test::run("/usr/bin/systemd-sysusers",
                  {"--root=" + fresh.path().string(), (packaging / "berthd.sysusers").string()});
    ASSERT_EQ(users.status, 0) << users.err;
    test::Outcome files = test::run(
        "/usr/bin/systemd-tmpfiles",
        {"--create", "--root=" + fresh.path().string(), (packaging / "berthd.tmpfiles").string()});
    ASSERT_EQ(files.status, 0) << files.err;

    const std::string passwd = test::readFile(fresh / "etc/passwd");
    EXPECT_NE(passwd.find("mobile:x:501:"), std::string::npos) << passwd;
    EXPECT_NE(passwd.find(":x:33:"), std::string::npos) << passwd;
    EXPECT_NE(passwd.find(":x:499:"), std::string::npos) << passwd;
    EXPECT_EQ(test::lstatOf(fresh / "etc/berthd/signatures").st_mode & 07777, 0700u);
    EXPECT_TRUE(fs::is_directory(fresh / "private/var"));

    DaemonProcess daemon(fresh.path());
    ASSERT_TRUE(daemon.waitUntilServing()) << daemon.standardError();
    EXPECT_TRUE(answersRequests(daemon.requestSocket()));
    EXPECT_EQ(daemon.stop(SIGTERM), 0);
}

}  // namespace
}  // namespace berth
