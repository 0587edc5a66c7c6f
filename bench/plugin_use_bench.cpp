// Using plug-ins through the real bxd: holds, readiness and launching, each against the cheapest real request in
// the same run. A private bxd gets Greeter.app (its Hello plug-in with the real example executable) and Many.app,
// an application of 100 plug-ins; one client connection of this process does every request, through the same
// transport a host uses (a Zem connection with replies that may pass descriptors).
//
// Rows (p50 and p99 of the round trips, in microseconds, and the p50 as a multiple of the reference's):
//   reference     "ready" with an empty list: the envelope, the handler table and a reply, nothing else;
//   lock 100      a hold placed on Many.app (100 plug-ins) and released by its UUID: two round trips;
//   ready 1       "ready" for Hello: host policy, the service description and the grant;
//   ready 20      "ready" for 20 plug-ins of Many.app;
//   launch        "launch" of Hello until the first byte of its answer to one line: bubblewrap sets up the
//                 sandbox, the plug-in starts and answers over the socket the reply passed.
//
// Usage: plugin_use_bench [--rounds N] [--launches N]. Pin it with `taskset -c 0` to measure CPU cost alone.

#include <getopt.h>
#include <poll.h>
#include <sys/wait.h>

#include <algorithm>
#include <chrono>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <future>
#include <thread>
#include <variant>

#include "BxdBench.h"
#include "base/Document.h"
#include "base/EventLoop.h"
#include "base/SerialQueue.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/ledgerix/LedgerixWorkspace.h"
#include "platform/zem/ZemConnection.h"

namespace fs = std::filesystem;
using namespace bexil;
using bench::die;

namespace {

constexpr int kManyPlugIns = 100;

// One connection with blocking round trips.
class Host {
  public:
    Host()
        : loop_(1),
          queue_("bench-host", loop_),
          connection_(ZemConnection::createClient(bench::kBxdServiceName, queue_)) {
        connection_->setEventHandler([](const ZemConnection::Event&) {});
        connection_->resume();
    }
    ~Host() { connection_->cancel(); }
    ZemMessage roundTrip(const Value& request) {
        std::promise<std::variant<ZemMessage, ZemError>> promise;
        connection_->sendWithMessageReply(
            request, queue_, [&promise](const std::variant<ZemMessage, ZemError>& reply) { promise.set_value(reply); });
        auto reply = promise.get_future().get();
        if (!std::holds_alternative<ZemMessage>(reply)) die("connection to bxd failed");
        const ZemMessage& message = std::get<ZemMessage>(reply);
        if (message.body().contains("errorcode")) {
            fprintf(stderr, "plugin_use_bench: %s\n", message.body().description().c_str());
            exit(1);
        }
        return message;
    }

  private:
    EventLoop loop_;
    SerialQueue queue_;
    std::shared_ptr<ZemConnection> connection_;
};

Value request(std::string_view name, std::vector<std::pair<std::string, Value>> fields = {}) {
    fields.emplace_back("request", Value::string(name));
    fields.emplace_back("version", Value::uint64(3));
    return Value::dictionary(std::move(fields));
}

void writeInfo(const fs::path& bundle, const std::string& identifier, const char* executable) {
    std::vector<std::pair<std::string, Value>> info{
        {"BDBundleIdentifier", Value::string(identifier)},
        {"BDBundleVersion", Value::string("1")},
        {"RZExtension", Value::dictionary({{"PrincipalClass", Value::string("Bench")},
                                           {"RZExtensionPointIdentifier", Value::string("com.example.bench")},
                                           {"RZExtensionProtocol", Value::string("Benching")},
                                           {"RZExtensionAttributes",
                                            Value::dictionary({{"RZExtensionVersion", Value::string("1")}})}})}};
    if (executable) info.emplace_back("BDBundleExecutable", Value::string(executable));
    if (auto error = Document::writeFileAtomically(bundle / "Info.vrec", Value::dictionary(std::move(info))))
        die("writing Info.vrec");
}

bench::Percentiles measure(int rounds, const std::function<void()>& once) {
    std::vector<double> micros;
    micros.reserve(static_cast<size_t>(rounds));
    for (int i = 0; i < rounds; ++i) {
        auto start = std::chrono::steady_clock::now();
        once();
        micros.push_back(std::chrono::duration<double, std::micro>(std::chrono::steady_clock::now() - start).count());
    }
    return bench::percentilesOf(micros);
}

}  // namespace

