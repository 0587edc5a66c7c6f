#include "platform/zem/ZemListener.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <list>
#include <map>
#include <mutex>
#include <set>

#include "base/EventLoopAsio.h"
#include "base/PosixError.h"
#include "base/StandardPaths.h"
#include "platform/log/Log.h"
#include "platform/zem/ZemSocketConnection.h"

// Design. Binding a service name is guarded by an advisory lock on "<socket>.lock", held for the listener's life:
// whoever holds it owns the name, so a second daemon fails at once and a socket file left by a dead daemon (whose
// lock died with it) is safely replaced. A socket handed over by systemd is used as it is. Accepted sockets become
// peer connections, each with a serial queue of its own on the listener's loop, and with the peer's identity taken
// right there, at accept, before the peer can exit and its pid be reused.

namespace bexil {

namespace {

using Protocol = asio::local::stream_protocol;

// After a failed accept (out of file descriptors, say), wait this long before the next try instead of spinning.
constexpr auto kAcceptRetryDelay = std::chrono::milliseconds(100);

// Where the listening socket came from: handed over by the service manager, or bound by this process.
enum class Origin { Activated, BoundHere };

class ZemSocketListener final : public ZemListener, public std::enable_shared_from_this<ZemSocketListener> {
  public:
    ZemSocketListener(std::string serviceName, SerialQueue queue, Origin origin, int lockFd)
        : serviceName_(std::move(serviceName)),
          queue_(std::move(queue)),
          acceptor_(*detail::QueueInternals::state(queue_)->core),
          signals_(*detail::QueueInternals::state(queue_)->core),
          retryTimer_(*detail::QueueInternals::state(queue_)->core),
          activated_(origin == Origin::Activated),
          lockFd_(lockFd) {}

    ~ZemSocketListener() override {
        if (lockFd_ >= 0) close(lockFd_);
    }

    Protocol::acceptor& acceptor() { return acceptor_; }

    void setConnectionHandler(ConnectionHandler handler) override { connectionHandler_ = std::move(handler); }
    void setLimits(Limits limits) override {
        limits.reservedForRoot = std::min(limits.reservedForRoot, limits.maxConnections / 4);
        limits_ = limits;
        ZemSocketConnection::setStalledConnectionTimeout(limits.stalledConnectionTimeout);
        ZemSocketConnection::setReadPauseBytes(limits.queuedReplyBytes);
    }
    void setErrorHandler(ErrorHandler handler) override { errorHandler_ = std::move(handler); }
    void setTerminationHandler(std::function<void()> handler) override { terminationHandler_ = std::move(handler); }

    void resume() override {
        queue_.async([self = shared_from_this()] {
            if (self->resumed_ || self->cancelled_) return;
            self->resumed_ = true;
            self->acceptNext();
            self->watchTermination();
        });
    }

    void cancel() override {
        queue_.async([self = shared_from_this()] {
            self->cancelled_ = true;
            asio::error_code ignored;
            self->acceptor_.close(ignored);
            self->signals_.cancel(ignored);
            self->retryTimer_.cancel();
        });
    }

    void keepAliveOpen() override { keepAlive_.fetch_add(1); }
    void keepAliveClose() override {
        if (keepAlive_.fetch_sub(1) == 0) {
            keepAlive_.fetch_add(1);
            log::ops().fault("keep-alive unit closed more often than opened on service %s", serviceName_.c_str());
        }
    }
    uint64_t keepAliveCount() const override { return keepAlive_.load(); }
    size_t connectionCount() const override { return connectionCount_.load(); }
    const std::string& serviceName() const override { return serviceName_; }
    bool activatedBySystemd() const override { return activated_; }

  private:
    // Counts a new connection of `uid`, or refuses it when a limit is reached: the total (with the last
    // reservedForRoot places kept for root) or the user's own. Each limit is logged once when it is hit.
    bool admit(uid_t uid) {
        std::lock_guard lock(countsMutex_);
        const size_t total = connectionCount_.load();
        const size_t forOthers = limits_.maxConnections - limits_.reservedForRoot;
        if (total >= limits_.maxConnections || (uid != 0 && total >= forOthers)) {
            if (!limitLogged_)
                log::ops().error(
                    "service %s has %zu connections, the limit (kMaxConnections %zu, of which %zu kept "
                    "for root): refusing new ones",
                    serviceName_.c_str(), total, limits_.maxConnections, limits_.reservedForRoot);
            limitLogged_ = true;
            return false;
        }
        size_t& ofUser = perUser_[uid];
        if (uid != 0 && ofUser >= limits_.maxConnectionsPerUser) {
            if (usersAtLimit_.insert(uid).second)
                log::ops().error(
                    "user %u has %zu connections to service %s, the limit (kMaxConnectionsPerUser): "
                    "refusing new ones",
                    static_cast<unsigned>(uid), ofUser, serviceName_.c_str());
            return false;
        }
        ++ofUser;
        connectionCount_.fetch_add(1);
        return true;
    }

