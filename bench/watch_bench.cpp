// Standing queries through the real bxd: what one annotation change costs when 100 watchers are connected, and how
// that cost grows with the watchers the change affects and with the size of the registry.
//
// The registry holds N plug-ins (one identifier each) over 100 extension points. 100 watchers connect, each with its
// own connection and a watch of one extension point: A of them watch point 0, the others one point each of 1..99
// (so a change of a plug-in of point 0 affects exactly A watchers). Then R annotation changes of one plug-in of point
// 0 are made one after the other; for each, the time from sending "annotate" until every affected watcher has read
// its message, and bxd's CPU time (all its threads, from /proc) over the R changes, per change. The same R changes
// are also made with no watcher at all, for the cost of the annotation itself.
//
// It runs every (N, A) of --sizes (default 10000,100000) and --affected (default 10,100). A cost proportional to the
// affected watchers shows as the CPU per change growing with A and staying flat with N.
//
// Registries are built once under --cache (default <tmp>/bexil-watch-bench-cache) and copied for each run.

#include <getopt.h>
#include <poll.h>
#include <sys/wait.h>

#include <chrono>
#include <fstream>
#include <sstream>
#include <thread>

#include "BxdBench.h"
#include "LargeRegistry.h"
#include "base/Document.h"
#include "bexil/Value.h"
#include "platform/zem/ZemCodec.h"
#include "platform/zem/ZemFrame.h"

namespace {

namespace fs = std::filesystem;
using namespace bexil;
using bench::die;
using Clock = std::chrono::steady_clock;

constexpr int kPoints = 100;
constexpr int kWatchers = 100;

// One raw connection that speaks frames.
struct Connection {
    int fd = -1;
    uint64_t serial = 0;
    std::vector<uint8_t> buffer;

    void send(const Value& body, ZemFrameKind kind = ZemFrameKind::Request) {
        std::vector<uint8_t> frame;
        if (ZemFrame::encode(kind, ++serial, 0, body, frame)) die("encoding a frame");
        bench::writeAll(fd, frame.data(), frame.size());
    }
    // The next frame's kind and body.
    std::pair<ZemFrameKind, Value> next() {
        uint8_t header[ZemFrame::kHeaderBytes];
        bench::readExactly(fd, header, sizeof header);
        Result<ZemFrameHeader> decoded =
            ZemFrame::decodeHeader(std::span<const uint8_t, ZemFrame::kHeaderBytes>(header, sizeof header));
        if (!decoded) die("a bad frame header");
        buffer.resize(decoded->payloadLength);
        bench::readExactly(fd, buffer.data(), buffer.size());
        Result<Value> body = ZemCodec::decode(std::span<const uint8_t>(buffer.data(), buffer.size()));
        if (!body) die("a bad frame");
        return {decoded->kind, *body};
    }
    Value roundTrip(const Value& body) {
        send(body);
        for (;;) {
            auto [kind, value] = next();
            if (kind != ZemFrameKind::Reply) continue;
            if (value.find("errorcode")) {
                fprintf(stderr, "watch_bench: %s\n", value.description().c_str());
                exit(1);
            }
            return value;
        }
    }
};

Value request(std::string_view name, std::vector<std::pair<std::string, Value>> fields) {
    fields.emplace_back("request", Value::string(name));
    fields.emplace_back("version", Value::uint64(3));
    return Value::dictionary(std::move(fields));
}

// bxd's CPU time so far, every thread, in microseconds (schedstat: nanoseconds on the CPU).
double cpuUs(pid_t pid) {
    double total = 0;
    for (const auto& task : fs::directory_iterator("/proc/" + std::to_string(pid) + "/task")) {
        std::ifstream in(task.path() / "schedstat");
        unsigned long long ns = 0;
        if (in >> ns) total += static_cast<double>(ns) / 1000.0;
    }
    return total;
}

fs::path prepare(const fs::path& cache, int count) {
    fs::path dir = cache / std::to_string(count);
    if (fs::exists(dir / "ready")) return dir;
    std::error_code ignored;
    fs::remove_all(dir, ignored);
    fs::create_directories(dir / "bundles");
    fs::create_directories(dir / "state");
    fprintf(stderr, "building a registry of %d plug-ins in %s ...\n", count, dir.c_str());
    bench::LargeRegistry built = bench::LargeRegistry::build(dir / "bundles", dir / "state", count, kPoints, false);
    fprintf(stderr, "built in %.1f s\n", built.writeSeconds + built.registerSeconds);
    std::ofstream(dir / "ready") << "ok\n";
    return dir;
}

struct Figures {
    double latencyP50Us = 0, latencyMaxUs = 0, cpuPerChangeUs = 0;
};

Figures measure(pid_t bxd, Connection& control, std::vector<Connection>& affected, const Uuid& plugIn, int changes,
                int& counter) {
    Figures figures;
    std::vector<double> latencies;
    double cpuBefore = cpuUs(bxd);
    for (int i = 0; i < changes; ++i) {
        Value annotation = Value::dictionary({{"extension", Value::dictionary({{"n", Value::int64(++counter)}})}});
        Clock::time_point sent = Clock::now();
        control.roundTrip(
            request("annotate", {{"uuids", Value::array({Value::uuid(plugIn)})}, {"annotations", annotation}}));
        for (Connection& watcher : affected) {
            auto [kind, message] = watcher.next();
            if (kind != ZemFrameKind::Message || message.get("changed").count() != 1) die("an unexpected message");
        }
        latencies.push_back(std::chrono::duration<double, std::micro>(Clock::now() - sent).count());
    }
    figures.cpuPerChangeUs = (cpuUs(bxd) - cpuBefore) / changes;
    bench::Percentiles p = bench::percentilesOf(latencies);
    figures.latencyP50Us = p.p50;
    figures.latencyMaxUs = latencies.back();
    return figures;
}

void run(const fs::path& cache, const std::string& bxdPath, int count, const std::vector<int>& affectedCounts,
         int changes) {
    fs::path registry = prepare(cache, count);
    printf("== %d plug-ins, %d watchers over %d points (%d forms each)\n", count, kWatchers, kPoints, count / kPoints);
    for (int affectedCount : affectedCounts) {
        fs::path root = bench::makePrivateBxdRoot("bexil-watch-run");
        fs::remove_all(root / "state");
        fs::create_directories(root / "state");
        fs::copy(registry / "state", root / "state", fs::copy_options::recursive);
        pid_t bxd = fork();
        if (bxd < 0) die("fork");
        if (bxd == 0) {
            bench::enterPrivateBxdEnvironment(root);
            setenv("BXD_LOG_LEVEL", "error", 1);
            execl(bxdPath.c_str(), bxdPath.c_str(), "-d", (root / "annotations").c_str(), nullptr);
            _exit(127);
        }
        const std::string socket = (root / "service" / bench::kBxdServiceName).string();
        Connection control;
        for (Clock::time_point deadline = Clock::now() + std::chrono::seconds(30); control.fd < 0;) {
            if (Clock::now() > deadline || waitpid(bxd, nullptr, WNOHANG) != 0) die("bxd did not come up");
            control.fd = bench::connectTo(socket);
            if (control.fd < 0) std::this_thread::sleep_for(std::chrono::milliseconds(20));
        }
        // A plug-in of point 0: the first one registered.
        Value point0 = Value::dictionary(
            {{"RZExtensionPointIdentifier", Value::string(bench::LargeRegistry::pointIdentifier(0))}});
        Value found = control.roundTrip(request("match", {{"rules", point0}, {"pagesize", Value::uint64(1)}}));
        std::optional<Uuid> plugIn = Uuid::parse(found.get("matches").items()[0].get("uuid").stringView());
        if (!plugIn) die("no plug-in on point 0");

        int counter = 0;
        std::vector<Connection> nobody;
        Figures alone = measure(bxd, control, nobody, *plugIn, changes, counter);

        std::vector<Connection> watchers(kWatchers);
        Clock::time_point started = Clock::now();
        for (int w = 0; w < kWatchers; ++w) {
            watchers[w].fd = bench::connectTo(socket);
            if (watchers[w].fd < 0) die("connect");
            int point = w < affectedCount ? 0 : w - affectedCount + 1;
            Value rules = Value::dictionary(
                {{"RZExtensionPointIdentifier", Value::string(bench::LargeRegistry::pointIdentifier(point))}});
            watchers[w].roundTrip(request("watch", {{"rules", rules}}));
        }
        double startSeconds = std::chrono::duration<double>(Clock::now() - started).count();
        std::vector<Connection> affected(watchers.begin(), watchers.begin() + affectedCount);
        Figures watched = measure(bxd, control, affected, *plugIn, changes, counter);
        printf(
            "  %3d affected: change seen by all p50 %8.0f us (max %8.0f); bxd CPU per change %8.0f us; without "
            "watchers %6.0f us (p50 %6.0f us); 100 watches started in %.2f s\n",
            affectedCount, watched.latencyP50Us, watched.latencyMaxUs, watched.cpuPerChangeUs, alone.cpuPerChangeUs,
            alone.latencyP50Us, startSeconds);
        fflush(stdout);
        for (Connection& watcher : watchers) close(watcher.fd);
        close(control.fd);
        kill(bxd, SIGTERM);
        waitpid(bxd, nullptr, 0);
        std::error_code ignored;
        fs::remove_all(root, ignored);
    }
}

}  // namespace

