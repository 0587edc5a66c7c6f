#include <gtest/gtest.h>
#include <stdlib.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "TestSupport.h"
#include "platform/sandbox/ProcessSandbox.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;

// A process table of our own: "self" and process 42 each get a status file and a user namespace link.
class ProcessSandboxTest : public ::testing::Test {
  protected:
    void SetUp() override {
        fs::create_directories(root_ / "namespaces");
        std::ofstream(root_ / "namespaces" / "ours") << "";
        std::ofstream(root_ / "namespaces" / "theirs") << "";
        process("self", "0", "ours");
    }

    void process(const std::string& name, const std::string& seccomp, const std::string& space) {
        fs::path dir = root_ / name;
        fs::create_directories(dir / "ns");
        std::ofstream(dir / "status") << "Name:\tclient\nUmask:\t0022\nSeccomp:\t" << seccomp
                                      << "\nSeccomp_filters:\t0\n";
        fs::remove(dir / "ns" / "user");
        fs::create_symlink(root_ / "namespaces" / space, dir / "ns" / "user");
    }

    test::TempDir tmp_{"bxsandbox-test"};
    fs::path root_ = tmp_.path();
};

TEST_F(ProcessSandboxTest, PlainProcessInOurNamespaceIsNotSandboxed) {
    process("42", "0", "ours");
    EXPECT_FALSE(processIsSandboxed(42, root_));
}

TEST_F(ProcessSandboxTest, SeccompFilterOrStrictModeIsSandboxed) {
    process("42", "2", "ours");
    EXPECT_TRUE(processIsSandboxed(42, root_));
    process("42", "1", "ours");
    EXPECT_TRUE(processIsSandboxed(42, root_));
}

TEST_F(ProcessSandboxTest, AnotherUserNamespaceIsSandboxed) {
    process("42", "0", "theirs");
    EXPECT_TRUE(processIsSandboxed(42, root_));
}

TEST_F(ProcessSandboxTest, UnknownStateCountsAsSandboxed) {
    EXPECT_TRUE(processIsSandboxed(43, root_)) << "no such process";
    fs::create_directories(root_ / "44" / "ns");
    std::ofstream(root_ / "44" / "status") << "Name:\told-kernel\n";
    EXPECT_TRUE(processIsSandboxed(44, root_)) << "no Seccomp line";
    process("45", "garbage", "ours");
    EXPECT_TRUE(processIsSandboxed(45, root_));
    process("46", "0", "ours");
    fs::remove(root_ / "46" / "ns" / "user");
    EXPECT_TRUE(processIsSandboxed(46, root_)) << "namespace not visible";
}

TEST_F(ProcessSandboxTest, TheTestProcessItselfAsTheRealProcessTableSeesIt) {
    std::ifstream status("/proc/self/status");
    std::string line;
    bool filtered = false;
    while (std::getline(status, line))
        if (line.rfind("Seccomp:", 0) == 0) filtered = line.find('0') == std::string::npos;
    EXPECT_EQ(processIsSandboxed(getpid()), filtered);
}

}  // namespace
}  // namespace bexil
