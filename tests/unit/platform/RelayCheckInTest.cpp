// Checking in the daemon's endpoints, and the busy counter of transactions.
#include <fcntl.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>

#include "ScratchDeviceRoot.h"
#include "TestSupport.h"
#include "platform/DeviceRoot.h"
#include "platform/RelayTransaction.h"
#include "platform/ServiceCheckIn.h"
#include "platform/WorkQueue.h"

namespace berth {
namespace {

[[maybe_unused]] const auto& kRoot = test::installScratchDeviceRoot();

// 0 when a client can connect to the socket at `path`, else the errno.
int connectError(const std::filesystem::path& path, int type = SOCK_STREAM) {
    return test::connectUnix(path, type) ? 0 : errno;
}

// True when a connection is waiting on the listening socket `fd`.
bool acceptsOne(int fd) {
    UniqueFd peer(::accept4(fd, nullptr, nullptr, SOCK_CLOEXEC));
    return peer.valid();
}

TEST(RelayCheckInTest, EndpointsLiveInTheRuntimeDirectoryWithTheirTypeAndMode) {
    std::filesystem::remove_all(ServiceCheckIn::runtimeDirectory());
    EXPECT_EQ(ServiceCheckIn::runtimeDirectory(), DeviceRoot::resolve("/run/berthd"));
    std::string why;
    auto requests = ServiceCheckIn::claim("sys.kelp.berthd", SOCK_STREAM, 0666, nullptr, &why);
    ASSERT_TRUE(requests) << why;
    auto upcall =
        ServiceCheckIn::claim("sys.kelp.berthd.upcall", SOCK_SEQPACKET, 0600, nullptr, &why);
    ASSERT_TRUE(upcall) << why;

    struct {
        const ServiceCheckIn& endpoint;
        const char* name;
        int type;
        mode_t mode;
    } const expected[] = {{*requests, "sys.kelp.berthd", SOCK_STREAM, 0666},
                          {*upcall, "sys.kelp.berthd.upcall", SOCK_SEQPACKET, 0600}};
    for (const auto& endpoint : expected) {
        SCOPED_TRACE(endpoint.name);
        EXPECT_EQ(endpoint.endpoint.path(), ServiceCheckIn::runtimeDirectory() / endpoint.name);
        const struct stat status = test::lstatOf(endpoint.endpoint.path());
        EXPECT_TRUE(S_ISSOCK(status.st_mode));
        EXPECT_EQ(status.st_mode & 07777, endpoint.mode);
        int type = 0;
        socklen_t length = sizeof type;
        ASSERT_EQ(::getsockopt(endpoint.endpoint.socket(), SOL_SOCKET, SO_TYPE, &type, &length), 0);
        EXPECT_EQ(type, endpoint.type);
        EXPECT_EQ(connectError(endpoint.endpoint.path(), endpoint.type), 0);
    }
}

TEST(RelayCheckInTest, ASecondClaimFailsAndLeavesTheFirstUntouched) {
    test::ScratchDir dir;
    std::string why;
    auto first = ServiceCheckIn::claim("endpoint", SOCK_STREAM, 0666, nullptr, &why, dir.path());
    ASSERT_TRUE(first) << why;
    const ino_t socketInode = test::lstatOf(first->path()).st_ino;

    int error = 0;
    EXPECT_FALSE(ServiceCheckIn::claim("endpoint", SOCK_STREAM, 0666, &error, &why, dir.path()));
    EXPECT_EQ(error, EADDRINUSE);
    EXPECT_NE(why.find("another process"), std::string::npos) << why;

    // The first holder's socket is still the one in place, and still works.
    EXPECT_EQ(test::lstatOf(first->path()).st_ino, socketInode);
    EXPECT_EQ(connectError(first->path()), 0);
    EXPECT_TRUE(acceptsOne(first->socket()));

    // Once the first lets go, the endpoint can be claimed again.
    first.reset();
    EXPECT_TRUE(ServiceCheckIn::claim("endpoint", SOCK_STREAM, 0666, nullptr, &why, dir.path()))
        << why;
}

TEST(RelayCheckInTest, TheStaleSocketOfAKilledHolderIsReplaced) {
    test::ScratchDir dir;
    int ready[2];
    ASSERT_EQ(::pipe2(ready, O_CLOEXEC), 0);
    const pid_t holder = ::fork();
    if (holder == 0) {
        auto claimed =
            ServiceCheckIn::claim("endpoint", SOCK_STREAM, 0666, nullptr, nullptr, dir.path());
        const char state = claimed ? 'y' : 'n';
        (void)!::write(ready[1], &state, 1);
        ::pause();
        _exit(0);
    }
    ::close(ready[1]);
    char state = 0;
    ASSERT_EQ(::read(ready[0], &state, 1), 1);
    ::close(ready[0]);
    ASSERT_EQ(state, 'y');
    ::kill(holder, SIGKILL);
    ::waitpid(holder, nullptr, 0);

    const std::filesystem::path path = dir / "endpoint";
    ASSERT_TRUE(std::filesystem::is_socket(path));
    EXPECT_EQ(connectError(path), ECONNREFUSED);

    std::string why;
    auto claimed = ServiceCheckIn::claim("endpoint", SOCK_STREAM, 0666, nullptr, &why, dir.path());
    ASSERT_TRUE(claimed) << why;
    EXPECT_EQ(connectError(path), 0);
    EXPECT_TRUE(acceptsOne(claimed->socket()));
}

TEST(RelayCheckInTest, NoClaimThroughALink) {
    test::ScratchDir dir;
    test::ScratchDir elsewhere;
    std::filesystem::create_directory_symlink(elsewhere.path(), dir / "linked");
    int error = 0;
    std::string why;
    EXPECT_FALSE(
        ServiceCheckIn::claim("endpoint", SOCK_STREAM, 0666, &error, &why, dir / "linked"));
    EXPECT_EQ(error, ELOOP) << why;
    EXPECT_TRUE(std::filesystem::is_empty(elsewhere.path()));
}

TEST(RelayTransactionTest, AGuardCarriedByWorkStaysOpenExactlyUntilTheWorkIsDone) {
    const uint64_t before = RelayTransaction::count();
    auto queue = WorkQueue::makeSerial("relay.test.transactions");
    queue->suspend();
    queue->async([guard = RelayTransaction::Guard()] {});
    EXPECT_EQ(RelayTransaction::count(), before + 1);
    queue->resume();
    queue->sync([] {});
    EXPECT_EQ(RelayTransaction::count(), before);
}

TEST(RelayTransactionDeathTest, EndingATransactionNeverBegunEndsTheProcess) {
    ASSERT_EQ(RelayTransaction::count(), 0u);
    EXPECT_DEATH(RelayTransaction::end(), "never begun");
}

}  // namespace
}  // namespace berth
