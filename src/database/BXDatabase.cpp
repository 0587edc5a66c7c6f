#include "database/BXDatabase.h"

// Every record the daemon hands out comes from here. The cache is a plain map guarded by `_sync`; the registry is
// asked outside `_sync` wherever the algorithm allows (look-ups by path and by application), so a slow registry
// query never blocks the annotation operations of other requests. The purge is deliberately all or nothing: the
// limit exists to bound memory in pathological cases, not to implement an eviction policy. Emptying the map is one
// swap inside `_sync`; freeing what it held (a large cache takes a good fraction of a second) is left to the
// writer's thread in batches, between whatever writes are queued there.
//
// Annotation changes are made in memory inside `_sync` and written by saveAnnotations on the writer, outside
// `_sync`: a snapshot of the map (a shared, immutable value) is taken inside, written without the lock, and its
// outcome noted inside again. Writes follow one another on the writer, so a snapshot never overtakes a newer one.

#include <algorithm>
#include <cctype>
#include <mutex>
#include <unordered_set>

#include "base/QueueAssert.h"
#include "database/BXDAnnotationStore.h"
#include "model/BXUtilities.h"
#include "platform/ledgerix/LXApplicationProxy.h"
#include "platform/ledgerix/LXApplicationWorkspace.h"
#include "platform/ledgerix/LXApplicationWorkspaceObserverProtocol.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/log/Log.h"
#include "platform/notify/SystemNotifications.h"
#include "policy/BXDPlugIn.h"
#include "policy/BXMatchRules.h"

namespace bexil {

namespace {

constexpr std::string_view kAnnotationsFormKey = protocol::form::kAnnotations;

std::string pathOf(const std::shared_ptr<const LXBexilProxy>& proxy) { return proxy->bundleURL().value_or("(null)"); }

std::string uuidText(const std::shared_ptr<const LXBexilProxy>& proxy) {
    return proxy->pluginUUID() ? proxy->pluginUUID()->string() : std::string("(null)");
}

}  // namespace

// Gives the match rules the stored annotation of a daemon record, entering `_sync` for each read. Records of other
// kinds have no annotation key of the daemon's and so no stored annotation.
class BXDatabase::AnnotationReader final : public BXAnnotationSource {
  public:
    explicit AnnotationReader(BXDatabase& database) : database_(database) {}
    Value annotationForPlugIn(const BXPlugInCore& plugIn) const override {
        const auto* record = dynamic_cast<const BXDPlugIn*>(&plugIn);
        if (record == nullptr) return Value();
        return database_.annotationForPlugIn(*record);
    }

  private:
    BXDatabase& database_;
};

// Forwards the registry's callbacks to the database that owns it.
class BXDatabase::Observer final : public LXApplicationWorkspaceObserverProtocol {
  public:
    explicit Observer(BXDatabase& database) : database_(database) {}
    void pluginsDidInstall(const std::vector<std::shared_ptr<const LXBexilProxy>>& plugIns) override {
        database_.pluginsDidInstall(plugIns);
    }
    void pluginsWillUninstall(const std::vector<std::shared_ptr<const LXBexilProxy>>& plugIns) override {
        database_.pluginsWillUninstall(plugIns);
    }

