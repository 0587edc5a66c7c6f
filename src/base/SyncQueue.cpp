#include "base/SyncQueue.h"

#include "base/Error.h"

namespace bexil {

void SyncQueue::enter() {
    if (isCurrent()) throw InternalInconsistency("queue \"" + label_ + "\" entered from inside itself");
    mutex_.lock();
    owner_.store(std::this_thread::get_id(), std::memory_order_relaxed);
}

void SyncQueue::leave() {
    owner_.store(std::thread::id(), std::memory_order_relaxed);
    mutex_.unlock();
}

}  // namespace bexil
