// A plug-in for the confinement tests: runs one probe per line its host sends and answers with one line, "ok" with
// what it found or "error" with the reason. Probes: "write PATH", "read PATH", "connect PORT" (TCP to
// 127.0.0.1), "env NAME", "uid".

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <string>

namespace {

std::string failure() { return std::string("error ") + std::strerror(errno); }

std::string probe(const std::string& line) {
    size_t space = line.find(' ');
    std::string verb = line.substr(0, space);
    std::string argument = space == std::string::npos ? std::string() : line.substr(space + 1);
    if (verb == "write") {
        int fd = open(argument.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
        if (fd < 0) return failure();
        bool wrote = write(fd, "probe\n", 6) == 6;
        close(fd);
        return wrote ? "ok" : failure();
    }
    if (verb == "read") {
        int fd = open(argument.c_str(), O_RDONLY | O_CLOEXEC);
        if (fd < 0) return failure();
        char buffer[64];
        ssize_t n = read(fd, buffer, sizeof buffer);
        close(fd);
        if (n < 0) return failure();
        std::string text(buffer, static_cast<size_t>(n));
        return "ok " + text.substr(0, text.find('\n'));
    }
    if (verb == "connect") {
        int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        if (fd < 0) return failure();
        sockaddr_in address{};
        address.sin_family = AF_INET;
        address.sin_port = htons(static_cast<uint16_t>(std::atoi(argument.c_str())));
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        int rc = connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address);
        std::string answer = rc == 0 ? "ok" : failure();
        close(fd);
        return answer;
    }
    if (verb == "env") {
        const char* value = std::getenv(argument.c_str());
        return value ? std::string("ok ") + value : "error unset";
    }
    if (verb == "uid") return "ok " + std::to_string(getuid());
    return "error unknown probe";
}

}  // namespace

int main() {
    const char* named = std::getenv("BEXIL_PLUGIN_FD");
    if (named == nullptr) return 64;
    const int host = std::atoi(named);
    std::string line;
    char c;
    for (;;) {
        ssize_t n = read(host, &c, 1);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) return 0;
        if (c != '\n') {
            line += c;
            continue;
        }
        std::string answer = probe(line) + "\n";
        if (write(host, answer.data(), answer.size()) != static_cast<ssize_t>(answer.size())) return 0;
        line.clear();
    }
}
