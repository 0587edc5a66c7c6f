#pragma once

// Where the daemon and its platform services keep their files. Every BX_* variable exists so that tests, the demo
// and unprivileged users can run a complete daemon in a private directory. Pure functions of the environment;
// any thread.

#include <filesystem>
#include <optional>

namespace bexil {

// $BX_RUNTIME_DIR, else /run/bexil for root, else $XDG_RUNTIME_DIR/bexil, else /tmp/bexil-<uid>.
std::filesystem::path runtimeDirectory();

// $BX_STATE_DIR, else /var/lib/bexil for root, else $XDG_STATE_HOME/bexil, else $HOME/.local/state/bexil (the
// base-directory default for an unset XDG_STATE_HOME); none when not even a home directory is known.
std::optional<std::filesystem::path> stateDirectory();

}  // namespace bexil
