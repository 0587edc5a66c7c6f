#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <fstream>
#include <future>
#include <memory>
#include <mutex>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "base/Error.h"
#include "base/EventLoop.h"
#include "base/EventLoopAsio.h"
#include "base/QueueAssert.h"
#include "base/SerialQueue.h"
#include "base/SyncQueue.h"

using namespace bexil;
using namespace std::chrono_literals;

namespace {

// Generous: only a broken queue ever waits this long.
constexpr auto kPatience = 20s;

int processThreadCount() {
    std::ifstream status("/proc/self/status");
    std::string line;
    while (std::getline(status, line)) {
        if (line.rfind("Threads:", 0) == 0) return std::stoi(line.substr(8));
    }
    return -1;
}

// Counts down to zero from any thread; the test waits for zero.
class Countdown {
  public:
    explicit Countdown(int count) : count_(count) {}
    void arrive() {
        std::lock_guard lock(mutex_);
        if (--count_ == 0) zero_.notify_all();
    }
    bool wait() {
        std::unique_lock lock(mutex_);
        return zero_.wait_for(lock, kPatience, [&] { return count_ == 0; });
    }

  private:
    std::mutex mutex_;
    std::condition_variable zero_;
    int count_;
};

// Records the highest number of blocks seen running at once.
class InFlight {
  public:
    void enter() {
        int now = ++current_;
        int seen = highest_.load();
        while (now > seen && !highest_.compare_exchange_weak(seen, now)) {
        }
    }
    void leave() { --current_; }
    int highest() const { return highest_.load(); }

  private:
    std::atomic<int> current_{0};
    std::atomic<int> highest_{0};
};

}  // namespace

// ---- SerialQueue ordering and concurrency --------------------------------------------------------------------

TEST(SerialQueueTest, RunsInSubmissionOrderAcrossProducers) {
    // Producers take a ticket and submit under one lock, so submission order is the ticket order.
    EventLoop loop(2);
    SerialQueue queue("tickets", loop);
    std::mutex submitting;
    int nextTicket = 0;
    std::vector<int> ran;  // touched only on the queue
    constexpr int kTotal = 3 * 1500;
    Countdown done(kTotal);
    std::vector<std::thread> producers;
    for (int p = 0; p < 3; ++p) {
        producers.emplace_back([&] {
            for (int i = 0; i < kTotal / 3; ++i) {
                std::lock_guard lock(submitting);
                int ticket = nextTicket++;
                queue.async([&, ticket] {
                    ran.push_back(ticket);
                    done.arrive();
                });
            }
        });
    }
    for (auto& t : producers) t.join();
    ASSERT_TRUE(done.wait());
    ASSERT_EQ(ran.size(), static_cast<size_t>(kTotal));
    for (int i = 0; i < kTotal; ++i) ASSERT_EQ(ran[i], i);
}

TEST(SerialQueueTest, TwoQueuesRunConcurrentlyButEachStaysSerial) {
    EventLoop loop(2);
    SerialQueue a("a", loop);
    SerialQueue b("b", loop);

    // A rendezvous that only succeeds when a block of each queue runs at the same time.
    std::promise<void> aStarted, bStarted;
    auto aFuture = aStarted.get_future();
    auto bFuture = bStarted.get_future();
    std::atomic<bool> metA{false}, metB{false};
    a.async([&] {
        aStarted.set_value();
        metA = bFuture.wait_for(kPatience) == std::future_status::ready;
    });
    b.async([&] {
        bStarted.set_value();
        metB = aFuture.wait_for(kPatience) == std::future_status::ready;
    });

    InFlight inA, inB;
    constexpr int kBlocks = 3000;
    Countdown done(2 * kBlocks);
    auto block = [&done](InFlight& inFlight) {
        return [&done, &inFlight] {
            inFlight.enter();
            std::this_thread::yield();
            inFlight.leave();
            done.arrive();
        };
    };
    for (int i = 0; i < kBlocks; ++i) {
        a.async(block(inA));
        b.async(block(inB));
    }
    ASSERT_TRUE(done.wait());
    EXPECT_TRUE(metA.load());
    EXPECT_TRUE(metB.load());
    EXPECT_EQ(inA.highest(), 1);
    EXPECT_EQ(inB.highest(), 1);
}

