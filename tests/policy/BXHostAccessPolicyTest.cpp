#include <gtest/gtest.h>

#include <filesystem>
#include <map>

#include "TestSupport.h"
#include "base/Document.h"
#include "platform/ksn/ConsentStore.h"
#include "policy/BXHostAccessPolicy.h"
#include "policy/BXMatchRules.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using test::Entries;
using test::str;

// A host with a fixed set of entitlements; holding one means a value that is not equal to false.
class FakeHost : public HostAccessClient {
  public:
    explicit FakeHost(std::map<std::string, Value> entitlements = {}) : entitlements_(std::move(entitlements)) {}
    Value entitlementValueForKey(std::string_view key) const override {
        auto found = entitlements_.find(std::string(key));
        return found == entitlements_.end() ? Value::null() : found->second;
    }
    bool hasEntitlement(std::string_view key) const override {
        Value value = entitlementValueForKey(key);
        if (value.isNull() || value.getBool() == false) return false;
        return !(value.isNumber() && value.numberAsDouble() == 0.0);
    }
    pid_t pid() const override { return 4242; }
    const std::string& path() const override { return path_; }

  private:
    std::map<std::string, Value> entitlements_;
    std::string path_ = "/usr/bin/fake-host";
};

std::shared_ptr<BXPlugInCore> plugIn(const std::string& path, Entries plugInEntries = {}) {
    return BXPlugInCore::initWithNameUrlBundleInfoInfoUuid("com.example.mail.share", path, std::nullopt,
                                                           Value::dictionary(std::move(plugInEntries)), std::nullopt);
}

// The policy's verdict with the real rule matcher, as the daemon's record asks it.
std::optional<std::string> allow(const BXPlugInCore& p, const HostAccessClient& host) {
    return BXHostAccessPolicy::allowForClient(p, host,
                                              [&](const Value& rules) { return BXMatchRules::match(rules, p); });
}

constexpr const char* kSharePath = "/Applications/Mail.app/PlugIns/Share.wexa";
const std::string kAllowed(BXHostAccessPolicy::kAllowedPlugInsEntitlement);

// The host's own rule set decides first; a restriction that is not a dictionary must never widen what the host may
// use, so it refuses every plug-in, even one that a rule set of that text would allow.
TEST(BXHostAccessPolicyAllow, HostRuleSetDecidesFirstAndAMalformedOneRefusesEveryPlugIn) {
    auto p = plugIn(kSharePath);
    EXPECT_EQ(allow(*p, FakeHost()), std::nullopt);
    for (Value value : {str("com.example.mail.share"), Value::array({Value::emptyDictionary()}), Value::int64(0)})
        EXPECT_EQ(allow(*p, FakeHost({{kAllowed, value}})), "invalid host restriction entitlement")
            << value.description();
    EXPECT_EQ(allow(*p, FakeHost({{kAllowed, Value::emptyDictionary()}})), std::nullopt);
    EXPECT_EQ(allow(*p, FakeHost({{kAllowed, Value::dictionary({{"RZExtensionIdentifier", str("com.other")}})}})),
              "the host's plug-in entitlement does not allow this plug-in");
}

// A plug-in may require its hosts to hold an entitlement (held: present and not equal to false); a host failing both
// restrictions learns about its own. A required name that is not a string can be held by no host.
TEST(BXHostAccessPolicyAllow, PlugInRequiresItsHostEntitlementAndAHostFailingBothGetsTheHostSideReason) {
    auto p = plugIn(kSharePath, {{"RZExtensionHostEntitlement", str("com.example.may-host-share")}});
    const std::string refused = "the host does not have the \"com.example.may-host-share\" entitlement";
    EXPECT_EQ(allow(*p, FakeHost()), refused);
    EXPECT_EQ(allow(*p, FakeHost({{"com.example.may-host-share", Value::int64(0)}})), refused);
    for (Value held : {Value::boolean(true), str("anything"), Value::emptyDictionary()})
        EXPECT_EQ(allow(*p, FakeHost({{"com.example.may-host-share", held}})), std::nullopt) << held.description();
    EXPECT_EQ(allow(*p, FakeHost({{kAllowed, Value::dictionary({{"RZExtensionIdentifier", str("com.other")}})}})),
              "the host's plug-in entitlement does not allow this plug-in");

    auto malformed = plugIn(kSharePath, {{"RZExtensionHostEntitlement", Value::int64(7)}});
    EXPECT_EQ(allow(*malformed, FakeHost({{"7", Value::boolean(true)}})),
              "the host does not have the \"7\" entitlement");
}

