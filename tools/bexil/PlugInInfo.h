#pragma once

// What `bexil info` and `bexil sdk show` read from disk, without the daemon: a plug-in bundle's record as a client
// builds it (its information dictionary with its extension point's SDK merged under it), and an SDK document with
// where it was found. Stateless; any thread.

#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/Error.h"
#include "bexil/Value.h"
#include "model/BXPlugInCore.h"

namespace bexil::tool {

// The record of the plug-in bundle at `path`, set up from its Info.vrec and resolved against its SDK. An error
// names the path when it is no bundle, has no information dictionary, no identifier or no RZExtension dictionary.
Result<std::shared_ptr<BXPlugInCore>> resolvedPlugInAtPath(const std::filesystem::path& path);

// The keys the SDK gave a resolved plug-in dictionary that its bundle's own lacked: top-level keys as they are,
// attribute keys as "RZExtensionAttributes.KEY", in key order. RZExtensionVersion filled in by canonicalization is
// not the SDK's and is left out unless the SDK's own attributes hold it.
std::vector<std::string> keysAddedBySDK(const Value& ownPlugIn, const Value& resolvedPlugIn, const Value& sdk);

struct SDKDocument {
    Value dictionary;
    std::filesystem::path path;
};
// The SDK document of `point` in the directories bexil's SDK registry searches: nothing when none holds one, an
// error when the name is refused or the document that would be used cannot be.
Result<std::optional<SDKDocument>> findSDK(std::string_view point);
// The directories searched, in precedence order, for messages.
std::string sdkDirectoriesText();

}  // namespace bexil::tool
