#pragma once

// Starts the real bxd binary in private directories for one test and stops it afterwards. Its log goes to a file
// (standard error) that tests read; the service socket lives in a temporary service directory.

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <thread>
#include <utility>
#include <vector>

extern char** environ;

namespace bexil::test {

class BxdProcess {
  public:
    // A fresh temporary root with service/, state/, runtime/ and entitlements.d/ below it.
    BxdProcess() {
        std::string pattern = (std::filesystem::temp_directory_path() / "bxd-e2e-XXXXXX").string();
        root_ = mkdtemp(pattern.data());
        for (const char* sub : {"service", "state", "runtime", "entitlements.d"})
            std::filesystem::create_directories(root_ / sub);
        // The daemon trusts entitlement files only in a directory nobody else may write to, whatever the umask.
        chmod(entitlementsDir().c_str(), 0755);
    }
    ~BxdProcess() {
        // Stopped as a service manager stops it, so that it ends what it started (a daemon killed in the middle of
        // a launch can leave a sandbox behind that only its next start would end); killed if it does not stop.
        if (running()) {
            kill(pid_, SIGTERM);
            for (int i = 0; i < 500 && running(); ++i) std::this_thread::sleep_for(std::chrono::milliseconds(10));
            if (running()) stop(SIGKILL);
        }
        std::error_code ignored;
        std::filesystem::remove_all(root_, ignored);
    }

    // Starts bxd with `arguments` and waits until its socket listens; false when the process exited or did not
    // come up within ten seconds.
    bool start(const std::vector<std::string>& arguments = {}) {
        std::string service = "com.quorvel.bexil.bxd";
        for (size_t i = 0; i + 1 < arguments.size(); ++i)
            if (arguments[i] == "-S") service = arguments[i + 1];
        // Logged once the socket listens, so connections from then on wait for the daemon to take them. A daemon
        // started before in this root logged it too.
        const std::string listening = "listening on service " + service + " ";
        size_t before = countInLog(listening);
        pid_ = spawn(arguments);
        auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
        while (running() && std::chrono::steady_clock::now() < deadline) {
            if (countInLog(listening) > before) return true;
            std::this_thread::sleep_for(std::chrono::milliseconds(10));
        }
        return false;
    }
    // Starts bxd through `command` from now on (a launcher that ends by executing the program and arguments that
    // follow it, such as a sandbox tool); stop() and running() then concern the launcher's process.
    void setLauncher(std::vector<std::string> command) { launcher_ = std::move(command); }
    // Sends `signal` and waits for the process; returns the wait status.
    int stop(int signal = SIGTERM) {
        if (pid_ <= 0) return -1;
        kill(pid_, signal);
        int status = 0;
        waitpid(std::exchange(pid_, -1), &status, 0);
        return status;
    }
    bool running() const { return pid_ > 0 && waitpid(pid_, nullptr, WNOHANG) == 0; }
    pid_t pid() const { return pid_; }
    // Sends `signal` without waiting (SIGSTOP and SIGCONT hold and release the daemon).
    void signal(int signal) const {
        if (pid_ > 0) kill(pid_, signal);
    }

    // Everything bxd wrote to standard error so far.
    std::string log() const {
        std::ifstream in(root_ / "bxd.log");
        return std::string(std::istreambuf_iterator<char>(in), {});
    }
    // Waits until log() contains `text`; false after `timeout`.
    bool waitForLog(const std::string& text, std::chrono::milliseconds timeout = std::chrono::seconds(5)) const {
        auto deadline = std::chrono::steady_clock::now() + timeout;
        do {
            if (log().find(text) != std::string::npos) return true;
            std::this_thread::sleep_for(std::chrono::milliseconds(5));
        } while (std::chrono::steady_clock::now() < deadline);
        return false;
    }
    size_t countInLog(const std::string& text) const {
        std::string all = log();
        size_t count = 0;
        for (size_t at = all.find(text); at != std::string::npos; at = all.find(text, at + text.size())) ++count;
        return count;
    }

    const std::filesystem::path& root() const { return root_; }
    std::filesystem::path serviceDir() const { return root_ / "service"; }
    std::filesystem::path entitlementsDir() const { return root_ / "entitlements.d"; }
    std::string socketPath(const std::string& service = "com.quorvel.bexil.bxd") const {
        return (serviceDir() / service).string();
    }
    // Points this process's BX_* variables at the private directories, so client code finds the service.
    void exportEnvironment() const {
        for (const std::string& entry : baseEnvironment()) {
            auto eq = entry.find('=');
            setenv(entry.substr(0, eq).c_str(), entry.substr(eq + 1).c_str(), 1);
        }
    }

    static std::filesystem::path binary() { return std::filesystem::path(BEXIL_BINARY_DIR) / "src/daemon/bxd"; }

  private:
    std::vector<std::string> baseEnvironment() const {
        return {"BX_SERVICE_DIR=" + serviceDir().string(),
                "BX_STATE_DIR=" + (root_ / "state").string(),
                "BX_RUNTIME_DIR=" + (root_ / "runtime").string(),
                "BX_ENTITLEMENTS_DIR=" + entitlementsDir().string(),
                "BX_LOG_SINK=stderr",
                "BXD_LOG_LEVEL=debug"};
    }

    pid_t spawn(const std::vector<std::string>& arguments) {
        // A later entry replaces an earlier one of the same name: programs read the first of two, and this
        // process's own environment may still name an earlier test's directories (exportEnvironment() stays).
        std::vector<std::string> env;
        for (char** e = environ; *e; ++e) env.emplace_back(*e);
        for (const std::string& entry : baseEnvironment()) {
            std::string prefix = entry.substr(0, entry.find('=') + 1);
            std::erase_if(env, [&prefix](const std::string& e) { return e.compare(0, prefix.size(), prefix) == 0; });
            env.push_back(entry);
        }
        std::vector<std::string> args = launcher_;
        args.push_back(binary().string());
        args.insert(args.end(), arguments.begin(), arguments.end());
        std::vector<char*> argv, envp;
        for (std::string& a : args) argv.push_back(a.data());
        for (std::string& e : env) envp.push_back(e.data());
        argv.push_back(nullptr);
        envp.push_back(nullptr);
        std::string logFile = (root_ / "bxd.log").string();
        pid_t child = fork();
        if (child == 0) {
            int fd = open(logFile.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644);
            dup2(fd, STDERR_FILENO);
            dup2(fd, STDOUT_FILENO);
            execve(argv[0], argv.data(), envp.data());
            _exit(127);
        }
        return child;
    }

    std::filesystem::path root_;
    pid_t pid_ = -1;
    std::vector<std::string> launcher_;
};

}  // namespace bexil::test
