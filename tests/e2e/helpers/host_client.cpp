// A host for end-to-end tests that need hosts in processes of their own: for each argument, in order,
// "add:PATH", "ready:UUID" or "launch:UUID" sends that request and prints "CODE TEXT" of the reply (0 and nothing on
// success), and "say:TEXT" sends TEXT as a line to the plug-in launched last and prints its one-line answer. The first
// line printed is the host's own pid. Each request goes on its own connection, as separate programs' would; the grant
// of "ready" belongs to this process, whichever connection asked.

#include <fcntl.h>
#include <unistd.h>

#include <cstdio>
#include <future>
#include <string>

#include "base/EventLoop.h"
#include "base/SerialQueue.h"
#include "base/UniqueFd.h"
#include "platform/zem/ZemConnection.h"

namespace {

using namespace bexil;

// The reply and a copy of the descriptor it passed, if any; none without a reply within ten seconds.
std::optional<std::pair<Value, UniqueFd>> requestOnce(const Value& request) {
    EventLoop loop(1);
    SerialQueue queue("host_client", loop);
    auto connection = ZemConnection::createClient("com.quorvel.bexil.bxd", queue);
    connection->setEventHandler([](const ZemConnection::Event&) {});
    connection->resume();
    auto promise = std::make_shared<std::promise<std::variant<ZemMessage, ZemError>>>();
    connection->sendWithMessageReply(
        request, queue, [promise](const std::variant<ZemMessage, ZemError>& reply) { promise->set_value(reply); });
    auto future = promise->get_future();
    bool answered = future.wait_for(std::chrono::seconds(10)) == std::future_status::ready;
    connection->cancel();
    if (!answered) return std::nullopt;
    auto reply = future.get();
    const auto* message = std::get_if<ZemMessage>(&reply);
    if (message == nullptr) return std::nullopt;
    UniqueFd descriptor(message->descriptorCount() > 0 ? fcntl(message->descriptor(0), F_DUPFD_CLOEXEC, 0) : -1);
    return std::pair<Value, UniqueFd>(message->body(), std::move(descriptor));
}

std::string exchange(int fd, const std::string& line) {
    std::string out = line + "\n";
    if (write(fd, out.data(), out.size()) != static_cast<ssize_t>(out.size())) return "(closed)";
    std::string answer;
    char c;
    while (read(fd, &c, 1) == 1 && c != '\n') answer += c;
    return answer;
}

}  // namespace

int main(int argc, char** argv) {
    printf("%d\n", static_cast<int>(getpid()));
    UniqueFd plugIn;
    for (int i = 1; i < argc; ++i) {
        std::string argument = argv[i];
        size_t colon = argument.find(':');
        std::string verb = argument.substr(0, colon),
                    rest = colon == std::string::npos ? "" : argument.substr(colon + 1);
        if (verb == "say") {
            printf("%s\n", plugIn ? exchange(plugIn.get(), rest).c_str() : "(nothing launched)");
            continue;
        }
        std::optional<Uuid> uuid = Uuid::parse(rest);
        if (verb != "add" && ((verb != "ready" && verb != "launch") || !uuid)) {
            fprintf(stderr, "host_client: expected add:PATH, ready:UUID, launch:UUID or say:TEXT, not %s\n", argv[i]);
            return 64;
        }
        Value list = verb == "add" ? Value::array({Value::string(rest)}) : Value::array({Value::uuid(*uuid)});
        auto reply = requestOnce(Value::dictionary({{"request", Value::string(verb)},
                                                    {"version", Value::uint64(3)},
                                                    {verb == "add" ? "paths" : "uuids", list}}));
        if (!reply) {
            fprintf(stderr, "host_client: no reply\n");
            return 2;
        }
        printf("%lld %s\n", static_cast<long long>(reply->first.get("errorcode").numberAsInt64().value_or(0)),
               std::string(reply->first.get("error").stringView()).c_str());
        if (reply->second) plugIn = std::move(reply->second);
        fflush(stdout);
    }
    return 0;
}
