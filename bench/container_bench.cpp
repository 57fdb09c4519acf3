// Container commands through a real berthd on a scratch device root, over
// its request socket, as clients see them.
//
//   create   command 0 creating a container under a fresh identifier each
//            time (class Data/Application, user 501)
//   lookup   command 0 finding containers that exist, without creating
//   rebuild  the first look-up in a class whose map the daemon has not built
//            yet: the class directory holds N containers written before the
//            daemon started, so that look-up reads and validates N metadata
//            files; timed against the look-ups after it
//
// Each client thread owns one connection and sends one request at a time,
// waiting for its reply; the throughput rows run 1 and 8 clients. The
// rebuild is timed over several daemon starts (each start builds the map
// anew; the files are in the page cache after the first).
//
//   container_bench <path of berthd> [--against=<path of another berthd>]
//                   [seconds per throughput row, default 3]
//                   [containers in the rebuilt class, default 10000]
//                   [daemon starts for the rebuild, default 5]
//
// With --against, the create rows are measured for both daemons in one run,
// on the same device root, one daemon at a time in the order A B B A per
// client count: side by side with another build (say, of main).
//
// Run as root (the daemon must be able to own what it makes); the defaults
// take about half a minute. The scratch device root is removed afterwards,
// except when a run fails, for a look at the daemon's log.
#include <fcntl.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/time.h>
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
#include <fstream>
#include <functional>
#include <optional>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "BTHGlobalConfiguration.h"
#include "BTHMetadata.h"
#include "BenchDaemon.h"
#include "BenchLatency.h"
#include "BenchSummary.h"
#include "core/RelayCodec.h"
#include "platform/CodeSigningRegistry.h"
#include "platform/UniqueFd.h"

