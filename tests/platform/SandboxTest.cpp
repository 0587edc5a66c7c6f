#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <fstream>

#include "TestSupport.h"
#include "platform/sandbox/ProcessSandbox.h"
#include "platform/sandbox/SandboxExtensions.h"
#include "platform/sandbox/SandboxProfiles.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;

// ---- Whether a process is sandboxed ----

// A process table of our own: "self" and the processes a test adds each get a status file and a user namespace
// link.
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

// A seccomp filter or strict mode, or another user namespace, is a sandbox; what cannot be read counts as one too.
TEST_F(ProcessSandboxTest, SeccompOrAnotherUserNamespaceOrUnknownStateIsSandboxed) {
    process("40", "0", "ours");
    process("41", "1", "ours");
    process("42", "2", "ours");
    process("43", "0", "theirs");
    process("44", "garbage", "ours");
    process("45", "0", "ours");
    fs::remove(root_ / "45" / "ns" / "user");
    fs::create_directories(root_ / "46");
    std::ofstream(root_ / "46" / "status") << "Name:\told-kernel\n";
    EXPECT_FALSE(processIsSandboxed(40, root_));
    for (pid_t pid : {41, 42, 43, 44, 45, 46, 47}) EXPECT_TRUE(processIsSandboxed(pid, root_)) << pid;
}

// ---- Extension tokens ----

class SandboxExtensionsTest : public ::testing::Test {
  protected:
    void SetUp() override { test::writeText(root_ / "bundle" / "Resources" / "a.txt", "a"); }

    fs::path keyPath() const { return root_ / "runtime" / "sandbox" / "extension-key"; }
    std::optional<std::string> issue(SandboxExtensions& issuer, const fs::path& path) {
        return issuer.issueFileExtension(SandboxExtensions::kReadOnlyClass, path.string());
    }

    test::TempDir tmp_{"sandbox-test"};
    fs::path root_ = tmp_.path();
};

// Guards the token's round trip: issued for the canonical path (through links too), with a key file only the owner
// can read, consumable by another process, and stable for the run even if the key file is removed.
TEST_F(SandboxExtensionsTest, IssuedTokenNamesTheCanonicalPathAndIsConsumable) {
    SandboxExtensions issuer(keyPath());
    auto token = issue(issuer, root_ / "bundle" / "Resources" / ".." / "Resources" / "a.txt");
    ASSERT_TRUE(token);
    EXPECT_EQ(fs::status(keyPath()).permissions() & fs::perms::all, fs::perms::owner_read | fs::perms::owner_write);

    // Another process (here: another object over the same key file) checks and records it.
    SandboxExtensions consumer(keyPath());
    int64_t handle = consumer.consume(*token);
    ASSERT_GT(handle, 0);
    EXPECT_EQ(consumer.consumedPath(handle), (root_ / "bundle" / "Resources" / "a.txt").string());
    consumer.release(handle);
    EXPECT_FALSE(consumer.consumedPath(handle));

    // Through a symbolic link to the bundle: the token names (and signs) the file the link leads to.
    fs::create_directory_symlink(root_ / "bundle", root_ / "link");
    EXPECT_EQ(issue(issuer, root_ / "link" / "Resources" / "a.txt"), token);

    // A removed key file is written back with the same key: still the same run.
    fs::remove_all(root_ / "runtime");
    EXPECT_EQ(issue(issuer, root_ / "bundle" / "Resources" / "a.txt"), token);
    EXPECT_GT(SandboxExtensions(keyPath()).consume(*token), 0);
}

// Guards forgery: a token altered in path or class, cut short, or from an earlier run grants nothing.
TEST_F(SandboxExtensionsTest, AlteredOrForeignTokensAreRefused) {
    SandboxExtensions consumer(keyPath());
    errno = 0;
    EXPECT_EQ(consumer.consume("com.quorvel.sandbox.read-only;00;/tmp"), -1) << "no key yet";
    EXPECT_EQ(errno, ENOENT);

    SandboxExtensions issuer(keyPath());
    auto token = issue(issuer, root_ / "bundle");
    ASSERT_TRUE(token);
    std::string otherPath = *token;
    otherPath.replace(otherPath.rfind("bundle"), 6, "bundlf");
    std::string otherClass = *token;
    otherClass.replace(0, 1, "x");
    // A token without a signature, for a real path: an empty signature must never compare equal to anything.
    std::string withoutSignature = "com.quorvel.sandbox.read-only;;" + (root_ / "bundle").string();
    for (const std::string& bad :
         {otherPath, otherClass, std::string(";;"), token->substr(0, token->size() / 2), withoutSignature}) {
        errno = 0;
        EXPECT_EQ(issuer.consume(bad), -1) << bad;
        EXPECT_EQ(errno, EPERM) << bad;
    }

    // A new run makes a new key: tokens of the earlier run stop working.
    SandboxExtensions nextRun(keyPath());
    ASSERT_TRUE(issue(nextRun, root_ / "bundle"));
    EXPECT_EQ(nextRun.consume(*token), -1);
}

