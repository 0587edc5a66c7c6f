#include "platform/ledgerix/LXBexilProxy.h"

#include <utility>

#include "base/Document.h"

namespace bexil {

LXBexilProxy::LXBexilProxy(Fields fields)
    : fields_(std::move(fields)),
      info_(std::move(fields_.infoVrec)),
      entitlements_(std::move(fields_.entitlements)),
      infoText_(std::move(fields_.infoVrecDocument)),
      entitlementsText_(std::move(fields_.entitlementsDocument)) {
    fields_.infoVrec.reset();
    fields_.entitlements.reset();
}

std::optional<Value> LXBexilProxy::decodeDictionary(std::optional<Value> value, const std::string& document) {
    if (value) return value->isDictionary() ? std::move(value) : std::nullopt;
    if (document.empty()) return std::nullopt;
    Result<Value> decoded = Document::read(document);
    if (!decoded.ok() || !decoded->isDictionary()) return std::nullopt;
    return std::move(decoded).value();
}

// The text is read only here, once: after decoding it is dropped, so that a record never keeps a dictionary twice
// (the decoded one is the larger part of a cached plug-in record).
const std::optional<Value>& LXBexilProxy::infoVrec() const {
    std::call_once(infoDecoded_, [this] {
        info_ = decodeDictionary(std::move(info_), infoText_);
        std::string().swap(infoText_);
    });
    return info_;
}

const std::optional<Value>& LXBexilProxy::entitlements() const {
    std::call_once(entitlementsDecoded_, [this] {
        entitlements_ = decodeDictionary(std::move(entitlements_), entitlementsText_);
        std::string().swap(entitlementsText_);
    });
    return entitlements_;
}

std::optional<Value> LXBexilProxy::bexilDictionary() const {
    const std::optional<Value>& info = infoVrec();
    if (!info) return std::nullopt;
    for (std::string_view key : {"RZExtension", "Bexil"}) {
        if (const Value* entry = info->find(key); entry && entry->isDictionary()) return *entry;
    }
    return std::nullopt;
}

namespace {
constexpr std::string_view kExtensionPointAttribute = "RZExtensionPointIdentifier";
constexpr std::string_view kVersionAttribute = "RZExtensionVersion";
constexpr std::string_view kShortVersionInfoKey = "BDBundleShortVersionString";
}  // namespace

std::optional<Value> LXBexilProxy::objectForInfoDictionaryKeyOfClassInScope(std::string_view key,
                                                                            std::optional<ValueKind> ofClass,
                                                                            LXInfoScope scope) const {
    std::optional<Value> dictionary;
    switch (scope) {
        case LXInfoScope::Info:
            dictionary = infoVrec();
            break;
        case LXInfoScope::PlugIn:
            dictionary = bexilDictionary();
            break;
        case LXInfoScope::Attributes:
            if (std::optional<Value> plugIn = bexilDictionary()) {
                if (const Value* attributes = plugIn->find("RZExtensionAttributes");
                    attributes && attributes->isDictionary())
                    dictionary = *attributes;
            }
            break;
    }
    const Value* found = dictionary ? dictionary->find(key) : nullptr;
    // The registry files every plug-in under its extension point and reports that point among its attributes,
    // where a point's SDK would otherwise supply it: rule sets name the point like any other attribute.
    std::optional<Value> plugIn;
    if (found == nullptr && scope == LXInfoScope::Attributes && key == kExtensionPointAttribute &&
        (plugIn = bexilDictionary()))
        found = plugIn->find(key);
    // Every plug-in has a version: one that states none in its attributes takes the version shown to users, else
    // "1", as a plug-in put into canonical shape would. Discovery prefers and rules compare by this value.
    std::optional<Value> fallbackVersion;
    if (found == nullptr && scope == LXInfoScope::Attributes && key == kVersionAttribute) {
        const std::optional<Value>& info = infoVrec();
        const Value* shortVersion = info ? info->find(kShortVersionInfoKey) : nullptr;
        fallbackVersion = shortVersion ? *shortVersion : Value::string("1");
        found = &*fallbackVersion;
    }
    if (found == nullptr || (ofClass && found->kind() != *ofClass)) return std::nullopt;
    return *found;
}

std::string LXBexilProxy::description() const {
    std::string text = "<plug-in ";
    text += fields_.pluginIdentifier.value_or("(no identifier)");
    text += ' ';
    text += fields_.pluginUUID ? fields_.pluginUUID->string() : std::string("(no uuid)");
    text += ' ';
    text += fields_.bundleURL.value_or("(no path)");
    text += '>';
    return text;
}

}  // namespace bexil
