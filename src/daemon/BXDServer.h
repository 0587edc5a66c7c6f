#pragma once

// The one server of the bxd process: the plug-in database (its base class), the Zem listener, the three queues on
// which all daemon work runs, the hold list and the preferences. Built once by main and reachable through
// server(); lives for the life of the process. Requests run one at a time on mainQueue; holds are touched only
// inside syncQueue.

#include <array>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/SerialQueue.h"
#include "base/SyncQueue.h"
#include "bexil/Protocol.h"
#include "daemon/ChangeFeed.h"
#include "daemon/DiscoveryContinuation.h"
#include "daemon/StandingQueries.h"
#include "database/BXDUserPrefs.h"
#include "database/BXDatabase.h"
#include "platform/jobard/ServiceManager.h"
#include "platform/ksn/PrivacyConsent.h"
#include "platform/wardend/ProcessAssertions.h"

namespace bexil {

class BXDPlugIn;
class BXDPlugInHold;
class BXDZemClient;
class EntitlementsDirectory;
class EventLoop;
class LXBexilProxy;
class PreferencesWatch;
class ZemListener;

class BXDServer : public BXDatabase, public BXDatabaseDelegate {
  public:
    static constexpr const char* kDefaultServiceName = protocol::kServiceName.data();

    // initForService:database: builds the server on `loop`; none when the database or the listener cannot be
    // built (the listener failure is logged with its reason).
    static std::unique_ptr<BXDServer> initForServiceDatabase(const char* serviceName, const char* databasePath,
                                                             EventLoop& loop);
    ~BXDServer() override;

    // The process-wide server (null before initForServiceDatabase has run).
    static BXDServer* server();

    // Resumes the listener, tells systemd that bxd is ready, and runs the event loop on the calling thread.
    // Returns only when the loop is stopped (tests); the daemon's process ends from outside.
    void run();
    // Runs `work` on mainQueue: at once when called on the loop's thread while the queue is free, else queued.
    void submitWork(std::function<void()> work);

    // The trusted directory of programs' entitlements, from which clients' identities are built (null before
    // initForServiceDatabase). Lives as long as the server; safe from any thread.
    EntitlementsDirectory* entitlementsDirectory() const { return entitlements_.get(); }

    // Database delegate: plug-ins about to be uninstalled, plug-ins installed, elections made automatically. Each
    // is a change of the feed (see noteChange).
    void removedPlugIns(const std::vector<std::shared_ptr<const LXBexilProxy>>& plugIns) override;
    void installedPlugIns(const std::vector<std::shared_ptr<const LXBexilProxy>>& plugIns) override;
    void electedAutomatically(const BXDPlugIn& plugIn) override;
    // Asks the service manager to end every running instance of `plugIns`; `reply` runs once, on a queue of this
    // call, after every request has been answered. Returns at once; nothing blocks while processes end.
    void terminatePlugInsReply(const std::vector<std::shared_ptr<const LXBexilProxy>>& plugIns,
                               std::function<void()> reply);
    // The service manager that keeps hosts' grants and terminates instances (tests point it at their own runtime
    // directory).
    ServiceManager& serviceManager() { return serviceManager_; }
    void setServiceManager(ServiceManager manager) { serviceManager_ = std::move(manager); }
    // The user's privacy-consent answers, read when a plug-in is enabled.
    const PrivacyConsent& privacyConsent() const { return *consent_; }
    void setPrivacyConsent(std::shared_ptr<const PrivacyConsent> consent) { consent_ = std::move(consent); }
    // The process-assertion service that says which plug-ins are busy (tests point it at their own runtime
    // directory).
    const ProcessAssertions& processAssertions() const { return processAssertions_; }
    void setProcessAssertions(ProcessAssertions assertions) { processAssertions_ = std::move(assertions); }

    // Holds. Each runs its work synchronously on syncQueue, so REQUIRES: not inside syncQueue. Every change of the
    // set of holds posts the annotation-change notification once, after leaving syncQueue.
    // holdOnPlugIn: whether some hold names the plug-in.
    bool holdOnPlugIn(const BXDPlugIn& plugIn);
    // The first hold in force that names the plug-in, or none.
    std::shared_ptr<BXDPlugInHold> holdNamingPlugIn(const BXDPlugIn& plugIn);
    // Appends `hold` to the holds, unless `placer` has already been seen to die: its holds were released then, and
    // one added now would outlive it. Returns whether the hold was added.
    bool addHold(std::shared_ptr<BXDPlugInHold> hold, const BXDZemClient* placer = nullptr);
    // Releases the hold with that UUID, if there is one.
    void unholdToken(const Uuid& uuid);
    // Releases every hold that `client` placed (one notification per hold); holds whose client is gone stay.
    void unholdClient(const BXDZemClient* client);

