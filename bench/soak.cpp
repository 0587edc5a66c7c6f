// A soak run of the real bxd: many client processes mix every request for a given time while a supervisor kills
// clients at random in the middle of their requests and starts new ones, and at the end the run says whether every
// request got its reply and whether bxd stayed alive, clean and flat in memory and descriptors.
//
//     cmake --build --preset release --target bxd hello-plugin soak
//     build/release/bench/soak [--seconds S] [--clients N] [--bxd PATH] [--keep]
//
// --seconds defaults to 60, --clients (8 to 64) to 16, --bxd to the bxd built beside this program; give it the
// debug preset's bxd (build/debug/src/daemon/bxd, AddressSanitizer and UBSan; set ASAN_OPTIONS=detect_leaks=1)
// to soak the sanitized daemon. --keep leaves the private root (bxd's log, the clients' log) in place; it is kept
// anyway when the run fails.
//
// Set-up: a private root with the example bundles, Hello's real executable (examples/plugins) in Greeter.app,
// Many.app with 50 generated plug-ins (three of them busy: a process assertion is recorded for each), Churn.app with
// 5 that managers unregister and register again, and an entitlements document that makes a copy of this program a
// manager. bxd logs only errors there (BXD_LOG_LEVEL=error unless set) to its own stderr, root/bxd.log.
//
// The clients are separate processes, this program executed again: even slots speak through libbexil, odd ones in
// hand-written Zem frames (and only those send malformed requests, and sometimes write a frame in two pieces so a
// kill can land inside one); slots 2 and 3 of every 8 run the manager copy. Each one loops over a weighted mix of
// every request: "add" (also of bad paths), "remove" (refused with code 11 unless manager), "bulk", "match" (with
// and without rules, discover-all), "ready", "access", "annotate", "bulk-annotate", "lock" (holds of applications
// and of plug-ins with flags 0x1, 0x2 and 0x4; some released by UUID, some never), "holds", "launch" (when
// bubblewrap works here: a line is exchanged with Hello, whose socket is closed at the client's next launch, so that
// instances run while others hold with 0x2 and 0x4), an unknown request name, a wrong or missing version, a frame
// whose payload is not a dictionary and a one-way message. Requests whose answer is fixed by the protocol (refusals
// for lack of the entitlement, malformed requests, releases) are checked. Once a second the supervisor kills one
// client with SIGKILL and starts another in its slot.
//
// It prints the requests sent and answered by kind, the errors by code, timeouts (no reply within 10 s), lost
// replies (the connection ended under a live client), wrong answers, and bxd's resident memory and open descriptors
// at the start, the middle, the end and once the clients are gone, with the ratio end/middle; then it stops bxd with
// SIGTERM and reports its exit status, any process of a plug-in sandbox that outlived it (ended then) and any
// sanitizer report on its stderr. It exits non-zero when bxd died, a reply was missing or late, an answer was wrong,
// a sandbox process outlived bxd, or a sanitizer reported. Once the clients are gone bxd may still hold a few more
// descriptors than at the start: the pidfds of ended hosts whose grants it drops at the next "ready" or "launch", not
// when the host ends; their number stays below the number of clients.

#include <fcntl.h>
#include <getopt.h>
#include <poll.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <deque>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "BxdBench.h"
#include "base/Document.h"
#include "base/UniqueFd.h"
#include "bexil/DaemonClient.h"
#include "bexil/Uuid.h"
#include "bexil/Value.h"
#include "platform/runtime/InstanceRecords.h"
#include "platform/zem/ZemCodec.h"
#include "platform/zem/ZemFrame.h"

