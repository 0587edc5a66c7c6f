#pragma once

// INTERNAL: the Asio side of EventLoop and SerialQueue. Only .cpp files of src/base and of the IPC layer may include
// this header; no public header may, so Asio never leaks into the interfaces of the rest of the system.
//
// The IPC layer uses it to open sockets on a loop's io_context and to run their completion handlers on a
// connection's SerialQueue: `socket.async_read_some(buffer, bindToQueue(queue, handler))` runs the handler on the
// queue's strand, serialised with every block submitted through SerialQueue::async, and with isCurrent() true.
//
// Lifetime: every SerialQueue keeps its loop's core (the io_context) alive, so a queue may outlive the EventLoop
// object that made it. When the EventLoop is destroyed its core is shut down: pending blocks and handlers are
// destroyed without running, and anything submitted afterwards is dropped.

// Every translation unit that sees Asio must see it configured alike, including ones (tests) that do not link the
// bexil_asio target which sets these.
#ifndef ASIO_STANDALONE
#define ASIO_STANDALONE
#endif
#ifndef ASIO_NO_DEPRECATED
#define ASIO_NO_DEPRECATED
#endif

#include <sys/types.h>

#include <asio.hpp>
#include <atomic>
#include <condition_variable>
#include <deque>
#include <exception>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <utility>

#include "base/EventLoop.h"
#include "base/SerialQueue.h"

namespace bexil::detail {

struct SerialQueueState;

// The second thread of a loop that has one (EventLoop::startBulkThread): it runs the blocks given to
// SerialQueue::asyncInBulk, one at a time. Every block of the loop's queues takes the loop's exclusion, here, so no
// two blocks ever overlap whichever thread runs them (a bulk block gives it back only around work that is safe
// beside them, SerialQueue::withLoopLetGo), and the loop's threads go first: after each of its blocks the bulk
// thread waits for a loop thread that wants the exclusion to have taken it.
//
// Where it may be raised again, the thread is scheduled as idle: it runs on a CPU only when nothing of normal
// priority wants that CPU, and the kernel counts a CPU that runs only it as free when it places a waking thread.
// While a loop thread waits for the exclusion, the bulk thread is raised to normal scheduling (at its nice value)
// until it gives the exclusion back, so that the wait lasts the block, not until the machine is quiet. It is idle
// again before it wakes the waiting thread: raised, the kernel would let it finish its time slice first, on the CPU
// where the woken thread is placed, even with another CPU free.
class BulkThread {
  public:
    // Starts the thread, `niceIncrement` steps of nice value below its creator.
    explicit BulkThread(int niceIncrement);
    // Joins the thread; blocks still waiting are destroyed without running.
    ~BulkThread();
    BulkThread(const BulkThread&) = delete;
    BulkThread& operator=(const BulkThread&) = delete;

    void submit(std::shared_ptr<SerialQueueState> state, std::function<void()> block);
    // Makes the thread leave after the block it is running, if any; blocks submitted afterwards are dropped.
    // Never waits, so a block may call it.
    void stop();
    // Stops the thread and waits until it has left. REQUIRES: not called from a block of the loop.
    void join();

    // Takes and gives back the exclusion, on any thread.
    void enter();
    void leave();
    // Whether a loop thread waits for the exclusion now.
    bool waitedFor() const { return loopWaiting_.load(std::memory_order_relaxed) > 0; }

  private:
    void run(int niceIncrement);
    // Lifts the thread out of idle scheduling until it gives the exclusion back (settle); on a loop thread that must
    // wait.
    void raise();
    void settle();

    std::mutex exclusion_;
    // Loop threads waiting for the exclusion.
    std::atomic<unsigned> loopWaiting_{0};
    // Set by the thread before it runs anything: its id, and whether it is idle-scheduled.
    std::atomic<pid_t> tid_{0};
    std::atomic<bool> idle_{false};
    // Whether a loop thread has raised it; changed with its policy, under `policyMutex_`.
    std::atomic<bool> raised_{false};
    std::mutex policyMutex_;

    std::mutex mutex_;
    std::condition_variable ready_;
    std::deque<std::pair<std::shared_ptr<SerialQueueState>, std::function<void()>>> blocks_;
    bool stopping_ = false;
    std::thread thread_;
};

// The io_context of one EventLoop plus what the queues need to know about the threads running it.
class EventLoopCore : public asio::io_context {
  public:
    EventLoopCore() : keepAlive_(std::in_place, get_executor()) {}

    // Destroys every pending handler while leaving the services alive, so strands and timers still held by queues
    // can be destroyed safely later; the io_context itself goes when the last queue lets go of the core.
    void shutDown() {
        closed_.store(true, std::memory_order_release);
        shutdown();
    }
    bool closed() const { return closed_.load(std::memory_order_acquire); }

