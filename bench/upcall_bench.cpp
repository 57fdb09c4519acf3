// The process-containers upcall through a real berthd, side by side with the
// request socket's look-up of the same data container, in one run:
//
//   upcall   a process-containers request for an app that exists, with its
//            tmp and two application groups (all created by a first request)
//   lookup   command 0 finding the same app's data container, without
//            creating
//
// Each client thread owns one connection and sends one request at a time;
// rows run 1 and 8 clients. The upcall is served on the daemon's main queue,
// one request at a time, so more clients add waiting, not throughput.
//
//   upcall_bench <path of berthd> [seconds per row, default 3]
//
// Run as root. The scratch device root is removed afterwards, except when a
// run fails, for a look at the daemon's log.
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

#include "BTHCodeSigningMapping.h"
#include "BenchDaemon.h"
#include "BenchLatency.h"
#include "BenchSummary.h"
#include "packbuff/packbuff.h"
#include "platform/UpcallTransport.h"

namespace berth {
namespace {

constexpr const char* kApp = "sys.kelp.bench.upcall.app";

// The request pack buffer: signing identifier, persona 501, two groups.
std::vector<uint8_t> appRequest() {
    sb_packbuff* pb = sb_packbuff_new(256);
    const std::string items[] = {kApp, "group.sys.kelp.bench.one", "group.sys.kelp.bench.two"};
    int failed = sb_packbuff_pack_string(pb, 0, items[0].c_str(), items[0].size());
    failed |= sb_packbuff_pack_uint32(pb, 3, 501);
    for (int i = 1; i < 3; ++i)
        failed |= sb_packbuff_pack_string(pb, 4, items[i].c_str(), items[i].size());
    const auto* bytes = static_cast<const uint8_t*>(sb_packbuff_get_bytes(pb));
    std::vector<uint8_t> request(bytes, bytes + sb_packbuff_get_size(pb));
    sb_packbuff_free(pb);
    if (failed) throw std::runtime_error("could not build the upcall request");
    return request;
}

// Whether a reply pack buffer ends with the success item holding 1.
bool succeeded(std::vector<uint8_t> reply) {
    sb_packbuff* pb = sb_packbuff_init_with_buffer(reply.data(), reply.size(), true, 0);
    bool success = false;
    uint16_t type = 0;
    while (pb && sb_packbuff_get_item_value_type(pb, &type)) {
        int error = 0;
        if (type == 0) {
            success = sb_packbuff_unpack_uint32(pb, &error) == 1;
        } else {
            sb_packbuff_unpack_string(pb, nullptr, &error);
        }
        if (error) break;
    }
    sb_packbuff_free(pb);
    return success;
}

bench::RoundTripFunction upcallClient(const std::filesystem::path& socket,
                                      const std::vector<uint8_t>& request) {
    int error = 0;
    auto client =
        std::make_shared<std::optional<BTHUpcallClient>>(BTHUpcallClient::connect(socket, &error));
    return [client, &request](uint64_t) {
        int error = 0;
        if (!*client) return bench::RoundTrip::kBroken;
        std::optional<BTHUpcallAnswer> answer = (*client)->call(request, &error);
        if (!answer) return bench::RoundTrip::kBroken;
        return answer->returnCode == 0 && succeeded(answer->replyData)
                   ? bench::RoundTrip::kSucceeded
                   : bench::RoundTrip::kFailed;
    };
}

bench::RoundTripFunction lookupClient(const std::filesystem::path& socket) {
    auto client = std::make_shared<bench::BenchClient>(socket);
    const Value request = bench::lookupRequest(2, kApp, false);
    return [client, request](uint64_t) {
        const uint64_t code = client->connected() ? client->call(request) : 0;
        if (code == 0) return bench::RoundTrip::kBroken;
        return code == 1 ? bench::RoundTrip::kSucceeded : bench::RoundTrip::kFailed;
    };
}

void run(const std::filesystem::path& berthd, const std::filesystem::path& root, double seconds) {
    Value entitlements = Value::dictionary();
    entitlements.set("sys.kelp.private.Berth.otherIdLookup", true);
    bench::prepareBenchRoot(root, "sys.kelp.bench.upcall", entitlements);
    // The installer's report of the app's data container class.
    auto mapping = BTHCodeSigningMapping::create();
    if (!mapping || mapping->setCodeSigningDictionaryValues(
                        {std::make_shared<BTHCodeSigningEntry>(Value::dictionary(), 2)}, {kApp}))
        throw std::runtime_error("could not record the app's code-signing entry");

    bench::BenchDaemon daemon(berthd, root);
    const std::filesystem::path upcallSocket =
        daemon.socket().parent_path() / "sys.kelp.berthd.upcall";
    const std::vector<uint8_t> request = appRequest();
    if (upcallClient(upcallSocket, request)(0) != bench::RoundTrip::kSucceeded)
        throw std::runtime_error("the first upcall did not answer every container");

    bench::printLatencyHeader();
    for (int clients : {1, 8}) {
        const bench::Latency upcall = bench::measureRoundTrips(
            clients, seconds, [&](int) { return upcallClient(upcallSocket, request); });
        bench::printLatencyRow("upcall", clients, upcall);
        const bench::Latency lookup = bench::measureRoundTrips(
            clients, seconds, [&](int) { return lookupClient(daemon.socket()); });
        bench::printLatencyRow("lookup", clients, lookup);
        bench::printSummary("upcall", "process containers, " + std::to_string(clients) + " clients",
                            "req/s", upcall.requestsPerSecond, "socket look-up",
                            lookup.requestsPerSecond);
    }
}

}  // namespace
}  // namespace berth

int main(int argc, char** argv) {
    using namespace berth;
    std::setvbuf(stdout, nullptr, _IOLBF, 0);
    if (argc < 2) {
        std::fprintf(stderr, "usage: upcall_bench <path of berthd> [seconds per row, default 3]\n");
        return 64;
    }
    const std::filesystem::path berthd = std::filesystem::absolute(argv[1]);
    const double seconds = argc > 2 ? std::atof(argv[2]) : 3;
    if (seconds <= 0) {
        std::fprintf(stderr, "upcall_bench: seconds must be positive\n");
        return 64;
    }
    return bench::runOnScratchRoot(
        "upcall-bench", [&](const std::filesystem::path& root) { run(berthd, root, seconds); });
}