namespace berth {
namespace {

using Clock = std::chrono::steady_clock;

constexpr uint64_t kDataApplication = 2;
constexpr uint64_t kDataSprocketPlugin = 4;
constexpr uint64_t kUser = 501;

// Ends the run; main reports it after every daemon started is stopped.
[[noreturn]] void die(const std::string& why) {
    throw std::runtime_error(why);
}

double millisecondsSince(Clock::time_point start) {
    return std::chrono::duration<double, std::milli>(Clock::now() - start).count();
}

using bench::BenchClient;
using bench::BenchDaemon;
using bench::lookupRequest;

std::string rebuiltIdentifier(uint64_t index) {
    return "sys.kelp.bench.existing." + std::to_string(index);
}

// The accounts and homes of a device root, and this program signed in its
// registry as a client that may act on other identifiers.
void prepareRoot(const std::filesystem::path& root) {
    Value entitlements = Value::dictionary();
    entitlements.set("sys.kelp.private.Berth.otherIdLookup", true);
    entitlements.set("sys.kelp.private.Berth.allowed", true);  // the listing that checks the map
    bench::prepareBenchRoot(root, "sys.kelp.bench.containers", entitlements);
}

// Writes `count` containers of user 501's Data/Application class directly
// on disk, each a directory with a valid metadata file, written the way the
// daemon writes it (durably, so several threads share the waits).
void writeContainers(uint64_t count) {
    const std::optional<std::filesystem::path> classDirectory =
        BTHGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(
            static_cast<uid_t>(kUser), kDataApplication, false);
    if (!classDirectory) die("no class directory for user 501");
    constexpr uint64_t kWriters = 32;
    std::atomic<bool> failed{false};
    std::vector<std::thread> writers;
    for (uint64_t w = 0; w < kWriters; ++w) {
        writers.emplace_back([&, w] {
            for (uint64_t i = w; i < count && !failed; i += kWriters) {
                const std::filesystem::path url = *classDirectory / Uuid::random().string();
                std::error_code ec;
                std::filesystem::create_directory(url, ec);
                BTHMetadata record(static_cast<uid_t>(kUser), Uuid::random(), kDataApplication,
                                   rebuiltIdentifier(i), std::nullopt, url, std::nullopt);
                if (ec || !record.writeMetadataToDisk(nullptr)) failed = true;
            }
        });
    }
    for (std::thread& writer : writers) writer.join();
    if (failed) die("could not write the containers");
}

struct Rebuild {
    double firstMilliseconds = 0;
    double nextMilliseconds = 0;  // median of the look-ups after the first
};

// The number of containers command 1 lists for the class.
size_t listedContainers(BenchClient& client) {
    Value request = Value::dictionary();
    request.set("Command", uint64_t{1});
    request.set("ContainerClass", kDataApplication);
    request.set("UserID", kUser);
    const std::optional<Value> reply = client.exchange(request);
    const Value* ids = reply ? reply->find("ReplyIdsArray") : nullptr;
    return ids ? ids->size() : 0;
}

// One daemon start: the first look-up in the populated class against the
// ones after it. A look-up in another class first takes the daemon's own
// first-request costs out of the measurement. With `verify`, also checks
// that the map holds every container written (that each file validated).
Rebuild timeRebuild(const std::filesystem::path& binary, const std::filesystem::path& root,
                    uint64_t count, bool verify) {
    BenchDaemon daemon(binary, root);
    BenchClient client(daemon.socket());
    client.call(lookupRequest(kDataSprocketPlugin, "sys.kelp.bench.warm-up", false));
    Rebuild result;
    auto start = Clock::now();
    if (client.call(lookupRequest(kDataApplication, rebuiltIdentifier(0), false)) != 1)
        die("the first look-up in the populated class failed");
    result.firstMilliseconds = millisecondsSince(start);
    std::vector<double> next;
    for (uint64_t i = 1; i <= 9; ++i) {
        start = Clock::now();
        if (client.call(
                lookupRequest(kDataApplication, rebuiltIdentifier(i * 7919 % count), false)) != 1)
            die("a look-up in the populated class failed");
        next.push_back(millisecondsSince(start));
    }
    std::sort(next.begin(), next.end());
    result.nextMilliseconds = next[next.size() / 2];
    if (verify && listedContainers(client) != count)
        die("the daemon's class map does not hold every container written");
    return result;
}

// Round trips of makeRequest(client, n) on one connection per client.
bench::Latency measure(const std::filesystem::path& socket, int clients, double seconds,
                       const std::function<Value(int client, uint64_t n)>& makeRequest) {
    return bench::measureRoundTrips(clients, seconds, [&](int c) -> bench::RoundTripFunction {
        auto client = std::make_shared<BenchClient>(socket);
        return [client, c, &makeRequest](uint64_t n) {
            const uint64_t code = client->connected() ? client->call(makeRequest(c, n)) : 0;
            if (code == 0) return bench::RoundTrip::kBroken;
            return code == 1 ? bench::RoundTrip::kSucceeded : bench::RoundTrip::kFailed;
        };
    });
}

// Creates under fresh identifiers ("<row>.<clients>.<client>.<n>") through
// a daemon of `binary` started for this row alone.
bench::Latency measureCreates(const std::filesystem::path& binary,
                              const std::filesystem::path& root, int clients, double seconds,
                              size_t row) {
    BenchDaemon daemon(binary, root);
    const std::string prefix =
        "sys.kelp.bench.new." + std::to_string(row) + "." + std::to_string(clients) + ".";
    return measure(daemon.socket(), clients, seconds, [&prefix](int client, uint64_t n) {
        return lookupRequest(kDataApplication,
                             prefix + std::to_string(client) + "." + std::to_string(n), true);
    });
}

// The mean of the rows of one build.
bench::Latency mean(const std::vector<std::pair<bool, bench::Latency>>& rows, bool mine) {
    bench::Latency sum;
    int count = 0;
    for (const auto& [isMine, latency] : rows) {
        if (isMine != mine) continue;
        sum.requestsPerSecond += latency.requestsPerSecond;
        sum.p50Microseconds += latency.p50Microseconds;
        sum.p99Microseconds += latency.p99Microseconds;
        sum.failures += latency.failures;
        ++count;
    }
    if (count == 0) return sum;
    sum.requestsPerSecond /= count;
    sum.p50Microseconds /= count;
    sum.p99Microseconds /= count;
    return sum;
}

struct Settings {
    std::filesystem::path berthd;
    std::optional<std::filesystem::path> against;  // another build, for the create rows
    double seconds = 3;                            // per throughput row
    uint64_t count = 10000;                        // containers in the rebuilt class
    int starts = 5;                                // daemon starts timing the rebuild
};

void run(const Settings& settings, const std::filesystem::path& root) {
    prepareRoot(root);
    const auto start = Clock::now();
    writeContainers(settings.count);
    std::printf("wrote %llu containers of Data/Application for user 501 in %.1f s\n",
                (unsigned long long)settings.count, millisecondsSince(start) / 1000);

    std::vector<Rebuild> rebuilds;
    for (int i = 0; i < settings.starts; ++i)
        rebuilds.push_back(timeRebuild(settings.berthd, root, settings.count, i == 0));
    std::sort(rebuilds.begin(), rebuilds.end(), [](const Rebuild& a, const Rebuild& b) {
        return a.firstMilliseconds < b.firstMilliseconds;
    });
    const Rebuild& median = rebuilds[rebuilds.size() / 2];
    std::printf("%-8s %10s %12s %12s %14s %8s\n", "rebuild", "containers", "first ms", "fastest ms",
                "next look-up ms", "ratio");
    std::printf("%-8s %10llu %12.1f %12.1f %14.3f %7.0fx\n\n", "",
                (unsigned long long)settings.count, median.firstMilliseconds,
                rebuilds.front().firstMilliseconds, median.nextMilliseconds,
                median.firstMilliseconds / median.nextMilliseconds);

    bench::printSummary("container", "first look-up of " + std::to_string(settings.count), "ms",
                        median.firstMilliseconds, "next look-up", median.nextMilliseconds);

    bench::printLatencyHeader();
    for (int clients : {1, 8}) {
        // This build, the other, the other, this: drift favours neither.
        std::vector<std::pair<bool, bench::Latency>> rows;
        for (bool mine : {true, false, false, true}) {
            if (!mine && !settings.against) continue;
            rows.emplace_back(mine, measureCreates(mine ? settings.berthd : *settings.against, root,
                                                   clients, settings.seconds, rows.size()));
            bench::printLatencyRow(mine ? "create" : "create (against)", clients,
                                   rows.back().second);
        }
        const bench::Latency mine = mean(rows, true);
        const std::string workload = "create, " + std::to_string(clients) + " clients";
        if (!settings.against) {
            bench::printSummary("container", workload, "req/s", mine.requestsPerSecond, "", 0);
            continue;
        }
        const bench::Latency other = mean(rows, false);
        bench::printSummary("container", workload, "req/s", mine.requestsPerSecond,
                            "--against build", other.requestsPerSecond);
        bench::printSummary("container", workload + " p99", "us", mine.p99Microseconds,
                            "--against build", other.p99Microseconds);
    }

    BenchDaemon daemon(settings.berthd, root);
    const uint64_t count = settings.count;
    for (int clients : {1, 8}) {
        const bench::Latency lookup =
            measure(daemon.socket(), clients, settings.seconds, [count](int client, uint64_t n) {
                // Each client walks the containers from its own start.
                return lookupRequest(kDataApplication,
                                     rebuiltIdentifier((n + client * 7919) % count), false);
            });
        bench::printLatencyRow("lookup", clients, lookup);
        bench::printSummary("container", "look-up, " + std::to_string(clients) + " clients",
                            "req/s", lookup.requestsPerSecond, "", 0);
    }
}

}  // namespace
}  // namespace berth

