#include "base/EventLoop.h"

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <mutex>
#include <string>

#include "base/Error.h"
#include "base/EventLoopAsio.h"

namespace bexil {

namespace {

// The loop the calling thread is running, if any. A thread runs at most one loop at a time.
thread_local const detail::EventLoopCore* tlsRunningLoop = nullptr;

void writeUncaughtToStandardError(std::string_view queueLabel, std::exception_ptr exception) {
    std::string what = exceptionMessage(exception);
    std::fprintf(stderr, "bexil: block on queue \"%.*s\" threw: %s\n", static_cast<int>(queueLabel.size()),
                 queueLabel.data(), what.c_str());
}

std::atomic<EventLoop::UncaughtExceptionHandler> uncaughtHandler{&writeUncaughtToStandardError};

std::mutex sharedMutex;
EventLoop* sharedLoop = nullptr;
unsigned sharedOwnThreads = EventLoop::kDefaultEventLoopThreads;

// Runs the loop on the calling thread until it is stopped. Handlers of our queues catch their own exceptions; this
// catches what a foreign handler might let through, so a bug there cannot end a loop thread.
// REQUIRES: the caller counted this thread in core.runners already.
void runLoop(detail::EventLoopCore& core) {
    const detail::EventLoopCore* previous = tlsRunningLoop;
    tlsRunningLoop = &core;
    for (;;) {
        try {
            core.run();
            break;
        } catch (...) {
            detail::reportUncaughtException("event loop", std::current_exception());
        }
    }
    core.runners.fetch_sub(1);
    tlsRunningLoop = previous;
}

}  // namespace

namespace detail {

bool runsOnCurrentThread(const EventLoopCore& core) { return tlsRunningLoop == &core; }

void reportUncaughtException(std::string_view label, std::exception_ptr exception) {
    uncaughtHandler.load()(label, exception);
}

}  // namespace detail

EventLoop& EventLoop::shared() {
    std::lock_guard lock(sharedMutex);
    // Never destroyed: queues of static objects may still use it while the process exits.
    if (sharedLoop == nullptr) {
        // The loop's threads must be gone before the process's static objects are: a handler still running during
        // exit would use Asio's error categories after their destruction. Touching the categories first makes them
        // outlive the exit handler registered right after, which stops the loop and joins its threads.
        (void)asio::system_category();
        (void)asio::error::get_misc_category();
        (void)asio::error::get_netdb_category();
        (void)asio::error::get_addrinfo_category();
        sharedLoop = new EventLoop(sharedOwnThreads);
        std::atexit([] {
            EventLoop* loop = sharedLoop;
            loop->stop();
            for (std::thread& thread : loop->threads_)
                if (thread.joinable() && thread.get_id() != std::this_thread::get_id()) thread.join();
        });
    }
    return *sharedLoop;
}

void EventLoop::configureShared(unsigned ownThreads) {
    std::lock_guard lock(sharedMutex);
    if (sharedLoop != nullptr) throw InternalInconsistency("the shared event loop is already running");
    sharedOwnThreads = ownThreads;
}

void EventLoop::setUncaughtExceptionHandler(UncaughtExceptionHandler handler) {
    uncaughtHandler.store(handler != nullptr ? handler : &writeUncaughtToStandardError);
}

EventLoop::EventLoop(unsigned ownThreads) : core_(std::make_shared<detail::EventLoopCore>()) {
    threads_.reserve(ownThreads);
    // Counted before they start, so that a sync made right away already knows it may block one of them.
    core_->runners.fetch_add(ownThreads);
    for (unsigned i = 0; i < ownThreads; ++i) {
        threads_.emplace_back([core = core_] { runLoop(*core); });
    }
}

EventLoop::~EventLoop() {
    stop();
    for (auto& thread : threads_) thread.join();
    // The bulk thread leaves after its block. It goes before the core can: its blocks hold queues, which hold the
    // core, and the last of them may go on that thread.
    if (core_->bulk) core_->bulk->join();
    // Pending blocks hold their queues, and queues hold the core: destroying the blocks here breaks that cycle.
    core_->shutDown();
}

void EventLoop::startBulkThread(int niceIncrement) {
    if (core_->runners.load() != 0 || core_->bulk)
        throw InternalInconsistency("a bulk thread starts before anything runs the loop, once");
    core_->bulk = std::make_shared<detail::BulkThread>(niceIncrement);
}

void EventLoop::runOnCurrentThread() {
    if (runsOnCurrentThread()) throw InternalInconsistency("runOnCurrentThread called from inside the same loop");
    core_->runners.fetch_add(1);
    runLoop(*core_);
    // Whoever ran the loop goes on to tear down what its blocks use: the block the bulk thread may still be in ends
    // first.
    if (core_->stopped() && core_->bulk) core_->bulk->join();
}

void EventLoop::stop() {
    core_->releaseKeepAlive();
    core_->stop();
    if (core_->bulk) core_->bulk->stop();
}

bool EventLoop::isStopped() const { return core_->stopped(); }

bool EventLoop::runsOnCurrentThread() const { return detail::runsOnCurrentThread(*core_); }

unsigned EventLoop::runningThreadCount() const { return core_->runners.load(); }

}  // namespace bexil
