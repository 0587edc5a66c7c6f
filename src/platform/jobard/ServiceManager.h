#pragma once

// The service manager's side of plug-in termination: ends every running instance of a plug-in that its runtime
// recorded (see InstanceRecords). The waiting happens on a thread of its own, never on the caller's queue; the
// completion is delivered on the queue the caller names. Thread-safe.

#include <functional>
#include <string>

#include "base/SerialQueue.h"
#include "platform/runtime/InstanceRecords.h"

namespace bexil {

class ServiceManager {
  public:
    // Completion codes besides 0 (something was terminated) and errno values.
    static constexpr int kNothingOnRecord = 3;
    // How long an instance has after SIGTERM before it is killed.
    static constexpr auto kTerminationGrace = std::chrono::seconds(5);

    explicit ServiceManager(InstanceRecords instances = InstanceRecords(InstanceRecords::Kind::Running));

    // remove-external-service: terminates the running instances of `bundleIdentifier` and calls `completion` on
    // `queue` with 0 when one or more were terminated, kNothingOnRecord when none was running, or an errno value.
    // Instances are recorded per bundle identifier, so `version` only names the registration in logs.
    void removeExternalService(const std::string& bundleIdentifier, const std::string& version, SerialQueue queue,
                               std::function<void(int error)> completion) const;

  private:
    InstanceRecords instances_;
};

}  // namespace bexil
