// What one user other than root may hold on the relay: connections beyond
// its count and bytes beyond its budget are refused at once, the refusals
// are logged once a minute, and root keeps being served throughout, also
// when the process is close to its descriptor limit.
#include <sys/socket.h>

#include "RelayTestServer.h"
#include "ScratchDeviceRoot.h"

namespace berth {
namespace {

using namespace std::chrono_literals;
using test::dict;
using test::RelayTestServer;

[[maybe_unused]] const auto& kRoot = test::installScratchDeviceRoot();

constexpr uid_t kAppUser = 501;

// Sends one request on `fd` and waits for its reply: false when the server
// ended the connection instead.
bool served(int fd, uint64_t id, const Value& body = Value::dictionary()) {
    if (!test::writeAll(fd, test::frameBytes(relay::FrameKind::Request, id, body))) return false;
    relay::FrameDecoder decoder;
    uint8_t buffer[4096];
    for (;;) {
        relay::Frame frame;
        if (decoder.next(frame) == relay::FrameDecoder::Status::Frame) return frame.messageId == id;
        const ssize_t n = ::read(fd, buffer, sizeof buffer);
        if (n <= 0) return false;
        decoder.feed(std::span<const uint8_t>(buffer, static_cast<size_t>(n)));
    }
}

// Whether the server has ended the connection on `fd` (read gives EOF or
// a reset within the connection's read timeout).
bool endedByServer(int fd) {
    uint8_t byte;
    const ssize_t n = ::read(fd, &byte, 1);
    return n == 0 || (n < 0 && errno == ECONNRESET);
}

// The first `length` bytes of a request frame whose body is far larger.
std::vector<uint8_t> unfinishedFrame(size_t length) {
    std::vector<uint8_t> frame = test::frameBytes(
        relay::FrameKind::Request, 1, dict({{"Blob", Value(Value::Data(length * 2, 0x5A))}}));
    frame.resize(length);
    return frame;
}

TEST(RelayUserBudgetTest, RefusalsAreLoggedOnceAMinutePerUserAndRootIsNeverRefused) {
    RelayUserLimits limits;
    limits.maxConnectionsPerUser = 1;
    limits.maxBufferedBytesPerUser = 100;
    std::vector<std::string> lines;
    RelayUserBudget budget(limits, [&](const std::string& line) { lines.push_back(line); });
    RelayUserBudget::Clock::time_point now{};
    budget.setClock([&] { return now; });

    EXPECT_TRUE(budget.admitConnection(kAppUser));
    EXPECT_FALSE(budget.admitConnection(kAppUser));
    EXPECT_FALSE(budget.admitConnection(kAppUser));
    EXPECT_FALSE(budget.charge(kAppUser, 150));
    EXPECT_EQ(lines.size(), 1u);
    EXPECT_TRUE(budget.admitConnection(kAppUser + 1));
    EXPECT_FALSE(budget.admitConnection(kAppUser + 1));
    EXPECT_EQ(lines.size(), 2u) << "each user has its own minute";
    now += std::chrono::seconds(61);
    EXPECT_FALSE(budget.admitConnection(kAppUser));
    EXPECT_EQ(lines.size(), 3u);

    EXPECT_TRUE(budget.charge(kAppUser, -150));
    EXPECT_EQ(budget.bufferedBytes(kAppUser), 0u);
    budget.releaseConnection(kAppUser);
    EXPECT_EQ(budget.connections(kAppUser), 0u);
    EXPECT_TRUE(budget.admitConnection(kAppUser));
    for (int i = 0; i < 5; ++i) EXPECT_TRUE(budget.admitConnection(0));
    EXPECT_TRUE(budget.charge(0, 1 << 30));
    EXPECT_EQ(lines.size(), 3u);
}

class RelayUserLimitsTest : public ::testing::Test {
  protected:
    void SetUp() override { BERTH_REQUIRE_ROOT(); }

    void start(RelayUserLimits limits) {
        server_ = std::make_unique<RelayTestServer>([](const RelayEvent&, RelayReply&) {},
                                                    RelayLimits{}, nullptr, limits);
        // The app user must reach the socket.
        std::filesystem::permissions(server_->path().parent_path(),
                                     std::filesystem::perms::others_exec,
                                     std::filesystem::perm_options::add);
    }

