// The relay's server side driven by real clients over a Unix socket: order
// of delivery, parallel peers, peers that leave, broken and flooding peers,
// and many peers at once.
#include <gtest/gtest.h>
#include <sys/socket.h>

#include <atomic>
#include <future>
#include <random>
#include <thread>

#include "RelayTestServer.h"
#include "ScratchDeviceRoot.h"
#include "libberth/BerthConnection.h"

namespace berth {
namespace {

using namespace std::chrono_literals;
using test::dictionaryWith;
using test::RelayTestServer;

[[maybe_unused]] const auto& kRoot = test::installScratchDeviceRoot();

uint64_t numberAt(const Value& dictionary, const char* key) {
    const Value* value = dictionary.find(key);
    return value && value->uint64Value() ? *value->uint64Value() : ~uint64_t{0};
}

std::unique_ptr<BerthConnection> connectTo(const RelayTestServer& server) {
    BerthError error;
    auto connection = BerthConnection::connect(server.path(), &error);
    EXPECT_TRUE(connection) << error.message;
    return connection;
}

// A handler that echoes "Seq" and tells, per connection, the how-manieth
// request it was for the handler.
RelayTestServer::Handler echoWithArrivalOrder() {
    auto counters = std::make_shared<std::map<const RelayConnection*, uint64_t>>();
    auto mutex = std::make_shared<std::mutex>();
    return [counters, mutex](const RelayEvent& event, RelayReply& reply) {
        uint64_t arrival;
        {
            std::lock_guard lock(*mutex);
            arrival = (*counters)[event.connection().get()]++;
        }
        reply.body().set("Seq", numberAt(event.message(), "Seq"));
        reply.body().set("Arrival", arrival);
        return true;
    };
}

TEST(RelayTest, PipelinedRequestsAreHandledAndAnsweredInOrder) {
    RelayTestServer server(echoWithArrivalOrder());
    UniqueFd client = server.connectRaw();
    constexpr uint64_t kCount = 200;
    std::vector<uint8_t> all;
    for (uint64_t seq = 0; seq < kCount; ++seq) {
        auto frame =
            test::frameBytes(relay::FrameKind::Request, 1000 + seq, dictionaryWith("Seq", seq));
        all.insert(all.end(), frame.begin(), frame.end());
    }
    // All at once, so that many requests are waiting at the same time.
    ASSERT_TRUE(test::writeAll(client.get(), all));

    std::vector<relay::Frame> replies = test::readFrames(client.get(), kCount);
    ASSERT_EQ(replies.size(), kCount);
    for (uint64_t seq = 0; seq < kCount; ++seq) {
        EXPECT_EQ(replies[seq].kind, relay::FrameKind::Reply);
        EXPECT_EQ(replies[seq].messageId, 1000 + seq);
        EXPECT_EQ(numberAt(replies[seq].body, "Seq"), seq);
        EXPECT_EQ(numberAt(replies[seq].body, "Arrival"), seq);
    }
}

TEST(RelayTest, ThreadsSharingAClientConnectionEachGetTheirOwnReply) {
    RelayTestServer server(echoWithArrivalOrder());
    auto connection = connectTo(server);
    ASSERT_TRUE(connection);
    std::vector<std::thread> threads;
    std::atomic<int> mismatches{0};
    for (uint64_t thread = 0; thread < 8; ++thread) {
        threads.emplace_back([&, thread] {
            for (uint64_t i = 0; i < 50; ++i) {
                const uint64_t seq = thread * 1000 + i;
                BerthError error;
                auto reply = connection->request(dictionaryWith("Seq", seq), 20s, &error);
                if (!reply || numberAt(*reply, "Seq") != seq) ++mismatches;
            }
        });
    }
    for (auto& thread : threads) thread.join();
    EXPECT_EQ(mismatches.load(), 0);
}

TEST(RelayTest, APeerWhoseHandlerBlocksDoesNotDelayAnother) {
    std::promise<void> release;
    std::shared_future<void> released = release.get_future().share();
    std::promise<void> blocking;
    RelayTestServer server([&](const RelayEvent& event, RelayReply& reply) {
        if (event.message().find("Block")) {
            blocking.set_value();
            released.wait();
        }
        reply.body().set("Seq", numberAt(event.message(), "Seq"));
        return true;
    });
    auto slow = connectTo(server);
    auto fast = connectTo(server);
    ASSERT_TRUE(slow && fast);

    auto slowReply = std::async(std::launch::async,
                                [&] { return slow->request(dictionaryWith("Block", true), 30s); });
    blocking.get_future().wait();
    // The blocked handler still runs; the other peer is served meanwhile.
    for (uint64_t seq = 0; seq < 20; ++seq) {
        BerthError error;
        auto reply = fast->request(dictionaryWith("Seq", seq), 20s, &error);
        ASSERT_TRUE(reply) << error.message;
        EXPECT_EQ(numberAt(*reply, "Seq"), seq);
    }
    EXPECT_EQ(slowReply.wait_for(0s), std::future_status::timeout);
    release.set_value();
    EXPECT_TRUE(slowReply.get());
}

TEST(RelayTest, APeerThatLeavesBeforeItsReplyCostsNothingButThatReply) {
    std::promise<void> release;
    std::shared_future<void> released = release.get_future().share();
    std::promise<void> blocking;
    RelayTestServer server([&](const RelayEvent& event, RelayReply& reply) {
        if (event.message().find("Block")) {
            blocking.set_value();
            released.wait();
        }
        return true;
    });
    {
        UniqueFd leaving = server.connectRaw();
        ASSERT_TRUE(test::writeAll(leaving.get(), test::frameBytes(relay::FrameKind::Request, 1,
                                                                   dictionaryWith("Block", true))));
        // A second request that will never start: its peer is gone by then.
        ASSERT_TRUE(test::writeAll(
            leaving.get(), test::frameBytes(relay::FrameKind::Request, 2, Value::dictionary())));
        blocking.get_future().wait();
    }
    // The connection ends as soon as the peer is gone; the handler under way
    // finishes, its reply goes nowhere, and the request behind it never starts.
    ASSERT_TRUE(server.waitFor([&] { return server.listener().connectionCount() == 0; }));
    release.set_value();
    EXPECT_TRUE(server.waitFor([&] { return server.unsent() == 1 && server.invalidated() == 1; }));

    auto other = connectTo(server);
    BerthError error;
    EXPECT_TRUE(other->request(Value::dictionary(), 20s, &error)) << error.message;
}

TEST(RelayTest, AMessageWithoutReplyContextLetsTheHandlerCancelThePeer) {
    RelayTestServer server([](const RelayEvent& event, RelayReply&) {
        ADD_FAILURE() << "one-way messages have no reply to fill";
        return false;
    });
    auto connection = connectTo(server);
    ASSERT_TRUE(connection->send(dictionaryWith("Command", uint64_t{1}), 20s));
    // The test server cancels a peer whose event cannot be answered.
    BerthError error;
    EXPECT_FALSE(connection->request(Value::dictionary(), 20s, &error));
    EXPECT_EQ(error.code, BerthError::Code::ConnectionClosed) << error.message;
    EXPECT_TRUE(server.waitFor([&] { return server.invalidated() == 1; }));
    EXPECT_TRUE(server.logged("cancelled"));
}

}  // namespace
}  // namespace berth
