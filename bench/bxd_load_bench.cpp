// End-to-end load on the real bxd: N client processes each make M blocking round trips through the daemon, and, in
// the same run, the same number of round trips with equally sized messages through a raw epoll echo server over a
// Unix stream socket. It prints p50 and p99 round trip and requests per second of both, and bxd's ratio to raw.
//
// The daemon is the real binary, started here in a private temporary service directory. Its clients speak the wire
// protocol directly (a request frame written with ZemFrame, the reply frame read back), so what is measured is the
// daemon and the kernel, not a client library. The request names no operation bxd knows, which takes it through the
// whole path: frame cutting, decoding, the request queue, the envelope checks, the handler table, the error reply
// and its encoding. The raw side sends as many bytes as bxd's request frame and answers with as many as its reply.
//
// Clients, the echo server and bxd are all processes forked from this one, so `taskset -c 0 bxd_load_bench ...`
// pins every one of them to one CPU (the CPU cost alone), while an unpinned run shows what wake-ups across CPUs add.
// Rounds alternate raw and bxd so that drift in the machine's speed hits both alike.

#include <fcntl.h>
#include <getopt.h>
#include <sched.h>
#include <sys/epoll.h>
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
#include <string>
#include <thread>
#include <unordered_map>
#include <vector>

#include "base/Value.h"
#include "platform/zem/ZemCodec.h"
#include "platform/zem/ZemFrame.h"

namespace {

namespace fs = std::filesystem;
using namespace bexil;
using Clock = std::chrono::steady_clock;

constexpr const char* kServiceName = "com.quorvel.bexil.bxd";
// Round trips each client makes before timing starts (connection set-up, caches, the daemon's first allocations).
constexpr unsigned kWarmUpRequests = 200;
// The raw protocol's header: a little-endian u32 with the number of bytes that follow.
constexpr size_t kRawHeaderBytes = 4;
// How long bxd or the echo server may take to accept connections before the run is given up.
constexpr auto kStartTimeout = std::chrono::seconds(10);
// The largest payload a run may ask for; far below the frame limit, and big enough for any realistic request.
constexpr size_t kMaxPayloadBytes = 1024 * 1024;

enum class Mode { Bxd, Raw, Both };

struct Options {
    unsigned clients = 1;
    unsigned requests = 20000;
    size_t payload = 64;
    unsigned rounds = 3;
    Mode mode = Mode::Both;
    std::string bxdPath;
};

[[noreturn]] void die(const char* what) {
    fprintf(stderr, "bxd_load_bench: %s: %s\n", what, errno ? strerror(errno) : "failed");
    exit(1);
}

[[noreturn]] void usage() {
    fputs(
        "Usage: bxd_load_bench [--clients N] [--requests M] [--payload BYTES] [--rounds R] [--mode bxd|raw|both]\n"
        "                      [--bxd PATH]\n",
        stderr);
    exit(2);
}

unsigned long parseNumber(const char* text, unsigned long max) {
    char* end = nullptr;
    errno = 0;
    unsigned long value = strtoul(text, &end, 10);
    if (errno != 0 || end == text || *end != '\0' || value == 0 || value > max) usage();
    return value;
}

Options parseOptions(int argc, char** argv) {
    static const option kLong[] = {
        {"clients", required_argument, nullptr, 'c'},
        {"requests", required_argument, nullptr, 'n'},
        {"payload", required_argument, nullptr, 'p'},
        {"rounds", required_argument, nullptr, 'r'},
        {"mode", required_argument, nullptr, 'm'},
        {"bxd", required_argument, nullptr, 'b'},
        {nullptr, 0, nullptr, 0},
    };
    Options options;
    int c;
    while ((c = getopt_long(argc, argv, "", kLong, nullptr)) != -1) {
        switch (c) {
            case 'c':
                options.clients = static_cast<unsigned>(parseNumber(optarg, 1024));
                break;
            case 'n':
                options.requests = static_cast<unsigned>(parseNumber(optarg, 100'000'000));
                break;
            case 'p':
                options.payload = parseNumber(optarg, kMaxPayloadBytes);
                break;
            case 'r':
                options.rounds = static_cast<unsigned>(parseNumber(optarg, 100));
                break;
            case 'm':
                if (strcmp(optarg, "bxd") == 0)
                    options.mode = Mode::Bxd;
                else if (strcmp(optarg, "raw") == 0)
                    options.mode = Mode::Raw;
                else if (strcmp(optarg, "both") == 0)
                    options.mode = Mode::Both;
                else
                    usage();
                break;
            case 'b':
                options.bxdPath = optarg;
                break;
            default:
                usage();
        }
    }
    if (optind < argc) usage();
    if (options.bxdPath.empty()) {
        // Built side by side: build/<preset>/bench/bxd_load_bench and build/<preset>/src/daemon/bxd.
        fs::path self = fs::read_symlink("/proc/self/exe");
        options.bxdPath = (self.parent_path() / ".." / "src" / "daemon" / "bxd").lexically_normal().string();
    }
    return options;
}

// ---- socket helpers -------------------------------------------------------------------------------------------

sockaddr_un unixAddress(const std::string& path) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (path.size() >= sizeof address.sun_path) {
        errno = ENAMETOOLONG;
        die(path.c_str());
    }
    memcpy(address.sun_path, path.c_str(), path.size() + 1);
    return address;
}

