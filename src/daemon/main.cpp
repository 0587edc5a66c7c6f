// bxd: the plug-in registry daemon. Parses its options, builds the one server and hands the main thread to the
// event loop for ever; the process is ended from outside (systemd).

#include <malloc.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <optional>

#include "base/EventLoop.h"
#include "daemon/BXDServer.h"
#include "platform/log/Log.h"
#include "platform/zem/ZemListener.h"

namespace {

// A block that lets an exception escape fails alone; the loop, and with it every other client, carries on.
void logUncaughtException(std::string_view queueLabel, std::exception_ptr exception) {
    std::string what = bexil::exceptionMessage(exception);
    bexil::log::ops().fault("block on queue %s threw: %s", std::string(queueLabel), what);
}

// Large frames (up to 16 MiB) come from the heap rather than from mappings of their own, and freed heap memory up
// to this much is kept rather than given back at once: otherwise every large request maps fresh pages, faults each
// of them in while it is read, and unmaps them when it is done, which costs far more than the reading itself.
constexpr int kLargeAllocationFromHeapBytes = 17 * 1024 * 1024;
constexpr int kFreeMemoryKeptBytes = 64 * 1024 * 1024;

// Descriptors bxd keeps for itself besides its connections: the registry, the annotation document, the log, the
// pidfds and pipes of launched plug-ins and of termination.
constexpr size_t kDescriptorsKeptBack = 128;
// Each connection holds its socket and a pidfd of its peer (which the peer's grants share rather than copy).
constexpr size_t kDescriptorsPerConnection = 2;

// How far below the request thread the steps of large discoveries run while a request waits for one of them to end
// (otherwise they run only on a CPU nothing else wants), or always where bxd may not raise a thread it has made
// idle-scheduled. At 10 the kernel gives them about a tenth of a CPU that something of normal priority also wants.
constexpr int kBulkStepsNiceIncrement = 10;

// A paged "match" that kept the request queue longer than this at a time would defeat the point of its steps.
constexpr size_t kLongestPageStepMicroseconds = 1'000'000;

// A positive count from the environment variable `name`; none when it is unset, and none (logged) when it is not a
// positive number.
std::optional<size_t> countFromEnvironment(const char* name) {
    const char* text = getenv(name);
    if (text == nullptr || *text == '\0') return std::nullopt;
    char* end = nullptr;
    unsigned long long value = strtoull(text, &end, 10);
    if (*end != '\0' || value == 0 || text[0] == '-') {
        bexil::log::ops().error("%s=%s is not a positive number; using the default", name, text);
        return std::nullopt;
    }
    return static_cast<size_t>(value);
}

// The connection limits: the defaults, or $BX_MAX_CONNECTIONS, $BX_MAX_CONNECTIONS_PER_USER,
// $BX_STALLED_CONNECTION_SECONDS and $BX_QUEUED_REPLY_BYTES, with the total held
// below what the open-file limit allows once bxd has raised its soft limit to the hard one.
bexil::ZemListener::Limits connectionLimits() {
    using bexil::log::ops;
    rlimit files{};
    if (getrlimit(RLIMIT_NOFILE, &files) == 0 && files.rlim_cur < files.rlim_max) {
        rlim_t before = files.rlim_cur;
        files.rlim_cur = files.rlim_max;
        if (setrlimit(RLIMIT_NOFILE, &files) == 0)
            ops().info("open-file limit raised from %llu to %llu", static_cast<unsigned long long>(before),
                       static_cast<unsigned long long>(files.rlim_cur));
        else
            files.rlim_cur = before;
    }
    bexil::ZemListener::Limits limits;
    if (auto total = countFromEnvironment("BX_MAX_CONNECTIONS")) limits.maxConnections = *total;
    if (auto perUser = countFromEnvironment("BX_MAX_CONNECTIONS_PER_USER")) limits.maxConnectionsPerUser = *perUser;
    if (auto seconds = countFromEnvironment("BX_STALLED_CONNECTION_SECONDS"))
        limits.stalledConnectionTimeout = std::chrono::seconds(*seconds);
    if (auto bytes = countFromEnvironment("BX_QUEUED_REPLY_BYTES")) limits.queuedReplyBytes = *bytes;
    const size_t openFiles = static_cast<size_t>(files.rlim_cur);
    const size_t affordable = openFiles > kDescriptorsKeptBack + kDescriptorsPerConnection
                                  ? (openFiles - kDescriptorsKeptBack) / kDescriptorsPerConnection
                                  : 1;
    if (limits.maxConnections > affordable) {
        ops().notice("connection limit lowered from %zu to %zu: the open-file limit is %zu", limits.maxConnections,
                     affordable, openFiles);
        limits.maxConnections = affordable;
    }
    limits.reservedForRoot = std::min(limits.reservedForRoot, limits.maxConnections / 4);
    return limits;
}

[[noreturn]] void usage() {
    fputs("Usage: bxd [-S servicename] [-v]\n", stderr);
    exit(2);
}

}  // namespace

