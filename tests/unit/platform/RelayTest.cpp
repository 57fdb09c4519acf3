// The relay's server side driven by real clients over a Unix socket: order
// of delivery, parallel peers, peers that leave, broken and flooding peers,
// and many peers at once.
#include <fcntl.h>
#include <linux/sockios.h>
#include <poll.h>
#include <sys/ioctl.h>
#include <sys/socket.h>

#include <array>
#include <chrono>
#include <future>
#include <random>
#include <thread>

#include "RelayTestServer.h"
#include "ScratchDeviceRoot.h"
#include "libberth/BerthConnection.h"

namespace berth {
namespace {

using namespace std::chrono_literals;
using test::dict;
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
    };
}

TEST(RelayTest, PipelinedRequestsAreHandledAndAnsweredInOrder) {
    RelayTestServer server(echoWithArrivalOrder());
    UniqueFd client = server.connectRaw();
    constexpr uint64_t kCount = 200;
    std::vector<uint8_t> all;
    for (uint64_t seq = 0; seq < kCount; ++seq) {
        auto frame = test::frameBytes(relay::FrameKind::Request, 1000 + seq, dict({{"Seq", seq}}));
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

// While other requests are being handled, a request run where it was read
// stays in the peer's socket until it is answered: taking it earlier wakes
// the peer, asleep waiting for its reply, for nothing. On an otherwise idle
// relay it is taken at once: there the early wake-up brings the peer's
// processor out of idle ahead of its reply. Either way it is gone once
// answered, and the next one is served. (A request read while the one before
// is still winding down may be counted the other way - on a loaded machine
// the thread that sent a reply is often preempted by the peer it woke - so
// each case has a few tries, and an idle try first gives the relay a moment
// to wind down.)
TEST(RelayTest, ARequestRunWhereItWasReadLeavesTheSocketAtOnceOnlyOnAnIdleRelay) {
    constexpr uint64_t kTries = 4;
    test::Event holding, releaseHold;
    std::array<test::Event, 2 * kTries> running, release;
    RelayTestServer server(
        [&](const RelayEvent& event, RelayReply& reply) {
            const Value& message = event.message();
            if (message.find("Hold")) holding.set(), releaseHold.wait(10min);
            if (message.find("Block")) {
                const uint64_t index = numberAt(message, "Block");
                running[index].set();
                release[index].wait(10min);
            }
            reply.body().set("Seq", numberAt(message, "Seq"));
        },
        {}, nullptr, {}, /*ioThreads=*/3);  // an inline place for each peer
    UniqueFd other = server.connectRaw();
    UniqueFd client = server.connectRaw();
    uint64_t seq = 0;
    auto send = [&](int fd, const char* key = nullptr, uint64_t value = 0) {
        Value body = dict({{"Seq", ++seq}});
        if (key) body.set(key, value);
        return test::writeAll(fd, test::frameBytes(relay::FrameKind::Request, seq, body));
    };
    auto answeredSeq = [](int fd) {
        std::vector<relay::Frame> replies = test::readFrames(fd, 1);
        return replies.size() == 1 ? numberAt(replies[0].body, "Seq") : ~uint64_t{0};
    };
    auto unread = [&] {
        int bytes = -1;
        EXPECT_EQ(::ioctl(client.get(), SIOCOUTQ, &bytes), 0);
        return bytes;
    };
    // Whether a request's bytes were still in the socket while it ran.
    uint64_t blocks = 0;
    auto stayedWhileRunning = [&] {
        const uint64_t index = blocks++;
        EXPECT_TRUE(send(client.get(), "Block", index));
        EXPECT_TRUE(running[index].wait());
        // (The kernel counts what the bytes occupy, not the bytes.)
        const bool stayed = unread() > 0;
        release[index].set();
        EXPECT_EQ(answeredSeq(client.get()), seq);
        EXPECT_TRUE(test::eventually([&] { return unread() == 0; }));
        return stayed;
    };
    // One exchange each first: a request that arrives while its connection
    // is still being set up is handed to its queue instead.
    ASSERT_TRUE(send(other.get()));
    ASSERT_EQ(answeredSeq(other.get()), seq);
    ASSERT_TRUE(send(client.get()));
    ASSERT_EQ(answeredSeq(client.get()), seq);

    bool takenWhenIdle = false;
    for (uint64_t trial = 0; trial < kTries && !takenWhenIdle; ++trial) {
        std::this_thread::sleep_for(std::chrono::milliseconds(20 << trial));
        takenWhenIdle = !stayedWhileRunning();
    }
    EXPECT_TRUE(takenWhenIdle);

    ASSERT_TRUE(send(other.get(), "Hold"));
    const uint64_t held = seq;
    ASSERT_TRUE(holding.wait());
    bool stayedUnderLoad = false;
    for (uint64_t trial = 0; trial < kTries && !stayedUnderLoad; ++trial)
        stayedUnderLoad = stayedWhileRunning();
    EXPECT_TRUE(stayedUnderLoad);
    releaseHold.set();
    EXPECT_EQ(answeredSeq(other.get()), held);

    ASSERT_TRUE(send(client.get()));
    EXPECT_EQ(answeredSeq(client.get()), seq);
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
                auto reply = connection->request(dict({{"Seq", seq}}), 20s, &error);
                if (!reply || numberAt(*reply, "Seq") != seq) ++mismatches;
            }
        });
    }
    for (auto& thread : threads) thread.join();
    EXPECT_EQ(mismatches.load(), 0);
}

