#pragma once

// Starts the real bxd binary in private directories for one test and stops it afterwards. Its log goes to a file
// (standard error) that tests read; the service socket lives in a temporary service directory.

#include <sys/types.h>

#include <chrono>
#include <csignal>
#include <filesystem>
#include <string>
#include <vector>

namespace bexil::test {

class BxdProcess {
  public:
    // A fresh temporary root with service/, state/, runtime/ and entitlements.d/ below it.
    BxdProcess();
    ~BxdProcess();

    // Starts bxd with `arguments` and waits until its socket accepts connections; false when the process exited
    // or did not come up within ten seconds.
    bool start(const std::vector<std::string>& arguments = {});
    // Starts bxd through `command` from now on (a launcher that ends by executing the program and arguments that
    // follow it, such as a sandbox tool); stop() and running() then concern the launcher's process.
    void setLauncher(std::vector<std::string> command) { launcher_ = std::move(command); }
    // Runs bxd to completion (for option errors) and returns its exit status; standard error goes to log().
    int runToExit(const std::vector<std::string>& arguments);
    // Sends `signal` and waits for the process; returns the wait status.
    int stop(int signal = SIGTERM);
    bool running() const;

    // Everything bxd wrote to standard error so far.
    std::string log() const;
    // Waits until log() contains `text`; false after `timeout`.
    bool waitForLog(const std::string& text, std::chrono::milliseconds timeout = std::chrono::seconds(5)) const;
    size_t countInLog(const std::string& text) const;

    const std::filesystem::path& root() const { return root_; }
    std::filesystem::path serviceDir() const { return root_ / "service"; }
    std::filesystem::path entitlementsDir() const { return root_ / "entitlements.d"; }
    std::string socketPath(const std::string& service = "com.quorvel.bexil.bxd") const;
    // Points this process's BX_* variables at the private directories, so client code finds the service.
    void exportEnvironment() const;

    static std::filesystem::path binary();

  private:
    std::vector<std::string> baseEnvironment() const;
    pid_t spawn(const std::vector<std::string>& arguments);

    std::filesystem::path root_;
    std::filesystem::path logFile_;
    pid_t pid_ = -1;
    std::vector<std::string> launcher_;
};

}  // namespace bexil::test
