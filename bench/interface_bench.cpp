// Cost of typed messages between a host and its plug-in. applyInterfaceSpec is measured per entry of a spec string
// (strings of 1, 10 and 100 entries, each naming a class set of two). The typed round trip (a "greet" call checked on
// both sides, served by TypedConnection) is measured against its in-run reference: the same call dictionary echoed as a
// raw Zem frame over the same kind of socket pair, with nothing checked. Compare the two within one run:
//
//   interface_bench --benchmark_repetitions=3 --benchmark_report_aggregates_only=true

#include <benchmark/benchmark.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <string>
#include <thread>

#include "bexil/TypedConnection.h"
#include "client/TypedMessage.h"
#include "platform/zem/ZemFrame.h"
#include "platform/zem/ZemFrameReader.h"

namespace {

using namespace bexil;

const std::shared_ptr<const BXProtocol>& benchProtocol() {
    static std::shared_ptr<const BXProtocol> protocol = [] {
        auto builder = BXProtocolRegistry::shared().createProtocol("BenchGreeting");
        builder->addMethod("greet", {"{BXString}"}, {"{BXString}", "{BXInteger}"});
        return *builder->registerProtocol();
    }();
    return protocol;
}

void BM_ApplyInterfaceSpecPerEntry(benchmark::State& state) {
    const auto entries = static_cast<size_t>(state.range(0));
    std::string spec;
    for (size_t i = 0; i < entries; ++i) spec += (i ? "," : "") + std::string("request:0:{BXString+BXData}");
    auto interface = BXInterface::interfaceWithProtocol(benchProtocol());
    for (auto _ : state) benchmark::DoNotOptimize(applyInterfaceSpec(*interface, "greet", spec));
    state.SetItemsProcessed(static_cast<int64_t>(state.iterations() * entries));
}
BENCHMARK(BM_ApplyInterfaceSpecPerEntry)->Arg(1)->Arg(10)->Arg(100);

std::array<int, 2> socketPair() {
    std::array<int, 2> ends{};
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends.data()) != 0) std::abort();
    return ends;
}

bool writeAll(int fd, const std::vector<uint8_t>& bytes) {
    size_t done = 0;
    while (done < bytes.size()) {
        ssize_t n = write(fd, bytes.data() + done, bytes.size() - done);
        if (n <= 0) return false;
        done += static_cast<size_t>(n);
    }
    return true;
}

std::optional<ZemFrame> readFrame(int fd, ZemFrameReader& reader) {
    uint8_t buffer[4096];
    for (;;) {
        if (auto frame = reader.next()) return frame;
        ssize_t n = read(fd, buffer, sizeof buffer);
        if (n <= 0 || reader.feed(std::span<const uint8_t>(buffer, static_cast<size_t>(n)))) return std::nullopt;
    }
}

// The reference: a request frame out, the same payload back in a reply frame, decoded; no interface anywhere.
void BM_RawFrameEcho(benchmark::State& state) {
    auto [host, plugIn] = socketPair();
    std::thread echo([plugIn = plugIn] {
        ZemFrameReader reader;
        while (auto frame = readFrame(plugIn, reader)) {
            std::vector<uint8_t> out;
            auto payload = frame->decodePayload();
            if (!payload || ZemFrame::encode(ZemFrameKind::Reply, 0, frame->serial(), *payload, out)) break;
            if (!writeAll(plugIn, out)) break;
        }
        close(plugIn);
    });
    Value call = typed::callMessage("greet", Value::array({Value::string("world")}));
    ZemFrameReader reader;
    uint64_t serial = 0;
    for (auto _ : state) {
        std::vector<uint8_t> out;
        ZemFrame::encode(ZemFrameKind::Request, ++serial, 0, call, out);
        writeAll(host, out);
        auto reply = readFrame(host, reader);
        benchmark::DoNotOptimize(reply->decodePayload());
    }
    close(host);
    echo.join();
}
BENCHMARK(BM_RawFrameEcho)->UseRealTime();

void BM_TypedRoundTrip(benchmark::State& state) {
    auto [host, plugIn] = socketPair();
    TypedConnection server(plugIn, BXInterface::interfaceWithProtocol(benchProtocol()));
    std::thread serving([&server] {
        server.serve([](std::string_view, const Value& arguments) -> Result<Value> {
            return Value::array({arguments.items()[0], Value::int64(1)});
        });
    });
    {
        TypedConnection client(host, BXInterface::interfaceWithProtocol(benchProtocol()));
        Value arguments = Value::array({Value::string("world")});
        for (auto _ : state) benchmark::DoNotOptimize(client.call("greet", arguments));
    }
    serving.join();
}
BENCHMARK(BM_TypedRoundTrip)->UseRealTime();

}  // namespace

BENCHMARK_MAIN();
