#include "platform/ledgerix/LXApplicationWorkspace.h"

#include <algorithm>
#include <mutex>

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

}  // namespace bexil
