// The C interface of libbexil (bexil/bexil-c.h) against the real bxd, linked as an application links it: only
// libbexil.so and its public header. Each request once through a whole life of a plug-in, then each way a call can
// fail: no daemon, no reply in time, a missing entitlement, an unknown plug-in, bad JSON, NULL and malformed
// arguments, and a request from an observer callback.

#include <gtest/gtest.h>
#include <poll.h>
#include <unistd.h>

#include <condition_variable>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "../e2e/BxdProcess.h"
#include "bexil/bexil-c.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using nlohmann::json;
using test::BxdProcess;

// One call's outcome: its code, the reply (null on failure) and the error's parts.
struct Call {
    int code = -1;
    json reply;
    std::string message;
    bool noReply = false;
    json failedReply;
};

// Runs `call` with a reply and an error out-parameter and collects both, freeing what the library handed out.
template <typename F>
Call collect(F&& call) {
    char* reply = nullptr;
    bexil_error* error = nullptr;
    Call outcome;
    outcome.code = call(&reply, &error);
    EXPECT_EQ(outcome.code == BEXIL_OK, error == nullptr) << "an error exactly when the call failed";
    if (reply != nullptr) outcome.reply = json::parse(reply);
    EXPECT_EQ(bexil_error_code(error), outcome.code);
    outcome.message = bexil_error_message(error);
    outcome.noReply = bexil_error_no_reply(error) != 0;
    if (const char* failed = bexil_error_reply(error)) outcome.failedReply = json::parse(failed);
    bexil_free(reply);
    bexil_error_free(error);
    return outcome;
}

// What the observer callback saw; the test waits on it.
struct Observed {
    std::mutex mutex;
    std::condition_variable changed;
    std::vector<std::string> names;
    std::string requestInCallback;
    bexil_client* client = nullptr;

    static void callback(const char* name, uint64_t, void* context) {
        auto* self = static_cast<Observed*>(context);
        // A request from here would wait for this very thread: it is refused at once.
        Call refused = collect([&](char** r, bexil_error** e) { return bexil_status(self->client, r, e); });
        std::lock_guard lock(self->mutex);
        self->names.emplace_back(name);
        self->requestInCallback = refused.message;
        self->changed.notify_all();
    }
    bool waitForCount(size_t count) {
        std::unique_lock lock(mutex);
        return changed.wait_for(lock, std::chrono::seconds(10), [&] { return names.size() >= count; });
    }
};

class CInterfaceTest : public ::testing::Test {
  protected:
    CInterfaceTest() {
        bxd_.exportEnvironment();
        fs::create_directories(bxd_.root() / "bundles");
        bundles_ = fs::canonical(bxd_.root() / "bundles");
        fs::copy(fs::path(BEXIL_SOURCE_DIR) / "examples/bundles/Greeter.app", bundles_ / "Greeter.app",
                 fs::copy_options::recursive);
        fs::copy_file(fs::path(BEXIL_BINARY_DIR) / "examples/plugins/hello-plugin", hello() + "/hello",
                      fs::copy_options::overwrite_existing);
    }
    ~CInterfaceTest() override { bexil_client_free(client_); }

    bool start() { return bxd_.start({"-d", (bxd_.root() / "annotations.vrec").string()}); }
    // Entitlements are read when a client connects: grant before making the client.
    void grantManager() {
        fs::path file = bxd_.entitlementsDir() / "self.vrec";
        std::ofstream(file) << "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<vrec version=\"1\">\n<dict>\n"
                            << "<key>Executable</key><string>" << fs::canonical("/proc/self/exe").string()
                            << "</string>\n<key>Entitlements</key><dict><key>com.quorvel.private.bexil.manager</key>"
                            << "<true/></dict>\n</dict>\n</vrec>\n";
        fs::permissions(file, fs::perms(0644));
    }
    bexil_client* client() {
        if (client_ == nullptr) client_ = bexil_client_new(nullptr, nullptr);
        return client_;
    }
    std::string hello() const { return (bundles_ / "Greeter.app/PlugIns/Hello.bxplugin").string(); }

    BxdProcess bxd_;
    fs::path bundles_;
    bexil_client* client_ = nullptr;
};

