// Request round trips through the relay server, side by side with a bare
// Unix-socket echo server measured in the same run.
//
// Each client thread owns one connection and sends one request at a time,
// waiting for its reply. Servers:
//   echo            one epoll thread writing every byte straight back
//   relay           the relay listener; the handler replies at once
//   relay+identity  the same, the handler also evaluates the peer's identity
//                   through the code-signing registry, as the daemon's
//                   intake does for every request
// Printed per server and client count: requests/s, p50 and p99 round trip,
// and requests/s as a ratio to the echo server's.
//
//   daemon          a real berthd on a scratch device root (when its path is
//                   given), with this program signed as a client holding
//                   ".allowed": every request is a look-up of a container
//                   that exists (command 0, not creating), through the
//                   daemon's intake (identity, entitlement check, command
//                   dispatch) and the container cache
//
//   daemon (against) the same look-ups through another berthd build, given
//                   with --against=PATH, on the same device root: the two
//                   daemons run one after the other for each client count
//
//   relay_bench [seconds per measurement, default 2] [path of berthd]
//               [--against=path of another berthd] [--daemon-only] [--detail]
//
// --daemon-only leaves out the relay and relay+identity rows; --detail also
// prints, per row, the tail of the round trips (p90 to the slowest) and the
// fewest and most requests one client got through.
#include <signal.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <map>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "BenchDaemon.h"
#include "BenchSummary.h"
#include "core/RelayCodec.h"
#include "platform/CodeSigningRegistry.h"
#include "platform/NamedSemaphore.h"
#include "platform/RelayListener.h"
#include "platform/ServiceCheckIn.h"

namespace berth {
namespace {

using Clock = std::chrono::steady_clock;

// A bare echo server: no framing, no queues, one thread.
class EchoServer {
  public:
    explicit EchoServer(UniqueFd listening) : listening_(std::move(listening)) {
        epoll_.reset(::epoll_create1(EPOLL_CLOEXEC));
        add(listening_.get());
        thread_ = std::thread([this] { run(); });
    }
    ~EchoServer() {
        stop_ = true;
        ::shutdown(listening_.get(), SHUT_RDWR);
        thread_.join();
    }

  private:
    void add(int fd) {
        epoll_event event{};
        event.events = EPOLLIN;
        event.data.fd = fd;
        ::epoll_ctl(epoll_.get(), EPOLL_CTL_ADD, fd, &event);
    }
    void run() {
        epoll_event events[64];
        std::vector<uint8_t> buffer(64 << 10);
        while (!stop_) {
            const int count = ::epoll_wait(epoll_.get(), events, 64, 100);
            for (int i = 0; i < count; ++i) {
                const int fd = events[i].data.fd;
                if (fd == listening_.get()) {
                    UniqueFd peer(::accept4(fd, nullptr, nullptr, SOCK_CLOEXEC));
                    if (peer) add(peer.get()), peers_.push_back(std::move(peer));
                    continue;
                }
                const ssize_t got = ::read(fd, buffer.data(), buffer.size());
                if (got <= 0) {
                    ::epoll_ctl(epoll_.get(), EPOLL_CTL_DEL, fd, nullptr);
                    continue;
                }
                // Replies are small; a blocking write of them never stalls.
                (void)!::send(fd, buffer.data(), static_cast<size_t>(got), MSG_NOSIGNAL);
            }
        }
    }