int main(int argc, char** argv) {
    using namespace bexil;
    log::ops().info("bxd is launching");

    const char* serviceName = BXDServer::kDefaultServiceName;
    const char* databasePath = nullptr;
    unsigned cacheLimit = BXDatabase::kDefaultCacheLimit;
    unsigned verbose = 0;

    int option;
    while ((option = getopt(argc, argv, "c:d:S:v")) != -1) {
        switch (option) {
            case 'c':
                // No validation, as documented: a non-number gives 0 and a negative number wraps.
                cacheLimit = static_cast<unsigned>(atoi(optarg));
                break;
            case 'd':
                databasePath = optarg;
                break;
            case 'S':
                serviceName = optarg;
                break;
            case 'v':
                log::defaultLog().error(
                    "verbose option -v is ineffective; use log config --subsystem com.quorvel.bexil");
                ++verbose;
                break;
            default:
                usage();
        }
    }
    if (optind < argc) usage();

    // The main thread is the loop's only thread: socket I/O, decoding, every request and encoding share it, so a
    // request never changes threads between its bytes arriving and its reply leaving.
    EventLoop::setUncaughtExceptionHandler(logUncaughtException);
    mallopt(M_MMAP_THRESHOLD, kLargeAllocationFromHeapBytes);
    mallopt(M_TRIM_THRESHOLD, kFreeMemoryKeptBytes);
    const ZemListener::Limits limits = connectionLimits();
    EventLoop loop(0);
    // The later steps of a large discovery run on a thread of their own, still one at a time with everything else.
    // The kernel then charges the CPU they take to that thread, not to the one that reads and answers requests,
    // which so keeps the standing of a thread that mostly waits and gets the CPU as soon as a request comes; and
    // idle-scheduled, a bulk discovery gives way to the other work of the machine, a host's point match first.
    loop.startBulkThread(kBulkStepsNiceIncrement);
    std::unique_ptr<BXDServer> server = BXDServer::initForServiceDatabase(serviceName, databasePath, loop);
    if (!server) {
        log::ops().error("unable to construct server");
        return 1;
    }
    server->service().setLimits(limits);
    server->setVerbose(verbose);
    server->setCacheLimit(cacheLimit);
    if (auto step = countFromEnvironment("BX_PAGE_STEP_MICROSECONDS")) {
        if (*step > kLongestPageStepMicroseconds) {
            log::ops().error(
                "BX_PAGE_STEP_MICROSECONDS=%zu is longer than %zu (kLongestPageStepMicroseconds); using that", *step,
                kLongestPageStepMicroseconds);
            step = kLongestPageStepMicroseconds;
        }
        server->setPageStep(std::chrono::microseconds(*step));
    }
    log::ops().debug(
        "bxd configured: service %s, cache limit %u, annotations %s, verbose %u, connections %zu "
        "(%zu per user, %zu kept for root), page steps of %lld us",
        serviceName, cacheLimit, databasePath ? databasePath : "(default)", verbose, limits.maxConnections,
        limits.maxConnectionsPerUser, limits.reservedForRoot, static_cast<long long>(server->pageStep().count()));
    // Plug-ins run no longer than the daemon that started them: their hosts reach them through sockets bxd handed
    // out, and the instance records that termination and holds rely on are bxd's own.
    server->serviceManager().endSandboxedInstances("left running by an earlier bxd");
    server->run();
    server->serviceManager().endSandboxedInstances("as bxd stops");
    return 0;
}