// While a request blocks where it was read, another thread reads within
// about a millisecond; that thread blocking in turn, the next one reads.
// Rounds repeat so that the thread standing guard is handed on each time.
TEST(RelayTest, APeerWhoseHandlerBlocksDoesNotDelayAnother) {
    constexpr int kRounds = 3;
    std::array<test::Event, kRounds> release, blocking;
    RelayTestServer server([&](const RelayEvent& event, RelayReply& reply) {
        if (event.message().find("Block")) {
            const uint64_t round = numberAt(event.message(), "Block");
            blocking.at(round).set();
            release.at(round).wait(10min);
        }
        reply.body().set("Seq", numberAt(event.message(), "Seq"));
    });
    std::vector<std::unique_ptr<BerthConnection>> slow;
    std::vector<std::future<std::optional<Value>>> slowReplies;
    auto fast = connectTo(server);
    ASSERT_TRUE(fast);
    for (uint64_t round = 0; round < kRounds; ++round) {
        slow.push_back(connectTo(server));
        ASSERT_TRUE(slow.back());
        slowReplies.push_back(std::async(std::launch::async, [&connection = *slow.back(), round] {
            return connection.request(dict({{"Block", round}}), 30s);
        }));
        ASSERT_TRUE(blocking[round].wait());
        // The blocked handlers still run; the other peer is served meanwhile.
        for (uint64_t seq = 0; seq < 20; ++seq) {
            BerthError error;
            auto reply = fast->request(dict({{"Seq", seq}}), 20s, &error);
            ASSERT_TRUE(reply) << error.message;
            EXPECT_EQ(numberAt(*reply, "Seq"), seq);
        }
        EXPECT_EQ(slowReplies.back().wait_for(0s), std::future_status::timeout);
        // The first round's handler goes on blocking through the later ones.
        if (round > 0) release[round].set();
    }
    release[0].set();
    for (auto& reply : slowReplies) EXPECT_TRUE(reply.get());
}

