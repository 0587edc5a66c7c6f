// bxd's start-up with a large registry against the same with an empty one, in one run: the time from exec until the
// socket accepts a connection and until the first reply arrives, the resident memory (VmRSS and VmHWM from
// /proc/<pid>/status) and how many bytes the daemon read (rchar from /proc/<pid>/io) by then. Records are built
// lazily, so a large registry should cost neither start-up time nor memory nor reads; a "bytes read" near the
// registry's file size says that start-up walks the records.
//
//     cmake --build --preset release --target bxd bxd_startup_bench
//     build/release/bench/bxd_startup_bench [--plugins N] [--points P] [--runs R] [--bxd PATH]
//
// The registry (default 100,000 plug-ins, ten to an application, on 50 extension points) is built once per run
// through the registry library in a private directory (on /dev/shm when there is one, see LargeRegistry.h) and
// removed at exit; then the real bxd binary is started
// --runs times on it and as often on an empty registry, alternately, each time with its BX_* variables pointing at
// private directories and its log on standard error (into a file). The registry file is in the page cache, so these
// are warm starts. The daemon's readiness notification (NOTIFY_SOCKET) wakes the waiting loop at once; between
// notifications it tries to connect every millisecond, so the figures do not depend on the notification.

#include <fcntl.h>
#include <getopt.h>
#include <poll.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "BxdBench.h"
#include "LargeRegistry.h"
#include "bexil/Value.h"
#include "platform/ledgerix/LedgerixWorkspace.h"
#include "platform/zem/ZemFrame.h"

