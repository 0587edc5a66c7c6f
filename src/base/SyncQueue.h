#pragma once

// SyncQueue is a lock that is only ever entered synchronously: sync(block) runs the block on the calling thread
// while no other thread is inside the same queue, and isCurrent() tells a thread whether it is inside. Entering it
// again from inside throws InternalInconsistency (naming the label) instead of deadlocking. The owner of the
// guarded state owns the SyncQueue; any thread may enter it.

#include <atomic>
#include <functional>
#include <mutex>
#include <string>
#include <thread>
#include <type_traits>
#include <utility>

namespace bexil {

class SyncQueue {
  public:
    explicit SyncQueue(std::string label) : label_(std::move(label)) {}

    SyncQueue(const SyncQueue&) = delete;
    SyncQueue& operator=(const SyncQueue&) = delete;

    const std::string& label() const { return label_; }
    // The label, for "%@" in log texts.
    const std::string& description() const { return label_; }

    // True while the calling thread is inside sync on this queue.
    bool isCurrent() const { return owner_.load(std::memory_order_relaxed) == std::this_thread::get_id(); }

    // Runs `block` on the calling thread with the queue held and returns its result; an exception from the block
    // leaves the queue and propagates. REQUIRES: not inside this queue already (throws InternalInconsistency).
    template <class F>
    std::invoke_result_t<F&> sync(F&& block) {
        enter();
        Leave leave{*this};
        return std::invoke(block);
    }

  private:
    struct Leave {
        SyncQueue& queue;
        ~Leave() { queue.leave(); }
    };

    void enter();
    void leave();

    const std::string label_;
    std::mutex mutex_;
    // The thread inside, if any. Only that thread stores its own id, so a thread reading its own id here is
    // certainly inside; any other value means it is not.
    std::atomic<std::thread::id> owner_{};
};

}  // namespace bexil
