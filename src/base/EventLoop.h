#pragma once

// EventLoop is the executor under every SerialQueue: one event loop run by a few threads, on which socket I/O,
// timers and queued blocks all run. Whoever makes an EventLoop owns it (the process-wide one is never destroyed);
// its member functions may be called from any thread.

#include <exception>
#include <memory>
#include <string_view>
#include <thread>
#include <vector>

namespace bexil {

namespace detail {
class EventLoopCore;
struct QueueInternals;
}  // namespace detail

class EventLoop {
  public:
    // One thread does socket I/O, decoding, the request queue and encoding, so a request never crosses threads
    // between its bytes arriving and its reply leaving: on small machines a cross-CPU wake-up costs more than a
    // whole request.
    static constexpr unsigned kDefaultEventLoopThreads = 1;

    // The process-wide loop, started on first use with the threads set by configureShared (by default
    // kDefaultEventLoopThreads threads of its own). It lives until the process ends.
    static EventLoop& shared();

    // Sets how many threads of its own the shared loop starts. 0 means the caller will run it itself with
    // runOnCurrentThread (the daemon's main thread does). REQUIRES: shared() not yet called; otherwise throws
    // InternalInconsistency.
    static void configureShared(unsigned ownThreads);

    // What runs when a block on any queue lets an exception escape. The block's queue label and the exception are
    // passed; the loop carries on. The default writes a line to standard error; the daemon installs one that logs
    // at fault level. Must not throw.
    using UncaughtExceptionHandler = void (*)(std::string_view queueLabel, std::exception_ptr exception);
    static void setUncaughtExceptionHandler(UncaughtExceptionHandler handler);

    // A private loop with `ownThreads` threads of its own, running at once (0: only callers of
    // runOnCurrentThread run it).
    explicit EventLoop(unsigned ownThreads = kDefaultEventLoopThreads);

    // Stops the loop, joins its own threads and destroys every block still pending, without running it. Queues
    // made on this loop may outlive it; whatever they are given afterwards is dropped.
    // REQUIRES: not called from one of the loop's threads, nor from a block of its bulk thread.
    ~EventLoop();

    EventLoop(const EventLoop&) = delete;
    EventLoop& operator=(const EventLoop&) = delete;

    // Gives the loop a bulk thread for SerialQueue::asyncInBulk: idle-scheduled where the process may raise it
    // back, and `niceIncrement` steps of nice value below the caller whenever it runs at normal scheduling. From
    // then on every block of the loop's queues takes the loop's exclusion, so blocks of different queues no longer
    // overlap either, whichever thread runs them: the loop stays one logical thread, but for the work a bulk block
    // runs with the loop let go (SerialQueue::withLoopLetGo). The bulk thread lets a loop thread that waits for the
    // exclusion go first, and is raised to normal scheduling while one waits for its block to end.
    // REQUIRES: no thread runs the loop yet (a loop made with no threads of its own); otherwise throws
    // InternalInconsistency.
    void startBulkThread(int niceIncrement);

    // Makes the calling thread one of the loop's threads until stop() is called (at once if it already was). When
    // it returns, the bulk thread, if any, has left too.
    void runOnCurrentThread();

    // Makes every thread leave the loop soon; blocks already queued are not run. A stopped loop stays stopped.
    void stop();
    bool isStopped() const;

    // True when the calling thread is one of the threads running this loop.
    bool runsOnCurrentThread() const;

    // How many threads run the loop: its own threads from construction until they leave, plus callers inside
    // runOnCurrentThread.
    unsigned runningThreadCount() const;

  private:
    friend struct detail::QueueInternals;

    std::shared_ptr<detail::EventLoopCore> core_;
    std::vector<std::thread> threads_;
};

}  // namespace bexil
