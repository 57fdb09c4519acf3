#include "BenchLatency.h"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <stdexcept>
#include <thread>
#include <vector>

namespace berth::bench {

namespace {
using Clock = std::chrono::steady_clock;
}  // namespace

Latency measureRoundTrips(int clients, double seconds,
                          const std::function<RoundTripFunction(int client)>& makeClient) {
    std::atomic<bool> measuring{false}, stop{false}, broken{false};
    std::atomic<uint64_t> failures{0};
    std::vector<std::vector<double>> latencies(clients);
    std::vector<std::thread> threads;
    for (int c = 0; c < clients; ++c) {
        threads.emplace_back([&, c] {
            const RoundTripFunction roundTrip = makeClient(c);
            std::vector<double>& mine = latencies[c];
            for (uint64_t n = 0; !stop.load(std::memory_order_relaxed); ++n) {
                const auto start = Clock::now();
                const RoundTrip outcome = roundTrip(n);
                if (outcome == RoundTrip::kBroken) {
                    broken = true;
                    return;
                }
                if (!measuring.load(std::memory_order_relaxed)) continue;
                if (outcome == RoundTrip::kFailed) failures.fetch_add(1, std::memory_order_relaxed);
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
    for (std::thread& thread : threads) thread.join();
    if (broken) throw std::runtime_error("a connection to berthd broke or got no reply in time");

    std::vector<double> all;
    for (const std::vector<double>& mine : latencies)
        all.insert(all.end(), mine.begin(), mine.end());
    Latency result;
    result.failures = failures;
    if (all.empty()) return result;
    std::sort(all.begin(), all.end());
    result.requestsPerSecond = static_cast<double>(all.size()) / elapsed;
    result.p50Microseconds = all[all.size() / 2];
    result.p99Microseconds = all[std::min(all.size() - 1, all.size() * 99 / 100)];
    return result;
}

void printLatencyHeader() {
    std::printf("%-16s %7s %12s %10s %10s\n", "workload", "clients", "requests/s", "p50 us",
                "p99 us");
}

void printLatencyRow(const char* workload, int clients, const Latency& result) {
    std::printf("%-16s %7d %12.0f %10.1f %10.1f", workload, clients, result.requestsPerSecond,
                result.p50Microseconds, result.p99Microseconds);
    if (result.failures) std::printf("   (%llu failed)", (unsigned long long)result.failures);
    std::printf("\n");
}

}  // namespace berth::bench
