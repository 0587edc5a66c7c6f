#include "daemon/BXDZemClient.h"

#include <atomic>
#include <cinttypes>
#include <cstdio>

#include "daemon/BXDServer.h"
#include "daemon/Transaction.h"
#include "model/BXBundle.h"
#include "platform/codesign/CodeSigningIdentity.h"
#include "platform/log/Log.h"
#include "platform/trace/Probes.h"

namespace bexil {

// Every this-many requests of one client, a debug line counts them.
static constexpr unsigned kRequestCountLogInterval = 1000;

namespace {
std::atomic<uint64_t> lastSerial{0};
}  // namespace

BXDZemClient::BXDZemClient(const std::shared_ptr<ZemConnection>& connection, BXDServer* server)
    : connection_(connection), server_(server), serial_(lastSerial.fetch_add(1, std::memory_order_relaxed) + 1) {}

std::shared_ptr<BXDZemClient> BXDZemClient::initWithConnectionServer(const std::shared_ptr<ZemConnection>& connection,
                                                                     BXDServer* server) {
    std::shared_ptr<BXDZemClient> client(new BXDZemClient(connection, server));
    client->start();
    return client;
}

void BXDZemClient::start() {
    std::shared_ptr<ZemConnection> connection = connection_.lock();
    // Who the peer is: its executable, pinned to the live process by the pidfd the transport took at accept, and
    // the entitlements the trusted directory grants that executable.
    std::shared_ptr<const CodeSigningIdentity> identity =
        CodeSigningIdentity::ofPeer(connection->peerCredentials(), server_->entitlementsDirectory());

    if (identity && identity->established() && identity->executablePath().size() < kExecutablePathBufferSize) {
        path_ = identity->executablePath();
        std::shared_ptr<BXBundle> bundle = BXBundle::initWithExecutablePath(path_);
        if (bundle && bundle->path()) bundle_ = std::move(bundle);
    }

    const pid_t peer = connection->peerPid();
    log::ops().debug("new client %d %s", static_cast<int>(peer), path_.c_str());
    trace::clientNew(static_cast<int>(peer));
    if (bundle_)
        log::ops().debug("client %d is inside bundle %s (%s)", static_cast<int>(peer), bundle_->path()->c_str(),
                         bundle_->bundleIdentifier().value_or("no identifier").c_str());

    codeSigningIdentity_ = identity;

    // The connection owns the client from here on; its finalizer lets go once the connection has ended.
    connection->setContext(shared_from_this());
    connection->setFinalizer([](std::shared_ptr<void> context) { context.reset(); });
    std::weak_ptr<BXDZemClient> weakSelf = weak_from_this();
    connection->setEventHandler([weakSelf](const ZemConnection::Event& event) {
        if (std::shared_ptr<BXDZemClient> self = weakSelf.lock()) self->handleEvent(event);
    });
    connection->resume();
}

void BXDZemClient::handleEvent(const ZemConnection::Event& event) {
    if (const ZemError* error = std::get_if<ZemError>(&event)) {
        switch (error->kind()) {
            case ZemError::Kind::TerminationImminent:
                dying();
                return;
            case ZemError::Kind::ConnectionInvalid:
                dead();
                return;
            default:
                log::ops().error("unexpected error type from zem: %{public}@", *error);
                return;
        }
    }
    const ZemMessage& message = std::get<ZemMessage>(event);
    if (!message.body().isDictionary()) {
        log::ops().error("unexpected message: %{public}@ from: %d", message.body(), static_cast<int>(pid()));
        return;
    }
    if (trace::requestInputEnabled()) trace::requestInput(static_cast<int>(pid()), message.description().c_str());

    auto transaction = std::make_shared<Transaction>(message, shared_from_this());
    server_->submitWork([transaction] { transaction->client()->run(transaction); });
}

void BXDZemClient::run(const std::shared_ptr<Transaction>& transaction) {
    if (writing_) {
        waiting_.push_back(transaction);
        return;
    }
    unsigned count = ++requestCount_;
    if (count % kRequestCountLogInterval == 0)
        log::ops().debug("client %d used %u requests so far", static_cast<int>(pid()), count);
    transaction->dispatch();
}

void BXDZemClient::endWrite() {
    writing_ = false;
    // A request run here may begin a write of its own; the rest wait for that one in turn.
    while (!writing_ && !waiting_.empty()) {
        std::shared_ptr<Transaction> next = std::move(waiting_.front());
        waiting_.pop_front();
        run(next);
    }
}

void BXDZemClient::dying() { log::ops().debug("client %d termination imminent", static_cast<int>(pid())); }

void BXDZemClient::dead() {
    if (deathNoted_.exchange(true)) return;
    server_->unholdClient(this);
    // Watches live on the request queue. A "watch" of this client that runs after this point sees the death and
    // starts nothing; one that ran before is released here.
    server_->submitWork([server = server_, self = shared_from_this()] {
        if (StandingQueries* queries = server->standingQueries()) queries->releaseClient(*self);
    });
    log::ops().debug("client %d is dead", static_cast<int>(pid()));
    acceptWork_.store(false, std::memory_order_release);
    trace::clientDone(static_cast<int>(pid()));
}

bool BXDZemClient::peerHasHungUp() const {
    std::shared_ptr<ZemConnection> connection = connection_.lock();
    return !connection || connection->peerHasHungUp();
}

std::shared_ptr<const UniqueFd> BXDZemClient::pidfd() const {
    std::shared_ptr<ZemConnection> connection = connection_.lock();
    return connection ? connection->peerCredentials().pidfd : nullptr;
}

std::optional<UserIdentity> BXDZemClient::user() const {
    std::shared_ptr<ZemConnection> connection = connection_.lock();
    if (!connection) return std::nullopt;
    return UserIdentity{connection->peerUid(), connection->peerGid()};
}

pid_t BXDZemClient::pid() const {
    std::shared_ptr<ZemConnection> connection = connection_.lock();
    return connection ? connection->peerPid() : 0;
}

Value BXDZemClient::entitlementValueForKey(std::string_view key) const {
    if (!codeSigningIdentity_) {
        log::ops().error("error retrieving entitlements for client %d", static_cast<int>(pid()));
        return Value();
    }
    Result<Value> value = codeSigningIdentity_->entitlementValueForKey(key);
    if (!value) {
        log::ops().error("error retrieving entitlements for client %d", static_cast<int>(pid()));
        return Value();
    }
    return *value;
}

bool BXDZemClient::hasEntitlement(std::string_view key) const {
    Value value = entitlementValueForKey(key);
    return !value.isNull() && !(value == Value::boolean(false));
}

std::string BXDZemClient::description() const {
    char address[32];
    snprintf(address, sizeof address, "%p", static_cast<const void*>(this));
    std::shared_ptr<ZemConnection> connection = connection_.lock();
    if (!connection) return std::string("<BXDZemClient ") + address + " NO CONNECTION>";
    return formatPrintf("<BXDZemClient %s con=%@ pid=%d path=%@>", address, connection->description(),
                        static_cast<int>(connection->peerPid()), path_);
}

}  // namespace bexil