// Requests run on the I/O thread that read them only while another thread is
// left to read: with two I/O threads, blocked handlers of three peers (one
// run where it was read, the others on their queues) leave the fourth peer
// served.
TEST(RelayTest, HandlersBlockingWhereTheyWereReadNeverStopTheReading) {
    constexpr uint64_t kBlocked = 3;
    std::mutex mutex;
    std::condition_variable changed;
    uint64_t blocked = 0;
    bool released = false;
    RelayTestServer server(
        [&](const RelayEvent& event, RelayReply& reply) {
            if (event.message().find("Block")) {
                std::unique_lock lock(mutex);
                ++blocked;
                changed.notify_all();
                changed.wait(lock, [&] { return released; });
            }
            reply.body().set("Seq", numberAt(event.message(), "Seq"));
        },
        RelayLimits{}, nullptr, RelayUserLimits{}, /*ioThreads=*/2);
    std::vector<std::unique_ptr<BerthConnection>> slow;
    std::vector<std::future<std::optional<Value>>> slowReplies;
    for (uint64_t i = 0; i < kBlocked; ++i) {
        slow.push_back(connectTo(server));
        ASSERT_TRUE(slow.back());
        slowReplies.push_back(std::async(std::launch::async, [&connection = *slow.back()] {
            return connection.request(dict({{"Block", true}}), 60s);
        }));
    }
    {
        std::unique_lock lock(mutex);
        ASSERT_TRUE(changed.wait_for(lock, 30s, [&] { return blocked == kBlocked; }));
    }
    auto fast = connectTo(server);
    ASSERT_TRUE(fast);
    for (uint64_t seq = 0; seq < 20; ++seq) {
        BerthError error;
        auto reply = fast->request(dict({{"Seq", seq}}), 10s, &error);
        ASSERT_TRUE(reply) << error.message;
        EXPECT_EQ(numberAt(*reply, "Seq"), seq);
    }
    {
        std::lock_guard lock(mutex);
        released = true;
        changed.notify_all();
    }
    for (auto& reply : slowReplies) EXPECT_TRUE(reply.get());
}

TEST(RelayTest, APeerThatLeavesBeforeItsReplyCostsNothingButThatReply) {
    // Twice: right after connecting (the request may reach the connection's
    // queue while it is being set up) and after an exchange, when it runs on
    // the I/O thread that read it, where the hang-up is watched for only once
    // the run holds the thread up.
    for (const bool settled : {false, true}) {
        SCOPED_TRACE(settled ? "after an exchange" : "right after connecting");
        test::Event release, blocking;
        RelayTestServer server(
            [&](const RelayEvent& event, RelayReply&) {
                if (event.message().find("Block")) blocking.set(), release.wait(10min);
            },
            {}, nullptr, {}, /*ioThreads=*/3);
        {
            UniqueFd leaving = server.connectRaw();
            if (settled) {
                ASSERT_TRUE(test::writeAll(
                    leaving.get(),
                    test::frameBytes(relay::FrameKind::Request, 1, Value::dictionary())));
                ASSERT_EQ(test::readFrames(leaving.get(), 1).size(), 1u);
            }
            ASSERT_TRUE(test::writeAll(leaving.get(), test::frameBytes(relay::FrameKind::Request, 2,
                                                                       dict({{"Block", true}}))));
            // A request that will never start: its peer is gone by then.
            ASSERT_TRUE(test::writeAll(leaving.get(), test::frameBytes(relay::FrameKind::Request, 3,
                                                                       Value::dictionary())));
            ASSERT_TRUE(blocking.wait());
        }
        // The connection ends as soon as the peer is gone; the handler under
        // way finishes, its reply goes nowhere, and the request behind it
        // never starts.
        const bool ended = server.waitFor([&] { return server.listener().connectionCount() == 0; });
        release.set();
        EXPECT_TRUE(ended);
        EXPECT_TRUE(
            server.waitFor([&] { return server.unsent() == 1 && server.invalidated() == 1; }));

        auto other = connectTo(server);
        BerthError error;
        EXPECT_TRUE(other->request(Value::dictionary(), 20s, &error)) << error.message;
    }
}

// A frame header declaring `length` body bytes, with the given magic,
// version and kind bytes.
std::vector<uint8_t> header(uint32_t length, uint8_t kind = 1, uint8_t version = 1,
                            uint8_t magic = 0x42) {
    std::vector<uint8_t> bytes = {magic, 0x52, version, kind, 7, 0, 0, 0, 0, 0, 0, 0};
    for (int shift = 0; shift < 32; shift += 8) bytes.push_back(uint8_t(length >> shift));
    return bytes;
}