namespace {

namespace fs = std::filesystem;
using namespace bexil;
using bench::die;
using Clock = std::chrono::steady_clock;

// A reply later than this counts as missing.
constexpr auto kReplyLimit = std::chrono::seconds(10);
constexpr int kManyPlugIns = 50;
constexpr int kChurnPlugIns = 5;
constexpr const char* kManagerEntitlement = "com.quorvel.private.bexil.manager";
// A client that met a missing or wrong reply reports it and ends with this status; the supervisor replaces it.
constexpr int kClientGaveUp = 3;

// ---- what every client adds to, in a file all processes map ---------------------------------------------------

enum Kind {
    kAdd,
    kAddBadPath,
    kRemove,
    kBulk,
    kMatch,
    kMatchRules,
    kMatchAll,
    kMatchBadRules,
    kReady,
    kAccess,
    kAnnotate,
    kAnnotateBad,
    kBulkAnnotate,
    kHoldApplication,
    kHoldPlugIns,
    kHoldBadPath,
    kRelease,
    kHolds,
    kLaunch,
    kUnknownName,
    kWrongVersion,
    kNoRequestName,
    kNotDictionary,
    kOneWay,
    kKinds
};

const char* const kKindNames[kKinds] = {
    "add",
    "add (bad path)",
    "remove",
    "bulk",
    "match",
    "match (rules)",
    "match (discover all)",
    "match (bad rules)",
    "ready",
    "access",
    "annotate",
    "annotate (bad election)",
    "bulk-annotate",
    "lock (hold application)",
    "lock (hold plug-ins)",
    "lock (hold bad path)",
    "lock (release by UUID)",
    "holds",
    "launch",
    "unknown request name",
    "wrong or missing version",
    "no request name",
    "not a dictionary",
    "one-way message",
};

constexpr int kCodes = 32;  // error codes 1 to 30 by themselves, the last slot for any other
constexpr int kNotes = 8;

struct Tally {
    std::atomic<uint64_t> sent[kKinds];
    std::atomic<uint64_t> answered[kKinds];
    std::atomic<uint64_t> slowestMicros[kKinds];
    std::atomic<uint64_t> errors[kCodes];
    std::atomic<uint64_t> timeouts;
    std::atomic<uint64_t> lost;
    std::atomic<uint64_t> wrong;
    std::atomic<uint64_t> misdirected;
    std::atomic<uint64_t> greeted;
    std::atomic<uint64_t> plugInEnded;
    std::atomic<uint64_t> plugInSilent;
    std::atomic<uint64_t> managersGranted;
    std::atomic<uint64_t> managersRefused;
    std::atomic<uint32_t> notesTaken;
    char notes[kNotes][256];
};
static_assert(std::atomic<uint64_t>::is_always_lock_free, "the tally is shared between processes");

Tally* mapTally(const fs::path& path, bool create) {
    int fd = open(path.c_str(), create ? O_RDWR | O_CREAT | O_TRUNC | O_CLOEXEC : O_RDWR | O_CLOEXEC, 0600);
    if (fd < 0 || (create && ftruncate(fd, sizeof(Tally)) != 0)) die("the tally file");
    void* shared = mmap(nullptr, sizeof(Tally), PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
    close(fd);
    if (shared == MAP_FAILED) die("mmap");
    return static_cast<Tally*>(shared);
}

// Keeps the first few problems in words for the report, with the time of day (UTC, as bxd's log has it).
void note(Tally& tally, const std::string& text) {
    uint32_t slot = tally.notesTaken.fetch_add(1);
    if (slot >= kNotes) return;
    timespec now{};
    clock_gettime(CLOCK_REALTIME, &now);
    tm utc{};
    gmtime_r(&now.tv_sec, &utc);
    snprintf(tally.notes[slot], sizeof tally.notes[slot], "%02d:%02d:%02d.%03ld %s", utc.tm_hour, utc.tm_min,
             utc.tm_sec, now.tv_nsec / 1000000, text.c_str());
}

void raiseTo(std::atomic<uint64_t>& slowest, uint64_t value) {
    uint64_t seen = slowest.load();
    while (value > seen && !slowest.compare_exchange_weak(seen, value)) {
    }
}

// ---- one request's answer, whichever way it travelled -----------------------------------------------------------

enum class Heard { Reply, TimedOut, Lost, Stray };

struct Answer {
    Heard heard = Heard::Lost;
    Value body;
    UniqueFd channel;  // launch: the socket to the plug-in

    int64_t code() const {
        return static_cast<int64_t>(body.get(protocol::key::kErrorCode).numberAsUInt64().value_or(0));
    }
};

Value request(std::string_view name, std::vector<std::pair<std::string, Value>> fields = {}) {
    fields.emplace_back("request", Value::string(name));
    fields.emplace_back("version", Value::uint64(protocol::kCurrentVersion));
    return Value::dictionary(std::move(fields));
}

Value stringArray(const std::vector<std::string>& items) {
    std::vector<Value> values;
    for (const std::string& item : items) values.push_back(Value::string(item));
    return Value::array(std::move(values));
}

Value uuidArray(const std::vector<Uuid>& items) {
    std::vector<Value> values;
    for (const Uuid& item : items) values.push_back(Value::uuid(item));
    return Value::array(std::move(values));
}

class Transport {
  public:
    virtual ~Transport() = default;
    // Sends `message` (a request dictionary) and waits at most kReplyLimit for its reply.
    virtual Answer call(const Value& message) = 0;
};

// Hand-written frames over a blocking socket: the client side of the protocol with nothing of the library in it.
class FrameTransport : public Transport {
  public:
    FrameTransport(const std::string& socketPath, std::mt19937_64* random) : random_(random) {
        fd_.reset(bench::connectTo(socketPath));
        if (!fd_) die("connect");
    }

    Answer call(const Value& message) override {
        std::vector<uint8_t> frame;
        if (ZemFrame::encode(ZemFrameKind::Request, ++serial_, 0, message, frame)) die("encoding a request");
        if (!send(frame)) return {};
        return await(serial_);
    }

    // Sends `payload` as an already encoded frame of `kind`, for frames the encoder would not build.
    bool sendRaw(ZemFrameKind kind, const std::vector<uint8_t>& payload) {
        std::vector<uint8_t> frame(ZemFrame::kHeaderBytes);
        ZemFrame::encodeHeader({kind, ++serial_, 0, static_cast<uint32_t>(payload.size()), 0},
                               std::span<uint8_t, ZemFrame::kHeaderBytes>(frame.data(), ZemFrame::kHeaderBytes));
        frame.insert(frame.end(), payload.begin(), payload.end());
        return send(frame);
    }

  private:
    // Now and then the frame goes in two writes with a pause between, so a kill may find bxd holding half a frame.
    bool send(const std::vector<uint8_t>& frame) {
        size_t first = frame.size();
        if ((*random_)() % 10 == 0) first = 1 + (*random_)() % (frame.size() - 1);
        if (!sendAll(frame.data(), first)) return false;
        if (first == frame.size()) return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
        return sendAll(frame.data() + first, frame.size() - first);
    }

    bool sendAll(const uint8_t* bytes, size_t length) {
        while (length > 0) {
            ssize_t n = ::send(fd_.get(), bytes, length, MSG_NOSIGNAL);
            if (n < 0 && errno == EINTR) continue;
            if (n <= 0) return false;
            bytes += n;
            length -= static_cast<size_t>(n);
        }
        return true;
    }

    // The next frame, which must be the reply to `serial`.
    Answer await(uint64_t serial) {
        const Clock::time_point deadline = Clock::now() + kReplyLimit;
        Answer answer;
        uint8_t header[ZemFrame::kHeaderBytes];
        if ((answer.heard = receive(header, sizeof header, deadline)) != Heard::Reply) return answer;
        Result<ZemFrameHeader> decoded =
            ZemFrame::decodeHeader(std::span<const uint8_t, ZemFrame::kHeaderBytes>(header));
        if (!decoded || decoded->kind != ZemFrameKind::Reply || decoded->inReplyTo != serial) {
            answer.heard = Heard::Stray;
            return answer;
        }
        std::vector<uint8_t> payload(decoded->payloadLength);
        if ((answer.heard = receive(payload.data(), payload.size(), deadline)) != Heard::Reply) return answer;
        Result<Value> body = ZemCodec::decode(payload);
        if (!body || !body->isDictionary() || pending_.size() < decoded->descriptorCount) {
            answer.heard = Heard::Stray;
            return answer;
        }
        answer.body = *body;
        for (uint8_t i = 0; i < decoded->descriptorCount; ++i) {
            if (i == 0) answer.channel = std::move(pending_.front());
            pending_.pop_front();
        }
        return answer;
    }

    // Fills `length` bytes, keeping the descriptors that come with them for the frame they belong to.
    Heard receive(uint8_t* into, size_t length, Clock::time_point deadline) {
        while (length > 0) {
            auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
            if (left <= 0) return Heard::TimedOut;
            pollfd readable{fd_.get(), POLLIN, 0};
            int ready = poll(&readable, 1, static_cast<int>(left) + 1);
            if (ready <= 0) continue;
            iovec io{into, length};
            alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int) * 16)];
            msghdr message{};
            message.msg_iov = &io;
            message.msg_iovlen = 1;
            message.msg_control = control;
            message.msg_controllen = sizeof control;
            ssize_t n = recvmsg(fd_.get(), &message, MSG_CMSG_CLOEXEC);
            if (n < 0 && (errno == EINTR || errno == EAGAIN)) continue;
            if (n <= 0) return Heard::Lost;
            for (cmsghdr* c = CMSG_FIRSTHDR(&message); c != nullptr; c = CMSG_NXTHDR(&message, c)) {
                if (c->cmsg_level != SOL_SOCKET || c->cmsg_type != SCM_RIGHTS) continue;
                size_t count = (c->cmsg_len - CMSG_LEN(0)) / sizeof(int);
                for (size_t i = 0; i < count; ++i) {
                    int fd;
                    memcpy(&fd, CMSG_DATA(c) + i * sizeof(int), sizeof fd);
                    pending_.emplace_back(fd);
                }
            }
            into += n;
            length -= static_cast<size_t>(n);
        }
        return Heard::Reply;
    }

    UniqueFd fd_;
    uint64_t serial_ = 0;
    std::deque<UniqueFd> pending_;
    std::mt19937_64* random_;
};

// The client library, as an application uses it: one DaemonClient, each request waited for.
class LibraryTransport : public Transport {
  public:
    // Never destroyed: the process ends with _exit or SIGKILL, and the kernel closes the connection.
    LibraryTransport() : client_(*new DaemonClient(std::string(protocol::kServiceName))) {}

