#include "policy/BXDPlugIn.h"

#include <atomic>
#include <cerrno>
#include <cmath>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <limits>

#include "bexil/Protocol.h"
#include "model/BXBundle.h"
#include "platform/ledgerix/LXApplicationProxy.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/log/Log.h"
#include "policy/BXHostAccessPolicy.h"
#include "policy/BXIssueReadExtension.h"

namespace bexil {

namespace {

constexpr std::string_view kHubProtocolVersionKey = "HubProtocolVersion";
constexpr std::string_view kOldStyleInfoKey = "Bexil";
constexpr std::string_view kDebugToolPrefix = "DT";
constexpr std::string_view kSharedKey = "Shared";
constexpr std::string_view kExtensionsFormKey = protocol::form::kExtensions;
constexpr std::string_view kWholeBundle = ".";

// Seconds since 1970 with the fraction dropped, held to the range of the 32-bit field rather than wrapping.
int32_t secondsAsInt32(double seconds) {
    if (std::isnan(seconds)) return 0;
    double truncated = std::trunc(seconds);
    if (truncated <= static_cast<double>(std::numeric_limits<int32_t>::min()))
        return std::numeric_limits<int32_t>::min();
    if (truncated >= static_cast<double>(std::numeric_limits<int32_t>::max()))
        return std::numeric_limits<int32_t>::max();
    return static_cast<int32_t>(truncated);
}

Error misconfigured(std::string_view message) { return BXError(ErrorCode::InvalidConfiguration, message); }

constexpr std::string_view kExtensionPointKey = "RZExtensionPointIdentifier";
constexpr std::string_view kServiceKey = "ZEMService";
constexpr std::string_view kEnvironmentKey = "EnvironmentVariables";
constexpr std::string_view kSandboxProfileKey = "_SandboxProfile";
constexpr std::string_view kOmitSandboxParametersKey = "_OmitSandboxParameters";
constexpr std::string_view kPackageTypeKey = "BDBundlePackageType";
constexpr std::string_view kRequestsOpenAccessKey = "RequestsOpenAccess";
constexpr std::string_view kTestSdkVariable = "BXTEST_SDK";

// The sandbox profile of each extension point with a profile of its own, tested in order; every other point (or
// none) runs under kDefaultProfile. The typepad point's profile also depends on open access and consent.
constexpr std::string_view kTypepadPoint = "com.quorvel.typepad-service";
constexpr std::string_view kTypepadProfile = "typepad";
constexpr std::string_view kDefaultProfile = "plugin";
struct PointProfile {
    std::string_view point;
    std::string_view profile;
};
constexpr PointProfile kPointProfiles[] = {
    {"com.quorvel.netguard.filter-data", "netguard-filter"},
    {"com.quorvel.peekview.extension.preview", "peekviewd"},
    {"com.quorvel.app.non-ui-extension", "sketchpad-devtools"},
    {"com.quorvel.app.non-ui-extension.multiple-instances", "sketchpad-devtools"},
};

}  // namespace

std::shared_ptr<BXDPlugIn> BXDPlugIn::initWithLXData(std::shared_ptr<const LXBexilProxy> proxy) {
    if (!proxy || !proxy->bundleURL()) return nullptr;

    auto record = std::make_shared<BXDPlugIn>();
    std::optional<Value> plugInDictionary = proxy->bexilDictionary();
    if (!record->setupWithNameUrlBundleInfoInfoUuid(proxy->pluginIdentifier(), proxy->bundleURL(), std::nullopt,
                                                    plugInDictionary, proxy->pluginUUID()))
        return nullptr;
    // Without an information dictionary set-up stores no plug-in dictionary; the registry's one stands in.
    if (!record->plugInDictionary() && plugInDictionary && plugInDictionary->isDictionary())
        record->setPlugInDictionary(*plugInDictionary);

    // The texts the registry's record already holds are shared rather than copied: a cached record would otherwise
    // keep each of them twice.
    record->shareIdentifier(proxy->pluginIdentifierValue());
    record->shareUrl(proxy->bundleURLValue());
    record->setLxproxy(proxy);
    record->setEntitlements(proxy->entitlements());
    record->shareOriginalIdentifier(proxy->originalIdentifierValue());
    record->setLastModified(proxy->registrationDate() ? secondsAsInt32(proxy->registrationDate()->secondsSince1970)
                                                      : 0);
    record->setOnSystemVolume(proxy->isOnSystemPartition());

    std::optional<Value> stored = record->plugInDictionary();
    const Value* explicitVersion = stored ? stored->find(kHubProtocolVersionKey) : nullptr;
    if (explicitVersion != nullptr) {
        record->setHubProtocolVersion(static_cast<uint32_t>(explicitVersion->numberAsUInt64().value_or(0)));
    } else {
        // Old-style plug-ins name their configuration under "Bexil" in the information dictionary.
        record->setHubProtocolVersion(record->infoKey(kOldStyleInfoKey) ? 1 : 2);
    }

    if (const std::shared_ptr<const LXApplicationProxy>& container = proxy->containingBundle())
        record->shareContainingUrl(container->bundleURLValue());

    if (std::optional<Error> error = record->diagnose()) {
        log::ops().info("ignoring mis-configured plug-in at %@: %{public}@", *proxy->bundleURL(),
                        error->localizedDescription());
        return nullptr;
    }
    return record;
}

// ---- Look-ups through the registry ----

std::optional<Value> BXDPlugIn::lookUp(std::string_view key, int scope) const {
    // Before the registry record is attached (during set-up) there is nobody to ask.
    if (!lxproxy_) return std::nullopt;
    return lxproxy_->objectForInfoDictionaryKeyOfClassInScope(key, std::nullopt, static_cast<LXInfoScope>(scope));
}

std::optional<Value> BXDPlugIn::infoKey(std::string_view key) const {
    return lookUp(key, static_cast<int>(LXInfoScope::Info));
}

std::optional<Value> BXDPlugIn::pluginKey(std::string_view key) const {
    return lookUp(key, static_cast<int>(LXInfoScope::PlugIn));
}

std::optional<Value> BXDPlugIn::attribute(std::string_view key) const {
    return lookUp(key, static_cast<int>(LXInfoScope::Attributes));
}

std::optional<Value> BXDPlugIn::bundleInfoDictionary() const {
    if (!lxproxy_) return std::nullopt;
    return lxproxy_->infoVrec();
}

Value BXDPlugIn::prunedInfoDictionaryFor(const Value& dictionary) {
    MutableDictionary pruned;
    for (const DictionaryEntry& entry : dictionary.entries()) {
        if (!entry.key.starts_with(kDebugToolPrefix)) pruned.set(entry.key, entry.value);
    }
    return pruned.take();
}

// ---- Display names ----
//
// The caches are the base record's atomic fields. Two first uses at once may both ask the registry and both store
// the same answer, which is harmless. The records are always made non-const (make_shared), so filling the cache
// from a const getter is sound.

std::optional<std::string> BXDPlugIn::localizedName() const {
    if (std::optional<std::string> cached = BXPlugInCore::localizedName()) return cached;
    std::optional<std::string> fetched = lxproxy_ ? lxproxy_->localizedName() : std::nullopt;
    if (fetched) const_cast<BXDPlugIn*>(this)->shareLocalizedName(lxproxy_->localizedNameValue());
    return fetched;
}

std::optional<std::string> BXDPlugIn::localizedShortName() const {
    if (std::optional<std::string> cached = BXPlugInCore::localizedShortName()) return cached;
    std::optional<std::string> fetched = lxproxy_ ? lxproxy_->localizedShortName() : std::nullopt;
    if (fetched) const_cast<BXDPlugIn*>(this)->shareLocalizedShortName(lxproxy_->localizedShortNameValue());
    return fetched;
}

std::optional<std::string> BXDPlugIn::localizedContainingName() const {
    if (std::optional<std::string> cached = BXPlugInCore::localizedContainingName()) return cached;
    std::optional<std::string> fetched;
    if (lxproxy_ && lxproxy_->containingBundle()) fetched = lxproxy_->containingBundle()->localizedName();
    if (fetched) const_cast<BXDPlugIn*>(this)->setLocalizedContainingName(fetched);
    return fetched;
}

// ---- Resource extensions ----

void BXDPlugIn::augmentForm(MutableDictionary& form) const {
    if (std::optional<Value> made = load(resourceTokens_)) {
        form.set(kExtensionsFormKey, std::move(*made));
        return;
    }
    std::optional<Value> resources = pluginKey(kSharedKey);
    // An application extension's host may read its whole bundle; its "Shared" entry is not used.
    if (isAppExtension()) resources = Value::array({Value::string(kWholeBundle)});
    if (!resources) return;
    bool complete = false;
    Value tokens = issueResourceExtensions(*resources, &complete);
    // A resource without a token (missing for now, say) is asked again next time, and logged again.
    if (complete) {
        BXDPlugIn* self = const_cast<BXDPlugIn*>(this);
        self->store(self->resourceTokens_, std::optional<Value>(tokens));
    }
    form.set(kExtensionsFormKey, std::move(tokens));
}

namespace {

// The entries of the exported form that can change while the record lives.
bool changesWhileKept(std::string_view key) {
    return key == protocol::form::kAnnotations || key == protocol::form::kLocalizedDisplayName ||
           key == protocol::form::kLocalizedShortName || key == protocol::form::kLocalizedContainingDisplayName;
}

std::atomic<size_t> keptBytes{0};
std::atomic<size_t> keptBudget{BXDPlugIn::kKeptFormBudgetBytes};
// Set when the budget was reached and not logged since; the log says so once per time it fills up.
std::atomic<bool> budgetReached{false};

}  // namespace

size_t BXDPlugIn::keptFormBytes() { return keptBytes.load(std::memory_order_relaxed); }

void BXDPlugIn::setKeptFormBudget(size_t bytes) { keptBudget.store(bytes, std::memory_order_relaxed); }

std::shared_ptr<const ZemCodec::Entries> BXDPlugIn::keptFormEntries() const {
    if (std::shared_ptr<const ZemCodec::Entries> kept = load(keptFormEntries_)) return kept;
    Result<MutableDictionary> exported = exportForm();
    if (!exported) return nullptr;
    for (std::string_view key : protocol::form::kList)
        if (changesWhileKept(key)) exported->remove(key);
    Result<ZemCodec::Entries> encoded = ZemCodec::encodeEntries(exported->take());
    if (!encoded) {
        log::ops().error("cannot encode the form of plug-in %@: %@", description(), encoded.error());
        return nullptr;
    }
    // The entries charge the budget for as long as they live: in the record, or in a reply still being written.
    const size_t bytes = sizeof(ZemCodec::Entries) + encoded->bytes.capacity() +
                         encoded->starts.capacity() * sizeof(decltype(encoded->starts)::value_type);
    if (keptBytes.fetch_add(bytes, std::memory_order_relaxed) + bytes > keptBudget.load(std::memory_order_relaxed)) {
        keptBytes.fetch_sub(bytes, std::memory_order_relaxed);
        if (!budgetReached.exchange(true))
            log::ops().info(
                "kept forms hold %zu bytes, the budget (kKeptFormBudgetBytes): further forms are "
                "encoded for each reply",
                keptFormBytes());
        return std::make_shared<const ZemCodec::Entries>(std::move(*encoded));
    }
    std::shared_ptr<const ZemCodec::Entries> kept(new ZemCodec::Entries(std::move(*encoded)),
                                                  [bytes](const ZemCodec::Entries* entries) {
                                                      delete entries;
                                                      keptBytes.fetch_sub(bytes, std::memory_order_relaxed);
                                                      budgetReached.store(false, std::memory_order_relaxed);
                                                  });
    // Two first discoveries at once may both encode it; either result is the same.
    BXDPlugIn* self = const_cast<BXDPlugIn*>(this);
    self->store(self->keptFormEntries_, std::shared_ptr<const ZemCodec::Entries>(kept));
    return kept;
}

void BXDPlugIn::addChangingFormEntries(MutableDictionary& form) const {
    auto setText = [&form](std::string_view key, std::optional<std::string> text) {
        if (text) form.set(key, Value::string(std::move(*text)));
    };
    // The names as the record holds them, as exportForm writes them: asking the registry is for other requests.
    setText(protocol::form::kLocalizedContainingDisplayName, BXPlugInCore::localizedContainingName());
    setText(protocol::form::kLocalizedDisplayName, BXPlugInCore::localizedName());
    setText(protocol::form::kLocalizedShortName, BXPlugInCore::localizedShortName());
}

Value BXDPlugIn::issueResourceExtensions(const Value& paths, bool* complete) const {
    Value list = paths.isString() ? Value::array({paths}) : paths;
    std::string bundle = url().value_or(std::string());
    MutableDictionary result;
    if (complete != nullptr) *complete = true;
    for (const Value& element : list.items()) {
        const std::string* resource = element.getString();
        if (resource == nullptr) continue;
        // Declared paths are joined unchanged; the sandbox resolves the target to its canonical form.
        std::string target = *resource == kWholeBundle ? bundle : bundle + "/" + *resource;
        if (std::optional<std::string> token = BXIssueReadExtension(target)) {
            result.set(*resource, Value::string(std::move(*token)));
        } else {
            int cause = errno;
            if (complete != nullptr) *complete = false;
            log::ops().info("failed to make extension for %@ in plug-in at %@: %{public}s", target, bundle,
                            strerror(cause));
        }
    }
    return result.take();
}

// ---- Enabling for a host ----

std::optional<std::string> BXDPlugIn::startableExecutableOf(const BXBundle* bundle) {
    std::optional<std::string> executable = bundle ? bundle->executablePath() : std::nullopt;
    // A bundle whose executable is missing answers with its own directory, which nothing can start.
    std::error_code ec;
    if (executable && !std::filesystem::is_regular_file(*executable, ec)) return std::nullopt;
    return executable;
}

std::optional<std::string> BXDPlugIn::startableExecutable() const {
    std::shared_ptr<BXBundle> bundle = url() ? BXBundle::initWithURL(*url()) : nullptr;
    return startableExecutableOf(bundle.get());
}

std::string BXDPlugIn::sandboxProfile(const PrivacyConsent& consent) const {
    std::optional<Value> typepadPoint = pluginKey(kExtensionPointKey);
    if (typepadPoint && *typepadPoint == Value::string(std::string(kTypepadPoint))) {
        std::optional<Value> openAccess = attribute(kRequestsOpenAccessKey);
        if (openAccess && openAccess->isBool() && openAccess->getBool() == true &&
            BXHostAccessPolicy::allowedKSNServices(*this, consent).count(std::string(kKSNServiceTypepadNetwork)) != 0)
            return std::string(kDefaultProfile);
        return std::string(kTypepadProfile);
    }
    if (std::optional<Value> dictionary = plugInDictionary()) {
        const Value* point = dictionary->find(kExtensionPointKey);
        const std::string* name = point != nullptr ? point->getString() : nullptr;
        if (name != nullptr)
            for (const PointProfile& entry : kPointProfiles)
                if (*name == entry.point) return std::string(entry.profile);
    }
    return std::string(kDefaultProfile);
}

std::optional<Error> BXDPlugIn::enableForClient(const HostAccessClient& client,
                                                const BXEnableServices& services) const {
    std::string uuidText = uuid() ? uuid()->string() : std::string();
    std::optional<std::string> identifier = this->identifier();
    std::optional<Value> version = this->version();

    MutableDictionary environment;
    std::optional<std::string> container = lxproxy_ ? lxproxy_->dataContainerURL() : std::nullopt;
    if (container) {
        environment.set("HOME", Value::string(*container));
        environment.set("BDFIXED_USER_HOME", Value::string(*container));
        environment.set("TMPDIR", Value::string((std::filesystem::path(*container) / "tmp").string()));
    } else {
        log::ops().debug("no data container for plug-in %@(%@) %{public}@ at %@", identifier, version, uuidText,
                         path());
    }

    std::string profile = sandboxProfile(services.consent);

    if (const char* sdk = std::getenv(kTestSdkVariable.data())) environment.set(kTestSdkVariable, Value::string(sdk));

    MutableDictionary serviceDescription;
    std::optional<Value> service = infoKey(kServiceKey);
    if (service && service->isDictionary()) {
        log::lx().debug("raw ZEMService=%@", *service);
        for (const auto& [key, value] : service->entries()) serviceDescription.set(key, value);
    } else {
        log::ops().info("no ZEMService for plug-in; database returned %@", service);
    }

    // The plug-in's own variables win over the daemon's; an entry that is not a dictionary cannot be merged and is
    // left out, so the daemon's variables stand alone.
    if (const Value* own = serviceDescription.find(kEnvironmentKey); own != nullptr && own->isDictionary())
        for (const auto& [name, value] : own->entries()) environment.set(name, value);
    serviceDescription.set(kEnvironmentKey, environment.take());
    serviceDescription.set(kSandboxProfileKey, Value::string(profile));
    serviceDescription.set(kOmitSandboxParametersKey, Value::boolean(true));

    log::ops().info("assigning plug-in %@(%@) %{public}@ to %s sandbox", identifier, version, uuidText,
                    profile.c_str());

    MutableDictionary overlay;
    overlay.set(kServiceKey, serviceDescription.take());
    overlay.set(kPackageTypeKey, Value::string(std::string(kServicePackageType)));
    Value activation = overlay.take();

    log::ops().notice("allowing host %d %@ to use plug-in %@(%@) uuid=%{public}@ at %@", static_cast<int>(client.pid()),
                      client.path(), identifier, version, uuidText, url());

    std::shared_ptr<BXBundle> bundle = url() ? BXBundle::initWithURL(*url()) : nullptr;
    std::optional<std::string> executable = startableExecutableOf(bundle.get());
    if (!executable) {
        log::ops().error("failed to obtain execPath for plug-in %@(%{public}@) bundle=%@", description(), uuidText,
                         bundle ? bundle->description() : std::string("(null)"));
        return BXError(ErrorCode::OperationFailed,
                       formatPrintf("cannot obtain executable path for plug-in %@(%@)", identifier, uuidText));
    }

    log::ops().debug("activation overlay=%@", activation);
    if (int error = services.serviceManager.addExternalService(client.pid(), *executable, activation, client.pidfd());
        error != 0) {
        log::ops().error("jobard error %d trying to allow %d %@ to use plug-in %@(%@) uuid=%{public}@ at %@", error,
                         static_cast<int>(client.pid()), client.path(), identifier, version, uuidText, path());
        return BXError(ErrorCode::OperationFailed,
                       formatPrintf("unable to enable plug-in %@(%@)", identifier, uuidText));
    }
    return std::nullopt;
}

// ---- Entitlements and annotations ----

std::optional<Value> BXDPlugIn::valueForEntitlement(std::string_view key) const {
    std::optional<Value> all = entitlements();
    if (!all) return std::nullopt;
    const Value* value = all->find(key);
    if (value == nullptr) return std::nullopt;
    return *value;
}

bool BXDPlugIn::hasEntitlement(std::string_view key) const {
    std::optional<Value> value = valueForEntitlement(key);
    // Numbers compare across kinds, so false, 0 and 0.0 all read as "not entitled".
    return value && !(*value == Value::boolean(false));
}

std::string BXDPlugIn::annotationKey() const {
    std::optional<Value> replaced = valueForEntitlement(kReplacePlugInEntitlement);
    if (replaced && replaced->isString()) return *replaced->getString();
    return identifier().value_or(std::string());
}

// ---- Checks ----

bool BXDPlugIn::match(const Value& rules, const BXMatchContext& context) const {
    return BXMatchRules::match(rules, *this, context);
}

bool BXDPlugIn::matchKeyPattern(std::string_view key, const Value& pattern, const BXMatchContext& context) const {
    return BXMatchRules::matchKeyPattern(key, pattern, *this, context);
}

std::optional<std::string> BXDPlugIn::allowForClient(const HostAccessClient& client,
                                                     const BXMatchContext& context) const {
    return BXHostAccessPolicy::allowForClient(*this, client,
                                              [&](const Value& ruleSet) { return match(ruleSet, context); });
}

std::optional<Error> BXDPlugIn::diagnose() const {
    if (std::optional<Error> error = BXPlugInCore::diagnose()) return error;
    if (!isData() && !(lxproxy_ && lxproxy_->dataContainerURL()))
        return misconfigured("this plug-in has no sandbox data container");
    if (!containingUrl()) {
        std::optional<std::string> location = path();
        if (!location || !location->starts_with(kSystemPrefix))
            return misconfigured("plug-ins outside containing apps must be in /System");
    }
    return std::nullopt;
}

std::string BXDPlugIn::description() const {
    std::optional<Uuid> u = uuid();
    return "<BXDPlugIn " + identifier().value_or("(no identifier)") + " " + (u ? u->string() : "(no uuid)") + " " +
           url().value_or("(no path)") + ">";
}

std::optional<Value> BXDPlugIn::checkBusy(const ProcessAssertions& assertions) const {
    std::optional<Value> identifier = infoKey("BDBundleIdentifier");
    if (!identifier || !identifier->isString()) return std::nullopt;
    for (const Value& instance : assertions.busyExtensionInstances({std::string(identifier->stringView())})) {
        const std::string* busy = instance.get(ProcessAssertions::kBundleIdentifierKey).getString();
        if (!busy) {
            log::ops().error("wardend reported incomplete bundle for plug-in %@/%{public}@", this->identifier(),
                             uuid() ? uuid()->string() : std::string("(none)"));
            continue;
        }
        return Value::dictionary({{ProcessAssertions::kBundleIdentifierKey, Value::string(*busy)}});
    }
    return std::nullopt;
}

}  // namespace bexil
