// Registering and unregistering plug-in bundles through the real daemon: "add", "remove", "bulk" as a client sees
// them, checked against the registry the daemon keeps in its state directory. How the registry treats path forms,
// re-registration, bad bundles and bundles gone from disk is LedgerixTest's.

#include <gtest/gtest.h>

#include <filesystem>

#include "BxdProcess.h"
#include "E2eSupport.h"
#include "TestClient.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using namespace test;

class RegistrationTest : public DaemonTest {
  protected:
    void SetUp() override {
        copyExamples({"Greeter.app", "OutsideApplication.bxplugin"});
        ASSERT_TRUE(start()) << bxd_.log();
    }
    std::string hello() const { return plugIn("Greeter.app/PlugIns/Hello.bxplugin"); }
    std::string bonjour() const { return plugIn("Greeter.app/PlugIns/Bonjour.bxplugin"); }
};

// Guards "add": an empty list succeeds with nothing registered; the plug-ins of an application and one outside any
// application (refused only when looked up: SystemPlugInTest) are registered and announced, and adding a bundle
// again keeps its UUID.
TEST_F(RegistrationTest, AddRegistersPlugInsAndReAddKeepsTheirUuids) {
    add({});
    EXPECT_EQ(bxd_.countInLog("plug-in INSTALLED:"), 0u);
    std::string outside = plugIn("OutsideApplication.bxplugin");
    add({hello(), bonjour(), plugIn("Greeter.app/PlugIns/NightTheme.bxplugin"), outside});
    std::optional<Uuid> helloUuid = registeredUuid(hello());
    ASSERT_TRUE(helloUuid && registeredUuid(plugIn("Greeter.app/PlugIns/NightTheme.bxplugin")) &&
                registeredUuid(outside));
    EXPECT_TRUE(bxd_.waitForLog("plug-in INSTALLED:com.example.greeter.hello")) << bxd_.log();
    add({hello()});
    EXPECT_EQ(registeredUuid(hello()), helloUuid);
}

// Guards the path checks of "add" with their codes and texts: a malformed list is code 4, a path that is not
// absolute or does not resolve (also one over the path limit) is code 9, a bundle the registry refuses is code 2
// without the database's own text. The walk handles the paths before the bad one and stops there.
TEST_F(RegistrationTest, BadPathsAreRefusedAndTheWalkStopsAtTheFirst) {
    expectFailure(request("add"), 4, "invalid request format");
    expectFailure(request("add", {{"paths", Value::string(hello())}}), 4, "invalid request format");
    expectFailure(request("add", {{"paths", Value::array({Value::string(hello()), Value::uint64(7)})}}), 4,
                  "invalid request format");
    EXPECT_TRUE(registeredUuid(hello())) << "the element before the bad one was handled";

    expectFailure(pathsRequest("add", {"bundles/Hello.bxplugin"}), 9, "absolute path required: bundles/Hello.bxplugin");
    std::string missing = plugIn("Greeter.app/PlugIns/Missing.bxplugin");
    expectFailure(pathsRequest("add", {hello(), missing, bonjour()}), 9, "invalid plugin path: " + missing);
    EXPECT_FALSE(registeredUuid(bonjour())) << "the walk stopped at the missing path";
    std::string tooLong = "/" + std::string(5000, 'x');
    expectFailure(pathsRequest("add", {tooLong}), 9, "invalid plugin path: " + tooLong);

    std::string application = plugIn("Greeter.app");
    expectFailure(pathsRequest("add", {application}), 2, "unable to register plug-in at " + application);
    EXPECT_TRUE(bxd_.waitForLog("failed to register plug-in at " + application));
    EXPECT_EQ(bxd_.countInLog("Ledgerix failed to register the plug-in"), 0u) << "the database's text stays inside";
}

// Guards the entitlement check of "remove": without the manager entitlement it is refused and logged and nothing
// is removed; the path's form is checked first.
TEST_F(RegistrationTest, RemoveNeedsTheManagerEntitlement) {
    add({hello()});
    expectFailure(pathsRequest("remove", {hello()}), 11, "caller lacks entitlement for this operation");
    EXPECT_TRUE(bxd_.waitForLog("refused request from pid=" + std::to_string(getpid()) + " to remove plug-in at " +
                                hello() + " - client lacks required entitlement"))
        << bxd_.log();
    EXPECT_TRUE(registeredUuid(hello()));
    expectFailure(pathsRequest("remove", {"Hello.bxplugin"}), 9, "absolute path required: Hello.bxplugin");
}

// Guards an entitled "remove" against a restarted daemon: it knows the bundles registered before, unregisters and
// announces them, and reports a path it does not know.
TEST_F(RegistrationTest, EntitledRemoveWorksAcrossARestart) {
    grantSelfManager();
    add({hello(), bonjour()});
    bxd_.stop();
    ASSERT_TRUE(start()) << bxd_.log();

    TestClient client;
    Value reply = client.replyTo(pathsRequest("remove", {hello()}));
    EXPECT_EQ(errorCode(reply), 0) << errorText(reply) << bxd_.log();
    EXPECT_FALSE(registeredUuid(hello()));
    EXPECT_TRUE(registeredUuid(bonjour()));
    EXPECT_TRUE(bxd_.waitForLog("plug-in UNINSTALLED:com.example.greeter.hello")) << bxd_.log();
    EXPECT_TRUE(bxd_.waitForLog("removal complete for")) << bxd_.log();
    expectFailure(pathsRequest("remove", {hello()}), 9, "no plugin at " + hello());
}

// Guards "bulk": it always succeeds and logs the flags it does not support.
TEST_F(RegistrationTest, BulkAlwaysSucceedsAndLogsItsFlags) {
    EXPECT_EQ(errorCode(TestClient().replyTo(request("bulk", {{"flags", Value::uint64(0x2a)}}))), 0);
    EXPECT_TRUE(bxd_.waitForLog("bulk options 0x2a not supported")) << bxd_.log();
}

}  // namespace
}  // namespace bexil