// ---- Dedicated plug-ins ----

class PolicyBundlesTest : public ::testing::Test {
  protected:
    // An application bundle directory with an information dictionary.
    fs::path makeApp(const std::string& name, std::optional<std::string> identifier) {
        fs::path app = root_ / name;
        fs::create_directories(app / "PlugIns");
        MutableDictionary info;
        if (identifier) info.set("BDBundleIdentifier", Value::string(*identifier));
        EXPECT_FALSE(Document::writeFileAtomically(app / "Info.vrec", info.take()));
        return app;
    }

    test::TempDir root_{"bx-policy"};
};

// A dedicated plug-in must not leak to other applications, nor to a host outside any bundle.
TEST_F(PolicyBundlesTest, DedicatedPlugInIsVisibleOnlyToItsOwnApplication) {
    fs::path mail = makeApp("Mail.app", "com.example.Mail");
    fs::path notes = makeApp("Notes.app", "com.example.Notes");
    auto dedicated = plugIn((mail / "PlugIns" / "Share.wexa").string(), {{"Dedicated", Value::boolean(true)}});
    auto shared = plugIn((mail / "PlugIns" / "Other.wexa").string());
    ASSERT_TRUE(dedicated && shared);
    auto mailBundle = BXBundle::initWithPath(mail.string());
    auto notesBundle = BXBundle::initWithPath(notes.string());

    EXPECT_TRUE(BXHostAccessPolicy::dedicatedPlugInVisibleToHost(*dedicated, mailBundle.get()));
    EXPECT_FALSE(BXHostAccessPolicy::dedicatedPlugInVisibleToHost(*dedicated, notesBundle.get()));
    EXPECT_FALSE(BXHostAccessPolicy::dedicatedPlugInVisibleToHost(*dedicated, nullptr));
    EXPECT_TRUE(BXHostAccessPolicy::dedicatedPlugInVisibleToHost(*shared, nullptr));
}

// ---- Privacy consent ----

// A plug-in gets the privacy services the user granted its containing application, as they are at the query.
TEST_F(PolicyBundlesTest, GrantedServicesOfTheContainingApplication) {
    fs::path mail = makeApp("Mail.app", "com.example.Mail");
    ConsentStore consent(root_ / "consent.vrec");
    ASSERT_FALSE(consent.setGranted("com.example.Mail", "camera", true));
    ASSERT_FALSE(consent.setGranted("com.example.Mail", "contacts", false));
    ASSERT_FALSE(consent.setGranted("com.example.Mail", "photos", true));
    ASSERT_FALSE(consent.setGranted("com.example.Notes", "microphone", true));

    auto p = plugIn((mail / "PlugIns" / "Share.wexa").string());
    p->setContainingUrl(mail.string());
    EXPECT_EQ(BXHostAccessPolicy::allowedKSNServices(*p, consent), (std::set<std::string>{"camera", "photos"}));

    // Consent answers change while the daemon runs; the next query sees them.
    ASSERT_FALSE(consent.setGranted("com.example.Mail", "camera", false));
    EXPECT_EQ(BXHostAccessPolicy::allowedKSNServices(*p, consent), (std::set<std::string>{"photos"}));
}

// No containing application, one that cannot be read, or one whose consent query fails (an application without an
// identifier) gives no services: a failure must never grant what the user did not.
TEST_F(PolicyBundlesTest, WithoutAUsableApplicationNoServicesAreGranted) {
    ConsentStore consent(root_ / "consent.vrec");
    EXPECT_TRUE(
        BXHostAccessPolicy::allowedKSNServices(*plugIn("/System/Library/Bexil/Indexer.bundle"), consent).empty());
    auto p = plugIn((root_ / "Gone.app" / "PlugIns" / "Share.wexa").string());
    p->setContainingUrl((root_ / "Gone.app").string());
    EXPECT_TRUE(BXHostAccessPolicy::allowedKSNServices(*p, consent).empty());
    p->setContainingUrl(makeApp("Anonymous.app", std::nullopt).string());
    EXPECT_TRUE(BXHostAccessPolicy::allowedKSNServices(*p, consent).empty());
}

}  // namespace
}  // namespace bexil