TEST(SerialQueueTest, TenThousandQueuesShareAFewThreads) {
    const int threadsBefore = processThreadCount();
    ASSERT_GT(threadsBefore, 0);
    EventLoop loop(2);
    constexpr int kQueues = 10000;
    constexpr int kBlocksEach = 3;
    std::vector<SerialQueue> queues;
    queues.reserve(kQueues);
    for (int i = 0; i < kQueues; ++i) queues.emplace_back("connection " + std::to_string(i), loop);

    std::vector<int> ranPerQueue(kQueues, 0);  // element i touched only on queue i
    std::atomic<int> wrongQueue{0};
    Countdown done(kQueues * kBlocksEach);
    for (int round = 0; round < kBlocksEach; ++round) {
        for (int i = 0; i < kQueues; ++i) {
            queues[i].async([&, i, round] {
                if (!queues[i].isCurrent() || ranPerQueue[i] != round) ++wrongQueue;
                ++ranPerQueue[i];
                done.arrive();
            });
        }
    }
    ASSERT_TRUE(done.wait());
    EXPECT_EQ(wrongQueue.load(), 0);
    for (int i = 0; i < kQueues; ++i) ASSERT_EQ(ranPerQueue[i], kBlocksEach) << "queue " << i;
    EXPECT_LE(processThreadCount(), threadsBefore + 4);
}

TEST(SerialQueueTest, AsyncAfterNeverFiresEarlyAndAsyncNeverRunsOnTheCallersStack) {
    EventLoop loop(1);
    SerialQueue queue("timers", loop);
    constexpr auto kDelay = 50ms;
    std::promise<std::chrono::steady_clock::time_point> fired;
    std::vector<std::string> order;  // touched only on the queue
    Countdown done(3);
    const auto submitted = std::chrono::steady_clock::now();
    queue.asyncAfter(kDelay, [&] {
        fired.set_value(std::chrono::steady_clock::now());
        order.push_back("late");
        done.arrive();
    });
    queue.asyncAfter(0ms, [&] {
        order.push_back("zero");
        done.arrive();
    });
    queue.async([&] {
        order.push_back("now");
        done.arrive();
    });
    ASSERT_TRUE(done.wait());
    EXPECT_GE(fired.get_future().get() - submitted, kDelay);
    EXPECT_EQ(order.back(), "late");

    std::vector<int> reentry;
    queue.sync([&] {
        queue.async([&] { reentry.push_back(2); });
        reentry.push_back(1);
    });
    queue.sync([] {});  // everything submitted before has run
    EXPECT_EQ(reentry, (std::vector<int>{1, 2}));
}

// ---- dispatch -------------------------------------------------------------------------------------------------------

TEST(SerialQueueTest, DispatchRunsAtOnceOnTheLoopUnlessBlocksAreQueuedAndIsQueuedFromOutside) {
    EventLoop loop(1);
    SerialQueue a("a", loop);
    SerialQueue b("b", loop);
    std::vector<int> order;
    bool bCurrentInside = false, aCurrentInside = true, aCurrentAfter = false;
    a.sync([&] {
        b.dispatch([&] {
            order.push_back(1);
            bCurrentInside = b.isCurrent();
            aCurrentInside = a.isCurrent();
        });
        order.push_back(2);
        aCurrentAfter = a.isCurrent();
        // Behind a block already queued, dispatch keeps its place.
        b.async([&] { order.push_back(4); });
        b.dispatch([&] { order.push_back(5); });
        order.push_back(3);
    });
    b.sync([] {});
    EXPECT_EQ(order, (std::vector<int>{1, 2, 3, 4, 5}));
    EXPECT_TRUE(bCurrentInside);
    EXPECT_FALSE(aCurrentInside);
    EXPECT_TRUE(aCurrentAfter);

    std::promise<std::thread::id> ranOn;
    a.dispatch([&] { ranOn.set_value(std::this_thread::get_id()); });
    std::future<std::thread::id> future = ranOn.get_future();
    ASSERT_EQ(future.wait_for(kPatience), std::future_status::ready);
    EXPECT_NE(future.get(), std::this_thread::get_id());
}

// ---- isCurrent and sync -------------------------------------------------------------------------------------------

// The message of the InternalInconsistency that `attempt` throws, or "no exception".
template <typename F>
std::string refusal(F&& attempt) {
    try {
        attempt();
    } catch (const InternalInconsistency& e) {
        return e.what();
    }
    return "no exception";
}

