// The record keeps its facts in plain fields behind one small lock and derives everything else on demand through
// the three primitive look-ups, so a subclass that answers those from elsewhere (the registry, in the daemon) gets
// every derived property for free. Nothing here caches a derived value: the dictionaries may be replaced while the
// record is shared, and a cache would have to be invalidated in the same atomic step.

#include "model/BXPlugInCore.h"

#include <unordered_set>

#include "bexil/Protocol.h"
#include "model/BXUtilities.h"
#include "platform/log/Log.h"
#include "platform/sdks/ExtensionSDKRegistry.h"

namespace bexil {

namespace {

// The plug-in configuration vocabulary: keys of the information, plug-in and attributes dictionaries.
namespace keys {
constexpr std::string_view kRZExtension = "RZExtension";
constexpr std::string_view kBexil = "Bexil";
constexpr std::string_view kBDBundleShortVersionString = "BDBundleShortVersionString";
constexpr std::string_view kBDBundleInfoVrecURL = "BDBundleInfoVrecURL";
constexpr std::string_view kMultiple = "Multiple";
constexpr std::string_view kRZExtensionAttributes = "RZExtensionAttributes";
constexpr std::string_view kRZExtensionProtocol = "RZExtensionProtocol";
constexpr std::string_view kPrincipalClass = "PrincipalClass";
constexpr std::string_view kEmbeddedCode = "EmbeddedCode";
constexpr std::string_view kEmbeddedProtocol = "EmbeddedProtocol";
constexpr std::string_view kDedicated = "Dedicated";
constexpr std::string_view kPassProxy = "PassProxy";
constexpr std::string_view kRZExtensionPointIdentifier = "RZExtensionPointIdentifier";
constexpr std::string_view kRZExtensionVersion = "RZExtensionVersion";
constexpr std::string_view kShared = "Shared";
constexpr std::string_view kCleanTimeout = "CleanTimeout";
}  // namespace keys

namespace form = protocol::form;

// The truth value of a configuration entry: booleans as they are, numbers when not zero. Anything else (a string,
// a dictionary) is not a truth value and counts as NO.
bool truthValue(const std::optional<Value>& v) {
    if (!v) return false;
    if (std::optional<bool> b = v->getBool()) return *b;
    if (std::optional<double> d = v->numberAsDouble()) return *d != 0;
    return false;
}

bool isString(const std::optional<Value>& v, std::string_view text) {
    return v && v->isString() && v->stringView() == text;
}

std::optional<Value> lookUp(const std::optional<Value>& dictionary, std::string_view key) {
    if (!dictionary) return std::nullopt;
    const Value* found = dictionary->find(key);
    if (found == nullptr) return std::nullopt;
    return *found;
}

constexpr std::string_view kRZObject = "RZObject";
constexpr int kInvalidConfiguration = 12;

Error invalidConfiguration(std::string message) { return BXError(kInvalidConfiguration, message); }

// Forms come from disk and from the wire, so every entry is read by kind: a value of another kind (or a null) reads
// as absent and the caller applies the default. Nothing here trusts that the writer was our own exportForm.
const Value* formEntry(const Value& form, std::string_view key) {
    const Value* v = form.find(key);
    return v == nullptr || v->isNull() ? nullptr : v;
}

std::optional<std::string> formString(const Value& form, std::string_view key) {
    const Value* v = formEntry(form, key);
    if (v == nullptr || !v->isString()) return std::nullopt;
    return *v->getString();
}

// A path that names a file: a non-empty string. Anything else gives no URL.
std::optional<std::string> formPath(const Value& form, std::string_view key) {
    std::optional<std::string> p = formString(form, key);
    if (p && p->empty()) return std::nullopt;
    return p;
}

std::optional<Value> formOfKind(const Value& form, std::string_view key, ValueKind kind) {
    const Value* v = formEntry(form, key);
    if (v == nullptr || v->kind() != kind) return std::nullopt;
    return *v;
}

// The canonical UUID text; a UUID-kind value is taken too, since a wire conversion may have produced one.
std::optional<Uuid> formUuid(const Value& form) {
    const Value* v = formEntry(form, form::kUuid);
    if (v == nullptr) return std::nullopt;
    if (const Uuid* u = v->getUuid()) return *u;
    if (v->isString()) return Uuid::parse(v->stringView());
    return std::nullopt;
}

void setIfPresent(MutableDictionary& out, std::string_view key, const std::optional<std::string>& v) {
    if (v) out.set(key, Value::string(*v));
}

void setIfPresent(MutableDictionary& out, std::string_view key, const std::optional<Value>& v) {
    if (v) out.set(key, *v);
}

// A text property: null when absent.
void setIfPresent(MutableDictionary& out, std::string_view key, const Value& text) {
    if (text.isString()) out.set(key, text);
}

}  // namespace

// ---- Construction ----

std::shared_ptr<BXPlugInCore> BXPlugInCore::initWithNameUrlBundleInfoInfoUuid(std::optional<std::string> identifier,
                                                                              std::optional<std::string> url,
                                                                              std::optional<Value> bundleInfo,
                                                                              std::optional<Value> info,
                                                                              std::optional<Uuid> uuid) {
    auto record = std::make_shared<BXPlugInCore>();
    if (!record->setupWithNameUrlBundleInfoInfoUuid(std::move(identifier), std::move(url), std::move(bundleInfo), info,
                                                    uuid))
        return nullptr;
    // Only a dictionary can stand in for the plug-in dictionary; anything else counts as no `info`.
    if (!record->plugInDictionary() && info && info->isDictionary()) record->setPlugInDictionary(std::move(info));
    return record;
}

std::shared_ptr<BXPlugInCore> BXPlugInCore::initWithForm(const Value& form) {
    auto record = std::make_shared<BXPlugInCore>();
    if (!record->setupWithForm(form)) return nullptr;
    return record;
}

bool BXPlugInCore::setupWithNameUrlBundleInfoInfoUuid(std::optional<std::string> identifier,
                                                      std::optional<std::string> url, std::optional<Value> bundleInfo,
                                                      std::optional<Value> /*info*/, std::optional<Uuid> uuid) {
    if (!url) return false;
    if (!identifier) {
        log::ops().error("missing identifier in plug-in at %@", *url);
        return false;
    }
    if (bundleInfo) {
        if (!setDictionaries(normalizeInfoDictionary(*bundleInfo))) {
            log::ops().notice("malformed plug-in dictionary in plug-in %@ at %@: %@", *identifier, *url, *bundleInfo);
            return false;
        }
    }
    setIdentifier(std::move(identifier));
    setUrl(std::move(url));
    setUuid(uuid ? *uuid : Uuid::random());
    return true;
}

// ---- Dictionaries ----

bool BXPlugInCore::setDictionaries(const Value& info) {
    if (!info.isDictionary()) return false;
    setBundleInfoDictionary(info);
    const Value* plugIn = info.find(keys::kRZExtension);
    if (plugIn == nullptr || !plugIn->isDictionary()) return false;
    setPlugInDictionary(*plugIn);
    if (plugIn->contains(keys::kMultiple))
        log::ops().notice("multiplexed plug-ins (%{public}@ key) obsolete and ignored", keys::kMultiple);
    return true;
}

Value BXPlugInCore::normalizeInfoDictionary(const Value& info) { return info; }

void BXPlugInCore::canonicalize() {
    std::optional<Value> existing = attributes();
    MutableDictionary attrs(existing ? *existing : Value::emptyDictionary());
    bool hasVersion = attribute(keys::kRZExtensionVersion).has_value();
    if (!hasVersion) {
        std::optional<Value> shortVersion = infoKey(keys::kBDBundleShortVersionString);
        attrs.set(keys::kRZExtensionVersion, shortVersion ? *shortVersion : Value::string("1"));
    }
    std::optional<Value> current = plugInDictionary();
    MutableDictionary plugIn(current ? *current : Value::emptyDictionary());
    plugIn.set(keys::kRZExtensionAttributes, attrs.take());
    setPlugInDictionary(plugIn.take());
}

// ---- SDK resolution ----

std::optional<Value> BXPlugInCore::readSDKDictionary(std::string_view name) {
    std::optional<Value> entry = ExtensionSDKRegistry::shared()->copySDKEntry(name);
    if (!entry) {
        log::ops().notice("plug-in sdk \"%{public}@\" not registered", name);
        return std::nullopt;
    }
    // The registry's entry is already a plain dictionary on this platform; anything else is not an SDK.
    if (!entry->isDictionary()) return std::nullopt;
    return entry;
}

void BXPlugInCore::resolveSDK() {
    std::optional<Value> info = bundleInfoDictionary();
    if (!info)
        log::ops().fault("cannot resolve SDK without materialized Info.vrec (%{public}@ of %@)", "resolveSDK",
                         description());
    if (std::optional<Value> spec = sdkSpec()) {
        if (!spec->isString()) {
            log::ops().error("invalid SDK key:%{public}@", spec->description());
            return;
        }
        std::optional<Value> sdk = readSDKDictionary(spec->stringView());
        // The merged dictionary's "RZExtension" comes from the plug-in's own, so it is a dictionary whenever the
        // plug-in's was; a false answer could only keep the plug-in dictionary as it was, which is what we want.
        if (sdk && info) setDictionaries(mergeDictionaryInto(*sdk, *info));
    }
    canonicalize();
}

Value BXPlugInCore::mergeDictionaryInto(const Value& sdk, const Value& plugIn) const {
    if (!sdk.isDictionary() || !plugIn.isDictionary()) return plugIn;
    MutableDictionary result(plugIn);
    for (const DictionaryEntry& entry : sdk.entries()) {
        const Value* mine = result.find(entry.key);
        if (mine == nullptr) {
            result.set(entry.key, entry.value);
        } else if (sdkOverridesKey(entry.key)) {
            result.set(entry.key, entry.value);
        } else if (entry.key == keys::kShared) {
            Value merged = mergeSharedResourcesInto(entry.value, *mine);
            result.set(entry.key, std::move(merged));
        } else if (entry.value.isDictionary()) {
            Value merged = mergeDictionaryInto(entry.value, *mine);
            result.set(entry.key, std::move(merged));
        }
        // Otherwise the plug-in's value stays, arrays included.
    }
    return result.take();
}

bool BXPlugInCore::sdkOverridesKey(std::string_view key) const { return key == keys::kCleanTimeout; }

Value BXPlugInCore::mergeSharedResourcesInto(const Value& sdk, const Value& plugIn) const {
    auto listOf = [](const Value& v) -> std::optional<std::vector<Value>> {
        if (v.isString()) return std::vector<Value>{v};
        if (v.isArray()) return std::vector<Value>(v.items().begin(), v.items().end());
        return std::nullopt;
    };
    std::optional<std::vector<Value>> theirs = listOf(sdk);
    std::optional<std::vector<Value>> mine = listOf(plugIn);
    if (!theirs || !mine) return plugIn;
    std::unordered_set<Value, ValueHash> seen;
    MutableArray result;
    result.reserve(mine->size() + theirs->size());
    for (const std::vector<Value>* list : {&*mine, &*theirs})
        for (const Value& path : *list)
            if (seen.insert(path).second) result.append(path);
    return result.take();
}

// ---- Checks and annotations ----

std::optional<Error> BXPlugInCore::diagnose() const {
    if (!identifier())
        return invalidConfiguration("missing identifier (no RZExtensionIdentifier, nor even BDBundleIdentifier)");
    if (!protocolSpec()) return invalidConfiguration("missing \"RZExtensionProtocol\" key in Info.vrec or SDK");
    if (!attributes()) return invalidConfiguration("missing \"RZExtensionAttributes\" key in Info.vrec or SDK");
    if (isAppExtension() && !isString(principalSpec(), kRZObject))
        return invalidConfiguration("Application Extensions may not use the \"PrincipalClass\" key");
    if (pluginKey(keys::kPassProxy))
        return invalidConfiguration("the \"PassProxy\" key is not supported on this platform");
    if (isHybrid()) return invalidConfiguration("hybrid plug-ins are not supported on this platform");
    return std::nullopt;
}

void BXPlugInCore::setAnnotationValue(std::string_view key, const std::optional<Value>& value) {
    // Read, build the new dictionary outside the lock, and store it only if nobody replaced the annotations in the
    // meantime; otherwise start again from theirs, so that two concurrent changes of different keys both survive.
    for (;;) {
        std::optional<Value> before = annotations();
        std::optional<Value> after = dictionaryChangingTo(before, key, value);
        std::lock_guard<std::mutex> guard(mutex());
        bool unchanged =
            before.has_value() == annotations_.has_value() && (!before || before->identical(*annotations_));
        if (unchanged) {
            annotations_.swap(after);
            return;
        }
    }
}

// ---- Identity ----

bool BXPlugInCore::isEqual(const BXPlugInCore& other) const {
    std::optional<Uuid> mine = uuid();
    if (!mine) throw InternalInconsistency("self.uuid");
    if (&other == this) return true;
    std::optional<Uuid> theirs = other.uuid();
    return theirs && *theirs == *mine;
}

size_t BXPlugInCore::hash() const {
    std::optional<Uuid> mine = uuid();
    if (!mine) throw InternalInconsistency("self.uuid");
    return std::hash<Uuid>()(*mine);
}

size_t BXPlugInCoreHash::operator()(const BXPlugInCore* record) const { return record ? record->hash() : 0; }

bool BXPlugInCoreEqual::operator()(const BXPlugInCore* a, const BXPlugInCore* b) const {
    if (a == nullptr || b == nullptr) return a == b;
    return a->isEqual(*b);
}

// ---- Primitive look-ups ----

std::optional<Value> BXPlugInCore::infoKey(std::string_view key) const { return lookUp(bundleInfoDictionary(), key); }

std::optional<Value> BXPlugInCore::pluginKey(std::string_view key) const { return lookUp(plugInDictionary(), key); }

std::optional<Value> BXPlugInCore::attribute(std::string_view key) const {
    std::optional<Value> attrs = attributes();
    return lookUp(attrs, key);
}

// ---- Derived properties ----

std::optional<std::string> BXPlugInCore::path() const { return url(); }

std::optional<std::string> BXPlugInCore::containingPath() const { return containingUrl(); }

std::optional<Value> BXPlugInCore::attributes() const { return pluginKey(keys::kRZExtensionAttributes); }

std::optional<Error> BXPlugInCore::augmentInterface(BXInterface&) const { return std::nullopt; }

std::optional<Value> BXPlugInCore::version() const { return attribute(keys::kRZExtensionVersion); }

std::optional<Value> BXPlugInCore::protocolSpec() const {
    if (std::optional<Value> spec = pluginKey(keys::kRZExtensionProtocol)) return spec;
    if (isAppExtension()) return Value::string(kRZObject);
    return std::nullopt;
}

std::optional<Value> BXPlugInCore::principalSpec() const {
    if (std::optional<Value> spec = pluginKey(keys::kPrincipalClass)) return spec;
    if (isAppExtension()) return Value::string(kRZObject);
    return std::nullopt;
}

std::optional<Value> BXPlugInCore::sdkSpec() const { return pluginKey(keys::kRZExtensionPointIdentifier); }

std::optional<std::string> BXPlugInCore::embeddedCodePath() const { return std::nullopt; }

std::optional<Value> BXPlugInCore::embeddedProtocolSpec() const {
    if (std::optional<Value> spec = pluginKey(keys::kEmbeddedProtocol)) return spec;
    return protocolSpec();
}

bool BXPlugInCore::isAppExtension() const {
    std::optional<std::string> p = path();
    return p && p->ends_with(".wexa");
}

bool BXPlugInCore::isMultiplexed() const { return false; }

bool BXPlugInCore::isHybrid() const { return pluginKey(keys::kEmbeddedCode).has_value(); }

bool BXPlugInCore::isDedicated() const { return truthValue(pluginKey(keys::kDedicated)); }

bool BXPlugInCore::isData() const { return isString(protocolSpec(), "#Data"); }

bool BXPlugInCore::oldStyle() const {
    if (infoKey(keys::kRZExtension)) return false;
    if (infoKey(keys::kBexil)) return true;
    log::ops().fault("unknown plug-in configuration style (%{public}@ of %@)", "oldStyle", description());
    return true;
}

Date BXPlugInCore::timestamp() const { return Date{static_cast<double>(lastModified())}; }

std::string BXPlugInCore::description() const {
    std::optional<Uuid> u = uuid();
    return "<BXPlugInCore " + identifier().value_or("(no identifier)") + " " + (u ? u->string() : "(no uuid)") + " " +
           url().value_or("(no path)") + ">";
}

// ---- Form ----

Result<MutableDictionary> BXPlugInCore::exportForm() const {
    // The information dictionary is shared as it is unless it carries the key the form must never hold.
    std::optional<Value> bundleInfo = bundleInfoDictionary();
    if (bundleInfo && bundleInfo->contains(keys::kBDBundleInfoVrecURL)) {
        MutableDictionary copy(*bundleInfo);
        copy.remove(keys::kBDBundleInfoVrecURL);
        bundleInfo = copy.take();
    }

    MutableDictionary out;
    out.reserve(16);
    out.set(form::kHubProtocolVersion, Value::uint64(hubProtocolVersion()));
    setIfPresent(out, form::kPath, path());
    out.set(form::kSystemResident, Value::boolean(onSystemVolume()));
    setIfPresent(out, form::kIdentifier, load(identifier_));
    setIfPresent(out, form::kOriginalIdentifier, load(originalIdentifier_));
    setIfPresent(out, form::kVersion, version());
    setIfPresent(out, form::kBundleInfo, bundleInfo);
    setIfPresent(out, form::kInfo, plugInDictionary());
    if (std::optional<Uuid> u = uuid()) out.set(form::kUuid, Value::string(u->string()));
    out.set(form::kLastModified, Value::int64(lastModified()));
    std::optional<Value> notes = annotations();
    out.set(form::kAnnotations, notes ? *notes : Value::emptyDictionary());

    setIfPresent(out, form::kEntitlements, entitlements());
    setIfPresent(out, form::kContainingPath, containingPath());
    setIfPresent(out, form::kLocalizedContainingDisplayName, load(localizedContainingName_));
    setIfPresent(out, form::kLocalizedDisplayName, load(localizedName_));
    setIfPresent(out, form::kLocalizedShortName, load(localizedShortName_));
    return out;
}

bool BXPlugInCore::setupWithForm(const Value& form) {
    std::optional<std::string> url = formPath(form, form::kPath);
    std::optional<Uuid> uuid = formUuid(form);
    std::optional<Value> bundleInfo;
    if (const Value* v = formEntry(form, form::kBundleInfo)) bundleInfo = *v;
    std::optional<Value> info;
    if (const Value* v = formEntry(form, form::kInfo)) info = *v;
    if (!setupWithNameUrlBundleInfoInfoUuid(formString(form, form::kIdentifier), std::move(url), std::move(bundleInfo),
                                            std::move(info), uuid))
        return false;

    uint32_t generation = 1;
    if (const Value* v = formEntry(form, form::kHubProtocolVersion)) {
        std::optional<uint64_t> n = v->isBool() ? std::nullopt : v->numberAsUInt64();
        if (n && *n <= UINT32_MAX) generation = static_cast<uint32_t>(*n);
    }
    setHubProtocolVersion(generation);
    store(originalIdentifier_, textEntry(form, form::kOriginalIdentifier));
    setCdhash(formOfKind(form, form::kHash, ValueKind::Data));
    store(requirement_, textEntry(form, form::kRequirement));

    int32_t seconds = 0;
    if (const Value* v = formEntry(form, form::kLastModified)) {
        std::optional<int64_t> n = v->isBool() ? std::nullopt : v->numberAsInt64();
        if (n && *n >= INT32_MIN && *n <= INT32_MAX) seconds = static_cast<int32_t>(*n);
    }
    setLastModified(seconds);
    setEntitlements(formOfKind(form, form::kEntitlements, ValueKind::Dictionary));
    if (std::optional<std::string> containing = formPath(form, form::kContainingPath))
        setContainingUrl(std::move(containing));
    const Value* resident = formEntry(form, form::kSystemResident);
    setOnSystemVolume(resident != nullptr && truthValue(*resident));
    setAnnotations(formOfKind(form, form::kAnnotations, ValueKind::Dictionary));
    store(localizedName_, textEntry(form, form::kLocalizedDisplayName));
    store(localizedShortName_, textEntry(form, form::kLocalizedShortName));
    store(localizedContainingName_, textEntry(form, form::kLocalizedContainingDisplayName));
    return true;
}

void BXPlugInCore::updateFromForm(const Value& form) {
    setAnnotations(formOfKind(form, form::kAnnotations, ValueKind::Dictionary));
}

// ---- Stored properties ----

std::mutex& BXPlugInCore::mutex() const {
    // Enough locks that records rarely share one; each on its own cache line.
    struct alignas(64) Lock {
        std::mutex mutex;
    };
    static Lock locks[64];
    auto address = reinterpret_cast<uintptr_t>(this);
    return locks[(address >> 6 ^ address >> 12) % 64].mutex;
}

std::optional<std::string> BXPlugInCore::loadText(const Value& field) const {
    Value v = load(field);
    if (!v.isString()) return std::nullopt;
    return std::string(v.stringView());
}

Value BXPlugInCore::textValue(std::optional<std::string> text) {
    if (!text) return Value();
    return Value::string(std::move(*text));
}

Value BXPlugInCore::textEntry(const Value& form, std::string_view key) {
    return formOfKind(form, key, ValueKind::String).value_or(Value());
}

Value BXPlugInCore::sharedText(const Value& text) { return text.isString() ? text : Value(); }

void BXPlugInCore::shareIdentifier(const Value& text) { store(identifier_, sharedText(text)); }
void BXPlugInCore::shareOriginalIdentifier(const Value& text) { store(originalIdentifier_, sharedText(text)); }
void BXPlugInCore::shareUrl(const Value& text) { store(url_, sharedText(text)); }
void BXPlugInCore::shareContainingUrl(const Value& text) { store(containingUrl_, sharedText(text)); }
void BXPlugInCore::shareLocalizedName(const Value& text) { store(localizedName_, sharedText(text)); }
void BXPlugInCore::shareLocalizedShortName(const Value& text) { store(localizedShortName_, sharedText(text)); }

std::optional<std::string> BXPlugInCore::identifier() const { return loadText(identifier_); }
void BXPlugInCore::setIdentifier(std::optional<std::string> v) { store(identifier_, textValue(std::move(v))); }
std::optional<std::string> BXPlugInCore::originalIdentifier() const { return loadText(originalIdentifier_); }
void BXPlugInCore::setOriginalIdentifier(std::optional<std::string> v) {
    store(originalIdentifier_, textValue(std::move(v)));
}
std::optional<std::string> BXPlugInCore::url() const { return loadText(url_); }
void BXPlugInCore::setUrl(std::optional<std::string> v) { store(url_, textValue(std::move(v))); }
std::optional<Value> BXPlugInCore::bundleInfoDictionary() const { return load(bundleInfoDictionary_); }
void BXPlugInCore::setBundleInfoDictionary(std::optional<Value> v) { store(bundleInfoDictionary_, std::move(v)); }
std::optional<Value> BXPlugInCore::plugInDictionary() const { return load(plugInDictionary_); }
void BXPlugInCore::setPlugInDictionary(std::optional<Value> v) { store(plugInDictionary_, std::move(v)); }
std::optional<Value> BXPlugInCore::entitlements() const { return load(entitlements_); }
void BXPlugInCore::setEntitlements(std::optional<Value> v) { store(entitlements_, std::move(v)); }
std::optional<Value> BXPlugInCore::annotations() const { return load(annotations_); }
void BXPlugInCore::setAnnotations(std::optional<Value> v) { store(annotations_, std::move(v)); }
std::optional<std::string> BXPlugInCore::containingUrl() const { return loadText(containingUrl_); }
void BXPlugInCore::setContainingUrl(std::optional<std::string> v) { store(containingUrl_, textValue(std::move(v))); }
bool BXPlugInCore::onSystemVolume() const { return load(onSystemVolume_); }
void BXPlugInCore::setOnSystemVolume(bool v) { store(onSystemVolume_, v); }
uint32_t BXPlugInCore::hubProtocolVersion() const { return load(hubProtocolVersion_); }
void BXPlugInCore::setHubProtocolVersion(uint32_t v) { store(hubProtocolVersion_, v); }
std::optional<std::string> BXPlugInCore::localizedName() const { return loadText(localizedName_); }
void BXPlugInCore::setLocalizedName(std::optional<std::string> v) { store(localizedName_, textValue(std::move(v))); }
std::optional<std::string> BXPlugInCore::localizedShortName() const { return loadText(localizedShortName_); }
void BXPlugInCore::setLocalizedShortName(std::optional<std::string> v) {
    store(localizedShortName_, textValue(std::move(v)));
}
std::optional<std::string> BXPlugInCore::localizedContainingName() const { return loadText(localizedContainingName_); }
void BXPlugInCore::setLocalizedContainingName(std::optional<std::string> v) {
    store(localizedContainingName_, textValue(std::move(v)));
}
int32_t BXPlugInCore::lastModified() const { return load(lastModified_); }
void BXPlugInCore::setLastModified(int32_t v) { store(lastModified_, v); }
std::optional<Uuid> BXPlugInCore::uuid() const { return load(uuid_); }
void BXPlugInCore::setUuid(std::optional<Uuid> v) { store(uuid_, v); }
std::optional<Value> BXPlugInCore::cdhash() const { return load(cdhash_); }
void BXPlugInCore::setCdhash(std::optional<Value> v) { store(cdhash_, std::move(v)); }
std::optional<std::string> BXPlugInCore::requirement() const { return loadText(requirement_); }
void BXPlugInCore::setRequirement(std::optional<std::string> v) { store(requirement_, textValue(std::move(v))); }

}  // namespace bexil
