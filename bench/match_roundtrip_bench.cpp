// Discovery through the real bxd: "match" requests over the wire against registries of 1,000 to 100,000 plug-ins
// spread over applications (10 plug-ins each) and 50 extension points. One point holds exactly kOnThePoint plug-ins
// at every size, so the point match returns the same number of forms however large the registry is; the rest are
// spread round-robin over the other 49 points. Every plug-in declares one shared resource, so each form carries a
// resource token as well as its annotations.
//
// First it prints what the host takes from a thread that spins for a second, alone and with every CPU spinning (see
// printHostStalls). For each size it prints:
//  - the point match: p50 / p99 round trip through bxd, and the same work done in this process (the database's
//    query, the rules, export, annotations, tokens and the encoding of the forms) as the server-side figure;
//  - the match with no rules (every visible plug-in): round trip and server-side time per returned plug-in, the
//    reply's size in bytes and the count at which it would pass the frame limit. Only for sizes up to --all-max,
//    since past some count the reply cannot be sent at all;
//  - the paged match with no rules (pages of --page-size, every page asked on one connection until the last):
//    time per returned plug-in at every size, since no reply is larger than a page;
//  - the paged match of one of the busy points (as a host pages through its own plug-ins): its time and bxd's CPU
//    per returned plug-in, which should stay near the figure of the paged match with no rules;
//  - "explain" of one plug-in on the point with the point's rules, beside the point match and a match of that one
//    plug-in by identifier: round trips and their ratios, in the same run;
//  - the point match beside a client that runs full discoveries back to back on another connection, paged and
//    (up to --all-max) unpaged: its p50 / p99 against the idle figures of the same run and the share slower than
//    twice the idle p99 and the slowest, once with that client at normal priority and once at nice 19 (on 2 cores the
//    first also measures the client's own decoding competing for the CPU); and its p99 against that of an idle
//    window of the same size just before it. Beside each, the same figure for a stand-in server (see StandIn) that
//    spends bxd's CPU per point match and sends a reply of its size, but shares nothing with bxd: what the host
//    alone does to such a request's tail while the same client discovers.
//
// --point-only stops after the point match and "explain" (the other figures take long at 100,000); --no-explain
// leaves "explain" out, to measure a bxd that does not serve it.
//
// Registries take a while to build (the 100,000 one minutes), so they are built once with the registry library
// under --cache (default: <tmp>/bexil-match-bench-cache) and reused; each run copies the state directory so that
// what bxd writes (elections, annotations) never leaks into the next run. The client speaks the wire protocol
// directly (ZemFrame out, one reply frame back), so the client library's cost is not measured.
//
// --wrapper "perf record -g -o FILE" starts bxd under a profiler.

#include <fcntl.h>
#include <getopt.h>
#include <sched.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "BxdBench.h"
#include "base/Document.h"
#include "bexil/Value.h"
#include "database/BXDatabase.h"
#include "platform/ledgerix/LedgerixWorkspace.h"
#include "platform/zem/ZemCodec.h"
#include "platform/zem/ZemFrame.h"
#include "policy/BXDPlugIn.h"

