// A SerialQueue is an Asio strand over its loop's io_context: the strand guarantees FIFO order and that no two
// blocks of the queue run at once, while the loop's threads are shared by all queues. Each block is wrapped so that,
// while it runs, a thread-local pointer names its queue; isCurrent() compares against it, which keeps the answer
// right for handlers bound with bindToQueue. Each such frame also links to the block it keeps waiting, so a sync
// that would wait for itself, however many queues away, is caught instead of hanging.

#include "base/SerialQueue.h"

#include <condition_variable>
#include <exception>
#include <mutex>

#include "base/Error.h"
#include "base/EventLoopAsio.h"

namespace bexil {

namespace {

thread_local const detail::QueueFrame* tlsCurrentFrame = nullptr;

}  // namespace

namespace detail {

const QueueFrame* currentQueueFrame() { return tlsCurrentFrame; }

CurrentQueueScope::CurrentQueueScope(const SerialQueueState* state, const QueueFrame* outer)
    : frame_{state, outer}, previous_(tlsCurrentFrame) {
    tlsCurrentFrame = &frame_;
}

CurrentQueueScope::~CurrentQueueScope() { tlsCurrentFrame = previous_; }

}  // namespace detail

SerialQueue::SerialQueue(std::string label, EventLoop& loop)
    : state_(std::make_shared<detail::SerialQueueState>(std::move(label), detail::QueueInternals::core(loop))) {}

SerialQueue::SerialQueue(std::string label, const SerialQueue& sibling)
    : state_(std::make_shared<detail::SerialQueueState>(std::move(label), sibling.state_->core)) {}

const std::string& SerialQueue::label() const { return state_->label; }

void SerialQueue::async(std::function<void()> block) const {
    // After the loop is gone nothing would ever run the block, and queued it would keep the loop's core alive.
    // FIXME: a block submitted while another thread is destroying the loop can slip past this check and keep the
    // core (and itself) alive until the process ends; closing that window needs a lock on every submission.
    if (state_->core->closed()) return;
    asio::post(state_->strand, [state = state_, block = std::move(block)] { detail::runOnQueue(*state, block); });
}

void SerialQueue::dispatch(std::function<void()> block) const {
    if (state_->core->closed()) return;
    // A strand runs a dispatched handler inline when this thread runs its io_context and the strand is free (or is
    // already running further out on this thread); otherwise it queues the handler exactly as post would.
    asio::dispatch(state_->strand, [state = state_, block = std::move(block)] { detail::runOnQueue(*state, block); });
}

void SerialQueue::asyncBehindReady(std::function<void()> block) const {
    if (state_->core->closed()) return;
    // The first trip through the loop's queue lands behind the handlers ready now and the loop's look for I/O;
    // the second lands behind what that look found. Only then does the block join this queue (and runs at once
    // when nothing of the queue is pending).
    asio::post(*state_->core, [state = state_, block = std::move(block)]() mutable {
        asio::post(*state->core, [state, block = std::move(block)]() mutable {
            asio::dispatch(state->strand, [state, block = std::move(block)] { detail::runOnQueue(*state, block); });
        });
    });
}

void SerialQueue::asyncAfter(std::chrono::steady_clock::duration delay, std::function<void()> block) const {
    if (state_->core->closed()) return;
    auto timer = std::make_shared<asio::steady_timer>(*state_->core, delay);
    // The handler owns the timer; a timer is never cancelled, so the error code is always success until the loop
    // is destroyed, which destroys the handler without calling it.
    timer->async_wait(asio::bind_executor(
        state_->strand, [state = state_, timer, block = std::move(block)](const asio::error_code& error) {
            if (!error) detail::runOnQueue(*state, block);
        }));
}

bool SerialQueue::isCurrent() const { return tlsCurrentFrame != nullptr && tlsCurrentFrame->state == state_.get(); }

void SerialQueue::syncBlock(const std::function<void()>& block) const {
    // Waiting for a queue whose block is itself waiting for us (directly, or through other syncs) never ends.
    const detail::QueueFrame* caller = tlsCurrentFrame;
    for (const detail::QueueFrame* frame = caller; frame != nullptr; frame = frame->outer) {
        if (frame->state == state_.get()) {
            throw InternalInconsistency("sync on queue \"" + state_->label + "\" from inside the same queue");
        }
    }
    if (detail::runsOnCurrentThread(*state_->core) && state_->core->runners.load() <= 1) {
        throw InternalInconsistency("sync on queue \"" + state_->label + "\" from the only thread of its event loop");
    }
    if (state_->core->closed() || state_->core->stopped()) {
        throw InternalInconsistency("sync on queue \"" + state_->label + "\" after its event loop stopped");
    }

    std::mutex mutex;
    std::condition_variable finished;
    bool done = false;
    std::exception_ptr failure;
    asio::post(state_->strand, [&, state = state_] {
        {
            detail::CurrentQueueScope scope(state.get(), caller);
            try {
                block();
            } catch (...) {
                failure = std::current_exception();
            }
        }
        std::lock_guard lock(mutex);
        done = true;
        finished.notify_one();
    });
    std::unique_lock lock(mutex);
    finished.wait(lock, [&] { return done; });
    if (failure) std::rethrow_exception(failure);
}

}  // namespace bexil
