// DaemonClient::wait against the real bxd, linked as an application links it (libbexil.so and the public headers
// only): the waiting thread may read its reply itself, but a callback of the application's own keeps running on the
// client's queue, and many threads waiting on one client each get their own reply.

#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <vector>

#include "../e2e/BxdProcess.h"
#include "bexil/DaemonClient.h"

namespace bexil {
namespace {

using test::BxdProcess;

class DaemonClientWaitTest : public ::testing::Test {
  protected:
    DaemonClientWaitTest() { bxd_.exportEnvironment(); }

    BxdProcess bxd_;
};

// Guards the callback promise under wait(): the application's callback given inside wait() runs on the client's
// queue, not on the waiting thread, and wait() still returns the reply.
TEST_F(DaemonClientWaitTest, AnApplicationCallbackInsideWaitRunsOnTheClientsQueue) {
    ASSERT_TRUE(bxd_.start()) << bxd_.log();
    DaemonClient client;
    ASSERT_TRUE(client.wait([&](DaemonClient::Callback done) { client.status(done); }).ok());
    std::thread::id ranOn;
    DaemonClient::Reply reply = client.wait([&](DaemonClient::Callback done) {
        client.status([&, done](const DaemonClient::Reply& reply) {
            ranOn = std::this_thread::get_id();
            done(reply);
        });
    });
    ASSERT_TRUE(reply.ok()) << reply.error->description();
    EXPECT_TRUE(reply.message.find("uptime") != nullptr);
    EXPECT_NE(ranOn, std::thread::id());
    EXPECT_NE(ranOn, std::this_thread::get_id());
}

// Guards waits from many threads on one client, some answered on the waiting thread and some through the queue:
// every one gets a reply to its own request ("status" answers with the number of requests served so far, which
// only grows along one thread's waits).
TEST_F(DaemonClientWaitTest, ManyThreadsWaitingOnOneClientEachGetAReply) {
    ASSERT_TRUE(bxd_.start()) << bxd_.log();
    DaemonClient client;
    std::atomic<unsigned> failed{0}, wentBack{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 6; ++t)
        threads.emplace_back([&] {
            uint64_t last = 0;
            for (int i = 0; i < 100; ++i) {
                DaemonClient::Reply reply = client.wait([&](DaemonClient::Callback done) { client.status(done); });
                if (!reply.ok()) {
                    ++failed;
                    continue;
                }
                uint64_t served = reply.message.get("served").get("status").numberAsUInt64().value_or(0);
                if (served <= last) ++wentBack;
                last = served;
            }
        });
    for (std::thread& thread : threads) thread.join();
    EXPECT_EQ(failed.load(), 0u);
    EXPECT_EQ(wentBack.load(), 0u);
}

}  // namespace
}  // namespace bexil