int main(int argc, char** argv) {
    bench::programName = "watch_bench";
    fs::path cache = fs::temp_directory_path() / "bexil-watch-bench-cache";
    std::string bxdPath = bench::defaultBxdPath();
    std::vector<int> sizes{10000, 100000};
    std::vector<int> affected{10, 100};
    int changes = 30;
    const option long_options[] = {
        {"cache", required_argument, nullptr, 'C'},   {"bxd", required_argument, nullptr, 'b'},
        {"sizes", required_argument, nullptr, 's'},   {"affected", required_argument, nullptr, 'a'},
        {"changes", required_argument, nullptr, 'n'}, {nullptr, 0, nullptr, 0}};
    auto numbers = [](const char* text, unsigned long max) {
        std::vector<int> list;
        for (const std::string& item : bench::splitList(text)) {
            std::optional<unsigned long> value = bench::parsePositive(item.c_str(), max);
            if (!value) {
                fprintf(stderr, "watch_bench: not a number from 1 to %lu: %s\n", max, item.c_str());
                exit(2);
            }
            list.push_back(static_cast<int>(*value));
        }
        return list;
    };
    for (int c; (c = getopt_long(argc, argv, "", long_options, nullptr)) != -1;) {
        switch (c) {
            case 'C':
                cache = optarg;
                break;
            case 'b':
                bxdPath = optarg;
                break;
            case 's':
                sizes = numbers(optarg, 1000000);
                break;
            case 'a':
                affected = numbers(optarg, kWatchers);
                break;
            case 'n':
                changes = numbers(optarg, 10000).front();
                break;
            default:
                fprintf(stderr,
                        "usage: watch_bench [--sizes N,...] [--affected A,...] [--changes R] [--cache DIR] [--bxd "
                        "PATH]\n");
                return 2;
        }
    }
    signal(SIGPIPE, SIG_IGN);
    for (int count : sizes) run(cache, bxdPath, count, affected, changes);
    return 0;
}
