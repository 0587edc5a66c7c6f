#include "Doctor.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <poll.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "base/StandardPaths.h"
#include "base/UniqueFd.h"
#include "client/BXDaemonClient.h"
#include "client/BXDaemonClientSync.h"
#include "platform/codesign/EntitlementsDirectory.h"
#include "platform/jobard/ServiceManager.h"
#include "platform/log/SystemLogSink.h"
#include "platform/zem/ZemListener.h"

namespace bexil::tool {

namespace fs = std::filesystem;

namespace {

// How long bubblewrap may take to run `true`; a sandbox that needs longer would fail bxd's launches too.
constexpr auto kSandboxProbeTimeout = std::chrono::seconds(10);

DoctorCheck good(std::string name, std::string detail) { return {std::move(name), true, std::move(detail), {}}; }
DoctorCheck bad(std::string name, std::string detail, std::string fix) {
    return {std::move(name), false, std::move(detail), std::move(fix)};
}

std::string modeText(mode_t mode) { return fmt::format("{:04o}", mode & 07777); }

// The first line bubblewrap wrote, so the user sees its own reason (a missing namespace permission, usually).
std::string firstLine(std::string text) {
    size_t end = text.find('\n');
    if (end != std::string::npos) text.resize(end);
    return text;
}

}  // namespace

uid_t daemonUser(const fs::path& socket) {
    struct stat st {};
    return lstat(socket.c_str(), &st) == 0 && S_ISSOCK(st.st_mode) ? st.st_uid : geteuid();
}

DoctorCheck checkDaemon(const std::string& service, std::chrono::milliseconds timeout) {
    const std::string socket = ZemListener::socketPathForService(service).string();
    BXDaemonClient client(service.c_str());
    std::optional<BXDaemonClient::Reply> reply =
        sendAndWait([&](BXDaemonClient::ReplyHandler handler) { client.statusReply(std::move(handler)); }, timeout);
    if (!reply)
        return bad("daemon", fmt::format("bxd on {} did not answer within {} ms", socket, timeout.count()),
                   "bxd is stuck: restart it (systemctl restart bxd.service)");
    if (std::holds_alternative<ZemError>(*reply))
        return bad("daemon", "nothing answers on " + socket,
                   "start bxd (systemctl start bxd.socket), or run bxd with the same BX_* variables as this command");
    std::optional<Error> error;
    try {
        error = BXDaemonClient::errorInReply(*reply);
    } catch (const InternalInconsistency& inconsistency) {
        return bad("daemon", "bxd on " + socket + " answered something bexil cannot read: " + inconsistency.what(),
                   "use a bexil that matches the daemon's version");
    }
    if (error)
        return bad("daemon",
                   "bxd on " + socket + " refused the status request: " + error->localizedDescription().value_or(""),
                   "use a bexil that matches the daemon's version");
    return good("daemon", "bxd answers on " + socket);
}

DoctorCheck checkOwnDirectory(const std::string& name, const fs::path& path, uid_t owner) {
    struct stat st {};
    if (stat(path.c_str(), &st) != 0)
        return bad(name, path.string() + ": " + std::strerror(errno),
                   "start bxd, which creates it, or create it: install -d -m 0755 " + path.string());
    if (!S_ISDIR(st.st_mode))
        return bad(name, path.string() + " is not a directory", "remove it and let bxd create the directory");
    if (st.st_uid != 0 && st.st_uid != owner)
        return bad(name,
                   fmt::format("{} belongs to uid {}, not to bxd's user (uid {})", path.string(), st.st_uid, owner),
                   fmt::format("chown {} {}", owner, path.string()));
    // Anyone who can write here could put a socket, key or record of their own in bxd's place.
    if ((st.st_mode & S_IWOTH) != 0)
        return bad(name, path.string() + " is writable by everybody (mode " + modeText(st.st_mode) + ")",
                   "chmod o-w " + path.string());
    return good(name, path.string() + ", mode " + modeText(st.st_mode));
}

DoctorCheck checkEntitlements(const fs::path& path, uid_t owner) {
    const std::string name = "entitlements directory";
    struct stat st {};
    if (stat(path.c_str(), &st) != 0) {
        if (errno == ENOENT) return good(name, path.string() + " does not exist: no program has entitlements");
        return bad(name, path.string() + ": " + std::strerror(errno), "make it readable by bxd's user");
    }
    if (!EntitlementsDirectory::isTrustedDirectory(path, owner))
        return bad(
            name,
            fmt::format("{} is not trusted (owner uid {}, mode {}): bxd ignores every file in it", path.string(),
                        st.st_uid, modeText(st.st_mode)),
            fmt::format("chown root {0} && chmod 0755 {0}  (or own it by bxd's user, uid {1})", path.string(), owner));
    std::error_code ec;
    std::vector<std::string> untrusted;
    for (const fs::directory_entry& entry : fs::directory_iterator(path, ec))
        if (entry.path().extension() == ".vrec" && !EntitlementsDirectory::isTrustedFile(entry.path(), owner))
            untrusted.push_back(entry.path().filename().string());
    if (ec) return bad(name, path.string() + ": " + ec.message(), "make it readable by bxd's user");
    if (!untrusted.empty()) {
        std::string files;
        for (const std::string& file : untrusted) files += (files.empty() ? "" : " ") + file;
        return bad(name, "bxd ignores these files (owner, mode or a link): " + files,
                   "make each a regular file owned by root (or uid " + std::to_string(owner) + ") with mode 0644, in " +
                       path.string());
    }
    return good(name, path.string() + " is trusted, mode " + modeText(st.st_mode));
}

DoctorCheck checkBubblewrap(const std::string& bwrap) {
    const std::string name = "bubblewrap";
    if (access(bwrap.c_str(), X_OK) != 0)
        return bad(name, bwrap + ": " + std::strerror(errno) + "; no plug-in can be launched",
                   "install bubblewrap, or point BX_BWRAP at it");
    int pipeEnds[2];
    if (pipe2(pipeEnds, O_CLOEXEC) != 0) return bad(name, std::string("pipe: ") + std::strerror(errno), "try again");
    UniqueFd readEnd(pipeEnds[0]), writeEnd(pipeEnds[1]);
    pid_t pid = fork();
    if (pid < 0) return bad(name, std::string("fork: ") + std::strerror(errno), "try again");
    if (pid == 0) {
        int devNull = open("/dev/null", O_RDWR);
        if (devNull < 0 || dup2(devNull, 0) < 0 || dup2(devNull, 1) < 0 || dup2(writeEnd.get(), 2) < 0) _exit(127);
        execl(bwrap.c_str(), bwrap.c_str(), "--unshare-all", "--ro-bind", "/", "/", "true",
              static_cast<char*>(nullptr));
        _exit(127);
    }
    writeEnd = UniqueFd();
    // Bubblewrap's error output, until it closes it by ending; a sandbox that takes too long is ended here.
    std::string errors;
    auto deadline = std::chrono::steady_clock::now() + kSandboxProbeTimeout;
    bool timedOut = false;
    for (;;) {
        auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
        pollfd watched{readEnd.get(), POLLIN, 0};
        int ready = left.count() > 0 ? poll(&watched, 1, static_cast<int>(left.count())) : 0;
        if (ready < 0 && errno == EINTR) continue;
        if (ready <= 0) {
            timedOut = true;
            kill(pid, SIGKILL);
            break;
        }
        char buffer[512];
        ssize_t n = read(readEnd.get(), buffer, sizeof buffer);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) break;
        if (errors.size() < 4096) errors.append(buffer, static_cast<size_t>(n));
    }
    int status = 0;
    while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
    if (timedOut)
        return bad(name, fmt::format("{} did not set up a sandbox within {} s", bwrap, kSandboxProbeTimeout.count()),
                   "check that the machine is not overloaded and that " + bwrap + " is bubblewrap");
    if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) {
        std::string reason = firstLine(errors);
        return bad(name, bwrap + " cannot create a sandbox" + (reason.empty() ? "" : ": " + reason),
                   "allow unprivileged user namespaces (sysctl kernel.unprivileged_userns_clone=1), or install " +
                       bwrap + " setuid root");
    }
    return good(name, bwrap + " creates sandboxes");
}

