#include "BxdProcess.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <cstring>
#include <fstream>
#include <iterator>
#include <thread>

extern char** environ;

namespace bexil::test {

namespace fs = std::filesystem;

BxdProcess::BxdProcess() {
    std::string pattern = (fs::temp_directory_path() / "bxd-e2e-XXXXXX").string();
    root_ = mkdtemp(pattern.data());
    for (const char* sub : {"service", "state", "runtime", "entitlements.d"}) fs::create_directories(root_ / sub);
    fs::permissions(root_ / "entitlements.d", fs::perms::owner_all | fs::perms::group_read | fs::perms::group_exec |
                                                  fs::perms::others_read | fs::perms::others_exec);
    logFile_ = root_ / "bxd.log";
}

BxdProcess::~BxdProcess() {
    if (running()) stop(SIGKILL);
    std::error_code ignored;
    fs::remove_all(root_, ignored);
}

fs::path BxdProcess::binary() { return fs::path(BEXIL_BINARY_DIR) / "src" / "daemon" / "bxd"; }

std::string BxdProcess::socketPath(const std::string& service) const { return (serviceDir() / service).string(); }

std::vector<std::string> BxdProcess::baseEnvironment() const {
    return {
        "BX_SERVICE_DIR=" + serviceDir().string(),
        "BX_STATE_DIR=" + (root_ / "state").string(),
        "BX_RUNTIME_DIR=" + (root_ / "runtime").string(),
        "BX_ENTITLEMENTS_DIR=" + entitlementsDir().string(),
        "BX_LOG_SINK=stderr",
        "BXD_LOG_LEVEL=debug",
    };
}

void BxdProcess::exportEnvironment() const {
    for (const std::string& entry : baseEnvironment()) {
        auto eq = entry.find('=');
        setenv(entry.substr(0, eq).c_str(), entry.substr(eq + 1).c_str(), 1);
    }
}

pid_t BxdProcess::spawn(const std::vector<std::string>& arguments) {
    std::vector<std::string> env;
    // A later entry replaces an earlier one of the same name. Programs read the first of two, and this process's
    // own environment may still name an earlier test's directories (exportEnvironment() leaves them behind).
    auto put = [&env](const std::string& entry) {
        std::string prefix = entry.substr(0, entry.find('=') + 1);
        std::erase_if(env, [&prefix](const std::string& e) { return e.compare(0, prefix.size(), prefix) == 0; });
        env.push_back(entry);
    };
    for (char** e = environ; *e; ++e) env.emplace_back(*e);
    for (const auto& e : baseEnvironment()) put(e);
    std::vector<std::string> args = launcher_;
    args.push_back(binary().string());
    args.insert(args.end(), arguments.begin(), arguments.end());

    pid_t child = fork();
    if (child == 0) {
        int fd = open(logFile_.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644);
        dup2(fd, STDERR_FILENO);
        dup2(fd, STDOUT_FILENO);
        std::vector<char*> argv, envp;
        for (auto& a : args) argv.push_back(a.data());
        argv.push_back(nullptr);
        for (auto& e : env) envp.push_back(e.data());
        envp.push_back(nullptr);
        execve(argv[0], argv.data(), envp.data());
        _exit(127);
    }
    return child;
}

static bool canConnect(const std::string& path) {
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    strncpy(addr.sun_path, path.c_str(), sizeof addr.sun_path - 1);
    bool ok = connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0;
    close(fd);
    return ok;
}

bool BxdProcess::start(const std::vector<std::string>& arguments) {
    std::string service = "com.quorvel.bexil.bxd";
    for (size_t i = 0; i + 1 < arguments.size(); ++i)
        if (arguments[i] == "-S") service = arguments[i + 1];
    pid_ = spawn(arguments);
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (std::chrono::steady_clock::now() < deadline) {
        if (!running()) return false;
        if (waitForLog("listening on service", std::chrono::milliseconds(1)) && canConnect(socketPath(service)))
            return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return false;
}

int BxdProcess::runToExit(const std::vector<std::string>& arguments) {
    pid_t child = spawn(arguments);
    int status = 0;
    waitpid(child, &status, 0);
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

int BxdProcess::stop(int signal) {
    if (pid_ <= 0) return -1;
    kill(pid_, signal);
    int status = 0;
    waitpid(pid_, &status, 0);
    pid_ = -1;
    return status;
}

bool BxdProcess::running() const {
    if (pid_ <= 0) return false;
    return waitpid(pid_, nullptr, WNOHANG) == 0;
}

std::string BxdProcess::log() const {
    std::ifstream in(logFile_);
    return std::string(std::istreambuf_iterator<char>(in), {});
}

size_t BxdProcess::countInLog(const std::string& text) const {
    std::string all = log();
    size_t count = 0;
    for (size_t at = all.find(text); at != std::string::npos; at = all.find(text, at + text.size())) ++count;
    return count;
}

bool BxdProcess::waitForLog(const std::string& text, std::chrono::milliseconds timeout) const {
    auto deadline = std::chrono::steady_clock::now() + timeout;
    do {
        if (log().find(text) != std::string::npos) return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    } while (std::chrono::steady_clock::now() < deadline);
    return false;
}

}  // namespace bexil::test