int main(int argc, char** argv) {
    using namespace berth;
    std::setvbuf(stdout, nullptr, _IOLBF, 0);  // rows appear as they are measured
    if (argc < 2) {
        std::fprintf(stderr,
                     "usage: container_bench <path of berthd> [--against=<another berthd>] "
                     "[seconds per row, default 3] "
                     "[containers in the rebuilt class, default 10000] [daemon starts for the "
                     "rebuild, default 5]\n");
        return 64;
    }
    Settings settings;
    settings.berthd = std::filesystem::absolute(argv[1]);
    std::vector<const char*> rest;
    for (int i = 2; i < argc; ++i) {
        const std::string argument = argv[i];
        if (argument.rfind("--against=", 0) == 0)
            settings.against = std::filesystem::absolute(argument.substr(10));
        else
            rest.push_back(argv[i]);
    }
    if (rest.size() > 0) settings.seconds = std::atof(rest[0]);
    if (rest.size() > 1) settings.count = std::strtoull(rest[1], nullptr, 10);
    if (rest.size() > 2) settings.starts = std::atoi(rest[2]);
    if (settings.seconds <= 0 || settings.count == 0 || settings.starts < 1) {
        std::fprintf(stderr, "container_bench: seconds, containers and starts must be positive\n");
        return 64;
    }

    return bench::runOnScratchRoot("container-bench",
                                   [&](const std::filesystem::path& root) { run(settings, root); });
}
