#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdio>
#include <string>

#include "platform/trace/Probes.h"

namespace bexil {
namespace {

// Guards that the trace probes tracers attach to are built into the binary under the provider "bxd": a build
// change that drops the probe notes would otherwise go unnoticed until someone tries to trace the daemon.
TEST(ProbesTest, ProbesAreInTheBinaryUnderTheirProvider) {
    // Firing them with no tracer attached does nothing, and keeps the probe sites linked into this binary.
    trace::clientNew(1);
    trace::requestInput(1, "{}");
    trace::pluginRemove("com.example.plugin", true);

    // readelf runs in a child, where /proc/self would be readelf itself: name our own executable by pid instead.
    std::string command = "readelf -n /proc/" + std::to_string(getpid()) + "/exe 2>/dev/null";
    FILE* pipe = popen(command.c_str(), "r");
    ASSERT_NE(pipe, nullptr);
    std::string notes;
    char buf[4096];
    for (size_t n; (n = fread(buf, 1, sizeof buf, pipe)) > 0;) notes.append(buf, n);
    pclose(pipe);
    for (const char* name : {"client-new", "request-input", "plugin-remove"})
        EXPECT_NE(notes.find(std::string("Name: ") + name), std::string::npos) << name;
    EXPECT_NE(notes.find("Provider: bxd"), std::string::npos) << notes;
}

}  // namespace
}  // namespace bexil
