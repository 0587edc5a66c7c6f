// The "ready" request through the real daemon: every named plug-in is checked (holds, then the host's own
// restriction) before any is enabled; plug-ins that carry code are enabled once each, data plug-ins are accepted
// without enabling, and a plug-in that cannot be enabled answers code 4 while the others are still enabled.

#include <gtest/gtest.h>

#include "E2eSupport.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using namespace test;

class ReadyTest : public DaemonTest {
  protected:
    void SetUp() override { copyExamples({"Greeter.app", "Notes.app"}); }
    void startAndAdd() {
        ASSERT_TRUE(start()) << bxd_.log();
        add({hello(), bonjour(), stationery()});
    }
    std::string hello() const { return plugIn("Greeter.app/PlugIns/Hello.bxplugin"); }
    std::string bonjour() const { return plugIn("Greeter.app/PlugIns/Bonjour.bxplugin"); }
    std::string stationery() const { return plugIn("Notes.app/PlugIns/Stationery.bxplugin"); }
    Value uuidOf(const std::string& path) const { return Value::uuid(registeredUuid(path).value_or(Uuid())); }
    Value readyRequest(const std::vector<Value>& uuids) const {
        return request("ready", {{"uuids", Value::array(std::vector<Value>(uuids))}, {"flags", Value::uint64(5)}});
    }
    // How often the daemon has granted this process a plug-in, by the line it logs for each grant.
    size_t grantsOf(const std::string& identifier) const {
        std::string needle = "allowing host " + std::to_string(getpid()) + " ";
        std::string log = bxd_.log();
        size_t count = 0;
        for (size_t at = log.find(needle); at != std::string::npos; at = log.find(needle, at + 1)) {
            size_t end = log.find('\n', at);
            if (log.substr(at, end - at).find("use plug-in " + identifier + "(") != std::string::npos) ++count;
        }
        return count;
    }
};

// Guards the success path: two plug-ins with code are enabled once each (a repeated UUID too), the data plug-in
// is accepted without a grant, and the reply has no key of its own beyond the envelope's.
TEST_F(ReadyTest, PlugInsWithCodeAreEnabledOnceAndDataPlugInsAccepted) {
    startAndAdd();
    Value reply = succeed(readyRequest({uuidOf(hello()), uuidOf(bonjour()), uuidOf(hello()), uuidOf(stationery())}));
    EXPECT_FALSE(reply.contains("extensions")) << reply.description();
    EXPECT_EQ(grantsOf("com.example.greeter.hello"), 1u) << bxd_.log();
    EXPECT_EQ(grantsOf("com.example.greeter.bonjour"), 1u);
    EXPECT_EQ(grantsOf("com.example.notes.stationery"), 0u) << "a data plug-in has nothing to start";
    expectLog("to plugin sandbox");
    expectLog("\"BDBundlePackageType\": \"ZEM!\"");
    succeed(readyRequest({}));
}

// Guards the refusals: a held plug-in and one outside the host's own rule set are refused with code 11 before
// anything is enabled, even the plug-ins named before them; an unknown UUID answers the UUID walk's text.
TEST_F(ReadyTest, RefusalsComeBeforeAnyPlugInIsEnabled) {
    grantSelf(Value::dictionary(
        {{"com.quorvel.developer.bexil.allowedplugins", identifierRule("com.example.greeter.hello")}}));
    startAndAdd();
    expectFailure(readyRequest({uuidOf(hello()), uuidOf(bonjour())}), 11,
                  "access to plugin com.example.greeter.bonjour denied: the host's plug-in entitlement does not "
                  "allow this plug-in");
    EXPECT_EQ(grantsOf("com.example.greeter.hello"), 0u) << "nothing is enabled when a later plug-in is refused";

    TestClient holder;
    ASSERT_EQ(errorCode(holder.replyTo(
                  request("lock", {{"paths", Value::array({Value::string(hello())})}, {"flags", Value::uint64(1)}}))),
              0);
    expectFailure(readyRequest({uuidOf(hello())}), 11,
                  "access to plugin com.example.greeter.hello denied: the plug-in is on hold");
    expectLog("denied access to " + std::to_string(getpid()) + " for plugin com.example.greeter.hello(" +
              registeredUuid(hello())->string() + "): the plug-in is on hold");
    EXPECT_EQ(grantsOf("com.example.greeter.hello"), 0u);

    expectFailure(readyRequest({Value::uuid(Uuid::random())}), 4, "no such plugin (uuid not found)");
}

