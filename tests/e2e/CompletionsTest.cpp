// The shell completions the build writes from the tool: each shell loads its script without complaint, and the
// bash one, driven as bash drives it, completes subcommands, nested subcommands and options, steps over option
// values, and completes file names after an option that takes a file. zsh and fish are checked where installed.

#include <gtest/gtest.h>

#include "E2eSupport.h"

namespace bexil {
namespace {

using namespace test;

const std::string kCompletions = BEXIL_BINARY_DIR "/tools/bexil/completions/";

using CompletionsTest = DaemonTest;

bool installed(const char* shell) {
    return std::system(("command -v " + std::string(shell) + " >/dev/null").c_str()) == 0;
}

// Guards the bash script: it registers itself for bexil, and a command line cut at the cursor gets the words a
// user expects (one per line, sorted by compgen).
TEST_F(CompletionsTest, BashCompletesSubcommandsOptionsAndFiles) {
    Outcome loaded = shell("bash --norc -c 'source " + kCompletions + "bexil; complete -p bexil'");
    EXPECT_EQ(loaded.status, 0) << loaded.err;
    EXPECT_EQ(loaded.err, "");
    EXPECT_NE(loaded.out.find("-F _bexil bexil"), std::string::npos) << loaded.out;

    // Drives the function as bash does: the words up to the cursor, the last being the one completed.
    const std::filesystem::path driver = bxd_.root() / "drive.bash";
    std::ofstream(driver) << "source " << kCompletions << "bexil\n"
                          << "COMP_WORDS=(\"$@\"); COMP_CWORD=$(($# - 1)); COMPREPLY=(); _bexil\n"
                          << "[ ${#COMPREPLY[@]} -eq 0 ] || printf '%s\\n' \"${COMPREPLY[@]}\"\n";
    auto complete = [&](const std::string& words) {
        return shell("cd / && bash --norc '" + driver.string() + "' " + words);
    };
    const std::pair<std::string, std::string> cases[] = {
        {"bexil do", "doctor\n"},
        {"bexil --json ho", "hold\nholds\n"},
        {"bexil --service com.example.x --timeout 5 st", "status\n"},
        {"bexil sdk ''", "show\n"},
        {"bexil match --rules-", "--rules-file\n"},
        {"bexil --js", "--json\n"},
        {"bexil hold --plugin-paths --re", "--refuse-busy\n"},
        {"bexil match --rules-file " + driver.string().substr(0, driver.string().size() - 3), driver.string() + "\n"},
    };
    for (const auto& [words, expected] : cases) {
        Outcome run = complete(words);
        EXPECT_EQ(run.status, 0) << words << ": " << run.err;
        EXPECT_EQ(run.out, expected) << words;
    }
    // A command that takes arguments is offered file names, never the program's subcommands.
    Outcome arguments = complete("bexil info ''");
    EXPECT_NE(arguments.out.find("usr\n"), std::string::npos) << arguments.out;
    EXPECT_EQ(arguments.out.find("doctor"), std::string::npos) << arguments.out;
}

// Guards the zsh and fish scripts where those shells exist. zsh's compadd and _files exist only inside its
// completion system, so stand-ins print what the function offers (compadd leaves filtering to the shell).
TEST_F(CompletionsTest, ZshAndFishCompleteSubcommandsAndOptions) {
    if (!installed("zsh") && !installed("fish")) GTEST_SKIP() << "neither zsh nor fish is installed";
    if (installed("zsh")) {
        const std::filesystem::path driver = bxd_.root() / "drive.zsh";
        std::ofstream(driver) << "compadd() { shift; print -l -- \"$@\"; }\n_files() { print FILES; }\n"
                              << "words=(\"$@\"); CURRENT=$#\nsource " << kCompletions << "_bexil\n";
        const std::pair<std::string, std::string> cases[] = {
            {"bexil sdk ''", "show\n"},
            {"bexil --service x hold --re", "--help\n-h\n--plugin-paths\n--refuse-busy\n--terminate\n--wait\n"},
            {"bexil match --rules-file ''", "FILES\n"},
        };
        for (const auto& [words, expected] : cases) {
            Outcome run = shell("zsh -f '" + driver.string() + "' " + words);
            EXPECT_EQ(run.status, 0) << words << ": " << run.err;
            EXPECT_EQ(run.out, expected) << words;
        }
    }
    if (installed("fish")) {
        Outcome run = shell("fish --no-config -c 'source " + kCompletions +
                            "bexil.fish; complete -C \"bexil doc\"; complete -C \"bexil match --rul\"'");
        EXPECT_EQ(run.status, 0) << run.err;
        EXPECT_EQ(run.out.rfind("doctor\t", 0), 0u) << run.out;
        EXPECT_NE(run.out.find("\n--rules-file\t"), std::string::npos) << run.out;
    }
}

}  // namespace
}  // namespace bexil
