#pragma once

// The sandbox profiles that enabling names in a plug-in's service description, and how each confines a plug-in on
// Linux: the bubblewrap arguments that start its executable. Every profile shows the plug-in the system's programs
// and libraries read-only, its own bundle read-only, its data container read-write, a private /tmp, and nothing
// else of the file system; they differ in whether the plug-in may reach the network (docs/sandbox-profiles.md).
// Stateless; any thread.

#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace bexil {

struct SandboxProfile {
    std::string_view name;
    // May open connections outside the sandbox (else it has only a loopback interface of its own).
    bool network;
};

class SandboxProfiles {
  public:
    static constexpr SandboxProfile kProfiles[] = {
        {"plugin", true},     {"typepad", false},           {"netguard-filter", true},
        {"peekviewd", false}, {"sketchpad-devtools", true},
    };
    // Files of /etc a plug-in may read under every profile: enough for the dynamic loader and time zones.
    static constexpr std::string_view kSystemFiles[] = {"/etc/ld.so.cache", "/etc/localtime"};
    // Files of /etc shown to profiles with network access: name resolution and certificates.
    static constexpr std::string_view kNetworkFiles[] = {"/etc/resolv.conf", "/etc/hosts", "/etc/nsswitch.conf",
                                                         "/etc/ssl/certs", "/etc/ca-certificates"};

    // The profile of that name, or none: a plug-in is never started under a profile nobody defined.
    static const SandboxProfile* named(std::string_view name);

    struct Launch {
        std::string bundle;                    // shown read-only at its own path
        std::optional<std::string> container;  // shown read-write at its own path, the working directory
        std::string executable;                // inside the bundle
        std::vector<std::pair<std::string, std::string>> environment;  // the plug-in's whole environment
        int statusFd;                                                  // where bubblewrap reports the started process
    };
    // The arguments after the bubblewrap program's own name.
    static std::vector<std::string> bubblewrapArguments(const SandboxProfile& profile, const Launch& launch);
};

}  // namespace bexil
