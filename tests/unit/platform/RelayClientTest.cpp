// libberth's connection: finding the daemon, matching replies, and telling
// its failures apart.
#include <fcntl.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <future>

#include "RelayTestServer.h"
#include "ScratchDeviceRoot.h"
#include "libberth/BerthConnection.h"
#include "platform/DeviceRoot.h"

namespace berth {
namespace {

using namespace std::chrono_literals;
using test::dict;
using test::RelayTestServer;

[[maybe_unused]] const auto& kRoot = test::installScratchDeviceRoot();

// A listening socket that is not a relay server: the test plays the daemon.
struct FakeDaemon {
    FakeDaemon() {
        std::string why;
        checkIn = ServiceCheckIn::claim("fake", SOCK_STREAM, 0666, nullptr, &why, dir.path());
        EXPECT_TRUE(checkIn) << why;
    }
    UniqueFd acceptOne() {
        ::fcntl(checkIn->socket(), F_SETFL, 0);  // wait for the client
        return UniqueFd(::accept4(checkIn->socket(), nullptr, nullptr, SOCK_CLOEXEC));
    }
    test::ScratchDir dir;
    std::optional<ServiceCheckIn> checkIn;
};

TEST(RelayClientTest, ConnectsToTheDaemonOfTheDeviceRootOrToAnyPath) {
    EXPECT_EQ(BerthConnection::defaultSocketPath(),
              DeviceRoot::resolve("/run/berthd/sys.kelp.berthd"));
    BerthError error;
    EXPECT_FALSE(BerthConnection::connect(&error));
    EXPECT_EQ(error.code, BerthError::Code::NotRunning) << error.message;

    // The daemon's endpoint under the device root.
    std::string why;
    auto endpoint = ServiceCheckIn::claim("sys.kelp.berthd", SOCK_STREAM, 0666, nullptr, &why);
    ASSERT_TRUE(endpoint) << why;
    EXPECT_TRUE(BerthConnection::connect(&error)) << error.message;

    // A path longer than a socket address holds.
    test::ScratchDir scratch;
    const std::filesystem::path deep = scratch / std::string(120, 'd');
    auto far = ServiceCheckIn::claim("far", SOCK_STREAM, 0666, nullptr, &why, deep);
    ASSERT_TRUE(far) << why;
    ASSERT_GT(far->path().string().size(), sizeof(sockaddr_un::sun_path));
    EXPECT_TRUE(BerthConnection::connect(far->path(), &error)) << error.message;

    // A socket nobody listens on any more.
    far.reset();
    EXPECT_FALSE(BerthConnection::connect(deep / "far", &error));
    EXPECT_EQ(error.code, BerthError::Code::NotRunning) << error.message;
}

TEST(RelayClientTest, ALateReplyIsDroppedAndNeverAnswersTheNextRequest) {
    test::Event release;
    RelayTestServer server([&](const RelayEvent& event, RelayReply& reply) {
        if (event.message().find("Slow")) release.wait(std::chrono::minutes(10));
        reply.body().set("Echo", event.message());
    });
    BerthError error;
    auto connection = BerthConnection::connect(server.path(), &error);
    ASSERT_TRUE(connection) << error.message;

    EXPECT_FALSE(connection->request(dict({{"Slow", true}}), 100ms, &error));
    EXPECT_EQ(error.code, BerthError::Code::Timeout) << error.message;
    release.set();
    // Queued behind the slow one on the daemon, so its reply comes second.
    auto reply = connection->request(dict({{"Fast", true}}), 20s, &error);
    ASSERT_TRUE(reply) << error.message;
    EXPECT_EQ(*reply->find("Echo"), dict({{"Fast", true}}));
    EXPECT_TRUE(connection->isOpen());
}

TEST(RelayClientTest, ABrokenDaemonFailsTheWaitingRequestAndEveryLaterOne) {
    struct {
        const char* name;
        std::vector<uint8_t> answer;  // what the daemon writes before closing
        BerthError::Code expected;
    } const cases[] = {
        {"garbage",
         {'n', 'o', 't', ' ', 'a', ' ', 'f', 'r', 'a', 'm', 'e', '!', 0, 0, 0, 0},
         BerthError::Code::ProtocolError},
        {"a hang-up", {}, BerthError::Code::ConnectionClosed},
    };
    for (const auto& broken : cases) {
        SCOPED_TRACE(broken.name);
        FakeDaemon daemon;
        BerthError error;
        auto connection = BerthConnection::connect(daemon.checkIn->path(), &error);
        ASSERT_TRUE(connection) << error.message;
        std::thread server([&] {
            UniqueFd peer = daemon.acceptOne();
            test::readFrames(peer.get(), 1);
            test::writeAll(peer.get(), broken.answer);
        });
        EXPECT_FALSE(connection->request(Value::dictionary(), 20s, &error));
        EXPECT_EQ(error.code, broken.expected) << error.message;
        server.join();
        EXPECT_FALSE(connection->isOpen());
        BerthError later;
        EXPECT_FALSE(connection->request(Value::dictionary(), 20s, &later));
        EXPECT_EQ(later.code, broken.expected) << later.message;
    }
}

}  // namespace
}  // namespace berth
