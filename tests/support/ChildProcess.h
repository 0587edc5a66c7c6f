// Stand-ins for running plug-in instances: child processes that sleep until signalled, shared by the unit and
// end-to-end tests of termination.
#pragma once

#include <fcntl.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <initializer_list>
#include <vector>

namespace bexil::test {

// A child process that sleeps until it is signalled (ignoring SIGTERM when asked, so that only SIGKILL ends it).
// It lets go of the test's output, so nothing waiting for that output waits for it, and dies with the test,
// whatever way the test ends.
inline pid_t startSleeper(bool ignoreTerm = false) {
    pid_t parent = getpid();
    pid_t child = fork();
    if (child == 0) {
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        if (getppid() != parent) _exit(0);
        int devnull = open("/dev/null", O_RDWR);
        dup2(devnull, STDOUT_FILENO);
        dup2(devnull, STDERR_FILENO);
        if (ignoreTerm) signal(SIGTERM, SIG_IGN);
        for (;;) pause();
    }
    return child;
}

// Kills and reaps the sleepers it was given when the test ends, also when an assertion ends it early.
class SleeperGuard {
  public:
    explicit SleeperGuard(std::initializer_list<pid_t> pids) : pids_(pids) {}
    SleeperGuard(const SleeperGuard&) = delete;
    SleeperGuard& operator=(const SleeperGuard&) = delete;
    ~SleeperGuard() {
        for (pid_t pid : pids_) {
            kill(pid, SIGKILL);
            waitpid(pid, nullptr, 0);
        }
    }

  private:
    std::vector<pid_t> pids_;
};

}  // namespace bexil::test
