#pragma once

// BXDPlugIn is the plug-in record as the daemon holds it: built from the registry's record of the plug-in, which it
// keeps for life and asks for every configuration question instead of keeping its own copies of the dictionaries.
// It adds entitlement queries, the annotation key and the stricter placement checks. The database builds and caches
// records on its lock `_sync`; afterwards any queue may read them (the stored properties are atomic, lxproxy is
// written once before the record is shared).

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "base/Error.h"
#include "bexil/Value.h"
#include "model/BXPlugInCore.h"
#include "platform/jobard/ServiceManager.h"
#include "platform/ksn/PrivacyConsent.h"
#include "platform/wardend/ProcessAssertions.h"
#include "platform/zem/ZemCodec.h"
#include "policy/BXMatchRules.h"
#include "policy/HostAccessClient.h"

namespace bexil {

class BXBundle;
class LXBexilProxy;

// What enabling a plug-in uses besides the host: the service manager that keeps the grant, and the user's privacy
// consent (which chooses the sandbox of typepad plug-ins). Both outlive the call.
struct BXEnableServices {
    ServiceManager& serviceManager;
    const PrivacyConsent& consent;
};

class BXDPlugIn : public BXPlugInCore {
  public:
    // Lets a plug-in take over the annotations (and the user's election) of the identifier it names.
    static constexpr std::string_view kReplacePlugInEntitlement = "com.quorvel.developer.replace-plugin";
    // Makes the database elect the plug-in automatically the first time it builds its record.
    static constexpr std::string_view kAutoElectEntitlement = "com.quorvel.developer.auto-elect-plugin";
    // Plug-ins outside any application must live below this directory.
    static constexpr std::string_view kSystemPrefix = "/System/";
    // What the kept form entries of all records may hold together (see keptFormEntries). A full discovery keeps
    // about 1 KB per plug-in, so a large registry would otherwise double the cache's memory; past the budget a
    // form's entries are encoded for the reply at hand and not kept (logged when first reached).
    static constexpr size_t kKeptFormBudgetBytes = 16 * 1024 * 1024;

    BXDPlugIn() = default;

    // initWithLXData: the record of a registry plug-in, or none when the registry record has no bundle URL, the
    // record cannot be set up, or diagnose finds it mis-configured (logged at info level).
    static std::shared_ptr<BXDPlugIn> initWithLXData(std::shared_ptr<const LXBexilProxy> proxy);

    // The three look-ups ask the registry: scope 2 (information dictionary), 1 (plug-in dictionary), 0 (attributes).
    std::optional<Value> infoKey(std::string_view key) const override;
    std::optional<Value> pluginKey(std::string_view key) const override;
    std::optional<Value> attribute(std::string_view key) const override;
    // The registry's information dictionary, asked anew on every call.
    std::optional<Value> bundleInfoDictionary() const override;

    // A new dictionary with every entry of `dictionary` except those whose key begins with "DT".
    static Value prunedInfoDictionaryFor(const Value& dictionary);

    // Display names: fetched from the registry on first use and cached; an absent answer is not cached.
    std::optional<std::string> localizedName() const override;
    std::optional<std::string> localizedShortName() const override;
    std::optional<std::string> localizedContainingName() const override;

    // Adds "extensions" to the form: read-only tokens for the whole bundle (".") of an application extension, else
    // for the plug-in dictionary's "Shared" resources; a plug-in with neither leaves the form unchanged. The tokens
    // are made once per record, the first time every resource gets one, and shared by every later form: a token
    // names the path the resource resolved to then, and stays good for the run of the daemon.
    void augmentForm(MutableDictionary& form) const;
    // The exported form splits in two for discovery, which sends many forms and most of each again and again. The
    // kept entries are those that stay as they are for the record's life, encoded once, the first time they are
    // asked for, and shared by every later reply: the record is dropped when its registration changes. They are
    // everything exportForm writes but the annotations (the database's, changed by annotating and electing) and
    // the display names (filled in when first asked of the registry), which addChangingFormEntries writes on every
    // call, besides what augmentForm adds. Null when the form cannot be encoded (logged).
    std::shared_ptr<const ZemCodec::Entries> keptFormEntries() const;
    // The bytes the kept form entries of all records hold now, and the budget they may hold (kKeptFormBudgetBytes
    // unless changed, as tests and benchmarks do). Safe on any thread.
    static size_t keptFormBytes();
    static void setKeptFormBudget(size_t bytes);
    void addChangingFormEntries(MutableDictionary& form) const;
    // Tokens for resource paths inside the bundle ("." is the bundle itself), keyed by the path as given. `paths`
    // is one string or an array; other elements are passed over; paths that get no token are left out (logged), and
    // `complete`, when given, says whether none was.
    Value issueResourceExtensions(const Value& paths, bool* complete = nullptr) const;

