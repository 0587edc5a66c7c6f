#pragma once

// One request on its way through the daemon: the request message, the client that sent it and the reply being
// built. Made on the client's connection queue, dispatched once on the server's request queue, and answered
// exactly once with done() (directly or through fail()), possibly later from another queue. A Transaction holds
// its client strongly, so the client outlives every request it has pending.

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/ActingAs.h"
#include "base/Error.h"
#include "base/UniqueFd.h"
#include "bexil/Protocol.h"
#include "bexil/Value.h"
#include "platform/zem/ZemCodec.h"
#include "platform/zem/ZemMessage.h"

namespace bexil {

class BXDPlugIn;
class BXDServer;
class BXDZemClient;
class ZemConnection;

// The value under `key` if it is an array, otherwise none.
std::optional<Value> zem_dictionary_get_array(const Value& dictionary, std::string_view key);
// The value under `key` if it is a dictionary, otherwise none.
std::optional<Value> zem_dictionary_get_dictionary(const Value& dictionary, std::string_view key);

class Transaction : public std::enable_shared_from_this<Transaction> {
  public:
    // initWithRequest:forClient: stores both and creates the reply from the request.
    Transaction(ZemMessage request, std::shared_ptr<BXDZemClient> client);

    // Validates the envelope and calls the handler for the request's name. REQUIRES: on the server's request queue.
    void dispatch();
    // Sends the reply. Called exactly once per transaction; later calls are ignored.
    void done();
    // The same, passing `descriptors` with the reply (closed here once sent, or if the client is gone).
    void doneWithDescriptors(std::vector<UniqueFd> descriptors);
    // The same, with the reply's dictionary made of what the handler set and `entries`, encoded already (the
    // handler's entry of a key replaces the encoded one). For replies most of whose bytes were kept encoded.
    void doneWithEncodedEntries(const ZemCodec::Entries& entries);
    // The same with the whole reply encoded already, what the handler set included, so that a reply of megabytes
    // is not copied once more on its way out.
    void doneWithEncodedReply(std::vector<uint8_t> payload);
    // Answers that the reply, of `size` bytes (past the frame limit), cannot be sent: what doneWithEncodedReply
    // answers for such a payload, from a handler that stopped writing it once it was past the limit.
    void doneWithOversizedReply(size_t size);
    // Sets "errorcode" and "error" in the reply, then done().
    void fail(ErrorCode code, std::string_view message);
    // A Bexil-domain error answers with its own code and message; any other with `code` and its description.
    void fail(ErrorCode code, const Error& error);

    // The refusal of a plug-in to this host, code 11 "access to plugin ID denied: REASON".
    void denyAccess(const BXDPlugIn& plugIn, std::string_view reason);
    // The reason a held plug-in is refused.
    static constexpr std::string_view kOnHoldReason = "the plug-in is on hold";

    // Writes that wait for the disk run on the database's writer queue, and a request that makes one answers only
    // once it is durable. holdReply keeps every reply made from then on (by done() or fail(), on any queue) until
    // releaseReply sends it, and makes the client's later requests wait until then. REQUIRES: both on the request
    // queue; releaseReply only after holdReply.
    void holdReply();
    void releaseReply();
    // Holds the reply, runs `work` on the writer queue and then `finish` (when given) back on the request queue,
    // and only then sends the reply either of them made. An exception from either is answered as from a handler.
    // REQUIRES: on the request queue.
    void continueOnWriter(std::function<void()> work, std::function<void()> finish = nullptr);
    // Holds the reply and runs `step` on the request queue, on the loop's bulk thread: never beside another block,
    // but idle-scheduled, and the thread that reads requests goes first whenever it waits. So a handler
    // with a long walk lets other clients' requests in between its steps, and the CPU its steps take is not held
    // against theirs. The reply goes out once a step has answered; a step may resume again instead. A step that does
    // neither is a fault answered with code 4, and an exception from a step is answered as from a handler. REQUIRES: on
    // the request queue.
    void resumeLater(std::function<void()> step);