int connectTo(const std::string& path) {
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) die("socket");
    sockaddr_un address = unixAddress(path);
    if (connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
        close(fd);
        return -1;
    }
    return fd;
}

bool waitUntilConnectable(const std::string& path, pid_t server) {
    auto deadline = Clock::now() + kStartTimeout;
    while (Clock::now() < deadline) {
        if (waitpid(server, nullptr, WNOHANG) != 0) return false;
        int fd = connectTo(path);
        if (fd >= 0) {
            close(fd);
            return true;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return false;
}

void writeAll(int fd, const uint8_t* bytes, size_t length) {
    while (length > 0) {
        ssize_t n = write(fd, bytes, length);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) die("write");
        bytes += n;
        length -= static_cast<size_t>(n);
    }
}

// Reads one message of a length-prefixed protocol into `buffer`: first enough for its header, then the length the
// header announces. Both protocols are strict ping-pong, so a read never takes bytes of the next message.
template <class LengthOf>
void readMessage(int fd, std::vector<uint8_t>& buffer, size_t headerBytes, LengthOf payloadLengthOf) {
    size_t have = 0;
    size_t want = headerBytes;
    bool headerSeen = false;
    for (;;) {
        if (have >= want) {
            if (headerSeen) return;
            headerSeen = true;
            want = headerBytes + payloadLengthOf(buffer.data());
            if (buffer.size() < want) buffer.resize(want);
            if (have >= want) return;
        }
        ssize_t n = read(fd, buffer.data() + have, buffer.size() - have);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) die("read (the server closed the connection)");
        have += static_cast<size_t>(n);
    }
}

uint32_t readLe32(const uint8_t* p) {
    return static_cast<uint32_t>(p[0]) | static_cast<uint32_t>(p[1]) << 8 | static_cast<uint32_t>(p[2]) << 16 |
           static_cast<uint32_t>(p[3]) << 24;
}

void writeLe32(uint8_t* p, uint32_t v) {
    for (int i = 0; i < 4; ++i) p[i] = static_cast<uint8_t>(v >> (8 * i));
}

// ---- the raw epoll echo server --------------------------------------------------------------------------------

