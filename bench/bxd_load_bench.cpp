// End-to-end load on the real bxd: N client processes each make M blocking round trips through the daemon, and, in
// the same run, the same number of round trips with equally sized messages through a raw epoll echo server over a
// Unix stream socket. It prints p50 and p99 round trip and requests per second of each, and each one's ratio to raw.
//
//     cmake --build --preset release --target bxd bxd_load_bench
//     build/release/bench/bxd_load_bench [--clients 1,8] [--requests M] [--rounds R] [--mode raw,frames,lib]
//                                        [--payload BYTES] [--bxd PATH]
//
// The daemon is the real binary, started here in a private temporary service directory. It is driven two ways:
//   frames  the clients speak the wire protocol directly (a request frame written with ZemFrame, the reply frame read
//           back), so what is measured is the daemon and the kernel, not a client library;
//   lib     the clients are applications of the shared library libbexil: each holds one DaemonClient and waits for
//           every reply with its wait(), as a program that needs the answer before going on does. The difference
//           to "frames" is the library's own cost: building the request, encoding it, reading and decoding the
//           reply (on the waiting thread itself while the connection is otherwise idle), handing it back.
// Both send the request the library builds for "ready" with no plug-ins, byte for byte the same: bxd answers it
// without touching a plug-in (the reply it gave is printed with the figures), after the whole path of any request:
// frame cutting, decoding, the request queue, the envelope checks, the handler table, the reply and its encoding. The
// raw side sends as many bytes as that request frame and answers with as many as bxd's reply. --payload BYTES makes
// the request, on every side, the library's "match" for an extension point nobody offers with BYTES of padding in
// its rules (the large-request case, e.g. --payload 1048576); bxd decodes it whole and answers with no matches.
// --reply-payload BYTES registers plug-ins whose forms add up to about BYTES and makes the request, on every side,
// the library's "match" of them (the large-reply case); the raw side then answers with as many bytes. With either,
// the library side sends what DaemonClient::match sends, which asks for pages: bxd then takes its paged path (it
// binds a continuation to the rules), which the frames side's unpaged "match" does not.
//
// Clients, the echo server and bxd are all processes forked from this one, so `taskset -c 0 bxd_load_bench ...`
// pins every one of them to one CPU (the CPU cost alone), while an unpinned run shows what wake-ups across CPUs add.
// Rounds alternate raw, frames and lib so that drift in the machine's speed hits all alike. The default runs 1 and
// then 8 clients, each for 3 rounds of 20,000 requests per client and side.

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

#include "BxdBench.h"
#include "base/Document.h"
#include "bexil/DaemonClient.h"
#include "bexil/Value.h"
#include "platform/zem/ZemCodec.h"
#include "platform/zem/ZemFrame.h"

namespace {

namespace fs = std::filesystem;
using namespace bexil;
using namespace bexil::bench;
using Clock = std::chrono::steady_clock;

// Round trips each client makes before timing starts (connection set-up, caches, the daemon's first allocations).
constexpr unsigned kWarmUpRequests = 200;
// The raw protocol's header: a little-endian u32 with the number of bytes that follow.
constexpr size_t kRawHeaderBytes = 4;
// How long bxd or the echo server may take to accept connections before the run is given up.
constexpr auto kStartTimeout = std::chrono::seconds(10);
// The largest payload a run may ask for; far below the frame limit, and big enough for any realistic request.
constexpr size_t kMaxPayloadBytes = 1024 * 1024;

// The three ways a round trip is made: through the echo server, through bxd with hand-written frames, through bxd
// with libbexil.
enum class Side { Raw, Frames, Library };
constexpr Side kSides[] = {Side::Raw, Side::Frames, Side::Library};

const char* sideName(Side side) {
    switch (side) {
        case Side::Raw:
            return "raw unix ping-pong";
        case Side::Frames:
            return "bxd, hand-written frames";
        case Side::Library:
            return "bxd, through libbexil";
    }
    return "";
}

struct Options {
    std::vector<unsigned> clients{1, 8};
    unsigned requests = 20000;
    size_t payload = 0;
    size_t replyPayload = 0;
    unsigned rounds = 3;
    bool sides[3] = {true, true, true};  // indexed by Side
    std::string bxdPath;

