// Descriptors passed with Zem frames: each reaches the frame that announced it, in order, however the frames are
// cut into sends; a peer that announces descriptors it did not pass, or passes more than a frame may carry, is
// disconnected without harm to the receiver.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <future>
#include <string>
#include <vector>

#include "TestSupport.h"
#include "base/EventLoop.h"
#include "base/SerialQueue.h"
#include "base/UniqueFd.h"
#include "platform/zem/ZemConnection.h"
#include "platform/zem/ZemFrame.h"
#include "platform/zem/ZemListener.h"

namespace bexil {
namespace {

constexpr const char* kService = "com.example.descriptors";

// A pipe whose write end has `text` written and closed; the read end is returned.
UniqueFd pipeHolding(const std::string& text) {
    int ends[2];
    if (pipe2(ends, O_CLOEXEC) != 0) return UniqueFd();
    EXPECT_EQ(write(ends[1], text.data(), text.size()), static_cast<ssize_t>(text.size()));
    close(ends[1]);
    return UniqueFd(ends[0]);
}

std::string readAll(int fd) {
    std::string out;
    char buffer[256];
    ssize_t n;
    while ((n = read(fd, buffer, sizeof buffer)) > 0) out.append(buffer, static_cast<size_t>(n));
    return out;
}

// A service that answers a request {"n": N} with a reply carrying a pipe that holds "payload-N", except that odd
// N get no descriptor; it counts the connections it lost.
class DescriptorService {
  public:
    DescriptorService() : queue_("descriptors", *loop_) {
        setenv("BX_SERVICE_DIR", dir_.path().c_str(), 1);
        auto listener = ZemListener::create(kService, queue_);
        EXPECT_TRUE(listener.ok());
        listener_ = *listener;
        listener_->setConnectionHandler([this](std::shared_ptr<ZemConnection> peer) {
            std::weak_ptr<ZemConnection> weak = peer;
            peer->setEventHandler([this, weak](const ZemConnection::Event& event) {
                auto peer = weak.lock();
                if (std::holds_alternative<ZemError>(event)) {
                    ++lost_;
                    return;
                }
                const ZemMessage& message = std::get<ZemMessage>(event);
                if (!peer) return;
                received_ += message.descriptorCount();
                uint64_t n = message.body().get("n").numberAsUInt64().value_or(0);
                std::vector<UniqueFd> descriptors;
                if (n % 2 == 0) descriptors.push_back(pipeHolding("payload-" + std::to_string(n)));
                peer->sendReplyWithDescriptors(message, Value::dictionary({{"n", Value::uint64(n)}}),
                                               std::move(descriptors));
            });
            peer->resume();
            peers_.push_back(peer);
        });
        listener_->resume();
    }
    ~DescriptorService() {
        queue_.sync([this] {
            listener_->cancel();
            for (auto& peer : peers_) peer->cancel();
        });
        loop_.reset();
    }
    int lost() {
        return queue_.sync([this] { return lost_; });
    }

    test::TempDir dir_{"zem-descriptors"};
    std::unique_ptr<EventLoop> loop_ = std::make_unique<EventLoop>(1);
    SerialQueue queue_;
    std::shared_ptr<ZemListener> listener_;
    std::vector<std::shared_ptr<ZemConnection>> peers_;
    int lost_ = 0;
    size_t received_ = 0;
};

// Guards the pairing of descriptors with frames: many replies written back to back, some with a descriptor and
// some without, each arrive with exactly their own.
TEST(ZemDescriptors, EachReplyCarriesItsOwnDescriptorInOrder) {
    DescriptorService service;
    EventLoop loop(1);
    SerialQueue queue("client", loop);
    auto client = ZemConnection::createClient(kService, queue);
    client->setEventHandler([](const ZemConnection::Event&) {});
    client->resume();
    constexpr uint64_t kRequests = 64;
    std::vector<std::promise<std::string>> results(kRequests);
    for (uint64_t n = 0; n < kRequests; ++n) {
        client->sendWithMessageReply(Value::dictionary({{"n", Value::uint64(n)}}), queue,
                                     [&results, n](const std::variant<ZemMessage, ZemError>& answer) {
                                         const auto* reply = std::get_if<ZemMessage>(&answer);
                                         if (reply == nullptr) return results[n].set_value("(connection error)");
                                         std::string text = "n=" + reply->body().get("n").description() +
                                                            " fds=" + std::to_string(reply->descriptorCount());
                                         if (reply->descriptorCount() == 1) text += " " + readAll(reply->descriptor(0));
                                         results[n].set_value(text);
                                     });
    }
    for (uint64_t n = 0; n < kRequests; ++n) {
        std::string expected =
            "n=" + std::to_string(n) + (n % 2 == 0 ? " fds=1 payload-" + std::to_string(n) : " fds=0");
        EXPECT_EQ(results[n].get_future().get(), expected);
    }
    client->cancel();
    queue.sync([] {});
}

// A raw peer on the service's socket: a frame that announces a descriptor it did not pass, and a send with more
// descriptors than any frame may carry, each end that peer's connection (and close what did arrive).
TEST(ZemDescriptors, AnnouncedButMissingOrTooManyDescriptorsDisconnectThePeer) {
    DescriptorService service;
    auto connectRaw = [&] {
        int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        std::string path = ZemListener::socketPathForService(kService).string();
        std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
        EXPECT_EQ(connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
        return UniqueFd(fd);
    };
    // Reads until the service closes the connection; true when it did within the time allowed.
    auto closedByService = [](int fd) {
        timeval timeout{5, 0};
        setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
        char buffer[512];
        ssize_t n;
        while ((n = read(fd, buffer, sizeof buffer)) > 0) {
        }
        return n == 0;
    };

    std::vector<uint8_t> frame;
    ASSERT_FALSE(ZemFrame::encode(ZemFrameKind::Request, 1, 0, Value::dictionary({{"n", Value::uint64(2)}}), frame, 1));
    UniqueFd missing = connectRaw();
    ASSERT_EQ(write(missing.get(), frame.data(), frame.size()), static_cast<ssize_t>(frame.size()));
    EXPECT_TRUE(closedByService(missing.get()));

    UniqueFd flood = connectRaw();
    std::vector<UniqueFd> pipes;
    std::vector<int> fds;
    for (int i = 0; i < 3 * ZemFrame::kMaxDescriptorsPerFrame; ++i) {
        pipes.push_back(pipeHolding("x"));
        fds.push_back(pipes.back().get());
    }
    iovec data{frame.data(), frame.size()};
    std::vector<char> control(CMSG_SPACE(sizeof(int) * fds.size()));
    msghdr message{};
    message.msg_iov = &data;
    message.msg_iovlen = 1;
    message.msg_control = control.data();
    message.msg_controllen = control.size();
    cmsghdr* header = CMSG_FIRSTHDR(&message);
    header->cmsg_level = SOL_SOCKET;
    header->cmsg_type = SCM_RIGHTS;
    header->cmsg_len = CMSG_LEN(sizeof(int) * fds.size());
    std::memcpy(CMSG_DATA(header), fds.data(), sizeof(int) * fds.size());
    ASSERT_EQ(sendmsg(flood.get(), &message, 0), static_cast<ssize_t>(frame.size()));
    EXPECT_TRUE(closedByService(flood.get()));
    EXPECT_EQ(service.lost(), 2);
    EXPECT_EQ(service.received_, 0u) << "no request of a misbehaving peer was handled";
}

}  // namespace
}  // namespace bexil
