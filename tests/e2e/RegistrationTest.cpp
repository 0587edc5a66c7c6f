// Registering and unregistering plug-in bundles through the real daemon: "add", "remove", "bulk" as a client sees
// them, checked against the registry the daemon keeps in its state directory.

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <future>
#include <variant>

#include "BxdProcess.h"
#include "E2eSupport.h"
#include "TestClient.h"
#include "base/Document.h"
#include "base/EventLoop.h"
#include "base/SerialQueue.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/ledgerix/LedgerixWorkspace.h"
#include "platform/zem/ZemConnection.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using test::BxdProcess;
using test::errorCode;
using test::errorText;

const fs::path kExamples = fs::path(BEXIL_SOURCE_DIR) / "examples" / "bundles";
constexpr const char* kManagerEntitlement = "com.quorvel.private.bexil.manager";

using test::TestClient;

Value pathsRequest(const char* name, std::vector<Value> paths) {
    return Value::dictionary(
        {{"request", Value::string(name)}, {"version", Value::uint64(3)}, {"paths", Value::array(std::move(paths))}});
}
Value pathsRequest(const char* name, const std::vector<std::string>& paths) {
    std::vector<Value> values;
    for (const auto& p : paths) values.push_back(Value::string(p));
    return pathsRequest(name, std::move(values));
}

class RegistrationTest : public ::testing::Test {
  protected:
    void SetUp() override {
        bundles_ = bxd_.root() / "bundles";
        fs::create_directories(bundles_);
        for (const char* bundle : {"Greeter.app", "Notes.app", "OutsideApplication.bxplugin"})
            fs::copy(kExamples / bundle, bundles_ / bundle, fs::copy_options::recursive);
        bundles_ = fs::canonical(bundles_);
        bxd_.exportEnvironment();
        ASSERT_TRUE(start()) << bxd_.log();
    }

    bool start() { return bxd_.start({"-d", (bxd_.root() / "annotations").string()}); }

    // The UUID under which the daemon's registry holds the bundle at `path`, read from its store.
    std::optional<Uuid> registeredUuid(const std::string& path) {
        return test::registeredUuid(bxd_.root() / "state", path);
    }

    // Gives this test program the manager entitlement through the daemon's trusted entitlements directory.
    void grantManagerEntitlement() {
        fs::path self = fs::canonical("/proc/self/exe");
        fs::path file = bxd_.entitlementsDir() / "registration-test.vrec";
        ASSERT_FALSE(Document::writeFileAtomically(
            file,
            Value::dictionary({{"Executable", Value::string(self.string())},
                               {"Entitlements", Value::dictionary({{kManagerEntitlement, Value::boolean(true)}})}})));
        ASSERT_EQ(chmod(file.c_str(), 0644), 0);
    }

    std::string plugIn(const std::string& relative) const { return (bundles_ / relative).string(); }
    std::string hello() const { return plugIn("Greeter.app/PlugIns/Hello.bxplugin"); }
    std::string bonjour() const { return plugIn("Greeter.app/PlugIns/Bonjour.bxplugin"); }
    std::string nightTheme() const { return plugIn("Greeter.app/PlugIns/NightTheme.bxplugin"); }

    BxdProcess bxd_;
    fs::path bundles_;
};

TEST_F(RegistrationTest, AddRegistersAnApplicationsPlugInsAndReAddKeepsTheirUuids) {
    TestClient client;
    Value reply = client.replyTo(pathsRequest("add", {hello(), bonjour(), nightTheme()}));
    EXPECT_EQ(errorCode(reply), 0) << errorText(reply);
    EXPECT_FALSE(reply.contains("error"));
    std::optional<Uuid> helloUuid = registeredUuid(hello());
    std::optional<Uuid> bonjourUuid = registeredUuid(bonjour());
    ASSERT_TRUE(helloUuid && bonjourUuid && registeredUuid(nightTheme()));
    EXPECT_TRUE(bxd_.waitForLog("plug-in INSTALLED:com.example.greeter.hello")) << bxd_.log();

    // Registration resolves the path first, so a path through ".." and a doubled slash names the same bundle.
    std::string roundabout = plugIn("Greeter.app/PlugIns/../PlugIns//Hello.bxplugin");
    reply = client.replyTo(pathsRequest("add", {roundabout, bonjour()}));
    EXPECT_EQ(errorCode(reply), 0) << errorText(reply);
    EXPECT_EQ(registeredUuid(hello()), helloUuid);
    EXPECT_EQ(registeredUuid(bonjour()), bonjourUuid);
}

