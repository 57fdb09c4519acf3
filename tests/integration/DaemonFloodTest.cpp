// One app user floods the request socket, with connections up to the
// daemon's descriptor limit and unfinished frames just under the frame
// limit, while root creates containers: root is answered throughout, the
// daemon stays small, and the flood's refusals make one log line.
#include <sys/socket.h>

#include <fstream>
#include <thread>

#include "DaemonSupport.h"
#include "core/RelayCodec.h"

namespace berth::test {
namespace {

constexpr uid_t kAppUser = 501;

// The resident memory of process `pid` in bytes.
size_t residentBytes(pid_t pid) {
    std::ifstream status("/proc/" + std::to_string(pid) + "/status");
    for (std::string line; std::getline(status, line);)
        if (line.rfind("VmRSS:", 0) == 0) return std::stoull(line.substr(6)) * 1024;
    return 0;
}

// Writes `bytes` unless the peer ends the connection first.
bool writeAllOf(int fd, const std::vector<uint8_t>& bytes) {
    size_t done = 0;
    while (done < bytes.size()) {
        const ssize_t n = ::send(fd, bytes.data() + done, bytes.size() - done, MSG_NOSIGNAL);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) return false;
        done += static_cast<size_t>(n);
    }
    return true;
}

// The first part of a request whose body is just under the frame limit.
std::vector<uint8_t> unfinishedRequest() {
    std::vector<uint8_t> frame;
    relay::encodeFrame({relay::FrameKind::Request, 1,
                        dict({{"Blob", Value(Value::Data(relay::kMaxBodySize - 64, 7))}})},
                       frame);
    frame.resize(frame.size() * 3 / 4);
    return frame;
}

class DaemonFloodTest : public DaemonFixture {};

TEST_F(DaemonFloodTest, OneUsersFloodLeavesRootServedAndTheDaemonSmall) {
    BERTH_REQUIRE_ROOT();
    // Far fewer descriptors than the flood wants.
    DaemonLaunch launch;
    launch.launcher = {"prlimit", "--nofile=1024:1024", "--"};
    daemon_.emplace(deviceRoot(), std::move(launch));
    ASSERT_TRUE(daemon_->waitUntilServing()) << daemon_->standardError();
    const std::filesystem::path socket = daemon_->requestSocket();
    // The app user must reach the socket, as on a device.
    for (std::filesystem::path dir = socket.parent_path(); dir != deviceRoot().parent_path();
         dir = dir.parent_path())
        std::filesystem::permissions(dir, std::filesystem::perms::others_exec,
                                     std::filesystem::perm_options::add);
    int ready[2], finish[2];
    ASSERT_EQ(::pipe(ready), 0);
    ASSERT_EQ(::pipe(finish), 0);

    std::thread flood([&] {
        inChild(
            [&] {
                const std::vector<uint8_t> frame = unfinishedRequest();
                std::vector<UniqueFd> held;
                for (int i = 0; i < 1200; ++i) {
                    UniqueFd fd = connectUnix(socket);
                    if (!fd) break;
                    timeval limit{20, 0};
                    ::setsockopt(fd.get(), SOL_SOCKET, SO_SNDTIMEO, &limit, sizeof limit);
                    if (i % 3 == 0 && !writeAllOf(fd.get(), frame)) continue;
                    held.push_back(std::move(fd));
                }
                char byte = 1;
                (void)!::write(ready[1], &byte, 1);
                (void)!::read(finish[0], &byte, 1);
                return 0;
            },
            kAppUser);
    });

    char byte;
    ASSERT_EQ(::read(ready[0], &byte, 1), 1);
    size_t most = residentBytes(daemon_->pid());
    for (int i = 0; i < 20; ++i) {
        auto fresh = BerthConnection::connect(socket);
        ASSERT_TRUE(fresh) << "root could not connect during the flood";
        BerthError error;
        std::optional<Value> reply =
            fresh->request(create(2, 501, "com.example.flood." + std::to_string(i)),
                           std::chrono::seconds(20), &error);
        ASSERT_TRUE(reply) << error.message;
        EXPECT_EQ(code(*reply), 1u) << reply->description();
        most = std::max(most, residentBytes(daemon_->pid()));
    }
    (void)!::write(finish[1], &byte, 1);
    flood.join();
    for (int fd : {ready[0], ready[1], finish[0], finish[1]}) ::close(fd);

    EXPECT_LT(most, size_t{256} << 20);
    size_t lines = 0;
    const std::string log = daemonLog();
    for (size_t at = log.find("refusing connections of user 501"); at != std::string::npos;
         at = log.find("refusing connections of user 501", at + 1))
        ++lines;
    EXPECT_EQ(lines, 1u);
}

}  // namespace
}  // namespace berth::test
