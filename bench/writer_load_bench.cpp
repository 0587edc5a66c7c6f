// One client's point match through the real bxd while another client writes, against the same client alone, in one
// run: p50 and p99 of the point match idle, beside a client that registers bundles one request at a time, and beside
// a client that changes an annotation in a loop. Registrations and annotation saves wait for the disk; they run on
// the daemon's writer thread, so the point match should stay near its idle figure (the ratios printed).
//
//     cmake --build --preset release --target bxd writer_load_bench
//     build/release/bench/writer_load_bench [--bundles N] [--requests M] [--bxd PATH]
//
// The daemon runs in a private directory under the temporary directory (so its syncs reach the same disk as in
// use), with 20 plug-ins on the matched extension point and N (default 1,000) more bundles to register.

#include <getopt.h>
#include <sys/wait.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <filesystem>
#include <future>
#include <memory>
#include <string>
#include <thread>
#include <variant>
#include <vector>

#include "BxdBench.h"
#include "base/Document.h"
#include "base/EventLoop.h"
#include "base/SerialQueue.h"
#include "bexil/Value.h"
#include "platform/zem/ZemConnection.h"

namespace {

namespace fs = std::filesystem;
using namespace bexil;
using namespace bexil::bench;
using Clock = std::chrono::steady_clock;

constexpr int kOnThePoint = 20;
constexpr const char* kPoint = "com.example.bench.matched";
constexpr const char* kOtherPoint = "com.example.bench.written";

// A blocking client over the daemon's own transport: its own loop and queue, one request at a time.
class Client {
  public:
    Client()
        : loop_(1), queue_("bench-client", loop_), connection_(ZemConnection::createClient(kBxdServiceName, queue_)) {
        connection_->setEventHandler([](const ZemConnection::Event&) {});
        connection_->resume();
    }
    ~Client() { connection_->cancel(); }

    Value roundTrip(const Value& message) {
        auto promise = std::make_shared<std::promise<Value>>();
        std::future<Value> future = promise->get_future();
        connection_->sendWithReply(message, queue_, [promise](const std::variant<Value, ZemError>& reply) {
            promise->set_value(std::holds_alternative<Value>(reply) ? std::get<Value>(reply) : Value());
        });
        if (future.wait_for(std::chrono::seconds(30)) != std::future_status::ready) die("no reply within 30 s");
        Value reply = future.get();
        if (!reply.isDictionary()) die("connection lost");
        if (reply.contains("errorcode")) {
            fprintf(stderr, "writer_load_bench: request failed: %s\n", reply.description().c_str());
            exit(1);
        }
        return reply;
    }

  private:
    EventLoop loop_;
    SerialQueue queue_;
    std::shared_ptr<ZemConnection> connection_;
};

Value request(std::string_view name, std::vector<std::pair<std::string, Value>> fields) {
    fields.emplace_back("request", Value::string(name));
    fields.emplace_back("version", Value::uint64(3));
    return Value::dictionary(std::move(fields));
}

std::string writeBundle(const fs::path& directory, const std::string& identifier, const char* point) {
    fs::path bundle = directory / (identifier + ".bxplugin");
    fs::create_directories(bundle);
    Value info = Value::dictionary(
        {{"BDBundleIdentifier", Value::string(identifier)},
         {"BDBundleVersion", Value::string("1")},
         {"RZExtension", Value::dictionary({{"PrincipalClass", Value::string("Bench")},
                                            {"RZExtensionPointIdentifier", Value::string(point)},
                                            {"RZExtensionProtocol", Value::string("Benching")},
                                            {"RZExtensionAttributes",
                                             Value::dictionary({{"RZExtensionVersion", Value::string("1")}})}})}});
    if (Document::writeFileAtomically(bundle / "Info.vrec", info)) die("cannot write a bundle");
    return bundle.string();
}

Value pathsRequest(const std::string& name, const std::vector<std::string>& paths) {
    std::vector<Value> values;
    for (const std::string& path : paths) values.push_back(Value::string(path));
    return request(name, {{"paths", Value::array(std::move(values))}});
}

// Point matches on `client` until `stop` is set (at least `minimum` of them); their round trips in microseconds.
std::vector<double> pointMatches(Client& client, const std::atomic<bool>& stop, size_t minimum) {
    const Value match =
        request("match", {{"rules", Value::dictionary({{"RZExtensionPointIdentifier", Value::string(kPoint)}})}});
    std::vector<double> times;
    while (times.size() < minimum || !stop.load()) {
        Clock::time_point start = Clock::now();
        Value reply = client.roundTrip(match);
        times.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
        if (reply.get("matches").count() != kOnThePoint) die("the point match lost plug-ins");
    }
    return times;
}

void print(const char* what, std::vector<double> times, const Percentiles& idle, size_t writes, double seconds) {
    Percentiles p = percentilesOf(times);
    printf("%-22s %6zu matches  p50 %7.1f us  p99 %7.1f us  p99/idle %5.2fx", what, times.size(), p.p50, p.p99,
           p.p99 / idle.p99);
    if (writes > 0) printf("  (%zu writes, %.2f ms each)", writes, seconds * 1e3 / static_cast<double>(writes));
    printf("\n");
}

}  // namespace

