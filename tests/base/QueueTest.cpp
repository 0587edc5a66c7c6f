#include <gtest/gtest.h>
#include <sched.h>
#include <sys/resource.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <fstream>
#include <future>
#include <memory>
#include <mutex>
#include <numeric>
#include <set>
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

// Guards the queue model the daemon is built on (one queue per connection): thousands of queues share the loop's
// few threads, each runs its blocks one at a time in submission order, and two queues do run at the same time.
TEST(SerialQueueTest, ManyQueuesShareAFewThreadsEachSerialAndInOrderWhileQueuesRunConcurrently) {
    const int threadsBefore = processThreadCount();
    ASSERT_GT(threadsBefore, 0);
    EventLoop loop(2);
    constexpr int kQueues = 10000;
    constexpr int kBlocksEach = 3;
    std::vector<SerialQueue> queues;
    queues.reserve(kQueues);
    for (int i = 0; i < kQueues; ++i) queues.emplace_back("connection " + std::to_string(i), loop);

    // A rendezvous that only succeeds when a block of each of two queues runs at the same time.
    std::promise<void> aStarted, bStarted;
    auto aFuture = aStarted.get_future();
    auto bFuture = bStarted.get_future();
    std::atomic<bool> metA{false}, metB{false};
    queues[0].async([&] {
        aStarted.set_value();
        metA = bFuture.wait_for(kPatience) == std::future_status::ready;
    });
    queues[1].async([&] {
        bStarted.set_value();
        metB = aFuture.wait_for(kPatience) == std::future_status::ready;
    });

    std::vector<InFlight> inFlight(kQueues);
    std::vector<int> ranPerQueue(kQueues, 0);  // element i touched only on queue i
    std::atomic<int> wrongQueueOrOrder{0};
    Countdown done(kQueues * kBlocksEach);
    for (int round = 0; round < kBlocksEach; ++round) {
        for (int i = 0; i < kQueues; ++i) {
            queues[i].async([&, i, round] {
                inFlight[i].enter();
                if (!queues[i].isCurrent() || ranPerQueue[i] != round) ++wrongQueueOrOrder;
                ++ranPerQueue[i];
                std::this_thread::yield();
                inFlight[i].leave();
                done.arrive();
            });
        }
    }
    ASSERT_TRUE(done.wait());
    EXPECT_TRUE(metA.load());
    EXPECT_TRUE(metB.load());
    EXPECT_EQ(wrongQueueOrOrder.load(), 0);
    for (int i = 0; i < kQueues; ++i) ASSERT_EQ(inFlight[i].highest(), 1) << "queue " << i;
    EXPECT_LE(processThreadCount(), threadsBefore + 4);
}

// Guards timers (never early) and re-entry (async from a block runs after it, never on the caller's stack).
TEST(SerialQueueTest, AsyncAfterNeverFiresEarlyAndAsyncNeverRunsOnTheCallersStack) {
    EventLoop loop(1);
    SerialQueue queue("timers", loop);
    constexpr auto kDelay = 50ms;
    std::promise<std::chrono::steady_clock::time_point> fired;
    const auto submitted = std::chrono::steady_clock::now();
    queue.asyncAfter(kDelay, [&] { fired.set_value(std::chrono::steady_clock::now()); });
    auto future = fired.get_future();
    ASSERT_EQ(future.wait_for(kPatience), std::future_status::ready);
    EXPECT_GE(future.get() - submitted, kDelay);

    std::vector<int> reentry;
    queue.sync([&] {
        queue.async([&] { reentry.push_back(2); });
        reentry.push_back(1);
    });
    queue.sync([] {});  // everything submitted before has run
    EXPECT_EQ(reentry, (std::vector<int>{1, 2}));
}

// ---- dispatch -------------------------------------------------------------------------------------------------------