    UniqueFd listening_;
    UniqueFd epoll_;
    std::vector<UniqueFd> peers_;
    std::atomic<bool> stop_{false};
    std::thread thread_;
};

std::unique_ptr<RelayListener> startRelay(UniqueFd listening, bool evaluateIdentity) {
    RelayListener::Options options;
    options.label = "relay.bench";
    std::string why;
    auto listener = RelayListener::make(
        std::move(listening), WorkQueue::makeConcurrent("relay.bench.listener"), options, &why);
    if (!listener) {
        std::fprintf(stderr, "relay: %s\n", why.c_str());
        std::exit(1);
    }
    listener->setEventHandler(
        [evaluateIdentity](const std::shared_ptr<RelayConnection>& connection) {
            connection->setEventHandler([evaluateIdentity, connection](const RelayEvent& event) {
                std::optional<RelayReply> reply = event.makeReply();
                if (!reply) return;
                if (evaluateIdentity && !connection->peerIdentity().processStillBound) return;
                reply->body().set("ReplyError", uint64_t{1});
                reply->send();
            });
            connection->resume();
        });
    listener->resume();
    return listener;
}

UniqueFd connectTo(const std::filesystem::path& path) {
    UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
    if (::connect(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
        std::perror("connect");
        std::exit(1);
    }
    return fd;
}

// Reads one whole frame (header and body); false at the end of the stream.
bool readFrame(int fd, std::vector<uint8_t>& buffer) {
    auto readExactly = [fd](uint8_t* into, size_t size) {
        for (size_t done = 0; done < size;) {
            const ssize_t got = ::read(fd, into + done, size - done);
            if (got <= 0) return false;
            done += static_cast<size_t>(got);
        }
        return true;
    };
    buffer.resize(relay::kHeaderSize);
    if (!readExactly(buffer.data(), relay::kHeaderSize)) return false;
    uint32_t length = 0;
    for (int i = 0; i < 4; ++i) length |= uint32_t(buffer[12 + i]) << (8 * i);
    buffer.resize(relay::kHeaderSize + length);
    return readExactly(buffer.data() + relay::kHeaderSize, length);
}

struct Result {
    double requestsPerSecond = 0;
    double p50Microseconds = 0;
    double p99Microseconds = 0;
    std::string detail;  // the tail and the spread, printed with --detail
};

// The bench client's own Data/Application container of user 501.
Value lookupRequest(bool create) {
    return bench::lookupRequest(2, "sys.kelp.bench.client", create);
}

Result measure(const std::filesystem::path& path, int clients, double seconds) {
    const Value request = lookupRequest(false);
    std::vector<uint8_t> frame;
    relay::encodeFrame({relay::FrameKind::Request, 1, request}, frame);

    std::atomic<bool> measuring{false}, stop{false};
    std::vector<std::vector<double>> latencies(clients);
    std::vector<std::thread> threads;
    for (int c = 0; c < clients; ++c) {
        threads.emplace_back([&, c] {
            UniqueFd fd = connectTo(path);
            std::vector<uint8_t> reply;
            auto& mine = latencies[c];
            mine.reserve(1 << 20);
            while (!stop.load(std::memory_order_relaxed)) {
                const auto start = Clock::now();
                if (::send(fd.get(), frame.data(), frame.size(), MSG_NOSIGNAL) !=
                        static_cast<ssize_t>(frame.size()) ||
                    !readFrame(fd.get(), reply))
                    return;
                if (measuring.load(std::memory_order_relaxed))
                    mine.push_back(
                        std::chrono::duration<double, std::micro>(Clock::now() - start).count());
            }
        });
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(300));  // warm-up
    measuring = true;
    const auto begin = Clock::now();
    std::this_thread::sleep_for(std::chrono::duration<double>(seconds));
    measuring = false;
    const double elapsed = std::chrono::duration<double>(Clock::now() - begin).count();
    stop = true;
    for (auto& thread : threads) thread.join();

    std::vector<double> all;
    for (auto& mine : latencies) all.insert(all.end(), mine.begin(), mine.end());
    Result result;
    if (all.empty()) return result;
    std::sort(all.begin(), all.end());
    result.requestsPerSecond = static_cast<double>(all.size()) / elapsed;
    auto at = [&](double q) {
        return all[std::min(all.size() - 1, static_cast<size_t>(all.size() * q))];
    };
    result.p50Microseconds = at(0.50);
    result.p99Microseconds = at(0.99);
    size_t fewest = SIZE_MAX, most = 0;
    for (const auto& mine : latencies) {
        fewest = std::min(fewest, mine.size());
        most = std::max(most, mine.size());
    }
    char line[160];
    std::snprintf(line, sizeof line,
                  "p90 %.0f p95 %.0f p99.9 %.0f max %.0f us; requests per client %zu to %zu",
                  at(0.90), at(0.95), at(0.999), all.back(), fewest, most);
    result.detail = line;
    return result;
}

// The accounts and homes of a device root, and this program signed into its
// registry as a client holding ".allowed".
void prepareRoot(const std::filesystem::path& root) {
    Value entitlements = Value::dictionary();
    entitlements.set("sys.kelp.private.Berth.allowed", true);
    bench::prepareBenchRoot(root, "sys.kelp.bench.client", entitlements);
}

// A berthd serving a root made by prepareRoot(); stopped when the object
// goes.
class Daemon {
  public:
    Daemon(const std::filesystem::path& binary, const std::filesystem::path& root)
        : daemon_(binary, root) {
        // The container the look-ups find (1: success).
        bench::BenchClient client(daemon_.socket());
        const std::optional<Value> reply = client.exchange(lookupRequest(true));
        const Value* error = reply ? reply->find("ReplyError") : nullptr;
        if (!error || error->uint64Value() != uint64_t{1}) {
            std::fprintf(stderr, "the daemon did not create the looked-up container (%s)\n",
                         reply ? reply->description().c_str() : "no reply");
            std::exit(1);
        }
    }
    const std::filesystem::path& socket() const { return daemon_.socket(); }

  private:
    bench::BenchDaemon daemon_;
};

UniqueFd claim(const std::filesystem::path& dir, const std::string& name) {
    std::string why;
    auto endpoint = ServiceCheckIn::claim(name, SOCK_STREAM, 0666, nullptr, &why, dir);
    if (!endpoint) {
        std::fprintf(stderr, "%s: %s\n", name.c_str(), why.c_str());
        std::exit(1);
    }
    UniqueFd socket = endpoint->takeSocket();
    return socket;
}

}  // namespace
}  // namespace berth

int main(int argc, char** argv) {
    using namespace berth;
    std::vector<std::string> positional;
    std::string against;
    bool daemonOnly = false, printDetail = false;
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        if (arg.rfind("--against=", 0) == 0)
            against = arg.substr(10);
        else if (arg == "--daemon-only")
            daemonOnly = true;
        else if (arg == "--detail")
            printDetail = true;
        else
            positional.push_back(arg);
    }
    const double seconds = !positional.empty() ? std::atof(positional[0].c_str()) : 2.0;
    char templ[] = "/tmp/relay-bench.XXXXXX";
    if (!::mkdtemp(templ)) return 1;
    const std::filesystem::path dir = templ;
    // The daemon's device root; this program reads it too (the registry).
    const std::filesystem::path root = dir / "root";
    const std::string binary = positional.size() > 1 ? positional[1] : "";
    if (!binary.empty()) {
        ::setenv("BERTH_ROOT", root.c_str(), 1);
        prepareRoot(root);
    }
    // Each daemon row starts its daemon, measures and stops it, so that the
    // two builds never run at the same time.
    auto measureDaemon = [&](const std::string& path, int clients) {
        Daemon daemon(path, root);
        return measure(daemon.socket(), clients, seconds);
    };

