#pragma once

// PlatformBundle is the platform bundle service as the plug-in model sees it: one bundle, found from a directory
// or from an executable inside it, answering its standard paths and its information dictionary. DirectoryBundle is
// the implementation over the file system; tests substitute their own. Implementations are immutable once made, so
// any thread may query them and share them.

#include <optional>
#include <string>

#include "bexil/Value.h"

namespace bexil {

// The string properties of a bundle, by their service codes.
enum class BundleStringProperty : int {
    // The bundle's root directory.
    BundlePath = 2,
    // The bundle's executable, when it names one that exists.
    ExecutablePath = 3,
    // The directory that holds the bundle's standard subdirectories ("PlugIns").
    SupportPath = 9,
};

class PlatformBundle {
  public:
    virtual ~PlatformBundle() = default;

    // The property as an absolute path, or none when the bundle has no such property (or is no bundle at all).
    virtual std::optional<std::string> stringProperty(BundleStringProperty property) const = 0;

    // The root value of the bundle's information document as the service read it, or none when the bundle has none
    // or it could not be read. The root is normally a dictionary but the service does not insist: turning it into
    // a dictionary is the caller's business.
    virtual std::optional<Value> infoDictionary() const = 0;

    // A one-line rendering for log lines: what the bundle is and, when it answers nothing, why.
    virtual std::string description() const = 0;
};

}  // namespace bexil
