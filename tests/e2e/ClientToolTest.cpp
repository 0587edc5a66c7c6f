// The bexil tool and libbexil against the real bxd: exit statuses, one-line errors, the daemon-not-running line,
// arguments refused before anything is sent, and an application built from an installed copy of the library.

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "BxdProcess.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using test::BxdProcess;

struct Outcome {
    int status = -1;
    std::string out;
    std::string err;
};

std::string slurp(const fs::path& path) {
    std::ifstream in(path);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
}

size_t lines(const std::string& text) {
    size_t n = 0;
    for (char c : text) n += c == '\n';
    return n;
}

class ClientToolTest : public ::testing::Test {
  protected:
    void SetUp() override {
        bxd_.exportEnvironment();
        setenv("BX_PREFERENCES_DIR", (bxd_.root() / "prefs").c_str(), 1);
    }

    // Runs a shell command line with the tool's path as $BEXIL; standard output and error are kept apart.
    Outcome shell(const std::string& command) {
        fs::path out = bxd_.root() / "out.txt", err = bxd_.root() / "err.txt";
        std::string line =
            "BEXIL='" + tool().string() + "'; " + command + " >'" + out.string() + "' 2>'" + err.string() + "'";
        int raw = std::system(line.c_str());
        Outcome run;
        run.status = WIFEXITED(raw) ? WEXITSTATUS(raw) : -1;
        run.out = slurp(out);
        run.err = slurp(err);
        return run;
    }
    Outcome bexil(const std::string& arguments) { return shell("timeout 60 \"$BEXIL\" " + arguments); }

    static fs::path tool() { return fs::path(BEXIL_BINARY_DIR) / "tools" / "bexil" / "bexil"; }

    BxdProcess bxd_;
};

TEST_F(ClientToolTest, DaemonNotRunningIsOneLineAndStatus69) {
    Outcome run = bexil("match");
    EXPECT_EQ(run.status, 69);
    EXPECT_EQ(run.err, "bexil: bxd is not running on service com.quorvel.bexil.bxd (" + bxd_.socketPath() + ")\n");
    EXPECT_TRUE(run.out.empty());

    Outcome other = bexil("--service com.example.other bulk");
    EXPECT_EQ(other.status, 69);
    EXPECT_NE(other.err.find("service com.example.other (" + bxd_.socketPath("com.example.other") + ")"),
              std::string::npos);
}

TEST_F(ClientToolTest, BadArgumentsAreRefusedBeforeAnythingIsSent) {
    ASSERT_TRUE(bxd_.start({}, {"BXD_LOG_LEVEL=debug"}));
    const std::pair<const char*, const char*> cases[] = {
        {"ready not-a-uuid", "not a UUID"},
        {"release 11111111-2222-4333-8444-55555555555", "not a UUID"},
        {"add relative/path.bxplugin", "absolute path required: relative/path.bxplugin"},
        {"hold ./App.app", "absolute path required"},
        {"match --flag everything", "unknown discovery flag"},
        {"match novalue", "not KEY=PATTERN"},
        {"match --rules-file /nonexistent/rules.json", "/nonexistent/rules.json"},
        {"bulk-annotate /nonexistent/a.json", "/nonexistent/a.json"},
        {"annotate 11111111-2222-4333-8444-555555555555", "needs --election or --extension"},
        {"frobnicate", ""},
        {"add", ""},
    };
    for (const auto& [arguments, expected] : cases) {
        Outcome run = bexil(arguments);
        EXPECT_EQ(run.status, 64) << arguments << ": " << run.err;
        EXPECT_EQ(lines(run.err), 1u) << arguments << ": " << run.err;
        EXPECT_EQ(run.err.rfind("bexil: ", 0), 0u) << run.err;
        EXPECT_NE(run.err.find(expected), std::string::npos) << arguments << ": " << run.err;
    }
    // Nothing reached the daemon: it logs every request it dispatches.
    EXPECT_EQ(bxd_.countInLog(" requested "), 0u) << bxd_.log();
}

TEST_F(ClientToolTest, DaemonErrorsBecomeOneLineAndTheCodeAsStatus) {
    ASSERT_TRUE(bxd_.start());
    // Every request reaches its handler; the handlers not built yet, and "annotate" for an unknown plug-in, answer
    // code 4.
    const std::pair<const char*, const char*> cases[] = {
        {"ready 11111111-2222-4333-8444-555555555555", "ready"},
        {"elect 11111111-2222-4333-8444-555555555555", "annotate"},
        {"release 11111111-2222-4333-8444-555555555555", "release"},
    };
    for (const auto& [arguments, what] : cases) {
        Outcome run = bexil(arguments);
        ASSERT_NE(run.status, 0) << arguments;
        EXPECT_EQ(run.status, 4) << arguments << ": " << run.err;
        EXPECT_EQ(lines(run.err), 1u) << run.err;
        EXPECT_EQ(run.err.rfind(std::string("bexil: ") + what + " failed (code 4): ", 0), 0u) << run.err;
    }
    // The daemon's own code becomes the exit status.
    Outcome missing = bexil("add /no/such.bxplugin");
    EXPECT_EQ(missing.status, 9) << missing.err;
    EXPECT_EQ(missing.err, "bexil: add failed (code 9): invalid plugin path: /no/such.bxplugin\n");
    // A request that succeeds prints nothing on standard error and exits 0.
    Outcome bulk = bexil("bulk");
    EXPECT_EQ(bulk.status, 0) << bulk.err;
    EXPECT_EQ(bulk.err, "");
}