    const std::shared_ptr<BXDZemClient>& client() const { return client_; }
    const Value& request() const { return request_.body(); }
    const ZemMessage& requestMessage() const { return request_; }
    // The reply under construction. REQUIRES: only the handler touches it, before done().
    MutableDictionary& reply() { return reply_; }
    uint64_t version() const { return version_; }
    BXDServer* server() const;
    std::shared_ptr<ZemConnection> connection() const;
    bool answered() const { return answered_.load(); }

    // Called per path of a request with the path (resolved when `resolved`, else as the client sent it); false
    // stops the walk, after the handler has answered with fail().
    using RegistrationHandler = std::function<bool(const std::string& path, bool resolved)>;
    // Called per plug-in named by a request; false stops the walk, after the handler has answered with fail().
    using PlugInHandler = std::function<bool(const std::shared_ptr<BXDPlugIn>& plugIn)>;

    // Walks the request's "paths": every element must be an absolute path string. True when every path was handled
    // and every handler call returned true; on false the transaction has been answered.
    // Paths are resolved with the rights of `resolveAs` when given (see ActingAs), else with bxd's own.
    bool marshalPaths(const RegistrationHandler& handler, std::optional<UserIdentity> resolveAs = std::nullopt);
    // marshalPaths, then done() when it returned true.
    bool processPaths(const RegistrationHandler& handler, std::optional<UserIdentity> resolveAs = std::nullopt);
    // Walks the request's "uuids", resolving each through the database. Sends no reply on success.
    bool processUuidList(const PlugInHandler& handler);
    // Sets the reply entry's "annotations" to the plug-in's stored annotation, or to an empty dictionary.
    void addAnnotationForPlugInIn(const BXDPlugIn& plugIn, MutableDictionary& entry);

    // Request handlers, one per request name.
    void addPlugIns();
    void removePlugIns();
    void bulkPlugIns();
    void matchPlugIns();
    void readyPlugIns();
    void accessPlugIns();
    void annotatePlugIns();
    void bulkAnnotatePlugIns();
    void lockDownPlugIns();
    void launchPlugIn();
    void listHolds();
    void reportStatus();
    void changesSince();
    void explainPlugIn();
    void watchPlugIns();
    void unwatchPlugIns();
    // The parts of "add" and "remove" that run on the writer queue.
    void registerPaths(std::optional<UserIdentity> caller);
    void unregisterPaths(bool entitled);
    // Writes the annotation changes made so far on the writer queue, then publishes them as one change of
    // `changed` (whatever the outcome: they are in memory) and answers: done() and the change notification when
    // `succeeded`, else the failure the handler made already.
    void saveAnnotationsThenAnswer(bool succeeded, std::vector<std::shared_ptr<BXDPlugIn>> changed);

  private:
    void runHandler(protocol::Request request);
    // Runs `step` of the current request's handler, answering when it throws.
    void guarded(const std::function<void()>& step);
    void failWithCode(int64_t code, std::string_view message);

    ZemMessage request_;
    std::shared_ptr<BXDZemClient> client_;
    MutableDictionary reply_;
    uint64_t version_ = 0;
    std::atomic<bool> answered_{false};
    protocol::Request handling_ = protocol::Request::Status;
    // While set, a reply made is kept in heldReply_ for releaseReply.
    bool holding_ = false;
    // Set by resumeLater: a step of the handler is queued.
    bool resumed_ = false;
    struct HeldReply {
        Value reply;
        std::vector<UniqueFd> descriptors;
        // When not empty, the whole reply encoded (and `reply` is unused).
        std::vector<uint8_t> encoded;
    };
    std::optional<HeldReply> heldReply_;
    // Sends the reply, or keeps it while holding.
    void answer(HeldReply reply);
    void send(HeldReply reply);
    // The failure that replaces a reply of `size` bytes, more than a frame carries.
    Value tooLargeReply(size_t size) const;
};

}  // namespace bexil