// Answers every length-prefixed message with a message of `replyBytes` bytes in all (header included), on one
// thread with epoll, the way a minimal event-driven server would. Runs until killed.
[[noreturn]] void runEchoServer(const std::string& path, size_t replyBytes) {
    int listener = socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (listener < 0) die("socket");
    sockaddr_un address = unixAddress(path);
    if (bind(listener, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) die("bind");
    if (listen(listener, SOMAXCONN) != 0) die("listen");
    int epoll = epoll_create1(EPOLL_CLOEXEC);
    epoll_event event{};
    event.events = EPOLLIN;
    event.data.fd = listener;
    epoll_ctl(epoll, EPOLL_CTL_ADD, listener, &event);

    std::vector<uint8_t> reply(replyBytes, 0x5A);
    writeLe32(reply.data(), static_cast<uint32_t>(replyBytes - kRawHeaderBytes));
    struct Peer {
        std::vector<uint8_t> in;
        std::vector<uint8_t> out;
    };
    std::unordered_map<int, Peer> peers;
    std::vector<uint8_t> chunk(64 * 1024);
    epoll_event ready[64];
    for (;;) {
        int count = epoll_wait(epoll, ready, 64, -1);
        if (count < 0 && errno == EINTR) continue;
        if (count < 0) die("epoll_wait");
        for (int i = 0; i < count; ++i) {
            int fd = ready[i].data.fd;
            if (fd == listener) {
                int peer;
                while ((peer = accept4(listener, nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC)) >= 0) {
                    epoll_event add{};
                    add.events = EPOLLIN;
                    add.data.fd = peer;
                    epoll_ctl(epoll, EPOLL_CTL_ADD, peer, &add);
                    peers[peer];
                }
                continue;
            }
            Peer& peer = peers[fd];
            bool closed = false;
            if (ready[i].events & (EPOLLIN | EPOLLHUP | EPOLLERR)) {
                ssize_t n;
                while ((n = read(fd, chunk.data(), chunk.size())) > 0)
                    peer.in.insert(peer.in.end(), chunk.begin(), chunk.begin() + n);
                closed = n == 0 || (n < 0 && errno != EAGAIN);
                size_t at = 0;
                while (peer.in.size() - at >= kRawHeaderBytes) {
                    size_t whole = kRawHeaderBytes + readLe32(peer.in.data() + at);
                    if (peer.in.size() - at < whole) break;
                    peer.out.insert(peer.out.end(), reply.begin(), reply.end());
                    at += whole;
                }
                peer.in.erase(peer.in.begin(), peer.in.begin() + static_cast<ptrdiff_t>(at));
            }
            if (!closed && !peer.out.empty()) {
                ssize_t n = write(fd, peer.out.data(), peer.out.size());
                if (n > 0) peer.out.erase(peer.out.begin(), peer.out.begin() + n);
                if (n < 0 && errno != EAGAIN) closed = true;
                epoll_event mod{};
                mod.events = peer.out.empty() ? EPOLLIN : EPOLLIN | EPOLLOUT;
                mod.data.fd = fd;
                epoll_ctl(epoll, EPOLL_CTL_MOD, fd, &mod);
            }
            if (closed) {
                epoll_ctl(epoll, EPOLL_CTL_DEL, fd, nullptr);
                close(fd);
                peers.erase(fd);
            }
        }
    }
}

// ---- the exchanges ----------------------------------------------------------------------------------------------

// What one client sends and how it checks what comes back.
struct Exchange {
    std::string socketPath;
    bool zem = false;
    std::vector<uint8_t> request;  // a whole message, header included
    size_t replyBytes = 0;         // the whole reply, header included
};

// The first reply of each client is decoded in full: the run measures nothing unless bxd really answered.
void checkFirstReply(const std::vector<uint8_t>& frame, uint32_t payloadLength) {
    Result<Value> body =
        ZemCodec::decode(std::span<const uint8_t>(frame.data() + ZemFrame::kHeaderBytes, payloadLength));
    const Value* code = body ? body->find("errorcode") : nullptr;
    if (!code || code->getUInt64() != std::optional<uint64_t>(4)) {
        fprintf(stderr, "bxd_load_bench: bxd's reply is not the expected error: %s\n",
                body ? body->description().c_str() : body.error().description().c_str());
        exit(1);
    }
}

// One client: connects, waits for the start signal, makes `warmUp` untimed and `count` timed round trips, and
// stores each timed round trip in nanoseconds into `latencies`; `span` gets the first send and the last reply.
void runClient(const Exchange& exchange, unsigned warmUp, unsigned count, int startPipe, uint32_t* latencies,
               int64_t* span) {
    int fd = connectTo(exchange.socketPath);
    if (fd < 0) die("connect");
    std::vector<uint8_t> request = exchange.request;
    std::vector<uint8_t> reply(exchange.replyBytes);
    char go;
    if (read(startPipe, &go, 1) < 0) die("start pipe");

    uint64_t serial = 0;
    for (unsigned i = 0; i < warmUp + count; ++i) {
        Clock::time_point start = Clock::now();
        if (exchange.zem) {
            ZemFrameHeader header{ZemFrameKind::Request, ++serial, 0,
                                  static_cast<uint32_t>(request.size() - ZemFrame::kHeaderBytes)};
            ZemFrame::encodeHeader(header,
                                   std::span<uint8_t, ZemFrame::kHeaderBytes>(request.data(), ZemFrame::kHeaderBytes));
            writeAll(fd, request.data(), request.size());
            readMessage(fd, reply, ZemFrame::kHeaderBytes, [](const uint8_t* h) {
                Result<ZemFrameHeader> decoded =
                    ZemFrame::decodeHeader(std::span<const uint8_t, ZemFrame::kHeaderBytes>(h, ZemFrame::kHeaderBytes));
                if (!decoded) {
                    fprintf(stderr, "bxd_load_bench: bad reply header from bxd\n");
                    exit(1);
                }
                return decoded->payloadLength;
            });
            Result<ZemFrameHeader> header2 = ZemFrame::decodeHeader(
                std::span<const uint8_t, ZemFrame::kHeaderBytes>(reply.data(), ZemFrame::kHeaderBytes));
            if (header2->kind != ZemFrameKind::Reply || header2->inReplyTo != serial) {
                fprintf(stderr, "bxd_load_bench: reply does not answer request #%llu\n",
                        static_cast<unsigned long long>(serial));
                exit(1);
            }
            if (i == 0) checkFirstReply(reply, header2->payloadLength);
        } else {
            writeAll(fd, request.data(), request.size());
            readMessage(fd, reply, kRawHeaderBytes, [](const uint8_t* h) { return readLe32(h); });
        }
        Clock::time_point end = Clock::now();
        if (i == warmUp) span[0] = start.time_since_epoch().count();
        if (i >= warmUp) {
            auto ns = std::chrono::duration_cast<std::chrono::nanoseconds>(end - start).count();
            latencies[i - warmUp] = static_cast<uint32_t>(std::min<int64_t>(ns, UINT32_MAX));
        }
        if (i + 1 == warmUp + count) span[1] = end.time_since_epoch().count();
    }
    close(fd);
}

struct RoundResult {
    std::vector<uint32_t> latencies;
    double seconds = 0;  // from the first timed send of any client to the last timed reply of any client
};

RoundResult runRound(const Exchange& exchange, const Options& options) {
    const size_t total = static_cast<size_t>(options.clients) * options.requests;
    size_t bytes = total * sizeof(uint32_t) + options.clients * 2 * sizeof(int64_t);
    void* shared = mmap(nullptr, bytes, PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
    if (shared == MAP_FAILED) die("mmap");
    auto* latencies = static_cast<uint32_t*>(shared);
    auto* spans = reinterpret_cast<int64_t*>(latencies + total + (total % 2));
    int start[2];
    if (pipe2(start, O_CLOEXEC) != 0) die("pipe");

    std::vector<pid_t> children;
    for (unsigned c = 0; c < options.clients; ++c) {
        pid_t child = fork();
        if (child < 0) die("fork");
        if (child == 0) {
            close(start[1]);
            runClient(exchange, kWarmUpRequests, options.requests, start[0],
                      latencies + static_cast<size_t>(c) * options.requests, spans + 2 * c);
            _exit(0);
        }
        children.push_back(child);
    }
    close(start[0]);
    // Give every client time to connect, then release them all at once by closing the pipe.
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    close(start[1]);
    bool failed = false;
    for (pid_t child : children) {
        int status = 0;
        waitpid(child, &status, 0);
        if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) failed = true;
    }
    if (failed) {
        fprintf(stderr, "bxd_load_bench: a client failed\n");
        exit(1);
    }
    RoundResult result;
    result.latencies.assign(latencies, latencies + total);
    int64_t first = INT64_MAX, last = INT64_MIN;
    for (unsigned c = 0; c < options.clients; ++c) {
        first = std::min(first, spans[2 * c]);
        last = std::max(last, spans[2 * c + 1]);
    }
    result.seconds = std::chrono::duration<double>(Clock::duration(last - first)).count();
    munmap(shared, bytes);
    return result;
}

struct Summary {
    double p50Us = 0;
    double p99Us = 0;
    double perSecond = 0;
};

Summary summarise(std::vector<uint32_t> latencies, double seconds) {
    Summary summary;
    if (latencies.empty()) return summary;
    auto at = [&](double fraction) {
        size_t index = std::min(latencies.size() - 1, static_cast<size_t>(fraction * latencies.size()));
        std::nth_element(latencies.begin(), latencies.begin() + static_cast<ptrdiff_t>(index), latencies.end());
        return latencies[index] / 1000.0;
    };
    summary.p50Us = at(0.50);
    summary.p99Us = at(0.99);
    summary.perSecond = seconds > 0 ? latencies.size() / seconds : 0;
    return summary;
}

// ---- the servers ------------------------------------------------------------------------------------------------

pid_t startBxd(const std::string& binary, const fs::path& root) {
    pid_t child = fork();
    if (child < 0) die("fork");
    if (child == 0) {
        setenv("BX_SERVICE_DIR", (root / "service").c_str(), 1);
        setenv("BX_STATE_DIR", (root / "state").c_str(), 1);
        setenv("BX_RUNTIME_DIR", (root / "runtime").c_str(), 1);
        setenv("BX_ENTITLEMENTS_DIR", (root / "entitlements.d").c_str(), 1);
        setenv("BX_LOG_SINK", "stderr", 1);
        int log = open((root / "bxd.log").c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
        if (log >= 0) {
            dup2(log, STDERR_FILENO);
            dup2(log, STDOUT_FILENO);
        }
        execl(binary.c_str(), binary.c_str(), static_cast<char*>(nullptr));
        _exit(127);
    }
    return child;
}

void stopProcess(pid_t pid) {
    if (pid <= 0) return;
    kill(pid, SIGTERM);
    waitpid(pid, nullptr, 0);
}

unsigned cpusAvailable() {
    cpu_set_t set;
    CPU_ZERO(&set);
    if (sched_getaffinity(0, sizeof set, &set) != 0) return 0;
    return static_cast<unsigned>(CPU_COUNT(&set));
}

}  // namespace

int main(int argc, char** argv) {
    Options options = parseOptions(argc, argv);
    const bool wantBxd = options.mode != Mode::Raw;
    const bool wantRaw = options.mode != Mode::Bxd;

    // The request bxd gets, and the reply it gives to a request name it does not know.
    MutableDictionary body;
    body.set("request", Value::string("bench"));
    body.set("version", Value::uint64(3));
    body.set("pad", Value::data(std::vector<uint8_t>(options.payload, 0xA5)));
    Exchange bxd;
    bxd.zem = true;
    if (ZemFrame::encode(ZemFrameKind::Request, 1, 0, body.take(), bxd.request)) die("encoding the request");
    MutableDictionary expectedReply;
    expectedReply.set("errorcode", Value::uint64(4));
    expectedReply.set("error", Value::string("unrecognized request"));
    std::vector<uint8_t> replyFrame;
    if (ZemFrame::encode(ZemFrameKind::Reply, 0, 1, expectedReply.take(), replyFrame)) die("encoding the reply");
    bxd.replyBytes = replyFrame.size();

    Exchange raw;
    raw.request.assign(bxd.request.size(), 0x5A);
    writeLe32(raw.request.data(), static_cast<uint32_t>(raw.request.size() - kRawHeaderBytes));
    raw.replyBytes = bxd.replyBytes;

    std::string pattern = (fs::temp_directory_path() / "bxd-load-XXXXXX").string();
    if (!mkdtemp(pattern.data())) die("mkdtemp");
    fs::path root = pattern;
    for (const char* sub : {"service", "state", "runtime", "entitlements.d"}) fs::create_directories(root / sub);
    bxd.socketPath = (root / "service" / kServiceName).string();
    raw.socketPath = (root / "echo.sock").string();

    signal(SIGPIPE, SIG_IGN);
    pid_t bxdPid = -1, echoPid = -1;
    auto cleanUp = [&] {
        stopProcess(bxdPid);
        stopProcess(echoPid);
        std::error_code ignored;
        fs::remove_all(root, ignored);
    };
    if (wantBxd) {
        if (access(options.bxdPath.c_str(), X_OK) != 0) {
            fprintf(stderr, "bxd_load_bench: no bxd at %s (use --bxd PATH)\n", options.bxdPath.c_str());
            cleanUp();
            return 1;
        }
        bxdPid = startBxd(options.bxdPath, root);
        if (!waitUntilConnectable(bxd.socketPath, bxdPid)) {
            fprintf(stderr, "bxd_load_bench: bxd did not come up; its log:\n");
            std::string command = "cat '" + (root / "bxd.log").string() + "' >&2";
            if (system(command.c_str()) != 0) fprintf(stderr, "(no log)\n");
            cleanUp();
            return 1;
        }
    }
    if (wantRaw) {
        echoPid = fork();
        if (echoPid < 0) die("fork");
        if (echoPid == 0) runEchoServer(raw.socketPath, raw.replyBytes);
        if (!waitUntilConnectable(raw.socketPath, echoPid)) {
            fprintf(stderr, "bxd_load_bench: the echo server did not come up\n");
            cleanUp();
            return 1;
        }
    }

    std::vector<uint32_t> bxdLatencies, rawLatencies;
    double bxdSeconds = 0, rawSeconds = 0;
    for (unsigned round = 0; round < options.rounds; ++round) {
        if (wantRaw) {
            RoundResult r = runRound(raw, options);
            rawLatencies.insert(rawLatencies.end(), r.latencies.begin(), r.latencies.end());
            rawSeconds += r.seconds;
        }
        if (wantBxd) {
            RoundResult r = runRound(bxd, options);
            bxdLatencies.insert(bxdLatencies.end(), r.latencies.begin(), r.latencies.end());
            bxdSeconds += r.seconds;
        }
    }
    cleanUp();

    printf(
        "bxd_load_bench: %u client%s x %u requests x %u rounds, payload %zu bytes (request %zu bytes, reply %zu "
        "bytes), %u CPU%s usable\n",
        options.clients, options.clients == 1 ? "" : "s", options.requests, options.rounds, options.payload,
        bxd.request.size(), bxd.replyBytes, cpusAvailable(), cpusAvailable() == 1 ? "" : "s");
    printf("%-24s %10s %10s %12s\n", "", "p50 us", "p99 us", "requests/s");
    Summary rawSummary = summarise(std::move(rawLatencies), rawSeconds);
    Summary bxdSummary = summarise(std::move(bxdLatencies), bxdSeconds);
    if (wantRaw)
        printf("%-24s %10.2f %10.2f %12.0f\n", "raw unix ping-pong", rawSummary.p50Us, rawSummary.p99Us,
               rawSummary.perSecond);
    if (wantBxd)
        printf("%-24s %10.2f %10.2f %12.0f\n", "bxd", bxdSummary.p50Us, bxdSummary.p99Us, bxdSummary.perSecond);
    if (wantRaw && wantBxd)
        printf("%-24s %9.2fx %9.2fx %11.2fx\n", "bxd / raw", bxdSummary.p50Us / rawSummary.p50Us,
               bxdSummary.p99Us / rawSummary.p99Us, bxdSummary.perSecond / rawSummary.perSecond);
    return 0;
}