// Guards issuing: no token for a missing path, a dangling link or a bad class, and no key made before one is issued.
TEST_F(SandboxExtensionsTest, MissingPathsAndBadClassesGetNoToken) {
    SandboxExtensions issuer(keyPath());
    fs::create_symlink(root_ / "missing", root_ / "dangling");
    const std::pair<fs::path, int> cases[] = {{root_ / "missing", ENOENT}, {root_ / "dangling", ENOENT}};
    for (const auto& [path, code] : cases) {
        errno = 0;
        EXPECT_FALSE(issue(issuer, path)) << path;
        EXPECT_EQ(errno, code) << path;
    }
    errno = 0;
    EXPECT_FALSE(issuer.issueFileExtension("a;b", (root_ / "bundle").string()));
    EXPECT_EQ(errno, EINVAL);
    EXPECT_FALSE(issuer.issueFileExtension(SandboxExtensions::kReadOnlyClass, std::string("/tmp\0x", 6)));
    EXPECT_FALSE(fs::exists(keyPath())) << "no key is made before a token is issued";
}

// The arguments of one option followed by its operands, found anywhere in `args`.
bool hasSequence(const std::vector<std::string>& args, const std::vector<std::string>& sequence) {
    return std::search(args.begin(), args.end(), sequence.begin(), sequence.end()) != args.end();
}

// Guards what a profile may do: only the network profiles share the host's network and see its name-service
// files; every profile drops capabilities, shows the bundle read-only and the container read-write, makes the root
// read-only after the mounts, clears the environment and runs exactly the executable; unknown names are refused.
TEST(SandboxProfiles, ProfilesDifferInNetworkOnlyAndConfineAlike) {
    EXPECT_EQ(SandboxProfiles::named("no-such-profile"), nullptr);
    SandboxProfiles::Launch launch{"/apps/A.app/PlugIns/P.bxplugin",
                                   "/state/containers/p",
                                   "/apps/A.app/PlugIns/P.bxplugin/p",
                                   {{"HOME", "/state/containers/p"}},
                                   4};
    for (const char* name : {"plugin", "typepad", "netguard-filter", "peekviewd", "sketchpad-devtools"}) {
        const SandboxProfile* profile = SandboxProfiles::named(name);
        ASSERT_NE(profile, nullptr) << name;
        std::vector<std::string> args = SandboxProfiles::bubblewrapArguments(*profile, launch);
        const bool network = std::string_view(name) != "typepad" && std::string_view(name) != "peekviewd";
        EXPECT_EQ(profile->network, network) << name;
        EXPECT_EQ(std::count(args.begin(), args.end(), "--share-net"), network ? 1 : 0) << name;
        EXPECT_EQ(hasSequence(args, {"--ro-bind-try", "/etc/resolv.conf", "/etc/resolv.conf"}), network) << name;
        EXPECT_TRUE(hasSequence(args, {"--unshare-all", "--cap-drop", "ALL"})) << name;
        EXPECT_TRUE(hasSequence(args, {"--ro-bind", launch.bundle, launch.bundle})) << name;
        EXPECT_TRUE(hasSequence(args, {"--bind", *launch.container, *launch.container})) << name;
        EXPECT_TRUE(hasSequence(args, {"--tmpfs", "/tmp"})) << name;
        EXPECT_TRUE(hasSequence(args, {"--clearenv", "--setenv", "HOME", "/state/containers/p"})) << name;
        // The root is made read-only after every mount, or a later mount would go back to a writable root.
        auto readOnlyRoot = std::find(args.begin(), args.end(), "--remount-ro");
        auto lastBind = std::find(args.rbegin(), args.rend(), "--bind");
        ASSERT_NE(readOnlyRoot, args.end());
        EXPECT_GT(readOnlyRoot - args.begin(), args.rend() - lastBind - 1) << name;
        EXPECT_TRUE(hasSequence(args, {"--json-status-fd", "4", "--", launch.executable})) << name;
        EXPECT_EQ(args.back(), launch.executable) << name;
        EXPECT_EQ(std::count(args.begin(), args.end(), "/"), 1) << "nothing binds the whole root: " << name;
    }
}

}  // namespace
}  // namespace bexil