namespace {

namespace fs = std::filesystem;
using namespace bexil;
using namespace bexil::bench;
using Clock = std::chrono::steady_clock;

// How long one start may take before the run is given up.
constexpr auto kStartTimeout = std::chrono::seconds(30);
// How long the daemon idles after its first reply before its memory is read, so that work it does in the
// background right after start-up is counted too.
constexpr auto kSettle = std::chrono::milliseconds(250);

struct Options {
    int plugIns = 100000;
    int points = 50;
    int runs = 10;
    std::string bxdPath;
};

[[noreturn]] void usage() {
    fputs("Usage: bxd_startup_bench [--plugins N] [--points P] [--runs R] [--bxd PATH]\n", stderr);
    exit(2);
}

int parseNumber(const char* text, long max) {
    std::optional<unsigned long> value = parsePositive(text, static_cast<unsigned long>(max));
    if (!value) usage();
    return static_cast<int>(*value);
}

Options parseOptions(int argc, char** argv) {
    static const option kLong[] = {
        {"plugins", required_argument, nullptr, 'n'},
        {"points", required_argument, nullptr, 'p'},
        {"runs", required_argument, nullptr, 'r'},
        {"bxd", required_argument, nullptr, 'b'},
        {nullptr, 0, nullptr, 0},
    };
    Options options;
    int c;
    while ((c = getopt_long(argc, argv, "", kLong, nullptr)) != -1) {
        switch (c) {
            case 'n':
                options.plugIns = parseNumber(optarg, 10'000'000);
                break;
            case 'p':
                options.points = parseNumber(optarg, 1'000'000);
                break;
            case 'r':
                options.runs = parseNumber(optarg, 1000);
                break;
            case 'b':
                options.bxdPath = optarg;
                break;
            default:
                usage();
        }
    }
    if (optind < argc) usage();
    if (options.bxdPath.empty()) options.bxdPath = bench::defaultBxdPath();
    return options;
}

// One request frame that bxd answers at once (a request name it does not know), and the check of its reply.
void roundTrip(int fd) {
    MutableDictionary body;
    body.set("request", Value::string("bench"));
    body.set("version", Value::uint64(3));
    std::vector<uint8_t> frame;
    if (ZemFrame::encode(ZemFrameKind::Request, 1, 0, body.take(), frame)) die("encoding the request");
    writeAll(fd, frame.data(), frame.size());
    std::vector<uint8_t> reply(ZemFrame::kHeaderBytes);
    readExactly(fd, reply.data(), ZemFrame::kHeaderBytes);
    Result<ZemFrameHeader> header =
        ZemFrame::decodeHeader(std::span<const uint8_t, ZemFrame::kHeaderBytes>(reply.data(), ZemFrame::kHeaderBytes));
    if (!header || header->kind != ZemFrameKind::Reply || header->inReplyTo != 1) die("reply header");
    reply.resize(ZemFrame::kHeaderBytes + header->payloadLength);
    readExactly(fd, reply.data() + ZemFrame::kHeaderBytes, header->payloadLength);
}

// A named figure of a process's /proc/<pid>/<file> ("VmRSS:" in status, "rchar:" in io), or -1.
long long procField(pid_t pid, const char* file, const std::string& name) {
    std::ifstream in("/proc/" + std::to_string(pid) + "/" + file);
    std::string line;
    while (std::getline(in, line)) {
        if (line.compare(0, name.size(), name) == 0) return atoll(line.c_str() + name.size());
    }
    return -1;
}

struct Start {
    double connectMs = 0;     // exec until a connection is accepted
    double firstReplyMs = 0;  // exec until the first reply has arrived
    double rssMiB = 0;
    double hwmMiB = 0;
    double readMiB = 0;  // bytes read through system calls (page cache included)
};

struct Setting {
    const char* name;
    fs::path root;  // holds state/, and gets service-<n>/, runtime-<n>/, bxd.log
};

// Starts the real bxd on `setting`, times it and reads its memory, then stops it.
Start startOnce(const Options& options, const Setting& setting, int number, const fs::path& entitlements) {
    fs::path service = setting.root / ("service-" + std::to_string(number));
    fs::path runtime = setting.root / ("runtime-" + std::to_string(number));
    fs::create_directories(service);
    fs::create_directories(runtime);
    std::string socketPath = (service / kBxdServiceName).string();
    std::string notifyPath = (setting.root / ("notify-" + std::to_string(number))).string();

    int notify = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
    if (notify < 0) die("socket");
    sockaddr_un notifyAddress = unixAddress(notifyPath);
    if (bind(notify, reinterpret_cast<sockaddr*>(&notifyAddress), sizeof notifyAddress) != 0) die("bind");

    // The child writes the moment just before exec here (the steady clock is the system's monotonic clock, the
    // same in every process).
    auto* execAt = static_cast<int64_t*>(
        mmap(nullptr, sizeof(int64_t), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0));
    if (execAt == MAP_FAILED) die("mmap");

    pid_t child = fork();
    if (child < 0) die("fork");
    if (child == 0) {
        setenv("BX_SERVICE_DIR", service.c_str(), 1);
        setenv("BX_STATE_DIR", (setting.root / "state").c_str(), 1);
        setenv("BX_RUNTIME_DIR", runtime.c_str(), 1);
        setenv("BX_ENTITLEMENTS_DIR", entitlements.c_str(), 1);
        setenv("BX_PREFERENCES_DIR", (setting.root / "preferences").c_str(), 1);
        setenv("BX_LOG_SINK", "stderr", 1);
        setenv("NOTIFY_SOCKET", notifyPath.c_str(), 1);
        int log = open((setting.root / "bxd.log").c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
        if (log >= 0) {
            dup2(log, STDERR_FILENO);
            dup2(log, STDOUT_FILENO);
        }
        *execAt = Clock::now().time_since_epoch().count();
        execl(options.bxdPath.c_str(), options.bxdPath.c_str(), static_cast<char*>(nullptr));
        _exit(127);
    }

    int fd = -1;
    Clock::time_point connected;
    auto deadline = Clock::now() + kStartTimeout;
    while (fd < 0) {
        if (Clock::now() > deadline || waitpid(child, nullptr, WNOHANG) != 0) {
            fprintf(stderr, "bxd_startup_bench: bxd did not come up; see its log in %s\n",
                    (setting.root / "bxd.log").c_str());
            exit(1);
        }
        pollfd ready{notify, POLLIN, 0};
        if (poll(&ready, 1, 1) > 0) {
            char message[256];
            while (recv(notify, message, sizeof message, 0) > 0) {
            }
        }
        fd = connectTo(socketPath);
        connected = Clock::now();
    }
    roundTrip(fd);
    Clock::time_point replied = Clock::now();

    Start start;
    Clock::time_point exec{Clock::duration(*execAt)};
    start.connectMs = std::chrono::duration<double, std::milli>(connected - exec).count();
    start.firstReplyMs = std::chrono::duration<double, std::milli>(replied - exec).count();
    std::this_thread::sleep_for(kSettle);
    start.rssMiB = procField(child, "status", "VmRSS:") / 1024.0;
    start.hwmMiB = procField(child, "status", "VmHWM:") / 1024.0;
    start.readMiB = procField(child, "io", "rchar:") / (1024.0 * 1024.0);

    close(fd);
    kill(child, SIGTERM);
    int status = 0;
    waitpid(child, &status, 0);
    close(notify);
    unlink(notifyPath.c_str());
    munmap(execAt, sizeof(int64_t));
    return start;
}

double median(std::vector<double> values) {
    std::sort(values.begin(), values.end());
    size_t n = values.size();
    return n % 2 ? values[n / 2] : (values[n / 2 - 1] + values[n / 2]) / 2;
}

double fileMiB(const fs::path& path) {
    std::error_code ec;
    auto size = fs::file_size(path, ec);
    return ec ? 0 : static_cast<double>(size) / (1024.0 * 1024.0);
}

}  // namespace

int main(int argc, char** argv) {
    bench::programName = "bxd_startup_bench";
    Options options = parseOptions(argc, argv);
    if (access(options.bxdPath.c_str(), X_OK) != 0) {
        fprintf(stderr, "bxd_startup_bench: no bxd at %s (use --bxd PATH)\n", options.bxdPath.c_str());
        return 1;
    }
    signal(SIGPIPE, SIG_IGN);

    fs::path root = bench::makeScratchDirectory("bxd-startup");
    fs::path entitlements = root / "entitlements.d";
    fs::create_directories(entitlements);
    Setting empty{"empty registry", root / "empty"};
    Setting large{"large registry", root / "large"};

    // The empty registry exists before the first start too, so that both settings open a file and neither creates
    // one.
    {
        LedgerixWorkspace::Options emptyOptions;
        emptyOptions.stateDirectory = empty.root / "state";
        if (!LedgerixWorkspace::open(emptyOptions).ok()) die("opening the empty registry");
    }
    bench::LargeRegistry built =
        bench::LargeRegistry::build(root / "bundles", large.root / "state", options.plugIns, options.points, false);
    fs::path registryFile = large.root / "state" / std::string(LedgerixWorkspace::kDatabaseFileName);
    fprintf(stderr,
            "built a registry of %d plug-ins in %d applications on %d points: bundles %.1f s, registrations %.1f s\n",
            options.plugIns, (options.plugIns + 9) / 10, options.points, built.writeSeconds, built.registerSeconds);

    std::vector<Start> emptyStarts, largeStarts;
    for (int run = 0; run < options.runs; ++run) {
        // Alternate which goes first, so that drift in the machine's speed hits both alike.
        if (run % 2 == 0) {
            emptyStarts.push_back(startOnce(options, empty, run, entitlements));
            largeStarts.push_back(startOnce(options, large, run, entitlements));
        } else {
            largeStarts.push_back(startOnce(options, large, run, entitlements));
            emptyStarts.push_back(startOnce(options, empty, run, entitlements));
        }
    }
    std::error_code ignored;
    double registryMiB = fileMiB(registryFile) + fileMiB(registryFile.string() + "-wal");
    fs::remove_all(root, ignored);

    auto column = [](const std::vector<Start>& starts, double Start::*field) {
        std::vector<double> values;
        for (const Start& s : starts) values.push_back(s.*field);
        return values;
    };
    printf("bxd_startup_bench: %d starts each, %d plug-ins on %d points (registry file %.1f MiB), medians [min..max]\n",
           options.runs, options.plugIns, options.points, registryMiB);
    struct Figure {
        const char* name;
        double Start::*field;
    };
    const Figure figures[] = {
        {"exec -> connect, ms", &Start::connectMs},
        {"exec -> first reply, ms", &Start::firstReplyMs},
        {"VmRSS, MiB", &Start::rssMiB},
        {"VmHWM, MiB", &Start::hwmMiB},
        {"bytes read (rchar), MiB", &Start::readMiB},
    };
    printf("%-26s %22s %22s %9s\n", "", empty.name, large.name, "ratio");
    for (const Figure& figure : figures) {
        std::vector<double> e = column(emptyStarts, figure.field), l = column(largeStarts, figure.field);
        double me = median(e), ml = median(l);
        char emptyText[64], largeText[64];
        snprintf(emptyText, sizeof emptyText, "%.2f [%.2f..%.2f]", me, *std::min_element(e.begin(), e.end()),
                 *std::max_element(e.begin(), e.end()));
        snprintf(largeText, sizeof largeText, "%.2f [%.2f..%.2f]", ml, *std::min_element(l.begin(), l.end()),
                 *std::max_element(l.begin(), l.end()));
        printf("%-26s %22s %22s %8.2fx\n", figure.name, emptyText, largeText, me > 0 ? ml / me : 0.0);
    }
    return 0;
}
