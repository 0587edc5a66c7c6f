// What a client that never reads its replies costs the others. A private bxd; a measuring client sends trivial
// requests ("bulk", answered at once) one at a time over hand-written frames and records each round trip, first
// with nobody else connected, then while another process pipelines requests into bxd and never reads a reply
// (bxd stops reading it once 1 MiB of its replies waits, and drops it after the stall time).
//
// Prints p50 and p99 of both phases in microseconds and the ratios lazy/idle; the target is a p99 ratio of at most 2.
// Usage: lazy_client_bench [--requests N] [--lazy-requests N]. Pin with `taskset -c 0` for the CPU cost alone.

#include <getopt.h>
#include <signal.h>
#include <sys/wait.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <thread>

#include "BxdBench.h"
#include "bexil/Value.h"
#include "platform/zem/ZemFrame.h"

namespace fs = std::filesystem;
using namespace bexil;
using bench::die;

namespace {

std::vector<uint8_t> requestFrame(uint64_t serial) {
    std::vector<uint8_t> frame;
    if (ZemFrame::encode(ZemFrameKind::Request, serial, 0,
                         Value::dictionary({{"request", Value::string("bulk")}, {"version", Value::uint64(3)}}), frame))
        die("encoding a request");
    return frame;
}

// One round trip over `fd`: the request out, the whole reply frame back.
void roundTrip(int fd, const std::vector<uint8_t>& frame) {
    bench::writeAll(fd, frame.data(), frame.size());
    uint8_t header[ZemFrame::kHeaderBytes];
    bench::readExactly(fd, header, sizeof header);
    Result<ZemFrameHeader> decoded = ZemFrame::decodeHeader(std::span<const uint8_t, ZemFrame::kHeaderBytes>(header));
    if (!decoded) die("a reply with a bad header");
    std::vector<uint8_t> payload(decoded->payloadLength);
    bench::readExactly(fd, payload.data(), payload.size());
}

bench::Percentiles measure(int fd, int requests) {
    std::vector<uint8_t> frame = requestFrame(1);
    std::vector<double> micros;
    micros.reserve(static_cast<size_t>(requests));
    for (int i = 0; i < requests; ++i) {
        auto start = std::chrono::steady_clock::now();
        roundTrip(fd, frame);
        micros.push_back(std::chrono::duration<double, std::micro>(std::chrono::steady_clock::now() - start).count());
    }
    return bench::percentilesOf(micros);
}

}  // namespace

int main(int argc, char** argv) {
    bench::programName = "lazy_client_bench";
    int requests = 20000, lazyRequests = 200000;
    static option longOptions[] = {{"requests", required_argument, nullptr, 'r'},
                                   {"lazy-requests", required_argument, nullptr, 'l'},
                                   {nullptr, 0, nullptr, 0}};
    for (int c; (c = getopt_long(argc, argv, "", longOptions, nullptr)) != -1;) {
        auto value = bench::parsePositive(optarg ? optarg : "", 10000000);
        if (!value) {
            fprintf(stderr, "usage: lazy_client_bench [--requests N] [--lazy-requests N]\n");
            return 64;
        }
        (c == 'r' ? requests : lazyRequests) = static_cast<int>(*value);
    }

    const fs::path root = bench::makePrivateBxdRoot("lazy-client-bench");
    pid_t bxd = bench::startPrivateBxd(root);
    const std::string socket = (root / "service" / bench::kBxdServiceName).string();
    int fd = -1;
    for (int i = 0; i < 500 && (fd = bench::connectTo(socket)) < 0; ++i)
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    if (fd < 0) die("bxd did not come up");

    measure(fd, 1000);  // warm up
    bench::Percentiles idle = measure(fd, requests);

    // The lazy client: writes its requests as fast as bxd takes them and never reads.
    pid_t lazy = fork();
    if (lazy == 0) {
        int own = bench::connectTo(socket);
        if (own < 0) _exit(1);
        std::vector<uint8_t> burst;
        for (int i = 1; i <= lazyRequests; ++i) {
            std::vector<uint8_t> one = requestFrame(static_cast<uint64_t>(i));
            burst.insert(burst.end(), one.begin(), one.end());
        }
        (void)!send(own, burst.data(), burst.size(), MSG_NOSIGNAL);
        pause();
        _exit(0);
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(200));  // let it fill bxd's queue for it
    bench::Percentiles loaded = measure(fd, requests);
    kill(lazy, SIGKILL);
    waitpid(lazy, nullptr, 0);

    printf("%-24s %10s %10s\n", "measuring client", "p50 us", "p99 us");
    printf("%-24s %10.1f %10.1f\n", "alone", idle.p50, idle.p99);
    printf("%-24s %10.1f %10.1f\n", "beside a lazy client", loaded.p50, loaded.p99);
    printf("%-24s %9.2fx %9.2fx\n", "lazy / alone", loaded.p50 / idle.p50, loaded.p99 / idle.p99);

    close(fd);
    kill(bxd, SIGTERM);
    waitpid(bxd, nullptr, 0);
    std::error_code ignored;
    fs::remove_all(root, ignored);
    return 0;
}