std::vector<uint8_t> frameWithBody(std::vector<uint8_t> body, uint8_t kind = 1) {
    std::vector<uint8_t> bytes = header(static_cast<uint32_t>(body.size()), kind);
    bytes.insert(bytes.end(), body.begin(), body.end());
    return bytes;
}

// Threads of this process.
size_t threadCount() {
    size_t count = 0;
    for ([[maybe_unused]] const auto& entry :
         std::filesystem::directory_iterator("/proc/self/task"))
        ++count;
    return count;
}

TEST(RelayTest, ABrokenFrameDropsItsConnectionAndNothingElse) {
    RelayTestServer server(echoWithArrivalOrder());
    auto bystander = connectTo(server);
    ASSERT_TRUE(bystander);

    std::mt19937 random(20240611);
    std::vector<uint8_t> noise(4096);
    for (auto& byte : noise) byte = static_cast<uint8_t>(random());
    noise[0] = 0x00;  // never the magic

    std::vector<uint8_t> deep;
    for (int level = 0; level <= relay::kMaxDepth; ++level)
        deep.insert(deep.end(), {0x0A, 1, 0, 0, 0});  // an array of one element...
    deep.push_back(0x00);                             // ...down to a null

    std::vector<uint8_t> badVersion = header(1, 1, 9);
    badVersion.push_back(0x00);

    struct Case {
        const char* name;
        std::vector<uint8_t> bytes;
        const char* logged;
    } const cases[] = {
        {"random bytes", noise, "not a relay stream"},
        {"unknown version", badVersion, "unsupported relay version"},
        {"a string running past its body", frameWithBody({0x06, 100, 0, 0, 0, 'a', 'b'}),
         "truncated value"},
        {"a body above the limit", header(relay::kMaxBodySize + 1), "body too large"},
        {"nesting above the limit", frameWithBody(deep), "nesting too deep"},
        {"keys out of order",
         frameWithBody({0x0B, 2, 0, 0, 0, 1, 0, 0, 0, 'b', 0x00, 1, 0, 0, 0, 'a', 0x00}), "order"},
        {"a reply sent by a client", frameWithBody({0x00}, 2), "reply frame"},
    };
    for (const Case& bad : cases) {
        SCOPED_TRACE(bad.name);
        UniqueFd peer = server.connectRaw();
        ASSERT_TRUE(test::writeAll(peer.get(), bad.bytes));
        // No reply: the stream just ends. (An oversized body is refused
        // from its header alone; it is never sent.)
        EXPECT_TRUE(test::readsEndOfStream(peer.get()));
        EXPECT_TRUE(server.waitFor([&] { return server.logged(bad.logged); }));

        BerthError error;
        auto reply = bystander->request(dict({{"Seq", uint64_t{5}}}), 20s, &error);
        ASSERT_TRUE(reply) << error.message;
        EXPECT_EQ(numberAt(*reply, "Seq"), 5u);
    }
    EXPECT_TRUE(server.logged("protocol error"));
}

TEST(RelayTest, AFloodingPeerIsHeldBackNotBufferedAndLosesNothing) {
    test::Event release;
    RelayLimits limits;
    limits.maxQueuedRequests = 4;
    RelayTestServer server(
        [&](const RelayEvent& event, RelayReply& reply) {
            const uint64_t seq = numberAt(event.message(), "Seq");
            if (seq == 0) release.wait(10min);
            reply.body().set("Seq", seq);
        },
        limits);
    UniqueFd flooder = server.connectRaw();
    ::fcntl(flooder.get(), F_SETFL, O_NONBLOCK);

    // While the first request is held, the peer writes until the daemon
    // stops taking its bytes for good (a full socket that does not drain
    // within a second). An unbounded server would swallow all of them.
    constexpr uint64_t kMostAttempted = 1'000'000;
    uint64_t sent = 0;
    bool heldBack = false;
    while (sent < kMostAttempted && !heldBack) {
        auto frame = test::frameBytes(relay::FrameKind::Request, sent, dict({{"Seq", sent}}));
        const ssize_t count = ::send(flooder.get(), frame.data(), frame.size(), MSG_NOSIGNAL);
        if (count < 0 && errno == EAGAIN) {
            pollfd writable{flooder.get(), POLLOUT, 0};
            heldBack = ::poll(&writable, 1, 1000) == 0;
            continue;
        }
        ASSERT_EQ(count, static_cast<ssize_t>(frame.size())) << strerror(errno);
        ++sent;
    }
    EXPECT_TRUE(heldBack) << "the server took all " << sent << " requests while stalled";

    release.set();
    ::fcntl(flooder.get(), F_SETFL, 0);
    std::vector<relay::Frame> replies = test::readFrames(flooder.get(), sent);
    ASSERT_EQ(replies.size(), sent);
    for (uint64_t seq = 0; seq < sent; ++seq) ASSERT_EQ(replies[seq].messageId, seq);
}

