// Starting a plug-in: the one place where bxd makes processes. The child between fork and exec only moves
// descriptors, drops to the host's user and execs bubblewrap, all with async-signal-safe calls and with every
// argument prepared before the fork, since other threads may hold locks the child would never see released.

#include <fcntl.h>
#include <grp.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <asio.hpp>
#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <memory>
#include <optional>
#include <utility>

#include "base/EventLoopAsio.h"
#include "base/Format.h"
#include "base/Pidfd.h"
#include "platform/containers/DataContainer.h"
#include "platform/jobard/ServiceManager.h"
#include "platform/log/Log.h"
#include "platform/sandbox/SandboxProfiles.h"

namespace bexil {

namespace {

namespace fs = std::filesystem;

constexpr std::string_view kEnvironmentKey = "EnvironmentVariables";
constexpr std::string_view kSandboxProfileKey = "_SandboxProfile";
constexpr int kStatusFd = 4;
constexpr std::string_view kChildPidKey = "\"child-pid\"";

Error launchError(const std::string& message) { return BXError(ErrorCode::OperationFailed, message); }

// The number that follows `key` and its colon in bubblewrap's status text; none when it is missing.
std::optional<unsigned long long> statusNumber(const std::string& status, std::string_view key) {
    size_t at = status.find(key);
    if (at == std::string::npos) return std::nullopt;
    at = status.find(':', at + key.size());
    if (at == std::string::npos) return std::nullopt;
    char* end = nullptr;
    unsigned long long value = strtoull(status.c_str() + at + 1, &end, 10);
    if (end == status.c_str() + at + 1) return std::nullopt;
    return value;
}

// Reads what bubblewrap reports on its status pipe until it names the sandbox's first process, and returns that
// pid; none when the pipe ends or the time runs out first.
std::optional<pid_t> sandboxStarted(int statusFd) {
    std::string status;
    auto deadline = std::chrono::steady_clock::now() + ServiceManager::kSandboxSetupTimeout;
    while (status.find(kChildPidKey) == std::string::npos || status.find('}') == std::string::npos) {
        auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
        if (left.count() <= 0) return std::nullopt;
        pollfd p{statusFd, POLLIN, 0};
        int ready = poll(&p, 1, static_cast<int>(left.count()));
        if (ready < 0 && errno == EINTR) continue;
        if (ready <= 0) return std::nullopt;
        char buffer[512];
        ssize_t n = read(statusFd, buffer, sizeof buffer);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) return std::nullopt;
        status.append(buffer, static_cast<size_t>(n));
    }
    std::optional<unsigned long long> first = statusNumber(status, kChildPidKey);
    if (!first || *first == 0 || *first > static_cast<unsigned long long>(INT32_MAX)) return std::nullopt;
    return static_cast<pid_t>(*first);
}

// The parent pid of `pid`; -1 when it cannot be read.
pid_t parentOf(pid_t pid) {
    std::optional<unsigned long long> parent = InstanceRecords::statField(pid, 4);
    return parent ? static_cast<pid_t>(*parent) : -1;
}

// A pidfd of the sandbox's first process, the child `first` of bubblewrap's process `outer`. bubblewrap names it
// before it lets it go on, and if bubblewrap's process ends before that moment (killed because the host left or a
// hold ends the instance, or failing), the first process waits for it forever, on no record, holding the
// plug-in's socket. Ending it ends the sandbox: it is the first process of the sandbox's pid namespace. It is
// pinned only while it is still the child of `outer`, which bxd has not reaped, so the pid names no other process.
UniqueFd pinSandbox(pid_t outer, pid_t first) {
    UniqueFd pinned(pidfdOpen(first));
    if (!pinned || parentOf(first) != outer || pidfdExited(pinned.get())) return UniqueFd();
    return pinned;
}

// Ends what is left of a sandbox whose outer process has ended. A sandbox that bubblewrap released ends with its
// outer process by itself (this only makes sure); one it never released is ended here.
void endSandbox(const UniqueFd& first, const std::string& identifier, pid_t pid) {
    if (!first || pidfdExited(first.get())) return;
    log::ops().notice("ending what is left of the sandbox of instance %d (plug-in %s)", static_cast<int>(pid),
                      identifier.c_str());
    if (pidfdSendSignal(first.get(), SIGKILL) != 0 && errno != ESRCH)
        log::ops().error("cannot end the sandbox of instance %d (plug-in %s): %s", static_cast<int>(pid),
                         identifier.c_str(), strerror(errno));
}

std::string exitText(int status) {
    if (WIFEXITED(status)) return "exit status " + std::to_string(WEXITSTATUS(status));
    if (WIFSIGNALED(status)) return std::string("signal ") + strsignal(WTERMSIG(status));
    return "status " + std::to_string(status);
}

// How long the reaper waits before it looks again at an instance that has ended but that bxd may not reap yet.
constexpr auto kReapRetry = std::chrono::milliseconds(100);

// One launched instance until bxd has reaped it: its pidfd watched on the event loop, and what goes with the
// instance (its record, the status pipe, the sandbox's first process). The status pipe stays open until the end:
// bubblewrap reports the plug-in's exit on it last, and a closed pipe would kill it with SIGPIPE instead.
//
// A readable pidfd is only a reason to look. The event loop can report it readable while the instance still runs
// (seen under heavy client churn), and a process that another process traces has ended before its parent may reap
// it. So waitpid never waits here: bxd has one thread, and every client would wait with it until the plug-in ended.
class InstanceReaper : public std::enable_shared_from_this<InstanceReaper> {
  public:
    InstanceReaper(int pidfd, pid_t pid, fs::path record, std::string identifier, UniqueFd status, UniqueFd sandbox,
                   SerialQueue& queue)
        : queue_(queue),
          watch_(*detail::QueueInternals::state(queue)->core, pidfd),
          again_(*detail::QueueInternals::state(queue)->core),
          pid_(pid),
          record_(std::move(record)),
          identifier_(std::move(identifier)),
          status_(std::move(status)),
          sandbox_(std::move(sandbox)) {}