DoctorCheck checkMimeDatabase(const std::vector<fs::path>& dataDirectories) {
    const std::string name = "MIME database";
    std::string searched;
    for (const fs::path& directory : dataDirectories) {
        fs::path mime = directory / "mime";
        std::error_code ec;
        if (fs::is_regular_file(mime / "subclasses", ec) && fs::is_regular_file(mime / "aliases", ec))
            return good(name, mime.string());
        searched += (searched.empty() ? "" : ":") + directory.string();
    }
    return bad(name, "no mime/subclasses and mime/aliases under " + searched + "; no type conforms to another",
               "install shared-mime-info (it runs update-mime-database), or add its directory to XDG_DATA_DIRS");
}

DoctorCheck checkJournal() {
    const std::string name = "journal";
    const std::string socket = log::SystemLogSink::kJournalSocket;
    const char* forced = std::getenv("BX_LOG_SINK");
    if (forced != nullptr && std::string_view(forced) == "stderr")
        return good(name, "bxd logs to standard error (BX_LOG_SINK=stderr)");
    const bool writable = access(socket.c_str(), W_OK) == 0;
    if (forced != nullptr && std::string_view(forced) == "journal" && !writable)
        return bad(name, "BX_LOG_SINK=journal but " + socket + " is not writable: log lines are lost",
                   "start systemd-journald, or unset BX_LOG_SINK");
    if (!writable) return good(name, "no journal at " + socket + ": bxd logs to standard error");
    return good(name, "bxd logs to the journal (" + socket + ")");
}

std::vector<DoctorCheck> runDoctor(const std::string& service, std::chrono::milliseconds timeout) {
    const uid_t owner = daemonUser(ZemListener::socketPathForService(service));
    std::vector<DoctorCheck> checks;
    checks.push_back(checkDaemon(service, timeout));
    checks.push_back(checkOwnDirectory("service directory", serviceDirectory(), owner));
    if (std::optional<fs::path> state = stateDirectory())
        checks.push_back(checkOwnDirectory("state directory", *state, owner));
    else
        checks.push_back(bad("state directory", "neither BX_STATE_DIR, XDG_STATE_HOME nor HOME is set",
                             "set BX_STATE_DIR to bxd's state directory"));
    checks.push_back(checkOwnDirectory("runtime directory", runtimeDirectory(), owner));
    checks.push_back(checkEntitlements(entitlementsDirectory(), owner));
    checks.push_back(checkBubblewrap(ServiceManager::bubblewrapPath()));
    checks.push_back(checkMimeDatabase(dataDirectories()));
    checks.push_back(checkJournal());
    return checks;
}

std::string doctorLine(const DoctorCheck& check) {
    if (check.ok) return check.name + ": ok (" + check.detail + ")";
    return check.name + ": PROBLEM: " + check.detail + "; fix: " + check.fix;
}

Value doctorValue(const std::vector<DoctorCheck>& checks) {
    MutableArray array;
    for (const DoctorCheck& check : checks)
        array.append(Value::dictionary({{"check", Value::string(check.name)},
                                        {"ok", Value::boolean(check.ok)},
                                        {"detail", Value::string(check.detail)},
                                        {"fix", Value::string(check.fix)}}));
    return array.take();
}

}  // namespace bexil::tool
