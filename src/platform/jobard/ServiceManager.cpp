#include "platform/jobard/ServiceManager.h"

#include <unistd.h>

#include <algorithm>
#include <asio.hpp>
#include <cerrno>
#include <csignal>
#include <filesystem>
#include <list>
#include <mutex>

#include "base/EventLoopAsio.h"
#include "base/Pidfd.h"
#include "base/UniqueFd.h"
#include "platform/log/Log.h"

namespace bexil {

namespace {

// Calls `ended` on `queue` once the process of `pidfd` has ended; nothing when the watch is closed first. A readable
// pidfd is only a reason to look: the event loop can report one while the process still runs, and whoever waits
// here (a hold with termination) promises its caller that the instance has ended.
void whenExited(std::shared_ptr<asio::posix::stream_descriptor> pidfd, SerialQueue queue, std::function<void()> ended) {
    pidfd->async_wait(
        asio::posix::stream_descriptor::wait_read,
        detail::bindToQueue(queue, [pidfd, queue, ended = std::move(ended)](const asio::error_code& error) mutable {
            if (error == asio::error::operation_aborted) return;
            if (!pidfdExited(pidfd->native_handle())) return whenExited(pidfd, queue, std::move(ended));
            ended();
        }));
}

// Ends one instance without blocking anyone: SIGTERM, then SIGKILL when it is still there after the grace period,
// all driven by `queue`'s event loop (a watch on the instance's pidfd and a timer). `done` runs once on `queue`
// with 0 or an errno value.
void terminate(const InstanceRecords::Instance& instance, SerialQueue& queue, std::function<void(int)> done) {
    int pidfd = pidfdOpen(instance.pid);
    if (pidfd < 0) return done(errno == ESRCH ? 0 : errno);
    // The pidfd pins one process; make sure it is still the one the record names before signalling it. The
    // instance may have ended meanwhile and its pid gone to another process.
    if (InstanceRecords::startTime(instance.pid) != instance.startTime) {
        close(pidfd);
        return done(0);
    }
    if (pidfdSendSignal(pidfd, SIGTERM) != 0) {
        int error = errno;
        close(pidfd);
        return done(error == ESRCH ? 0 : error);
    }
    asio::io_context& io = *detail::QueueInternals::state(queue)->core;
    auto exited = std::make_shared<asio::posix::stream_descriptor>(io, pidfd);
    auto timer = std::make_shared<asio::steady_timer>(io, ServiceManager::kTerminationGrace);
    auto finished = std::make_shared<bool>(false);
    auto finish = [exited, timer, finished, done = std::move(done)](int result) {
        if (std::exchange(*finished, true)) return;
        timer->cancel();
        exited->close();
        done(result);
    };
    whenExited(exited, queue, [finish] { finish(0); });
    timer->async_wait(
        detail::bindToQueue(queue, [queue, exited, timer, finished, finish](const asio::error_code& error) {
            if (error || *finished) return;
            if (pidfdSendSignal(exited->native_handle(), SIGKILL) != 0 && errno != ESRCH) return finish(errno);
            // A killed process is gone at once, unless it is stuck in the kernel: wait a little, then give up on it.
            timer->expires_after(std::chrono::seconds(1));
            timer->async_wait(detail::bindToQueue(queue, [finish](const asio::error_code& again) {
                if (!again) finish(0);
            }));
        }));
}

}  // namespace

struct ServiceManager::Grants {
    struct Grant {
        std::shared_ptr<const UniqueFd> host;  // pidfd of the process the grant was made to, shared
        pid_t hostPid;
        std::string executablePath;
        Value overlay;
    };

    // Drops the grants of hosts that have ended. REQUIRES: `mutex` held.
    void prune() {
        grants.remove_if([](const Grant& grant) { return pidfdExited(grant.host->get()); });
    }

    mutable std::mutex mutex;
    std::list<Grant> grants;  // oldest first
};

ServiceManager::ServiceManager(InstanceRecords instances)
    : instances_(std::move(instances)), grants_(std::make_shared<Grants>()) {}

int ServiceManager::addExternalService(pid_t hostPid, const std::string& executablePath, const Value& overlay,
                                       std::shared_ptr<const UniqueFd> hostPidfd) {
    if (executablePath.empty() || hostPid <= 0) return EINVAL;
    std::shared_ptr<const UniqueFd> host = std::move(hostPidfd);
    if (!host || !*host) {
        UniqueFd opened(pidfdOpen(hostPid));
        if (!opened) return errno;
        host = std::make_shared<const UniqueFd>(std::move(opened));
    }
    if (pidfdExited(host->get())) return ESRCH;
    std::lock_guard lock(grants_->mutex);
    grants_->prune();
    size_t ofHost = 0;
    for (auto it = grants_->grants.begin(); it != grants_->grants.end();) {
        if (it->hostPid == hostPid && it->executablePath == executablePath) {
            it = grants_->grants.erase(it);
            continue;
        }
        if (it->hostPid == hostPid) ++ofHost;
        ++it;
    }
    if (ofHost >= kMaxGrantsPerHost) {
        auto oldest = std::find_if(grants_->grants.begin(), grants_->grants.end(),
                                   [hostPid](const Grants::Grant& grant) { return grant.hostPid == hostPid; });
        log::ops().error("host %d holds %zu grants, the limit (kMaxGrantsPerHost): dropping its oldest, for %s",
                         static_cast<int>(hostPid), ofHost, oldest->executablePath.c_str());
        grants_->grants.erase(oldest);
    }
    grants_->grants.push_back(Grants::Grant{std::move(host), hostPid, executablePath, overlay});
    return 0;
}

std::optional<Value> ServiceManager::grantedOverlay(pid_t hostPid, const std::string& executablePath) const {
    std::lock_guard lock(grants_->mutex);
    grants_->prune();
    for (const Grants::Grant& grant : grants_->grants)
        if (grant.hostPid == hostPid && grant.executablePath == executablePath) return grant.overlay;
    return std::nullopt;
}

size_t ServiceManager::grantCount() const {
    std::lock_guard lock(grants_->mutex);
    grants_->prune();
    return grants_->grants.size();
}

void ServiceManager::removeExternalService(const std::string& bundleIdentifier, const std::string& /*version*/,
                                           SerialQueue queue, std::function<void(int error)> completion) const {
    std::vector<InstanceRecords::Instance> running = instances_.live(bundleIdentifier);
    if (running.empty()) {
        queue.async([completion = std::move(completion)] { completion(kNothingOnRecord); });
        return;
    }
    // Every instance is ended at once; the completion runs when the last one is done, with the first error.
    struct Progress {
        size_t remaining;
        int error = 0;
        std::function<void(int)> completion;
    };
    auto progress = std::make_shared<Progress>(Progress{running.size(), 0, std::move(completion)});
    queue.async([running = std::move(running), queue, progress]() mutable {
        for (const InstanceRecords::Instance& instance : running) {
            terminate(instance, queue, [progress, record = instance.record](int result) {
                std::error_code ignored;
                std::filesystem::remove(record, ignored);
                if (result != 0 && progress->error == 0) progress->error = result;
                if (--progress->remaining == 0) progress->completion(progress->error);
            });
        }
    });
}

}  // namespace bexil
