#pragma once

// Named system notifications between processes ("com.quorvel.bexil.annotation-change"). A post replaces the file
// <directory>/<name>, which holds a decimal counter, atomically (write a temporary file, rename it over the old
// one), so a reader never sees a half-written counter. Observers watch the folder with inotify and are called on
// a serial queue of their choice for each renamed-in counter file of a name they observe. One object owns one
// watcher thread (started by the first observe) and stops it on destruction; any thread may use it.

#include <atomic>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <thread>

#include "base/Error.h"
#include "base/SerialQueue.h"

namespace bexil {

class SystemNotifications {
  public:
    // Longest notification name; longer names are refused (they must fit one file name with room for the
    // temporary suffix).
    static constexpr size_t kMaxNameLength = 200;

    using Token = uint64_t;
    // The name posted and its counter as read right after the post was seen.
    using Callback = std::function<void(const std::string& name, uint64_t counter)>;

    // <runtime dir>/notify, the runtime dir being $BX_RUNTIME_DIR, else /run/bexil for root, else
    // $XDG_RUNTIME_DIR/bexil.
    static std::filesystem::path defaultDirectory();

    explicit SystemNotifications(std::filesystem::path directory = defaultDirectory());
    ~SystemNotifications();
    SystemNotifications(const SystemNotifications&) = delete;
    SystemNotifications& operator=(const SystemNotifications&) = delete;

    const std::filesystem::path& directory() const { return directory_; }

    // Increments the counter of `name`. Concurrent posts from several processes are serialised by a lock file.
    std::optional<Error> post(std::string_view name);
    // The counter of `name`: 0 when it was never posted.
    uint64_t state(std::string_view name) const;

    // Calls `callback` on `queue` for every post of `name` seen from now on.
    Result<Token> observe(std::string name, Callback callback, SerialQueue queue);
    // Stops one observation; the callback is not called for posts seen afterwards.
    void cancel(Token token);

    static bool validName(std::string_view name);

  private:
    struct Observer {
        std::string name;
        Callback callback;
        SerialQueue queue;
    };

    std::optional<Error> startWatching();
    void watch();
    void dispatch(const std::string& name);

    std::filesystem::path directory_;
    mutable std::mutex mutex_;
    std::map<Token, std::shared_ptr<Observer>> observers_;
    Token nextToken_ = 1;
    int inotifyFd_ = -1;
    int stopFd_ = -1;
    std::thread watcher_;
};

}  // namespace bexil
