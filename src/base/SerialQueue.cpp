// A SerialQueue is an Asio strand over its loop's io_context: the strand guarantees FIFO order and that no two
// blocks of the queue run at once, while the loop's threads are shared by all queues. Each block is wrapped so that,
// while it runs, a thread-local pointer names its queue; isCurrent() compares against it, which keeps the answer
// right for handlers bound with bindToQueue. Each such frame also links to the block it keeps waiting, so a sync
// that would wait for itself, however many queues away, is caught instead of hanging.

#include "base/SerialQueue.h"

#include <pthread.h>
#include <sched.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <condition_variable>
#include <cstdlib>
#include <exception>
#include <fstream>
#include <mutex>
#include <string>
#include <thread>

#include "base/Error.h"
#include "base/EventLoopAsio.h"

namespace bexil {

namespace {

thread_local const detail::QueueFrame* tlsCurrentFrame = nullptr;
// The bulk thread whose exclusion the calling thread holds, if any.
thread_local detail::BulkThread* tlsExclusion = nullptr;

// How often the bulk thread gives the CPU away, at most, waiting for a loop thread it woke to take the exclusion;
// past that it takes its turn again (the loop thread may be waiting for a CPU that the bulk thread is not on).
constexpr int kMaxGiveWays = 64;

}  // namespace

namespace detail {

const QueueFrame* currentQueueFrame() { return tlsCurrentFrame; }

CurrentQueueScope::CurrentQueueScope(const SerialQueueState* state, const QueueFrame* outer)
    : frame_{state, outer}, previous_(tlsCurrentFrame) {
    tlsCurrentFrame = &frame_;
}

CurrentQueueScope::~CurrentQueueScope() { tlsCurrentFrame = previous_; }

ExclusiveScope::ExclusiveScope(const EventLoopCore& core) {
    BulkThread* bulk = core.bulk.get();
    if (bulk == nullptr || tlsExclusion == bulk) return;
    bulk->enter();
    tlsExclusion = bulk;
    taken_ = bulk;
}

ExclusiveScope::~ExclusiveScope() {
    if (taken_ == nullptr) return;
    tlsExclusion = nullptr;
    taken_->leave();
}

bool holdsExclusion(const EventLoopCore& core) { return core.bulk && tlsExclusion == core.bulk.get(); }

namespace {

thread_local bool tlsOnBulkThread = false;

// Whether this process may give a thread back normal scheduling, at `nice`, once it has made it idle-scheduled:
// with CAP_SYS_NICE, or within RLIMIT_NICE (which counts 20 - nice).
bool mayRaiseTo(int nice) {
    rlimit limit{};
    if (getrlimit(RLIMIT_NICE, &limit) == 0 &&
        (limit.rlim_cur == RLIM_INFINITY || static_cast<rlim_t>(20 - nice) <= limit.rlim_cur))
        return true;
    std::ifstream status("/proc/thread-self/status");
    std::string line;
    constexpr int kCapSysNice = 23;
    while (std::getline(status, line))
        if (line.rfind("CapEff:", 0) == 0) return (std::strtoull(line.c_str() + 7, nullptr, 16) >> kCapSysNice) & 1;
    return false;
}

}  // namespace

BulkThread::BulkThread(int niceIncrement) : thread_([this, niceIncrement] { run(niceIncrement); }) {}

BulkThread::~BulkThread() {
    // The loop joins the thread when it goes; a loop never destroyed keeps its core, and this, alive too.
    if (thread_.joinable()) join();
}

void BulkThread::join() {
    stop();
    if (thread_.joinable()) thread_.join();
}

void BulkThread::submit(std::shared_ptr<SerialQueueState> state, std::function<void()> block) {
    {
        std::lock_guard lock(mutex_);
        if (stopping_) return;
        blocks_.emplace_back(std::move(state), std::move(block));
    }
    ready_.notify_one();
}

void BulkThread::stop() {
    {
        std::lock_guard lock(mutex_);
        stopping_ = true;
    }
    ready_.notify_one();
}

void BulkThread::enter() {
    if (tlsOnBulkThread) {
        exclusion_.lock();
        return;
    }
    if (exclusion_.try_lock()) return;
    loopWaiting_.fetch_add(1, std::memory_order_relaxed);
    raise();
    exclusion_.lock();
    loopWaiting_.fetch_sub(1, std::memory_order_relaxed);
}

void BulkThread::leave() {
    if (tlsOnBulkThread) settle();
    exclusion_.unlock();
}

void BulkThread::raise() {
    if (!idle_.load()) return;
    std::lock_guard lock(policyMutex_);
    // sched_setscheduler keeps the thread's nice value.
    sched_param normal{};
    if (!raised_.load() && sched_setscheduler(tid_.load(), SCHED_OTHER, &normal) == 0) raised_.store(true);
}

void BulkThread::settle() {
    // A raise still under way is settled after the next block.
    if (!raised_.load()) return;
    std::lock_guard lock(policyMutex_);
    sched_param idle{};
    if (sched_setscheduler(0, SCHED_IDLE, &idle) == 0) raised_.store(false);
}

void BulkThread::run(int niceIncrement) {
    tlsOnBulkThread = true;
    // Named apart from the loop's thread, in ps -L, top -H and scheduler traces.
    pthread_setname_np(pthread_self(), "bulk");
    // The thread started with its creator's nice value; on Linux this changes this thread's alone. Lowering one's
    // own priority needs no privilege, so neither call can be refused.
    const auto self = static_cast<pid_t>(gettid());
    errno = 0;
    const int nice = getpriority(PRIO_PROCESS, static_cast<id_t>(self));
    const int lowered = std::min(nice + niceIncrement, 19);
    if (errno == 0) setpriority(PRIO_PROCESS, static_cast<id_t>(self), lowered);
    tid_.store(self);
    sched_param idle{};
    if (mayRaiseTo(lowered) && sched_setscheduler(0, SCHED_IDLE, &idle) == 0) idle_.store(true);
    for (;;) {
        std::pair<std::shared_ptr<SerialQueueState>, std::function<void()>> next;
        {
            std::unique_lock lock(mutex_);
            ready_.wait(lock, [this] { return stopping_ || !blocks_.empty(); });
            if (stopping_) {
                blocks_.clear();
                return;
            }
            next = std::move(blocks_.front());
            blocks_.pop_front();
        }
        runOnQueue(*next.first, next.second);
        next = {};
        // A raise that came just after the block gave the exclusion back.
        settle();
        // A loop thread woken by the unlock has not necessarily run yet; taking the exclusion straight back would
        // make it wait a whole block more.
        for (int i = 0; i < kMaxGiveWays && loopWaiting_.load(std::memory_order_relaxed) > 0; ++i)
            std::this_thread::yield();
    }
}

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

void SerialQueue::asyncInBulk(std::function<void()> block) const {
    if (state_->core->closed()) return;
    if (!state_->core->bulk) return asyncBehindReady(std::move(block));
    state_->core->bulk->submit(state_, std::move(block));
}

bool SerialQueue::letsLoopGo() { return detail::tlsOnBulkThread && tlsExclusion != nullptr; }

SerialQueue::LetGo::LetGo() {
    if (!letsLoopGo()) return;
    released_ = tlsExclusion;
    tlsExclusion = nullptr;
    released_->leave();
}

SerialQueue::LetGo::~LetGo() {
    if (released_ == nullptr) return;
    released_->enter();
    tlsExclusion = released_;
}

bool SerialQueue::bulkBlockIsWaitedFor() { return letsLoopGo() && tlsExclusion->waitedFor(); }

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
    if (detail::holdsExclusion(*state_->core)) {
        throw InternalInconsistency("sync on queue \"" + state_->label + "\" from a block of the same event loop");
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
            detail::ExclusiveScope exclusive(*state->core);
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
