#pragma once

// LXApplicationProxy is the registry's record of one application: the bundle that contains plug-ins under its
// "PlugIns" directory. It is an immutable snapshot shared through std::shared_ptr; any thread may read it. Its
// plug-in list is read from the registry on first use and then kept.

#include <atomic>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "bexil/Value.h"

namespace bexil {

class LXBexilProxy;

class LXApplicationProxy {
  public:
    using PlugInList = std::vector<std::shared_ptr<const LXBexilProxy>>;
    // Reads the application's plug-ins when the list is first asked for.
    using PlugInLoader = std::function<PlugInList()>;

    struct Fields {
        // The application bundle's path (URLs are file-system paths throughout).
        std::string bundleURL;
        std::optional<std::string> bundleIdentifier;
        std::optional<std::string> localizedName;
        // The application bundle has no readable information document yet: it is not fully installed.
        bool isPlaceholder = false;
    };

    // A record with a fixed plug-in list, or one read by `loader` on first use (none: the list is empty).
    LXApplicationProxy(Fields fields, PlugInLoader loader);
    LXApplicationProxy(Fields fields, PlugInList plugIns);
    LXApplicationProxy(const LXApplicationProxy&) = delete;
    LXApplicationProxy& operator=(const LXApplicationProxy&) = delete;

    const std::string& bundleURL() const { return *bundleURL_.getString(); }
    // The same path as a string Value, which the daemon's records share instead of copying.
    const Value& bundleURLValue() const { return bundleURL_; }
    const std::optional<std::string>& bundleIdentifier() const { return fields_.bundleIdentifier; }
    const std::optional<std::string>& localizedName() const { return fields_.localizedName; }
    bool isPlaceholder() const { return fields_.isPlaceholder; }

    // The application's plug-ins in the order of their paths.
    const PlugInList& plugIns() const;
    // True once plugIns() was first asked for the list, from before it is read (a record made with a fixed list has
    // it from the start).
    bool plugInsRead() const { return plugInsRead_.load(std::memory_order_acquire); }

    // "<application com.example.greeter /path/Greeter.app>" for log lines.
    std::string description() const;

  private:
    // The path lives in bundleURL_ alone (the one in fields_ is left empty).
    const Value bundleURL_;
    const Fields fields_;
    mutable std::once_flag loaded_;
    mutable PlugInLoader loader_;
    mutable PlugInList plugIns_;
    mutable std::atomic<bool> plugInsRead_{false};
};

}  // namespace bexil
