// The bexil tool and libbexil against the real bxd: exit statuses, one-line errors, the daemon-not-running line,
// arguments refused before anything is sent, and an application built from an installed copy of the library.
// (How each argument is checked: ToolArgumentsTest; the exclusions subcommand: DiscoveryTest.)

#include <gtest/gtest.h>

#include <tuple>

#include "E2eSupport.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using namespace test;

size_t lines(const std::string& text) { return static_cast<size_t>(std::count(text.begin(), text.end(), '\n')); }

using ClientToolTest = DaemonTest;

// Guards the tool's exit statuses and one-line errors: 69 naming the service's socket when no daemon listens; 64 for
// usage errors (a bad argument, a missing option, an unknown subcommand, a missing argument), which send nothing
// (the daemon logs every request it dispatches); the daemon's code for its errors, in one line naming the request
// (--json prints the raw reply instead); 0 and nothing on standard error for success.
TEST_F(ClientToolTest, ExitStatusesAndOneLineErrors) {
    Outcome down = bexil("match");
    EXPECT_EQ(down.status, 69);
    EXPECT_EQ(down.err, "bexil: bxd is not running on service com.quorvel.bexil.bxd (" + bxd_.socketPath() + ")\n");
    EXPECT_EQ(
        bexil("--service com.example.other bulk").err,
        "bexil: bxd is not running on service com.example.other (" + bxd_.socketPath("com.example.other") + ")\n");

    ASSERT_TRUE(start());
    const std::string uuid = "11111111-2222-4333-8444-555555555555";
    // Text that is not UTF-8 cannot travel: the tool says where it is, and that it sent nothing.
    const std::string badRules = (bxd_.root() / "bad-rules.json").string();
    std::ofstream(badRules) << "{\n  \"RZExtensionPointIdentifier\": \"com.example.\xff\"\n}\n";
    // Each row: arguments, exit status, text the one line on standard error must hold.
    const std::tuple<std::string, int, std::string> cases[] = {
        {"ready not-a-uuid", 64, "not a UUID"},
        {"match --rules-file /nonexistent/rules.json", 64, "/nonexistent/rules.json"},
        {"match --rules-file " + badRules, 64, "JSON line 2, column 46: text is not UTF-8 (bad byte 0xff)"},
        {"match $(printf 'RZExtensionPointIdentifier=\\377')", 64,
         "bexil: match not sent: it holds text that is not UTF-8"},
        {"annotate " + uuid, 64, "needs --election or --extension"},
        {"frobnicate", 64, ""},
        {"add", 64, ""},
        {"ready " + uuid, 4, "bexil: ready failed (code 4): "},
        {"add /no/such.bxplugin", 9, "bexil: add failed (code 9): invalid plugin path: /no/such.bxplugin\n"},
    };
    for (const auto& [arguments, status, text] : cases) {
        Outcome run = bexil(arguments);
        EXPECT_EQ(run.status, status) << arguments << ": " << run.err;
        EXPECT_EQ(lines(run.err), 1u) << arguments << ": " << run.err;
        EXPECT_EQ(run.err.rfind("bexil: ", 0), 0u) << run.err;
        EXPECT_NE(run.err.find(text), std::string::npos) << arguments << ": " << run.err;
    }
    EXPECT_EQ(bxd_.countInLog(" requested "), 2u) << "only the last two reached the daemon\n" << bxd_.log();

    Outcome json = bexil("--json ready " + uuid);
    EXPECT_EQ(json.status, 4);
    EXPECT_NE(json.out.find("\"errorcode\": 4"), std::string::npos) << json.out;
    EXPECT_NE(json.out.find("\"error\": "), std::string::npos) << json.out;
    Outcome bulk = bexil("bulk");
    EXPECT_EQ(bulk.status, 0) << bulk.err;
    EXPECT_EQ(bulk.err, "");
}

// Guards the help texts: every subcommand has one with an example, and the top one lists the exit statuses.
TEST_F(ClientToolTest, EverySubcommandHasHelpWithAnExample) {
    for (const char* sub :
         {"add", "remove", "bulk", "match", "ready", "access", "annotate", "elect", "unelect", "bulk-annotate", "hold",
          "holds", "release", "launch", "exclusions", "changes", "watch", "doctor", "completions"}) {
        Outcome run = bexil(std::string(sub) + " --help");
        EXPECT_EQ(run.status, 0) << sub;
        EXPECT_NE(run.out.find("example: bexil"), std::string::npos) << sub << ": " << run.out;
    }
    EXPECT_NE(bexil("--help").out.find("69 bxd not running"), std::string::npos);
}

