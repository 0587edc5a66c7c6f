#include "platform/notify/SystemNotifications.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/file.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <charconv>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "base/AtomicFile.h"
#include "base/PosixError.h"
#include "base/StandardPaths.h"
#include "base/UniqueFd.h"
#include "platform/log/Log.h"

namespace bexil {

namespace fs = std::filesystem;

namespace {

constexpr const char* kLockFileName = ".lock";

// Notification failures are the daemon's own (code 4), with the system's text for the cause.
Error failure(int error, std::string_view what) {
    return BXError(ErrorCode::OperationFailed, posixMessage(error, what));
}

// The counter file is a decimal number; anything else (a stray file) counts as 0 so that the next post repairs it.
uint64_t readCounter(const fs::path& path) {
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    if (!fd) return 0;
    std::array<char, 32> buffer{};
    ssize_t n = ::read(fd.get(), buffer.data(), buffer.size() - 1);
    if (n <= 0) return 0;
    uint64_t value = 0;
    auto [end, error] = std::from_chars(buffer.data(), buffer.data() + n, value);
    if (error != std::errc()) return 0;
    (void)end;
    return value;
}

}  // namespace

fs::path SystemNotifications::defaultDirectory() { return runtimeDirectory() / "notify"; }

SystemNotifications::SystemNotifications(fs::path directory) : directory_(std::move(directory)) {}

SystemNotifications::~SystemNotifications() {
    if (watcher_.joinable()) {
        uint64_t one = 1;
        (void)!::write(stopFd_, &one, sizeof one);
        watcher_.join();
    }
    if (inotifyFd_ >= 0) ::close(inotifyFd_);
    if (stopFd_ >= 0) ::close(stopFd_);
}

bool SystemNotifications::validName(std::string_view name) {
    if (name.empty() || name.size() > kMaxNameLength || name.front() == '.') return false;
    return name.find('/') == std::string_view::npos && name.find('\0') == std::string_view::npos;
}

std::optional<Error> SystemNotifications::post(std::string_view name) {
    if (!validName(name))
        return BXError(ErrorCode::OperationFailed, "invalid notification name \"" + std::string(name) + "\"");
    std::error_code ec;
    fs::create_directories(directory_, ec);
    if (ec) return BXError(ErrorCode::OperationFailed, "cannot create " + directory_.string() + ": " + ec.message());

    int lockFd = ::open((directory_ / kLockFileName).c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
    if (lockFd < 0) return failure(errno, "cannot open notification lock in " + directory_.string());
    UniqueFd closeLock(lockFd);
    while (::flock(lockFd, LOCK_EX) != 0) {
        if (errno != EINTR) return failure(errno, "cannot lock notification folder " + directory_.string());
    }

    const fs::path target = directory_ / std::string(name);
    const std::string text = std::to_string(readCounter(target) + 1) + "\n";
    // The counter is a wake-up signal, not data worth an fsync: after a crash observers start over anyway.
    if (std::optional<Error> error = replaceFileAtomically(target, text, 0644, Durability::ReadersOnly))
        return BXError(ErrorCode::OperationFailed,
                       "cannot replace " + target.string() + ": " + error->localizedDescription().value_or(""));
    return std::nullopt;
}

uint64_t SystemNotifications::state(std::string_view name) const {
    if (!validName(name)) return 0;
    return readCounter(directory_ / std::string(name));
}

Result<SystemNotifications::Token> SystemNotifications::observe(std::string name, Callback callback,
                                                                SerialQueue queue) {
    if (!validName(name)) return BXError(ErrorCode::OperationFailed, "invalid notification name \"" + name + "\"");
    std::lock_guard lock(mutex_);
    if (inotifyFd_ < 0) {
        if (auto error = startWatching()) return *error;
    }
    Token token = nextToken_++;
    observers_.emplace(token, std::make_shared<Observer>(Observer{std::move(name), std::move(callback), queue}));
    return token;
}

void SystemNotifications::cancel(Token token) {
    std::lock_guard lock(mutex_);
    observers_.erase(token);
}

// REQUIRES: mutex_ held.
std::optional<Error> SystemNotifications::startWatching() {
    std::error_code ec;
    fs::create_directories(directory_, ec);
    if (ec) return BXError(ErrorCode::OperationFailed, "cannot create " + directory_.string() + ": " + ec.message());
    int inotifyFd = inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
    if (inotifyFd < 0) return failure(errno, "inotify_init1");
    // A post renames its counter file into place; a plain write by some other tool closes it after writing.
    if (inotify_add_watch(inotifyFd, directory_.c_str(), IN_MOVED_TO | IN_CLOSE_WRITE) < 0) {
        int error = errno;
        ::close(inotifyFd);
        return failure(error, "cannot watch " + directory_.string());
    }
    int stopFd = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
    if (stopFd < 0) {
        int error = errno;
        ::close(inotifyFd);
        return failure(error, "eventfd");
    }
    inotifyFd_ = inotifyFd;
    stopFd_ = stopFd;
    watcher_ = std::thread([this] { watch(); });
    return std::nullopt;
}

void SystemNotifications::watch() {
    alignas(inotify_event) std::array<char, 16 * (sizeof(inotify_event) + NAME_MAX + 1)> buffer;
    for (;;) {
        std::array<pollfd, 2> fds{pollfd{inotifyFd_, POLLIN, 0}, pollfd{stopFd_, POLLIN, 0}};
        if (::poll(fds.data(), fds.size(), -1) < 0) {
            if (errno == EINTR) continue;
            log::ops().error("notification watcher stops: poll failed: %s", std::strerror(errno));
            return;
        }
        if (fds[1].revents != 0) return;
        for (;;) {
            ssize_t n = ::read(inotifyFd_, buffer.data(), buffer.size());
            if (n <= 0) break;
            for (ssize_t offset = 0; offset < n;) {
                const auto* event = reinterpret_cast<const inotify_event*>(buffer.data() + offset);
                offset += static_cast<ssize_t>(sizeof(inotify_event) + event->len);
                if (event->mask & IN_Q_OVERFLOW) {
                    log::ops().error("notification watcher lost events in %s (inotify queue overflow)",
                                     directory_.c_str());
                    continue;
                }
                if (event->len == 0) continue;
                std::string name(event->name);
                if (validName(name)) dispatch(name);
            }
        }
    }
}

void SystemNotifications::dispatch(const std::string& name) {
    std::vector<std::shared_ptr<Observer>> targets;
    {
        std::lock_guard lock(mutex_);
        for (const auto& [token, observer] : observers_) {
            if (observer->name == name) targets.push_back(observer);
        }
    }
    if (targets.empty()) return;
    uint64_t counter = readCounter(directory_ / name);
    for (const auto& observer : targets) {
        observer->queue.async([observer, name, counter] { observer->callback(name, counter); });
    }
}

}  // namespace bexil
