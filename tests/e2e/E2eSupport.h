#pragma once

// Shorthands the end-to-end tests share: the error fields of a reply, the example bundles in a test's own
// directory, and what the daemon's registry holds.

#include <gtest/gtest.h>

#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>

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

}  // namespace bexil::test