// Guards every request once, in the order of a plug-in's life, with the reply each hands out as JSON: add,
// bulk, match (the forms decoded), ready, access, annotate and bulk-annotate (each posts the change a callback
// sees), hold, holds, release, status, launch (pid and a socket the plug-in answers on) and remove.
TEST_F(CInterfaceTest, EveryRequestOnceAgainstTheDaemon) {
    ASSERT_TRUE(start()) << bxd_.log();
    grantManager();
    bexil_client* c = client();
    ASSERT_NE(c, nullptr);
    EXPECT_STREQ(bexil_client_service(c), "com.quorvel.bexil.bxd");
    EXPECT_STREQ(bexil_version(), "0.1.0");

    Observed observed;
    observed.client = c;
    uint64_t token = 0;
    ASSERT_EQ(bexil_observe(c, "com.quorvel.bexil.annotation-change", Observed::callback, &observed, &token, nullptr),
              BEXIL_OK);

    const std::string path = hello();
    const char* paths[] = {path.c_str()};
    EXPECT_EQ(collect([&](char** r, bexil_error** e) { return bexil_add(c, paths, 1, r, e); }).code, BEXIL_OK);
    EXPECT_EQ(collect([&](char** r, bexil_error** e) { return bexil_bulk(c, 0, r, e); }).code, BEXIL_OK);

    Call match = collect([&](char** r, bexil_error** e) {
        return bexil_match(c, R"({"RZExtensionIdentifier": "com.example.greeter.hello"})", 0, r, e);
    });
    ASSERT_EQ(match.code, BEXIL_OK) << match.message;
    ASSERT_EQ(match.reply["matches"].size(), 1u) << match.reply.dump();
    const json& form = match.reply["matches"][0];
    EXPECT_EQ(form["path"], path);
    const std::string uuid = form["uuid"];
    const char* uuids[] = {uuid.c_str()};

    EXPECT_EQ(collect([&](char** r, bexil_error** e) { return bexil_ready(c, uuids, 1, r, e); }).code, BEXIL_OK);
    Call access = collect([&](char** r, bexil_error** e) { return bexil_access(c, uuids, 1, r, e); });
    EXPECT_EQ(access.code, BEXIL_OK) << access.message;
    EXPECT_TRUE(access.reply["extensions"].is_array()) << access.reply.dump();

    Call annotate =
        collect([&](char** r, bexil_error** e) { return bexil_annotate(c, uuids, 1, R"({"election": 1})", r, e); });
    EXPECT_EQ(annotate.code, BEXIL_OK) << annotate.message;
    EXPECT_TRUE(observed.waitForCount(1)) << "no annotation-change seen";
    const std::string bulk = R"({")" + uuid + R"(": {"election": 0}})";
    EXPECT_EQ(collect([&](char** r, bexil_error** e) { return bexil_bulk_annotate(c, bulk.c_str(), r, e); }).code,
              BEXIL_OK);
    EXPECT_TRUE(observed.waitForCount(2));
    {
        std::lock_guard lock(observed.mutex);
        EXPECT_EQ(observed.names[0], "com.quorvel.bexil.annotation-change");
        EXPECT_EQ(observed.requestInCallback,
                  "bexil_status: not allowed in an observer callback, where it would "
                  "wait for its own thread");
    }
    EXPECT_EQ(bexil_stop_observing(c, token, nullptr), BEXIL_OK);

    Call hold =
        collect([&](char** r, bexil_error** e) { return bexil_hold(c, paths, 1, BEXIL_HOLD_PLUGIN_PATHS, r, e); });
    ASSERT_EQ(hold.code, BEXIL_OK) << hold.message;
    const std::string holdUuid = hold.reply["uuids"];
    Call holds = collect([&](char** r, bexil_error** e) { return bexil_holds(c, r, e); });
    ASSERT_EQ(holds.reply["holds"].size(), 1u) << holds.reply.dump();
    EXPECT_EQ(holds.reply["holds"][0]["uuid"], holdUuid);
    EXPECT_EQ(collect([&](char** r, bexil_error** e) { return bexil_release_hold(c, holdUuid.c_str(), r, e); }).code,
              BEXIL_OK);

    Call status = collect([&](char** r, bexil_error** e) { return bexil_status(c, r, e); });
    EXPECT_EQ(status.reply["holdCount"], 0);
    EXPECT_EQ(status.reply["served"]["lock"], 2) << status.reply.dump();

    // bubblewrap needs namespaces some machines do not grant; then nothing can be launched.
    if (std::system("bwrap --unshare-all --ro-bind / / true >/dev/null 2>&1") == 0) {
        int64_t pid = 0;
        int channel = -1;
        Call launch =
            collect([&](char** r, bexil_error** e) { return bexil_launch(c, uuid.c_str(), &pid, &channel, r, e); });
        ASSERT_EQ(launch.code, BEXIL_OK) << launch.message << "\n" << bxd_.log();
        EXPECT_GT(pid, 0);
        EXPECT_EQ(launch.reply["pid"], pid);
        ASSERT_GE(channel, 0);
        ASSERT_EQ(write(channel, "world\n", 6), 6);
        char answer[64] = {};
        pollfd ready{channel, POLLIN, 0};
        ASSERT_EQ(poll(&ready, 1, 10000), 1);
        ASSERT_GT(read(channel, answer, sizeof answer - 1), 0);
        EXPECT_EQ(std::string(answer).rfind("Hello, world!", 0), 0u) << answer;
        close(channel);
    }

    EXPECT_EQ(collect([&](char** r, bexil_error** e) { return bexil_remove(c, paths, 1, r, e); }).code, BEXIL_OK);
    Call after = collect([&](char** r, bexil_error** e) { return bexil_match(c, "{}", 0, r, e); });
    EXPECT_TRUE(after.reply["matches"].empty()) << after.reply.dump();
}

