// bxd started by socket activation: the socket exists before the daemon, and the first connection starts it.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>
#include <thread>

#include "BxdProcess.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using test::BxdProcess;

TEST(SocketActivation, FirstConnectionStartsBxdOnThePassedSocket) {
    if (access("/usr/bin/systemd-socket-activate", X_OK) != 0) GTEST_SKIP() << "systemd-socket-activate not installed";
    BxdProcess environment;  // private directories only; bxd is started by the activator
    std::string socketPath = environment.socketPath();
    fs::path log = environment.root() / "activated.log";

    pid_t activator = fork();
    if (activator == 0) {
        environment.exportEnvironment();
        int fd = open(log.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644);
        dup2(fd, STDERR_FILENO);
        dup2(fd, STDOUT_FILENO);
        std::string listen = "--listen=" + socketPath;
        execl("/usr/bin/systemd-socket-activate", "systemd-socket-activate", listen.c_str(),
              "--fdname=com.quorvel.bexil.bxd", "-E", "BX_LOG_SINK", "-E", "BX_SERVICE_DIR", "-E", "BXD_LOG_LEVEL",
              BxdProcess::binary().c_str(), nullptr);
        _exit(127);
    }
    // Wait for the activator's socket to exist; bxd itself is not running yet.
    for (int i = 0; i < 500 && !fs::exists(socketPath); ++i) std::this_thread::sleep_for(std::chrono::milliseconds(10));
    ASSERT_TRUE(fs::exists(socketPath));

    pid_t client = fork();
    if (client == 0) {
        environment.exportEnvironment();
        fs::path ping = fs::path(BEXIL_BINARY_DIR) / "tests" / "bx_zem_ping";
        int devnull = open("/dev/null", O_WRONLY);
        dup2(devnull, STDOUT_FILENO);
        execl(ping.c_str(), ping.c_str(), "bogus", nullptr);
        _exit(127);
    }
    int status = 0;
    waitpid(client, &status, 0);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;

    kill(activator, SIGTERM);
    waitpid(activator, nullptr, 0);
    std::ifstream in(log);
    std::string text((std::istreambuf_iterator<char>(in)), {});
    EXPECT_NE(text.find("listening on service com.quorvel.bexil.bxd (socket passed by systemd)"), std::string::npos)
        << text;
}

}  // namespace
}  // namespace bexil
