// Cost of identifying a peer by the code-signing registry: with the digest
// of its executable remembered (every look-up after the first) and without
// (each look-up hashes the executable), and the per-request check that the
// peer still runs the same file. The peer is this benchmark program itself,
// signed into a scratch device root. Needs root (signing is root only).
#include <benchmark/benchmark.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <iostream>

#include "platform/CodeSigningRegistry.h"

namespace berth {
namespace {

struct Self {
    pid_t pid = ::getpid();
    UniqueFd pidfd{static_cast<int>(::syscall(SYS_pidfd_open, ::getpid(), 0))};
};

CodeSigningRegistry::Options withCache(size_t capacity) {
    CodeSigningRegistry::Options options;
    options.digestCacheCapacity = capacity;
    options.racyWindow = std::chrono::nanoseconds(0);
    return options;
}

void identifyLoop(benchmark::State& state, CodeSigningRegistry& registry) {
    Self self;
    std::string why;
    for (auto _ : state) {
        std::optional<PeerIdentity> identity = registry.identify(self.pid, self.pidfd.get(), &why);
        if (!identity) {
            state.SkipWithError(why.c_str());
            break;
        }
        benchmark::DoNotOptimize(identity);
    }
    state.counters["hashes"] = static_cast<double>(registry.digestComputations());
}

void BM_IdentifyWarmDigestCache(benchmark::State& state) {
    CodeSigningRegistry registry(withCache(512));
    identifyLoop(state, registry);
}
BENCHMARK(BM_IdentifyWarmDigestCache);

void BM_IdentifyColdDigestCache(benchmark::State& state) {
    CodeSigningRegistry registry(withCache(0));
    identifyLoop(state, registry);
}
BENCHMARK(BM_IdentifyColdDigestCache);

void BM_ExecutableOf(benchmark::State& state) {
    CodeSigningRegistry registry;
    Self self;
    for (auto _ : state)
        benchmark::DoNotOptimize(registry.executableOf(self.pid, self.pidfd.get()));
}
BENCHMARK(BM_ExecutableOf);

}  // namespace
}  // namespace berth

int main(int argc, char** argv) {
    if (::geteuid() != 0) {
        std::cerr << "code_signing_bench needs root (signing is root only)\n";
        return 0;
    }
    char root[] = "/tmp/berth-signing-bench.XXXXXX";
    if (!::mkdtemp(root)) return 1;
    ::setenv("BERTH_ROOT", root, 1);
    int status = 0;
    {
        std::string why;
        berth::CodeSigningRegistry registry;
        if (registry.sign(std::filesystem::read_symlink("/proc/self/exe"), "sys.kelp.bench.self",
                          berth::Value::dictionary(), &why) != 0) {
            std::cerr << "cannot sign the benchmark: " << why << "\n";
            status = 1;
        } else {
            benchmark::Initialize(&argc, argv);
            benchmark::RunSpecifiedBenchmarks();
            benchmark::Shutdown();
        }
    }
    std::error_code ignored;
    std::filesystem::remove_all(root, ignored);
    return status;
}