    size_t refusalLines() {
        size_t lines = 0;
        for (const auto& line : server_->log())
            if (line.find("refusing connections of user 501") != std::string::npos) ++lines;
        return lines;
    }

    std::unique_ptr<RelayTestServer> server_;
};

TEST_F(RelayUserLimitsTest, ConnectionsBeyondTheUsersCountAreClosedAndRootIsNotCounted) {
    RelayUserLimits limits;
    limits.maxConnectionsPerUser = 6;
    start(limits);
    const int status = test::inChild(
        [&] {
            std::vector<UniqueFd> held;
            int servedCount = 0;
            for (int i = 0; i < 10; ++i) {
                held.push_back(server_->connectRaw());
                servedCount += served(held.back().get(), 1);
            }
            return servedCount;
        },
        kAppUser);
    EXPECT_EQ(status, 6);
    EXPECT_EQ(refusalLines(), 1u) << "four refusals within a minute, one line";

    // The app's connections are gone with it: it may connect again, and
    // root may hold more than the user's count.
    ASSERT_TRUE(server_->waitFor([&] { return server_->listener().connectionCount() == 0; }));
    EXPECT_EQ(
        test::inChild([&] { return served(server_->connectRaw().get(), 1) ? 0 : 1; }, kAppUser), 0);
    std::vector<UniqueFd> rootConnections;
    for (int i = 0; i < 10; ++i) {
        rootConnections.push_back(server_->connectRaw());
        EXPECT_TRUE(served(rootConnections.back().get(), 1)) << "root connection " << i;
    }
}

TEST_F(RelayUserLimitsTest, BytesBeyondTheUsersBudgetEndTheConnectionThatAskedForThem) {
    RelayUserLimits limits;
    limits.maxBufferedBytesPerUser = 256 << 10;
    start(limits);
    const int status = test::inChild(
        [&] {
            UniqueFd modest = server_->connectRaw();
            UniqueFd greedy = server_->connectRaw();
            if (!test::writeAll(greedy.get(), unfinishedFrame(200 << 10))) return 10;
            if (!served(modest.get(), 1)) return 11;  // within the budget together
            // The write itself may fail: the server can end the connection
            // as soon as it has read the part that crosses the budget.
            test::writeAll(greedy.get(), std::vector<uint8_t>(100 << 10, 0x5A));
            if (!endedByServer(greedy.get())) return 13;
            // What the ended connection held is given back.
            return served(modest.get(), 2, dict({{"Blob", Value(Value::Data(200 << 10, 1))}})) ? 0
                                                                                               : 14;
        },
        kAppUser);
    EXPECT_EQ(status, 0);
    EXPECT_EQ(refusalLines(), 1u);

    // Root buffers what it likes.
    UniqueFd root = server_->connectRaw();
    EXPECT_TRUE(served(root.get(), 1, dict({{"Blob", Value(Value::Data(1 << 20, 2))}})));
}

TEST_F(RelayUserLimitsTest, DescriptorsNearTheLimitAreKeptForRoot) {
    RelayUserLimits limits;
    limits.reservedDescriptors = 64;
    const size_t open = static_cast<size_t>(test::openDescriptorCount());
    // Room for about 20 connections of others (two descriptors each), then
    // only root's reserve.
    test::DescriptorLimit tight(open + 40 + limits.reservedDescriptors);
    start(limits);
    const int status = test::inChild(
        [&] {
            std::vector<UniqueFd> held;
            int servedCount = 0;
            for (int i = 0; i < 40; ++i) {
                held.push_back(server_->connectRaw());
                servedCount += served(held.back().get(), 1);
            }
            return servedCount;
        },
        kAppUser);
    EXPECT_GT(status, 0);
    EXPECT_LE(status, 21);
    EXPECT_TRUE(server_->logged("kept for root"));
    UniqueFd root = server_->connectRaw();
    EXPECT_TRUE(served(root.get(), 1));
}

}  // namespace
}  // namespace berth