    Answer call(const Value& message) override {
        const std::string_view name = message.get("request").stringView();
        std::vector<std::string> paths;
        for (const Value& path : message.get("paths").items()) paths.emplace_back(path.stringView());
        std::vector<Uuid> uuids;
        for (const Value& uuid : message.get("uuids").items())
            if (uuid.getUuid()) uuids.push_back(*uuid.getUuid());
        const uint64_t flags = message.get("flags").numberAsUInt64().value_or(0);
        const Value annotations = message.get("annotations");
        std::function<void(DaemonClient::Callback)> start;
        if (name == "add") {
            start = [&](DaemonClient::Callback done) { client_.add(paths, done); };
        } else if (name == "remove") {
            start = [&](DaemonClient::Callback done) { client_.remove(paths, done); };
        } else if (name == "bulk") {
            start = [&](DaemonClient::Callback done) { client_.bulk(flags, done); };
        } else if (name == "match") {
            const Value rules = message.contains("rules") ? message.get("rules") : Value::emptyDictionary();
            start = [&, rules](DaemonClient::Callback done) { client_.match(rules, flags, done); };
        } else if (name == "ready") {
            start = [&](DaemonClient::Callback done) { client_.ready(uuids, done); };
        } else if (name == "access") {
            start = [&](DaemonClient::Callback done) { client_.access(uuids, done); };
        } else if (name == "annotate") {
            start = [&](DaemonClient::Callback done) { client_.annotate(uuids, annotations, done); };
        } else if (name == "bulk-annotate") {
            start = [&](DaemonClient::Callback done) { client_.bulkAnnotate(annotations, done); };
        } else if (name == "lock" && !uuids.empty()) {
            start = [&](DaemonClient::Callback done) { client_.releaseHold(uuids.front(), done); };
        } else if (name == "lock") {
            start = [&](DaemonClient::Callback done) { client_.hold(paths, flags, done); };
        } else if (name == "holds") {
            start = [&](DaemonClient::Callback done) { client_.holds(done); };
        } else if (name == "launch" && uuids.size() == 1) {
            start = [&](DaemonClient::Callback done) { client_.launch(uuids.front(), done); };
        } else {
            die("the library cannot send this request");
        }
        const Clock::time_point begun = Clock::now();
        DaemonClient::Reply reply = client_.wait(start, kReplyLimit);
        Answer answer;
        if (reply.connectionFailed) {
            answer.heard = Clock::now() - begun >= kReplyLimit ? Heard::TimedOut : Heard::Lost;
            return answer;
        }
        answer.heard = Heard::Reply;
        answer.body = reply.message;
        answer.channel.reset(reply.takeChannel());
        return answer;
    }

  private:
    DaemonClient& client_;
};

// ---- what the supervisor tells the clients -----------------------------------------------------------------------

struct PlugIn {
    std::string path;
    Uuid uuid;
};

struct Plan {
    fs::path root;
    std::string socketPath;
    std::string greeter, notes, many, hello;
    Uuid helloUuid;
    std::vector<PlugIn> plugIns;     // Many.app's
    std::vector<std::string> churn;  // Churn.app's plug-ins
    std::vector<std::string> misfits;
    bool launch = false;
};

Value planValue(const Plan& plan) {
    std::vector<Value> plugIns;
    for (const PlugIn& plugIn : plan.plugIns)
        plugIns.push_back(
            Value::dictionary({{"path", Value::string(plugIn.path)}, {"uuid", Value::string(plugIn.uuid.string())}}));
    return Value::dictionary({{"greeter", Value::string(plan.greeter)},
                              {"notes", Value::string(plan.notes)},
                              {"many", Value::string(plan.many)},
                              {"hello", Value::string(plan.hello)},
                              {"helloUuid", Value::string(plan.helloUuid.string())},
                              {"plugIns", Value::array(std::move(plugIns))},
                              {"churn", stringArray(plan.churn)},
                              {"misfits", stringArray(plan.misfits)},
                              {"launch", Value::boolean(plan.launch)}});
}

Plan readPlan(const fs::path& root) {
    Result<Value> read = Document::readFile(root / "plan.vrec");
    if (!read) die("reading the plan");
    const Value& value = *read;
    Plan plan;
    plan.root = root;
    plan.socketPath = (root / "service" / bench::kBxdServiceName).string();
    plan.greeter = value.get("greeter").stringView();
    plan.notes = value.get("notes").stringView();
    plan.many = value.get("many").stringView();
    plan.hello = value.get("hello").stringView();
    plan.helloUuid = Uuid::parse(value.get("helloUuid").stringView()).value_or(Uuid());
    for (const Value& plugIn : value.get("plugIns").items())
        plan.plugIns.push_back(
            {std::string(plugIn.get("path").stringView()), Uuid::parse(plugIn.get("uuid").stringView()).value()});
    for (const Value& path : value.get("churn").items()) plan.churn.emplace_back(path.stringView());
    for (const Value& path : value.get("misfits").items()) plan.misfits.emplace_back(path.stringView());
    plan.launch = value.get("launch").getBool().value_or(false);
    return plan;
}

bool speaksFrames(unsigned slot) { return slot % 2 == 1; }
bool runsAsManager(unsigned slot) { return slot % 8 == 2 || slot % 8 == 3; }

// ---- a client -------------------------------------------------------------------------------------------------

class Soaker {
  public:
    Soaker(const Plan& plan, Tally& tally, unsigned slot)
        : plan_(plan), tally_(tally), slot_(slot), random_(std::random_device()() ^ (uint64_t(slot) << 32) ^ getpid()) {
        if (speaksFrames(slot)) {
            frames_ = new FrameTransport(plan.socketPath, &random_);
            transport_ = frames_;
        } else {
            transport_ = new LibraryTransport();
        }
    }

    [[noreturn]] void run() {
        // Whether this client is a manager is what bxd says: the entitlement may not have been honoured.
        Answer holds = exchange(kHolds, request("holds"));
        manager_ = holds.code() == 0;
        if (runsAsManager(slot_)) (manager_ ? tally_.managersGranted : tally_.managersRefused)++;
        if (!runsAsManager(slot_) && holds.code() != 11)
            wrong("\"holds\" without the entitlement answered " + describe(holds));
        enum Action {
            Add,
            Remove,
            Bulk,
            Match,
            Ready,
            Access,
            Annotate,
            BulkAnnotate,
            Hold,
            Release,
            Holds,
            Launch,
            Malformed,
            kActions
        };
        const double weights[kActions] = {
            6, 4, 5, 10, 8, 6, 6, 5, 10, 8, 3, plan_.launch ? 4.0 : 0.0, frames_ ? 8.0 : 0.0};
        std::discrete_distribution<int> pick(std::begin(weights), std::end(weights));
        for (;;) {
            switch (pick(random_)) {
                case Add:
                    add();
                    break;
                case Remove:
                    remove();
                    break;
                case Bulk:
                    expect(kBulk, request("bulk", {{"flags", Value::uint64(chance(3) ? random_() % 8 : 0)}}), 0);
                    break;
                case Match:
                    match();
                    break;
                case Ready:
                    ready();
                    break;
                case Access:
                    expect(kAccess, request("access", {{"uuids", uuidArray(somePlugIns(3))}}), 0);
                    break;
                case Annotate:
                    annotate();
                    break;
                case BulkAnnotate:
                    bulkAnnotate();
                    break;
                case Hold:
                    hold();
                    break;
                case Release:
                    release();
                    break;
                case Holds: {
                    Answer answer = exchange(kHolds, request("holds"));
                    if (answer.code() != (manager_ ? 0 : 11) || (manager_ && !answer.body.get("holds").isArray()))
                        wrong("\"holds\" answered " + describe(answer));
                    break;
                }
                case Launch:
                    launch();
                    break;
                case Malformed:
                    malformed();
                    break;
            }
        }
    }

