#include "platform/sdks/ExtensionSDKRegistry.h"

#include <mutex>

#include "platform/sdks/SDKDirectoryRegistry.h"

namespace bexil {

namespace {

// The process's registry. Readers take a reference under the lock and use it outside, so a replacement never
// pulls a registry away from a look-up in progress.
std::mutex sharedMutex;
std::shared_ptr<const ExtensionSDKRegistry> sharedRegistry;

}  // namespace

std::shared_ptr<const ExtensionSDKRegistry> ExtensionSDKRegistry::shared() {
    std::lock_guard guard(sharedMutex);
    if (!sharedRegistry) sharedRegistry = std::make_shared<SDKDirectoryRegistry>();
    return sharedRegistry;
}

std::shared_ptr<const ExtensionSDKRegistry> ExtensionSDKRegistry::setShared(
    std::shared_ptr<const ExtensionSDKRegistry> registry) {
    std::lock_guard guard(sharedMutex);
    std::swap(sharedRegistry, registry);
    return registry;
}

}  // namespace bexil
