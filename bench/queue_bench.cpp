// What a hop through a SerialQueue costs, against a direct call, and what a ping between two queues costs on the
// daemon's default single-thread loop and on a two-thread loop (where every hop may wake another CPU).
// The "per_hop" counters are seconds per hop (shown with an SI prefix, so "150n" is 150 ns).

#include <benchmark/benchmark.h>

#include <atomic>
#include <functional>
#include <future>
#include <memory>

#include "base/EventLoop.h"
#include "base/SerialQueue.h"

using namespace bexil;

namespace {

constexpr int kBatch = 1000;

benchmark::Counter perHop(double hops) {
    return benchmark::Counter(hops, benchmark::Counter::kIsRate | benchmark::Counter::kInvert);
}

void BM_DirectCall(benchmark::State& state) {
    long counter = 0;
    std::function<void()> block = [&] { ++counter; };
    for (auto _ : state) {
        for (int i = 0; i < kBatch; ++i) {
            block();
            benchmark::DoNotOptimize(counter);
        }
    }
    state.counters["per_hop"] = perHop(static_cast<double>(state.iterations()) * kBatch);
}
BENCHMARK(BM_DirectCall);

// kBatch blocks submitted from outside the loop, then one wait: the cost of async() plus running the block.
void BM_AsyncHop(benchmark::State& state) {
    EventLoop loop(1);
    SerialQueue queue("bench", loop);
    long counter = 0;  // only on the queue
    for (auto _ : state) {
        std::promise<void> done;
        for (int i = 0; i < kBatch - 1; ++i) queue.async([&] { ++counter; });
        queue.async([&] {
            ++counter;
            done.set_value();
        });
        done.get_future().wait();
    }
    benchmark::DoNotOptimize(counter);
    state.counters["per_hop"] = perHop(static_cast<double>(state.iterations()) * kBatch);
}
BENCHMARK(BM_AsyncHop)->UseRealTime();

// One sync() at a time from outside the loop: a full round trip including two thread wake-ups.
void BM_SyncRoundTrip(benchmark::State& state) {
    EventLoop loop(1);
    SerialQueue queue("bench", loop);
    long counter = 0;
    for (auto _ : state) queue.sync([&] { ++counter; });
    benchmark::DoNotOptimize(counter);
    state.counters["per_hop"] = perHop(static_cast<double>(state.iterations()));
}
BENCHMARK(BM_SyncRoundTrip)->UseRealTime();

// A block on `a` submits to `b`, which submits back to `a`, kBatch times: two hops per ping.
void pingPong(benchmark::State& state, unsigned threads) {
    EventLoop loop(threads);
    SerialQueue a("ping", loop);
    SerialQueue b("pong", loop);
    struct Rally {
        SerialQueue a, b;
        int left = 0;
        std::promise<void> done;
        void ping() {
            if (left-- == 0) {
                done.set_value();
                return;
            }
            b.async([this] { a.async([this] { ping(); }); });
        }
    };
    for (auto _ : state) {
        Rally rally{a, b, kBatch, {}};
        auto finished = rally.done.get_future();
        a.async([&] { rally.ping(); });
        finished.wait();
    }
    state.counters["per_hop"] = perHop(static_cast<double>(state.iterations()) * kBatch * 2);
}

void BM_PingPongOneThread(benchmark::State& state) { pingPong(state, 1); }
BENCHMARK(BM_PingPongOneThread)->UseRealTime();

void BM_PingPongTwoThreads(benchmark::State& state) { pingPong(state, 2); }
BENCHMARK(BM_PingPongTwoThreads)->UseRealTime();

}  // namespace

BENCHMARK_MAIN();
