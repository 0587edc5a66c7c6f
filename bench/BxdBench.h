#pragma once

// What the benchmarks that drive the real bxd over its socket share: the fatal-error exit, where bxd is found, the
// Unix socket plumbing, blocking whole writes and reads, and the private environment a child bxd starts in.

#include <fcntl.h>
#include <poll.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <optional>
#include <string>
#include <vector>

namespace bexil::bench {

// The name error messages start with; each program sets it first thing in main.
inline const char* programName = "bench";

[[noreturn]] inline void die(const char* what) {
    fprintf(stderr, "%s: %s: %s\n", programName, what, errno ? strerror(errno) : "failed");
    exit(1);
}

// The service bxd listens on when it is given no -S.
inline constexpr const char* kBxdServiceName = "com.quorvel.bexil.bxd";

// A decimal number from 1 to `max`, or none when `text` is anything else (the caller prints its usage).
inline std::optional<unsigned long> parsePositive(const char* text, unsigned long max) {
    char* end = nullptr;
    errno = 0;
    unsigned long value = strtoul(text, &end, 10);
    if (errno != 0 || end == text || *end != '\0' || *text == '-' || value == 0 || value > max) return std::nullopt;
    return value;
}

// The items of a comma-separated list, empty ones included.
inline std::vector<std::string> splitList(const char* text) {
    std::vector<std::string> items(1);
    for (const char* p = text; *p != '\0'; ++p) {
        if (*p == ',') {
            items.emplace_back();
        } else {
            items.back() += *p;
        }
    }
    return items;
}

// Built side by side: build/<preset>/bench/<program> and build/<preset>/src/daemon/bxd.
inline std::string defaultBxdPath() {
    std::filesystem::path self = std::filesystem::read_symlink("/proc/self/exe");
    return (self.parent_path() / ".." / "src" / "daemon" / "bxd").lexically_normal().string();
}

inline sockaddr_un unixAddress(const std::string& path) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (path.size() >= sizeof address.sun_path) {
        errno = ENAMETOOLONG;
        die(path.c_str());
    }
    memcpy(address.sun_path, path.c_str(), path.size() + 1);
    return address;
}

// A connected stream socket, or -1 while nothing listens at `path` yet.
inline int connectTo(const std::string& path) {
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) die("socket");
    sockaddr_un address = unixAddress(path);
    if (connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
        close(fd);
        return -1;
    }
    return fd;
}

// The pid of the process at the other end of a connected Unix socket. A daemon started under a wrapper (a profiler,
// a sandbox tool) is not the child this program forked, so figures about the daemon's process start from here.
inline pid_t peerPid(int fd) {
    ucred credentials{};
    socklen_t length = sizeof credentials;
    if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0) die("SO_PEERCRED");
    return credentials.pid;
}

inline void writeAll(int fd, const uint8_t* bytes, size_t length) {
    while (length > 0) {
        ssize_t n = write(fd, bytes, length);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) die("write");
        bytes += n;
        length -= static_cast<size_t>(n);
    }
}

// Waits for input with poll before each read, as the client library does: a thread blocked in read() on a Unix
// stream socket is also woken, for nothing, each time the peer takes in what it sent, and such a wake-up can queue
// it on a busy CPU just before its answer comes.
inline void readExactly(int fd, uint8_t* bytes, size_t length) {
    while (length > 0) {
        pollfd ready{.fd = fd, .events = POLLIN, .revents = 0};
        if (poll(&ready, 1, -1) < 0) {
            if (errno == EINTR) continue;
            die("poll");
        }
        ssize_t n = read(fd, bytes, length);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) die("read (bxd closed the connection)");
        bytes += n;
        length -= static_cast<size_t>(n);
    }
}

// In a forked child about to exec bxd: points its BX_* directories at service/, state/, runtime/ and
// entitlements.d/ under `root` and sends its log (and standard output) to root/bxd.log.
inline void enterPrivateBxdEnvironment(const std::filesystem::path& root) {
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
}

// The median and 99th percentile of `micros` (reordered).
struct Percentiles {
    double p50, p99;
};
inline Percentiles percentilesOf(std::vector<double>& micros) {
    std::sort(micros.begin(), micros.end());
    return {micros[micros.size() / 2], micros[std::min(micros.size() - 1, micros.size() * 99 / 100)]};
}

// A new temporary directory named after `prefix`, with the service/, state/, runtime/ and entitlements.d/ a
// private bxd needs (the last one only its owner may write, as bxd demands).
inline std::filesystem::path makePrivateBxdRoot(const std::string& prefix) {
    std::string pattern = (std::filesystem::temp_directory_path() / (prefix + "-XXXXXX")).string();
    if (mkdtemp(pattern.data()) == nullptr) die("mkdtemp");
    const std::filesystem::path root = pattern;
    for (const char* sub : {"service", "state", "runtime", "entitlements.d"})
        std::filesystem::create_directories(root / sub);
    std::filesystem::permissions(root / "entitlements.d", std::filesystem::perms(0755));
    return root;
}

// Starts `binary` (by default the bxd built beside this program) in the private environment of `root`, its
// annotations in root/annotations.vrec; returns its pid.
inline pid_t startPrivateBxd(const std::filesystem::path& root, const std::string& binary = defaultBxdPath()) {
    pid_t bxd = fork();
    if (bxd < 0) die("fork");
    if (bxd == 0) {
        // A benchmark that dies on an error must not leave its daemon behind.
        prctl(PR_SET_PDEATHSIG, SIGTERM);
        enterPrivateBxdEnvironment(root);
        std::string document = (root / "annotations.vrec").string();
        execl(binary.c_str(), binary.c_str(), "-d", document.c_str(), nullptr);
        _exit(127);
    }
    return bxd;
}

}  // namespace bexil::bench
