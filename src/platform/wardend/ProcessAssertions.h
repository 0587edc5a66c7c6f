#pragma once

// The process-assertion service: which running extension instances are busy. A plug-in runtime records a busy
// instance under `<runtime dir>/assertions/<bundle identifier>/<pid>` (see InstanceRecords) while it holds an
// assertion; a record counts only while its process is alive. Stateless; any thread.

#include <set>
#include <string>
#include <vector>

#include "bexil/Value.h"
#include "platform/runtime/InstanceRecords.h"

namespace bexil {

class ProcessAssertions {
  public:
    // The property key under which an instance description carries its bundle identifier.
    static constexpr const char* kBundleIdentifierKey = "ExtensionBundleIdentifier";

    explicit ProcessAssertions(InstanceRecords assertions = InstanceRecords(InstanceRecords::Kind::Assertion));

    // Descriptions of the busy instances of the given bundles: dictionaries with kBundleIdentifierKey and "pid".
    std::vector<Value> busyExtensionInstances(const std::set<std::string>& bundleIdentifiers) const;

  private:
    InstanceRecords assertions_;
};

}  // namespace bexil