    // A connection of `uid` has ended. Runs on the connection's queue.
    void release(uid_t uid) {
        std::lock_guard lock(countsMutex_);
        connectionCount_.fetch_sub(1);
        if (connectionCount_.load() + limits_.reservedForRoot < limits_.maxConnections) limitLogged_ = false;
        auto found = perUser_.find(uid);
        if (found == perUser_.end()) return;
        if (--found->second < limits_.maxConnectionsPerUser) usersAtLimit_.erase(uid);
        if (found->second == 0) perUser_.erase(found);
    }

    void acceptNext() {
        if (cancelled_) return;
        acceptor_.async_accept(detail::bindToQueue(
            queue_, [self = shared_from_this()](const asio::error_code& error, Protocol::socket socket) {
                self->onAccept(error, std::move(socket));
            }));
    }

    void onAccept(const asio::error_code& error, Protocol::socket socket) {
        if (cancelled_) return;
        if (error) {
            if (error == asio::error::operation_aborted) return;
            // Reported once until an accept succeeds again: out of descriptors, every retry would fail alike.
            Error failure = posixError(error.value(), "accept on service " + serviceName_);
            if (errorHandler_ && !acceptFailing_) errorHandler_(failure);
            acceptFailing_ = true;
            retryTimer_.expires_after(kAcceptRetryDelay);
            retryTimer_.async_wait(detail::bindToQueue(queue_, [self = shared_from_this()](const asio::error_code& e) {
                if (!e) self->acceptNext();
            }));
            return;
        }
        acceptFailing_ = false;
        int fd = socket.native_handle();
        ZemPeerCredentials peer = ZemPeerCredentials::ofConnectedSocket(fd);
        if (!admit(peer.uid)) {
            asio::error_code ignored;
            socket.close(ignored);
            acceptNext();
            return;
        }
        pid_t pid = peer.pid > 0 ? peer.pid : 0;
        SerialQueue peerQueue("peer-" + std::to_string(pid), queue_);
        auto connection =
            std::make_shared<ZemSocketConnection>(std::move(socket), peerQueue, serviceName_, std::move(peer));
        {
            // Connections that have ended are forgotten here, so the list stays as long as the live ones.
            std::lock_guard lock(peersMutex_);
            peers_.remove_if([](const std::weak_ptr<ZemSocketConnection>& weak) { return weak.expired(); });
            peers_.push_back(connection);
        }
        connection->setClosedCallback([self = shared_from_this(), uid = peer.uid] { self->release(uid); });
        // The next accept is asked for before this connection's handler runs, so that nothing the handler throws
        // can stop the service from taking connections.
        acceptNext();
        if (connectionHandler_)
            connectionHandler_(connection);
        else
            connection->cancel();
    }

    void watchTermination() {
        asio::error_code error;
        signals_.add(SIGTERM, error);
        if (error) {
            log::ops().error("cannot watch for SIGTERM: %s", error.message().c_str());
            return;
        }
        signals_.async_wait(detail::bindToQueue(queue_, [self = shared_from_this()](const asio::error_code& e, int) {
            if (e) return;
            log::ops().info("SIGTERM received: telling %zu clients that termination is imminent",
                            self->connectionCount_.load());
            std::list<std::weak_ptr<ZemSocketConnection>> peers;
            {
                std::lock_guard lock(self->peersMutex_);
                peers.swap(self->peers_);
            }
            for (auto& weak : peers)
                if (auto peer = weak.lock()) peer->deliverTerminationImminent();
            if (self->terminationHandler_)
                self->terminationHandler_();
            else
                std::exit(0);
        }));
    }

