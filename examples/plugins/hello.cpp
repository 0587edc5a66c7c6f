// The Hello example plug-in. bxd starts it in its sandbox with one end of a socket to the host as descriptor
// BEXIL_PLUGIN_FD. A host that binds the socket to Hello's protocol (GreetingProvider) calls "greet" with typed
// messages, which Hello serves through the client library; a host that just writes text lines (`bexil launch
// --say`) gets one line back for each. The first byte tells the two apart: a typed host's first frame starts with
// the frame magic, a byte that never begins UTF-8 text.

#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "GreetingProtocol.h"
#include "bexil/TypedConnection.h"

namespace {

constexpr unsigned char kFrameMagic = 0xB7;

std::string greetingFor(const std::string& name) {
    const char* home = std::getenv("HOME");
    return "Hello, " + name + "! (plug-in pid " + std::to_string(getpid()) + ", home " + (home ? home : "none") + ")";
}

int serveTyped(int host) {
    if (!greeting::declareProtocol()) return 70;
    auto connection = bexil::TypedConnection::bind(host, bexil::Value::string(greeting::kProtocol));
    if (!connection) {
        std::fprintf(stderr, "hello: %s\n", connection.error().description().c_str());
        return 70;
    }
    // The connection has checked the call against the protocol: "greet" with one string.
    auto greet = [](std::string_view, const bexil::Value& arguments) -> bexil::Result<bexil::Value> {
        return bexil::Value::array({bexil::Value::string(greetingFor(std::string(arguments.items()[0].stringView()))),
                                    bexil::Value::int64(getpid())});
    };
    if (auto broken = (*connection)->serve(greet)) {
        std::fprintf(stderr, "hello: the host broke the connection: %s\n", broken->description().c_str());
        return 1;
    }
    return 0;
}

bool writeAll(int fd, const std::string& text) {
    size_t done = 0;
    while (done < text.size()) {
        ssize_t n = write(fd, text.data() + done, text.size() - done);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) return false;
        done += static_cast<size_t>(n);
    }
    return true;
}

}  // namespace

int main() {
    const char* named = std::getenv("BEXIL_PLUGIN_FD");
    if (named == nullptr) {
        std::fprintf(stderr, "hello: no BEXIL_PLUGIN_FD: this plug-in is started by bxd for a host\n");
        return 64;
    }
    const int host = std::atoi(named);
    unsigned char first = 0;
    ssize_t peeked;
    do {
        peeked = recv(host, &first, 1, MSG_PEEK);
    } while (peeked < 0 && errno == EINTR);
    if (peeked == 0) return 0;  // the host closed its end before saying anything
    // A descriptor that cannot be peeked at (not a socket) is read as lines; the reads report any real failure.
    if (peeked > 0 && first == kFrameMagic) return serveTyped(host);
    std::string line;
    char buffer[4096];
    for (;;) {
        ssize_t n = read(host, buffer, sizeof buffer);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) return 0;  // the host closed its end: nothing more to greet
        for (ssize_t i = 0; i < n; ++i) {
            if (buffer[i] != '\n') {
                line += buffer[i];
                continue;
            }
            if (!writeAll(host, greetingFor(line) + "\n")) return 0;
            line.clear();
        }
    }
}
