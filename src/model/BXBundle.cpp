#include "model/BXBundle.h"

#include <utility>

#include "base/Text.h"
#include "platform/bundles/DirectoryBundle.h"
#include "platform/log/Log.h"

namespace bexil {

namespace {

// The path of a local file URL; anything else is taken as a path already, which is what callers of this model pass
// nearly always.
std::string pathOfURL(std::string_view url) { return pathOfFileURL(url).value_or(std::string(url)); }

}  // namespace

BXBundle::BXBundle(std::shared_ptr<const PlatformBundle> bundle) : bundle_(std::move(bundle)) {}

std::shared_ptr<BXBundle> BXBundle::initWithZEMBundle(std::shared_ptr<const PlatformBundle> bundle) {
    if (!bundle) return nullptr;
    return std::make_shared<BXBundle>(std::move(bundle));
}

std::shared_ptr<BXBundle> BXBundle::initForMainBundle() { return initWithZEMBundle(DirectoryBundle::createMain()); }

std::shared_ptr<BXBundle> BXBundle::initWithPath(std::string_view path) {
    return initWithZEMBundle(DirectoryBundle::create(std::string(path), BundleLookup::Directory));
}

std::shared_ptr<BXBundle> BXBundle::initWithURL(std::string_view url) { return initWithPath(pathOfURL(url)); }

std::shared_ptr<BXBundle> BXBundle::initWithExecutablePath(std::string_view path) {
    std::shared_ptr<const PlatformBundle> found =
        DirectoryBundle::create(std::string(path), BundleLookup::ContainingExecutable);
    // Nothing above the path names it as an executable: perhaps the caller handed us the bundle itself.
    if (!found->stringProperty(BundleStringProperty::BundlePath))
        found = DirectoryBundle::create(std::string(path), BundleLookup::Directory);
    return initWithZEMBundle(std::move(found));
}

std::shared_ptr<BXBundle> BXBundle::initWithExecutableURL(std::string_view url) {
    return initWithExecutablePath(pathOfURL(url));
}

std::optional<std::string> BXBundle::stringProperty(BundleStringProperty property) const {
    return bundle_->stringProperty(property);
}

std::optional<Value> BXBundle::infoDictionary() const {
    std::optional<Value> info = bundle_->infoDictionary();
    if (!info) {
        log::ops().info("failed to retrieve Info.vrec for %@ through %@", path(), bundle_);
        return std::nullopt;
    }
    if (!info->isDictionary()) {
        log::ops().info("failed to convert Info.vrec to dictionary: %@ source=%@", path(), bundle_);
        return std::nullopt;
    }
    return info;
}

std::optional<std::string> BXBundle::bundleIdentifier() const {
    std::optional<Value> info = bundle_->infoDictionary();
    if (!info) return std::nullopt;
    const Value* identifier = info->find("BDBundleIdentifier");
    if (identifier == nullptr || !identifier->isString()) return std::nullopt;
    return *identifier->getString();
}

std::optional<std::string> BXBundle::path() const { return stringProperty(BundleStringProperty::BundlePath); }

std::optional<std::string> BXBundle::url() const { return path(); }

std::optional<std::string> BXBundle::supportPath() const {
    std::shared_ptr<const CachedPath> cached = supportPath_.load(std::memory_order_acquire);
    if (!cached) {
        cached = std::make_shared<const CachedPath>(stringProperty(BundleStringProperty::SupportPath));
        supportPath_.store(cached, std::memory_order_release);
    }
    return *cached;
}

std::optional<std::string> BXBundle::bundleDirectory(std::string_view name) const {
    std::optional<std::string> support = supportPath();
    if (!support) return std::nullopt;
    if (support->empty() || support->back() != '/') support->push_back('/');
    support->append(name);
    return support;
}

std::optional<std::string> BXBundle::executablePath() const {
    if (std::optional<std::string> executable = stringProperty(BundleStringProperty::ExecutablePath)) return executable;
    return path();
}

std::optional<std::string> BXBundle::plugInsPath() const { return bundleDirectory("PlugIns"); }

std::string BXBundle::description() const { return "<BXBundle " + bundle_->description() + ">"; }

}  // namespace bexil
