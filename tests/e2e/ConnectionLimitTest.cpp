// Connection limits through the real daemon: one user cannot take more than its share of connections, the last
// places are kept for root, each limit is logged once when it is hit, and other clients go on being served. The
// greedy client runs as user nobody, so these tests need root.

#include <grp.h>
#include <gtest/gtest.h>

#include "E2eSupport.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using namespace test;

const fs::path kConnectionHog = fs::path(BEXIL_BINARY_DIR) / "tests/bx_connection_hog";

class ConnectionLimitTest : public DaemonTest {
  protected:
    void SetUp() override {
        if (geteuid() != 0) GTEST_SKIP() << "needs root to run a client as another user";
        fs::permissions(bxd_.root(), fs::perms(0755));
    }
    void TearDown() override {
        unsetenv("BX_MAX_CONNECTIONS");
        unsetenv("BX_MAX_CONNECTIONS_PER_USER");
    }

    // A client of user nobody holding `count` connections until end() is called.
    struct Hog {
        pid_t pid = -1;
        UniqueFd input;
        int answered = -1;
        void end() {
            input.reset();
            if (pid > 0) waitpid(std::exchange(pid, -1), nullptr, 0);
        }
        ~Hog() { end(); }
    };
    std::unique_ptr<Hog> startHog(int count) {
        int in[2], out[2];
        EXPECT_EQ(pipe2(in, O_CLOEXEC), 0);
        EXPECT_EQ(pipe2(out, O_CLOEXEC), 0);
        auto hog = std::make_unique<Hog>();
        std::string countText = std::to_string(count);
        hog->pid = fork();
        if (hog->pid == 0) {
            if (dup2(in[0], 0) < 0 || dup2(out[1], 1) < 0 || setgroups(0, nullptr) != 0 ||
                setresgid(65534, 65534, 65534) != 0 || setresuid(65534, 65534, 65534) != 0)
                _exit(125);
            execl(kConnectionHog.c_str(), kConnectionHog.c_str(), countText.c_str(), nullptr);
            _exit(127);
        }
        close(in[0]);
        close(out[1]);
        hog->input.reset(in[1]);
        char line[32] = {};
        ssize_t n = read(out[0], line, sizeof line - 1);
        close(out[0]);
        hog->answered = n > 0 ? std::atoi(line) : -1;
        if (hog->answered < 0) {
            int status = 0;
            waitpid(std::exchange(hog->pid, -1), &status, 0);
            ADD_FAILURE() << "the client ended without answering, status "
                          << (WIFEXITED(status) ? WEXITSTATUS(status) : -1);
        }
        return hog;
    }
};

// Guards the per-user limit: a user's connections past its limit are closed at accept, the limit is logged once
// however many are refused, root is served meanwhile, and once the user's connections end it may connect again.
TEST_F(ConnectionLimitTest, OneUserCannotTakeMoreThanItsShare) {
    setenv("BX_MAX_CONNECTIONS_PER_USER", "4", 1);
    ASSERT_TRUE(start()) << bxd_.log();
    auto greedy = startHog(10);
    EXPECT_EQ(greedy->answered, 4) << bxd_.log();
    expectLog("user 65534 has 4 connections to service com.quorvel.bexil.bxd, the limit (kMaxConnectionsPerUser)");
    EXPECT_EQ(bxd_.countInLog("the limit (kMaxConnectionsPerUser)"), 1u) << "logged once, not per refusal";
    succeed(request("bulk"));

    greedy->end();
    for (int i = 0; i < 500 && bxd_.countInLog(" is dead") < 4; ++i)
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    auto again = startHog(4);
    EXPECT_EQ(again->answered, 4) << "the user's count went down as its connections ended";
}

// Guards the total limit and root's reserve: with 8 connections in all, 2 are kept for root, so a user gets 6;
// root still gets in, and the limit is logged once.
TEST_F(ConnectionLimitTest, TheLastPlacesAreKeptForRoot) {
    setenv("BX_MAX_CONNECTIONS", "8", 1);
    ASSERT_TRUE(start()) << bxd_.log();
    expectLog("connections 8 (256 per user");
    auto greedy = startHog(10);
    EXPECT_EQ(greedy->answered, 6) << bxd_.log();
    expectLog("connections, the limit (kMaxConnections 8, of which 2 kept for root): refusing new ones");
    EXPECT_EQ(bxd_.countInLog("the limit (kMaxConnections 8"), 1u);
    succeed(request("bulk"));
}

// Guards the descriptors: under an open-file limit of 256 bxd cannot afford 4096 connections, so it lowers its limit
// (two descriptors per connection, 128 kept back) and says so, rather than failing accepts later.
TEST_F(ConnectionLimitTest, TheConnectionLimitStaysBelowWhatTheDescriptorsAllow) {
    bxd_.setLauncher({"/usr/bin/prlimit", "--nofile=256:256", "--"});
    ASSERT_TRUE(start()) << bxd_.log();
    expectLog("connection limit lowered from 4096 to 64: the open-file limit is 256");
    succeed(request("bulk"));
}

}  // namespace
}  // namespace bexil