  private:
    bool chance(unsigned outOf) { return random_() % outOf == 0; }
    template <class T>
    const T& any(const std::vector<T>& items) {
        return items[random_() % items.size()];
    }
    std::vector<Uuid> somePlugIns(unsigned most) {
        std::vector<Uuid> uuids;
        for (unsigned n = 1 + random_() % most; n > 0; --n)
            uuids.push_back(chance(5) ? plan_.helloUuid : any(plan_.plugIns).uuid);
        return uuids;
    }

    static std::string describe(const Answer& answer) { return answer.body.description(200); }

    [[noreturn]] void giveUp(const std::string& what) {
        note(tally_, "client " + std::to_string(slot_) + ": " + what);
        _exit(kClientGaveUp);
    }
    void wrong(const std::string& what) {
        tally_.wrong++;
        note(tally_, "client " + std::to_string(slot_) + ": " + what);
    }

    // One round trip, counted; a missing, late or misdirected reply ends the client.
    Answer exchange(Kind kind, const Value& message) {
        tally_.sent[kind]++;
        const Clock::time_point begun = Clock::now();
        Answer answer = transport_->call(message);
        switch (answer.heard) {
            case Heard::Reply:
                break;
            case Heard::TimedOut:
                tally_.timeouts++;
                giveUp(std::string("no reply within 10 s to ") + kKindNames[kind]);
            case Heard::Lost:
                tally_.lost++;
                giveUp(std::string("the connection ended instead of a reply to ") + kKindNames[kind]);
            case Heard::Stray:
                tally_.misdirected++;
                giveUp(std::string("a frame that is not the reply to ") + kKindNames[kind]);
        }
        tally_.answered[kind]++;
        auto micros = std::chrono::duration_cast<std::chrono::microseconds>(Clock::now() - begun).count();
        raiseTo(tally_.slowestMicros[kind], static_cast<uint64_t>(micros));
        if (int64_t code = answer.code(); code != 0) tally_.errors[code > 0 && code < kCodes - 1 ? code : kCodes - 1]++;
        return answer;
    }

    // A request whose outcome the protocol fixes.
    Answer expect(Kind kind, const Value& message, int64_t code) {
        Answer answer = exchange(kind, message);
        if (answer.code() != code)
            wrong(std::string(kKindNames[kind]) + " answered " + describe(answer) + ", not code " +
                  std::to_string(code));
        return answer;
    }

    void add() {
        switch (random_() % 4) {
            case 0:
                expect(kAddBadPath, request("add", {{"paths", stringArray({"Notes.app"})}}), 9);
                break;
            case 1:
                expect(kAddBadPath, request("add", {{"paths", stringArray({plan_.root.string() + "/nowhere"})}}), 9);
                break;
            case 2:
                exchange(kAdd, request("add", {{"paths", stringArray({any(plan_.misfits)})}}));
                break;
            default:
                exchange(kAdd, request("add", {{"paths", stringArray(plan_.churn)}}));
        }
    }

    void remove() {
        if (!manager_) {
            expect(kRemove, request("remove", {{"paths", stringArray({any(plan_.churn)})}}), 11);
            return;
        }
        // Another manager may have just removed the same plug-ins (code 9); either way they are registered again.
        exchange(kRemove, request("remove", {{"paths", stringArray(plan_.churn)}}));
        exchange(kAdd, request("add", {{"paths", stringArray(plan_.churn)}}));
    }

    void match() {
        switch (random_() % 6) {
            case 0:
                expect(kMatch, request("match"), 0);
                break;
            case 1:
                expect(kMatch, request("match", {{"flags", Value::uint64(chance(2) ? 0x1 : 0x5)}}), 0);
                break;
            case 2:
                expect(kMatchRules,
                       request("match", {{"rules", Value::dictionary({{"RZExtensionPointIdentifier",
                                                                       Value::string("com.example.greeting")}})}}),
                       0);
                break;
            case 3:
                expect(kMatchRules,
                       request("match", {{"rules", Value::dictionary({{"RZExtensionIdentifier",
                                                                       Value::string("com.example.many.p7")}})},
                                         {"flags", Value::uint64(0x8)}}),
                       0);
                break;
            case 4:
                expect(kMatchAll, request("match", {{"flags", Value::uint64(0x200)}}), manager_ ? 0 : 11);
                break;
            default:
                if (frames_) {
                    expect(kMatchBadRules, request("match", {{"rules", Value::string("everything")}}), 4);
                } else {
                    expect(kMatch, request("match"), 0);
                }
        }
    }

    void ready() {
        switch (random_() % 4) {
            case 0:
                expect(kReady, request("ready", {{"uuids", uuidArray({Uuid::random()})}}), 4);
                break;
            case 1:
                exchange(kReady, request("ready", {{"uuids", uuidArray({plan_.helloUuid})}}));
                break;
            default:
                exchange(kReady, request("ready", {{"uuids", uuidArray(somePlugIns(5))}}));
        }
    }

    void annotate() {
        Value election = chance(2) ? Value::uint64(random_() % 2) : Value::boolean(chance(2));
        Value annotations = Value::dictionary(
            {{"election", election}, {"extension", Value::dictionary({{"soak-client", Value::uint64(slot_)}})}});
        if (frames_ && chance(4)) {
            expect(kAnnotateBad,
                   request("annotate", {{"uuids", uuidArray(somePlugIns(2))},
                                        {"annotations", Value::dictionary({{"election", Value::string("yes")}})}}),
                   4);
            return;
        }
        exchange(kAnnotate, request("annotate", {{"uuids", uuidArray(somePlugIns(2))}, {"annotations", annotations}}));
    }

    void bulkAnnotate() {
        const std::string known = any(plan_.plugIns).uuid.string();
        const Value extension = Value::dictionary({{"soak-client", Value::uint64(slot_)}});
        switch (random_() % 4) {
            case 0:
                expect(kBulkAnnotate,
                       request("bulk-annotate",
                               {{"annotations", Value::dictionary({{Uuid::random().string(), extension}})}}),
                       2);
                break;
            case 1:
                expect(kBulkAnnotate,
                       request("bulk-annotate", {{"annotations", Value::dictionary({{known, Value::uint64(1)}})}}), 18);
                break;
            default:
                expect(kBulkAnnotate,
                       request("bulk-annotate", {{"annotations", Value::dictionary({{known, extension}})}}), 0);
        }
    }