    bool wants(Side side) const { return sides[static_cast<int>(side)]; }
};

[[noreturn]] void usage() {
    fputs(
        "Usage: bxd_load_bench [--clients N[,N...]] [--requests M] [--rounds R] [--mode SIDE[,SIDE...]]\n"
        "                      [--payload BYTES | --reply-payload BYTES] [--bxd PATH]\n"
        "SIDE is raw, frames or lib (also: bxd = frames, both = raw,frames, all = every side).\n",
        stderr);
    exit(2);
}

unsigned long parseNumber(const char* text, unsigned long max) {
    std::optional<unsigned long> value = parsePositive(text, max);
    if (!value) usage();
    return *value;
}

Options parseOptions(int argc, char** argv) {
    static const option kLong[] = {
        {"clients", required_argument, nullptr, 'c'}, {"requests", required_argument, nullptr, 'n'},
        {"payload", required_argument, nullptr, 'p'}, {"reply-payload", required_argument, nullptr, 'P'},
        {"rounds", required_argument, nullptr, 'r'},  {"mode", required_argument, nullptr, 'm'},
        {"bxd", required_argument, nullptr, 'b'},     {nullptr, 0, nullptr, 0},
    };
    Options options;
    int c;
    while ((c = getopt_long(argc, argv, "", kLong, nullptr)) != -1) {
        switch (c) {
            case 'c':
                options.clients.clear();
                for (const std::string& count : splitList(optarg))
                    options.clients.push_back(static_cast<unsigned>(parseNumber(count.c_str(), 1024)));
                break;
            case 'n':
                options.requests = static_cast<unsigned>(parseNumber(optarg, 100'000'000));
                break;
            case 'p':
                options.payload = parseNumber(optarg, kMaxPayloadBytes);
                break;
            case 'P':
                options.replyPayload = parseNumber(optarg, kMaxPayloadBytes);
                break;
            case 'r':
                options.rounds = static_cast<unsigned>(parseNumber(optarg, 100));
                break;
            case 'm': {
                bool sides[3] = {false, false, false};
                for (const std::string& side : splitList(optarg)) {
                    if (side == "raw" || side == "both" || side == "all") sides[static_cast<int>(Side::Raw)] = true;
                    if (side == "frames" || side == "bxd" || side == "both" || side == "all")
                        sides[static_cast<int>(Side::Frames)] = true;
                    if (side == "lib" || side == "all") sides[static_cast<int>(Side::Library)] = true;
                    if (side != "raw" && side != "frames" && side != "bxd" && side != "lib" && side != "both" &&
                        side != "all")
                        usage();
                }
                std::copy(std::begin(sides), std::end(sides), std::begin(options.sides));
                break;
            }
            case 'b':
                options.bxdPath = optarg;
                break;
            default:
                usage();
        }
    }
    if (optind < argc || (options.payload > 0 && options.replyPayload > 0)) usage();
    if (options.bxdPath.empty()) options.bxdPath = bench::defaultBxdPath();
    return options;
}

// ---- socket helpers -------------------------------------------------------------------------------------------

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
    Side side = Side::Raw;
    std::string socketPath;        // raw and frames
    std::string serviceDirectory;  // lib: where the library looks for bxd's service
    std::vector<uint8_t> request;  // raw and frames: a whole message, header included
    size_t replyBytes = 0;         // raw and frames: the whole reply, header included
    std::string expectedReply;     // frames and lib: the description of the reply bxd gave the probe
    Value matchRules;              // lib, with --payload or --reply-payload: the rules of its "match"
};