  private:
    BXDatabase& database_;
};

BXDatabase::BXDatabase(std::optional<std::string> databasePath, std::shared_ptr<LXApplicationWorkspace> workspace,
                       NotificationPoster poster)
    : databasePath_(std::move(databasePath)),
      workspace_(std::move(workspace)),
      poster_(std::move(poster)),
      annotationSource_(std::make_unique<AnnotationReader>(*this)) {}

BXDatabase::~BXDatabase() {
    if (workspace_ && observer_) workspace_->removeObserver(observer_.get());
    // Changes queued for the disk are written before the store goes away.
    if (!writer_.isCurrent()) waitForWriter();
}

std::unique_ptr<BXDatabase> BXDatabase::create(std::optional<std::string> databasePath,
                                               std::shared_ptr<LXApplicationWorkspace> workspace,
                                               NotificationPoster poster) {
    std::unique_ptr<BXDatabase> database(
        new BXDatabase(std::move(databasePath), std::move(workspace), std::move(poster)));
    if (!database->initWithDatabase()) return nullptr;
    return database;
}

bool BXDatabase::initWithDatabase() {
    if (!workspace_) {
        Result<std::shared_ptr<LXApplicationWorkspace>> shared = LXApplicationWorkspace::defaultWorkspace();
        if (!shared) {
            log::ops().error("unable to open the application registry: %@", shared.error());
            return false;
        }
        workspace_ = *shared;
    }
    try {
        annotations_ = std::make_unique<BXDAnnotationStore>(databasePath_);
    } catch (const InternalInconsistency& e) {
        // The store could locate neither the document nor the daemon's container: nothing to serve annotations from.
        log::ops().error("unable to open the annotation store: %s", e.what());
        return false;
    }
    if (!poster_) {
        auto notifications = std::make_shared<SystemNotifications>();
        poster_ = [notifications](std::string_view name) {
            if (std::optional<Error> error = notifications->post(name))
                log::ops().error("unable to post %{public}@: %@", name, *error);
        };
    }
    observer_ = std::make_shared<Observer>(*this);
    workspace_->addObserver(observer_);
    return true;
}

BXDAnnotationStore& BXDatabase::annotations() {
    BX_ASSERT_ON_QUEUE(_sync);
    return *annotations_;
}

// ---- Records ----

std::shared_ptr<BXDPlugIn> BXDatabase::plugInForProxy(const std::shared_ptr<const LXBexilProxy>& proxy) {
    if (!proxy) return nullptr;
    return _sync.sync([&]() -> std::shared_ptr<BXDPlugIn> {
        if (proxy->pluginUUID()) {
            auto hit = cache_.find(*proxy->pluginUUID());
            if (hit != cache_.end()) return hit->second;
        }
        return createPlugInForProxy(proxy);
    });
}

std::shared_ptr<BXDPlugIn> BXDatabase::createPlugInForProxy(const std::shared_ptr<const LXBexilProxy>& proxy) {
    BX_ASSERT_ON_QUEUE(_sync);
    std::shared_ptr<BXDPlugIn> plugIn = BXDPlugIn::initWithLXData(proxy);
    if (!plugIn) return nullptr;
    if (plugIn->hasEntitlement(BXDPlugIn::kAutoElectEntitlement)) autoElect(*plugIn);
    purgeCachesToLimit(cacheLimit());
    // A record always has a UUID after set-up (a random one when the registry gave none). One it replaces is let go
    // outside cacheEntries_, which is held around the change itself only.
    std::shared_ptr<BXDPlugIn> replaced = plugIn;
    {
        std::unique_lock entries(cacheEntries_);
        cache_[*plugIn->uuid()].swap(replaced);
    }
    return plugIn;
}

void BXDatabase::purgeCachesToLimit(unsigned limit) {
    BX_ASSERT_ON_QUEUE(_sync);
    if (cache_.size() <= limit) return;
    log::ops().info("purging cache for %d > %d", cache_.size(), limit);
    auto released = std::make_shared<RecordMap>();
    {
        std::unique_lock entries(cacheEntries_);
        released->swap(cache_);
    }
    purgesReleasing_.fetch_add(1);
    releaseOnWriter(std::move(released));
}

void BXDatabase::releaseOnWriter(std::shared_ptr<RecordMap> records) {
    writer_.async([this, records = std::move(records)] {
        for (size_t i = 0; i < kPurgeReleaseBatch && !records->empty(); ++i) records->erase(records->begin());
        if (!records->empty()) {
            releaseOnWriter(records);
            return;
        }
        // The registry's statement and page caches go last, also off the purging thread: freeing them takes
        // milliseconds with a large registry.
        workspace_->LXClearSchemaCaches();
        purgesReleasing_.fetch_sub(1);
    });
}

std::shared_ptr<BXDPlugIn> BXDatabase::findPlugIn(const Uuid& uuid) {
    return _sync.sync([&]() -> std::shared_ptr<BXDPlugIn> {
        auto hit = cache_.find(uuid);
        if (hit != cache_.end()) return hit->second;
        if (std::shared_ptr<const LXBexilProxy> proxy = workspace_->plugInProxyForUUID(uuid))
            return createPlugInForProxy(proxy);
        log::ops().info("Ledgerix cannot find plug-in with UUID:%{public}@", uuid.string());
        return nullptr;
    });
}

std::shared_ptr<BXDPlugIn> BXDatabase::findPlugInAtPath(std::string_view url) {
    std::shared_ptr<const LXBexilProxy> proxy = workspace_->plugInProxyForURL(url);
    if (!proxy) {
        log::ops().info("Ledgerix cannot find plug-in at path:%@", url);
        return nullptr;
    }
    // A registry record always carries its UUID; one without cannot be looked up by it.
    if (!proxy->pluginUUID()) return nullptr;
    return findPlugIn(*proxy->pluginUUID());
}

std::optional<std::vector<std::shared_ptr<BXDPlugIn>>> BXDatabase::plugInsWithinApplication(std::string_view url) {
    std::shared_ptr<const LXApplicationProxy> application = workspace_->applicationProxyForBundleURL(url);
    if (!application || application->plugIns().empty()) return std::nullopt;
    std::vector<std::shared_ptr<BXDPlugIn>> plugIns;
    for (const std::shared_ptr<const LXBexilProxy>& proxy : application->plugIns()) {
        if (std::shared_ptr<BXDPlugIn> plugIn = plugInForProxy(proxy)) plugIns.push_back(std::move(plugIn));
    }
    return plugIns;
}

// ---- Discovery ----

std::optional<std::string> BXDatabase::normalizeElection(const Value& value) {
    const std::string* text = value.getString();
    if (text == nullptr || text->empty()) return std::nullopt;
    if (text->front() == '=') return text->substr(1);
    if (!std::isalnum(static_cast<unsigned char>(text->front()))) return std::nullopt;
    return *text;
}

std::optional<std::vector<std::string>> BXDatabase::wantedElections(const Value& query) {
    const Value* election = query.isDictionary() ? query.find(kUserElectionQueryKey) : nullptr;
    if (election == nullptr) return std::nullopt;
    std::vector<std::string> wanted;
    if (election->isString()) {
        std::optional<std::string> value = normalizeElection(*election);
        if (!value) return std::nullopt;
        wanted.push_back(std::move(*value));
    } else if (election->isArray()) {
        for (const Value& element : election->items()) {
            std::optional<std::string> value = normalizeElection(element);
            // One bad element switches filtering off for the whole query rather than narrowing it silently.
            if (!value) return std::nullopt;
            wanted.push_back(std::move(*value));
        }
    } else {
        return std::nullopt;
    }
    return wanted;
}

bool BXDatabase::electionFilter(const std::vector<std::string>& wanted, std::string_view identifier,
                                const std::optional<Value>& entitlements) {
    // The same key as the record's annotationKey: a replacing plug-in is filtered by the election it took over.
    std::string key(identifier);
    const Value* replaced = entitlements ? entitlements->find(BXDPlugIn::kReplacePlugInEntitlement) : nullptr;
    if (replaced != nullptr && replaced->isString()) key = replaced->stringView();

    Value annotation = _sync.sync([&] { return annotations_->annotationForIdentifier(key); });
    int64_t election = 0;
    if (annotation.isDictionary() && annotation.contains(kElectionKey)) {
        election = BXMatchRules::electionFromAnnotation(annotation);
    } else {
        // Not elected yet: a plug-in entitled to automatic election counts as elected, as it will be once built.
        const Value* automatic = entitlements ? entitlements->find(BXDPlugIn::kAutoElectEntitlement) : nullptr;
        std::optional<double> number = automatic != nullptr ? automatic->numberAsDouble() : std::nullopt;
        election = number && *number != 0 ? 1 : 0;
    }
    std::string text = std::to_string(election & 0xff);
    bool keep = std::find(wanted.begin(), wanted.end(), text) != wanted.end();
    log::ops().debug("lx filter %@ -> %d", key, keep ? 1 : 0);
    return keep;
}

LXPreselection BXDatabase::preselectionFor(const Value& query) const {
    return LXPreselection{
        .extensionPoints = BXMatchRules::requiredValues(query, BXMatchRules::kExtensionPointKey),
        .identifiers = BXMatchRules::requiredValues(query, BXMatchRules::kIdentifierKey),
    };
}

LXPlugInFilter BXDatabase::filterFor(const Value& query) {
    // No filter at all when the query wants no election: the registry then never reads a candidate's entitlements
    // for it, which costs decoding them for every row of every query.
    std::optional<std::vector<std::string>> wanted = wantedElections(query);
    if (!wanted) return {};
    return [this, wanted = std::move(*wanted)](std::string_view identifier, const std::optional<Value>& entitlements) {
        return electionFilter(wanted, identifier, entitlements);
    };
}

std::optional<BXDatabase::PlugInSet> BXDatabase::findPlugIns(const Value& query) {
    BX_ASSERT_NOT_ON_QUEUE(_sync);
    const bool all = !query.isDictionary() || query.count() == 0;
    const LXPlugInFilter filter = all ? LXPlugInFilter() : filterFor(query);
    const LXPreselection preselection = all ? LXPreselection{} : preselectionFor(query);
    size_t cachedBefore = cachedCount();
    std::optional<PlugInSet> result = recordsAsking([&](const LXKnownRecord& known) {
        std::optional<LXCandidateList> candidates =
            all ? workspace_->installedCandidates(known)
                : workspace_->candidatesMatchingQuery(query, filter, preselection, known);
        log::lx().debug("%d plugin(s) matching %@", candidates ? candidates->size() : 0, query);
        return candidates;
    });
    if (!result) return std::nullopt;
    log::ops().debug("LX reported %u plug-ins (cache %u/%u)", result->size(), cachedBefore, cachedCount());
    return result;
}

bool BXDatabase::cacheHolds(const Uuid& uuid) const {
    std::shared_lock entries(cacheEntries_);
    return cache_.count(uuid) > 0;
}

std::optional<BXDatabase::PlugInSet> BXDatabase::recordsAsking(
    const std::function<std::optional<LXCandidateList>(const LXKnownRecord& known)>& ask) {
    std::optional<LXCandidateList> candidates = ask([this](const Uuid& uuid) { return cacheHolds(uuid); });
    if (!candidates) return std::nullopt;
    if (std::optional<PlugInSet> records = recordsForCandidates(*candidates)) return records;
    // What the registry left out may have changed since: its record is read again rather than guessed, the
    // query's other candidates with it, so that the answer is one state of the registry.
    log::ops().debug("a record left out of a query went from the cache meanwhile; asking the registry again");
    candidates = ask(LXKnownRecord());
    if (!candidates) return std::nullopt;
    return recordsForCandidates(*candidates);
}

std::optional<BXDatabase::PlugInSet> BXDatabase::findPlugInsWithIdentifier(const Value& query,
                                                                           const std::string& identifier) {
    BX_ASSERT_NOT_ON_QUEUE(_sync);
    // Pre-selected by the identifier alone: it names a handful of rows, where the query's extension point may name
    // thousands, each of which would be read only to be dropped. The caller checks every rule anyway.
    LXPreselection preselection{.extensionPoints = std::nullopt, .identifiers = std::vector<std::string>{identifier}};
    std::optional<LXProxyList> proxies =
        workspace_->pluginsMatchingQueryApplyFilter(query, filterFor(query), preselection);
    if (!proxies) return std::nullopt;
    // The pre-selection keeps plug-ins without an identifier key as candidates, and compares keys, not identifiers.
    std::erase_if(*proxies, [&](const std::shared_ptr<const LXBexilProxy>& proxy) {
        return proxy->pluginIdentifier().value_or("") != identifier;
    });
    return recordsForProxies(*proxies);
}

std::optional<BXDatabase::PlugInSlice> BXDatabase::findPlugInsAfterIdentifier(const Value& query,
                                                                              const std::optional<std::string>& after,
                                                                              size_t rows) {
    BX_ASSERT_NOT_ON_QUEUE(_sync);
    // An empty query is every installed plug-in, as in findPlugIns: no pre-selection, and no election is wanted.
    const LXPlugInFilter filter = filterFor(query);
    const LXPreselection preselection = preselectionFor(query);
    std::optional<LXCandidateSlice> slice;
    std::optional<PlugInSet> records = recordsAsking([&](const LXKnownRecord& known) -> std::optional<LXCandidateList> {
        slice = workspace_->candidatesAfterIdentifier(query, filter, preselection, after, rows, known);
        if (!slice) return std::nullopt;
        return std::move(slice->candidates);
    });
    if (!records) return std::nullopt;
    return PlugInSlice{std::move(*records), std::move(slice->last), slice->ended};
}

std::optional<BXDatabase::PlugInStretch> BXDatabase::findPlugInsAfterRegistration(const Value& query, int64_t after,
                                                                                  size_t rows) {
    BX_ASSERT_NOT_ON_QUEUE(_sync);
    // As in findPlugIns, an empty query is every installed plug-in without election filtering.
    const bool all = !query.isDictionary() || query.count() == 0;
    const LXPlugInFilter filter = all ? LXPlugInFilter() : filterFor(query);
    const LXPreselection preselection = all ? LXPreselection{} : preselectionFor(query);
    std::optional<LXRegistrationSlice> slice;
    std::optional<PlugInSet> records = recordsAsking([&](const LXKnownRecord& known) -> std::optional<LXCandidateList> {
        slice = workspace_->candidatesAfterRegistration(query, filter, preselection, after, rows, known);
        if (!slice) return std::nullopt;
        return std::move(slice->candidates);
    });
    if (!records) return std::nullopt;
    return PlugInStretch{std::move(*records), slice->last, slice->ended};
}

std::optional<uint64_t> BXDatabase::registryVersion() { return workspace_->contentVersion(); }

BXDatabase::PlugInSet BXDatabase::recordsForProxies(const LXProxyList& proxies) {
    LXCandidateList candidates;
    candidates.reserve(proxies.size());
    for (const std::shared_ptr<const LXBexilProxy>& proxy : proxies)
        candidates.push_back(LXCandidate{proxy, {}, false});
    // Every candidate has its registry record: there is none to miss in the cache.
    return *recordsForCandidates(candidates);
}

std::optional<BXDatabase::PlugInSet> BXDatabase::recordsForCandidates(const LXCandidateList& candidates) {
    PlugInSet result;
    result.reserve(candidates.size());
    std::unordered_set<Uuid> seen;
    std::vector<const LXCandidate*> wanted;
    wanted.reserve(candidates.size());
    for (const LXCandidate& candidate : candidates) {
        const std::shared_ptr<const LXBexilProxy>& proxy = candidate.proxy;
        if (!proxy) {
            if (candidate.inPlaceholderApplication) {
                log::ops().info("skipping plug-in %@ because its app is a placeholder", candidate.uuid.string());
                continue;
            }
            wanted.push_back(&candidate);
            continue;
        }
        if (!proxy->bundleURL()) {
            log::ops().info("skipping lx proxy %@ with nil bundleURL", proxy->description());
            continue;
        }
        // A containing bundle is always an application record: the registry's interface has no other kind to
        // hand out, so the type itself rules out a containing bundle of the wrong kind.
        const std::shared_ptr<const LXApplicationProxy>& application = proxy->containingBundle();
        if (application && application->isPlaceholder()) {
            log::ops().info("skipping lx proxy %@ because its app is a placeholder", proxy->description());
            continue;
        }
        wanted.push_back(&candidate);
    }
    // The records are looked up a stretch at a time inside `_sync`, not one entry each: a discovery of every plug-in
    // would otherwise enter it once per candidate. A stretch bounds how long a cold cache, which builds the records,
    // keeps others out.
    constexpr size_t kStretch = 64;
    bool uncached = false;
    for (size_t from = 0; from < wanted.size() && !uncached; from += kStretch) {
        const size_t to = std::min(wanted.size(), from + kStretch);
        _sync.sync([&] {
            for (size_t i = from; i < to; ++i) {
                const std::shared_ptr<const LXBexilProxy>& proxy = wanted[i]->proxy;
                std::shared_ptr<BXDPlugIn> plugIn;
                if (!proxy) {
                    auto hit = cache_.find(wanted[i]->uuid);
                    if (hit == cache_.end()) {
                        uncached = true;
                        return;
                    }
                    plugIn = hit->second;
                } else if (proxy->pluginUUID()) {
                    auto hit = cache_.find(*proxy->pluginUUID());
                    if (hit != cache_.end()) plugIn = hit->second;
                }
                if (!plugIn) plugIn = createPlugInForProxy(proxy);
                if (!plugIn) continue;
                if (seen.insert(*plugIn->uuid()).second) result.push_back(std::move(plugIn));
            }
        });
    }
    if (uncached) return std::nullopt;
    return result;
}

std::optional<Error> BXDatabase::addPlugIn(std::string_view url, std::optional<UserIdentity> readAs) {
    Result<std::shared_ptr<const LXBexilProxy>> registered = workspace_->registerPlugin(url, readAs);
    if (!registered) {
        log::ops().debug("registry refused %@: %@", url, registered.error());
        return BXError(ErrorCode::RegistryRefused, "Ledgerix failed to register the plug-in");
    }
    return std::nullopt;
}

std::optional<Error> BXDatabase::removePlugIn(std::string_view url) {
    if (std::optional<Error> error = workspace_->unregisterPlugin(url)) {
        log::ops().debug("registry refused to unregister %@: %@", url, *error);
        return BXError(ErrorCode::RegistryRefused, "Ledgerix failed to deregister the plug-in");
    }
    return std::nullopt;
}

size_t BXDatabase::cachedCount() {
    return _sync.sync([&] { return cache_.size(); });
}

// ---- Annotations ----

Value BXDatabase::annotationForPlugIn(const BXDPlugIn& plugIn) {
    return _sync.sync([&] { return annotations_->annotationForPlugIn(plugIn); });
}

void BXDatabase::setAnnotationForPlugIn(const Value& annotation, const BXDPlugIn& plugIn) {
    changeAnnotationForPlugIn(annotation, plugIn);
    if (writer_.isCurrent())
        saveAnnotations();
    else
        writer_.sync([this] { saveAnnotations(); });
}

uint64_t BXDatabase::annotationGeneration() {
    return _sync.sync([&] { return annotations_->generation(); });
}

void BXDatabase::changeAnnotationForPlugIn(const Value& annotation, const BXDPlugIn& plugIn) {
    _sync.sync([&] { annotations_->changeAnnotationForPlugIn(annotation, plugIn); });
}

void BXDatabase::saveAnnotations() {
    BX_ASSERT_ON_QUEUE(writer_);
    std::optional<BXDAnnotationStore::Snapshot> snapshot =
        _sync.sync([&]() -> std::optional<BXDAnnotationStore::Snapshot> {
            if (annotations_->savedGeneration() >= annotations_->generation()) return std::nullopt;
            return annotations_->snapshot();
        });
    if (!snapshot) return;
    std::optional<Error> error = annotations_->writeSnapshot(*snapshot);
    _sync.sync([&] { annotations_->noteSaved(*snapshot, error); });
    if (error)
        log::ops().error("unable to save annotations:%{public}@ error:%{public}@", snapshot->url.string(), *error);
}

void BXDatabase::waitForWriter() {
    BX_ASSERT_NOT_ON_QUEUE(writer_);
    do {
        writer_.sync([] {});
    } while (releasingPurgedRecords());
}

void BXDatabase::addAnnotationForPlugInIn(const BXDPlugIn& plugIn, MutableDictionary& form) {
    Value annotation = annotationForPlugIn(plugIn);
    form.set(kAnnotationsFormKey, annotation.isDictionary() ? annotation : Value::emptyDictionary());
}

void BXDatabase::notifyAnnotationChange() { poster_(kAnnotationChangeNotification); }

void BXDatabase::autoElect(const BXDPlugIn& plugIn) {
    BX_ASSERT_ON_QUEUE(_sync);
    // The store directly: the database's own annotation operations would enter `_sync` again.
    Value current = annotations_->annotationForPlugIn(plugIn);
    if (!current.isDictionary()) current = Value::emptyDictionary();
    const Value* election = current.find(kElectionKey);
    if (election != nullptr && !(*election == Value::int64(0))) return;
    std::optional<Value> elected = dictionaryChangingTo(current, kElectionKey, Value::int64(kAutoElection));
    annotations_->changeAnnotationForPlugIn(*elected, plugIn);
    // Nobody waits for this one: an election lost to a crash is made again when the record is next built.
    writer_.async([this] { saveAnnotations(); });
    if (BXDatabaseDelegate* target = delegate()) target->electedAutomatically(plugIn);
}

// ---- Registry events ----

void BXDatabase::pluginsDidInstall(const std::vector<std::shared_ptr<const LXBexilProxy>>& plugIns) {
    for (const std::shared_ptr<const LXBexilProxy>& proxy : plugIns) {
        log::ops().notice("plug-in INSTALLED:%@ %@(%@) %{public}@ %@", proxy->bundleIdentifier(),
                          proxy->pluginIdentifier(), proxy->bundleVersion(), uuidText(proxy), pathOf(proxy));
    }
    if (BXDatabaseDelegate* target = delegate()) target->installedPlugIns(plugIns);
}

void BXDatabase::pluginsWillUninstall(const std::vector<std::shared_ptr<const LXBexilProxy>>& plugIns) {
    _sync.sync([&] {
        for (const std::shared_ptr<const LXBexilProxy>& proxy : plugIns) {
            log::ops().notice("plug-in UNINSTALLED:%@ %@(%@) %{public}@ %@", proxy->bundleIdentifier(),
                              proxy->pluginIdentifier(), proxy->bundleVersion(), uuidText(proxy), pathOf(proxy));
            if (!proxy->pluginUUID()) continue;
            std::shared_ptr<BXDPlugIn> dropped;
            {
                std::unique_lock entries(cacheEntries_);
                auto hit = cache_.find(*proxy->pluginUUID());
                if (hit == cache_.end()) continue;
                dropped = std::move(hit->second);
                cache_.erase(hit);
            }
        }
    });
    if (BXDatabaseDelegate* target = delegate()) target->removedPlugIns(plugIns);
}

}  // namespace bexil