    EchoServer echo(claim(dir, "echo"));
    auto relay = startRelay(claim(dir, "relay"), false);
    auto relayIdentity = startRelay(claim(dir, "relay-identity"), true);

    std::printf("%-17s %7s %12s %10s %10s %9s\n", "server", "clients", "requests/s", "p50 us",
                "p99 us", "vs echo");
    for (int clients : {1, 8, 64}) {
        const Result baseline = measure(dir / "echo", clients, seconds);
        std::vector<std::pair<const char*, Result>> rows = {
            {"echo", baseline},
        };
        if (!daemonOnly) {
            rows.emplace_back("relay", measure(dir / "relay", clients, seconds));
            rows.emplace_back("relay+identity", measure(dir / "relay-identity", clients, seconds));
        }
        if (!binary.empty()) rows.emplace_back("daemon", measureDaemon(binary, clients));
        if (!against.empty())
            rows.emplace_back("daemon (against)", measureDaemon(against, clients));
        for (const auto& [name, result] : rows)
            std::printf("%-17s %7d %12.0f %10.1f %10.1f %9.2f\n", name, clients,
                        result.requestsPerSecond, result.p50Microseconds, result.p99Microseconds,
                        baseline.requestsPerSecond > 0
                            ? result.requestsPerSecond / baseline.requestsPerSecond
                            : 0.0);
        for (const auto& [name, result] : rows)
            if (printDetail) std::printf("  %-15s %s\n", name, result.detail.c_str());
        for (const auto& [name, result] : rows) {
            if (std::string(name) == "echo") continue;
            bench::printSummary(
                "relay", std::string(name) + ", " + std::to_string(clients) + " clients", "req/s",
                result.requestsPerSecond, "echo server", baseline.requestsPerSecond);
        }
    }
    relay.reset();
    relayIdentity.reset();
    std::error_code ignored;
    std::filesystem::remove_all(dir, ignored);
    return 0;
}
