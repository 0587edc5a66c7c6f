#include <gtest/gtest.h>

#include <filesystem>

#include "PlugInRecord.h"
#include "TestSupport.h"
#include "base/EventLoop.h"
#include "daemon/BXDPlugInHold.h"
#include "daemon/BXDServer.h"
#include "platform/notify/SystemNotifications.h"
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

    // Places a hold whose client object is already gone, as the server sees one after its client was freed.
    Uuid place(std::vector<std::shared_ptr<BXDPlugIn>> plugIns) {
        auto hold = std::make_shared<BXDPlugInHold>(std::move(plugIns), std::weak_ptr<BXDZemClient>());
        Uuid uuid = hold->uuid();
        server_->addHold(std::move(hold));
        return uuid;
    }
    uint64_t posted() const {
        return SystemNotifications(root_ / "runtime" / "notify").state(protocol::kAnnotationChangeNotification);
    }

    test::DaemonDirs root_{"bxdserver-hold"};
    EventLoop loop_{0};
    std::unique_ptr<BXDServer> server_;
};

// Guards holds (which keep plug-ins out of use while an application changes): a hold names plug-ins by UUID, so a
// record rebuilt for the same registry plug-in is held too; an empty hold (an application without plug-ins) holds
// nothing; a hold whose client object is gone stays until it is released by its UUID; every change of the set of
// holds posts the notification once, and an unknown UUID changes and posts nothing. Each hold keeps one keep-alive
// unit open while it exists.
TEST_F(BXDServerHoldTest, HoldsNamePlugInsByUuidAndEndOnlyWhenReleased) {
    Uuid helloUuid = Uuid::random();
    std::shared_ptr<BXDPlugIn> hello = record("hello", helloUuid);
    std::shared_ptr<BXDPlugIn> bonjour = record("bonjour", Uuid::random());
    std::shared_ptr<BXDPlugIn> night = record("night", Uuid::random());
    ASSERT_TRUE(hello && bonjour && night);
    const size_t unitsBefore = BXDPlugInHold::openKeepAliveUnits();
    const uint64_t before = posted();
    EXPECT_FALSE(server_->holdOnPlugIn(*hello));
    Uuid empty = place({});
    EXPECT_FALSE(server_->holdOnPlugIn(*hello));

    place({bonjour});
    Uuid both = place({night, hello, record("hello", helloUuid)});
    EXPECT_EQ(posted(), before + 3);
    EXPECT_EQ(BXDPlugInHold::openKeepAliveUnits(), unitsBefore + 3);
    EXPECT_TRUE(server_->holdOnPlugIn(*hello)) << "found in a later hold";
    EXPECT_TRUE(server_->holdOnPlugIn(*record("hello", helloUuid)));
    EXPECT_FALSE(server_->holdOnPlugIn(*record("other", Uuid::random())));

    server_->unholdClient(nullptr);
    EXPECT_TRUE(server_->holdOnPlugIn(*hello)) << "a hold whose client is gone belongs to nobody";
    server_->unholdToken(Uuid::random());
    EXPECT_EQ(posted(), before + 3) << "nothing released, nothing posted";

    server_->unholdToken(both);
    EXPECT_FALSE(server_->holdOnPlugIn(*hello));
    EXPECT_TRUE(server_->holdOnPlugIn(*bonjour));
    server_->unholdToken(empty);
    EXPECT_EQ(posted(), before + 5);
    EXPECT_EQ(BXDPlugInHold::openKeepAliveUnits(), unitsBefore + 1);
}

}  // namespace
}  // namespace bexil
