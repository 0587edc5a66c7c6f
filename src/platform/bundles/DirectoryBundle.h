#pragma once

// DirectoryBundle is the bundle service on the file system: a bundle is a directory with its information document
// "Info.vrec" at its root. The document's "BDBundleExecutable" names the executable by a path relative to the root;
// the root is also the support directory, so the plug-in directory of a bundle is "<root>/PlugIns". A bundle is
// read once when it is made and never changes afterwards, so any thread may use and share it.
//
// A path that names no bundle still gives an object; it answers nothing to every query and its description says
// why. The bundle layout is documented for plug-in authors in docs/bundles.md.

#include <cstdint>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "bexil/Value.h"
#include "platform/bundles/PlatformBundle.h"

namespace bexil {

// How a path leads to a bundle.
enum class BundleLookup : int {
    // The path is the bundle directory itself.
    Directory = 1,
    // The path is an executable; the bundle is the nearest directory above it whose information document names
    // that executable under "BDBundleExecutable".
    ContainingExecutable = 2,
};

class DirectoryBundle final : public PlatformBundle {
  public:
    static constexpr std::string_view kInfoFileName = "Info.vrec";
    static constexpr std::string_view kExecutableKey = "BDBundleExecutable";
    // Information documents are small; a larger file at the root of some directory is refused instead of read,
    // because walking up from an executable reads the documents of directories nobody vouched for.
    static constexpr std::uintmax_t kMaxInfoBytes = 1u << 20;

    static std::shared_ptr<const DirectoryBundle> create(const std::filesystem::path& path, BundleLookup lookup);
    // The bundle that contains the running program's executable (/proc/self/exe), found by ContainingExecutable.
    static std::shared_ptr<const DirectoryBundle> createMain();

    std::optional<std::string> stringProperty(BundleStringProperty property) const override;
    std::optional<Value> infoDictionary() const override;
    std::string description() const override;

    // Why the bundle answers nothing or has no information document; empty when nothing went wrong.
    const std::string& problem() const { return problem_; }

    // Use create(): the constructor is public only for make_shared.
    struct Parts {
        std::string requestedPath;
        std::optional<std::string> root;
        std::optional<Value> info;
        std::optional<std::string> executable;
        std::string problem;
    };
    explicit DirectoryBundle(Parts parts);

  private:
    std::string requestedPath_;
    std::optional<std::string> root_;
    std::optional<Value> info_;
    std::optional<std::string> executable_;
    std::string problem_;
};

}  // namespace bexil