TEST_F(ClientToolTest, JsonOutputCarriesTheRawReply) {
    ASSERT_TRUE(bxd_.start());
    Outcome run = bexil("--json ready 11111111-2222-4333-8444-555555555555");
    EXPECT_EQ(run.status, 4);
    EXPECT_NE(run.out.find("\"errorcode\": 4"), std::string::npos) << run.out;
    EXPECT_NE(run.out.find("\"error\": "), std::string::npos) << run.out;
}

TEST_F(ClientToolTest, ExclusionsAreReadAndWrittenLocally) {
    Outcome empty = bexil("exclusions");
    EXPECT_EQ(empty.status, 0) << empty.err;
    EXPECT_NE(empty.out.find("no exclusions"), std::string::npos);

    Outcome add = bexil("exclusions --add RZExtensionPointIdentifier=com.example.ads");
    EXPECT_EQ(add.status, 0) << add.err;
    Outcome shown = bexil("--json exclusions");
    EXPECT_EQ(shown.status, 0);
    EXPECT_NE(shown.out.find("\"RZExtensionPointIdentifier\": \"com.example.ads\""), std::string::npos) << shown.out;

    fs::path bad = bxd_.root() / "bad.json";
    std::ofstream(bad) << "{\"exclusions\": [\"not a rule\"]}";
    Outcome refused = bexil("exclusions --set " + bad.string());
    EXPECT_EQ(refused.status, 64);
    Outcome still = bexil("--json exclusions");
    EXPECT_NE(still.out.find("com.example.ads"), std::string::npos) << "a refused --set must not lose the old rules";

    EXPECT_EQ(bexil("exclusions --clear").status, 0);
    EXPECT_EQ(bexil("--json exclusions").out, "[]\n");
}

TEST_F(ClientToolTest, EverySubcommandHasHelpWithAnExample) {
    for (const char* sub : {"add", "remove", "bulk", "match", "ready", "access", "annotate", "elect", "unelect",
                            "bulk-annotate", "hold", "release", "exclusions"}) {
        Outcome run = bexil(std::string(sub) + " --help");
        EXPECT_EQ(run.status, 0) << sub;
        EXPECT_NE(run.out.find("example: bexil"), std::string::npos) << sub << ": " << run.out;
    }
    Outcome top = bexil("--help");
    EXPECT_NE(top.out.find("69 bxd not running"), std::string::npos);
}

// Installs the project into a private prefix and builds the example application with pkg-config only.
TEST_F(ClientToolTest, InstalledLibraryBuildsAndRunsTheExample) {
    fs::path prefix = bxd_.root() / "prefix", work = bxd_.root() / "example";
    fs::create_directories(work);
    fs::copy(fs::path(BEXIL_SOURCE_DIR) / "examples/client/list-plugins.cpp", work);
    fs::copy(fs::path(BEXIL_SOURCE_DIR) / "examples/client/Makefile", work);
    Outcome install =
        shell("cmake --install '" + std::string(BEXIL_BINARY_DIR) + "' --prefix '" + prefix.string() + "'");
    ASSERT_EQ(install.status, 0) << install.err;
    fs::path libdir = fs::exists(prefix / "lib/pkgconfig/bexil.pc") ? prefix / "lib" : prefix / "lib64";
    ASSERT_TRUE(fs::exists(libdir / "pkgconfig/bexil.pc"));
    ASSERT_TRUE(fs::exists(prefix / "include/bexil/bexil.h"));
    ASSERT_TRUE(fs::exists(prefix / "bin/bexil"));
    ASSERT_TRUE(fs::exists(prefix / "share/man/man1/bexil.1"));
    ASSERT_TRUE(fs::exists(libdir / "cmake/Bexil/BexilConfig.cmake"));
    // No private header may come along with the public ones.
    for (const auto& entry : fs::recursive_directory_iterator(prefix / "include")) {
        if (!entry.is_regular_file()) continue;
        std::string text = slurp(entry.path());
        EXPECT_EQ(text.find("asio"), std::string::npos) << entry.path();
        EXPECT_EQ(text.find("platform/"), std::string::npos) << entry.path();
    }
#ifdef __SANITIZE_ADDRESS__
    const std::string extra = "EXTRA_CXXFLAGS='-fsanitize=address,undefined' ";
#else
    const std::string extra;
#endif
    Outcome build =
        shell("cd '" + work.string() + "' && PKG_CONFIG_PATH='" + (libdir / "pkgconfig").string() + "' make " + extra);
    ASSERT_EQ(build.status, 0) << build.out << build.err;

    std::string run = "LD_LIBRARY_PATH='" + libdir.string() + "' '" + (work / "list-plugins").string() + "'";
    Outcome offline = shell(run);
    EXPECT_EQ(offline.status, 1) << offline.out << offline.err;
    EXPECT_NE(offline.out.find("bxd is not reachable"), std::string::npos) << offline.out;

    ASSERT_TRUE(bxd_.start());
    Outcome online = shell(run);
    EXPECT_EQ(online.status, 0) << online.out << online.err;
    EXPECT_NE(online.out.find("libbexil 0.1.0"), std::string::npos) << online.out;
    // Nothing is registered in the private registry, so discovery succeeds with nothing.
    EXPECT_NE(online.out.find("match: 0 plug-ins"), std::string::npos) << online.out;
}

}  // namespace
}  // namespace bexil