    void wait() {
        watch_.async_wait(asio::posix::stream_descriptor::wait_read,
                          detail::bindToQueue(queue_, [self = shared_from_this()](const asio::error_code& error) {
                              if (error != asio::error::operation_aborted) self->look();
                          }));
    }

  private:
    void look() {
        int status = 0;
        pid_t reaped;
        do {
            reaped = waitpid(pid_, &status, WNOHANG);
        } while (reaped < 0 && errno == EINTR);
        if (reaped == 0) {
            if (!pidfdExited(watch_.native_handle())) return wait();
            again_.expires_after(kReapRetry);
            again_.async_wait(detail::bindToQueue(queue_, [self = shared_from_this()](const asio::error_code& error) {
                if (!error) self->look();
            }));
            return;
        }
        endSandbox(sandbox_, identifier_, pid_);
        std::error_code ignored;
        fs::remove(record_, ignored);
        log::ops().info("plug-in %s instance %d ended (%s)", identifier_.c_str(), static_cast<int>(pid_),
                        exitText(status).c_str());
        watch_.close(ignored);
    }

    SerialQueue queue_;
    asio::posix::stream_descriptor watch_;
    asio::steady_timer again_;
    const pid_t pid_;
    const fs::path record_;
    const std::string identifier_;
    UniqueFd status_;
    UniqueFd sandbox_;
};

// Reaps the instance `pid` on `queue` once it has ended (see InstanceReaper), without blocking anyone.
void reapWhenDone(pid_t pid, fs::path record, std::string identifier, UniqueFd status, UniqueFd sandbox,
                  SerialQueue& queue) {
    int pidfd = pidfdOpen(pid);
    if (pidfd < 0) {
        log::ops().error("cannot watch plug-in %s instance %d: %s; reaping it now", identifier.c_str(),
                         static_cast<int>(pid), strerror(errno));
        kill(pid, SIGKILL);
        waitpid(pid, nullptr, 0);
        endSandbox(sandbox, identifier, pid);
        std::error_code ignored;
        fs::remove(record, ignored);
        return;
    }
    std::make_shared<InstanceReaper>(pidfd, pid, std::move(record), std::move(identifier), std::move(status),
                                     std::move(sandbox), queue)
        ->wait();
}

}  // namespace

std::string ServiceManager::bubblewrapPath() {
    const char* configured = std::getenv("BX_BWRAP");
    return configured != nullptr && *configured != '\0' ? configured : "/usr/bin/bwrap";
}

