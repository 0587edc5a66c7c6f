#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdio>
#include <map>
#include <optional>
#include <sstream>
#include <string>
#include <vector>

#include "platform/trace/Probes.h"

namespace bexil {
namespace {

struct ProbeNote {
    std::string provider;
    unsigned long long semaphore = 0;
    // The size part of each argument, "-4" for a signed 4-byte value, "8" for an unsigned 8-byte one.
    std::vector<std::string> argumentSizes;
};

// The probe notes of this very executable, as readelf shows them to tracers, keyed by probe name.
std::map<std::string, ProbeNote> readProbeNotes() {
    std::map<std::string, ProbeNote> notes;
    // readelf runs in a child, where /proc/self would be readelf itself: name our own executable by pid instead.
    std::string command = "readelf -n /proc/" + std::to_string(getpid()) + "/exe 2>/dev/null";
    FILE* pipe = popen(command.c_str(), "r");
    if (pipe == nullptr) return notes;
    std::string output;
    char buf[4096];
    for (size_t n; (n = fread(buf, 1, sizeof buf, pipe)) > 0;) output.append(buf, n);
    pclose(pipe);

    std::istringstream lines(output);
    std::string line, provider, name;
    while (std::getline(lines, line)) {
        auto field = [&](const char* label) -> std::optional<std::string> {
            size_t at = line.find(label);
            if (at == std::string::npos) return std::nullopt;
            return line.substr(at + std::string(label).size());
        };
        if (auto p = field("Provider: ")) {
            provider = *p;
        } else if (auto n = field("Name: ")) {
            name = *n;
            notes[name].provider = provider;
        } else if (auto s = field("Semaphore: ")) {
            notes[name].semaphore = std::stoull(*s, nullptr, 16);
        } else if (auto a = field("Arguments: ")) {
            std::istringstream args(*a);
            for (std::string arg; args >> arg;) notes[name].argumentSizes.push_back(arg.substr(0, arg.find('@')));
        }
    }
    return notes;
}

TEST(ProbesTest, EveryProbeIsInTheBinaryWithItsArgumentTypes) {
    // Firing them with no tracer attached does nothing, and keeps every probe site linked into this binary.
    trace::clientNew(1);
    trace::clientDone(1);
    trace::requestInput(1, "{}");
    trace::request(1, "match");
    trace::requestOutput(1, "{}");
    trace::dbLoad("Bexil", 7);
    trace::discoverRaw(3);
    trace::pluginAdd("com.example.plugin");
    trace::pluginRemove("com.example.plugin", true);
    trace::pluginReady("com.example.plugin");

    auto notes = readProbeNotes();
    ASSERT_FALSE(notes.empty()) << "readelf found no probe notes";
    const std::map<std::string, std::vector<std::string>> expected = {
        {"client-new", {"-4"}},   {"client-done", {"-4"}},         {"request-input", {"-4", "8"}},
        {"request", {"-4", "8"}}, {"request-output", {"-4", "8"}}, {"db-load", {"8", "8"}},
        {"discover-raw", {"4"}},  {"plugin-add", {"8"}},           {"plugin-remove", {"8", "1"}},
        {"plugin-ready", {"8"}},
    };
    for (const auto& [name, sizes] : expected) {
        auto it = notes.find(name);
        ASSERT_NE(it, notes.end()) << "missing probe " << name;
        EXPECT_EQ(it->second.provider, "bxd") << name;
        EXPECT_EQ(it->second.argumentSizes, sizes) << name;
        bool hasSemaphore = name == "request-input" || name == "request-output";
        EXPECT_EQ(it->second.semaphore != 0, hasSemaphore) << name;
    }
    EXPECT_NE(notes["request-input"].semaphore, notes["request-output"].semaphore);
}

}  // namespace
}  // namespace bexil