TEST_F(RegistrationTest, EmptyPathListSucceedsAndRegistersNothing) {
    TestClient client;
    EXPECT_EQ(errorCode(client.replyTo(pathsRequest("add", std::vector<std::string>{}))), 0);
    EXPECT_EQ(bxd_.countInLog("plug-in INSTALLED:"), 0u);
}

TEST_F(RegistrationTest, MalformedPathListsAreCode4) {
    TestClient client;
    Value noPaths =
        client.replyTo(Value::dictionary({{"request", Value::string("add")}, {"version", Value::uint64(3)}}));
    EXPECT_EQ(errorCode(noPaths), 4);
    EXPECT_EQ(errorText(noPaths), "invalid request format");

    Value notArray = client.replyTo(Value::dictionary(
        {{"request", Value::string("add")}, {"version", Value::uint64(3)}, {"paths", Value::string(hello())}}));
    EXPECT_EQ(errorCode(notArray), 4);
    EXPECT_EQ(errorText(notArray), "invalid request format");

    Value number = client.replyTo(pathsRequest("add", std::vector<Value>{Value::string(hello()), Value::uint64(7)}));
    EXPECT_EQ(errorCode(number), 4);
    EXPECT_EQ(errorText(number), "invalid request format");
    EXPECT_TRUE(registeredUuid(hello())) << "the element before the bad one was handled";
}

TEST_F(RegistrationTest, PathsMustBeAbsoluteAndResolve) {
    TestClient client;
    Value relative = client.replyTo(pathsRequest("add", {"bundles/Greeter.app/PlugIns/Hello.bxplugin"}));
    EXPECT_EQ(errorCode(relative), 9);
    EXPECT_EQ(errorText(relative), "absolute path required: bundles/Greeter.app/PlugIns/Hello.bxplugin");

    Value empty = client.replyTo(pathsRequest("add", {""}));
    EXPECT_EQ(errorCode(empty), 9);
    EXPECT_EQ(errorText(empty), "absolute path required: ");

    // A valid, a missing and a valid path: the first is registered, the walk stops at the second.
    std::string missing = plugIn("Greeter.app/PlugIns/Missing.bxplugin");
    Value reply = client.replyTo(pathsRequest("add", {hello(), missing, bonjour()}));
    EXPECT_EQ(errorCode(reply), 9);
    EXPECT_EQ(errorText(reply), "invalid plugin path: " + missing);
    EXPECT_TRUE(registeredUuid(hello()));
    EXPECT_FALSE(registeredUuid(bonjour()));

    std::string tooLong = "/" + std::string(5000, 'x');
    Value longReply = client.replyTo(pathsRequest("add", {tooLong}));
    EXPECT_EQ(errorCode(longReply), 9);
    EXPECT_EQ(errorText(longReply), "invalid plugin path: " + tooLong);
}

TEST_F(RegistrationTest, BundlesTheRegistryRefusesAreCode2) {
    TestClient client;
    // An application is not a plug-in.
    std::string application = plugIn("Greeter.app");
    Value reply = client.replyTo(pathsRequest("add", {application}));
    EXPECT_EQ(errorCode(reply), 2);
    EXPECT_EQ(errorText(reply), "unable to register plug-in at " + application);
    EXPECT_TRUE(bxd_.waitForLog("failed to register plug-in at " + application));
    EXPECT_EQ(bxd_.countInLog("Ledgerix failed to register the plug-in"), 0u) << "the database's text stays inside";

    // A bundle whose information document is not a document.
    std::ofstream(plugIn("Greeter.app/PlugIns/Hello.bxplugin/Info.vrec"), std::ios::trunc) << "<vrec><dict><key>";
    reply = client.replyTo(pathsRequest("add", {hello()}));
    EXPECT_EQ(errorCode(reply), 2);
    EXPECT_EQ(errorText(reply), "unable to register plug-in at " + hello());

    // A plain directory with no information document at all.
    fs::create_directories(bundles_ / "Empty.bxplugin");
    reply = client.replyTo(pathsRequest("add", {plugIn("Empty.bxplugin")}));
    EXPECT_EQ(errorCode(reply), 2);
}

