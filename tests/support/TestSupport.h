// Helpers shared by the unit-test programs: value shorthands, a private temporary directory, an environment
// variable restored at scope end, and a file system whose calls can be made to fail.
#pragma once

#include <gtest/gtest.h>
#include <stdlib.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "base/Document.h"
#include "bexil/Value.h"

namespace bexil::test {

namespace fs = std::filesystem;

using Entries = std::vector<std::pair<std::string, Value>>;

inline Value dict(Entries entries) { return Value::dictionary(std::move(entries)); }
inline Value str(std::string_view s) { return Value::string(s); }

inline std::string readText(const fs::path& path) {
    std::ifstream in(path, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

inline void writeText(const fs::path& path, const std::string& text) {
    fs::create_directories(path.parent_path());
    std::ofstream(path, std::ios::binary | std::ios::trunc) << text;
}

// A fresh directory of its own, removed with everything in it at scope end.
class TempDir {
  public:
    explicit TempDir(const std::string& prefix = "bexil-test") {
        std::string pattern = (fs::temp_directory_path() / (prefix + "-XXXXXX")).string();
        if (mkdtemp(pattern.data()) == nullptr) ADD_FAILURE() << "mkdtemp failed";
        path_ = fs::canonical(pattern);
    }
    ~TempDir() {
        std::error_code ec;
        fs::remove_all(path_, ec);
    }
    TempDir(const TempDir&) = delete;
    TempDir& operator=(const TempDir&) = delete;
    const fs::path& path() const { return path_; }
    operator const fs::path&() const { return path_; }
    fs::path operator/(const fs::path& relative) const { return path_ / relative; }

  private:
    fs::path path_;
};

// Sets (or, given nullopt, unsets) an environment variable and restores it at scope end.
class ScopedEnv {
  public:
    ScopedEnv(const char* name, const std::optional<std::string>& value) : name_(name) {
        if (const char* old = getenv(name)) old_ = old;
        if (value)
            setenv(name, value->c_str(), 1);
        else
            unsetenv(name);
    }
    ~ScopedEnv() {
        if (old_)
            setenv(name_, old_->c_str(), 1);
        else
            unsetenv(name_);
    }
    ScopedEnv(const ScopedEnv&) = delete;
    ScopedEnv& operator=(const ScopedEnv&) = delete;

  private:
    const char* name_;
    std::optional<std::string> old_;
};

// A private root with the directories a daemon uses (service, state, runtime, entitlements), each named by its
// environment variable for the test's lifetime.
class DaemonDirs {
  public:
    explicit DaemonDirs(const std::string& prefix) : root_(prefix) {
        for (const char* dir : {"service", "state", "runtime", "entitlements"}) fs::create_directories(root_ / dir);
    }
    const fs::path& path() const { return root_.path(); }
    fs::path operator/(const fs::path& relative) const { return root_ / relative; }

  private:
    TempDir root_;
    ScopedEnv service_{"BX_SERVICE_DIR", (root_ / "service").string()};
    ScopedEnv state_{"BX_STATE_DIR", (root_ / "state").string()};
    ScopedEnv runtime_{"BX_RUNTIME_DIR", (root_ / "runtime").string()};
    ScopedEnv entitlements_{"BX_ENTITLEMENTS_DIR", (root_ / "entitlements").string()};
};

// Makes one named call fail with a given errno (after `afterCalls` successful ones), otherwise makes the real
// calls; writes are cut to 4 KiB so that writers must loop over short writes.
class FailingFileSystem : public FileSystem {
  public:
    FailingFileSystem(std::string call, int error, int afterCalls = 0)
        : call_(std::move(call)), error_(error), afterCalls_(afterCalls) {}
    void heal() { call_.clear(); }

    int open(const char* path, int flags, mode_t mode) override {
        return shouldFail("open") ? -1 : FileSystem::open(path, flags, mode);
    }
    ssize_t write(int fd, const void* bytes, size_t count) override {
        return shouldFail("write") ? -1 : FileSystem::write(fd, bytes, std::min<size_t>(count, 4096));
    }
    int fsync(int fd) override { return shouldFail("fsync") ? -1 : FileSystem::fsync(fd); }
    int close(int fd) override {
        if (!shouldFail("close")) return FileSystem::close(fd);
        FileSystem::close(fd);
        errno = error_;
        return -1;
    }
    int rename(const char* from, const char* to) override {
        return shouldFail("rename") ? -1 : FileSystem::rename(from, to);
    }

  private:
    bool shouldFail(const std::string& call) {
        if (call != call_) return false;
        if (afterCalls_-- > 0) return false;
        errno = error_;
        return true;
    }
    std::string call_;
    int error_;
    int afterCalls_;
};

}  // namespace bexil::test