// Guards each way a call fails, with its code and message: no daemon (and no reply in time) says so and names the
// service; the daemon's refusals (an entitlement missing, a plug-in unknown) keep its code, message and reply; what
// the library refuses itself (NULL, not JSON, not a UUID, a time limit of 0, an unknown observation) is code 4
// naming the argument, and sends nothing.
TEST_F(CInterfaceTest, EachErrorPathGivesCodeAndMessage) {
    bexil_client* c = client();
    Call down = collect([&](char** r, bexil_error** e) { return bexil_status(c, r, e); });
    EXPECT_EQ(down.code, BEXIL_ERROR_INVALID_REQUEST);
    EXPECT_TRUE(down.noReply);
    EXPECT_NE(down.message.find("com.quorvel.bexil.bxd (" + bxd_.socketPath() + ")"), std::string::npos)
        << down.message;
    EXPECT_TRUE(down.failedReply.is_null());
    bexil_client_free(std::exchange(client_, nullptr));

    ASSERT_TRUE(start()) << bxd_.log();
    c = client();
    Call holds = collect([&](char** r, bexil_error** e) { return bexil_holds(c, r, e); });
    EXPECT_EQ(holds.code, BEXIL_ERROR_NOT_ALLOWED);
    EXPECT_EQ(holds.message, "caller lacks entitlement for this operation");
    EXPECT_FALSE(holds.noReply);
    EXPECT_EQ(holds.failedReply["errorcode"], BEXIL_ERROR_NOT_ALLOWED) << holds.failedReply.dump();

    Call unknown = collect([&](char** r, bexil_error** e) {
        return bexil_bulk_annotate(c, R"({"11111111-2222-4333-8444-555555555555": {"election": 1}})", r, e);
    });
    EXPECT_EQ(unknown.code, BEXIL_ERROR_REGISTRY_REFUSED);
    EXPECT_EQ(unknown.message, "no plug-in with the requested uuid");

    const size_t requestsBefore = bxd_.countInLog(" requested ");
    const char* nullEntry[] = {nullptr};
    const char* badUuid[] = {"not-a-uuid"};
    const std::pair<std::function<int(char**, bexil_error**)>, std::string> refused[] = {
        {[&](char** r, bexil_error** e) { return bexil_match(c, "{\"a\": ", 0, r, e); },
         "bexil_match: rules_json: JSON line 1, column 7: "},
        {[&](char** r, bexil_error** e) { return bexil_match(c, nullptr, 0, r, e); },
         "bexil_match: rules_json is NULL"},
        {[&](char** r, bexil_error** e) { return bexil_status(nullptr, r, e); }, "bexil_status: client is NULL"},
        {[&](char** r, bexil_error** e) { return bexil_add(c, nullptr, 1, r, e); }, "bexil_add: paths is NULL"},
        {[&](char** r, bexil_error** e) { return bexil_hold(c, nullEntry, 1, 0, r, e); },
         "bexil_hold: an entry of paths is NULL"},
        {[&](char** r, bexil_error** e) { return bexil_ready(c, badUuid, 1, r, e); },
         "bexil_ready: an entry of uuids: not a UUID: not-a-uuid"},
        {[&](char** r, bexil_error** e) { return bexil_launch(c, nullptr, nullptr, nullptr, r, e); },
         "bexil_launch: uuid is NULL"},
        {[&](char**, bexil_error** e) { return bexil_client_set_timeout(c, 0, e); },
         "bexil_client_set_timeout: a time limit of 0 ms"},
        {[&](char**, bexil_error** e) { return bexil_stop_observing(c, 12345, e); },
         "bexil_stop_observing: no observation 12345"},
        {[&](char**, bexil_error** e) { return bexil_observe(c, "x", nullptr, nullptr, nullptr, e); },
         "bexil_observe: callback is NULL"},
    };
    for (const auto& [call, text] : refused) {
        Call outcome = collect(call);
        EXPECT_EQ(outcome.code, BEXIL_ERROR_INVALID_REQUEST) << text;
        EXPECT_EQ(outcome.message.rfind(text, 0), 0u) << outcome.message;
        EXPECT_FALSE(outcome.noReply);
    }
    EXPECT_EQ(bxd_.countInLog(" requested "), requestsBefore) << "nothing refused by the library was sent";
    EXPECT_EQ(bexil_error_code(nullptr), 0);
    EXPECT_STREQ(bexil_error_message(nullptr), "");

    // A daemon that stops answering: the client's own time limit ends the wait.
    ASSERT_EQ(bexil_client_set_timeout(c, 200, nullptr), BEXIL_OK);
    bxd_.signal(SIGSTOP);
    Call silent = collect([&](char** r, bexil_error** e) { return bexil_status(c, r, e); });
    bxd_.signal(SIGCONT);
    EXPECT_EQ(silent.code, BEXIL_ERROR_INVALID_REQUEST);
    EXPECT_TRUE(silent.noReply);
    EXPECT_NE(silent.message.find("time limit"), std::string::npos) << silent.message;
}

}  // namespace
}  // namespace bexil
