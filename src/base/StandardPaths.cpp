#include "base/StandardPaths.h"

#include <unistd.h>

#include <cstdlib>
#include <string>
#include <string_view>

namespace bexil {

namespace fs = std::filesystem;

namespace {

// The value of `name` when it is set and not empty.
const char* variable(const char* name) {
    const char* value = getenv(name);
    return value != nullptr && *value != '\0' ? value : nullptr;
}

// The runtime directory when no BX_* variable names one.
fs::path defaultRuntimeDirectory() {
    if (geteuid() == 0) return "/run/bexil";
    if (const char* xdg = variable("XDG_RUNTIME_DIR")) return fs::path(xdg) / "bexil";
    return fs::path("/tmp") / ("bexil-" + std::to_string(geteuid()));
}

}  // namespace

fs::path runtimeDirectory() {
    if (const char* dir = variable("BX_RUNTIME_DIR")) return dir;
    return defaultRuntimeDirectory();
}

fs::path serviceDirectory() {
    if (const char* dir = variable("BX_SERVICE_DIR")) return dir;
    return defaultRuntimeDirectory();
}

fs::path preferencesDirectory() {
    if (const char* dir = variable("BX_PREFERENCES_DIR")) return dir;
    if (const char* config = variable("XDG_CONFIG_HOME")) return fs::path(config) / "bexil" / "preferences";
    const char* home = variable("HOME");
    return fs::path(home ? home : "/") / ".config" / "bexil" / "preferences";
}

fs::path entitlementsDirectory() {
    if (const char* dir = variable("BX_ENTITLEMENTS_DIR")) return dir;
    return "/etc/bexil/entitlements.d";
}

std::vector<fs::path> dataDirectories() {
    const char* env = variable("XDG_DATA_DIRS");
    std::string_view list = env ? std::string_view(env) : "/usr/local/share:/usr/share";
    std::vector<fs::path> directories;
    while (!list.empty()) {
        size_t colon = list.find(':');
        std::string_view item = list.substr(0, colon);
        if (!item.empty()) directories.emplace_back(std::string(item));
        if (colon == std::string_view::npos) break;
        list.remove_prefix(colon + 1);
    }
    return directories;
}

std::optional<fs::path> stateDirectory() {
    if (const char* dir = variable("BX_STATE_DIR")) return fs::path(dir);
    if (geteuid() == 0) return fs::path("/var/lib/bexil");
    if (const char* state = getenv("XDG_STATE_HOME"); state && state[0] == '/') return fs::path(state) / "bexil";
    if (const char* home = getenv("HOME"); home && home[0] == '/') return fs::path(home) / ".local" / "state" / "bexil";
    return std::nullopt;
}

}  // namespace bexil
