#include "platform/jobard/ServiceManager.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <filesystem>
#include <list>
#include <mutex>
#include <thread>

#include "base/UniqueFd.h"
#include "platform/log/Log.h"

namespace bexil {

namespace {

int pidfdOpen(pid_t pid) { return static_cast<int>(syscall(SYS_pidfd_open, pid, 0)); }
int pidfdSignal(int pidfd, int signal) {
    return static_cast<int>(syscall(SYS_pidfd_send_signal, pidfd, signal, nullptr, 0));
}

// A pidfd becomes readable when its process has exited.
bool waitForExit(int pidfd, std::chrono::milliseconds timeout) {
    pollfd p{pidfd, POLLIN, 0};
    int rc;
    do {
        rc = poll(&p, 1, static_cast<int>(timeout.count()));
    } while (rc < 0 && errno == EINTR);
    return rc > 0;
}

// Ends one instance: SIGTERM, then SIGKILL after the grace period. Returns 0 or an errno value.
int terminate(const InstanceRecords::Instance& instance) {
    int pidfd = pidfdOpen(instance.pid);
    if (pidfd < 0) return errno == ESRCH ? 0 : errno;
    // The pidfd pins one process; make sure it is still the one the record names before signalling it. Earlier
    // instances may have taken seconds to end, time enough for this one to end too and its pid to be reused.
    if (InstanceRecords::startTime(instance.pid) != instance.startTime) {
        close(pidfd);
        return 0;
    }
    int result = 0;
    if (pidfdSignal(pidfd, SIGTERM) != 0) {
        result = errno == ESRCH ? 0 : errno;
    } else if (!waitForExit(pidfd, ServiceManager::kTerminationGrace)) {
        if (pidfdSignal(pidfd, SIGKILL) != 0 && errno != ESRCH) result = errno;
        waitForExit(pidfd, std::chrono::seconds(1));
    }
    close(pidfd);
    return result;
}

bool hasExited(int pidfd) { return waitForExit(pidfd, std::chrono::milliseconds(0)); }

}  // namespace

struct ServiceManager::Grants {
    struct Grant {
        UniqueFd host;  // pidfd of the process the grant was made to
        pid_t hostPid;
        std::string executablePath;
        Value overlay;
    };

    // Drops the grants of hosts that have ended. REQUIRES: `mutex` held.
    void prune() {
        grants.remove_if([](const Grant& grant) { return hasExited(grant.host.get()); });
    }

    mutable std::mutex mutex;
    std::list<Grant> grants;  // oldest first
};

ServiceManager::ServiceManager(InstanceRecords instances)
    : instances_(std::move(instances)), grants_(std::make_shared<Grants>()) {}

int ServiceManager::addExternalService(pid_t hostPid, const std::string& executablePath, const Value& overlay,
                                       int hostPidfd) {
    if (executablePath.empty() || hostPid <= 0) return EINVAL;
    UniqueFd host(hostPidfd >= 0 ? fcntl(hostPidfd, F_DUPFD_CLOEXEC, 0) : pidfdOpen(hostPid));
    if (!host) return errno;
    if (hasExited(host.get())) return ESRCH;
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
    // Waiting for processes to exit can take seconds: it must not hold up any queue.
    std::thread([running = std::move(running), queue, completion = std::move(completion)]() mutable {
        int error = 0;
        for (const InstanceRecords::Instance& instance : running) {
            int result = terminate(instance);
            std::error_code ignored;
            std::filesystem::remove(instance.record, ignored);
            if (result != 0 && error == 0) error = result;
        }
        queue.async([completion = std::move(completion), error] { completion(error); });
    }).detach();
}

}  // namespace bexil
