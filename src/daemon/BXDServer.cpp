#include "daemon/BXDServer.h"

#include <systemd/sd-daemon.h>

#include <algorithm>
#include <atomic>

#include "base/EventLoop.h"
#include "daemon/BXDPlugInHold.h"
#include "daemon/BXDZemClient.h"
#include "daemon/GenerationStore.h"
#include "platform/codesign/EntitlementsDirectory.h"
#include "platform/ksn/ConsentStore.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/log/Log.h"
#include "platform/prefs/PreferencesWatch.h"
#include "platform/zem/ZemConnection.h"
#include "platform/zem/ZemListener.h"
#include "policy/BXDPlugIn.h"

namespace bexil {

// The server of this process, as BXDServer::server() answers it.
static std::atomic<BXDServer*> runningServer{nullptr};

// How long bxd lingers after SIGTERM so that termination-imminent events reach every connection queue.
static constexpr auto kTerminationGrace = std::chrono::milliseconds(50);

BXDServer::BXDServer(const char* databasePath, EventLoop& loop)
    : BXDatabase(databasePath ? std::optional<std::string>(databasePath) : std::nullopt),
      loop_(loop),
      zemQueue_("zem", loop),
      mainQueue_("service", loop),
      syncQueue_("serverSync"),
      consent_(std::make_shared<ConsentStore>()) {}

BXDServer::~BXDServer() {
    preferencesWatch_.reset();
    if (service_) service_->cancel();
    // What the writer still has queued may call back into the server (as the database's delegate): let it finish
    // while the server is whole.
    waitForWriter();
    setDelegate(nullptr);
    BXDServer* self = this;
    runningServer.compare_exchange_strong(self, nullptr);
}

std::unique_ptr<BXDServer> BXDServer::initForServiceDatabase(const char* serviceName, const char* databasePath,
                                                             EventLoop& loop) {
    std::unique_ptr<BXDServer> server(new BXDServer(databasePath, loop));
    if (!server->initWithDatabase()) return nullptr;

    server->entitlements_ = std::make_unique<EntitlementsDirectory>(EntitlementsDirectory::defaultPath(), geteuid());
    Result<std::shared_ptr<ZemListener>> listener =
        ZemListener::create(serviceName ? serviceName : kDefaultServiceName, server->zemQueue_);
    if (!listener) {
        log::ops().error("cannot listen on service %s: %@", serviceName ? serviceName : kDefaultServiceName,
                         listener.error());
        return nullptr;
    }
    server->service_ = *listener;

    runningServer.store(server.get());
    server->setDelegate(server.get());

    BXDServer* raw = server.get();
    server->service_->setConnectionHandler([raw](std::shared_ptr<ZemConnection> connection) {
        // The client object lives as long as its connection: the server keeps no list of clients.
        BXDZemClient::initWithConnectionServer(connection, raw);
    });
    server->service_->setErrorHandler(
        [](const Error& error) { log::ops().error("error on the listening endpoint: %@", error); });

    // After SIGTERM every client has been told; give their connection queues a moment to log it, then leave the
    // loop so that main returns and the process exits with status 0.
    server->service_->setTerminationHandler(
        [raw] { raw->mainQueue_.asyncAfter(kTerminationGrace, [raw] { raw->loop_.stop(); }); });

    server->userPrefs_ = std::make_unique<BXDUserPrefs>();
    // What the exclusions are at start is no change; a difference from here on is.
    server->lastExclusions_ = server->userPrefs_->exclusions();
    server->changeFeed_ = std::make_shared<ChangeFeed>(
        std::make_unique<GenerationStore>(GenerationStore::defaultPath()), server->mainQueue_);
    Result<std::unique_ptr<PreferencesWatch>> watch = PreferencesWatch::start(
        PreferencesStore::shared().directory(), server->mainQueue_, [raw] { raw->currentExclusions(); });
    if (watch)
        server->preferencesWatch_ = std::move(*watch);
    else
        log::ops().error(
            "cannot watch the preferences folder: %@; an exclusions change is noticed at the next "
            "discovery",
            watch.error());
    return server;
}

BXDServer* BXDServer::server() { return runningServer.load(); }

void BXDServer::run() {
    service_->resume();
    // Readiness means "accepting connections": the listener is bound and resumed, the loop starts right below.
    sd_notify(0, "READY=1");
    loop_.runOnCurrentThread();
}

// Work usually arrives from a connection queue on the loop's own thread; dispatching runs it there at once when the
// request queue is free, so a request goes from its bytes to its reply without another turn of the loop.
void BXDServer::submitWork(std::function<void()> work) { mainQueue_.dispatch(std::move(work)); }

namespace {

// The UUIDs and identifiers of registry records, as a change names them.
void describe(const std::vector<std::shared_ptr<const LXBexilProxy>>& plugIns, std::vector<Uuid>& uuids,
              std::vector<std::string>& identifiers) {
    for (const std::shared_ptr<const LXBexilProxy>& plugIn : plugIns) {
        if (!plugIn->pluginUUID()) continue;
        uuids.push_back(*plugIn->pluginUUID());
        identifiers.push_back(plugIn->pluginIdentifier().value_or(""));
    }
}

}  // namespace

void BXDServer::removedPlugIns(const std::vector<std::shared_ptr<const LXBexilProxy>>& plugIns) {
    std::vector<Uuid> uuids;
    std::vector<std::string> identifiers;
    describe(plugIns, uuids, identifiers);
    if (changeFeed_) noteChange(Change::Kind::Unregistered, std::move(uuids), std::move(identifiers));
    terminatePlugInsReply(plugIns, [plugIns] { log::ops().debug("removal complete for %@", plugIns); });
}

void BXDServer::installedPlugIns(const std::vector<std::shared_ptr<const LXBexilProxy>>& plugIns) {
    std::vector<Uuid> uuids;
    std::vector<std::string> identifiers;
    describe(plugIns, uuids, identifiers);
    if (changeFeed_) noteChange(Change::Kind::Registered, std::move(uuids), std::move(identifiers));
}

void BXDServer::electedAutomatically(const BXDPlugIn& plugIn) {
    if (!changeFeed_ || !plugIn.uuid()) return;
    noteChange(Change::Kind::Annotated, {*plugIn.uuid()}, {plugIn.identifier().value_or("")});
}

// ---- Changes ----

void BXDServer::noteChange(Change::Kind kind, std::vector<Uuid> plugIns, std::vector<std::string> identifiers) {
    // The publication waits for the writer's current block in either case: an automatic election is saved by a
    // block queued before this one, and an uninstall is committed by the rest of the block that announced it.
    auto publishAfterWriter = [this] {
        noteWriterChanges();
        mainQueue_.async(publishingPending());
    };
    if (writer().isCurrent()) {
        writerChanges_.push_back(Change{0, kind, std::move(plugIns), std::move(identifiers)});
    } else {
        changeFeed_->note(kind, std::move(plugIns), std::move(identifiers));
    }
    writer().async(publishAfterWriter);
}

void BXDServer::noteWriterChanges() {
    std::vector<Change> changes;
    changes.swap(writerChanges_);
    for (Change& change : changes)
        changeFeed_->note(change.kind, std::move(change.plugIns), std::move(change.identifiers));
}

void BXDServer::publishChange(Change::Kind kind, const std::vector<std::shared_ptr<BXDPlugIn>>& plugIns) {
    std::vector<Uuid> uuids;
    std::vector<std::string> identifiers;
    for (const std::shared_ptr<BXDPlugIn>& plugIn : plugIns) {
        if (!plugIn || !plugIn->uuid()) continue;
        uuids.push_back(*plugIn->uuid());
        identifiers.push_back(plugIn->identifier().value_or(""));
    }
    if (mainQueue_.isCurrent()) {
        changeFeed_->publish(kind, std::move(uuids), std::move(identifiers));
        return;
    }
    changeFeed_->note(kind, std::move(uuids), std::move(identifiers));
    mainQueue_.async(publishingPending());
}

std::function<void()> BXDServer::publishingPending() const {
    return [feed = std::weak_ptr<ChangeFeed>(changeFeed_)] {
        if (std::shared_ptr<ChangeFeed> alive = feed.lock()) alive->publishPending();
    };
}

Value BXDServer::currentExclusions() {
    Value exclusions = userPrefs_->exclusions();
    if (!(exclusions == lastExclusions_)) {
        lastExclusions_ = exclusions;
        changeFeed_->publish(Change::Kind::ExclusionsChanged, {}, {});
    }
    return exclusions;
}

// Every record gets one request to the service manager; their completions run on this call's "killer" queue, one
// at a time, and the last of them sends the reply. Nothing waits for a process to exit: the service manager's
// watches on the event loop say when each one has.
void BXDServer::terminatePlugInsReply(const std::vector<std::shared_ptr<const LXBexilProxy>>& plugIns,
                                      std::function<void()> reply) {
    SerialQueue killer("killer", loop_);
    const size_t count = plugIns.size();
    log::ops().debug("waiting for %d termination replies", static_cast<int>(count));
    if (count == 0) {
        killer.async([reply = std::move(reply)] {
            log::ops().debug("sending termination reply");
            reply();
        });
        return;
    }
    struct Waiting {
        size_t remaining;
        std::function<void()> reply;
    };
    auto waiting = std::make_shared<Waiting>(Waiting{count, std::move(reply)});
    log::ops().debug("awaiting termination reply #%d", 0);
    for (const std::shared_ptr<const LXBexilProxy>& plugIn : plugIns) {
        std::string version = "1";
        if (plugIn->infoVrec())
            if (const std::string* v = plugIn->infoVrec()->get("BDBundleVersion").getString()) version = *v;
        std::string uuid = plugIn->pluginUUID() ? plugIn->pluginUUID()->string() : std::string("(none)");
        log::ops().debug("requesting termination for %@(%@) jobard:%@ %@", plugIn->bundleIdentifier(),
                         plugIn->bundleVersion(), version, uuid);
        serviceManager_.removeExternalService(
            plugIn->bundleIdentifier().value_or(""), version, killer, [waiting, uuid, count](int error) {
                if (error == 0)
                    log::ops().info("one or more plug-ins have been terminated for uuid=%@", uuid);
                else if (error == ServiceManager::kNothingOnRecord)
                    log::ops().debug("jobard reported no plug-ins on record for uuid=%@", uuid);
                else
                    log::ops().error("jobard error attempting to terminate plug-ins: error=%d for uuid=%@", error,
                                     uuid);
                if (--waiting->remaining > 0) {
                    log::ops().debug("awaiting termination reply #%d", static_cast<int>(count - waiting->remaining));
                    return;
                }
                log::ops().debug("sending termination reply");
                waiting->reply();
            });
    }
}

std::vector<std::shared_ptr<BXDPlugInHold>>& BXDServer::holds() { return holds_; }

bool BXDServer::holdOnPlugIn(const BXDPlugIn& plugIn) {
    return syncQueue_.sync([&] {
        return std::any_of(holds_.begin(), holds_.end(),
                           [&](const std::shared_ptr<BXDPlugInHold>& hold) { return hold->blocks(plugIn); });
    });
}

bool BXDServer::addHold(std::shared_ptr<BXDPlugInHold> hold, const BXDZemClient* placer) {
    // A client's death is noted before its holds are released on this queue, so the check and the addition here
    // either come before that release (which then takes the hold) or see the death.
    bool added = syncQueue_.sync([&] {
        if (placer != nullptr && placer->isDead()) return false;
        holds_.push_back(hold);
        return true;
    });
    if (!added) return false;
    publishChange(Change::Kind::HoldPlaced, hold->blocked());
    hold.reset();
    log::ops().debug("keep-alive units open: %zu", BXDPlugInHold::openKeepAliveUnits());
    notifyAnnotationChange();
    return true;
}

void BXDServer::unholdToken(const Uuid& uuid) {
    // The released hold is destroyed (closing its keep-alive unit) after syncQueue is left.
    std::shared_ptr<BXDPlugInHold> released;
    syncQueue_.sync([&] {
        auto found = std::find_if(holds_.begin(), holds_.end(),
                                  [&](const std::shared_ptr<BXDPlugInHold>& hold) { return hold->uuid() == uuid; });
        if (found == holds_.end()) return;
        log::ops().debug("releasing plug-in hold %{public}@ at client's request", uuid.string());
        released = std::move(*found);
        holds_.erase(found);
    });
    if (!released) return;
    publishChange(Change::Kind::HoldReleased, released->blocked());
    released.reset();
    log::ops().debug("keep-alive units open: %zu", BXDPlugInHold::openKeepAliveUnits());
    notifyAnnotationChange();
}

void BXDServer::unholdClient(const BXDZemClient* client) {
    std::vector<std::shared_ptr<BXDPlugInHold>> released;
    const int pid = client != nullptr ? static_cast<int>(client->pid()) : 0;
    syncQueue_.sync([&] {
        for (auto hold = holds_.begin(); hold != holds_.end();) {
            if (!(*hold)->placedBy(client)) {
                ++hold;
                continue;
            }
            log::ops().debug("releasing plug-in hold %{public}@ for dead client pid %d", (*hold)->uuid().string(), pid);
            released.push_back(std::move(*hold));
            hold = holds_.erase(hold);
        }
    });
    if (released.empty()) return;
    for (const std::shared_ptr<BXDPlugInHold>& hold : released)
        publishChange(Change::Kind::HoldReleased, hold->blocked());
    size_t count = released.size();
    released.clear();
    log::ops().debug("keep-alive units open: %zu", BXDPlugInHold::openKeepAliveUnits());
    for (size_t i = 0; i < count; ++i) notifyAnnotationChange();
}

}  // namespace bexil