    // Without this guard run() would return whenever the loop has no work; the loop runs until stop().
    void releaseKeepAlive() {
        std::lock_guard lock(keepAliveMutex_);
        keepAlive_.reset();
    }

    // Number of threads running the loop or about to (own threads and callers of runOnCurrentThread).
    std::atomic<unsigned> runners{0};

    // Set once, before any block of the loop runs, when the loop has a bulk thread.
    std::shared_ptr<BulkThread> bulk;

  private:
    std::mutex keepAliveMutex_;
    std::optional<asio::executor_work_guard<asio::io_context::executor_type>> keepAlive_;
    std::atomic<bool> closed_{false};
};

// True when the calling thread is one of the threads running `core`.
bool runsOnCurrentThread(const EventLoopCore& core);

// Hands an exception that escaped a block to the process's handler (see EventLoop::setUncaughtExceptionHandler).
void reportUncaughtException(std::string_view label, std::exception_ptr exception);

using QueueStrand = asio::strand<asio::io_context::executor_type>;

// What a SerialQueue handle shares with its copies and with every block it has queued.
struct SerialQueueState {
    SerialQueueState(std::string label, std::shared_ptr<EventLoopCore> core)
        : label(std::move(label)), core(std::move(core)), strand(asio::make_strand(*this->core)) {}

    const std::string label;
    const std::shared_ptr<EventLoopCore> core;
    QueueStrand strand;
};

// One block in progress on the calling thread. `outer` is the block this one keeps waiting: the block further out
// on the same thread's stack or, for a block run by SerialQueue::sync, the caller's block on the waiting thread.
// Following `outer` names every queue that cannot run anything until this block returns.
struct QueueFrame {
    const SerialQueueState* state;
    const QueueFrame* outer;
};

// The innermost block the calling thread is running, if any.
const QueueFrame* currentQueueFrame();

// Marks the calling thread as running a block of `state` for the scope's lifetime; scopes nest.
class CurrentQueueScope {
  public:
    explicit CurrentQueueScope(const SerialQueueState* state) : CurrentQueueScope(state, currentQueueFrame()) {}
    CurrentQueueScope(const SerialQueueState* state, const QueueFrame* outer);
    ~CurrentQueueScope();
    CurrentQueueScope(const CurrentQueueScope&) = delete;
    CurrentQueueScope& operator=(const CurrentQueueScope&) = delete;

  private:
    QueueFrame frame_;
    const QueueFrame* previous_;
};

// Holds the exclusion of the loop's bulk thread for the scope's lifetime, when the loop has one and the calling
// thread does not hold it already (a block run inside another, by dispatch). Nothing otherwise.
class ExclusiveScope {
  public:
    explicit ExclusiveScope(const EventLoopCore& core);
    ~ExclusiveScope();
    ExclusiveScope(const ExclusiveScope&) = delete;
    ExclusiveScope& operator=(const ExclusiveScope&) = delete;

  private:
    BulkThread* taken_ = nullptr;
};

// True when the calling thread holds the exclusion of `core`'s bulk thread.
bool holdsExclusion(const EventLoopCore& core);

// Runs `block` as a block of the queue: marked current, and an escaping exception is reported instead of unwinding
// through the loop (which would end the loop thread and, with it, the process).
template <class Block>
void runOnQueue(const SerialQueueState& state, Block&& block) noexcept {
    ExclusiveScope exclusive(*state.core);
    CurrentQueueScope scope(&state);
    try {
        std::forward<Block>(block)();
    } catch (...) {
        reportUncaughtException(state.label, std::current_exception());
    }
}

// The only way into the private parts of EventLoop and SerialQueue.
struct QueueInternals {
    static const std::shared_ptr<EventLoopCore>& core(const EventLoop& loop) { return loop.core_; }
    static const std::shared_ptr<SerialQueueState>& state(const SerialQueue& queue) { return queue.state_; }
};

// The io_context on which the IPC layer opens its sockets and timers.
inline asio::io_context& ioContext(const EventLoop& loop) { return *QueueInternals::core(loop); }

// The strand under a SerialQueue. Handlers bound to it directly are serialised with the queue's blocks but do not
// see isCurrent() as true; prefer bindToQueue.
inline QueueStrand strandOf(const SerialQueue& queue) { return QueueInternals::state(queue)->strand; }

// Wraps a completion handler so that it runs as a block of `queue`.
template <class Handler>
auto bindToQueue(const SerialQueue& queue, Handler handler) {
    auto state = QueueInternals::state(queue);
    QueueStrand strand = state->strand;
    return asio::bind_executor(std::move(strand),
                               [state = std::move(state), handler = std::move(handler)](auto&&... args) mutable {
                                   runOnQueue(*state, [&] { handler(std::forward<decltype(args)>(args)...); });
                               });
}

}  // namespace bexil::detail
