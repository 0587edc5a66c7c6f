// The "status" request through the real daemon and the tool: what it counts (requests once dispatched, by name;
// not those refused before dispatch), and what it sees now (connections, holds, the registry, the cache).

#include <gtest/gtest.h>

#include "E2eSupport.h"

namespace bexil {
namespace {

using namespace test;

class StatusTest : public DaemonTest {
  protected:
    void SetUp() override {
        copyExamples({"Greeter.app"});
        ASSERT_TRUE(start()) << bxd_.log();
        add({plugIn("Greeter.app/PlugIns/Hello.bxplugin"), plugIn("Greeter.app/PlugIns/Bonjour.bxplugin")});
    }
    uint64_t number(const Value& reply, std::string_view key) const {
        std::optional<uint64_t> value = reply.get(key).numberAsUInt64();
        EXPECT_TRUE(value.has_value()) << key << " missing from " << reply.description();
        return value.value_or(0);
    }
};

// Guards the counts: a request counts under its name once it is dispatched, whatever its outcome, and neither an
// unknown name nor a refused version counts anywhere; holds and connections are those in force at the moment.
TEST_F(StatusTest, CountsDispatchedRequestsByNameAndSeesHoldsAndConnectionsNow) {
    for (int i = 0; i < 3; ++i) succeed(matchRequest());
    expectFailure(request("frobnicate"), 4, "unrecognized request");
    Value oldVersion = Value::dictionary({{"request", Value::string("match")}, {"version", Value::uint64(99)}});
    EXPECT_EQ(errorCode(TestClient().replyTo(oldVersion)), 7);
    TestClient holder;
    Value held = holder.replyTo(pathsRequest("lock", {plugIn("Greeter.app")}));
    ASSERT_EQ(errorCode(held), 0) << errorText(held);

    Value status = succeed(request("status"));
    const Value served = status.get("served");
    EXPECT_EQ(served.get("match").numberAsUInt64(), 3u);
    EXPECT_EQ(served.get("add").numberAsUInt64(), 1u);
    EXPECT_EQ(served.get("lock").numberAsUInt64(), 1u);
    EXPECT_EQ(served.get("status").numberAsUInt64(), 1u) << "the status request counts itself";
    EXPECT_EQ(served.get("remove").numberAsUInt64(), 0u) << "every request name is listed, served or not";
    EXPECT_FALSE(served.contains("frobnicate"));
    uint64_t total = 0;
    for (const DictionaryEntry& entry : served.entries()) total += entry.value.numberAsUInt64().value_or(0);
    EXPECT_EQ(total, 6u) << served.description();

    EXPECT_EQ(number(status, "holdCount"), 1u);
    EXPECT_GE(number(status, "connections"), 2u) << "the holder's and the asker's";
    EXPECT_EQ(number(status, "registered"), 2u);
    EXPECT_GE(number(status, "cachedRecords"), 1u);
    EXPECT_LE(number(status, "cachedRecords"), number(status, "cacheLimit"));
    EXPECT_LT(number(status, "uptime"), 600u);

    holder.replyTo(request("lock", {{"uuids", Value::array({held.get("uuids")})}}));
    EXPECT_EQ(number(succeed(request("status")), "holdCount"), 0u);
}

// Guards the tool's rendering for administrators: the figures in their lines, the requests served by name, and the
// reply as it came with --json.
TEST_F(StatusTest, TheToolShowsTheFiguresAndTheRequestsServed) {
    succeed(matchRequest());
    Outcome shown = bexil("status");
    ASSERT_EQ(shown.status, 0) << shown.err;
    EXPECT_NE(shown.out.find("registered:   2 plug-ins\n"), std::string::npos) << shown.out;
    EXPECT_NE(shown.out.find("holds:        0\n"), std::string::npos) << shown.out;
    EXPECT_NE(shown.out.find("  match          1\n"), std::string::npos) << shown.out;
    EXPECT_EQ(shown.out.find("  remove"), std::string::npos) << "requests never served are left out\n" << shown.out;

    Outcome json = bexil("--json status");
    ASSERT_EQ(json.status, 0) << json.err;
    EXPECT_NE(json.out.find("\"holdCount\": 0"), std::string::npos) << json.out;
    EXPECT_NE(json.out.find("\"cacheLimit\": "), std::string::npos) << json.out;
}

}  // namespace
}  // namespace bexil
