#pragma once

// BXDaemonClient is the client end of the daemon's request protocol: it holds one Zem connection to bxd's service,
// builds one request dictionary per operation, sends it with a reply expected and hands the raw reply (the reply
// dictionary or the connection error in its place) to the caller's callback on its own serial queue, "bxd_client".
// The request methods may be called from any thread; every callback and connection event of one client runs on
// its replyQueue, one at a time, in delivery order, except the library's own hand-backs to a thread that waits for
// its reply (CallerThreadHandler), which may run on that thread. The object keeps its one connection for its whole life
// and never reconnects; destroying it cancels the connection, and replies still outstanding then arrive as connection
// errors.

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <variant>
#include <vector>

#include "base/Error.h"
#include "base/EventLoop.h"
#include "base/SerialQueue.h"
#include "bexil/Protocol.h"
#include "bexil/Value.h"
#include "platform/zem/ZemConnection.h"
#include "platform/zem/ZemError.h"

namespace bexil {

class BXDaemonClient {
  public:
    static constexpr const char* kDefaultServiceName = protocol::kServiceName.data();
    static constexpr const char* kReplyQueueLabel = "bxd_client";
    // The version written into every request after creation; the only one whose discovery result is encoded.
    static constexpr int64_t kProtocolVersion = protocol::kCurrentVersion;

    // The reply dictionary, or the connection-level error delivered in its place.
    using Reply = std::variant<Value, ZemError>;
    using ReplyHandler = std::function<void(const Reply&)>;
    // A reply together with the descriptors it passed (only "launch" passes one).
    using MessageReplyHandler = ZemConnection::MessageReplyHandler;
    // A reply handler of the library's own that only hands the reply to a thread blocked in waitOnCallingThread
    // (it runs no application code). A request made with one inside that wait may be answered on the waiting thread
    // instead of the reply queue.
    struct CallerThreadHandler {
        ReplyHandler handler;
        void operator()(const Reply& reply) const { handler(reply); }
    };
    // Runs `start`, then sends the requests that it (and the handlers of their replies) made with a
    // CallerThreadHandler one after the other, each exchanged on this thread when its connection allows
    // (ZemConnection::exchangeOnCallingThread) and sent as usual otherwise; `deadline()` bounds each exchange.
    // Returns when no such request is left to send; the caller then waits for the reply it wants as before.
    // REQUIRES: not called on a reply queue.
    static void waitOnCallingThread(const std::function<void()>& start,
                                    const std::function<std::chrono::steady_clock::time_point()>& deadline);

    // Connects to `serviceName`, or to kDefaultServiceName when it is null. The reply queue runs on `loop`.
    explicit BXDaemonClient(const char* serviceName = nullptr, EventLoop& loop = EventLoop::shared());
    ~BXDaemonClient();
    BXDaemonClient(const BXDaemonClient&) = delete;
    BXDaemonClient& operator=(const BXDaemonClient&) = delete;

    static std::shared_ptr<BXDaemonClient> initWithServiceName(const char* serviceName);

    const std::shared_ptr<ZemConnection>& bxd() const { return bxd_; }
    const SerialQueue& replyQueue() const { return replyQueue_; }
    const std::string& serviceName() const { return serviceName_; }
    int64_t protocolVersion() const { return protocolVersion_.load(std::memory_order_relaxed); }
    void setProtocolVersion(int64_t version) { protocolVersion_.store(version, std::memory_order_relaxed); }