// Guards dispatch: from a loop thread it runs at once (as the target queue) unless blocks wait before it.
TEST(SerialQueueTest, DispatchRunsAtOnceOnTheLoopUnlessBlocksAreQueued) {
    EventLoop loop(1);
    SerialQueue a("a", loop);
    SerialQueue b("b", loop);
    std::vector<int> order;
    bool bCurrentInside = false, aCurrentAfter = false;
    a.sync([&] {
        b.dispatch([&] {
            order.push_back(1);
            bCurrentInside = b.isCurrent() && !a.isCurrent();
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
    EXPECT_TRUE(aCurrentAfter);
}

// Guards asyncBehindReady, which keeps a long walk's steps from delaying requests: a connection's handler that is
// ready when the step is submitted hands its request to the queue ahead of the step (async would put the step
// first), the step still comes after what the queue held already, and it runs as a block of the queue.
TEST(SerialQueueTest, AsyncBehindReadyLetsWhatTheLoopHasReadyGoFirst) {
    EventLoop loop(1);
    SerialQueue requests("requests", loop);
    SerialQueue connection("connection", loop);
    std::vector<std::string> order;
    bool stepOnQueue = false;
    Countdown done(3);
    requests.sync([&] {
        requests.async([&] {
            order.push_back("queued before");
            done.arrive();
        });
        requests.asyncBehindReady([&] {
            order.push_back("step");
            stepOnQueue = requests.isCurrent();
            done.arrive();
        });
        connection.async([&] {
            requests.async([&] {
                order.push_back("request");
                done.arrive();
            });
        });
    });
    ASSERT_TRUE(done.wait());
    EXPECT_EQ(order, (std::vector<std::string>{"queued before", "request", "step"}));
    EXPECT_TRUE(stepOnQueue);
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

// Guards sync: results and exceptions come back, and a wait that could never end is refused naming the queue
// (directly, through another queue, or from the only thread of a loop) instead of hanging the daemon.
TEST(SerialQueueTest, SyncReturnsRethrowsAndRefusesWhatWouldDeadlock) {
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
    // With two threads, nesting that cannot deadlock is allowed.
    EXPECT_EQ(a.sync([&] { return b.sync([&] { return b.isCurrent() && !a.isCurrent(); }); }), true);

    // From the only thread of a loop, a sync to another queue would wait for ever.
    EventLoop narrow(1);
    SerialQueue c("c", narrow);
    SerialQueue d("d", narrow);
    std::string what = c.sync([&] { return refusal([&] { d.sync([] {}); }); });
    EXPECT_NE(what.find("only thread"), std::string::npos) << what;
    narrow.stop();
    EXPECT_THROW(c.sync([] {}), InternalInconsistency);
}

// Guards the bulk thread: its blocks run as blocks of their queue, in order, on a thread of their own that runs at a
// lower priority, and never beside any block of the loop, whatever queue and thread; such a block learns when a loop
// thread waits for it, and nothing else ever thinks so; a sync that would wait for the loop from inside it is
// refused; the loop's end drops what is still waiting. A loop without one runs them itself.
TEST(SerialQueueTest, BlocksInBulkRunBelowTheLoopOnTheirOwnThreadAndNeverBesideItsBlocks) {
    const int creatorNice = getpriority(PRIO_PROCESS, static_cast<id_t>(gettid()));
    auto sentinel = std::make_shared<int>(0);
    std::atomic<bool> lateRan{false};
    {
        EventLoop loop(0);
        loop.startBulkThread(10);
        EXPECT_THROW(loop.startBulkThread(10), InternalInconsistency);
        std::thread runner([&] { loop.runOnCurrentThread(); });
        SerialQueue a("a", loop);
        SerialQueue b("b", loop);

        // Neither side starts a block while the other is inside one: each waits a while, inside, for the other.
        auto meets = [](auto submitInside, auto submitOther) {
            std::promise<void> inside;
            std::atomic<bool> otherEntered{false};
            std::promise<bool> sawOther;
            std::promise<void> otherDone;
            submitInside([&] {
                inside.set_value();
                auto until = std::chrono::steady_clock::now() + 100ms;
                while (!otherEntered && std::chrono::steady_clock::now() < until) std::this_thread::yield();
                sawOther.set_value(otherEntered.load());
            });
            inside.get_future().wait();
            submitOther([&] {
                otherEntered = true;
                otherDone.set_value();
            });
            bool met = sawOther.get_future().get();
            otherDone.get_future().wait();
            return met;
        };
        EXPECT_FALSE(meets([&](auto block) { a.asyncInBulk(block); }, [&](auto block) { b.async(block); }));
        EXPECT_FALSE(meets([&](auto block) { b.async(block); }, [&](auto block) { a.asyncInBulk(block); }));

        constexpr int kRounds = 100;
        Countdown done(2 * kRounds);
        std::vector<int> bulkOrder;
        std::set<std::thread::id> bulkThreads;
        std::thread::id loopThread;
        bool allCurrent = true;
        int bulkNice = 0;
        for (int i = 0; i < kRounds; ++i) {
            b.async([&] {
                loopThread = std::this_thread::get_id();
                done.arrive();
            });
            a.asyncInBulk([&, i] {
                bulkOrder.push_back(i);
                bulkThreads.insert(std::this_thread::get_id());
                allCurrent = allCurrent && a.isCurrent() && !b.isCurrent();
                bulkNice = getpriority(PRIO_PROCESS, static_cast<id_t>(gettid()));
                done.arrive();
            });
        }
        ASSERT_TRUE(done.wait());
        std::vector<int> expected(kRounds);
        std::iota(expected.begin(), expected.end(), 0);
        EXPECT_EQ(bulkOrder, expected);
        ASSERT_EQ(bulkThreads.size(), 1u);
        EXPECT_NE(*bulkThreads.begin(), loopThread);
        EXPECT_TRUE(allCurrent);
        EXPECT_EQ(bulkNice, std::min(creatorNice + 10, 19));

        // Idle-scheduled where it may be raised again (root may), raised while a loop thread waits for it, and idle
        // again before that thread goes on.
        std::promise<pid_t> bulkTid;
        std::promise<void> release, held;
        auto released = release.get_future().share();
        bool waitedForAtFirst = true;
        bool waitedForOnceWaited = false;
        std::promise<void> waited;
        auto loopBlockRan = waited.get_future().share();
        a.asyncInBulk([&, released, loopBlockRan] {
            waitedForAtFirst = SerialQueue::bulkBlockIsWaitedFor();
            bulkTid.set_value(static_cast<pid_t>(gettid()));
            held.set_value();
            released.wait();
            for (auto until = std::chrono::steady_clock::now() + kPatience;
                 !waitedForOnceWaited && std::chrono::steady_clock::now() < until; std::this_thread::sleep_for(1ms))
                waitedForOnceWaited = SerialQueue::bulkBlockIsWaitedFor();
            // The waiting block runs while this one has let the loop go, and sees it idle again.
            SerialQueue::withLoopLetGo([&] { loopBlockRan.wait_for(kPatience); });
        });
        held.get_future().wait();
        const pid_t tid = bulkTid.get_future().get();
        const int policy = sched_getscheduler(tid);
        if (geteuid() == 0) {
            EXPECT_EQ(policy, SCHED_IDLE);
        }
        auto policyBecomes = [tid](int wanted) {
            for (auto until = std::chrono::steady_clock::now() + kPatience; std::chrono::steady_clock::now() < until;
                 std::this_thread::sleep_for(1ms)) {
                if (sched_getscheduler(tid) == wanted) return true;
            }
            return false;
        };
        bool waitedForInLoopBlock = true;
        int policyInLoopBlock = -1;
        b.async([&] {
            waitedForInLoopBlock = SerialQueue::bulkBlockIsWaitedFor();
            policyInLoopBlock = sched_getscheduler(tid);
            waited.set_value();
        });
        if (policy == SCHED_IDLE) {
            EXPECT_TRUE(policyBecomes(SCHED_OTHER));
            EXPECT_EQ(getpriority(PRIO_PROCESS, static_cast<id_t>(tid)), std::min(creatorNice + 10, 19));
        }
        release.set_value();
        loopBlockRan.wait();
        EXPECT_EQ(policyInLoopBlock, policy);
        EXPECT_TRUE(policyBecomes(policy));
        EXPECT_FALSE(waitedForAtFirst);
        EXPECT_TRUE(waitedForOnceWaited);
        EXPECT_FALSE(waitedForInLoopBlock);
        EXPECT_FALSE(SerialQueue::bulkBlockIsWaitedFor());

        // A bulk block that lets the loop go: a block of its own queue runs meanwhile, and once the work returns
        // the bulk block holds the loop again. A loop block letting go keeps the bulk thread out all the same.
        auto runsWithin = [](auto&& submit, std::chrono::milliseconds patience) {
            auto ran = std::make_shared<std::promise<void>>();
            submit([ran] { ran->set_value(); });
            return ran->get_future().wait_for(patience) == std::future_status::ready;
        };
        auto onLoop = [&](const SerialQueue& queue) { return [&queue](auto block) { queue.async(block); }; };
        // letsLoopGo() tells each case apart: only a bulk block that holds the loop lets it go.
        std::promise<std::pair<bool, bool>> letGo;
        bool letsGoInBulk = false;
        bool letsGoAgainMeanwhile = true;
        a.asyncInBulk([&] {
            letsGoInBulk = SerialQueue::letsLoopGo();
            bool ranMeanwhile = SerialQueue::withLoopLetGo([&] {
                letsGoAgainMeanwhile = SerialQueue::letsLoopGo();
                return runsWithin(onLoop(a), kPatience);
            });
            letGo.set_value({ranMeanwhile, runsWithin(onLoop(b), 50ms)});
        });
        auto [ranMeanwhile, ranAfterwards] = letGo.get_future().get();
        EXPECT_TRUE(ranMeanwhile);
        EXPECT_FALSE(ranAfterwards);
        EXPECT_TRUE(letsGoInBulk);
        EXPECT_FALSE(letsGoAgainMeanwhile);
        std::promise<bool> loopLetGo;
        bool letsGoOnLoop = true;
        b.async([&] {
            letsGoOnLoop = SerialQueue::letsLoopGo();
            loopLetGo.set_value(SerialQueue::withLoopLetGo(
                [&] { return runsWithin([&](auto block) { a.asyncInBulk(block); }, 50ms); }));
        });
        EXPECT_FALSE(loopLetGo.get_future().get());
        EXPECT_FALSE(letsGoOnLoop);
        EXPECT_FALSE(SerialQueue::letsLoopGo());

        std::promise<std::string> refused;
        a.asyncInBulk([&] { refused.set_value(refusal([&] { b.sync([] {}); })); });
        std::string what = refused.get_future().get();
        EXPECT_NE(what.find("same event loop"), std::string::npos) << what;

        // A block held up in bulk, and one behind it that must never run. Whoever ran the loop goes on only once
        // the block in bulk has ended, since what comes next tears down what blocks use.
        std::promise<void> gate, holding;
        auto opened = gate.get_future().share();
        std::atomic<bool> heldEnded{false};
        a.asyncInBulk([opened, &holding, &heldEnded] {
            holding.set_value();
            opened.wait();
            std::this_thread::sleep_for(50ms);
            heldEnded = true;
        });
        holding.get_future().wait();
        a.asyncInBulk([&lateRan, sentinel] { lateRan = true; });
        loop.stop();
        gate.set_value();
        runner.join();
        EXPECT_TRUE(heldEnded.load());
    }
    EXPECT_FALSE(lateRan.load());
    EXPECT_EQ(sentinel.use_count(), 1);

    EventLoop plain(1);
    SerialQueue queue("plain", plain);
    std::promise<std::thread::id> inBulk;
    const std::thread::id loopThread = queue.sync([] { return std::this_thread::get_id(); });
    queue.asyncInBulk([&] {
        EXPECT_FALSE(SerialQueue::bulkBlockIsWaitedFor());
        inBulk.set_value(std::this_thread::get_id());
    });
    EXPECT_EQ(inBulk.get_future().get(), loopThread);
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

// Guards the loop against a faulty block: the exception is reported with the queue's name and later blocks run.
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

// Guards shutdown: pending and timed blocks are destroyed unrun, and a queue outliving its loop drops new work.
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

// Guards socket and timer handlers: bound to a queue, they never run beside its blocks.
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

// Guards the database lock (a mutex that knows its owner, so its exclusion is the standard library's): it is
// current per thread, and entering it again from inside or asserting the wrong side is refused with the queue's
// name rather than deadlocking or passing silently.
TEST(SyncQueueTest, IsCurrentPerThreadAndRefusesReentryNamingTheQueue) {
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
    EXPECT_NO_THROW(BX_ASSERT_NOT_ON_QUEUE(queue));
}