    // The privacy-consent service that lets a typepad plug-in that asks for open access run in the ordinary
    // plug-in sandbox, which may reach the network.
    static constexpr std::string_view kKSNServiceTypepadNetwork = "typepad-network";
    // The package type the service manager expects in an activation overlay.
    static constexpr std::string_view kServicePackageType = "ZEM!";

    // The plug-in's executable when it is a file that can be started; none when the bundle cannot be opened or
    // names no executable that exists. Reads the bundle from disk.
    std::optional<std::string> startableExecutable() const;
    static std::optional<std::string> startableExecutableOf(const BXBundle* bundle);

    // The sandbox profile the plug-in runs under: by its extension point, and for a typepad plug-in by whether it
    // asks for open access and the user granted its application the typepad network.
    std::string sandboxProfile(const PrivacyConsent& consent) const;
    // enableForClient: builds the plug-in's service description (its "ZEMService", the environment of its data
    // container, the sandbox profile) and grants `client` the right to start its executable with it. Errors have
    // code 4. Keeps nothing in the record; calling it again repeats the grant.
    std::optional<Error> enableForClient(const HostAccessClient& client, const BXEnableServices& services) const;

    // The value of `key` in the plug-in's entitlements, or none.
    std::optional<Value> valueForEntitlement(std::string_view key) const;
    // True unless the entitlement is absent or equal to false (false, 0).
    bool hasEntitlement(std::string_view key) const;
    // The replace-plugin entitlement when it is a string, else the identifier.
    std::string annotationKey() const;

    // A description of a busy instance of this plug-in ({ProcessAssertions::kBundleIdentifierKey: identifier}),
    // or none when no instance is busy. Instances reported without a bundle identifier are logged and passed over.
    std::optional<Value> checkBusy(const ProcessAssertions& assertions) const;

    // match: whether the plug-in satisfies every rule of `rules` (a null or empty rule set always matches). The
    // election is read through `context`'s annotation source. REQUIRES: not on the database's queue.
    bool match(const Value& rules, const BXMatchContext& context = {}) const;
    // matchKey:pattern: one rule of a rule set.
    bool matchKeyPattern(std::string_view key, const Value& pattern, const BXMatchContext& context = {}) const;
    // allowForClient: the reason why `client` may not use this plug-in, or nothing when it may. A host that
    // restricts itself with a rule set has it evaluated with `context`.
    std::optional<std::string> allowForClient(const HostAccessClient& client, const BXMatchContext& context = {}) const;

    // The base checks, then: a plug-in that carries code needs a data container; a plug-in outside any
    // application must live below /System/. Errors have code 12.
    std::optional<Error> diagnose() const override;

    std::string description() const override;

    const std::shared_ptr<const LXBexilProxy>& lxproxy() const { return lxproxy_; }
    // REQUIRES: before the record is shared with another queue.
    void setLxproxy(std::shared_ptr<const LXBexilProxy> proxy) { lxproxy_ = std::move(proxy); }

  private:
    std::optional<Value> lookUp(std::string_view key, int scope) const;

    std::shared_ptr<const LXBexilProxy> lxproxy_;
    // The "extensions" of augmentForm once every resource got its token; guarded by the record's lock. Resolving a
    // resource's real path costs system calls that walk the path, most of what exporting a form cost.
    std::optional<Value> resourceTokens_;
    // What keptFormEntries made; guarded by the record's lock.
    std::shared_ptr<const ZemCodec::Entries> keptFormEntries_;
};

}  // namespace bexil