    SerialQueue& zemQueue() { return zemQueue_; }
    SerialQueue& mainQueue() { return mainQueue_; }
    SyncQueue& syncQueue() { return syncQueue_; }
    ZemListener& service() { return *service_; }
    BXDUserPrefs& userPrefs() { return *userPrefs_; }
    EventLoop& eventLoop() { return loop_; }
    // REQUIRES: inside syncQueue.
    std::vector<std::shared_ptr<BXDPlugInHold>>& holds();

    unsigned verbose() const { return verbose_; }
    void setVerbose(unsigned count) { verbose_ = count; }

    // What "status" reports: requests dispatched since start, counted by name (safe from any thread), and when the
    // server was built.
    void countRequest(protocol::Request request) {
        served_[static_cast<size_t>(request)].fetch_add(1, std::memory_order_relaxed);
    }
    uint64_t served(protocol::Request request) const {
        return served_[static_cast<size_t>(request)].load(std::memory_order_relaxed);
    }
    std::chrono::steady_clock::time_point started() const { return started_; }

    // Makes and checks the continuations of paged discovery with this run's key.
    const DiscoveryContinuation& continuations() const { return continuations_; }
    // The longest a "match" (a page, or an unpaged one of many candidates) keeps the request queue at a time before
    // it lets the requests that came meanwhile in (its steps after the first run on the loop's bulk thread);
    // $BX_PAGE_STEP_MICROSECONDS sets it. Shorter steps serve other clients sooner and make a discovery cost a little
    // more. REQUIRES: on mainQueue.
    static constexpr std::chrono::microseconds kDefaultPageStep{50};
    std::chrono::microseconds pageStep() const { return pageStep_; }
    void setPageStep(std::chrono::microseconds step) { pageStep_ = step; }

    // ---- Changes ----

    // Every change a client could observe through "match", with its generation. REQUIRES: on mainQueue (but see
    // ChangeFeed::note).
    ChangeFeed& changeFeed() { return *changeFeed_; }
    // Publishes a change of `plugIns` on mainQueue: at once when called there, else as soon as it is free.
    void publishChange(Change::Kind kind, const std::vector<std::shared_ptr<BXDPlugIn>>& plugIns);
    // A change made on any thread that becomes public once the writer has finished what it is doing: on the writer
    // (registry events come there, before the registry's own commit for an uninstall) it waits for
    // noteWriterChanges, which continueOnWriter calls after a request's work on the writer, and else for the end of
    // the writer's current block; elsewhere it is noted at once. The feed publishes it on mainQueue.
    void noteChange(Change::Kind kind, std::vector<Uuid> plugIns, std::vector<std::string> identifiers);
    // Hands the changes made by the writer's current block to the feed. REQUIRES: on the writer.
    void noteWriterChanges();
    // A block for mainQueue that publishes what the feed has noted, unless the server has gone meanwhile.
    std::function<void()> publishingPending() const;
    // The global exclusions as stored now, as discovery reads them. Reading them also compares them with the last
    // value seen, and a difference is published as one exclusions change first, so nothing a "match" or "changes"
    // sees is missed. REQUIRES: on mainQueue.
    Value currentExclusions();

    // The standing queries, made by the first "watch" (null before). REQUIRES: on the request queue.
    StandingQueries* standingQueries() const { return standingQueries_.get(); }
    void setStandingQueries(std::unique_ptr<StandingQueries> queries) { standingQueries_ = std::move(queries); }

  private:
    BXDServer(const char* databasePath, EventLoop& loop);

    EventLoop& loop_;
    SerialQueue zemQueue_;
    SerialQueue mainQueue_;
    std::chrono::microseconds pageStep_ = kDefaultPageStep;
    SyncQueue syncQueue_;
    std::unique_ptr<EntitlementsDirectory> entitlements_;
    std::shared_ptr<ZemListener> service_;
    std::vector<std::shared_ptr<BXDPlugInHold>> holds_;
    std::unique_ptr<BXDUserPrefs> userPrefs_;
    unsigned verbose_ = 0;
    ServiceManager serviceManager_;
    ProcessAssertions processAssertions_;
    std::shared_ptr<const PrivacyConsent> consent_;
    std::array<std::atomic<uint64_t>, protocol::kRequests.size()> served_{};
    const std::chrono::steady_clock::time_point started_ = std::chrono::steady_clock::now();
    const DiscoveryContinuation continuations_;
    // Shared so that a publication queued on mainQueue can tell that the server has gone meanwhile.
    std::shared_ptr<ChangeFeed> changeFeed_;
    // Changes made by the writer's current block (touched on the writer only).
    std::vector<Change> writerChanges_;
    // The exclusions as last seen, to notice a change, and the watch that looks again when the folder changes.
    Value lastExclusions_;
    std::unique_ptr<PreferencesWatch> preferencesWatch_;
    // Last, so that the watches (which observe the server's changes) go first.
    std::unique_ptr<StandingQueries> standingQueries_;
};

}  // namespace bexil