int main(int argc, char** argv) {
    programName = "writer_load_bench";
    unsigned long bundles = 1000, requests = 2000;
    std::string bxdPath = defaultBxdPath();
    const option longOptions[] = {{"bundles", required_argument, nullptr, 'b'},
                                  {"requests", required_argument, nullptr, 'r'},
                                  {"bxd", required_argument, nullptr, 'x'},
                                  {nullptr, 0, nullptr, 0}};
    for (int c; (c = getopt_long(argc, argv, "", longOptions, nullptr)) != -1;) {
        std::optional<unsigned long> value;
        if (c == 'b' && (value = parsePositive(optarg, 100000))) {
            bundles = *value;
        } else if (c == 'r' && (value = parsePositive(optarg, 1000000))) {
            requests = *value;
        } else if (c == 'x') {
            bxdPath = optarg;
        } else {
            fputs("Usage: writer_load_bench [--bundles N] [--requests M] [--bxd PATH]\n", stderr);
            return 2;
        }
    }

    const fs::path root = makePrivateBxdRoot("bexil-writer-bench");
    // Plug-ins outside an application are discovered only on the system volume.
    const fs::path matched = root / "bundles" / "Matched.app" / "PlugIns",
                   written = root / "bundles" / "Written.app" / "PlugIns";
    for (const fs::path& plugIns : {matched, written}) {
        fs::create_directories(plugIns);
        Value info = Value::dictionary({{"BDBundleIdentifier", Value::string("com.example.bench.app")}});
        if (Document::writeFileAtomically(plugIns.parent_path() / "Info.vrec", info)) die("cannot write an app");
    }
    std::vector<std::string> pointPaths, writtenPaths;
    for (int i = 0; i < kOnThePoint; ++i)
        pointPaths.push_back(writeBundle(matched, "com.example.bench.m" + std::to_string(i), kPoint));
    for (unsigned long i = 0; i < bundles; ++i)
        writtenPaths.push_back(writeBundle(written, "com.example.bench.w" + std::to_string(i), kOtherPoint));

    setenv("BX_SERVICE_DIR", (root / "service").c_str(), 1);
    setenv("BXD_LOG_LEVEL", "error", 1);
    pid_t bxd = startPrivateBxd(root, bxdPath);
    std::string socketPath = (root / "service" / kBxdServiceName).string();
    for (Clock::time_point deadline = Clock::now() + std::chrono::seconds(30);;) {
        int fd = connectTo(socketPath);
        if (fd >= 0) {
            close(fd);
            break;
        }
        if (Clock::now() > deadline || waitpid(bxd, nullptr, WNOHANG) != 0) die("bxd did not come up (see bxd.log)");
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }

    Client matcher, writer;
    writer.roundTrip(pathsRequest("add", pointPaths));
    std::atomic<bool> stop{true};
    pointMatches(matcher, stop, 200);  // builds the records and settles the caches

    std::vector<double> idleTimes = pointMatches(matcher, stop, requests);
    std::vector<double> copy = idleTimes;
    const Percentiles idle = percentilesOf(copy);
    printf("== point match (%d forms) beside one writing client, %lu bundles to register\n", kOnThePoint, bundles);
    print("idle", idleTimes, idle, 0, 0);

    // Beside registrations: one bundle per request, as an installer adding plug-ins one by one.
    stop = false;
    double addSeconds = 0;
    std::thread adder([&] {
        Clock::time_point start = Clock::now();
        for (const std::string& path : writtenPaths) writer.roundTrip(pathsRequest("add", {path}));
        addSeconds = std::chrono::duration<double>(Clock::now() - start).count();
        stop = true;
    });
    std::vector<double> addTimes = pointMatches(matcher, stop, 0);
    adder.join();
    print("beside registrations", addTimes, idle, writtenPaths.size(), addSeconds);

    // Beside annotations: the same number of elections, alternating, on the matched plug-ins.
    Value forms = matcher.roundTrip(
        request("match", {{"rules", Value::dictionary({{"RZExtensionPointIdentifier", Value::string(kPoint)}})}}));
    std::vector<Value> uuids;
    for (const Value& form : forms.get("matches").items())
        if (std::optional<Uuid> uuid = Uuid::parse(form.get("uuid").stringView())) uuids.push_back(Value::uuid(*uuid));
    stop = false;
    double annotateSeconds = 0;
    std::thread annotator([&] {
        Clock::time_point start = Clock::now();
        for (unsigned long i = 0; i < bundles; ++i) {
            writer.roundTrip(request(
                "annotate",
                {{"uuids", Value::array({uuids[i % uuids.size()]})},
                 {"annotations", Value::dictionary({{"election", Value::int64(1 + static_cast<int64_t>(i % 2))}})}}));
        }
        annotateSeconds = std::chrono::duration<double>(Clock::now() - start).count();
        stop = true;
    });
    std::vector<double> annotateTimes = pointMatches(matcher, stop, 0);
    annotator.join();
    print("beside annotations", annotateTimes, idle, bundles, annotateSeconds);

    kill(bxd, SIGTERM);
    waitpid(bxd, nullptr, 0);
    std::error_code ec;
    fs::remove_all(root, ec);
    return 0;
}
