#include <gtest/gtest.h>
#include <sched.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <thread>

#include "TestSupport.h"
#include "base/Document.h"
#include "platform/codesign/CodeSigningIdentity.h"
#include "platform/codesign/EntitlementsDirectory.h"
#include "platform/log/CaptureSink.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;

constexpr const char* kManager = "com.quorvel.private.bexil.manager";

std::string selfExecutable() { return fs::read_symlink("/proc/self/exe").string(); }

class CodeSigningIdentityTest : public ::testing::Test {
  protected:
    void SetUp() override {
        fs::create_directories(root_ / "entitlements.d");
        chmod(root_.c_str(), 0755);
        chmod((root_ / "entitlements.d").c_str(), 0755);
        listener_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_un addr = address();
        ASSERT_EQ(bind(listener_, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
        ASSERT_EQ(listen(listener_, 8), 0);
    }
    void TearDown() override { close(listener_); }

    fs::path entitlementsDir() const { return root_ / "entitlements.d"; }
    sockaddr_un address() const {
        sockaddr_un addr{};
        addr.sun_family = AF_UNIX;
        strncpy(addr.sun_path, (root_ / "sock").c_str(), sizeof addr.sun_path - 1);
        return addr;
    }

    void writeEntitlements(const std::string& name, const std::string& executable, Value entitlements,
                           mode_t mode = 0644) {
        Value doc = Value::dictionary({{"Executable", Value::string(executable)}, {"Entitlements", entitlements}});
        fs::path file = entitlementsDir() / name;
        ASSERT_FALSE(Document::writeFileAtomically(file, doc).has_value());
        chmod(file.c_str(), mode);
    }

    // Forks a child that connects to the listener and exits at once.
    pid_t connectFromChild() {
        pid_t child = fork();
        if (child == 0) {
            int fd = socket(AF_UNIX, SOCK_STREAM, 0);
            sockaddr_un addr = address();
            _exit(connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0 ? 0 : 2);
        }
        return child;
    }

    test::TempDir tmp_{"bx-codesign"};
    fs::path root_ = tmp_.path();
    int listener_ = -1;
};

// Guards pid reuse: a peer gone (zombie or reaped) before it is identified gets no identity and no entitlements,
// since its pid may already name another program.
TEST_F(CodeSigningIdentityTest, PeerThatExitsRightAfterConnectingHasNoIdentity) {
    writeEntitlements("self.vrec", selfExecutable(), Value::dictionary({{kManager, Value::boolean(true)}}));
    EntitlementsDirectory dir(entitlementsDir(), geteuid());
    for (bool reaped : {false, true}) {
        pid_t child = connectFromChild();
        if (reaped) {
            waitpid(child, nullptr, 0);
        } else {
            // Wait until the child is a zombie: exited, not yet reaped.
            siginfo_t info{};
            waitid(P_PID, static_cast<id_t>(child), &info, WEXITED | WNOWAIT);
        }
        int fd = accept(listener_, nullptr, nullptr);
        ASSERT_GE(fd, 0);
        ZemPeerCredentials peer = ZemPeerCredentials::ofConnectedSocket(fd);
        auto id = CodeSigningIdentity::ofPeer(peer, &dir);
        EXPECT_FALSE(id->established()) << (reaped ? "reaped" : "zombie");
        EXPECT_TRUE(id->entitlements().count() == 0);
        auto value = id->entitlementValueForKey(kManager);
        EXPECT_FALSE(value.ok());
        close(fd);
        if (!reaped) waitpid(child, nullptr, 0);
    }
}

// Guards the daemon's side of the split: credentials the transport could not complete never give an identity or
// entitlements, even when their pid names a program that has them (here this very process).
TEST_F(CodeSigningIdentityTest, IncompleteCredentialsGrantNothing) {
    writeEntitlements("self.vrec", selfExecutable(), Value::dictionary({{kManager, Value::boolean(true)}}));
    EntitlementsDirectory dir(entitlementsDir(), geteuid());
    ZemPeerCredentials peer{.pid = getpid(), .uid = geteuid(), .gid = getegid(), .failure = "no pidfd for the peer"};
    auto id = CodeSigningIdentity::ofPeer(peer, &dir);
    EXPECT_FALSE(id->established());
    EXPECT_EQ(id->failureReason(), "no pidfd for the peer");
    EXPECT_EQ(id->entitlements().count(), 0u);
    EXPECT_FALSE(id->entitlementValueForKey(kManager).ok());
}

// Guards the trust rules for entitlements files: writable by others, foreign owner, a link, an open directory or a
// writable program each grant nothing; a malformed file beside a good one does not spoil it.
TEST_F(CodeSigningIdentityTest, UntrustedFilesGrantNothing) {
    log::CaptureSink capture;
    const std::string self = selfExecutable();
    EntitlementsDirectory dir(entitlementsDir(), geteuid());

    for (mode_t writableByOthers : {0664, 0646}) {
        writeEntitlements("writable.vrec", self, Value::dictionary({{kManager, Value::boolean(true)}}),
                          writableByOthers);
        EXPECT_EQ(dir.entitlementsForExecutable(self)->count(), 0u) << writableByOthers;
        fs::remove(entitlementsDir() / "writable.vrec");
    }
    EXPECT_TRUE(capture.contains("ignoring untrusted entitlements file"));

    if (geteuid() == 0) {
        // Owned by somebody who is neither root nor the daemon's user.
        writeEntitlements("foreign.vrec", self, Value::dictionary({{kManager, Value::boolean(true)}}));
        ASSERT_EQ(chown((entitlementsDir() / "foreign.vrec").c_str(), 12345, 12345), 0);
        EXPECT_EQ(dir.entitlementsForExecutable(self)->count(), 0u);
        fs::remove(entitlementsDir() / "foreign.vrec");
    }

    // A symbolic link is judged as itself, even when it leads to a trusted file: the link could be repointed.
    writeEntitlements("target.vrec.off", self, Value::dictionary({{kManager, Value::boolean(true)}}));
    fs::create_symlink(entitlementsDir() / "target.vrec.off", entitlementsDir() / "link.vrec");
    EXPECT_EQ(dir.entitlementsForExecutable(self)->count(), 0u);
    fs::remove(entitlementsDir() / "link.vrec");

    // A directory that others may write to makes every file in it untrusted, however good the file.
    writeEntitlements("good.vrec", self, Value::dictionary({{kManager, Value::boolean(true)}}));
    chmod(entitlementsDir().c_str(), 0777);
    EXPECT_EQ(dir.entitlementsForExecutable(self)->count(), 0u);
    EXPECT_TRUE(capture.contains("is not trusted (owner or mode); no program has entitlements"));
    chmod(entitlementsDir().c_str(), 0755);
    fs::remove(entitlementsDir() / "good.vrec");

    // A trusted file naming an executable that others may write grants nothing either.
    fs::path copy = root_ / "writable-program";
    fs::copy_file(self, copy);
    chmod(copy.c_str(), 0777);
    writeEntitlements("writable-program.vrec", copy.string(), Value::dictionary({{kManager, Value::boolean(true)}}));
    EXPECT_EQ(dir.entitlementsForExecutable(copy.string())->count(), 0u);

    // Malformed documents are ignored, and a correct file beside them still counts.
    std::ofstream(entitlementsDir() / "garbage.vrec") << "<not a document";
    chmod((entitlementsDir() / "garbage.vrec").c_str(), 0644);
    writeEntitlements("good.vrec", self, Value::dictionary({{kManager, Value::string("yes")}}));
    auto granted = dir.entitlementsForExecutable(self);
    ASSERT_TRUE(granted.ok());
    EXPECT_EQ(granted->get(kManager), Value::string("yes"));
}

// Guards against borrowing a trusted program's name: a process that runs another file mounted over an entitled
// program (in a mount namespace of its own) shows that program's path, but gets none of its entitlements; the same
// program run plainly does.
TEST_F(CodeSigningIdentityTest, AFileMountedOverAnEntitledProgramGetsNothing) {
    if (geteuid() != 0) GTEST_SKIP() << "mounting needs root";
    const fs::path entitled = root_ / "entitled", impostor = root_ / "impostor";
    fs::copy_file("/usr/bin/sleep", entitled);
    fs::copy_file("/usr/bin/sleep", impostor);
    writeEntitlements("entitled.vrec", entitled.string(), Value::dictionary({{kManager, Value::boolean(true)}}));
    EntitlementsDirectory dir(entitlementsDir(), geteuid());
    log::CaptureSink capture;
    for (bool mountedOver : {false, true}) {
        SCOPED_TRACE(mountedOver ? "impostor mounted over the program" : "the program itself");
        pid_t child = fork();
        if (child == 0) {
            int fd = socket(AF_UNIX, SOCK_STREAM, 0);  // kept across exec: the peer is the program that follows
            sockaddr_un addr = address();
            if (connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) _exit(2);
            if (mountedOver &&
                (unshare(CLONE_NEWNS) != 0 || mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) ||
                 mount(impostor.c_str(), entitled.c_str(), nullptr, MS_BIND, nullptr) != 0))
                _exit(3);
            execl(entitled.c_str(), "entitled", "30", nullptr);
            _exit(127);
        }
        int fd = accept(listener_, nullptr, nullptr);
        ASSERT_GE(fd, 0);
        // Identify the peer only once it runs the program (or what stands in its place).
        struct stat expected {
        }, seen{};
        ASSERT_EQ(stat((mountedOver ? impostor : entitled).c_str(), &expected), 0);
        const std::string exe = "/proc/" + std::to_string(child) + "/exe";
        for (int i = 0; i < 500 && !(stat(exe.c_str(), &seen) == 0 && seen.st_ino == expected.st_ino); ++i)
            std::this_thread::sleep_for(std::chrono::milliseconds(10));
        ASSERT_EQ(seen.st_ino, expected.st_ino) << "the child never ran the program";

        auto id = CodeSigningIdentity::ofPeer(ZemPeerCredentials::ofConnectedSocket(fd), &dir);
        EXPECT_TRUE(id->established()) << id->failureReason();
        EXPECT_EQ(id->executablePath(), entitled.string()) << "the name is the same either way";
        EXPECT_EQ(id->entitlements().count(), mountedOver ? 0u : 1u);
        close(fd);
        kill(child, SIGKILL);
        waitpid(child, nullptr, 0);
    }
    EXPECT_TRUE(capture.contains("ignoring entitlements of " + entitled.string() +
                                 ": the process runs another file under that name"));
}

// Guards reloading: a changed file is seen, the later of two files for one program wins, a removed one is forgotten
// (revoking entitlements must not need a restart).
TEST_F(CodeSigningIdentityTest, ChangedFilesAreSeenAndRemovedFilesForgotten) {
    const std::string self = selfExecutable();
    EntitlementsDirectory dir(entitlementsDir(), geteuid());
    writeEntitlements("a.vrec", self, Value::dictionary({{"k", Value::int64(1)}}));
    EXPECT_EQ(dir.entitlementsForExecutable(self)->get("k"), Value::int64(1));
    writeEntitlements("a.vrec", self, Value::dictionary({{"k", Value::int64(2)}}));
    EXPECT_EQ(dir.entitlementsForExecutable(self)->get("k"), Value::int64(2));
    // Two files for one program: the later name wins, whatever order the directory lists them in.
    writeEntitlements("b.vrec", self, Value::dictionary({{"k", Value::int64(3)}}));
    EXPECT_EQ(dir.entitlementsForExecutable(self)->get("k"), Value::int64(3));
    fs::remove(entitlementsDir() / "b.vrec");
    fs::remove(entitlementsDir() / "a.vrec");
    EXPECT_EQ(dir.entitlementsForExecutable(self)->count(), 0u);
}

}  // namespace
}  // namespace bexil
