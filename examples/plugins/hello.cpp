// The Hello example plug-in: greets every line its host sends. bxd starts it in its sandbox with one end of a
// socket to the host as descriptor BEXIL_PLUGIN_FD; the plug-in reads lines from it and answers each with one line,
// until the host closes its end. It uses nothing but the C library, as a plug-in in any language could.

#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <string>

namespace {

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
    const char* home = std::getenv("HOME");
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
            std::string answer = "Hello, " + line + "! (plug-in pid " + std::to_string(getpid()) + ", home " +
                                 (home ? home : "none") + ")\n";
            if (!writeAll(host, answer)) return 0;
            line.clear();
        }
    }
}
