#include "base/StandardPaths.h"

#include <unistd.h>

#include <cstdlib>
#include <string>

namespace bexil {

namespace fs = std::filesystem;

fs::path runtimeDirectory() {
    if (const char* dir = getenv("BX_RUNTIME_DIR"); dir && *dir) return dir;
    if (geteuid() == 0) return "/run/bexil";
    if (const char* xdg = getenv("XDG_RUNTIME_DIR"); xdg && *xdg) return fs::path(xdg) / "bexil";
    return fs::path("/tmp") / ("bexil-" + std::to_string(geteuid()));
}

std::optional<fs::path> stateDirectory() {
    if (const char* dir = getenv("BX_STATE_DIR"); dir && *dir) return fs::path(dir);
    if (geteuid() == 0) return fs::path("/var/lib/bexil");
    if (const char* state = getenv("XDG_STATE_HOME"); state && state[0] == '/') return fs::path(state) / "bexil";
    if (const char* home = getenv("HOME"); home && home[0] == '/') return fs::path(home) / ".local" / "state" / "bexil";
    return std::nullopt;
}

}  // namespace bexil
