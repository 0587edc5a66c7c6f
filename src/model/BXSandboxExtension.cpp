#include "model/BXSandboxExtension.h"

#include "platform/sandbox/SandboxExtensions.h"

namespace bexil {

BXSandboxExtension::BXSandboxExtension(std::string token, SandboxExtensions* sandbox)
    : sandbox_(sandbox ? *sandbox : SandboxExtensions::shared()), token_(std::move(token)) {}

BXSandboxExtension::~BXSandboxExtension() { expel(); }

void BXSandboxExtension::consume() {
    if (handle_.load() != 0) return;
    int64_t handle = sandbox_.consume(token());
    if (handle > 0) handle_.store(handle);
}

void BXSandboxExtension::expel() {
    int64_t handle = handle_.exchange(0);
    if (handle != 0) sandbox_.release(handle);
}

std::string BXSandboxExtension::token() const {
    std::lock_guard lock(tokenMutex_);
    return token_;
}

void BXSandboxExtension::setToken(std::string token) {
    std::lock_guard lock(tokenMutex_);
    token_ = std::move(token);
}

}  // namespace bexil