namespace {

namespace fs = std::filesystem;
using namespace bexil;
using namespace bexil::bench;
using Clock = std::chrono::steady_clock;

constexpr int kPlugInsPerApplication = 10;
constexpr int kPoints = 50;
constexpr int kOnThePoint = 20;
constexpr auto kStartTimeout = std::chrono::seconds(60);

std::string pointName(int point) { return "com.example.bench.point" + std::to_string(point); }

struct Options {
    std::vector<int> counts = {1000, 10000, 100000};
    unsigned requests = 2000;
    unsigned allRequests = 20;
    int allMax = 10000;
    fs::path cache;
    std::string bxdPath;
    std::string wrapper;
    bool serverSide = true;
    uint64_t pageSize = 256;
    unsigned pagedWalks = 3;
    bool pointOnly = false;
    bool explain = true;
};

[[noreturn]] void usage() {
    fputs(
        "Usage: match_roundtrip_bench [--counts N,N,...] [--requests M] [--all-requests M] [--all-max N]\n"
        "                             [--cache DIR] [--bxd PATH] [--wrapper CMD] [--no-server-side]\n"
        "                             [--page-size N] [--paged-walks M] [--point-only] [--no-explain]\n",
        stderr);
    exit(2);
}

Options parseOptions(int argc, char** argv) {
    static const option kLong[] = {
        {"counts", required_argument, nullptr, 'c'},
        {"requests", required_argument, nullptr, 'n'},
        {"all-requests", required_argument, nullptr, 'a'},
        {"all-max", required_argument, nullptr, 'm'},
        {"cache", required_argument, nullptr, 'C'},
        {"bxd", required_argument, nullptr, 'b'},
        {"wrapper", required_argument, nullptr, 'w'},
        {"no-server-side", no_argument, nullptr, 's'},
        {"page-size", required_argument, nullptr, 'p'},
        {"paged-walks", required_argument, nullptr, 'W'},
        {"point-only", no_argument, nullptr, 'P'},
        {"no-explain", no_argument, nullptr, 'E'},
        {nullptr, 0, nullptr, 0},
    };
    Options options;
    options.cache = fs::temp_directory_path() / "bexil-match-bench-cache";
    int c;
    while ((c = getopt_long(argc, argv, "", kLong, nullptr)) != -1) {
        switch (c) {
            case 'c': {
                options.counts.clear();
                std::stringstream list(optarg);
                std::string item;
                while (std::getline(list, item, ',')) {
                    int count = atoi(item.c_str());
                    // Each point but the wanted one must get plug-ins too.
                    if (count < kOnThePoint * kPlugInsPerApplication) usage();
                    options.counts.push_back(count);
                }
                break;
            }
            case 'n':
                options.requests = static_cast<unsigned>(std::max(1, atoi(optarg)));
                break;
            case 'a':
                options.allRequests = static_cast<unsigned>(std::max(1, atoi(optarg)));
                break;
            case 'm':
                options.allMax = atoi(optarg);
                break;
            case 'C':
                options.cache = optarg;
                break;
            case 'b':
                options.bxdPath = optarg;
                break;
            case 'w':
                options.wrapper = optarg;
                break;
            case 's':
                options.serverSide = false;
                break;
            case 'p':
                options.pageSize = static_cast<uint64_t>(std::max(1, atoi(optarg)));
                break;
            case 'W':
                options.pagedWalks = static_cast<unsigned>(std::max(1, atoi(optarg)));
                break;
            case 'P':
                options.pointOnly = true;
                break;
            case 'E':
                options.explain = false;
                break;
            default:
                usage();
        }
    }
    if (optind < argc || options.counts.empty()) usage();
    if (options.bxdPath.empty()) options.bxdPath = bench::defaultBxdPath();
    return options;
}

// ---- the registry ----------------------------------------------------------------------------------------------

// The point of plug-in `index`: kOnThePoint of them, evenly spread, are on point 0; the rest go round the others.
int pointOf(int index, int count) {
    int every = count / kOnThePoint;
    if (index % every == 0 && index / every < kOnThePoint) return 0;
    return 1 + index % (kPoints - 1);
}

void writeDocument(const fs::path& file, const Value& value) { std::ofstream(file) << Document::write(value).value(); }

// Builds the registry of `count` plug-ins under `dir` (apps/ and state/) unless a finished one is there.
fs::path prepareRegistry(const fs::path& cache, int count) {
    fs::path dir = cache / std::to_string(count);
    if (fs::exists(dir / "ready")) return dir;
    std::error_code ignored;
    fs::remove_all(dir, ignored);
    fs::create_directories(dir / "state");
    fprintf(stderr, "building a registry of %d plug-ins in %s ...\n", count, dir.c_str());
    Clock::time_point start = Clock::now();

    LedgerixWorkspace::Options options;
    options.stateDirectory = dir / "state";
    options.durability = LedgerixWorkspace::Durability::Process;
    std::shared_ptr<LedgerixWorkspace> workspace = *LedgerixWorkspace::open(options);
    for (int i = 0; i < count; ++i) {
        fs::path app = dir / "apps" / ("A" + std::to_string(i / kPlugInsPerApplication) + ".app");
        // An application without its information document is a placeholder, whose plug-ins discovery skips.
        if (i % kPlugInsPerApplication == 0) {
            fs::create_directories(app);
            writeDocument(
                app / "Info.vrec",
                Value::dictionary({{"BDBundleIdentifier", Value::string("com.example.bench.a" + std::to_string(i))}}));
        }
        fs::path bundle = app / "PlugIns" / ("P" + std::to_string(i) + ".bxplugin");
        fs::create_directories(bundle / "Resources");
        writeDocument(
            bundle / "Info.vrec",
            Value::dictionary({
                {"BDBundleIdentifier", Value::string("com.example.bench.p" + std::to_string(i))},
                {"BDBundleVersion", Value::string("1")},
                {"BDBundleName", Value::string("Plug-in " + std::to_string(i))},
                {"RZExtension",
                 Value::dictionary({
                     {"RZExtensionPointIdentifier", Value::string(pointName(pointOf(i, count)))},
                     {"RZExtensionProtocol", Value::string("#Data")},
                     {"RZExtensionAttributes", Value::dictionary({{"RZExtensionVersion", Value::string("1.0")}})},
                     {"Shared", Value::array({Value::string("Resources")})},
                 })},
            }));
        if (!workspace->registerPlugin(bundle.string())) die("registering a plug-in");
        if ((i + 1) % 10000 == 0) fprintf(stderr, "  %d registered\n", i + 1);
    }
    workspace.reset();
    std::ofstream(dir / "ready") << "ok\n";
    fprintf(stderr, "built in %.1f s\n", std::chrono::duration<double>(Clock::now() - start).count());
    return dir;
}

// ---- the wire ------------------------------------------------------------------------------------------------

struct Connection {
    int fd = -1;
    uint64_t serial = 0;
    std::vector<uint8_t> request;
    std::vector<uint8_t> reply;

