#include "platform/prefs/PreferencesWatch.h"

#include <sys/inotify.h>
#include <unistd.h>

#include <array>
#include <asio.hpp>
#include <atomic>
#include <cerrno>
#include <climits>
#include <cstring>

#include "base/EventLoopAsio.h"
#include "base/PosixError.h"
#include "platform/log/Log.h"

namespace bexil {

struct PreferencesWatch::State {
    State(asio::io_context& io, int fd, SerialQueue queue, std::function<void()> changed)
        : descriptor(io, fd), queue(std::move(queue)), changed(std::move(changed)) {}
    asio::posix::stream_descriptor descriptor;
    SerialQueue queue;
    std::function<void()> changed;
    std::atomic<bool> stopped{false};
};

namespace {

void arm(const std::shared_ptr<PreferencesWatch::State>& state);

// Reads every pending event (the descriptor is non-blocking) and reports the burst once.
void drain(const std::shared_ptr<PreferencesWatch::State>& state) {
    alignas(inotify_event) std::array<char, 16 * (sizeof(inotify_event) + NAME_MAX + 1)> buffer;
    bool any = false;
    for (;;) {
        ssize_t n = ::read(state->descriptor.native_handle(), buffer.data(), buffer.size());
        if (n <= 0) break;
        any = true;
    }
    if (any && !state->stopped) state->changed();
}

void arm(const std::shared_ptr<PreferencesWatch::State>& state) {
    state->descriptor.async_wait(asio::posix::stream_descriptor::wait_read,
                                 detail::bindToQueue(state->queue, [state](const asio::error_code& error) {
                                     if (error || state->stopped) return;
                                     drain(state);
                                     if (!state->stopped) arm(state);
                                 }));
}

}  // namespace

Result<std::unique_ptr<PreferencesWatch>> PreferencesWatch::start(const std::filesystem::path& directory,
                                                                  SerialQueue queue, std::function<void()> changed) {
    std::error_code ec;
    std::filesystem::create_directories(directory, ec);
    if (ec) return BXError(ErrorCode::OperationFailed, "cannot make " + directory.string() + ": " + ec.message());
    int fd = inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
    if (fd < 0) return posixError(errno, "inotify_init1");
    // The preferences store replaces a file by renaming a new one over it; other tools may write it in place.
    if (inotify_add_watch(fd, directory.c_str(), IN_CLOSE_WRITE | IN_MOVED_TO | IN_MOVED_FROM | IN_CREATE | IN_DELETE) <
        0) {
        int error = errno;
        ::close(fd);
        return posixError(error, "cannot watch " + directory.string());
    }
    asio::io_context& io = *detail::QueueInternals::state(queue)->core;
    auto state = std::make_shared<State>(io, fd, std::move(queue), std::move(changed));
    arm(state);
    return std::unique_ptr<PreferencesWatch>(new PreferencesWatch(std::move(state)));
}

PreferencesWatch::~PreferencesWatch() {
    state_->stopped = true;
    asio::error_code ignored;
    state_->descriptor.cancel(ignored);
}

}  // namespace bexil
