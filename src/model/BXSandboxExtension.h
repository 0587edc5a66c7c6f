#pragma once

// BXSandboxExtension holds one sandbox-extension token received from the daemon (a form's "extensions", or the
// "access" reply) and consumes it into this process on request; destruction releases what was consumed. The
// properties are atomic; consume and expel are not synchronised against each other, so one owner calls them.

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string>

namespace bexil {

class SandboxExtensions;

class BXSandboxExtension {
  public:
    // initWithExtension: a holder of `token`, not yet consumed. `sandbox` is the process's by default.
    explicit BXSandboxExtension(std::string token, SandboxExtensions* sandbox = nullptr);
    ~BXSandboxExtension();
    BXSandboxExtension(const BXSandboxExtension&) = delete;
    BXSandboxExtension& operator=(const BXSandboxExtension&) = delete;

    // Consumes the token once; later calls do nothing while it is consumed. A token the sandbox refuses leaves
    // the handle 0 (errno says why).
    void consume();
    // Releases a consumed extension; does nothing when none is consumed.
    void expel();

    std::string token() const;
    void setToken(std::string token);
    int64_t handle() const { return handle_.load(); }

  private:
    SandboxExtensions& sandbox_;
    mutable std::mutex tokenMutex_;
    std::string token_;
    std::atomic<int64_t> handle_{0};
};

}  // namespace bexil