    // Sends `body` and waits for its reply frame; returns the reply frame's size, header included.
    size_t roundTrip(const Value& body) {
        request.clear();
        if (ZemFrame::encode(ZemFrameKind::Request, ++serial, 0, body, request)) die("encoding the request");
        writeAll(fd, request.data(), request.size());
        reply.resize(ZemFrame::kHeaderBytes);
        readExactly(fd, reply.data(), ZemFrame::kHeaderBytes);
        Result<ZemFrameHeader> header = ZemFrame::decodeHeader(
            std::span<const uint8_t, ZemFrame::kHeaderBytes>(reply.data(), ZemFrame::kHeaderBytes));
        if (!header || header->kind != ZemFrameKind::Reply || header->inReplyTo != serial) die("unexpected reply");
        reply.resize(ZemFrame::kHeaderBytes + header->payloadLength);
        readExactly(fd, reply.data() + ZemFrame::kHeaderBytes, header->payloadLength);
        return reply.size();
    }

    // The number of forms in the last reply; exits on an error reply.
    size_t matches() const {
        Result<Value> body = ZemCodec::decode(
            std::span<const uint8_t>(reply.data() + ZemFrame::kHeaderBytes, reply.size() - ZemFrame::kHeaderBytes));
        if (!body || body->find("errorcode")) {
            fprintf(stderr, "match_roundtrip_bench: bad reply: %s\n",
                    body ? body->description().c_str() : body.error().description().c_str());
            exit(1);
        }
        const Value& forms = body->get("matches");
        // Every form must carry its annotations and its resource token, or the figures measure less than they say.
        for (const Value& form : forms.items()) {
            if (!form.get("annotations").isDictionary() || !form.get("extensions").get("Resources").isString()) {
                fprintf(stderr, "match_roundtrip_bench: incomplete form: %s\n", form.description().c_str());
                exit(1);
            }
        }
        return forms.items().size();
    }
};

// Walks every page of a match with `rules` (none: every plug-in) on `connection`; returns the forms and pages it
// got.
std::pair<size_t, size_t> pagedWalk(Connection& connection, uint64_t pageSize,
                                    const Value& rules = Value::emptyDictionary()) {
    size_t forms = 0, pages = 0;
    Value continuation;
    do {
        std::vector<std::pair<std::string, Value>> fields{{"request", Value::string("match")},
                                                          {"version", Value::uint64(3)},
                                                          {"rules", rules},
                                                          {"pagesize", Value::uint64(pageSize)}};
        if (!continuation.isNull()) fields.emplace_back("continuation", continuation);
        connection.roundTrip(Value::dictionary(std::move(fields)));
        Result<Value> body = ZemCodec::decode(std::span<const uint8_t>(
            connection.reply.data() + ZemFrame::kHeaderBytes, connection.reply.size() - ZemFrame::kHeaderBytes));
        if (!body || body->find("errorcode")) {
            fprintf(stderr, "match_roundtrip_bench: bad page: %s\n",
                    body ? body->description().c_str() : body.error().description().c_str());
            exit(1);
        }
        forms += body->get("matches").count();
        ++pages;
        continuation = body->get("continuation");
    } while (!continuation.isNull());
    return {forms, pages};
}

Connection connectWhenUp(const std::string& socketPath, pid_t bxd) {
    Connection connection;
    for (Clock::time_point deadline = Clock::now() + kStartTimeout; connection.fd < 0;) {
        if (Clock::now() > deadline || waitpid(bxd, nullptr, WNOHANG) != 0) die("bxd did not come up (see bxd.log)");
        connection.fd = connectTo(socketPath);
        if (connection.fd < 0) std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    return connection;
}

Value matchRequest(const Value& rules) {
    return Value::dictionary({{"request", Value::string("match")},
                              {"version", Value::uint64(3)},
                              {"rules", rules},
                              {"flags", Value::uint64(0)}});
}

pid_t startBxd(const Options& options, const fs::path& run) {
    pid_t child = fork();
    if (child < 0) die("fork");
    if (child == 0) {
        bench::enterPrivateBxdEnvironment(run);
        setenv("BXD_LOG_LEVEL", "error", 1);
        std::vector<std::string> words;
        std::stringstream wrapper(options.wrapper);
        for (std::string word; wrapper >> word;) words.push_back(word);
        words.push_back(options.bxdPath);
        std::vector<char*> argv;
        for (std::string& word : words) argv.push_back(word.data());
        argv.push_back(nullptr);
        execvp(argv[0], argv.data());
        _exit(127);
    }
    return child;
}

void stopProcess(pid_t pid) {
    if (pid <= 0) return;
    kill(pid, SIGTERM);
    waitpid(pid, nullptr, 0);
}

// ---- figures ---------------------------------------------------------------------------------------------------

struct Percentiles {
    double p50Us = 0, p99Us = 0;
};

Percentiles percentiles(std::vector<double> us) {
    std::sort(us.begin(), us.end());
    auto at = [&](double fraction) { return us[std::min(us.size() - 1, static_cast<size_t>(fraction * us.size()))]; };
    return {at(0.50), at(0.99)};
}

double elapsedUs(Clock::time_point start) {
    return std::chrono::duration<double, std::micro>(Clock::now() - start).count();
}

// What the match handler does for every candidate, in this process, down to the encoded reply: the server-side
// cost without the socket, the request queue and the envelope. Returns the times of `rounds` runs and the count.
std::pair<std::vector<double>, size_t> serverSide(BXDatabase& database, const Value& rules, unsigned rounds) {
    BXMatchContext context{.annotations = &database.annotationSource()};
    std::vector<double> times;
    size_t matched = 0;
    std::vector<uint8_t> out;
    for (unsigned round = 0; round <= rounds; ++round) {
        Clock::time_point start = Clock::now();
        std::optional<BXDatabase::PlugInSet> candidates = database.findPlugIns(rules);
        std::vector<Value> forms;
        for (const auto& plugIn : candidates ? *candidates : BXDatabase::PlugInSet{}) {
            if (!plugIn->onSystemVolume() && !plugIn->containingUrl()) continue;
            if (!plugIn->match(rules, context)) continue;
            Result<MutableDictionary> form = plugIn->exportForm();
            if (!form) continue;
            database.addAnnotationForPlugInIn(*plugIn, *form);
            plugIn->augmentForm(*form);
            forms.push_back(form->value());
        }
        matched = forms.size();
        out.clear();
        if (ZemFrame::encode(ZemFrameKind::Reply, 0, 1,
                             Value::dictionary({{"matches", Value::array(std::move(forms))}}), out))
            die("encoding the forms");
        // The first round builds the records; the figures are those of a warm daemon.
        if (round > 0) times.push_back(elapsedUs(start));
    }
    return {times, matched};
}

void copyState(const fs::path& from, const fs::path& to) {
    fs::create_directories(to);
    fs::copy(from, to, fs::copy_options::recursive | fs::copy_options::overwrite_existing);
}

// The CPU time (user and system) `pid` has used so far, in microseconds: less disturbed by other work on the
// machine than the wall-clock round trip, so it is the figure to compare builds by.
double cpuUs(pid_t pid) {
    std::ifstream stat("/proc/" + std::to_string(pid) + "/stat");
    std::string text((std::istreambuf_iterator<char>(stat)), std::istreambuf_iterator<char>());
    size_t end = text.rfind(')');
    if (end == std::string::npos) return 0;
    std::istringstream fields(text.substr(end + 2));
    std::string field;
    unsigned long long user = 0, system = 0;
    // After the name: state is field 3; utime and stime are fields 14 and 15.
    for (int i = 3; i <= 15 && fields >> field; ++i) {
        if (i == 14) user = std::stoull(field);
        if (i == 15) system = std::stoull(field);
    }
    return static_cast<double>(user + system) * 1e6 / static_cast<double>(sysconf(_SC_CLK_TCK));
}

double loadAverage() {
    double load = 0;
    if (FILE* f = fopen("/proc/loadavg", "r")) {
        if (fscanf(f, "%lf", &load) != 1) load = 0;
        fclose(f);
    }
    return load;
}

// What the machine itself takes from busy threads: one second of reading the clock in a loop, every gap longer than
// 20 us counted as time lost, first on one thread while the other CPUs idle, then on one thread per CPU at once.
// Beside each figure is the share of the second that the kernel saw the thread run: when that is near 100% while the
// gaps add up to several percent, the time went to the hypervisor, which this machine's scheduler cannot see or give
// back. The tails measured here are only as steady as this is: on a host that stalls a CPU for milliseconds a few
// times a second, a p99 of a few thousand round trips moves by whole stalls from one window to the next.
struct Stalls {
    double lostPercent = 0;
    double ranPercent = 0;
    unsigned longGaps = 0;
    double longestUs = 0;
};

// The CPU time the calling thread has had so far, as the kernel's scheduler counts it, in microseconds.
double threadCpuUs() {
    timespec now{};
    clock_gettime(CLOCK_THREAD_CPUTIME_ID, &now);
    return static_cast<double>(now.tv_sec) * 1e6 + static_cast<double>(now.tv_nsec) / 1e3;
}

Stalls spinOneSecond(int cpu) {
    constexpr double kGapUs = 20, kLongUs = 300;
    cpu_set_t only;
    CPU_ZERO(&only);
    CPU_SET(cpu, &only);
    sched_setaffinity(0, sizeof only, &only);
    Stalls stalls;
    const double ranBefore = threadCpuUs();
    const Clock::time_point start = Clock::now(), end = start + std::chrono::seconds(1);
    Clock::time_point last = start;
    double lostUs = 0;
    for (Clock::time_point now = last; now < end; last = now) {
        now = Clock::now();
        double gap = std::chrono::duration<double, std::micro>(now - last).count();
        if (gap <= kGapUs) continue;
        lostUs += gap;
        stalls.longestUs = std::max(stalls.longestUs, gap);
        if (gap > kLongUs) ++stalls.longGaps;
    }
    const double wallUs = elapsedUs(start);
    stalls.lostPercent = 100 * lostUs / wallUs;
    stalls.ranPercent = 100 * (threadCpuUs() - ranBefore) / wallUs;
    return stalls;
}

void printHostStalls() {
    cpu_set_t allowed;
    CPU_ZERO(&allowed);
    if (sched_getaffinity(0, sizeof allowed, &allowed) != 0) die("sched_getaffinity");
    std::vector<int> cpus;
    for (int cpu = 0; cpu < CPU_SETSIZE; ++cpu)
        if (CPU_ISSET(cpu, &allowed)) cpus.push_back(cpu);
    std::vector<Stalls> every(cpus.size());
    Stalls alone;
    // Threads of their own, so that pinning them leaves this thread's CPUs as they were.
    std::thread([&] { alone = spinOneSecond(cpus.front()); }).join();
    std::vector<std::thread> spinners;
    for (size_t i = 0; i < cpus.size(); ++i) spinners.emplace_back([&, i] { every[i] = spinOneSecond(cpus[i]); });
    for (std::thread& spinner : spinners) spinner.join();
    const Stalls& worst = *std::max_element(
        every.begin(), every.end(), [](const Stalls& a, const Stalls& b) { return a.lostPercent < b.lostPercent; });
    printf(
        "host stalls: a spinning thread lost %.1f%% of a second alone (gaps over 300 us: %u, the longest %.0f us; "
        "the kernel saw it run %.1f%%), and up to %.1f%% with one spinning on each of the %zu CPUs (gaps over "
        "300 us: %u, the longest %.0f us; seen running %.1f%%)\n",
        alone.lostPercent, alone.longGaps, alone.longestUs, alone.ranPercent, worst.lostPercent, cpus.size(),
        worst.longGaps, worst.longestUs, worst.ranPercent);
}

// A stand-in for bxd that shares nothing with it: a forked process that answers each 8-byte request on its end of a
// socket pair with `replyBytes` bytes, after spending `cpuUs` of its own CPU time, as bxd spends on a point match.
// Beside the same discovering client, its tail is what this host alone adds to a request of that cost, which no
// server can give back: the in-run reference for the point match's tail.
class StandIn {
  public:
    StandIn(size_t replyBytes, double cpuUs) : reply_(replyBytes) {
        int pair[2];
        if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) != 0) die("socketpair");
        pid_ = fork();
        if (pid_ < 0) die("fork");
        if (pid_ == 0) {
            // Only its own socket: a copy of a connection to bxd held here would keep it open past its close.
            close_range(3, static_cast<unsigned>(pair[1]) - 1, 0);
            close_range(static_cast<unsigned>(pair[1]) + 1, ~0U, 0);
            serve(pair[1], cpuUs);
        }
        close(pair[1]);
        fd_ = pair[0];
    }
    ~StandIn() {
        close(fd_);  // the stand-in exits at the end of its input
        waitpid(pid_, nullptr, 0);
    }
    StandIn(const StandIn&) = delete;
    StandIn& operator=(const StandIn&) = delete;