TEST(SerialQueueTest, SyncReturnsRethrowsNestsAndRefusesWhatWouldDeadlock) {
    EventLoop loop(2);
    SerialQueue a("service", loop);
    SerialQueue b("other", loop);
    EXPECT_EQ(a.sync([] { return std::string("answer"); }), "answer");
    EXPECT_THROW(a.sync([]() -> int { throw std::runtime_error("bad record"); }), std::runtime_error);
    // Waiting for itself, directly or through another queue that a block of `a` waits for.
    std::string direct = a.sync([&] { return refusal([&] { a.sync([] {}); }); });
    EXPECT_NE(direct.find("\"service\""), std::string::npos) << direct;
    std::string indirect = a.sync([&] { return b.sync([&] { return refusal([&] { a.sync([] {}); }); }); });
    EXPECT_NE(indirect.find("\"service\""), std::string::npos) << indirect;
    // Both queues still work after a block threw and after the refusals; with two threads nesting is fine, only
    // the innermost queue is current inside, and the outer one is current again once the nested sync returns.
    EXPECT_FALSE(a.isCurrent());
    std::vector<bool> seen = a.sync([&] {
        std::vector<bool> inner = b.sync([&] { return std::vector<bool>{a.isCurrent(), b.isCurrent()}; });
        inner.insert(inner.end(), {a.isCurrent(), b.isCurrent()});
        return inner;
    });
    EXPECT_EQ(seen, (std::vector<bool>{false, true, true, false}));
    // A copy of the handle is the same queue.
    EXPECT_TRUE(a.sync([copy = a] { return copy.isCurrent(); }));

    // From the only thread of a loop, a sync to another queue would wait for ever.
    EventLoop narrow(1);
    SerialQueue c("c", narrow);
    SerialQueue d("d", narrow);
    std::string what = c.sync([&] { return refusal([&] { d.sync([] {}); }); });
    EXPECT_NE(what.find("only thread"), std::string::npos) << what;
    narrow.stop();
    EXPECT_THROW(c.sync([] {}), InternalInconsistency);
}

// ---- failures and lifetime ----------------------------------------------------------------------------------------

namespace {
std::mutex reportedMutex;
std::vector<std::string> reported;
void recordUncaught(std::string_view label, std::exception_ptr exception) {
    std::string what;
    try {
        std::rethrow_exception(exception);
    } catch (const std::exception& e) {
        what = e.what();
    }
    std::lock_guard lock(reportedMutex);
    reported.push_back(std::string(label) + ": " + what);
}
}  // namespace

TEST(SerialQueueTest, AnEscapingExceptionIsReportedAndTheLoopCarriesOn) {
    {
        std::lock_guard lock(reportedMutex);
        reported.clear();
    }
    EventLoop::setUncaughtExceptionHandler(&recordUncaught);
    {
        EventLoop loop(1);
        SerialQueue queue("faulty", loop);
        queue.async([] { throw InternalInconsistency("broken record"); });
        EXPECT_EQ(queue.sync([] { return 3; }), 3);
    }
    EventLoop::setUncaughtExceptionHandler(nullptr);
    std::lock_guard lock(reportedMutex);
    ASSERT_EQ(reported.size(), 1u);
    EXPECT_EQ(reported[0], "faulty: broken record");
}

TEST(SerialQueueTest, DestroyingTheLoopDropsPendingBlocksWithoutRunningThem) {
    auto sentinel = std::make_shared<int>(0);
    std::atomic<bool> ran{false};
    std::optional<SerialQueue> survivor;
    {
        EventLoop loop(1);
        SerialQueue queue("doomed", loop);
        survivor = queue;
        queue.asyncAfter(1h, [&ran, sentinel] { ran = true; });
        std::promise<void> gate, holding;
        auto opened = gate.get_future().share();
        // Holds the queue so that the next block is still waiting when the loop stops.
        queue.async([opened, &holding] {
            holding.set_value();
            opened.wait();
        });
        holding.get_future().wait();
        queue.async([&ran, sentinel] { ran = true; });
        loop.stop();
        gate.set_value();
        EXPECT_GT(sentinel.use_count(), 1);
    }
    EXPECT_FALSE(ran.load());
    EXPECT_EQ(sentinel.use_count(), 1);  // the pending blocks were destroyed
    // A queue that outlived its loop drops what it is given.
    survivor->async([&ran, sentinel] { ran = true; });
    EXPECT_EQ(sentinel.use_count(), 1);
    EXPECT_THROW(survivor->sync([] {}), InternalInconsistency);
    EXPECT_FALSE(ran.load());
}

