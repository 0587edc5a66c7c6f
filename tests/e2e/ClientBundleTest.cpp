// The daemon knows which application a client runs from: the bundle that contains the client's executable.

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>

#include "BxdProcess.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using test::BxdProcess;

fs::path pingBinary() { return fs::path(BEXIL_BINARY_DIR) / "tests" / "bx_zem_ping"; }

// Runs `program` with the daemon's private environment; returns its exit status.
int runClient(const BxdProcess& bxd, const fs::path& program) {
    pid_t child = fork();
    if (child == 0) {
        bxd.exportEnvironment();
        execl(program.c_str(), program.c_str(), "bogus", nullptr);
        _exit(127);
    }
    int status = 0;
    waitpid(child, &status, 0);
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

TEST(ClientBundle, ClientInsideAnApplicationCarriesThatApplicationsBundle) {
    BxdProcess bxd;
    ASSERT_TRUE(bxd.start()) << bxd.log();

    // A copy of the example application whose executable is a real client program.
    fs::path app = bxd.root() / "Greeter.app";
    fs::copy(fs::path(BEXIL_SOURCE_DIR) / "examples" / "bundles" / "Greeter.app", app, fs::copy_options::recursive);
    fs::remove(app / "greeter");
    fs::copy_file(pingBinary(), app / "greeter");
    fs::permissions(app / "greeter", fs::perms::owner_all | fs::perms::group_read | fs::perms::group_exec |
                                         fs::perms::others_read | fs::perms::others_exec);

    ASSERT_EQ(runClient(bxd, app / "greeter"), 0) << bxd.log();
    std::string expected = "is inside bundle " + fs::canonical(app).string() + " (com.example.greeter)";
    EXPECT_TRUE(bxd.waitForLog(expected)) << bxd.log();

    // The same program outside any bundle has none.
    ASSERT_EQ(runClient(bxd, pingBinary()), 0);
    EXPECT_EQ(bxd.countInLog("is inside bundle"), 1u) << bxd.log();
}

}  // namespace
}  // namespace bexil
