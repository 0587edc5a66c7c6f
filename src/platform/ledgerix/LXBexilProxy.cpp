#include "platform/ledgerix/LXBexilProxy.h"

#include <initializer_list>
#include <mutex>
#include <unordered_map>
#include <utility>

#include "base/Document.h"
#include "platform/log/Log.h"

namespace bexil {

namespace {
// A string Value of `text`, or null when absent; equal texts given side by side (the registry gives a plug-in's
// identifiers so) share one.
Value textValue(std::optional<std::string>& text, std::initializer_list<const Value*> earlier = {}) {
    if (!text) return Value();
    for (const Value* other : earlier)
        if (other->isString() && other->stringView() == *text) return *other;
    return Value::string(std::move(*text));
}

// Text is kept apart until it is decoded, and not at all when there is none.
std::unique_ptr<const std::string> pendingText(std::string& text) {
    if (text.empty()) return nullptr;
    return std::make_unique<const std::string>(std::move(text));
}
}  // namespace

LXBexilProxy::LXBexilProxy(Fields fields)
    : bundleURL_(textValue(fields.bundleURL)),
      pluginIdentifier_(textValue(fields.pluginIdentifier)),
      originalIdentifier_(textValue(fields.originalIdentifier, {&pluginIdentifier_})),
      bundleIdentifier_(textValue(fields.bundleIdentifier, {&originalIdentifier_, &pluginIdentifier_})),
      bundleVersion_(textValue(fields.bundleVersion)),
      dataContainerURL_(textValue(fields.dataContainerURL)),
      localizedName_(textValue(fields.localizedName)),
      localizedShortName_(textValue(fields.localizedShortName, {&localizedName_})),
      containingBundle_(std::move(fields.containingBundle)),
      registrationDate_(fields.registrationDate),
      pluginUUID_(fields.pluginUUID),
      isOnSystemPartition_(fields.isOnSystemPartition),
      info_(std::move(fields.infoVrec)),
      entitlements_(std::move(fields.entitlements)),
      infoText_(pendingText(fields.infoVrecDocument)),
      entitlementsText_(pendingText(fields.entitlementsDocument)) {}

namespace {

// The given value when it is a dictionary, else the document decoded when it holds one, else none.
std::optional<Value> decodeDictionary(std::optional<Value> value, const std::string* document,
                                      const Document::StringMaker& makeString) {
    if (value) return value->isDictionary() ? std::move(value) : std::nullopt;
    if (document == nullptr) return std::nullopt;
    Result<Value> decoded = Document::read(*document, makeString);
    if (!decoded.ok() || !decoded->isDictionary()) return std::nullopt;
    return std::move(decoded).value();
}

// Strings that information dictionaries repeat from plug-in to plug-in (extension points, protocols, classes,
// versions, flags) are kept once for the process: the first kSharedStrings short strings decoded are kept for
// good and handed out to every later dictionary that has them. The bound keeps what is kept small (well under a
// megabyte) whatever the registry holds; strings met after it is reached are each a Value of their own again.
class SharedStrings {
  public:
    static constexpr size_t kSharedStrings = 4096;
    static constexpr size_t kLongestShared = 64;

    Value make(std::string&& text) {
        if (text.size() > kLongestShared) return Value::string(std::move(text));
        std::lock_guard lock(mutex_);
        if (auto it = strings_.find(std::string_view(text)); it != strings_.end()) return it->second;
        Value made = Value::string(std::move(text));
        // The key views the Value's own text, which never changes or moves while the Value is kept here.
        if (strings_.size() < kSharedStrings) {
            strings_.emplace(made.stringView(), made);
            if (strings_.size() == kSharedStrings)
                log::lx().info("%zu strings shared between records (kSharedStrings): later ones are kept per record",
                               kSharedStrings);
        }
        return made;
    }

  private:
    std::mutex mutex_;
    std::unordered_map<std::string_view, Value> strings_;
};

SharedStrings& sharedStrings() {
    static SharedStrings* strings = new SharedStrings;  // never destroyed: records may outlive static destructors
    return *strings;
}

}  // namespace

// The text is read only here, once: after decoding it is dropped, so that a record never keeps a dictionary twice
// (the decoded one is the larger part of a cached plug-in record).
const std::optional<Value>& LXBexilProxy::infoVrec() const {
    std::call_once(infoDecoded_, [this] {
        // The information dictionary repeats the identifiers, version and names this record holds: the decoded
        // dictionary shares their Values, and those of the strings that other plug-ins' dictionaries have too.
        auto makeString = [this](std::string&& text) -> Value {
            for (const Value* known :
                 {&pluginIdentifier_, &bundleIdentifier_, &bundleVersion_, &localizedName_, &localizedShortName_})
                if (known->isString() && known->stringView() == text) return *known;
            return sharedStrings().make(std::move(text));
        };
        info_ = decodeDictionary(std::move(info_), infoText_.get(), makeString);
        infoText_.reset();
    });
    return info_;
}

const std::optional<Value>& LXBexilProxy::entitlements() const {
    std::call_once(entitlementsDecoded_, [this] {
        entitlements_ = decodeDictionary(std::move(entitlements_), entitlementsText_.get(),
                                         [](std::string&& text) { return Value::string(std::move(text)); });
        entitlementsText_.reset();
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
    text += pluginIdentifier_.isString() ? pluginIdentifier_.stringView() : "(no identifier)";
    text += ' ';
    text += pluginUUID_ ? pluginUUID_->string() : std::string("(no uuid)");
    text += ' ';
    text += bundleURL_.isString() ? bundleURL_.stringView() : "(no path)";
    text += '>';
    return text;
}

}  // namespace bexil
