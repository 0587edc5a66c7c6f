// Plug-in records the record tests share: an ordinary current-style application extension as a builder sets it up,
// and a record that has only a plug-in dictionary.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "TestSupport.h"
#include "model/BXPlugInCore.h"
#include "platform/log/CaptureSink.h"

namespace bexil::test {

inline const char* const kSharePath = "/Applications/Mail.app/PlugIns/Share.wexa";
inline const char* const kToolPath = "/System/Library/Bexil/Indexer.bundle";

// The information dictionary of the share extension, with `extraPlugIn` added to its plug-in dictionary.
inline Value shareInfo(Entries extraPlugIn = {}) {
    Entries plugIn = {
        {"RZExtensionPointIdentifier", str("com.quorvel.share-services")},
        {"RZExtensionProtocol", str("ShareProtocol")},
        {"PrincipalClass", str("RZObject")},
        {"RZExtensionAttributes", dict({{"RZExtensionVersion", str("2.4")},
                                        {"RZExtensionActivationRule",
                                         dict({{"image/png", Value::int64(4)}, {"text/plain", Value::int64(1)}})}})},
    };
    for (auto& e : extraPlugIn) plugIn.push_back(std::move(e));
    return dict({
        {"BDBundleIdentifier", str("com.example.mail.share")},
        {"BDBundleShortVersionString", str("2.4.1")},
        {"BDBundleInfoVrecURL", str("file:///Applications/Mail.app/PlugIns/Share.wexa/Info.vrec")},
        {"RZExtension", dict(std::move(plugIn))},
    });
}

inline std::shared_ptr<BXPlugInCore> makeRecord(const char* path, Value info, std::optional<Uuid> uuid = std::nullopt) {
    return BXPlugInCore::initWithNameUrlBundleInfoInfoUuid("com.example.mail.share", std::string(path), info,
                                                           std::nullopt, uuid);
}

// A record whose plug-in dictionary is a dictionary of the given entries (no information dictionary).
inline std::shared_ptr<BXPlugInCore> recordWithPlugIn(const char* path, Entries plugIn) {
    return BXPlugInCore::initWithNameUrlBundleInfoInfoUuid("com.example.tool", std::string(path), std::nullopt,
                                                           dict(std::move(plugIn)), std::nullopt);
}

// A copy of `dictionary` with `key` set to `value`, or removed when `value` is nothing.
inline Value changed(const Value& dictionary, std::string_view key, std::optional<Value> value) {
    MutableDictionary copy(dictionary);
    if (value)
        copy.set(key, *value);
    else
        copy.remove(key);
    return copy.take();
}

}  // namespace bexil::test