Result<ServiceManager::LaunchedService> ServiceManager::startService(const ServiceLaunch& launch,
                                                                     SerialQueue& reaper) const {
    const std::string name = launch.bundleIdentifier;
    const std::string* profileName = launch.serviceDescription.get(kSandboxProfileKey).getString();
    const SandboxProfile* profile = profileName ? SandboxProfiles::named(*profileName) : nullptr;
    if (profile == nullptr)
        return launchError(
            formatPrintf("cannot launch %s: no known sandbox profile in its service description", name.c_str()));
    const std::string bwrap = bubblewrapPath();
    if (access(bwrap.c_str(), X_OK) != 0)
        return launchError(formatPrintf("cannot launch %s: bubblewrap is not available (%s: %s)", name.c_str(),
                                        bwrap.c_str(), strerror(errno)));

    // The plug-in runs as the host's user, so its container (and the TMPDIR inside it) must be that user's. A user
    // who ran the plug-in before owns the container and could have put links in it: prepare follows none.
    if (launch.container) {
        std::optional<DataContainer::Owner> owner;
        if (geteuid() == 0 && launch.uid != 0) owner = DataContainer::Owner{launch.uid, launch.gid};
        if (std::optional<Error> error = DataContainer::prepare(*launch.container, owner))
            return launchError(formatPrintf("cannot launch %s: %s", name.c_str(),
                                            error->localizedDescription().value_or("its data container")));
    }

    SandboxProfiles::Launch sandbox{launch.bundlePath, launch.container, launch.executablePath, {}, kStatusFd};
    for (const auto& [variable, value] : launch.serviceDescription.get(kEnvironmentKey).entries())
        if (const std::string* text = value.getString()) sandbox.environment.emplace_back(variable, *text);
    sandbox.environment.emplace_back(std::string(kPlugInSocketVariable), std::to_string(kPlugInSocketFd));
    std::vector<std::string> arguments = SandboxProfiles::bubblewrapArguments(*profile, sandbox);
    arguments.insert(arguments.begin(), bwrap);
    std::vector<char*> argv;
    for (std::string& argument : arguments) argv.push_back(argument.data());
    argv.push_back(nullptr);
    char path[] = "PATH=/usr/bin:/bin";
    char* envp[] = {path, nullptr};

    int sockets[2];
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, sockets) != 0)
        return launchError(formatPrintf("cannot launch %s: socketpair: %s", name.c_str(), strerror(errno)));
    UniqueFd hostEnd(sockets[0]), plugInEnd(sockets[1]);
    int statusPipe[2];
    if (pipe2(statusPipe, O_CLOEXEC) != 0)
        return launchError(formatPrintf("cannot launch %s: pipe: %s", name.c_str(), strerror(errno)));
    UniqueFd statusRead(statusPipe[0]), statusWrite(statusPipe[1]);
    const uid_t uid = launch.uid;
    const gid_t gid = launch.gid;
    const bool dropToHost = geteuid() == 0 && (uid != 0 || gid != 0);

    pid_t pid = fork();
    if (pid < 0) return launchError(formatPrintf("cannot launch %s: fork: %s", name.c_str(), strerror(errno)));
    if (pid == 0) {
        // Above the numbers they are moved to, so that neither dup2 overwrites the other's source.
        int socketCopy = fcntl(plugInEnd.get(), F_DUPFD_CLOEXEC, 10);
        int statusCopy = fcntl(statusWrite.get(), F_DUPFD_CLOEXEC, 10);
        int devNull = open("/dev/null", O_RDONLY | O_CLOEXEC);
        if (socketCopy < 0 || statusCopy < 0 || devNull < 0 || dup2(devNull, 0) < 0 ||
            dup2(socketCopy, kPlugInSocketFd) < 0 || dup2(statusCopy, kStatusFd) < 0)
            _exit(126);
        syscall(SYS_close_range, kStatusFd + 1, ~0U, 0);
        sigset_t none;
        sigemptyset(&none);
        sigprocmask(SIG_SETMASK, &none, nullptr);
        if (dropToHost &&
            (setgroups(0, nullptr) != 0 || setresgid(gid, gid, gid) != 0 || setresuid(uid, uid, uid) != 0))
            _exit(126);
        execve(argv[0], argv.data(), envp);
        _exit(127);
    }
    plugInEnd.reset();
    statusWrite.reset();

    std::optional<pid_t> first = sandboxStarted(statusRead.get());
    if (!first) {
        kill(pid, SIGKILL);
        int status = 0;
        while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
        }
        return launchError(formatPrintf("cannot launch %s: bubblewrap did not set up its sandbox (%s)", name.c_str(),
                                        exitText(status).c_str()));
    }
    UniqueFd firstProcess = pinSandbox(pid, *first);
    // An instance that termination and the busy check could not see must not run.
    const std::optional<pid_t> sandboxFirst = firstProcess ? std::optional<pid_t>(*first) : std::nullopt;
    if (!instances_.record(launch.bundleIdentifier, pid, sandboxFirst)) {
        kill(pid, SIGKILL);
        while (waitpid(pid, nullptr, 0) < 0 && errno == EINTR) {
        }
        endSandbox(firstProcess, name, pid);
        return launchError(formatPrintf("cannot launch %s: cannot record its instance under %s", name.c_str(),
                                        instances_.directory().c_str()));
    }
    fs::path record = instances_.directory() / launch.bundleIdentifier / std::to_string(pid);
    reapWhenDone(pid, record, name, std::move(statusRead), std::move(firstProcess), reaper);
    log::ops().notice("launched plug-in %s as instance %d (user %u) in the %s sandbox", name.c_str(),
                      static_cast<int>(pid), static_cast<unsigned>(uid), std::string(profile->name).c_str());
    return LaunchedService{pid, std::move(hostEnd)};
}

size_t ServiceManager::endSandboxedInstances(const char* why) const {
    size_t ended = 0;
    for (const InstanceRecords::Sandboxed& left : instances_.sandboxed()) {
        bool signalled = false;
        for (auto [pid, started] :
             {std::pair(left.instance.pid, left.instance.startTime), std::pair(left.sandbox, left.sandboxStartTime)}) {
            // Pinned before it is checked, so that the pid cannot come to name another process in between.
            UniqueFd pinned(pidfdOpen(pid));
            if (pinned && InstanceRecords::startTime(pid) == started && pidfdSendSignal(pinned.get(), SIGKILL) == 0)
                signalled = true;
        }
        if (signalled) {
            log::ops().notice("ending plug-in %s instance %d %s", left.bundleIdentifier.c_str(),
                              static_cast<int>(left.instance.pid), why);
            ++ended;
        }
        std::error_code ignored;
        fs::remove(left.instance.record, ignored);
    }
    return ended;
}

}  // namespace bexil