// The first reply of each client is decoded in full: the run measures nothing unless bxd really answered, and
// answered what it answered the probe.
void checkFirstReply(const Exchange& exchange, const std::string& description) {
    if (description != exchange.expectedReply) {
        fprintf(stderr, "bxd_load_bench: %s: bxd's reply %s is not the probe's %s\n", sideName(exchange.side),
                description.c_str(), exchange.expectedReply.c_str());
        exit(1);
    }
}

std::string describeReplyFrame(const std::vector<uint8_t>& frame, uint32_t payloadLength) {
    Result<Value> body =
        ZemCodec::decode(std::span<const uint8_t>(frame.data() + ZemFrame::kHeaderBytes, payloadLength));
    return body ? body->description() : "undecodable: " + body.error().description();
}

// The request the library builds for "ready" with no plug-ins, key for key in its order.
Value readyRequest() {
    MutableDictionary body;
    body.set("request", Value::string("ready"));
    body.set("version", Value::uint64(3));
    body.set("flags", Value::uint64(0));
    body.set("uuids", Value::emptyArray());
    return body.take();
}

// With --payload: rules for an extension point nobody offers, carrying `padding` bytes under a key of their own, so
// that the request is as large as asked for and bxd still answers it after decoding all of it (no candidate, so
// the rules are never evaluated against a plug-in).
Value paddedRules(size_t padding) {
    return Value::dictionary({{"RZExtensionPointIdentifier", Value::string("com.example.load.nobody")},
                              {"pad", Value::data(std::vector<uint8_t>(padding, 0xA5))}});
}

// The request the library builds for "match" with `rules` and no flags, key for key in its order.
Value matchRequest(const Value& rules) {
    MutableDictionary body;
    body.set("request", Value::string("match"));
    body.set("version", Value::uint64(3));
    body.set("rules", rules);
    body.set("flags", Value::uint64(0));
    return body.take();
}

// With --reply-payload: the point of the plug-ins registered so that its match answers with about that many bytes.
const Value kLargeReplyRules =
    Value::dictionary({{"RZExtensionPointIdentifier", Value::string("com.example.load.large")}});
constexpr size_t kPaddingPerPlugIn = 64 * 1024;

// Writes Load.app with enough plug-ins of the large-reply point, each carrying kPaddingPerPlugIn bytes in its
// attributes (which every form of the match reply carries twice: in its bundle information and its attributes),
// and registers them through a hand-written "add".
void registerLargeReplyPlugIns(const fs::path& root, const std::string& socketPath, size_t replyBytes) {
    const fs::path app = root / "bundles" / "Load.app";
    fs::create_directories(app / "PlugIns");
    if (Document::writeFileAtomically(app / "Info.vrec",
                                      Value::dictionary({{"BDBundleIdentifier", Value::string("com.example.load")}})))
        die("writing Load.app");
    std::vector<Value> paths;
    for (size_t i = 0; i * 2 * kPaddingPerPlugIn < replyBytes; ++i) {
        fs::path bundle = app / "PlugIns" / ("P" + std::to_string(i) + ".bxplugin");
        fs::create_directories(bundle);
        Value attributes =
            Value::dictionary({{"RZExtensionVersion", Value::string("1")},
                               {"Pad", Value::data(std::vector<uint8_t>(kPaddingPerPlugIn, static_cast<uint8_t>(i)))}});
        Value info = Value::dictionary(
            {{"BDBundleIdentifier", Value::string("com.example.load.p" + std::to_string(i))},
             {"BDBundleVersion", Value::string("1")},
             {"RZExtension", Value::dictionary({{"PrincipalClass", Value::string("Load")},
                                                {"RZExtensionPointIdentifier", Value::string("com.example.load.large")},
                                                {"RZExtensionProtocol", Value::string("Loading")},
                                                {"RZExtensionAttributes", attributes}})}});
        if (Document::writeFileAtomically(bundle / "Info.vrec", info)) die("writing a plug-in");
        paths.push_back(Value::string(bundle.string()));
    }
    Value add = Value::dictionary(
        {{"request", Value::string("add")}, {"version", Value::uint64(3)}, {"paths", Value::array(std::move(paths))}});
    std::vector<uint8_t> frame;
    if (ZemFrame::encode(ZemFrameKind::Request, 1, 0, add, frame)) die("encoding the registration");
    int fd = connectTo(socketPath);
    if (fd < 0) die("connect");
    writeAll(fd, frame.data(), frame.size());
    std::vector<uint8_t> reply(ZemFrame::kHeaderBytes);
    readMessage(fd, reply, ZemFrame::kHeaderBytes, [](const uint8_t* h) {
        return ZemFrame::decodeHeader(std::span<const uint8_t, ZemFrame::kHeaderBytes>(h, ZemFrame::kHeaderBytes))
            ->payloadLength;
    });
    close(fd);
}

