#pragma once

// LXBexilProxy is the registry's record of one registered plug-in: where its bundle is, its identifiers, UUID and
// registration date, its information dictionary and entitlements as read at registration, its containing
// application, system-volume residence, data container and display names. It is an immutable snapshot shared
// through std::shared_ptr; any thread may read it. A record read from the store decodes its dictionaries on first
// use, so look-ups and discovery pay only for what they read.
//
// Tests of the layers above build records directly from Fields; the registry builds them from its rows.

#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "bexil/Value.h"

namespace bexil {

class LXApplicationProxy;

// Where objectForInfoDictionaryKeyOfClassInScope looks.
enum class LXInfoScope : int {
    // The attributes dictionary ("RZExtensionAttributes" of the plug-in dictionary); the plug-in dictionary's
    // "RZExtensionPointIdentifier" counts among the attributes when they do not name one themselves.
    Attributes = 0,
    // The plug-in dictionary ("RZExtension" of the information dictionary).
    PlugIn = 1,
    // The whole information dictionary.
    Info = 2,
};

class LXBexilProxy {
  public:
    struct Fields {
        // The plug-in bundle's path; URLs are file-system paths throughout.
        std::optional<std::string> bundleURL;
        std::optional<std::string> pluginIdentifier;
        std::optional<std::string> originalIdentifier;
        std::optional<std::string> bundleIdentifier;
        std::optional<std::string> bundleVersion;
        std::optional<Uuid> pluginUUID;
        std::optional<Date> registrationDate;
        bool isOnSystemPartition = false;
        std::shared_ptr<const LXApplicationProxy> containingBundle;
        std::optional<std::string> dataContainerURL;
        std::optional<std::string> localizedName;
        std::optional<std::string> localizedShortName;
        // The dictionaries, either as values or as their document text (decoded on first use; text that does not
        // decode, or whose root is not a dictionary, reads as absent). A value wins over text.
        std::optional<Value> infoVrec;
        std::optional<Value> entitlements;
        std::string infoVrecDocument;
        std::string entitlementsDocument;
    };

    explicit LXBexilProxy(Fields fields);
    LXBexilProxy(const LXBexilProxy&) = delete;
    LXBexilProxy& operator=(const LXBexilProxy&) = delete;

    // The texts are kept as string Values (null when absent), which the daemon's records share instead of copying;
    // the accessors below hand out copies, the *Value accessors the shared Values themselves.
    std::optional<std::string> bundleURL() const { return text(bundleURL_); }
    // The plug-in's identifier: the plug-in dictionary's "RZExtensionIdentifier", else "BDBundleIdentifier".
    std::optional<std::string> pluginIdentifier() const { return text(pluginIdentifier_); }
    // The identifier the bundle was shipped under ("BDBundleIdentifier").
    std::optional<std::string> originalIdentifier() const { return text(originalIdentifier_); }
    std::optional<std::string> bundleIdentifier() const { return text(bundleIdentifier_); }
    // "BDBundleVersion" of the information dictionary.
    std::optional<std::string> bundleVersion() const { return text(bundleVersion_); }
    const std::optional<Uuid>& pluginUUID() const { return pluginUUID_; }
    const std::optional<Date>& registrationDate() const { return registrationDate_; }
    bool isOnSystemPartition() const { return isOnSystemPartition_; }
    // The application that contains the plug-in; none outside applications.
    const std::shared_ptr<const LXApplicationProxy>& containingBundle() const { return containingBundle_; }
    // The plug-in's data container directory; none for data plug-ins.
    std::optional<std::string> dataContainerURL() const { return text(dataContainerURL_); }
    std::optional<std::string> localizedName() const { return text(localizedName_); }
    std::optional<std::string> localizedShortName() const { return text(localizedShortName_); }

    const Value& bundleURLValue() const { return bundleURL_; }
    const Value& pluginIdentifierValue() const { return pluginIdentifier_; }
    const Value& originalIdentifierValue() const { return originalIdentifier_; }
    const Value& localizedNameValue() const { return localizedName_; }
    const Value& localizedShortNameValue() const { return localizedShortName_; }

    // The whole information dictionary (Info.vrec), or none.
    const std::optional<Value>& infoVrec() const;
    // The plug-in dictionary: "RZExtension" of the information dictionary, else the old-style "Bexil" entry, when
    // it is a dictionary.
    std::optional<Value> bexilDictionary() const;
    // The entitlements dictionary (Entitlements.vrec), or none.
    const std::optional<Value>& entitlements() const;

    // The value of `key` in the dictionary that `scope` selects, or none. With `ofClass` set, a value of another
    // kind reads as none.
    std::optional<Value> objectForInfoDictionaryKeyOfClassInScope(std::string_view key,
                                                                  std::optional<ValueKind> ofClass,
                                                                  LXInfoScope scope) const;

    // "<plug-in com.example.hello 0A1B... /path/Hello.bxplugin>" for log lines.
    std::string description() const;

  private:
    static std::optional<std::string> text(const Value& value) {
        if (!value.isString()) return std::nullopt;
        return std::string(value.stringView());
    }

    Value bundleURL_;
    Value pluginIdentifier_;
    Value originalIdentifier_;
    Value bundleIdentifier_;
    Value bundleVersion_;
    Value dataContainerURL_;
    Value localizedName_;
    Value localizedShortName_;
    std::shared_ptr<const LXApplicationProxy> containingBundle_;
    std::optional<Date> registrationDate_;
    std::optional<Uuid> pluginUUID_;
    bool isOnSystemPartition_ = false;
    mutable std::once_flag infoDecoded_;
    mutable std::once_flag entitlementsDecoded_;
    // The dictionaries: before their first use as the values or text given, afterwards as the decoded dictionaries
    // alone (the text is dropped then).
    mutable std::optional<Value> info_;
    mutable std::optional<Value> entitlements_;
    mutable std::unique_ptr<const std::string> infoText_;
    mutable std::unique_ptr<const std::string> entitlementsText_;
};

}  // namespace bexil