    // Requests. `paths` is an array of path strings, `rules` and `annotations` dictionaries; each is sent as is.
    void addPlugInsReply(const Value& paths, ReplyHandler reply);
    void removePlugInsReply(const Value& paths, ReplyHandler reply);
    void bulkPluginsReply(uint64_t flags, ReplyHandler reply);
    void readyPlugInsFlagsReply(const std::vector<Uuid>& uuids, uint64_t flags, ReplyHandler reply);
    void accessPlugInsFlagsReply(const std::vector<Uuid>& uuids, uint64_t flags, ReplyHandler reply);
    void matchPlugInsFlagsReply(const Value& rules, uint64_t flags, ReplyHandler reply);
    // One page of paged discovery (an extension of the protocol): at most `pageSize` forms, after the position
    // that `continuation` (the previous page's, data) names, or from the start when it is null.
    void matchPagePlugInsFlagsReply(const Value& rules, uint64_t flags, uint64_t pageSize, const Value& continuation,
                                    ReplyHandler reply);
    // Called on the reply queue after each page of matchAllPagesReply but the last, with the forms received so far.
    using PageProgress = std::function<void(size_t formsSoFar)>;
    // Asks for page after page until the last, then answers `reply` once as an unpaged match would: "matches"
    // holds the forms of every page in order, with the replacement links written across pages, and "generation"
    // is the first page's (the walk reflects at least every change up to it). A page that fails answers in place of
    // the whole. A daemon that does not page answers everything in its first reply.
    void matchAllPagesReply(const Value& rules, uint64_t flags, uint64_t pageSize, PageProgress progress,
                            ReplyHandler reply);
    void setPluginAnnotationsAnnotationsReply(const std::vector<Uuid>& uuids, const Value& annotations,
                                              ReplyHandler reply);
    void bulkSetPluginAnnotationsReply(const Value& annotations, ReplyHandler reply);
    void holdPluginsFlagsReply(const Value& paths, uint64_t flags, ReplyHandler reply);
    void releaseHoldReply(const Uuid& hold, ReplyHandler reply);
    // The holds in force (needs the manager entitlement).
    void listHoldsReply(ReplyHandler reply);
    // What bxd is doing now (any client may ask).
    void statusReply(ReplyHandler reply);
    // The plug-ins added, removed and changed since `generation` (an extension of ours).
    void changesReply(uint64_t generation, ReplyHandler reply);
    // Why a match with `rules` (none when null) and `flags` returns the plug-in `plugIn` (an identifier, UUID, UUID
    // text or absolute path) or not (an extension of the protocol).
    void explainPlugInRulesFlagsReply(const Value& plugIn, const Value& rules, uint64_t flags, ReplyHandler reply);
    // Starts a plug-in made ready for this process; the reply passes the socket to it as descriptor 0.
    void launchPlugInReply(const Uuid& plugIn, MessageReplyHandler reply);
    // Standing queries (an extension of the protocol): "watch" answers with the watch's id, its result and its
    // generation; the watch's messages then come to the message handler. "unwatch" ends one.
    void watchPlugInsFlagsReply(const Value& rules, uint64_t flags, ReplyHandler reply);
    void unwatchReply(uint64_t watch, ReplyHandler reply);

    // What bxd sends on its own (the messages of watches), and the end of the connection. Both run on the reply
    // queue, in the order of the frames they come from relative to replies: a watch's messages never overtake the
    // reply that started it. Either may be set at any time, from any thread.
    using MessageHandler = std::function<void(const Value& message)>;
    using ConnectionHandler = std::function<void(const ZemError& error)>;
    void setMessageHandler(MessageHandler handler);
    void setConnectionHandler(ConnectionHandler handler);

    // Building blocks of the request methods.
    MutableDictionary request(protocol::Request name) const;
    MutableDictionary requestPaths(protocol::Request name, const Value& paths) const;
    static void setUuids(MutableDictionary& request, const std::vector<Uuid>& uuids);
    void sendReply(const Value& request, ReplyHandler reply);

    // None when the reply reports success; code 4 with the error's description for a connection error.
    // Throws InternalInconsistency for a reply that carries a message without a code.
    static std::optional<Error> errorInReply(const Reply& reply);

    // The message form of the discovery result for `version`; none for every version but 3.
    static std::optional<Value> convertToZEMVersion(const Value& value, int64_t version);
    // The value decoded from the message form; none unless this client's protocolVersion is 3.
    std::optional<Value> convertFromZEM(const Value& value) const;

    // Writes the replacement links ("overrider", "overriding") among `forms` as the daemon writes them within one
    // reply: a form whose entitlements name identifiers it replaces links with every form of those identifiers.
    static void linkReplacements(std::vector<Value>& forms);

  private:
    struct PagedWalk;
    // Sends `request` on the connection, answering `reply` on the reply queue.
    void sendOnQueue(const Value& request, ReplyHandler reply);
    // One exchange of waitOnCallingThread.
    void exchangeOnCallingThread(const Value& request, ReplyHandler reply,
                                 std::chrono::steady_clock::time_point deadline);
    void continueWalk(const std::shared_ptr<PagedWalk>& walk, const Value& continuation);

    struct Handlers {
        std::mutex mutex;
        MessageHandler message;
        ConnectionHandler connection;
    };

    // Whether this object still exists, for the reply blocks of a paged walk that would ask for the next page
    // through it: a page can be read and queued just before the owner destroys the client. Held while such a block
    // uses the object (it runs no application code meanwhile), so the destructor waits for one that is running.
    struct Life {
        std::mutex mutex;
        bool alive = true;
    };

    std::shared_ptr<Life> life_ = std::make_shared<Life>();
    std::string serviceName_;
    SerialQueue replyQueue_;
    // Shared with the connection's event handler, which may outlive this object by a queued block.
    std::shared_ptr<Handlers> handlers_ = std::make_shared<Handlers>();
    std::shared_ptr<ZemConnection> bxd_;
    std::atomic<int64_t> protocolVersion_;
};

}  // namespace bexil