// A client process of the library side: an application with one DaemonClient that waits for every reply.
void runLibraryClient(const Exchange& exchange, unsigned warmUp, unsigned count, int startPipe, uint32_t* latencies,
                      int64_t* span) {
    setenv("BX_SERVICE_DIR", exchange.serviceDirectory.c_str(), 1);
    // Never destroyed: the process ends with _exit when this returns, and the kernel closes the connection. Closing
    // it through the library would log a line about the cancelled connection into the figures' output.
    DaemonClient& client = *new DaemonClient(kBxdServiceName);
    char go;
    if (read(startPipe, &go, 1) < 0) die("start pipe");
    const std::vector<Uuid> none;
    for (unsigned i = 0; i < warmUp + count; ++i) {
        Clock::time_point start = Clock::now();
        DaemonClient::Reply reply = client.wait([&](DaemonClient::Callback done) {
            if (exchange.matchRules.isNull())
                client.ready(none, done);
            else
                client.match(exchange.matchRules, 0, done);
        });
        Clock::time_point end = Clock::now();
        if (reply.connectionFailed) {
            fprintf(stderr, "bxd_load_bench: libbexil lost bxd: %s\n", reply.error->description().c_str());
            exit(1);
        }
        if (i == 0) checkFirstReply(exchange, reply.message.description());
        if (i == warmUp) span[0] = start.time_since_epoch().count();
        if (i >= warmUp) {
            auto ns = std::chrono::duration_cast<std::chrono::nanoseconds>(end - start).count();
            latencies[i - warmUp] = static_cast<uint32_t>(std::min<int64_t>(ns, UINT32_MAX));
        }
        if (i + 1 == warmUp + count) span[1] = end.time_since_epoch().count();
    }
}

