#include "platform/sandbox/SandboxProfiles.h"

#include <filesystem>

namespace bexil {

namespace {

namespace fs = std::filesystem;

// The top-level directories that hold programs and libraries. On a merged-/usr system all but /usr are links into
// it, and are recreated as the same links; a real directory is shown read-only.
constexpr std::string_view kProgramDirectories[] = {"/usr", "/bin", "/sbin", "/lib", "/lib32", "/lib64", "/libx32"};

}  // namespace

const SandboxProfile* SandboxProfiles::named(std::string_view name) {
    for (const SandboxProfile& profile : kProfiles)
        if (profile.name == name) return &profile;
    return nullptr;
}

std::vector<std::string> SandboxProfiles::bubblewrapArguments(const SandboxProfile& profile, const Launch& launch) {
    std::vector<std::string> args = {
        // Ends with bxd, so that no plug-in outlives the daemon that started and records it; a session of its own
        // keeps it away from the terminal bxd may have been started from.
        "--die-with-parent", "--new-session",
        // Own namespaces for everything, and no capabilities, even when the host (and so the plug-in) is root.
        "--unshare-all", "--cap-drop", "ALL"};
    if (profile.network) args.push_back("--share-net");

    std::error_code ec;
    for (std::string_view directory : kProgramDirectories) {
        fs::path path(directory);
        if (fs::is_symlink(path, ec)) {
            fs::path target = fs::read_symlink(path, ec);
            if (!ec) args.insert(args.end(), {"--symlink", target.string(), path.string()});
        } else if (fs::is_directory(path, ec)) {
            args.insert(args.end(), {"--ro-bind", path.string(), path.string()});
        }
    }
    auto showFiles = [&](std::span<const std::string_view> files) {
        for (std::string_view file : files)
            args.insert(args.end(), {"--ro-bind-try", std::string(file), std::string(file)});
    };
    showFiles(kSystemFiles);
    if (profile.network) showFiles(kNetworkFiles);

    args.insert(args.end(), {"--proc", "/proc", "--dev", "/dev", "--tmpfs", "/tmp"});
    args.insert(args.end(), {"--ro-bind", launch.bundle, launch.bundle});
    if (launch.container) {
        args.insert(args.end(), {"--bind", *launch.container, *launch.container, "--chdir", *launch.container});
    } else {
        args.insert(args.end(), {"--chdir", launch.bundle});
    }
    // Nothing but /tmp and the container is writable: the root the mounts above hang from is made read-only last.
    args.insert(args.end(), {"--remount-ro", "/"});

    args.push_back("--clearenv");
    for (const auto& [name, value] : launch.environment) args.insert(args.end(), {"--setenv", name, value});
    args.insert(args.end(), {"--json-status-fd", std::to_string(launch.statusFd), "--", launch.executable});
    return args;
}

}  // namespace bexil
