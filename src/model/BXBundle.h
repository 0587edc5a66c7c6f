#pragma once

// BXBundle answers the standard facts of one bundle (its path, executable, identifier, information dictionary and
// plug-in directory) over the platform bundle service. It wraps one platform bundle for its whole life and is
// shared freely: every query may be made from any thread or queue.
//
// URLs are file-system paths here, as everywhere in the model: `url()` is the bundle's path, and the ...URL
// constructors take a path (a "file://" URL is accepted too and turned into its path).

#include <atomic>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "bexil/Value.h"
#include "platform/bundles/PlatformBundle.h"

namespace bexil {

class BXBundle {
  public:
    // The constructors never fail on a path that does not name a bundle: the bundle they return answers nothing.
    // Only initWithZEMBundle given no platform bundle returns an empty pointer.

    // The running program's own bundle: the one that names /proc/self/exe as its executable.
    static std::shared_ptr<BXBundle> initForMainBundle();
    // The bundle whose root directory is the URL's path (see initWithPath).
    static std::shared_ptr<BXBundle> initWithURL(std::string_view url);
    // The bundle whose root directory is `path`.
    static std::shared_ptr<BXBundle> initWithPath(std::string_view path);
    // The bundle that contains the executable at the URL's path (see initWithExecutablePath).
    static std::shared_ptr<BXBundle> initWithExecutableURL(std::string_view url);
    // The nearest bundle above the executable at `path` that names it as its executable; when none does, the
    // bundle whose root directory is `path` itself (so a bundle directory gives that bundle).
    static std::shared_ptr<BXBundle> initWithExecutablePath(std::string_view path);
    // Wraps a bundle of the platform bundle service. Every other constructor ends here. (The IPC layer's own
    // bundle object does not exist on this platform: the platform bundle is the bundle service's object.)
    static std::shared_ptr<BXBundle> initWithZEMBundle(std::shared_ptr<const PlatformBundle> bundle);

    // The service's string property, or none when it has none.
    std::optional<std::string> stringProperty(BundleStringProperty property) const;
    // The information dictionary, or none when the bundle has none or its document is not a dictionary (both are
    // logged at info level).
    std::optional<Value> infoDictionary() const;
    // The information dictionary's "BDBundleIdentifier" string, or none. Never logs.
    std::optional<std::string> bundleIdentifier() const;
    // The bundle's file URL, as its path (equal to path()).
    std::optional<std::string> url() const;
    // The bundle's root directory.
    std::optional<std::string> path() const;
    // The directory that holds the bundle's standard subdirectories; asked of the service once, then kept.
    std::optional<std::string> supportPath() const;
    // supportPath() with `name` appended as one path component.
    std::optional<std::string> bundleDirectory(std::string_view name) const;
    // The executable, or the bundle's path when the bundle has no executable.
    std::optional<std::string> executablePath() const;
    // bundleDirectory("PlugIns").
    std::optional<std::string> plugInsPath() const;

    // The platform bundle this object wraps; it is never replaced.
    const std::shared_ptr<const PlatformBundle>& bundle() const { return bundle_; }

    std::string description() const;

    // Use the init... factories; the constructor is public only for make_shared.
    explicit BXBundle(std::shared_ptr<const PlatformBundle> bundle);

  private:
    using CachedPath = std::optional<std::string>;

    const std::shared_ptr<const PlatformBundle> bundle_;
    // Filled on first use. Two first uses at once may both ask the service; both store the same answer.
    mutable std::atomic<std::shared_ptr<const CachedPath>> supportPath_;
};

}  // namespace bexil