TEST_F(RegistrationTest, PlugInOutsideAnyApplicationRegistersButIsNeverServed) {
    // The registry records what is on disk; the daemon's own checks refuse the record when it is looked up, which
    // the discovery and readiness requests do. Registration itself succeeds.
    TestClient client;
    std::string outside = plugIn("OutsideApplication.bxplugin");
    Value reply = client.replyTo(pathsRequest("add", {outside}));
    EXPECT_EQ(errorCode(reply), 0) << errorText(reply);
    EXPECT_TRUE(registeredUuid(outside));
}

TEST_F(RegistrationTest, RemoveNeedsTheManagerEntitlement) {
    TestClient adder;
    ASSERT_EQ(errorCode(adder.replyTo(pathsRequest("add", {hello()}))), 0);

    TestClient client;
    Value refused = client.replyTo(pathsRequest("remove", {hello()}));
    EXPECT_EQ(errorCode(refused), 11);
    EXPECT_EQ(errorText(refused), "caller lacks entitlement for this operation");
    EXPECT_TRUE(bxd_.waitForLog("refused request from pid=" + std::to_string(getpid()) + " to remove plug-in at " +
                                hello() + " - client lacks required entitlement"))
        << bxd_.log();
    EXPECT_TRUE(registeredUuid(hello()));

    // The path's form is checked before the entitlement.
    Value relative = client.replyTo(pathsRequest("remove", {"Hello.bxplugin"}));
    EXPECT_EQ(errorCode(relative), 9);
}

TEST_F(RegistrationTest, EntitledRemoveUnregistersAndReportsUnknownPaths) {
    grantManagerEntitlement();
    TestClient client;
    ASSERT_EQ(errorCode(client.replyTo(pathsRequest("add", {hello(), bonjour()}))), 0);

    Value reply = client.replyTo(pathsRequest("remove", {hello()}));
    EXPECT_EQ(errorCode(reply), 0) << errorText(reply) << bxd_.log();
    EXPECT_FALSE(registeredUuid(hello()));
    EXPECT_TRUE(registeredUuid(bonjour()));
    EXPECT_TRUE(bxd_.waitForLog("plug-in UNINSTALLED:com.example.greeter.hello")) << bxd_.log();
    EXPECT_TRUE(bxd_.waitForLog("removal complete for")) << bxd_.log();

    Value again = client.replyTo(pathsRequest("remove", {hello()}));
    EXPECT_EQ(errorCode(again), 9);
    EXPECT_EQ(errorText(again), "no plugin at " + hello());

    // A bundle deleted from disk is still unregistered, by the path the client sent.
    fs::remove_all(bonjour());
    reply = client.replyTo(pathsRequest("remove", {bonjour()}));
    EXPECT_EQ(errorCode(reply), 0) << errorText(reply);
    EXPECT_FALSE(registeredUuid(bonjour()));
}

TEST_F(RegistrationTest, BulkAlwaysSucceedsAndLogsItsFlags) {
    TestClient client;
    Value withFlags = client.replyTo(Value::dictionary(
        {{"request", Value::string("bulk")}, {"version", Value::uint64(3)}, {"flags", Value::uint64(0x2a)}}));
    EXPECT_EQ(errorCode(withFlags), 0);
    EXPECT_TRUE(bxd_.waitForLog("bulk options 0x2a not supported")) << bxd_.log();
    Value without =
        client.replyTo(Value::dictionary({{"request", Value::string("bulk")}, {"version", Value::uint64(3)}}));
    EXPECT_EQ(errorCode(without), 0);
    EXPECT_TRUE(bxd_.waitForLog("bulk options 0x0 not supported")) << bxd_.log();
}

TEST_F(RegistrationTest, RegistrationsSurviveARestart) {
    grantManagerEntitlement();
    std::optional<Uuid> before;
    {
        TestClient client;
        ASSERT_EQ(errorCode(client.replyTo(pathsRequest("add", {hello(), bonjour()}))), 0);
        before = registeredUuid(hello());
        ASSERT_TRUE(before);
    }
    bxd_.stop();
    ASSERT_TRUE(start()) << bxd_.log();

    TestClient client;
    // Re-adding after the restart keeps the UUID; removing works because the new daemon knows the bundle.
    ASSERT_EQ(errorCode(client.replyTo(pathsRequest("add", {hello()}))), 0);
    EXPECT_EQ(registeredUuid(hello()), before);
    Value removed = client.replyTo(pathsRequest("remove", {bonjour()}));
    EXPECT_EQ(errorCode(removed), 0) << errorText(removed);
}

}  // namespace
}  // namespace bexil
