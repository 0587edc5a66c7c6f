// Changes that wait for the disk (registrations, annotations) are written on the daemon's writer thread while the
// request queue goes on serving others. What a client sees must not change: a reply only once its change is on
// disk, every later request (its own, pipelined, or another client's) seeing the change, and nothing acknowledged
// lost when the daemon is killed.

#include <gtest/gtest.h>

#include <csignal>
#include <map>
#include <thread>

#include "E2eSupport.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using namespace test;

const Value kPoint = Value::dictionary({{"RZExtensionPointIdentifier", Value::string("com.example.writer")}});

class WriterTest : public DaemonTest {
  protected:
    void SetUp() override {
        fs::create_directories(bxd_.root() / "bundles" / "Writer.app" / "PlugIns");
        bundles_ = fs::canonical(bxd_.root() / "bundles");
        ASSERT_FALSE(Document::writeFileAtomically(
            bundles_ / "Writer.app" / "Info.vrec",
            Value::dictionary({{"BDBundleIdentifier", Value::string("com.example.writer")}})));
    }

    // A plug-in of extension point com.example.writer whose identifier is `identifier`, inside Writer.app.
    std::string writePlugIn(const std::string& identifier) {
        fs::path bundle = bundles_ / "Writer.app" / "PlugIns" / (identifier + ".bxplugin");
        fs::create_directories(bundle);
        Value info = Value::dictionary(
            {{"BDBundleIdentifier", Value::string(identifier)},
             {"BDBundleVersion", Value::string("1")},
             {"RZExtension", Value::dictionary({{"PrincipalClass", Value::string("Writer")},
                                                {"RZExtensionPointIdentifier", Value::string("com.example.writer")},
                                                {"RZExtensionProtocol", Value::string("Writing")},
                                                {"RZExtensionAttributes",
                                                 Value::dictionary({{"RZExtensionVersion", Value::string("1")}})}})}});
        EXPECT_FALSE(Document::writeFileAtomically(bundle / "Info.vrec", info));
        return bundle.string();
    }

    // The election stored on disk for each identifier in the annotation document.
    std::map<std::string, int64_t> electionsOnDisk() const {
        std::map<std::string, int64_t> elections;
        Result<Value> root = Document::readFile(document());
        if (!root) return elections;
        for (const DictionaryEntry& entry : root->get("data").entries())
            elections[std::string(entry.key)] = entry.value.get("election").numberAsInt64().value_or(-1);
        return elections;
    }
};

Value annotate(const Uuid& uuid, int64_t election) {
    return request("annotate", {{"uuids", Value::array({Value::uuid(uuid)})},
                                {"annotations", Value::dictionary({{"election", Value::int64(election)}})}});
}

// Guards the writer's contract under concurrency: four clients each register plug-ins one at a time and elect each
// one as soon as its registration is acknowledged. Another connection's discovery finds every acknowledged plug-in,
// the document on disk holds every acknowledged election the moment its reply arrives, and after SIGKILL the
// restarted daemon serves all of them.
TEST_F(WriterTest, ConcurrentChangesAreSeenByOthersOnDiskWhenAcknowledgedAndSurviveAKill) {
    constexpr int kClients = 4, kEach = 6;
    std::vector<std::vector<std::string>> identifiers(kClients);
    for (int c = 0; c < kClients; ++c)
        for (int n = 0; n < kEach; ++n)
            identifiers[c].push_back("com.example.writer.c" + std::to_string(c) + "n" + std::to_string(n));
    std::map<std::string, std::string> paths;
    for (const auto& list : identifiers)
        for (const std::string& identifier : list) paths[identifier] = writePlugIn(identifier);
    ASSERT_TRUE(start()) << bxd_.log();

    std::vector<std::string> failures(kClients);
    std::vector<std::thread> clients;
    for (int c = 0; c < kClients; ++c) {
        clients.emplace_back([&, c] {
            TestClient writer, observer;
            for (const std::string& identifier : identifiers[c]) {
                Value added = writer.replyTo(pathsRequest("add", {paths[identifier]}));
                std::vector<Value> forms =
                    formsOf(observer.replyTo(matchRequest(identifierRule(identifier))), identifier);
                if (errorCode(added) != 0 || forms.size() != 1) {
                    failures[c] = identifier + " not found after its registration: " + added.description();
                    return;
                }
                Value elected = writer.replyTo(annotate(*Uuid::parse(forms[0].get("uuid").stringView()), 2 + c));
                if (errorCode(elected) != 0 || electionsOnDisk()[identifier] != 2 + c) {
                    failures[c] = identifier + " election acknowledged but not on disk: " + elected.description();
                    return;
                }
            }
        });
    }
    for (std::thread& client : clients) client.join();
    for (const std::string& failure : failures) EXPECT_EQ(failure, "");

    bxd_.stop(SIGKILL);
    ASSERT_TRUE(start()) << bxd_.log();
    Value reply = TestClient().replyTo(matchRequest(kPoint));
    for (int c = 0; c < kClients; ++c) {
        for (const std::string& identifier : identifiers[c]) {
            std::vector<Value> forms = formsOf(reply, identifier);
            ASSERT_EQ(forms.size(), 1u) << identifier << " lost";
            EXPECT_EQ(forms[0].get("annotations").get("election"), Value::int64(2 + c)) << identifier;
        }
    }
}

// Guards per-client order: requests a client sends without waiting for the replies run as if one after another, so
// a discovery sent right behind a registration and an election finds the plug-in elected, and a failing
// registration in the middle answers with its usual error and stops nothing behind it.
TEST_F(WriterTest, PipelinedRequestsOfOneClientSeeTheChangesBeforeThem) {
    const std::string first = writePlugIn("com.example.writer.first");
    ASSERT_TRUE(start()) << bxd_.log();
    TestClient client;
    // A directory the registry refuses: its error comes from the writer, as the registration's always did.
    const std::string refused = (bundles_ / "Empty.bxplugin").string();
    fs::create_directories(refused);
    std::vector<TestClient::Reply> replies =
        client.pipeline({pathsRequest("add", {first}), pathsRequest("add", {refused}),
                         matchRequest(identifierRule("com.example.writer.first"))});
    ASSERT_EQ(replies.size(), 3u);
    for (const TestClient::Reply& reply : replies) ASSERT_TRUE(std::holds_alternative<Value>(reply));
    EXPECT_EQ(errorCode(std::get<Value>(replies[0])), 0);
    EXPECT_EQ(errorCode(std::get<Value>(replies[1])), 2);
    EXPECT_EQ(errorText(std::get<Value>(replies[1])), "unable to register plug-in at " + refused);
    std::vector<Value> forms = formsOf(std::get<Value>(replies[2]), "com.example.writer.first");
    ASSERT_EQ(forms.size(), 1u);

    Uuid uuid = *Uuid::parse(forms[0].get("uuid").stringView());
    replies = client.pipeline({annotate(uuid, 3), matchRequest(identifierRule("com.example.writer.first"))});
    ASSERT_EQ(replies.size(), 2u);
    ASSERT_TRUE(std::holds_alternative<Value>(replies[1]));
    forms = formsOf(std::get<Value>(replies[1]), "com.example.writer.first");
    ASSERT_EQ(forms.size(), 1u);
    EXPECT_EQ(forms[0].get("annotations").get("election"), Value::int64(3));
}

}  // namespace
}  // namespace bexil
