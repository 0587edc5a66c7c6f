#include "model/BXBundle.h"

#include <utility>

#include "platform/bundles/DirectoryBundle.h"
#include "platform/log/Log.h"

namespace bexil {

namespace {

int hexDigit(char c) {
    if (c >= '0' && c <= '9') return c - '0';
    if (c >= 'a' && c <= 'f') return c - 'a' + 10;
    if (c >= 'A' && c <= 'F') return c - 'A' + 10;
    return -1;
}

// The path of a local file URL ("file:///a%20b" -> "/a b", "file://localhost/x" -> "/x"). Anything else is taken
// as a path already, which is what callers of this model pass nearly always.
std::string pathOfURL(std::string_view url) {
    constexpr std::string_view kScheme = "file://";
    if (url.substr(0, kScheme.size()) != kScheme) return std::string(url);
    std::string_view rest = url.substr(kScheme.size());
    if (rest.substr(0, 9) == "localhost") rest.remove_prefix(9);
    if (rest.empty() || rest.front() != '/') return std::string(url);
    std::string path;
    path.reserve(rest.size());
    for (size_t i = 0; i < rest.size(); ++i) {
        int high = -1, low = -1;
        if (rest[i] == '%' && i + 2 < rest.size() && (high = hexDigit(rest[i + 1])) >= 0 &&
            (low = hexDigit(rest[i + 2])) >= 0) {
            path.push_back(static_cast<char>(high * 16 + low));
            i += 2;
        } else {
            path.push_back(rest[i]);
        }
    }
    return path;
}

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