TEST(RelayTest, APeerThatLeavesItsRepliesUnreadIsDroppedAtTheOutputBound) {
    RelayLimits limits;
    limits.outputHighWater = 256 << 10;
    limits.maxBufferedOutput = 1 << 20;
    RelayTestServer server(
        [](const RelayEvent& event, RelayReply& reply) {
            if (event.message().find("Big"))
                reply.body().set("Blob", Value(Value::Data(256 << 10, 0xAB)));
        },
        limits);
    UniqueFd hoarder = server.connectRaw();
    std::vector<uint8_t> requests;
    for (uint64_t id = 0; id < 32; ++id) {
        auto frame = test::frameBytes(relay::FrameKind::Request, id, dict({{"Big", true}}));
        requests.insert(requests.end(), frame.begin(), frame.end());
    }
    ASSERT_TRUE(test::writeAll(hoarder.get(), requests));
    EXPECT_TRUE(server.waitFor([&] { return server.logged("leaves its replies unread"); }));
    EXPECT_TRUE(server.waitFor([&] { return server.invalidated() == 1; }));

    auto other = connectTo(server);
    BerthError error;
    EXPECT_TRUE(other->request(Value::dictionary(), 20s, &error)) << error.message;
}

TEST(RelayTest, TwoHundredPeersAreServedAtOnce) {
    constexpr size_t kPeers = 200;
    std::mutex mutex;
    std::condition_variable allArrived;
    size_t arrived = 0;
    // Every handler waits until all peers' requests are in handlers at the
    // same time: only a server that runs them side by side gets there.
    RelayTestServer server([&](const RelayEvent& event, RelayReply& reply) {
        std::unique_lock lock(mutex);
        if (++arrived == kPeers) allArrived.notify_all();
        const bool together = allArrived.wait_for(lock, 60s, [&] { return arrived >= kPeers; });
        reply.body().set("Together", together);
        reply.body().set("Seq", numberAt(event.message(), "Seq"));
    });

    std::vector<std::thread> peers;
    std::atomic<size_t> together{0};
    for (uint64_t seq = 0; seq < kPeers; ++seq) {
        peers.emplace_back([&, seq] {
            BerthError error;
            auto connection = BerthConnection::connect(server.path(), &error);
            if (!connection) return;
            auto reply = connection->request(dict({{"Seq", seq}}), 90s, &error);
            if (reply && numberAt(*reply, "Seq") == seq && *reply->find("Together")->boolValue())
                ++together;
        });
    }
    for (auto& peer : peers) peer.join();
    EXPECT_EQ(together.load(), kPeers);
}

TEST(RelayTest, ManyIdlePeersCostNoThreadEach) {
    RelayTestServer server(echoWithArrivalOrder());
    auto warmUp = connectTo(server);
    ASSERT_TRUE(warmUp->request(Value::dictionary(), 20s));
    const size_t before = threadCount();

    std::vector<UniqueFd> peers;
    for (int i = 0; i < 200; ++i) peers.push_back(server.connectRaw());
    ASSERT_TRUE(server.waitFor([&] { return server.listener().connectionCount() == 201; }));
    // Handing 200 connections over may wake a few pool workers, never one
    // thread per peer.
    EXPECT_LT(threadCount(), before + 50);
    EXPECT_TRUE(warmUp->request(Value::dictionary(), 20s));
}

}  // namespace
}  // namespace berth
