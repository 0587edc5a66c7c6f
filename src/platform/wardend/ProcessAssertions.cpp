#include "platform/wardend/ProcessAssertions.h"

namespace bexil {

ProcessAssertions::ProcessAssertions(InstanceRecords assertions) : assertions_(std::move(assertions)) {}

std::vector<Value> ProcessAssertions::busyExtensionInstances(const std::set<std::string>& bundleIdentifiers) const {
    std::vector<Value> busy;
    for (const std::string& identifier : bundleIdentifiers) {
        for (const InstanceRecords::Instance& instance : assertions_.live(identifier)) {
            busy.push_back(Value::dictionary(
                {{kBundleIdentifierKey, Value::string(identifier)}, {"pid", Value::int64(instance.pid)}}));
        }
    }
    return busy;
}

}  // namespace bexil
