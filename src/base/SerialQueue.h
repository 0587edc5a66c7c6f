#pragma once

// SerialQueue runs blocks one at a time, in the order they were submitted, on the threads of an EventLoop; blocks of
// one queue never overlap, blocks of different queues may. A queue costs a small allocation and no thread, so every
// connection can have its own. SerialQueue is a handle: copies refer to the same queue, and the queue lives until
// the last copy and the last block queued on it are gone. Any thread may use it.

#include <chrono>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <type_traits>
#include <utility>

#include "base/EventLoop.h"

namespace bexil {

namespace detail {
struct SerialQueueState;
class BulkThread;
}  // namespace detail

class SerialQueue {
  public:
    // A new queue on `loop`; the label names it in log lines and in consistency failures.
    explicit SerialQueue(std::string label, EventLoop& loop = EventLoop::shared());
    // A new queue on the same loop as `sibling` (the IPC layer gives each accepted connection one).
    SerialQueue(std::string label, const SerialQueue& sibling);

    const std::string& label() const;
    // The label, for "%@" in log texts.
    const std::string& description() const { return label(); }

    // Queues `block` to run after every block submitted to this queue before it. Never runs it on the caller's
    // stack, even when the caller is on this queue. An exception escaping the block goes to the loop's
    // uncaught-exception handler.
    void async(std::function<void()> block) const;

    // Like async, except that `block` runs at once, on the caller's stack, when the calling thread runs this queue's
    // loop and the queue is free: nothing of it queued or running on another thread. It still runs as a block of
    // this queue (isCurrent() is true inside it, no other thread runs the queue meanwhile, and it keeps its place
    // after blocks already queued). When the caller is itself nested inside a block of this queue further out, it
    // runs at once too, inside that block: a queue whose state can be entered that way must say so. For hand-overs
    // on the request path, where a trip through the loop costs more than the work handed over.
    void dispatch(std::function<void()> block) const;

    // Like async, except that `block` waits behind the loop's own work first: it enters this queue only once the
    // loop has run the handlers ready by then and looked for I/O once more, so that what that I/O brings (and
    // submits to this queue) comes before it. For long work cut into steps that must not delay requests: with
    // async, a queue kept busy that way would make every request wait for a step before it is even read.
    void asyncBehindReady(std::function<void()> block) const;

    // Like asyncBehindReady, except that on a loop with a bulk thread (EventLoop::startBulkThread) `block` runs on
    // that thread: still as a block of this queue, and never beside any other block of the loop, but counted by
    // the kernel against the bulk thread's share of the CPU. For the later steps of long work, so that the thread
    // that reads and answers requests keeps the standing of a thread that mostly waits.
    void asyncInBulk(std::function<void()> block) const;

    // Whether the calling block runs in bulk while a thread of its loop waits to run a block of its own. Long work
    // asks between two pieces and, when so, queues the rest and returns: the waiting block then runs after one
    // piece rather than after the whole step. False anywhere but in a bulk block.
    static bool bulkBlockIsWaitedFor();

    // Runs `work` and returns its result; in a bulk block, with the loop let go meanwhile: the loop's thread may run
    // blocks of every queue, this one's included, while `work` runs, and the block holds the loop again once `work`
    // returns. So `work` may touch only what is safe from any thread (the database's public operations are), and the
    // caller must expect what those blocks changed meanwhile. Anywhere else it runs `work` as it is. For the slow
    // reads of long work, which a request would otherwise wait for.
    //
    // letsLoopGo() says whether withLoopLetGo, called here, would let the loop go: only then can blocks have run
    // during `work`.
    static bool letsLoopGo();
    template <class F>
    static std::invoke_result_t<F&> withLoopLetGo(F&& work) {
        LetGo letGo;
        return work();
    }

    // Queues `block` once `delay` has passed; it then runs in order with the blocks submitted by then.
    void asyncAfter(std::chrono::steady_clock::duration delay, std::function<void()> block) const;

    // True while the calling thread runs a block of this queue; false inside a block of another queue, even one
    // that a block of this queue waits for with sync.
    bool isCurrent() const;

    // Runs `block` on the queue, waits for it and returns its result; an exception it throws is rethrown here.
    // REQUIRES: not called from inside this queue (nor from a queue that a block of this queue waits for with
    // sync), nor from the loop's thread when it is the loop's only thread, nor after the loop stopped: each would
    // wait for ever, so each throws InternalInconsistency instead.
    template <class F>
    std::invoke_result_t<F&> sync(F&& block) const {
        using R = std::invoke_result_t<F&>;
        if constexpr (std::is_void_v<R>) {
            syncBlock([&] { block(); });
        } else {
            std::optional<R> result;
            syncBlock([&] { result.emplace(block()); });
            return std::move(*result);
        }
    }

    // Two handles are equal when they refer to the same queue.
    bool operator==(const SerialQueue& other) const { return state_ == other.state_; }

  private:
    friend struct detail::QueueInternals;

    // Lets go of the loop for its lifetime, in a bulk block; does nothing elsewhere.
    class LetGo {
      public:
        LetGo();
        ~LetGo();
        LetGo(const LetGo&) = delete;
        LetGo& operator=(const LetGo&) = delete;

      private:
        detail::BulkThread* released_ = nullptr;
    };

    void syncBlock(const std::function<void()>& block) const;

    std::shared_ptr<detail::SerialQueueState> state_;
};

}  // namespace bexil