// Guards enabling failures: a plug-in whose executable vanished after registration answers code 4 with its own
// message, and the plug-in after it in the request is still enabled.
TEST_F(ReadyTest, AVanishedExecutableFailsThatPlugInOnly) {
    startAndAdd();
    fs::remove(plugIn("Greeter.app/PlugIns/Hello.bxplugin/hello"));
    std::string uuid = registeredUuid(hello())->string();
    expectFailure(readyRequest({uuidOf(hello()), uuidOf(bonjour())}), 4,
                  "cannot obtain executable path for plug-in com.example.greeter.hello(" + uuid + ")");
    expectLog("failed to obtain execPath for plug-in ");
    EXPECT_EQ(grantsOf("com.example.greeter.bonjour"), 1u) << bxd_.log();
}

// Guards bxd's descriptors: a grant is tied to the host process by the pidfd the host's connection already holds,
// so readying many plug-ins with code costs bxd no descriptor per plug-in. A descriptor per grant would let one host
// make bxd hold up to kMaxGrantsPerHost of them, beyond the two per connection its connection limit counts on.
TEST_F(ReadyTest, GrantsCostTheDaemonNoDescriptorPerPlugIn) {
    constexpr int kPlugIns = 40;
    const fs::path app = bundles_ / "Many.app";
    fs::create_directories(app / "PlugIns");
    ASSERT_FALSE(Document::writeFileAtomically(
        app / "Info.vrec", Value::dictionary({{"BDBundleIdentifier", Value::string("com.example.many")}})));
    std::vector<std::string> paths;
    for (int i = 0; i < kPlugIns; ++i) {
        const fs::path bundle = app / "PlugIns" / ("P" + std::to_string(i) + ".bxplugin");
        fs::create_directories(bundle);
        std::ofstream(bundle / "run") << "#!/bin/sh\n";
        fs::permissions(bundle / "run", fs::perms(0755));
        ASSERT_FALSE(Document::writeFileAtomically(
            bundle / "Info.vrec",
            Value::dictionary(
                {{"BDBundleIdentifier", Value::string("com.example.many.p" + std::to_string(i))},
                 {"BDBundleExecutable", Value::string("run")},
                 {"BDBundleVersion", Value::string("1")},
                 {"RZExtension",
                  Value::dictionary({{"PrincipalClass", Value::string("Many")},
                                     {"RZExtensionPointIdentifier", Value::string("com.example.many")},
                                     {"RZExtensionProtocol", Value::string("Many")},
                                     {"RZExtensionAttributes",
                                      Value::dictionary({{"RZExtensionVersion", Value::string("1")}})}})}})));
        paths.push_back(bundle.string());
    }
    startAndAdd();
    add(paths);
    std::vector<Value> uuids;
    for (const std::string& path : paths) uuids.push_back(uuidOf(path));
    auto descriptors = [this] {
        size_t count = 0;
        for ([[maybe_unused]] const auto& entry : fs::directory_iterator("/proc/" + std::to_string(bxd_.pid()) + "/fd"))
            ++count;
        return count;
    };

    TestClient host;
    ASSERT_EQ(errorCode(host.replyTo(request("bulk"))), 0);  // the connection, and its pidfd, are in place
    const size_t before = descriptors();
    Value reply = host.replyTo(readyRequest(uuids));
    ASSERT_EQ(errorCode(reply), 0) << errorText(reply);
    EXPECT_EQ(grantsOf("com.example.many.p39"), 1u) << bxd_.log();
    EXPECT_LE(descriptors(), before + 2) << "descriptors of bxd before the grants: " << before;
}

}  // namespace
}  // namespace bexil
