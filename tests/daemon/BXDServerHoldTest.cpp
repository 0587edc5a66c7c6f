#include <gtest/gtest.h>

#include <filesystem>

#include "PlugInRecord.h"
#include "TestSupport.h"
#include "base/EventLoop.h"
#include "daemon/BXDPlugInHold.h"
#include "daemon/BXDServer.h"
#include "policy/BXDPlugIn.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;

std::shared_ptr<BXDPlugIn> record(const std::string& name, const Uuid& uuid) {
    return test::plugInRecord("com.example." + name, uuid);
}

// A server over private directories; its listener is bound but never resumed.
class BXDServerHoldTest : public ::testing::Test {
  protected:
    void SetUp() override {
        server_ =
            BXDServer::initForServiceDatabase("com.example.hold-test", (root_ / "annotations.vrec").c_str(), loop_);
        ASSERT_NE(server_, nullptr);
    }
    void TearDown() override { server_.reset(); }

    void place(std::vector<std::shared_ptr<BXDPlugIn>> plugIns) {
        server_->syncQueue().sync([&] {
            server_->holds().push_back(
                std::make_shared<BXDPlugInHold>(Uuid::random(), std::weak_ptr<BXDZemClient>(), std::move(plugIns)));
        });
    }

    test::DaemonDirs root_{"bxdserver-hold"};
    EventLoop loop_{0};
    std::unique_ptr<BXDServer> server_;
};

// Guards holds (which keep plug-ins from being ended while an application updates): a hold names plug-ins by
// UUID, so a record rebuilt for the same registry plug-in is held too; an empty hold (an application without
// plug-ins) holds nothing, and a hold without a living client goes with the next release of dead clients' holds.
TEST_F(BXDServerHoldTest, HoldsNamePlugInsByUuidAndGoWithTheirClient) {
    Uuid helloUuid = Uuid::random();
    std::shared_ptr<BXDPlugIn> hello = record("hello", helloUuid);
    std::shared_ptr<BXDPlugIn> bonjour = record("bonjour", Uuid::random());
    std::shared_ptr<BXDPlugIn> night = record("night", Uuid::random());
    ASSERT_TRUE(hello && bonjour && night);
    EXPECT_FALSE(server_->holdOnPlugIn(*hello));
    place({});
    EXPECT_FALSE(server_->holdOnPlugIn(*hello));

    place({bonjour});
    place({night, hello});
    EXPECT_TRUE(server_->holdOnPlugIn(*hello)) << "found in a later hold";
    EXPECT_TRUE(server_->holdOnPlugIn(*record("hello", helloUuid)));
    EXPECT_FALSE(server_->holdOnPlugIn(*record("other", Uuid::random())));

    server_->unholdClient(nullptr);
    EXPECT_FALSE(server_->holdOnPlugIn(*hello));
}

}  // namespace
}  // namespace bexil
