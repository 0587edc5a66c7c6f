// A client that takes many connections at once, for the connection-limit tests: opens the number of connections
// given as its argument to the daemon's service, sends one request on each, prints how many were answered, and
// keeps them all open until its standard input ends.

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "bexil/Value.h"
#include "platform/zem/ZemFrame.h"
#include "platform/zem/ZemListener.h"

int main(int argc, char** argv) {
    using namespace bexil;
    if (argc != 2) return 64;
    const int count = std::atoi(argv[1]);
    const std::string path = ZemListener::socketPathForService("com.quorvel.bexil.bxd").string();
    std::vector<uint8_t> frame;
    if (ZemFrame::encode(ZemFrameKind::Request, 1, 0,
                         Value::dictionary({{"request", Value::string("bulk")}, {"version", Value::uint64(3)}}), frame))
        return 70;
    std::vector<int> sockets;
    for (int i = 0; i < count; ++i) {
        int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
        if (fd < 0 || connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) return 69;
        // A connection refused at accept may be closed already: the send fails (without SIGPIPE) and that
        // connection simply gets no answer.
        (void)send(fd, frame.data(), frame.size(), MSG_NOSIGNAL);
        sockets.push_back(fd);
    }
    int answered = 0;
    for (int fd : sockets) {
        pollfd p{fd, POLLIN, 0};
        uint8_t header[ZemFrame::kHeaderBytes];
        if (poll(&p, 1, 3000) == 1 && recv(fd, header, sizeof header, MSG_WAITALL) == sizeof header) ++answered;
    }
    printf("%d\n", answered);
    fflush(stdout);
    char byte;
    while (read(0, &byte, 1) > 0) {
    }
    return 0;
}
