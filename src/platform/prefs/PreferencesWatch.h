#pragma once

// Says when a file of a preferences folder may have changed: an inotify watch on the folder, carried by the event
// loop of the queue it is given, calls back on that queue after each burst of events (a file closed after writing,
// renamed in or out, created or deleted). It does not read or compare anything: the caller re-reads what it cares
// about, so a spurious call costs one read. Whoever starts it owns it; the calls stop when it is destroyed, which
// must happen on its queue or while the loop is not running the callback.

#include <filesystem>
#include <functional>
#include <memory>

#include "base/Error.h"
#include "base/SerialQueue.h"

namespace bexil {

class PreferencesWatch {
  public:
    // Watches `directory` (made when missing), calling `changed` on `queue`. An error when the folder cannot be made
    // or watched.
    static Result<std::unique_ptr<PreferencesWatch>> start(const std::filesystem::path& directory, SerialQueue queue,
                                                           std::function<void()> changed);
    ~PreferencesWatch();
    PreferencesWatch(const PreferencesWatch&) = delete;
    PreferencesWatch& operator=(const PreferencesWatch&) = delete;

    // What the watch's pending callbacks share with it (defined in the source).
    struct State;

  private:
    explicit PreferencesWatch(std::shared_ptr<State> state) : state_(std::move(state)) {}
    std::shared_ptr<State> state_;
};

}  // namespace bexil
