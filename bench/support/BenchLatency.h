// The timed loop of the benchmarks that measure round trips: several client
// threads, each doing one round trip at a time on its own connection, after
// a short warm-up, for a fixed time; throughput and latency percentiles.
#pragma once

#include <cstdint>
#include <functional>

namespace berth::bench {

// What one round trip gave.
enum class RoundTrip {
    kSucceeded,
    kFailed,  // answered, but not as expected: counted
    kBroken,  // no answer: ends the measurement with an error
};

struct Latency {
    double requestsPerSecond = 0;
    double p50Microseconds = 0;
    double p99Microseconds = 0;
    uint64_t failures = 0;
};

// A client's round trip number `n`.
using RoundTripFunction = std::function<RoundTrip(uint64_t n)>;

// Runs `clients` threads, each with the round trip makeClient(c) gives it
// (made on its own thread, so it may own a connection), for `seconds` after
// a 300 ms warm-up. Throws std::runtime_error when a round trip broke.
Latency measureRoundTrips(int clients, double seconds,
                          const std::function<RoundTripFunction(int client)>& makeClient);

// One row: workload, clients, requests/s, p50 and p99 in microseconds.
void printLatencyHeader();
void printLatencyRow(const char* workload, int clients, const Latency& result);

}  // namespace berth::bench
