#pragma once

// Shorthands the end-to-end tests share: the error fields of a reply, the example bundles in a test's own
// directory, and what the daemon's registry holds.

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "base/Value.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/ledgerix/LedgerixWorkspace.h"

namespace bexil::test {

// A reply's error code, 0 when it has none.
inline int64_t errorCode(const Value& reply) { return reply.get("errorcode").numberAsInt64().value_or(0); }
inline std::string errorText(const Value& reply) { return std::string(reply.get("error").stringView()); }

// Copies the example Greeter application into bundles/ under `root`; returns that directory, canonical.
inline std::filesystem::path copyExampleGreeter(const std::filesystem::path& root) {
    namespace fs = std::filesystem;
    fs::path bundles = root / "bundles";
    fs::create_directories(bundles);
    fs::copy(fs::path(BEXIL_SOURCE_DIR) / "examples" / "bundles" / "Greeter.app", bundles / "Greeter.app",
             fs::copy_options::recursive);
    return fs::canonical(bundles);
}

// The UUID under which the registry in `stateDirectory` holds the bundle at `path`, read from its store.
inline std::optional<Uuid> registeredUuid(const std::filesystem::path& stateDirectory, const std::string& path) {
    LedgerixWorkspace::Options options;
    options.stateDirectory = stateDirectory;
    auto registry = LedgerixWorkspace::open(options);
    if (!registry) {
        ADD_FAILURE() << registry.error().description();
        return std::nullopt;
    }
    auto proxy = (*registry)->pluginProxyForURL(path);
    return proxy ? proxy->pluginUUID() : std::nullopt;
}

// A "match" request with the given rules (none: the key is absent) and flag word (0: the key is absent).
inline Value matchRequest(std::optional<Value> rules = std::nullopt, uint64_t flags = 0, uint64_t version = 3) {
    std::vector<std::pair<std::string, Value>> entries = {{"request", Value::string("match")},
                                                          {"version", Value::uint64(version)}};
    if (rules) entries.emplace_back("rules", *rules);
    if (flags) entries.emplace_back("flags", Value::uint64(flags));
    return Value::dictionary(std::move(entries));
}

using Ids = std::vector<std::string>;

// The identifiers of a discovery reply's forms, sorted.
inline Ids identifiers(const Value& reply) {
    Ids ids;
    for (const Value& form : reply.get("matches").items()) ids.emplace_back(form.get("identifier").stringView());
    std::sort(ids.begin(), ids.end());
    return ids;
}

}  // namespace bexil::test
