#pragma once

// Shell completion scripts for the bexil tool, written from its command-line definition itself, so that a new
// subcommand or option is completed as soon as it exists and no hand-kept list can fall behind. Completes
// subcommands (nested ones too), each command's options, file names after options that take a value, and file
// names where a command takes arguments. Stateless; any thread.

#include <CLI/CLI.hpp>
#include <optional>
#include <string>
#include <string_view>

namespace bexil::tool {

// The shells there are scripts for, as `bexil completions` names them.
inline constexpr std::string_view kCompletionShells[] = {"bash", "zsh", "fish"};

// The completion script of `app` for `shell` ("bash", "zsh" or "fish"); none for another shell.
std::optional<std::string> completionScript(const CLI::App& app, std::string_view shell);

}  // namespace bexil::tool