    const std::string serviceName_;
    SerialQueue queue_;
    Protocol::acceptor acceptor_;
    asio::signal_set signals_;
    asio::steady_timer retryTimer_;
    const bool activated_;
    int lockFd_;
    ConnectionHandler connectionHandler_;
    ErrorHandler errorHandler_;
    std::function<void()> terminationHandler_;
    bool resumed_ = false;
    bool cancelled_ = false;
    bool limitLogged_ = false;  // under countsMutex_
    bool acceptFailing_ = false;
    Limits limits_;
    std::mutex countsMutex_;
    std::map<uid_t, size_t> perUser_;
    std::set<uid_t> usersAtLimit_;
    std::atomic<uint64_t> keepAlive_{0};
    std::atomic<size_t> connectionCount_{0};
    std::mutex peersMutex_;
    std::list<std::weak_ptr<ZemSocketConnection>> peers_;
};

// The socket systemd passed for this service, if any: matched by its FileDescriptorName.
int activatedSocketFor(const std::string& serviceName) {
    char** names = nullptr;
    int count = sd_listen_fds_with_names(0, &names);
    int found = -1;
    for (int i = 0; i < count; ++i) {
        if (names && names[i] && serviceName == names[i]) found = SD_LISTEN_FDS_START + i;
    }
    if (names) {
        for (int i = 0; i < count; ++i) free(names[i]);
        free(names);
    }
    return found;
}

// True when a process accepts connections on the socket at `path` right now.
bool socketIsLive(const std::string& path) {
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) return false;
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    strncpy(addr.sun_path, path.c_str(), sizeof addr.sun_path - 1);
    bool live = connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0;
    close(fd);
    return live;
}

}  // namespace

std::filesystem::path ZemListener::serviceDirectory() { return bexil::serviceDirectory(); }

std::filesystem::path ZemListener::socketPathForService(const std::string& serviceName) {
    return serviceDirectory() / serviceName;
}

Result<std::shared_ptr<ZemListener>> ZemListener::create(const std::string& serviceName, SerialQueue& queue) {
    if (serviceName.empty() || serviceName.find('/') != std::string::npos || serviceName[0] == '.')
        return BXError(ErrorCode::OperationFailed, "invalid service name \"" + serviceName + "\"");

    if (int fd = activatedSocketFor(serviceName); fd >= 0) {
        auto listener = std::make_shared<ZemSocketListener>(serviceName, queue, Origin::Activated, -1);
        asio::error_code error;
        listener->acceptor().assign(Protocol(), fd, error);
        if (error) return posixError(error.value(), "socket passed by systemd for " + serviceName);
        log::ops().info("listening on service %s (socket passed by systemd)", serviceName.c_str());
        return std::shared_ptr<ZemListener>(listener);
    }

    std::filesystem::path dir = serviceDirectory();
    std::error_code ec;
    std::filesystem::create_directories(dir, ec);
    if (ec) return posixError(ec.value(), "cannot create service directory " + dir.string());
    std::string path = (dir / serviceName).string();
    if (path.size() >= sizeof(sockaddr_un{}.sun_path))
        return BXError(ErrorCode::OperationFailed, "socket path too long for service " + serviceName + ": " + path);

    int lockFd = open((path + ".lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
    if (lockFd < 0) return posixError(errno, "cannot open lock for service " + serviceName);
    if (flock(lockFd, LOCK_EX | LOCK_NB) != 0) {
        int error = errno;
        close(lockFd);
        if (error == EWOULDBLOCK)
            return BXError(ErrorCode::OperationFailed,
                           "service " + serviceName + " is already served by another process (" + path + ")");
        return posixError(error, "cannot lock service " + serviceName);
    }

    struct stat st {};
    if (lstat(path.c_str(), &st) == 0) {
        if (!S_ISSOCK(st.st_mode)) {
            close(lockFd);
            return BXError(ErrorCode::OperationFailed, path + " exists and is not a socket; not replacing it");
        }
        if (socketIsLive(path)) {
            close(lockFd);
            return BXError(ErrorCode::OperationFailed,
                           "service " + serviceName + " is already served by another process (" + path + ")");
        }
        log::ops().info("replacing stale socket %s", path.c_str());
        unlink(path.c_str());
    }

    auto listener = std::make_shared<ZemSocketListener>(serviceName, queue, Origin::BoundHere, lockFd);
    asio::error_code error;
    Protocol::acceptor& acceptor = listener->acceptor();
    acceptor.open(Protocol(), error);
    if (!error) acceptor.bind(Protocol::endpoint(path), error);
    // Every user may connect: what a caller may do is decided per request, from its identity.
    if (!error && chmod(path.c_str(), 0666) != 0) error = asio::error_code(errno, asio::system_category());
    if (!error) acceptor.listen(asio::socket_base::max_listen_connections, error);
    if (error) return posixError(error.value(), "cannot listen on " + path);
    log::ops().info("listening on service %s at %s", serviceName.c_str(), path.c_str());
    return std::shared_ptr<ZemListener>(listener);
}

}  // namespace bexil