// One client: connects, waits for the start signal, makes `warmUp` untimed and `count` timed round trips, and
// stores each timed round trip in nanoseconds into `latencies`; `span` gets the first send and the last reply.
void runClient(const Exchange& exchange, unsigned warmUp, unsigned count, int startPipe, uint32_t* latencies,
               int64_t* span) {
    if (exchange.side == Side::Library) {
        runLibraryClient(exchange, warmUp, count, startPipe, latencies, span);
        return;
    }
    int fd = connectTo(exchange.socketPath);
    if (fd < 0) die("connect");
    std::vector<uint8_t> request = exchange.request;
    std::vector<uint8_t> reply(exchange.replyBytes);
    char go;
    if (read(startPipe, &go, 1) < 0) die("start pipe");

    uint64_t serial = 0;
    for (unsigned i = 0; i < warmUp + count; ++i) {
        Clock::time_point start = Clock::now();
        if (exchange.side == Side::Frames) {
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
            if (i == 0) checkFirstReply(exchange, describeReplyFrame(reply, header2->payloadLength));
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

RoundResult runRound(const Exchange& exchange, unsigned clients, const Options& options) {
    const size_t total = static_cast<size_t>(clients) * options.requests;
    size_t bytes = (total + 1) * sizeof(uint32_t) + clients * 2 * sizeof(int64_t);
    void* shared = mmap(nullptr, bytes, PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
    if (shared == MAP_FAILED) die("mmap");
    auto* latencies = static_cast<uint32_t*>(shared);
    auto* spans = reinterpret_cast<int64_t*>(latencies + total + (total % 2));
    int start[2];
    if (pipe2(start, O_CLOEXEC) != 0) die("pipe");

    std::vector<pid_t> children;
    for (unsigned c = 0; c < clients; ++c) {
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
    for (unsigned c = 0; c < clients; ++c) {
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
        bench::enterPrivateBxdEnvironment(root);
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
    bench::programName = "bxd_load_bench";
    Options options = parseOptions(argc, argv);

    std::string pattern = (fs::temp_directory_path() / "bxd-load-XXXXXX").string();
    if (!mkdtemp(pattern.data())) die("mkdtemp");
    fs::path root = pattern;
    for (const char* sub : {"service", "state", "runtime", "entitlements.d"}) fs::create_directories(root / sub);

    Exchange exchanges[3];
    Exchange& raw = exchanges[static_cast<int>(Side::Raw)];
    Exchange& frames = exchanges[static_cast<int>(Side::Frames)];
    Exchange& library = exchanges[static_cast<int>(Side::Library)];
    raw.side = Side::Raw;
    frames.side = Side::Frames;
    library.side = Side::Library;
    if (options.payload > 0) library.matchRules = paddedRules(options.payload);
    if (options.replyPayload > 0) library.matchRules = kLargeReplyRules;
    const Value request = library.matchRules.isNull() ? readyRequest() : matchRequest(library.matchRules);
    if (ZemFrame::encode(ZemFrameKind::Request, 1, 0, request, frames.request)) die("encoding the request");
    frames.socketPath = (root / "service" / kBxdServiceName).string();
    library.serviceDirectory = (root / "service").string();
    raw.socketPath = (root / "echo.sock").string();

    signal(SIGPIPE, SIG_IGN);
    pid_t bxdPid = -1, echoPid = -1;
    auto cleanUp = [&] {
        stopProcess(bxdPid);
        stopProcess(echoPid);
        std::error_code ignored;
        fs::remove_all(root, ignored);
    };
    // bxd runs even for the raw side alone: its reply to the probe sets the size of the raw side's replies.
    if (access(options.bxdPath.c_str(), X_OK) != 0) {
        fprintf(stderr, "bxd_load_bench: no bxd at %s (use --bxd PATH)\n", options.bxdPath.c_str());
        cleanUp();
        return 1;
    }
    bxdPid = startBxd(options.bxdPath, root);
    if (!waitUntilConnectable(frames.socketPath, bxdPid)) {
        fprintf(stderr, "bxd_load_bench: bxd did not come up; its log:\n");
        std::string command = "cat '" + (root / "bxd.log").string() + "' >&2";
        if (system(command.c_str()) != 0) fprintf(stderr, "(no log)\n");
        cleanUp();
        return 1;
    }

    if (options.replyPayload > 0) registerLargeReplyPlugIns(root, frames.socketPath, options.replyPayload);

    // The probe: one hand-written request, whose reply every later first reply must equal.
    {
        int fd = connectTo(frames.socketPath);
        if (fd < 0) die("connect");
        writeAll(fd, frames.request.data(), frames.request.size());
        std::vector<uint8_t> reply(ZemFrame::kHeaderBytes);
        uint32_t payloadLength = 0;
        readMessage(fd, reply, ZemFrame::kHeaderBytes, [&](const uint8_t* h) {
            Result<ZemFrameHeader> header =
                ZemFrame::decodeHeader(std::span<const uint8_t, ZemFrame::kHeaderBytes>(h, ZemFrame::kHeaderBytes));
            if (!header || header->kind != ZemFrameKind::Reply || header->inReplyTo != 1) {
                fprintf(stderr, "bxd_load_bench: bad reply to the probe\n");
                exit(1);
            }
            payloadLength = header->payloadLength;
            return payloadLength;
        });
        close(fd);
        frames.replyBytes = ZemFrame::kHeaderBytes + payloadLength;
        frames.expectedReply = describeReplyFrame(reply, payloadLength);
        library.expectedReply = frames.expectedReply;
    }

    raw.request.assign(frames.request.size(), 0x5A);
    writeLe32(raw.request.data(), static_cast<uint32_t>(raw.request.size() - kRawHeaderBytes));
    raw.replyBytes = frames.replyBytes;
    if (options.wants(Side::Raw)) {
        echoPid = fork();
        if (echoPid < 0) die("fork");
        if (echoPid == 0) runEchoServer(raw.socketPath, raw.replyBytes);
        if (!waitUntilConnectable(raw.socketPath, echoPid)) {
            fprintf(stderr, "bxd_load_bench: the echo server did not come up\n");
            cleanUp();
            return 1;
        }
    }

    struct Measured {
        unsigned clients;
        Summary summaries[3];
    };
    std::vector<Measured> results;
    for (unsigned clients : options.clients) {
        std::vector<uint32_t> latencies[3];
        double seconds[3] = {0, 0, 0};
        for (unsigned round = 0; round < options.rounds; ++round) {
            for (Side side : kSides) {
                if (!options.wants(side)) continue;
                int i = static_cast<int>(side);
                RoundResult r = runRound(exchanges[i], clients, options);
                latencies[i].insert(latencies[i].end(), r.latencies.begin(), r.latencies.end());
                seconds[i] += r.seconds;
            }
        }
        Measured measured{clients, {}};
        for (Side side : kSides) {
            int i = static_cast<int>(side);
            measured.summaries[i] = summarise(std::move(latencies[i]), seconds[i]);
        }
        results.push_back(measured);
    }
    cleanUp();

    printf("bxd_load_bench: %u rounds x %u requests per client and side, %u CPU%s usable\n", options.rounds,
           options.requests, cpusAvailable(), cpusAvailable() == 1 ? "" : "s");
    printf("request: %s, %zu bytes; reply %zu bytes: %s\n",
           options.payload > 0        ? "\"match\" with padded rules"
           : options.replyPayload > 0 ? "\"match\" of large plug-ins"
                                      : "\"ready\" with no plug-ins",
           frames.request.size(), frames.replyBytes, frames.expectedReply.c_str());
    struct Ratio {
        const char* name;
        Side over;
        Side under;
    };
    const Ratio ratios[] = {
        {"frames / raw", Side::Frames, Side::Raw},
        {"libbexil / raw", Side::Library, Side::Raw},
        {"libbexil / frames", Side::Library, Side::Frames},
    };
    for (const Measured& measured : results) {
        char title[32];
        snprintf(title, sizeof title, "%u client%s", measured.clients, measured.clients == 1 ? "" : "s");
        printf("\n%-26s %10s %10s %12s\n", title, "p50 us", "p99 us", "requests/s");
        for (Side side : kSides) {
            if (!options.wants(side)) continue;
            const Summary& summary = measured.summaries[static_cast<int>(side)];
            printf("%-26s %10.2f %10.2f %12.0f\n", sideName(side), summary.p50Us, summary.p99Us, summary.perSecond);
        }
        for (const Ratio& ratio : ratios) {
            if (!options.wants(ratio.over) || !options.wants(ratio.under)) continue;
            const Summary& over = measured.summaries[static_cast<int>(ratio.over)];
            const Summary& under = measured.summaries[static_cast<int>(ratio.under)];
            printf("%-26s %9.2fx %9.2fx %11.2fx\n", ratio.name, over.p50Us / under.p50Us, over.p99Us / under.p99Us,
                   over.perSecond / under.perSecond);
        }
    }
    return 0;
}
