#pragma once

// Where the daemon and its platform services keep their files. Every BX_* variable exists so that tests, the demo
// and unprivileged users can run a complete daemon in a private directory. Pure functions of the environment;
// any thread.

#include <filesystem>
#include <optional>
#include <vector>

namespace bexil {

// $BX_RUNTIME_DIR, else /run/bexil for root, else $XDG_RUNTIME_DIR/bexil, else /tmp/bexil-<uid>.
std::filesystem::path runtimeDirectory();

// $BX_STATE_DIR, else /var/lib/bexil for root, else $XDG_STATE_HOME/bexil, else $HOME/.local/state/bexil (the
// base-directory default for an unset XDG_STATE_HOME); none when not even a home directory is known.
std::optional<std::filesystem::path> stateDirectory();

// Where service sockets live: $BX_SERVICE_DIR, else /run/bexil for root, else $XDG_RUNTIME_DIR/bexil, else
// /tmp/bexil-<uid>.
std::filesystem::path serviceDirectory();

// $BX_PREFERENCES_DIR, else $XDG_CONFIG_HOME/bexil/preferences, else $HOME/.config/bexil/preferences (from / when
// HOME is unset).
std::filesystem::path preferencesDirectory();

// Where programs' entitlement documents are: $BX_ENTITLEMENTS_DIR, else /etc/bexil/entitlements.d.
std::filesystem::path entitlementsDirectory();

// The shared data directories, in order: the non-empty entries of $XDG_DATA_DIRS, else /usr/local/share and
// /usr/share.
std::vector<std::filesystem::path> dataDirectories();

}  // namespace bexil