int main(int argc, char** argv) {
    bench::programName = "plugin_use_bench";
    int rounds = 2000, launches = 50;
    static option longOptions[] = {{"rounds", required_argument, nullptr, 'r'},
                                   {"launches", required_argument, nullptr, 'l'},
                                   {nullptr, 0, nullptr, 0}};
    for (int c; (c = getopt_long(argc, argv, "", longOptions, nullptr)) != -1;) {
        auto value = bench::parsePositive(optarg ? optarg : "", 1000000);
        if (!value) {
            fprintf(stderr, "usage: plugin_use_bench [--rounds N] [--launches N]\n");
            return 64;
        }
        (c == 'r' ? rounds : launches) = static_cast<int>(*value);
    }

    const fs::path root = bench::makePrivateBxdRoot("plugin-use-bench");
    const fs::path self = fs::read_symlink("/proc/self/exe").parent_path();
    const fs::path helloPlugIn = (self / ".." / "examples/plugins/hello-plugin").lexically_normal();
    fs::copy(fs::path(BEXIL_SOURCE_DIR) / "examples/bundles/Greeter.app", root / "Greeter.app",
             fs::copy_options::recursive);
    const fs::path hello = root / "Greeter.app/PlugIns/Hello.bxplugin";
    fs::copy_file(helloPlugIn, hello / "hello", fs::copy_options::overwrite_existing);
    fs::create_directories(root / "Many.app/PlugIns");
    writeInfo(root / "Many.app", "com.example.many", nullptr);
    std::vector<std::string> paths{hello.string()};
    for (int i = 0; i < kManyPlugIns; ++i) {
        fs::path bundle = root / "Many.app/PlugIns" / ("P" + std::to_string(i) + ".bxplugin");
        fs::create_directories(bundle);
        writeInfo(bundle, "com.example.many.p" + std::to_string(i), "run");
        std::ofstream(bundle / "run") << "#!/bin/sh\n";
        paths.push_back(bundle.string());
    }

    pid_t bxd = bench::startPrivateBxd(root);
    for (int i = 0; i < 500 && !fs::exists(root / "service" / bench::kBxdServiceName); ++i)
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    setenv("BX_SERVICE_DIR", (root / "service").c_str(), 1);
    std::this_thread::sleep_for(std::chrono::milliseconds(100));

    {
        Host host;
        std::vector<Value> pathValues;
        for (const std::string& path : paths) pathValues.push_back(Value::string(path));
        host.roundTrip(request("add", {{"paths", Value::array(std::move(pathValues))}}));

        LedgerixWorkspace::Options options;
        options.stateDirectory = root / "state";
        auto registry = LedgerixWorkspace::open(options);
        if (!registry) die("opening the registry");
        auto uuidOf = [&](const std::string& path) {
            auto proxy = (*registry)->plugInProxyForURL(path);
            if (!proxy || !proxy->pluginUUID()) die(("no UUID for " + path).c_str());
            return Value::uuid(*proxy->pluginUUID());
        };
        const Value helloUuid = Value::array({uuidOf(paths[0])});
        std::vector<Value> twenty;
        for (int i = 1; i <= 20; ++i) twenty.push_back(uuidOf(paths[static_cast<size_t>(i)]));
        const Value twentyUuids = Value::array(std::move(twenty));

        const Value reference = request("ready", {{"uuids", Value::emptyArray()}});
        const Value hold = request("lock", {{"paths", Value::array({Value::string((root / "Many.app").string())})},
                                            {"flags", Value::uint64(0)}});
        const Value readyOne = request("ready", {{"uuids", helloUuid}});
        const Value readyTwenty = request("ready", {{"uuids", twentyUuids}});
        const Value launch = request("launch", {{"uuids", helloUuid}});

        for (int i = 0; i < 200; ++i) host.roundTrip(reference);  // warm caches and the connection
        bench::Percentiles ref = measure(rounds, [&] { host.roundTrip(reference); });
        bench::Percentiles lock = measure(rounds, [&] {
            Value uuid = host.roundTrip(hold).body().get("uuids");
            host.roundTrip(request("lock", {{"uuids", Value::array({uuid})}}));
        });
        bench::Percentiles one = measure(rounds, [&] { host.roundTrip(readyOne); });
        bench::Percentiles many = measure(rounds, [&] { host.roundTrip(readyTwenty); });
        bench::Percentiles started = measure(launches, [&] {
            ZemMessage reply = host.roundTrip(launch);
            if (reply.descriptorCount() != 1) die("launch passed no socket");
            int plugIn = reply.descriptor(0);
            bench::writeAll(plugIn, reinterpret_cast<const uint8_t*>("x\n"), 2);
            uint8_t first;
            bench::readExactly(plugIn, &first, 1);
        });

        printf("%-12s %10s %10s %10s\n", "request", "p50 us", "p99 us", "p50/ref");
        auto row = [&](const char* name, bench::Percentiles f) {
            printf("%-12s %10.1f %10.1f %10.2f\n", name, f.p50, f.p99, f.p50 / ref.p50);
        };
        row("reference", ref);
        row("lock 100", lock);
        row("ready 1", one);
        row("ready 20", many);
        row("launch", started);
    }

    kill(bxd, SIGTERM);
    waitpid(bxd, nullptr, 0);
    std::error_code ignored;
    fs::remove_all(root, ignored);
    return 0;
}
