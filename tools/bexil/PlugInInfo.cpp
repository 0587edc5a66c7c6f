#include "PlugInInfo.h"

#include "model/BXBundle.h"
#include "platform/sdks/SDKDirectoryRegistry.h"

namespace bexil::tool {

namespace fs = std::filesystem;

namespace {

Error infoError(const std::string& message) { return BXError(ErrorCode::OperationFailed, message); }

std::optional<std::string> stringEntry(const Value& dictionary, std::string_view key) {
    const Value* v = dictionary.find(key);
    if (v == nullptr || !v->isString()) return std::nullopt;
    return std::string(v->stringView());
}

}  // namespace

Result<std::shared_ptr<BXPlugInCore>> resolvedPlugInAtPath(const fs::path& path) {
    std::error_code ec;
    fs::path real = fs::canonical(path, ec);
    if (ec || !fs::is_directory(real)) return infoError(path.string() + " is not a bundle directory");
    std::optional<Value> info = BXBundle::initWithPath(real.string())->infoDictionary();
    if (!info) return infoError(real.string() + " has no Info.vrec dictionary");
    const Value* plugIn = info->find("RZExtension");
    if (plugIn == nullptr || !plugIn->isDictionary())
        return infoError(real.string() + " is not a plug-in: its Info.vrec has no RZExtension dictionary");
    // The identifier the registry gives a plug-in: its own, else its bundle's.
    std::optional<std::string> identifier = stringEntry(*plugIn, "RZExtensionIdentifier");
    if (!identifier) identifier = stringEntry(*info, "BDBundleIdentifier");
    if (!identifier)
        return infoError(real.string() + " has no identifier (no RZExtensionIdentifier, nor even BDBundleIdentifier)");
    auto record =
        BXPlugInCore::initWithNameUrlBundleInfoInfoUuid(identifier, real.string(), *info, std::nullopt, std::nullopt);
    if (!record) return infoError(real.string() + " cannot be read as a plug-in");
    record->resolveSDK();
    return record;
}

std::vector<std::string> keysAddedBySDK(const Value& ownPlugIn, const Value& resolvedPlugIn, const Value& sdk) {
    constexpr std::string_view kAttributes = "RZExtensionAttributes";
    std::vector<std::string> added;
    for (const DictionaryEntry& entry : resolvedPlugIn.entries())
        if (!ownPlugIn.contains(entry.key)) added.push_back(entry.key);
    const Value ownAttributes = ownPlugIn.get(kAttributes);
    const Value sdkAttributes = sdk.get("RZExtension").get(kAttributes);
    for (const DictionaryEntry& entry : resolvedPlugIn.get(kAttributes).entries())
        if (!ownAttributes.contains(entry.key) && sdkAttributes.contains(entry.key))
            added.push_back(std::string(kAttributes) + "." + entry.key);
    // The attributes dictionary itself counts as added only when the SDK supplied it.
    if (!sdk.get("RZExtension").contains(kAttributes)) std::erase(added, std::string(kAttributes));
    return added;
}

Result<std::optional<SDKDocument>> findSDK(std::string_view point) {
    SDKDirectoryRegistry registry;
    fs::path at;
    Result<std::optional<Value>> entry = registry.readSDKEntry(point, &at);
    if (!entry) return entry.error();
    if (!*entry) return std::optional<SDKDocument>();
    return std::optional<SDKDocument>(SDKDocument{**entry, at});
}

std::string sdkDirectoriesText() {
    std::string text;
    for (const fs::path& directory : SDKDirectoryRegistry::defaultDirectories())
        text += (text.empty() ? "" : ", ") + directory.string();
    return text;
}

}  // namespace bexil::tool
