#pragma once

// Checks and conversions of the bexil tool's arguments, made before anything is sent to the daemon, so that a bad
// UUID, a relative path, an unknown flag or an unreadable rule file ends the tool with one clear line. Stateless.

#include <cstdint>
#include <filesystem>
#include <string>
#include <string_view>
#include <vector>

#include "base/Error.h"
#include "bexil/Protocol.h"
#include "bexil/Value.h"

namespace bexil::tool {

// Exit statuses of the tool besides 0 and the daemon's error codes (sysexits.h values).
inline constexpr int kExitUsage = 64;        // bad arguments; nothing was sent
inline constexpr int kExitDataError = 65;    // a document on disk (an SDK, a bundle's Info.vrec) cannot be used
inline constexpr int kExitNoInput = 66;      // what was asked for is not there (an SDK that is not registered)
inline constexpr int kExitUnavailable = 69;  // bxd is not running or the connection failed
inline constexpr int kExitSoftware = 70;     // the daemon answered something the tool cannot read
inline constexpr int kExitTimeout = 75;      // bxd did not answer in time

// The exit status for a reply's error code: the code itself when it fits 1..63, 1 otherwise.
int exitStatusForCode(int64_t code);

// Every text must be a UUID in its canonical 8-4-4-4-12 form.
Result<std::vector<Uuid>> parseUuids(const std::vector<std::string>& texts);
// Every text must be an absolute path; the result is an array of strings, in order.
Result<Value> absolutePaths(const std::vector<std::string>& texts);
// "KEY=PATTERN" arguments into a rule dictionary; the key must not be empty, the pattern may be.
Result<Value> rulesFromArguments(const std::vector<std::string>& arguments);
// A dictionary from a file: the structured-document form when it ends in ".vrec", JSON otherwise.
Result<Value> readDictionaryFile(const std::filesystem::path& path);
// The plug-in an "explain" asks about, as sent: an identifier or UUID text as it is, a path made absolute (a text
// with a "/" in it is a path). Empty text is refused.
Result<Value> plugInArgument(const std::string& text);
// Discovery flags by name: all-versions, all-instances, system-only, all.
Result<uint64_t> discoveryFlags(const std::vector<std::string>& names);

// The preferences domain that holds the global exclusions, under the key "exclusions".
inline constexpr std::string_view kUserPrefsDomain = protocol::kUserPrefsDomain;

// Where the global exclusions live: the preferences store's file of kUserPrefsDomain ($BX_PREFERENCES_DIR, else
// $XDG_CONFIG_HOME/bexil/preferences with ~/.config for an unset XDG_CONFIG_HOME;
// com.quorvel.bexil.userprefs.<host>.vrec).
std::filesystem::path preferencesFile();
// Checks that `rules` is an array of rule dictionaries.
std::optional<Error> validateExclusions(const Value& rules);

}  // namespace bexil::tool