// Guards the installed library: the install holds the tool, its manual and shell completions, the public headers
// (each compiling alone, and no private one), the manual of the C interface, the pkg-config and CMake files, the
// Python module, and the example applications, in C++ and in C99, build with pkg-config alone and talk to bxd.
TEST_F(ClientToolTest, InstalledLibraryBuildsAndRunsTheExample) {
    fs::path prefix = bxd_.root() / "prefix", work = bxd_.root() / "example";
    fs::create_directories(work);
    for (const char* file : {"list-plugins.cpp", "list-plugins.c", "Makefile"})
        fs::copy(fs::path(BEXIL_SOURCE_DIR) / "examples/client" / file, work);
    Outcome install =
        shell("cmake --install '" + std::string(BEXIL_BINARY_DIR) + "' --prefix '" + prefix.string() + "'");
    ASSERT_EQ(install.status, 0) << install.err;
    fs::path libdir = fs::exists(prefix / "lib/pkgconfig/bexil.pc") ? prefix / "lib" : prefix / "lib64";
    for (const fs::path& installed :
         {libdir / "pkgconfig/bexil.pc", prefix / "include/bexil/bexil.h", prefix / "include/bexil/bexil-c.h",
          prefix / "share/man/man3/bexil-c.3", prefix / "lib/python3/dist-packages/bexil/__init__.py",
          prefix / "bin/bexil", prefix / "share/man/man1/bexil.1", libdir / "cmake/Bexil/BexilConfig.cmake",
          prefix / "share/bash-completion/completions/bexil", prefix / "share/zsh/vendor-completions/_bexil",
          prefix / "share/fish/vendor_completions.d/bexil.fish"})
        ASSERT_TRUE(fs::exists(installed)) << installed;
    // Each installed header stands alone on the install tree: nothing of the source tree is on the include path.
    for (const auto& entry : fs::recursive_directory_iterator(prefix / "include")) {
        if (!entry.is_regular_file()) continue;
        std::string text = slurp(entry.path());
        EXPECT_EQ(text.find("asio"), std::string::npos) << entry.path();
        EXPECT_EQ(text.find("#include \"base/"), std::string::npos) << entry.path();
        EXPECT_EQ(text.find("platform/"), std::string::npos) << entry.path();
        std::string name = fs::relative(entry.path(), prefix / "include").string();
        Outcome alone = shell("printf '#include <" + name + ">\\n' | c++ -std=c++20 -fsyntax-only -Wall -Werror -I'" +
                              (prefix / "include").string() + "' -x c++ -");
        EXPECT_EQ(alone.status, 0) << name << ": " << alone.err;
    }
#ifdef __SANITIZE_ADDRESS__
    const std::string extra =
        "EXTRA_CXXFLAGS='-fsanitize=address,undefined' EXTRA_CFLAGS='-fsanitize=address,undefined' ";
#else
    const std::string extra;
#endif
    Outcome build =
        shell("cd '" + work.string() + "' && PKG_CONFIG_PATH='" + (libdir / "pkgconfig").string() + "' make " + extra);
    ASSERT_EQ(build.status, 0) << build.out << build.err;

    const std::string run = "LD_LIBRARY_PATH='" + libdir.string() + "' '" + (work / "list-plugins").string() + "'";
    const std::string runC = "LD_LIBRARY_PATH='" + libdir.string() + "' '" + (work / "list-plugins-c").string() + "'";
    for (const std::string& program : {run, runC}) {
        Outcome offline = shell(program);
        EXPECT_EQ(offline.status, 1) << offline.out << offline.err;
        EXPECT_NE(offline.out.find("bxd is not reachable"), std::string::npos) << offline.out;
    }

    ASSERT_TRUE(start());
    Outcome online = shell(run);
    EXPECT_EQ(online.status, 0) << online.out << online.err;
    EXPECT_NE(online.out.find("libbexil 0.1.0"), std::string::npos) << online.out;
    EXPECT_NE(online.out.find("match: 0 plug-ins"), std::string::npos) << "nothing is registered" << online.out;
    Outcome onlineC = shell(runC);
    EXPECT_EQ(onlineC.status, 0) << onlineC.out << onlineC.err;
    EXPECT_NE(onlineC.out.find("libbexil 0.1.0 (C)"), std::string::npos) << onlineC.out;
    EXPECT_NE(onlineC.out.find("\"matches\":[]"), std::string::npos) << "nothing is registered" << onlineC.out;
#ifndef __SANITIZE_ADDRESS__
    // The installed Python module runs the Python example (python3 cannot load a library built with the sanitizers).
    Outcome python =
        shell("PYTHONPATH='" + (prefix / "lib/python3/dist-packages").string() + "' LD_LIBRARY_PATH='" +
              libdir.string() + "' /usr/bin/python3 -B '" BEXIL_SOURCE_DIR "/examples/python/list_plugins.py'");
    EXPECT_EQ(python.status, 0) << python.out << python.err;
    EXPECT_NE(python.out.find("match: 0 plug-ins"), std::string::npos) << python.out;
#endif
}

}  // namespace
}  // namespace bexil
