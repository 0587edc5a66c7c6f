#pragma once

// The watches of one BXDaemonClient as the client library keeps them: it starts each with "watch", routes bxd's
// messages to the right watch by its id, starts a watch again when bxd asks for a resync, and ends every watch when
// the connection is lost. Owned next to its client, which it must not outlive; the methods may be called from any
// thread, and every callback runs on the client's reply queue, in order.

#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "bexil/DaemonClient.h"
#include "bexil/Value.h"
#include "client/BXDaemonClient.h"

namespace bexil {

class BXDaemonWatches {
  public:
    using Callbacks = DaemonClient::WatchCallbacks;
    // How the message of a watch that ended because bxd could not be reached, or went away, begins.
    static constexpr std::string_view kConnectionLost = "the connection to bxd was lost: ";
    using Change = DaemonClient::WatchChange;

    explicit BXDaemonWatches(BXDaemonClient& client) : client_(client) {}
    ~BXDaemonWatches();
    BXDaemonWatches(const BXDaemonWatches&) = delete;
    BXDaemonWatches& operator=(const BXDaemonWatches&) = delete;

    // Starts a watch; its handle, or none when `rules` is neither null nor a dictionary.
    std::optional<uint64_t> watch(const Value& rules, uint64_t flags, Callbacks callbacks);
    // Ends it; `done` gets the reply of "unwatch", or an empty success when bxd had nothing to end yet.
    void unwatch(uint64_t handle, BXDaemonClient::ReplyHandler done);

  private:
    struct Watch {
        uint64_t handle = 0;
        Value rules;
        uint64_t flags = 0;
        Callbacks callbacks;
        std::optional<uint64_t> id;  // bxd's, while one is in force
        bool cancelled = false;
    };

    void start(const std::shared_ptr<Watch>& watch);
    void message(const Value& message);
    void connectionLost(const ZemError& error);
    std::shared_ptr<Watch> withId(uint64_t id);

    // Whether this object still exists, for the blocks of the reply queue that refer to it: a reply to "watch" or a
    // message can still be on its way when the owner destroys it. Held while such a block runs here.
    struct Life {
        std::recursive_mutex mutex;
        bool alive = true;
    };

    BXDaemonClient& client_;
    std::shared_ptr<Life> life_ = std::make_shared<Life>();
    std::mutex mutex_;
    uint64_t lastHandle_ = 0;
    bool routing_ = false;
    std::map<uint64_t, std::shared_ptr<Watch>> watches_;  // by handle
    std::map<uint64_t, std::shared_ptr<Watch>> ids_;      // by bxd's id
};

}  // namespace bexil
