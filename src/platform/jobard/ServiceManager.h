#pragma once

// The service manager: remembers which plug-in executables each host process may start and with which activation
// overlay (the grants that enabling a plug-in makes), and ends every running instance of a plug-in that its runtime
// recorded (see InstanceRecords). A grant is tied to the host process through a pidfd, so it ends with that process
// and a later process that is given the same pid never inherits it. Copies share one grant table. Termination
// waits for nothing: pidfd watches and timers on the event loop of the queue the caller names carry it, and the
// completion is delivered on that queue. Thread-safe.

#include <sys/types.h>

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "base/Error.h"
#include "base/SerialQueue.h"
#include "base/UniqueFd.h"
#include "bexil/Value.h"
#include "platform/runtime/InstanceRecords.h"

namespace bexil {

class ServiceManager {
  public:
    // Completion codes besides 0 (something was terminated) and errno values.
    static constexpr int kNothingOnRecord = 3;
    // How long an instance has after SIGTERM before it is killed.
    static constexpr auto kTerminationGrace = std::chrono::seconds(5);

    // Grants kept at most for one host process; past this the oldest grant of that host is dropped (logged), so a
    // host that enables plug-ins in a loop cannot grow the table without bound.
    static constexpr size_t kMaxGrantsPerHost = 1024;

    explicit ServiceManager(InstanceRecords instances = InstanceRecords(InstanceRecords::Kind::Running));

    // add-external-service: allows the live process `hostPid` to start `executablePath` with `overlay`, replacing
    // an earlier grant of the same host and executable. The grant is tied to the process `hostPidfd` pins (the
    // descriptor is shared, never duplicated: a host's grants must not cost a descriptor each), or, without one,
    // to the process that has the pid now. Returns 0, or an errno value (ESRCH when the host has already ended;
    // EINVAL for an empty path).
    int addExternalService(pid_t hostPid, const std::string& executablePath, const Value& overlay,
                           std::shared_ptr<const UniqueFd> hostPidfd = nullptr);
    // The overlay granted to `hostPid` for `executablePath`, as long as the process that received the grant still
    // runs; none otherwise.
    std::optional<Value> grantedOverlay(pid_t hostPid, const std::string& executablePath) const;
    // Grants of processes that still run (grants of ended hosts are dropped on the way).
    size_t grantCount() const;

    // remove-external-service: terminates the running instances of `bundleIdentifier` and calls `completion` on
    // `queue` with 0 when one or more were terminated, kNothingOnRecord when none was running, or an errno value.
    // Instances are recorded per bundle identifier, so `version` only names the registration in logs.
    void removeExternalService(const std::string& bundleIdentifier, const std::string& version, SerialQueue queue,
                               std::function<void(int error)> completion) const;

    // The longest bubblewrap may take to set up a sandbox before the launch counts as failed.
    static constexpr auto kSandboxSetupTimeout = std::chrono::seconds(10);
    // The descriptor number of the plug-in's end of its socket to the host, and the variable that names it.
    static constexpr int kPlugInSocketFd = 3;
    static constexpr std::string_view kPlugInSocketVariable = "BEXIL_PLUGIN_FD";

    // $BX_BWRAP, else /usr/bin/bwrap.
    static std::string bubblewrapPath();

    struct ServiceLaunch {
        std::string bundleIdentifier;  // names the instance record
        std::string bundlePath;
        std::string executablePath;
        std::optional<std::string> container;
        Value serviceDescription;  // the "ZEMService" of a granted overlay: environment and sandbox profile
        uid_t uid;                 // the host's user and group, which the plug-in runs as
        gid_t gid;
    };
    struct LaunchedService {
        pid_t pid;         // the recorded instance (the sandbox's outer process)
        UniqueFd hostEnd;  // the host's end of the socket whose other end the plug-in has as kPlugInSocketFd
    };
    // Starts the plug-in's executable under bubblewrap with the sandbox profile and environment of its service
    // description, records the instance, and reaps it on `reaper` when it ends (removing the record). Fails with
    // code 4 and a message saying why, never starting the plug-in without its sandbox. Blocks the caller until
    // the sandbox is set up (at most kSandboxSetupTimeout).
    Result<LaunchedService> startService(const ServiceLaunch& launch, SerialQueue& reaper) const;

    // Ends every instance that bxd started in a sandbox and that is still on record, with its sandbox, and removes
    // the records; `why` ends the log line of each ("as bxd stops", "left running by an earlier bxd"). bxd calls it
    // when it stops, and when it starts for what a killed bxd could not end: a sandbox that bubblewrap had named
    // but not yet released when its outer process died waits forever otherwise. Returns how many it ended.
    size_t endSandboxedInstances(const char* why) const;

    const InstanceRecords& instances() const { return instances_; }

  private:
    struct Grants;

    InstanceRecords instances_;
    std::shared_ptr<Grants> grants_;
};

}  // namespace bexil
