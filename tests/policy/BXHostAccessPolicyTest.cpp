#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <map>

#include "TestSupport.h"
#include "base/Document.h"
#include "platform/ksn/ConsentStore.h"
#include "platform/log/CaptureSink.h"
#include "policy/BXHostAccessPolicy.h"

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

  private:
    std::map<std::string, Value> entitlements_;
};

std::shared_ptr<BXPlugInCore> plugIn(const std::string& path, Entries plugInEntries = {},
                                     const char* identifier = "com.example.mail.share") {
    return BXPlugInCore::initWithNameUrlBundleInfoInfoUuid(identifier, path, std::nullopt,
                                                           Value::dictionary(std::move(plugInEntries)), std::nullopt);
}

// A stand-in for rule matching that knows one key, enough to tell the policy's steps apart; counts its calls.
struct Matcher {
    const BXPlugInCore* plugIn;
    int calls = 0;
    bool operator()(const Value& ruleSet) {
        ++calls;
        const Value* wanted = ruleSet.find("RZExtensionIdentifier");
        return wanted == nullptr || *wanted == Value::string(plugIn->identifier().value_or(""));
    }
};

std::optional<std::string> allow(const BXPlugInCore& p, const HostAccessClient& host, Matcher* matcher = nullptr) {
    Matcher local{&p};
    Matcher& m = matcher ? *matcher : local;
    return BXHostAccessPolicy::allowForClient(p, host, [&](const Value& rules) { return m(rules); });
}

constexpr const char* kSharePath = "/Applications/Mail.app/PlugIns/Share.wexa";
const std::string kAllowed(BXHostAccessPolicy::kAllowedPlugInsEntitlement);

TEST(BXHostAccessPolicyAllow, UnrestrictedHostAndPlugInAreAllowedAndANonDictionaryRestrictionRefusesEveryPlugIn) {
    auto p = plugIn(kSharePath);
    ASSERT_TRUE(p);
    Matcher matcher{p.get()};
    EXPECT_EQ(allow(*p, FakeHost(), &matcher), std::nullopt);
    EXPECT_EQ(matcher.calls, 0) << "no rule set, nothing to match";
    for (Value value : {str("com.example.mail.share"), Value::array({Value::emptyDictionary()}), Value::boolean(true),
                        Value::int64(0)}) {
        matcher.calls = 0;
        EXPECT_EQ(allow(*p, FakeHost({{kAllowed, value}}), &matcher), "invalid host restriction entitlement")
            << value.description();
        EXPECT_EQ(matcher.calls, 0);
    }
}

TEST(BXHostAccessPolicyAllow, HostRuleSetDecidesFirst) {
    auto p = plugIn(kSharePath);
    EXPECT_EQ(allow(*p, FakeHost({{kAllowed, Value::emptyDictionary()}})), std::nullopt)
        << "an empty rule set allows every plug-in";
    EXPECT_EQ(
        allow(*p,
              FakeHost({{kAllowed, Value::dictionary({{"RZExtensionIdentifier", str("com.example.mail.share")}})}})),
        std::nullopt);
    EXPECT_EQ(allow(*p, FakeHost({{kAllowed, Value::dictionary({{"RZExtensionIdentifier", str("com.other")}})}})),
              "the host's plug-in entitlement does not allow this plug-in");
}

TEST(BXHostAccessPolicyAllow, PlugInRequiresItsHostEntitlementAndAHostFailingBothGetsTheHostSideReason) {
    auto p = plugIn(kSharePath, {{"RZExtensionHostEntitlement", str("com.example.may-host-share")}});
    ASSERT_TRUE(p);
    const std::string refused = "the host does not have the \"com.example.may-host-share\" entitlement";
    EXPECT_EQ(allow(*p, FakeHost()), refused);
    EXPECT_EQ(allow(*p, FakeHost({{"com.example.may-host-share", Value::boolean(false)}})), refused);
    EXPECT_EQ(allow(*p, FakeHost({{"com.example.may-host-share", Value::int64(0)}})), refused);
    EXPECT_EQ(allow(*p, FakeHost({{"com.example.unrelated", Value::boolean(true)}})), refused);
    for (Value held :
         {Value::boolean(true), str("anything"), Value::int64(2), Value::emptyDictionary(), Value::emptyArray()})
        EXPECT_EQ(allow(*p, FakeHost({{"com.example.may-host-share", held}})), std::nullopt) << held.description();
    EXPECT_EQ(allow(*p, FakeHost({{kAllowed, Value::dictionary({{"RZExtensionIdentifier", str("com.other")}})}})),
              "the host's plug-in entitlement does not allow this plug-in");
    EXPECT_EQ(allow(*p, FakeHost({{kAllowed, str("bad")}})), "invalid host restriction entitlement");
}

// A host entitlement name of the wrong kind cannot be held by anyone: the plug-in stays restricted.
TEST(BXHostAccessPolicyAllow, MalformedHostEntitlementNameRefusesEveryHost) {
    auto p = plugIn(kSharePath, {{"RZExtensionHostEntitlement", Value::int64(7)}});
    ASSERT_TRUE(p);
    EXPECT_EQ(allow(*p, FakeHost({{"7", Value::boolean(true)}})), "the host does not have the \"7\" entitlement");
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
    EXPECT_TRUE(BXHostAccessPolicy::dedicatedPlugInVisibleToHost(*shared, notesBundle.get()));
    EXPECT_TRUE(BXHostAccessPolicy::dedicatedPlugInVisibleToHost(*shared, nullptr));
}

// ---- Privacy consent ----

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

TEST_F(PolicyBundlesTest, NoApplicationGivesNoServicesSilentlyAndFailuresWithOneInfoLine) {
    ConsentStore consent(root_ / "consent.vrec");
    {
        log::CaptureSink capture;
        auto system = plugIn("/System/Library/Bexil/Indexer.bundle");
        ASSERT_TRUE(system);
        EXPECT_TRUE(BXHostAccessPolicy::allowedKSNServices(*system, consent).empty());
        EXPECT_TRUE(capture.entries().empty());
    }
    // A containing application that cannot be read gives none, with one info line.
    std::string plugInPath = (root_ / "Gone.app" / "PlugIns" / "Share.wexa").string();
    auto p = plugIn(plugInPath);
    {
        log::CaptureSink capture;
        p->setContainingUrl((root_ / "Gone.app").string());
        EXPECT_TRUE(BXHostAccessPolicy::allowedKSNServices(*p, consent).empty());
        auto lines = capture.matching("failed to create bundle for ");
        ASSERT_EQ(lines.size(), 1u);
        EXPECT_EQ(lines[0].message, "failed to create bundle for " + plugInPath);
        EXPECT_EQ(lines[0].level, log::Level::Info);
    }
    {
        log::CaptureSink capture;
        fs::path anonymous = makeApp("Anonymous.app", std::nullopt);
        p->setContainingUrl(anonymous.string());
        EXPECT_TRUE(BXHostAccessPolicy::allowedKSNServices(*p, consent).empty());
        EXPECT_EQ(capture.count("KSNAccessCopyInformationForBundle failed for "), 1u);
    }
}

}  // namespace
}  // namespace bexil