TEST(EventLoopTest, RunOnCurrentThreadRunsWorkHereUntilStoppedFromThereOrAnotherThread) {
    EventLoop loop(0);
    SerialQueue queue("main", loop);
    const auto caller = std::this_thread::get_id();
    std::vector<std::thread::id> ranOn;  // touched only on the queue
    bool sawLoopThread = false;
    for (int i = 0; i < 3; ++i) queue.async([&] { ranOn.push_back(std::this_thread::get_id()); });
    queue.async([&] {
        sawLoopThread = loop.runsOnCurrentThread() && loop.runningThreadCount() == 1;
        loop.stop();
    });
    EXPECT_FALSE(loop.runsOnCurrentThread());
    loop.runOnCurrentThread();  // returns only once stop() was called
    EXPECT_TRUE(loop.isStopped());
    EXPECT_TRUE(sawLoopThread);
    EXPECT_EQ(ranOn, std::vector<std::thread::id>(3, caller));
    EXPECT_EQ(loop.runningThreadCount(), 0u);
    loop.runOnCurrentThread();  // a stopped loop stays stopped: returns at once

    EventLoop other(0);
    std::thread stopper([&] {
        while (other.runningThreadCount() == 0) std::this_thread::sleep_for(1ms);
        other.stop();
    });
    other.runOnCurrentThread();
    stopper.join();
    EXPECT_TRUE(other.isStopped());
}

TEST(EventLoopTest, SharedLoopRunsQueuesOnItsOwnThread) {
    SerialQueue queue("shared");
    auto ranOn = queue.sync([] { return std::this_thread::get_id(); });
    EXPECT_NE(ranOn, std::this_thread::get_id());
    EXPECT_EQ(&EventLoop::shared(), &EventLoop::shared());
    EXPECT_THROW(EventLoop::configureShared(0), InternalInconsistency);
}

TEST(EventLoopTest, HandlersBoundToAQueueRunAsItsBlocks) {
    EventLoop loop(2);
    SerialQueue queue("connection", loop);
    InFlight inFlight;
    Countdown done(200);
    std::atomic<int> notCurrent{0};
    std::vector<std::unique_ptr<asio::steady_timer>> timers;
    for (int i = 0; i < 100; ++i) {
        auto& timer = timers.emplace_back(std::make_unique<asio::steady_timer>(detail::ioContext(loop), 1ms));
        timer->async_wait(detail::bindToQueue(queue, [&](const asio::error_code& error) {
            inFlight.enter();
            if (error || !queue.isCurrent()) ++notCurrent;
            inFlight.leave();
            done.arrive();
        }));
        queue.async([&] {
            inFlight.enter();
            inFlight.leave();
            done.arrive();
        });
    }
    ASSERT_TRUE(done.wait());
    EXPECT_EQ(notCurrent.load(), 0);
    EXPECT_EQ(inFlight.highest(), 1);
}

// ---- SyncQueue and the assertions ---------------------------------------------------------------------------------

TEST(SyncQueueTest, ExcludesOtherThreads) {
    SyncQueue queue("serverSync");
    InFlight inFlight;
    long counter = 0;  // guarded by the queue only
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([&] {
            for (int i = 0; i < 5000; ++i) {
                queue.sync([&] {
                    inFlight.enter();
                    ++counter;
                    inFlight.leave();
                });
            }
        });
    }
    for (auto& t : threads) t.join();
    EXPECT_EQ(counter, 4 * 5000);
    EXPECT_EQ(inFlight.highest(), 1);
}

// SyncQueue is current per thread; entering it again from inside, or asserting the wrong side of either kind of
// queue, is refused with the queue's name rather than deadlocking or passing silently.
TEST(SyncQueueTest, IsCurrentPerThreadAndTheWrongSideThrowsNamingTheQueue) {
    SyncQueue queue("BXDatabase");
    EXPECT_THROW(BX_ASSERT_ON_QUEUE(queue), InternalInconsistency);
    bool otherThreadSawInside = true;
    std::string what = queue.sync([&] {
        std::thread([&] { otherThreadSawInside = queue.isCurrent(); }).join();
        BX_ASSERT_ON_QUEUE(queue);
        EXPECT_THROW(BX_ASSERT_NOT_ON_QUEUE(queue), InternalInconsistency);
        return refusal([&] { queue.sync([] {}); });
    });
    EXPECT_FALSE(otherThreadSawInside);
    EXPECT_NE(what.find("\"BXDatabase\""), std::string::npos) << what;
    // An exception out of the block leaves the queue, so it can be entered again.
    EXPECT_THROW(queue.sync([] { throw std::runtime_error("x"); }), std::runtime_error);
    EXPECT_FALSE(queue.isCurrent());
    EXPECT_NO_THROW(BX_ASSERT_NOT_ON_QUEUE(queue));

    EventLoop loop(1);
    SerialQueue serial("service", loop);
    EXPECT_THROW(BX_ASSERT_ON_QUEUE(serial), InternalInconsistency);
    what = serial.sync([&] {
        BX_ASSERT_ON_QUEUE(serial);
        return refusal([&] { BX_ASSERT_NOT_ON_QUEUE(serial); });
    });
    EXPECT_NE(what.find("\"service\""), std::string::npos) << what;
}
