// Throughput of the work queues: asynchronous submission drained by the pool,
// synchronous round trips, and the main run loop draining its queue.
#include <benchmark/benchmark.h>

#include <atomic>
#include <latch>

#include "platform/RunLoop.h"
#include "platform/WorkQueue.h"

namespace berth {
namespace {

// Submits range(0) items and waits until all have run.
void BM_AsyncSerial(benchmark::State& state) {
    auto queue = WorkQueue::makeSerial("bench.serial");
    const int64_t items = state.range(0);
    int64_t ran = 0;  // touched only on the queue
    for (auto _ : state) {
        for (int64_t i = 0; i < items; ++i) queue->async([&ran] { ++ran; });
        queue->sync([] {});
    }
    benchmark::DoNotOptimize(ran);
    state.SetItemsProcessed(state.iterations() * items);
}
BENCHMARK(BM_AsyncSerial)->Arg(1000)->UseRealTime();

void BM_AsyncConcurrent(benchmark::State& state) {
    auto queue = WorkQueue::makeConcurrent("bench.concurrent");
    const int64_t items = state.range(0);
    for (auto _ : state) {
        std::latch done(items);
        for (int64_t i = 0; i < items; ++i) queue->async([&done] { done.count_down(); });
        done.wait();
    }
    state.SetItemsProcessed(state.iterations() * items);
}
BENCHMARK(BM_AsyncConcurrent)->Arg(1000)->UseRealTime();

// Several threads feeding one serial queue, as peers feeding a shared queue.
void BM_AsyncSerialManySubmitters(benchmark::State& state) {
    static std::shared_ptr<WorkQueue> queue;
    if (state.thread_index() == 0) queue = WorkQueue::makeSerial("bench.serial.shared");
    constexpr int kItems = 1000;
    std::atomic<int64_t> ran{0};
    for (auto _ : state) {
        for (int i = 0; i < kItems; ++i) queue->async([&ran] { ran.fetch_add(1); });
        queue->sync([] {});
    }
    state.SetItemsProcessed(state.iterations() * kItems);
}
BENCHMARK(BM_AsyncSerialManySubmitters)->Threads(1)->Threads(4)->UseRealTime();

void BM_SyncSerial(benchmark::State& state) {
    auto queue = WorkQueue::makeSerial("bench.sync.serial");
    int value = 0;
    for (auto _ : state) benchmark::DoNotOptimize(queue->sync([&value] { return ++value; }));
    state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_SyncSerial)->UseRealTime();

void BM_SyncConcurrent(benchmark::State& state) {
    auto queue = WorkQueue::makeConcurrent("bench.sync.concurrent");
    for (auto _ : state) benchmark::DoNotOptimize(queue->sync([] { return 1; }));
    state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_SyncConcurrent)->UseRealTime();

// A serial queue behind a serial target (the code-signing queue pattern on a
// shared queue): the cost of the extra hop.
void BM_SyncSerialThroughTarget(benchmark::State& state) {
    auto target = WorkQueue::makeSerial("bench.target");
    auto queue = WorkQueue::makeSerial("bench.targeted");
    queue->setTarget(target);
    for (auto _ : state) benchmark::DoNotOptimize(queue->sync([] { return 1; }));
    state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_SyncSerialThroughTarget)->UseRealTime();

// The run loop draining range(0) items submitted before it runs.
void BM_RunLoopDrain(benchmark::State& state) {
    RunLoop loop("bench.runloop");
    const int64_t items = state.range(0);
    int64_t ran = 0;
    for (auto _ : state) {
        for (int64_t i = 0; i < items; ++i) loop.queue()->async([&ran] { ++ran; });
        loop.queue()->async([&loop] { loop.stop(); });
        loop.run();
    }
    benchmark::DoNotOptimize(ran);
    state.SetItemsProcessed(state.iterations() * items);
}
BENCHMARK(BM_RunLoopDrain)->Arg(1000)->UseRealTime();

}  // namespace
}  // namespace berth

BENCHMARK_MAIN();
