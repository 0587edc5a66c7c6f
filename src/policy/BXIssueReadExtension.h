#pragma once

// Read-only sandbox extensions for plug-in files, issued by the daemon and handed to hosts (in discovery results and
// by the "access" request). Any thread.

#include <optional>
#include <string>

namespace bexil {

// The token of a read-only extension for the canonical form of `url` (a path), or none with errno as the sandbox
// set it (for example ENOENT when the path does not exist).
std::optional<std::string> BXIssueReadExtension(const std::string& url);

// Puts the key that checks this run's tokens back in place when somebody removed it; false (errno set) when it
// cannot be written. Called before handing out tokens that were made earlier.
bool BXKeepReadExtensionsCheckable();

}  // namespace bexil