    // Holds of Greeter.app and Hello are let go at once, so that Hello stays mostly usable; holds of Notes.app and
    // Many.app's plug-ins are sometimes kept for the client's whole life.
    void hold() {
        const uint64_t extra = (chance(3) ? 0x2 : 0) | (chance(3) ? 0x4 : 0);
        std::vector<std::string> paths;
        uint64_t flags = extra;
        bool transient = false;
        Kind kind = kHoldApplication;
        switch (random_() % 7) {
            case 0:
                paths = {plan_.notes};
                break;
            case 1:
                paths = {plan_.many};
                transient = !chance(10);
                break;
            case 2:
            case 3:
                for (unsigned n = 1 + random_() % 3; n > 0; --n) paths.push_back(any(plan_.plugIns).path);
                flags |= 0x1;
                kind = kHoldPlugIns;
                break;
            case 4:
                paths = {plan_.greeter};
                transient = true;
                break;
            case 5:
                paths = {plan_.hello};
                flags |= 0x1;
                kind = kHoldPlugIns;
                transient = true;
                break;
            default:
                expect(kHoldBadPath,
                       request("lock", {{"paths", stringArray({plan_.root.string() + "/nowhere.app"})},
                                        {"flags", Value::uint64(extra)}}),
                       9);
                return;
        }
        Answer answer =
            exchange(kind, request("lock", {{"paths", stringArray(paths)}, {"flags", Value::uint64(flags)}}));
        const Uuid* uuid = answer.body.get("uuids").getUuid();
        if (answer.code() == 0 && uuid == nullptr) wrong("a hold granted without its UUID: " + describe(answer));
        if (answer.code() == 14 && !answer.body.get("conflicts").isArray())
            wrong("a busy refusal without conflicts: " + describe(answer));
        if (answer.code() != 0 || uuid == nullptr) return;
        if (transient) {
            expect(kRelease, request("lock", {{"uuids", uuidArray({*uuid})}}), 0);
        } else if (chance(3)) {
            kept_.push_back(*uuid);  // never released: it ends with the connection
        } else {
            releasable_.push_back(*uuid);
        }
    }

    void release() {
        if (releasable_.empty() || chance(5)) {
            // Unknown UUIDs and elements that are not UUIDs are passed over.
            std::vector<Value> uuids{Value::uuid(Uuid::random())};
            if (frames_) uuids.push_back(Value::string("not a uuid"));
            expect(kRelease, request("lock", {{"uuids", Value::array(std::move(uuids))}}), 0);
            return;
        }
        size_t at = random_() % releasable_.size();
        Uuid uuid = releasable_[at];
        releasable_.erase(releasable_.begin() + static_cast<ptrdiff_t>(at));
        expect(kRelease, request("lock", {{"uuids", uuidArray({uuid})}}), 0);
    }

    void launch() {
        running_.reset();  // the previous instance ends once its host closes its end
        if (frames_ && chance(6)) {
            expect(kLaunch, request("launch", {{"uuids", uuidArray({plan_.helloUuid, plan_.helloUuid})}}), 4);
            return;
        }
        exchange(kReady, request("ready", {{"uuids", uuidArray({plan_.helloUuid})}}));
        Answer answer = exchange(kLaunch, request("launch", {{"uuids", uuidArray({plan_.helloUuid})}}));
        if (answer.code() != 0) return;
        if (!answer.channel) {
            wrong("a launch reply without its socket: " + describe(answer));
            return;
        }
        // A hold with termination from another client may end Hello before it answers.
        const std::string line = "soak " + std::to_string(slot_) + "\n";
        if (::send(answer.channel.get(), line.data(), line.size(), MSG_NOSIGNAL) != static_cast<ssize_t>(line.size())) {
            tally_.plugInEnded++;
            return;
        }
        std::string heard;
        const Clock::time_point deadline = Clock::now() + kReplyLimit;
        for (;;) {
            auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
            pollfd readable{answer.channel.get(), POLLIN, 0};
            if (left <= 0 || poll(&readable, 1, static_cast<int>(left)) == 0) {
                tally_.plugInSilent++;
                return;
            }
            char c;
            if (read(answer.channel.get(), &c, 1) != 1) {
                tally_.plugInEnded++;
                return;
            }
            if (c == '\n') break;
            heard += c;
        }
        if (heard.rfind("Hello, soak " + std::to_string(slot_) + "!", 0) == 0) {
            tally_.greeted++;
            running_ = std::move(answer.channel);
        } else {
            wrong("Hello answered \"" + heard + "\"");
        }
    }

    // Requests only hand-written frames can send. The ones that get no reply are each followed by a "bulk", whose
    // reply must be the next frame: nothing may answer what expects no answer, and the connection must go on.
    void malformed() {
        switch (random_() % 8) {
            case 0:
                expect(kUnknownName, request("frobnicate"), 4);
                break;
            case 1:
                expect(kUnknownName, request("Match"), 4);
                break;
            case 2:
                expect(kWrongVersion,
                       Value::dictionary({{"request", Value::string("bulk")}, {"version", Value::uint64(4)}}), 7);
                break;
            case 3:
                // A version of the wrong kind, or none at all.
                expect(kWrongVersion,
                       chance(2) ? Value::dictionary({{"request", Value::string("bulk")}, {"version", Value::int64(3)}})
                                 : Value::dictionary({{"request", Value::string("bulk")}}),
                       7);
                break;
            case 4:
                expect(kNoRequestName,
                       Value::dictionary({{"version", Value::uint64(3)}, {"paths", stringArray({plan_.notes})}}), 4);
                break;
            case 5:
                expect(kNoRequestName,
                       Value::dictionary({{"request", Value::uint64(1)}, {"version", Value::uint64(3)}}), 4);
                break;
            case 6: {
                Result<std::vector<uint8_t>> payload =
                    ZemCodec::encode(Value::array({Value::string("request"), Value::string("bulk")}));
                tally_.sent[kNotDictionary]++;
                if (!payload || !frames_->sendRaw(ZemFrameKind::Request, *payload)) giveUp("sending a non-dictionary");
                expect(kBulk, request("bulk"), 0);
                tally_.answered[kNotDictionary]++;
                break;
            }
            default: {
                Result<std::vector<uint8_t>> payload = ZemCodec::encode(request("bulk"));
                tally_.sent[kOneWay]++;
                if (!payload || !frames_->sendRaw(ZemFrameKind::Message, *payload)) giveUp("sending a message");
                expect(kBulk, request("bulk"), 0);
                tally_.answered[kOneWay]++;
            }
        }
    }

    const Plan& plan_;
    Tally& tally_;
    const unsigned slot_;
    std::mt19937_64 random_;
    Transport* transport_ = nullptr;
    FrameTransport* frames_ = nullptr;  // set when this client speaks frames
    bool manager_ = false;
    std::vector<Uuid> releasable_, kept_;
    UniqueFd running_;  // the socket to the Hello instance this client launched last
};

[[noreturn]] void runClient(const fs::path& root, unsigned slot) {
    signal(SIGPIPE, SIG_IGN);
    static const Plan plan = readPlan(root);
    Tally& tally = *mapTally(root / "tally", false);
    Soaker(plan, tally, slot).run();
}

// ---- the supervisor ---------------------------------------------------------------------------------------------

struct Options {
    unsigned seconds = 60;
    unsigned clients = 16;
    std::string bxdPath;
    bool keep = false;
};

[[noreturn]] void usage() {
    fputs("usage: soak [--seconds S] [--clients N (8 to 64)] [--bxd PATH] [--keep]\n", stderr);
    exit(64);
}

