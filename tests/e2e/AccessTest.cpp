// The "access" request through the real daemon: one token per UUID, in order, each opening the plug-in's bundle to
// the platform's sandbox check and to nothing else; neither holds nor the host policy matter; a bundle gone since
// registration answers the errno of the failed token.

#include <gtest/gtest.h>

#include "E2eSupport.h"
#include "platform/sandbox/SandboxExtensions.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using namespace test;

class AccessTest : public DaemonTest {
  protected:
    void SetUp() override {
        copyExamples({"Greeter.app"});
        ASSERT_TRUE(start()) << bxd_.log();
        add({hello(), bonjour()});
    }
    std::string hello() const { return plugIn("Greeter.app/PlugIns/Hello.bxplugin"); }
    std::string bonjour() const { return plugIn("Greeter.app/PlugIns/Bonjour.bxplugin"); }
    Value uuidOf(const std::string& path) const { return Value::uuid(registeredUuid(path).value_or(Uuid())); }
    Value accessRequest(const std::vector<Value>& uuids) const {
        return request("access", {{"uuids", Value::array(std::vector<Value>(uuids))}, {"flags", Value::uint64(7)}});
    }
    // The path a token opens, as the sandbox's check reads it; none when the check refuses it.
    std::optional<std::string> opened(const Value& token) const {
        SandboxExtensions consumer(bxd_.root() / "runtime" / "sandbox" / "extension-key");
        int64_t handle = consumer.consume(std::string(token.stringView()));
        return handle > 0 ? consumer.consumedPath(handle) : std::nullopt;
    }
};

// Guards the answer: tokens in the request's order, one per UUID even when a UUID repeats, each opening exactly
// its plug-in's bundle; a held plug-in gets its token too; an altered token opens nothing.
TEST_F(AccessTest, OneTokenPerUuidInOrderEachOpeningItsBundle) {
    TestClient holder;
    ASSERT_EQ(errorCode(holder.replyTo(
                  request("lock", {{"paths", Value::array({Value::string(hello())})}, {"flags", Value::uint64(1)}}))),
              0);
    Value reply = succeed(accessRequest({uuidOf(bonjour()), uuidOf(hello()), uuidOf(bonjour())}));
    const Value tokens = reply.get("extensions");
    ASSERT_EQ(tokens.count(), 3u) << reply.description();
    EXPECT_EQ(opened(tokens.items()[0]), bonjour());
    EXPECT_EQ(opened(tokens.items()[1]), hello());
    EXPECT_EQ(opened(tokens.items()[2]), bonjour());
    std::string forged(tokens.items()[0].stringView());
    forged.replace(forged.rfind("Bonjour"), 7, "Hello.b");
    EXPECT_FALSE(opened(Value::string(forged)));
    EXPECT_TRUE(succeed(accessRequest({})).get("extensions").isArray()) << "an empty list answers an empty list";
}

// Guards the failures: an unknown UUID answers the UUID walk's code and text; a bundle deleted since it was
// registered answers code 4 with its path and the errno of the token that could not be made.
TEST_F(AccessTest, UnknownPlugInsAndVanishedBundlesAreRefused) {
    expectFailure(accessRequest({uuidOf(hello()), Value::uuid(Uuid::random())}), 4, "no such plugin (uuid not found)");
    Value bonjourUuid = uuidOf(bonjour());
    fs::remove_all(bonjour());
    expectFailure(accessRequest({uuidOf(hello()), bonjourUuid}), 4,
                  "cannot create extension to " + bonjour() + ": " + std::to_string(ENOENT));
}

}  // namespace
}  // namespace bexil
