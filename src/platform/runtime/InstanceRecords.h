#pragma once

// The one format of the records that plug-in runtimes keep of their processes, shared by the service manager
// (jobard: which instances run) and the process-assertion service (wardend: which instances hold an assertion):
// one file per process under `<runtime dir>/<kind folder>/<bundle identifier>/<pid>`, holding the process's start
// time (field 22 of /proc/<pid>/stat) in decimal, so that a record whose pid has since been reused by another
// process is recognised as stale. An instance that bxd started in a sandbox has a second line, "sandbox <pid>
// <start time>", naming the sandbox's first process: a sandbox whose outer process dies before releasing it waits
// forever, and only this line lets a later bxd find and end it. Stateless; any thread.

#include <sys/types.h>

#include <filesystem>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace bexil {

class InstanceRecords {
  public:
    struct Instance {
        pid_t pid;
        std::filesystem::path record;
        // The start time the record holds: whoever acts on the instance later compares against it, since by then
        // the pid may name another process.
        unsigned long long startTime;
    };

    // $BX_RUNTIME_DIR, else /run/bexil for root, else $XDG_RUNTIME_DIR/bexil.
    static std::filesystem::path runtimeDirectory();

    // Which records: of running instances (folder "instances") or of process assertions (folder "assertions").
    enum class Kind { Running, Assertion };
    static std::string_view folderOf(Kind kind);

    explicit InstanceRecords(Kind kind, std::filesystem::path runtimeDir = runtimeDirectory());

    // Records `pid` as a live instance of `bundleIdentifier` (what a plug-in runtime does when it starts), and
    // `sandbox` as the first process of its sandbox when there is one.
    bool record(const std::string& bundleIdentifier, pid_t pid, std::optional<pid_t> sandbox = std::nullopt) const;
    // The recorded instances of `bundleIdentifier` whose process is still the one recorded; stale records are
    // removed on the way.
    std::vector<Instance> live(const std::string& bundleIdentifier) const;

    // A record with a sandbox line, whether or not its processes still run.
    struct Sandboxed {
        std::string bundleIdentifier;
        Instance instance;
        pid_t sandbox;
        unsigned long long sandboxStartTime;
    };
    // Every record of every bundle that names a sandbox.
    std::vector<Sandboxed> sandboxed() const;

    // The start time of a process, or none when it does not exist.
    static std::optional<unsigned long long> startTime(pid_t pid);
    // Field `index` (3 or more, numbered as proc(5) numbers them: 4 is the parent pid, 22 the start time) of
    // /proc/<pid>/stat as a number; none when the process or the field is not there.
    static std::optional<unsigned long long> statField(pid_t pid, int index);

    const std::filesystem::path& directory() const { return directory_; }

  private:
    std::filesystem::path directory_;
};

}  // namespace bexil