Options parseOptions(int argc, char** argv) {
    static const option kLong[] = {{"seconds", required_argument, nullptr, 's'},
                                   {"clients", required_argument, nullptr, 'c'},
                                   {"bxd", required_argument, nullptr, 'b'},
                                   {"keep", no_argument, nullptr, 'k'},
                                   {nullptr, 0, nullptr, 0}};
    Options options;
    for (int c; (c = getopt_long(argc, argv, "", kLong, nullptr)) != -1;) {
        switch (c) {
            case 's':
                options.seconds = static_cast<unsigned>(bench::parsePositive(optarg, 7 * 24 * 3600).value_or(0));
                if (options.seconds == 0) usage();
                break;
            case 'c':
                options.clients = static_cast<unsigned>(bench::parsePositive(optarg, 64).value_or(0));
                if (options.clients < 8) usage();
                break;
            case 'b':
                options.bxdPath = optarg;
                break;
            case 'k':
                options.keep = true;
                break;
            default:
                usage();
        }
    }
    if (optind < argc) usage();
    if (options.bxdPath.empty()) options.bxdPath = bench::defaultBxdPath();
    return options;
}

void writeInfo(const fs::path& bundle, const std::string& identifier, const char* executable) {
    std::vector<std::pair<std::string, Value>> info{
        {"BDBundleIdentifier", Value::string(identifier)},
        {"BDBundleVersion", Value::string("1")},
        {"RZExtension", Value::dictionary({{"PrincipalClass", Value::string("Soak")},
                                           {"RZExtensionPointIdentifier", Value::string("com.example.soak")},
                                           {"RZExtensionProtocol", Value::string("Soaking")},
                                           {"RZExtensionAttributes",
                                            Value::dictionary({{"RZExtensionVersion", Value::string("1")}})}})}};
    if (executable) info.emplace_back("BDBundleExecutable", Value::string(executable));
    if (auto error = Document::writeFileAtomically(bundle / "Info.vrec", Value::dictionary(std::move(info))))
        die("writing Info.vrec");
}

// An application of `count` generated plug-ins P0 ... under `root`; returns the plug-ins' paths.
std::vector<std::string> makeApplication(const fs::path& root, const std::string& name, const std::string& identifier,
                                         int count) {
    const fs::path app = root / (name + ".app");
    fs::create_directories(app / "PlugIns");
    writeInfo(app, identifier, nullptr);
    std::vector<std::string> paths;
    for (int i = 0; i < count; ++i) {
        fs::path bundle = app / "PlugIns" / ("P" + std::to_string(i) + ".bxplugin");
        fs::create_directories(bundle);
        writeInfo(bundle, identifier + ".p" + std::to_string(i), "run");
        std::ofstream(bundle / "run") << "#!/bin/sh\n";
        fs::permissions(bundle / "run", fs::perms(0755));
        paths.push_back(bundle.string());
    }
    return paths;
}

struct Sample {
    long rssKb = -1;
    long fds = -1;
};

Sample sample(pid_t pid) {
    Sample s;
    std::ifstream status("/proc/" + std::to_string(pid) + "/status");
    for (std::string line; std::getline(status, line);)
        if (line.rfind("VmRSS:", 0) == 0) s.rssKb = strtol(line.c_str() + 6, nullptr, 10);
    std::error_code error;
    long fds = 0;
    for (fs::directory_iterator it("/proc/" + std::to_string(pid) + "/fd", error), end; !error && it != end;
         it.increment(error))
        ++fds;
    if (!error) s.fds = fds;
    return s;
}

std::string slurp(const fs::path& path) {
    std::ifstream in(path);
    return std::string(std::istreambuf_iterator<char>(in), {});
}

// The live processes (zombies have no command line) whose command line names `root`, other than this one: what is
// left of the plug-in sandboxes bxd started there, once bxd has ended.
std::vector<std::pair<pid_t, std::string>> processesIn(const fs::path& root) {
    std::vector<std::pair<pid_t, std::string>> found;
    std::error_code error;
    for (fs::directory_iterator it("/proc", error), end; !error && it != end; it.increment(error)) {
        const std::string name = it->path().filename().string();
        if (name.find_first_not_of("0123456789") != std::string::npos) continue;
        const pid_t pid = static_cast<pid_t>(std::stol(name));
        if (pid == getpid()) continue;
        std::string command = slurp(it->path() / "cmdline");
        std::replace(command.begin(), command.end(), '\0', ' ');
        if (command.find(root.string()) != std::string::npos) found.emplace_back(pid, command);
    }
    return found;
}

// The sanitizer reports in a log: how many, and the first line of the first one.
std::pair<size_t, std::string> sanitizerReports(const fs::path& log) {
    const std::string text = slurp(log);
    size_t count = 0, first = std::string::npos;
    for (const char* marker : {"ERROR: AddressSanitizer", "ERROR: LeakSanitizer", "runtime error:"}) {
        for (size_t at = text.find(marker); at != std::string::npos; at = text.find(marker, at + 1)) {
            ++count;
            first = std::min(first, at);
        }
    }
    if (count == 0) return {0, ""};
    size_t begin = text.rfind('\n', first);
    begin = begin == std::string::npos ? 0 : begin + 1;
    return {count, text.substr(begin, text.find('\n', first) - begin)};
}

std::string describeStatus(int status) {
    if (WIFEXITED(status)) return "exited " + std::to_string(WEXITSTATUS(status));
    if (WIFSIGNALED(status)) return std::string("killed by ") + strsignal(WTERMSIG(status));
    return "status " + std::to_string(status);
}

// The body of one blocking request of the set-up, which must succeed.
Value setUpRequest(FrameTransport& link, const Value& message) {
    Answer answer = link.call(message);
    if (answer.heard != Heard::Reply || answer.code() != 0) {
        fprintf(stderr, "soak: set-up request %s failed: %s\n", message.description(300).c_str(),
                answer.body.description(300).c_str());
        exit(1);
    }
    return answer.body;
}

volatile sig_atomic_t interrupted = 0;

}  // namespace

