#include "platform/ledgerix/LXApplicationWorkspace.h"

#include <algorithm>
#include <mutex>

#include "platform/ledgerix/LXApplicationProxy.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/ledgerix/LedgerixWorkspace.h"

namespace bexil {

Result<std::shared_ptr<LXApplicationWorkspace>> LXApplicationWorkspace::defaultWorkspace() {
    static std::mutex mutex;
    static std::shared_ptr<LXApplicationWorkspace> shared;
    std::lock_guard lock(mutex);
    if (shared) return shared;
    LedgerixWorkspace::Options options;
    options.stateDirectory = LedgerixWorkspace::defaultStateDirectory();
    Result<std::shared_ptr<LedgerixWorkspace>> opened = LedgerixWorkspace::open(std::move(options));
    if (!opened.ok()) return opened.error();
    shared = std::move(opened).value();
    return shared;
}

std::optional<LXWalkSlice> LXApplicationWorkspace::pluginsMatchingQueryAfterIdentifier(
    const Value& query, const LXPlugInFilter& filter, const LXPreselection& preselection,
    const std::optional<std::string>& after, size_t rows) {
    std::optional<LXProxyList> candidates = pluginsMatchingQueryApplyFilter(
        query, [](std::string_view, const std::optional<Value>&) { return true; }, preselection);
    if (!candidates) return std::nullopt;
    auto identifierOf = [](const std::shared_ptr<const LXBexilProxy>& proxy) {
        return proxy->pluginIdentifier().value_or("");
    };
    // Stable: within an identifier the candidates keep their registration order.
    std::stable_sort(candidates->begin(), candidates->end(),
                     [&](const auto& a, const auto& b) { return identifierOf(a) < identifierOf(b); });
    auto at = candidates->begin();
    if (after)
        at = std::upper_bound(candidates->begin(), candidates->end(), *after,
                              [&](const std::string& text, const auto& proxy) { return text < identifierOf(proxy); });
    LXWalkSlice slice;
    size_t walked = 0;
    for (; at != candidates->end(); ++at) {
        std::string identifier = identifierOf(*at);
        if (walked >= rows && identifier != slice.last) break;
        ++walked;
        slice.last = identifier;
        if (!filter || filter(identifier, (*at)->entitlements())) slice.plugIns.push_back(*at);
    }
    slice.ended = at == candidates->end();
    return slice;
}

namespace {

LXCandidateList candidatesOf(LXProxyList proxies) {
    LXCandidateList candidates;
    candidates.reserve(proxies.size());
    for (std::shared_ptr<const LXBexilProxy>& proxy : proxies) {
        LXCandidate& candidate = candidates.emplace_back();
        candidate.uuid = proxy->pluginUUID().value_or(Uuid());
        candidate.inPlaceholderApplication = proxy->containingBundle() && proxy->containingBundle()->isPlaceholder();
        candidate.proxy = std::move(proxy);
    }
    return candidates;
}

}  // namespace

std::optional<LXCandidateList> LXApplicationWorkspace::installedCandidates(const LXKnownRecord&) {
    std::optional<LXProxyList> proxies = installedPlugins();
    if (!proxies) return std::nullopt;
    return candidatesOf(std::move(*proxies));
}

std::optional<LXCandidateList> LXApplicationWorkspace::candidatesMatchingQuery(const Value& query,
                                                                               const LXPlugInFilter& filter,
                                                                               const LXPreselection& preselection,
                                                                               const LXKnownRecord&) {
    std::optional<LXProxyList> proxies = pluginsMatchingQueryApplyFilter(query, filter, preselection);
    if (!proxies) return std::nullopt;
    return candidatesOf(std::move(*proxies));
}

std::optional<LXCandidateSlice> LXApplicationWorkspace::candidatesAfterIdentifier(
    const Value& query, const LXPlugInFilter& filter, const LXPreselection& preselection,
    const std::optional<std::string>& after, size_t rows, const LXKnownRecord&) {
    std::optional<LXWalkSlice> slice = pluginsMatchingQueryAfterIdentifier(query, filter, preselection, after, rows);
    if (!slice) return std::nullopt;
    return LXCandidateSlice{candidatesOf(std::move(slice->plugIns)), std::move(slice->last), slice->ended};
}

std::optional<LXRegistrationSlice> LXApplicationWorkspace::candidatesAfterRegistration(
    const Value& query, const LXPlugInFilter& filter, const LXPreselection& preselection, int64_t after, size_t,
    const LXKnownRecord& known) {
    // Without positions to walk by, the first stretch is everything and there is no second.
    if (after != 0) return LXRegistrationSlice{{}, after, true};
    std::optional<LXCandidateList> candidates = candidatesMatchingQuery(query, filter, preselection, known);
    if (!candidates) return std::nullopt;
    return LXRegistrationSlice{std::move(*candidates), 1, true};
}

}  // namespace bexil
