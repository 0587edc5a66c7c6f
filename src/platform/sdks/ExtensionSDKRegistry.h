#pragma once

// ExtensionSDKRegistry is the extension-SDK registry as the plug-in model sees it: for the name of an extension
// point, the SDK dictionary registered for it (the defaults every plug-in of that point starts from), or nothing.
// SDKDirectoryRegistry is the implementation over directories of SDK documents; tests substitute their own through
// setShared. Implementations may be called from any thread.

#include <memory>
#include <optional>
#include <string_view>

#include "bexil/Value.h"

namespace bexil {

class ExtensionSDKRegistry {
  public:
    virtual ~ExtensionSDKRegistry() = default;

    // The SDK entry registered under `name`, or nothing when none is (or the one there cannot be used; an
    // implementation logs why). The entry is always a dictionary.
    virtual std::optional<Value> copySDKEntry(std::string_view name) const = 0;

    // The registry the process uses: an SDKDirectoryRegistry over its default directories unless replaced.
    static std::shared_ptr<const ExtensionSDKRegistry> shared();
    // Replaces the registry the process uses (an empty pointer brings the default back) and returns the one it
    // replaced. Meant for tests and tools that must look elsewhere; callers already holding the old one keep it.
    static std::shared_ptr<const ExtensionSDKRegistry> setShared(std::shared_ptr<const ExtensionSDKRegistry> registry);
};

}  // namespace bexil