int main(int argc, char** argv) {
    bench::programName = "soak";
    if (argc == 4 && strcmp(argv[1], "--client") == 0) {
        // Slots are passed counting from 1, as parsePositive reads them.
        auto slot = bench::parsePositive(argv[3], 1000);
        if (!slot) usage();
        runClient(argv[2], static_cast<unsigned>(*slot - 1));
    }
    const Options options = parseOptions(argc, argv);
    if (access(options.bxdPath.c_str(), X_OK) != 0) {
        fprintf(stderr, "soak: no bxd at %s (use --bxd PATH)\n", options.bxdPath.c_str());
        return 1;
    }
    signal(SIGPIPE, SIG_IGN);

    // ---- the private root and its bundles
    const fs::path root = fs::canonical(bench::makePrivateBxdRoot("bxd-soak"));
    const fs::path self = fs::read_symlink("/proc/self/exe");
    for (const fs::directory_entry& entry : fs::directory_iterator(fs::path(BEXIL_SOURCE_DIR) / "examples/bundles"))
        fs::copy(entry.path(), root / entry.path().filename(), fs::copy_options::recursive);
    Plan plan;
    plan.root = root;
    plan.socketPath = (root / "service" / bench::kBxdServiceName).string();
    plan.greeter = (root / "Greeter.app").string();
    plan.notes = (root / "Notes.app").string();
    plan.many = (root / "Many.app").string();
    plan.hello = (root / "Greeter.app/PlugIns/Hello.bxplugin").string();
    fs::copy_file((self.parent_path() / ".." / "examples/plugins/hello-plugin").lexically_normal(),
                  plan.hello + "/hello", fs::copy_options::overwrite_existing);
    std::vector<std::string> many = makeApplication(root, "Many", "com.example.many", kManyPlugIns);
    plan.churn = makeApplication(root, "Churn", "com.example.churn", kChurnPlugIns);
    for (const fs::directory_entry& entry : fs::directory_iterator(root / "Misconfigured.app/PlugIns"))
        plan.misfits.push_back(entry.path().string());
    std::sort(plan.misfits.begin(), plan.misfits.end());

    // A copy of this program that the entitlements directory makes a manager; bxd trusts it because root or this
    // user owns it and nobody else may write it.
    const fs::path managerCopy = root / "manager" / "soak";
    fs::create_directories(managerCopy.parent_path());
    fs::permissions(managerCopy.parent_path(), fs::perms(0755));
    fs::copy_file(self, managerCopy);
    fs::permissions(managerCopy, fs::perms(0755));
    const fs::path entitlements = root / "entitlements.d" / "soak-manager.vrec";
    if (Document::writeFileAtomically(
            entitlements,
            Value::dictionary({{"Executable", Value::string(managerCopy.string())},
                               {"Entitlements", Value::dictionary({{kManagerEntitlement, Value::boolean(true)}})}})) ||
        chmod(entitlements.c_str(), 0644) != 0)
        die("writing the entitlements document");

    // bubblewrap needs namespaces the machine may not grant; without it nothing can be launched.
    plan.launch = system("bwrap --unshare-all --ro-bind / / true >/dev/null 2>&1") == 0;

    // ---- bxd
    setenv("BXD_LOG_LEVEL", "error", 0);  // info logs every match: the log would drown the reports it is read for
    setenv("BX_SERVICE_DIR", (root / "service").c_str(), 1);
    setenv("BX_LOG_SINK", "stderr", 1);
    const pid_t bxd = bench::startPrivateBxd(root, options.bxdPath);
    int bxdStatus = 0;
    bool bxdEnded = false;
    auto bxdAlive = [&] {
        if (!bxdEnded && waitpid(bxd, &bxdStatus, WNOHANG) == bxd) bxdEnded = true;
        return !bxdEnded;
    };
    bool listening = false;
    for (int i = 0; i < 3000 && !listening && bxdAlive(); ++i) {
        int fd = bench::connectTo(plan.socketPath);
        listening = fd >= 0;
        if (listening) close(fd);
        if (!listening) std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    if (!listening) {
        fprintf(stderr, "soak: bxd did not come up within 30 s; its log is in %s\n", (root / "bxd.log").c_str());
        kill(bxd, SIGKILL);
        waitpid(bxd, nullptr, 0);
        return 1;
    }
    std::mt19937_64 random(std::random_device{}());
    {
        FrameTransport link(plan.socketPath, &random);
        std::vector<std::string> paths = many;
        paths.push_back(plan.hello);
        paths.insert(paths.end(), plan.churn.begin(), plan.churn.end());
        for (const char* plugIn : {"Bonjour", "NightTheme"})
            paths.push_back((root / "Greeter.app/PlugIns" / (std::string(plugIn) + ".bxplugin")).string());
        for (const fs::directory_entry& entry : fs::directory_iterator(root / "Notes.app/PlugIns"))
            paths.push_back(entry.path().string());
        setUpRequest(link, request("add", {{"paths", stringArray(paths)}}));
        Value found = setUpRequest(link, request("match"));
        for (const Value& form : found.get("matches").items()) {
            std::string path(form.get("path").stringView());
            std::optional<Uuid> uuid = Uuid::parse(form.get("uuid").stringView());
            if (!uuid) continue;
            if (path == plan.hello) plan.helloUuid = *uuid;
            if (std::find(many.begin(), many.end(), path) != many.end()) plan.plugIns.push_back({path, *uuid});
        }
        if (plan.helloUuid.string() == Uuid().string() || plan.plugIns.size() != many.size()) {
            fprintf(stderr, "soak: the registered plug-ins were not all found (%zu of %zu)\n", plan.plugIns.size(),
                    many.size());
            return 1;
        }
    }
    if (Document::writeFileAtomically(root / "plan.vrec", planValue(plan))) die("writing the plan");
    // Busy plug-ins, for the holds that refuse busy ones (0x2): process assertions on three of Many.app's plug-ins,
    // recorded as a plug-in runtime records them, for this process, which lives as long as the run.
    for (int i = 0; i < 3; ++i)
        if (!InstanceRecords(InstanceRecords::Kind::Assertion, root / "runtime")
                 .record("com.example.many.p" + std::to_string(i), getpid()))
            die("recording a process assertion");
    Tally& tally = *mapTally(root / "tally", true);

    // ---- the clients
    const std::string selfPath = self.string();
    FILE* clientLog = fopen((root / "clients.log").c_str(), "ae");
    if (!clientLog) die("the clients' log");
    uint64_t clientsStarted = 0, clientsKilled = 0, clientsGaveUp = 0, clientsOther = 0;
    std::string otherEnds;
    std::vector<pid_t> clients(options.clients, -1);
    auto startClient = [&](unsigned slot) {
        const std::string executable = runsAsManager(slot) ? managerCopy.string() : selfPath;
        const std::string slotText = std::to_string(slot + 1);
        pid_t child = fork();
        if (child < 0) die("fork");
        if (child == 0) {
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            dup2(fileno(clientLog), STDERR_FILENO);
            dup2(fileno(clientLog), STDOUT_FILENO);
            execl(executable.c_str(), executable.c_str(), "--client", root.c_str(), slotText.c_str(), nullptr);
            _exit(127);
        }
        clients[slot] = child;
        ++clientsStarted;
    };
    // Reaps the client of `slot` if it ended, and counts how; true when the slot is free.
    auto reap = [&](unsigned slot, bool block) {
        int status = 0;
        if (clients[slot] < 0) return true;
        if (waitpid(clients[slot], &status, block ? 0 : WNOHANG) != clients[slot]) return false;
        clients[slot] = -1;
        if (WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL) {
            ++clientsKilled;
        } else if (WIFEXITED(status) && WEXITSTATUS(status) == kClientGaveUp) {
            ++clientsGaveUp;
        } else {
            ++clientsOther;
            if (otherEnds.size() < 200)
                otherEnds += " client " + std::to_string(slot) + " " + describeStatus(status) + ";";
        }
        return true;
    };

    signal(SIGINT, [](int) { interrupted = 1; });
    signal(SIGTERM, [](int) { interrupted = 1; });
    const Sample atStart = sample(bxd);
    for (unsigned slot = 0; slot < options.clients; ++slot) startClient(slot);
    const Clock::time_point begun = Clock::now();
    const Clock::time_point middle = begun + std::chrono::seconds(options.seconds) / 2;
    const Clock::time_point deadline = begun + std::chrono::seconds(options.seconds);
    Clock::time_point nextKill = begun + std::chrono::seconds(1);
    Sample atMiddle;
    bool middleTaken = false;
    // A client that cannot even start (its program cannot be executed) would be restarted forever.
    while (Clock::now() < deadline && !interrupted && bxdAlive() && clientsOther < 50) {
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
        if (!middleTaken && Clock::now() >= middle) {
            atMiddle = sample(bxd);
            middleTaken = true;
        }
        if (Clock::now() >= nextKill) {
            nextKill += std::chrono::seconds(1);
            unsigned victim = static_cast<unsigned>(random() % options.clients);
            if (clients[victim] > 0) {
                kill(clients[victim], SIGKILL);
                reap(victim, true);
            }
        }
        for (unsigned slot = 0; slot < options.clients; ++slot)
            if (reap(slot, false)) startClient(slot);
    }
    const double ranSeconds = std::chrono::duration<double>(Clock::now() - begun).count();
    const bool diedDuringRun = !bxdAlive();
    const Sample atEnd = diedDuringRun ? Sample{} : sample(bxd);
    for (unsigned slot = 0; slot < options.clients; ++slot) {
        if (clients[slot] > 0) kill(clients[slot], SIGKILL);
        reap(slot, true);
    }
    // The clients' connections and their Hello instances go; what bxd holds then should be what it held at the start.
    std::this_thread::sleep_for(std::chrono::seconds(2));
    const Sample idle = bxdAlive() ? sample(bxd) : Sample{};

    // ---- the end of bxd
    std::string ending = "died during the run: " + describeStatus(bxdStatus);
    if (!diedDuringRun) {
        if (bxdAlive()) {
            kill(bxd, SIGTERM);
            // A sanitized bxd looks for leaks as it exits, which takes a while.
            for (int i = 0; i < 600 && bxdAlive(); ++i) std::this_thread::sleep_for(std::chrono::milliseconds(100));
            if (bxdAlive()) {
                kill(bxd, SIGKILL);
                waitpid(bxd, &bxdStatus, 0);
                ending = "did not end within 60 s of SIGTERM; killed";
            } else {
                ending = describeStatus(bxdStatus);
            }
        } else {
            ending = "died after the run: " + describeStatus(bxdStatus);
        }
    }
    // Instances end with bxd: give the kernel a moment to end their sandboxes, then end and count what is left.
    std::this_thread::sleep_for(std::chrono::seconds(1));
    const std::vector<std::pair<pid_t, std::string>> leftBehind = processesIn(root);
    for (const auto& [pid, command] : leftBehind) kill(pid, SIGKILL);
    auto [reports, firstReport] = sanitizerReports(root / "bxd.log");
    auto [clientReports, firstClientReport] = sanitizerReports(root / "clients.log");

    // ---- the report
    uint64_t sent = 0, answered = 0;
    unsigned managerSlots = 0;
    for (unsigned slot = 0; slot < options.clients; ++slot) managerSlots += runsAsManager(slot);
    printf("soak: %.0f s, %u clients (%u through libbexil, %u in hand-written frames, %u run as managers)\n",
           ranSeconds, options.clients, (options.clients + 1) / 2, options.clients / 2, managerSlots);
    printf("bxd: %s\n", options.bxdPath.c_str());
    printf("launch: %s\n", plan.launch ? "on" : "off (bubblewrap cannot run here)");
    printf("managers: %llu client starts granted the entitlement, %llu refused\n",
           static_cast<unsigned long long>(tally.managersGranted.load()),
           static_cast<unsigned long long>(tally.managersRefused.load()));
    printf("\n%-26s %10s %10s %12s\n", "request", "sent", "answered", "slowest ms");
    for (int kind = 0; kind < kKinds; ++kind) {
        sent += tally.sent[kind];
        answered += tally.answered[kind];
        printf("%-26s %10llu %10llu %12.1f\n", kKindNames[kind], static_cast<unsigned long long>(tally.sent[kind]),
               static_cast<unsigned long long>(tally.answered[kind]), tally.slowestMicros[kind] / 1000.0);
    }
    printf("%-26s %10llu %10llu   (%.0f answers/s)\n", "total", static_cast<unsigned long long>(sent),
           static_cast<unsigned long long>(answered), answered / ranSeconds);
    printf("\nerrors by code:");
    for (int code = 1; code < kCodes; ++code)
        if (tally.errors[code])
            printf(" %s%d: %llu", code == kCodes - 1 ? "other " : "", code,
                   static_cast<unsigned long long>(tally.errors[code]));
    printf("\ntimeouts (no reply within 10 s): %llu\n", static_cast<unsigned long long>(tally.timeouts.load()));
    printf("lost replies (connection ended under a live client): %llu\n",
           static_cast<unsigned long long>(tally.lost.load()));
    printf("misdirected replies (a frame that answers another request): %llu\n",
           static_cast<unsigned long long>(tally.misdirected.load()));
    printf("wrong answers: %llu\n", static_cast<unsigned long long>(tally.wrong.load()));
    printf("cut off by SIGKILL (sent, never answered): %llu\n",
           static_cast<unsigned long long>(sent - answered - tally.timeouts - tally.lost - tally.misdirected));
    printf("clients: %llu started, %llu killed, %llu gave up on a missing or wrong reply, %llu ended otherwise%s\n",
           static_cast<unsigned long long>(clientsStarted), static_cast<unsigned long long>(clientsKilled),
           static_cast<unsigned long long>(clientsGaveUp), static_cast<unsigned long long>(clientsOther),
           otherEnds.c_str());
    printf("Hello: %llu lines answered, %llu ended before answering (held with termination), %llu silent for 10 s\n",
           static_cast<unsigned long long>(tally.greeted.load()),
           static_cast<unsigned long long>(tally.plugInEnded.load()),
           static_cast<unsigned long long>(tally.plugInSilent.load()));
    for (uint32_t i = 0; i < std::min<uint32_t>(tally.notesTaken, kNotes); ++i) printf("  %s\n", tally.notes[i]);

    printf("\n%-22s %10s %8s\n", "bxd", "VmRSS kB", "fds");
    auto row = [](const char* when, Sample s) { printf("%-22s %10ld %8ld\n", when, s.rssKb, s.fds); };
    row("start", atStart);
    row("middle", atMiddle);
    row("end", atEnd);
    row("clients gone", idle);
    if (atMiddle.rssKb > 0 && atEnd.rssKb > 0 && atMiddle.fds > 0)
        printf("%-22s %9.2fx %7.2fx\n", "end / middle", static_cast<double>(atEnd.rssKb) / atMiddle.rssKb,
               static_cast<double>(atEnd.fds) / atMiddle.fds);
    const bool died = diedDuringRun || ending.rfind("died", 0) == 0;
    printf("bxd alive at the end: %s\n", died ? "no" : "yes");
    printf("bxd after SIGTERM: %s\n", ending.c_str());
    printf("processes of bxd's sandboxes left behind: %zu%s%.120s\n", leftBehind.size(),
           leftBehind.empty() ? "" : " (killed now), the first: ",
           leftBehind.empty() ? "" : leftBehind.front().second.c_str());
    printf("sanitizer reports on bxd's stderr: %zu%s%s\n", reports, reports ? ", the first: " : "",
           firstReport.c_str());
    if (clientReports)
        printf("sanitizer reports on the clients' stderr: %zu, the first: %s\n", clientReports,
               firstClientReport.c_str());

    const bool failed = died || tally.timeouts > 0 || tally.lost > 0 || tally.misdirected > 0 || tally.wrong > 0 ||
                        !leftBehind.empty() || reports > 0 || clientReports > 0;
    printf("verdict: %s\n", failed ? "FAIL" : "pass");
    if (failed || options.keep) {
        printf("private root kept: %s\n", root.c_str());
    } else {
        std::error_code ignored;
        fs::remove_all(root, ignored);
    }
    return failed ? 1 : 0;
}