    void roundTrip() {
        const uint8_t request[kRequestBytes] = {};
        writeAll(fd_, request, sizeof request);
        readExactly(fd_, reply_.data(), reply_.size());
    }

  private:
    static constexpr size_t kRequestBytes = 8;

    [[noreturn]] void serve(int fd, double cpuUs) {
        std::vector<uint8_t> request(kRequestBytes);
        for (;;) {
            size_t got = 0;
            while (got < request.size()) {
                ssize_t n = read(fd, request.data() + got, request.size() - got);
                if (n < 0 && errno == EINTR) continue;
                if (n <= 0) _exit(0);
                got += static_cast<size_t>(n);
            }
            for (const double until = threadCpuUs() + cpuUs; threadCpuUs() < until;) {
            }
            writeAll(fd, reply_.data(), reply_.size());
        }
    }

    std::vector<uint8_t> reply_;
    pid_t pid_ = -1;
    int fd_ = -1;
};

void runSize(const Options& options, int count) {
    fs::path registry = prepareRegistry(options.cache, count);
    std::string pattern = (fs::temp_directory_path() / "bexil-match-run-XXXXXX").string();
    if (!mkdtemp(pattern.data())) die("mkdtemp");
    fs::path run = pattern;
    for (const char* sub : {"service", "runtime", "entitlements.d"}) fs::create_directories(run / sub);
    copyState(registry / "state", run / "state");

    const Value pointRules = Value::dictionary({{"RZExtensionPointIdentifier", Value::string(pointName(0))}});
    const Value noRules = Value::dictionary({});
    const bool all = count <= options.allMax;
    printf("== %d plug-ins registered (load average %.2f)\n", count, loadAverage());

    if (options.serverSide) {
        // In-process, on a private copy so that bxd later starts from the same state.
        fs::path local = run / "local";
        copyState(registry / "state", local / "state");
        setenv("BX_STATE_DIR", (local / "state").c_str(), 1);
        LedgerixWorkspace::Options lx;
        lx.stateDirectory = local / "state";
        lx.durability = LedgerixWorkspace::Durability::Process;
        std::shared_ptr<LedgerixWorkspace> workspace = *LedgerixWorkspace::open(lx);
        std::unique_ptr<BXDatabase> database =
            BXDatabase::create((local / "annotations").string(), workspace, [](std::string_view) {});
        auto [pointTimes, pointCount] = serverSide(*database, pointRules, options.requests);
        Percentiles p = percentiles(pointTimes);
        printf("server-side point match: %zu forms, p50 %.1f us, p99 %.1f us\n", pointCount, p.p50Us, p.p99Us);
        if (all) {
            auto [allTimes, allCount] = serverSide(*database, noRules, options.allRequests);
            Percentiles a = percentiles(allTimes);
            printf("server-side match all: %zu forms, p50 %.0f us = %.2f us per plug-in\n", allCount, a.p50Us,
                   a.p50Us / static_cast<double>(allCount));
        }
    }

    pid_t bxd = startBxd(options, run);
    std::string socketPath = (run / "service" / kBxdServiceName).string();
    Connection connection = connectWhenUp(socketPath, bxd);

    // The CPU figures are bxd's own, also when it runs under --wrapper (whose process is the one forked here).
    const pid_t server = peerPid(connection.fd);

    // The first point match builds the candidates' records; a few more settle the caches.
    for (int i = 0; i < 20; ++i) connection.roundTrip(matchRequest(pointRules));
    size_t pointCount = connection.matches();
    // --requests point matches back to back: their round trips, and the size of the last reply in pointBytes.
    size_t pointBytes = 0;
    auto pointWindow = [&] {
        std::vector<double> us;
        us.reserve(options.requests);
        for (unsigned i = 0; i < options.requests; ++i) {
            Clock::time_point start = Clock::now();
            pointBytes = connection.roundTrip(matchRequest(pointRules));
            us.push_back(elapsedUs(start));
        }
        return us;
    };
    double cpuBefore = cpuUs(server);
    Percentiles p = percentiles(pointWindow());
    double pointCpu = (cpuUs(server) - cpuBefore) / options.requests;
    printf(
        "round trip point match: %zu forms, %zu bytes, p50 %.1f us, p99 %.1f us, bxd CPU %.1f us per request "
        "(load %.2f)\n",
        pointCount, pointBytes, p.p50Us, p.p99Us, pointCpu, loadAverage());

    // "explain" of the first plug-in on the point, with the point's rules (so the claimers of its identifier are
    // looked for among the point's plug-ins too), against the point match and a match of that plug-in alone.
    if (options.explain) {
        const std::string identifier = "com.example.bench.p0";
        const Value explain = Value::dictionary({{"request", Value::string("explain")},
                                                 {"version", Value::uint64(3)},
                                                 {"rules", pointRules},
                                                 {"flags", Value::uint64(0)},
                                                 {"plugin", Value::string(identifier)}});
        const Value single = matchRequest(Value::dictionary({{"RZExtensionIdentifier", Value::string(identifier)}}));
        for (int i = 0; i < 20; ++i) connection.roundTrip(explain);
        Result<Value> body = ZemCodec::decode(std::span<const uint8_t>(
            connection.reply.data() + ZemFrame::kHeaderBytes, connection.reply.size() - ZemFrame::kHeaderBytes));
        if (!body || body->get("explanation").count() != 1 ||
            body->get("explanation").items()[0].get("outcome").stringView() != "matched") {
            fprintf(stderr, "match_roundtrip_bench: bad explain reply: %s\n",
                    body ? body->description().c_str() : body.error().description().c_str());
            exit(1);
        }
        // Interleaved, so that both see the same load.
        std::vector<double> explainTimes, singleTimes, pointTimes;
        double explainCpu = 0;
        for (unsigned i = 0; i < options.requests; ++i) {
            Clock::time_point start = Clock::now();
            double before = cpuUs(server);
            connection.roundTrip(explain);
            explainCpu += cpuUs(server) - before;
            explainTimes.push_back(elapsedUs(start));
            start = Clock::now();
            connection.roundTrip(single);
            singleTimes.push_back(elapsedUs(start));
            start = Clock::now();
            connection.roundTrip(matchRequest(pointRules));
            pointTimes.push_back(elapsedUs(start));
        }
        Percentiles e = percentiles(explainTimes), s1 = percentiles(singleTimes), pt = percentiles(pointTimes);
        printf(
            "round trip explain: p50 %.1f us, p99 %.1f us, bxd CPU %.1f us per request; point match p50 %.1f us "
            "(explain/point %.2f), match by identifier p50 %.1f us (explain/identifier %.2f) (load %.2f)\n",
            e.p50Us, e.p99Us, explainCpu / options.requests, pt.p50Us, e.p50Us / pt.p50Us, s1.p50Us, e.p50Us / s1.p50Us,
            loadAverage());
    }
    if (options.pointOnly) {
        fflush(stdout);
        close(connection.fd);
        stopProcess(bxd);
        std::error_code ignored;
        fs::remove_all(run, ignored);
        return;
    }

    if (all) {
        Clock::time_point cold = Clock::now();
        connection.roundTrip(matchRequest(noRules));
        double coldUs = elapsedUs(cold);
        size_t allCount = connection.matches();
        std::vector<double> allTimes;
        size_t bytes = 0;
        double allCpuBefore = cpuUs(server);
        for (unsigned i = 0; i < options.allRequests; ++i) {
            Clock::time_point start = Clock::now();
            bytes = connection.roundTrip(matchRequest(noRules));
            allTimes.push_back(elapsedUs(start));
        }
        double allCpu = (cpuUs(server) - allCpuBefore) / options.allRequests / static_cast<double>(allCount);
        Percentiles a = percentiles(allTimes);
        double perForm = static_cast<double>(bytes) / static_cast<double>(allCount);
        printf(
            "round trip match all: %zu forms, %zu bytes (%.0f per form; the %zu-byte frame limit is passed at "
            "about %.0f forms), first (cold) %.0f us, p50 %.0f us = %.2f us per plug-in, p99 %.0f us, bxd CPU "
            "%.2f us per plug-in (load %.2f)\n",
            allCount, bytes, perForm, ZemFrame::kMaxFrameBytes, static_cast<double>(ZemFrame::kMaxFrameBytes) / perForm,
            coldUs, a.p50Us, a.p50Us / static_cast<double>(allCount), a.p99Us, allCpu, loadAverage());
    }

    // Paged discovery of everything; the first walk builds every record.
    {
        Clock::time_point cold = Clock::now();
        auto [forms, pages] = pagedWalk(connection, options.pageSize);
        double coldUs = elapsedUs(cold);
        std::vector<double> walkTimes;
        double cpuBeforeWalks = cpuUs(server);
        for (unsigned i = 0; i < options.pagedWalks; ++i) {
            Clock::time_point start = Clock::now();
            pagedWalk(connection, options.pageSize);
            walkTimes.push_back(elapsedUs(start));
        }
        double walkCpu = (cpuUs(server) - cpuBeforeWalks) / options.pagedWalks / static_cast<double>(forms);
        Percentiles w = percentiles(walkTimes);
        printf(
            "round trip paged match all: %zu forms in %zu pages of %llu, first (cold) %.0f ms, p50 %.0f ms = %.2f us "
            "per plug-in, bxd CPU %.2f us per plug-in (load %.2f)\n",
            forms, pages, static_cast<unsigned long long>(options.pageSize), coldUs / 1000, w.p50Us / 1000,
            w.p50Us / static_cast<double>(forms), walkCpu, loadAverage());
    }

    // Paged discovery of one of the busy points (a host discovering its own plug-ins, page by page): the registry
    // is asked for the point's plug-ins in walk order, a stretch at a time.
    {
        const Value busyPoint = Value::dictionary({{"RZExtensionPointIdentifier", Value::string(pointName(1))}});
        auto [forms, pages] = pagedWalk(connection, options.pageSize, busyPoint);
        // The CPU figure counts in clock ticks (10 ms), so a short walk is repeated for a quarter of a second.
        double cpuBefore = cpuUs(server);
        Clock::time_point start = Clock::now();
        unsigned walks = 0;
        do {
            pagedWalk(connection, options.pageSize, busyPoint);
            ++walks;
        } while (elapsedUs(start) < 250000);
        double wallUs = elapsedUs(start) / walks;
        double cpu = (cpuUs(server) - cpuBefore) / walks / static_cast<double>(std::max<size_t>(forms, 1));
        printf(
            "round trip paged match of one busy point: %zu forms in %zu pages of %llu, %.1f ms (mean of %u walks), "
            "bxd CPU %.2f us per plug-in (load %.2f)\n",
            forms, pages, static_cast<unsigned long long>(options.pageSize), wallUs / 1000, walks, cpu, loadAverage());
    }

    // The in-run reference for the windows below: a server that costs what the point match costs and shares nothing
    // with bxd.
    StandIn standIn(pointBytes, pointCpu);
    auto standInWindow = [&](unsigned requests, std::vector<double> us = {}) {
        us.reserve(us.size() + requests);
        for (unsigned i = 0; i < requests; ++i) {
            Clock::time_point start = Clock::now();
            standIn.roundTrip();
            us.push_back(elapsedUs(start));
        }
        return us;
    };

    // The point match beside a client that discovers everything on its own connection, back to back: page after
    // page, and (where the reply fits a frame) unpaged, as a client of the protocol without pages asks. The
    // discovering client decodes every reply, so on a machine with fewer cores than busy threads part of what the
    // point match waits for is that client's own work, which no server can give back; the second round runs it
    // at the lowest priority, which takes most of its share of the CPU away but not its time slice: a thread woken
    // onto the CPU it runs on may still wait for the rest of that slice (a scheduler trace here showed bxd's request
    // thread waiting behind it at nice 19 as at nice 0, for most of a millisecond at a time).
    // This host's own stalls drift over a run, and the idle figure above was taken well before these: each
    // window also gets an idle window of the same size just before it, to tell drift from what the discovery costs.
    for (bool paged : {true, false}) {
        if (!paged && !all) break;
        for (int discovererNice : {0, 19}) {
            const Percentiles before = percentiles(pointWindow());
            const Percentiles standInIdle = percentiles(standInWindow(options.requests));
            std::atomic<bool> stop{false};
            std::atomic<unsigned> walks{0};
            std::thread discoverer([&] {
                setpriority(PRIO_PROCESS, static_cast<id_t>(gettid()), discovererNice);
                Connection other = connectWhenUp(socketPath, bxd);
                while (!stop.load()) {
                    if (paged)
                        pagedWalk(other, options.pageSize);
                    else {
                        other.roundTrip(matchRequest(noRules));
                        other.matches();
                    }
                    walks.fetch_add(1);
                }
                close(other.fd);
            });
            std::this_thread::sleep_for(std::chrono::milliseconds(50));
            // Half of the stand-in's requests before the point match's and half after, so that on average both see
            // the same stretch of the discovery.
            std::vector<double> standInBusy = standInWindow(options.requests / 2);
            std::vector<double> busy = pointWindow();
            const Percentiles standInBeside =
                percentiles(standInWindow(options.requests - options.requests / 2, std::move(standInBusy)));
            stop.store(true);
            discoverer.join();
            Percentiles b = percentiles(busy);
            // The slow tail is made of whole scheduler time slices, so the p99 jumps as their share crosses 1%; the
            // share itself says how close it is.
            double beyond = static_cast<double>(
                                std::count_if(busy.begin(), busy.end(), [&](double us) { return us > 2 * p.p99Us; })) /
                            static_cast<double>(busy.size());
            printf(
                "point match beside %s full discovery (discovering client at nice %d, %u walks meanwhile): p50 "
                "%.1f us (%.2fx idle), p99 %.1f us (%.2fx idle), %.2f%% beyond 2x the idle p99, slowest %.1f ms; "
                "idle just before: p99 %.1f us (%.2fx)\n",
                paged ? "paged" : "unpaged", discovererNice, walks.load(), b.p50Us, b.p50Us / p.p50Us, b.p99Us,
                b.p99Us / p.p99Us, 100 * beyond, *std::max_element(busy.begin(), busy.end()) / 1000, before.p99Us,
                b.p99Us / before.p99Us);
            printf("  the stand-in server beside the same discovery: p99 %.1f us (%.2fx its idle p99 of %.1f us)\n",
                   standInBeside.p99Us, standInBeside.p99Us / standInIdle.p99Us, standInIdle.p99Us);
        }
    }
    fflush(stdout);

    close(connection.fd);
    stopProcess(bxd);
    std::error_code ignored;
    fs::remove_all(run, ignored);
}

}  // namespace

int main(int argc, char** argv) {
    bench::programName = "match_roundtrip_bench";
    Options options = parseOptions(argc, argv);
    setvbuf(stdout, nullptr, _IOLBF, 0);
    signal(SIGPIPE, SIG_IGN);
    if (access(options.bxdPath.c_str(), X_OK) != 0) {
        fprintf(stderr, "match_roundtrip_bench: no bxd at %s (use --bxd PATH)\n", options.bxdPath.c_str());
        return 1;
    }
    // The in-process side's token key: one file for the whole run (the process keeps writing it back where it
    // first put it), removed at the end.
    std::string pattern = (fs::temp_directory_path() / "bexil-match-runtime-XXXXXX").string();
    if (!mkdtemp(pattern.data())) die("mkdtemp");
    setenv("BX_RUNTIME_DIR", pattern.c_str(), 1);
    printHostStalls();
    for (int count : options.counts) runSize(options, count);
    std::error_code ignored;
    fs::remove_all(pattern, ignored);
    return 0;
}
