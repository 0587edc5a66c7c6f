#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <functional>
#include <utility>

#include "TestSupport.h"
#include "database/BXDAnnotationStore.h"
#include "database/BXDatabase.h"
#include "platform/ledgerix/LXApplicationProxy.h"
#include "platform/ledgerix/LXApplicationWorkspace.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/log/CaptureSink.h"
#include "policy/BXDPlugIn.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using test::dict;
using test::str;

// A registry whose answers the test decides. It hands the filter exactly what a real registry would (the
// identifier and the entitlements) and records what it was asked.
class ScriptedWorkspace : public LXApplicationWorkspace {
  public:
    void addObserver(std::weak_ptr<LXApplicationWorkspaceObserverProtocol>) override {}
    void removeObserver(const LXApplicationWorkspaceObserverProtocol*) override {}
    Result<std::shared_ptr<const LXBexilProxy>> registerPlugin(std::string_view, std::optional<UserIdentity>) override {
        return Error("test", 1, "not supported");
    }
    std::optional<Error> unregisterPlugin(std::string_view) override { return Error("test", 1, "not supported"); }
    void LXClearSchemaCaches() override {}
    std::shared_ptr<const LXBexilProxy> plugInProxyForUUID(const Uuid&) override { return nullptr; }
    std::shared_ptr<const LXBexilProxy> plugInProxyForURL(std::string_view) override { return nullptr; }
    std::shared_ptr<const LXApplicationProxy> applicationProxyForBundleURL(std::string_view) override {
        return nullptr;
    }
    std::optional<LXProxyList> installedPlugins() override {
        ++installedCalls;
        return answer;
    }
    std::optional<LXProxyList> pluginsMatchingQueryApplyFilter(const Value& query, const LXPlugInFilter& filter,
                                                               const LXPreselection& preselection) override {
        lastQuery = query;
        lastPreselection = preselection;
        if (!answer) return std::nullopt;
        LXProxyList kept;
        for (const auto& proxy : *answer) {
            if (!filter) {
                kept.push_back(proxy);
                continue;
            }
            ++filterCalls;
            if (filter(proxy->pluginIdentifier().value_or(""), proxy->entitlements())) kept.push_back(proxy);
        }
        return kept;
    }
    // As a registry does: a candidate whose record the caller holds comes back as its UUID, unless a filter needs
    // it. `betweenQueryAndLookUp` runs once, after the answer is made and before the database looks it up.
    std::optional<LXCandidateList> installedCandidates(const LXKnownRecord& known) override {
        return held(LXApplicationWorkspace::installedCandidates(known), {}, known);
    }
    std::optional<LXCandidateList> candidatesMatchingQuery(const Value& query, const LXPlugInFilter& filter,
                                                           const LXPreselection& preselection,
                                                           const LXKnownRecord& known) override {
        return held(LXApplicationWorkspace::candidatesMatchingQuery(query, filter, preselection, known), filter, known);
    }
    std::optional<LXCandidateSlice> candidatesAfterIdentifier(const Value& query, const LXPlugInFilter& filter,
                                                              const LXPreselection& preselection,
                                                              const std::optional<std::string>& after, size_t rows,
                                                              const LXKnownRecord& known) override {
        std::optional<LXCandidateSlice> slice =
            LXApplicationWorkspace::candidatesAfterIdentifier(query, filter, preselection, after, rows, known);
        if (slice) slice->candidates = *held(std::move(slice->candidates), filter, known);
        return slice;
    }

    std::optional<LXCandidateList> held(std::optional<LXCandidateList> candidates, const LXPlugInFilter& filter,
                                        const LXKnownRecord& known) {
        if (!known) ++toldNothing;
        if (candidates && known && !filter) {
            for (LXCandidate& candidate : *candidates) {
                if (!known(candidate.uuid)) continue;
                candidate.proxy = nullptr;
                ++leftOut;
            }
        }
        if (betweenQueryAndLookUp) std::exchange(betweenQueryAndLookUp, nullptr)();
        return candidates;
    }

    std::optional<LXProxyList> answer = LXProxyList{};
    int leftOut = 0;
    int toldNothing = 0;
    std::function<void()> betweenQueryAndLookUp;
    Value lastQuery;
    LXPreselection lastPreselection;
    int installedCalls = 0;
    int filterCalls = 0;
};

std::shared_ptr<const LXApplicationProxy> application(bool placeholder = false) {
    LXApplicationProxy::Fields fields;
    fields.bundleURL = placeholder ? "/Applications/Pending.app" : "/Applications/Greeter.app";
    fields.isPlaceholder = placeholder;
    return std::make_shared<LXApplicationProxy>(fields, LXApplicationProxy::PlugInList{});
}

// A well-formed plug-in inside an application, with the entitlements given.
std::shared_ptr<const LXBexilProxy> plugIn(const std::string& name, std::optional<Value> entitlements = std::nullopt,
                                           std::optional<Uuid> uuid = std::nullopt) {
    LXBexilProxy::Fields fields;
    std::string identifier = "com.example." + name;
    fields.bundleURL = "/Applications/Greeter.app/PlugIns/" + name + ".bxplugin";
    fields.pluginIdentifier = identifier;
    fields.originalIdentifier = identifier;
    fields.pluginUUID = uuid ? *uuid : Uuid::random();
    fields.registrationDate = Date{1700000000};
    fields.containingBundle = application();
    fields.dataContainerURL = "/var/lib/bexil/containers/" + identifier;
    fields.infoVrec = dict({
        {"BDBundleIdentifier", str(identifier)},
        {"BDBundleVersion", str("1")},
        {"RZExtension", dict({{"RZExtensionPointIdentifier", str("com.example.greeting")},
                              {"RZExtensionProtocol", str("GreetingProvider")},
                              {"PrincipalClass", str("Greeting")},
                              {"RZExtensionAttributes", dict({{"RZExtensionVersion", str("1.0")}})}})},
    });
    fields.entitlements = std::move(entitlements);
    return std::make_shared<LXBexilProxy>(std::move(fields));
}

Value autoElect() { return dict({{std::string(BXDPlugIn::kAutoElectEntitlement), Value::boolean(true)}}); }

class BXDatabaseDiscoveryTest : public ::testing::Test {
  protected:
    void SetUp() override {
        root_ = dir_.path();
        workspace_ = std::make_shared<ScriptedWorkspace>();
        database_ = BXDatabase::create((root_ / "annotations.vrec").string(), workspace_, [](std::string_view) {});
        ASSERT_NE(database_, nullptr);
    }
    void TearDown() override { database_.reset(); }

    void storeElection(const std::string& key, Value election) {
        database_->sync().sync([&] {
            database_->annotations().setAnnotationForIdentifier(dict({{"election", std::move(election)}}), key);
        });
    }

    // The identifiers of the result, sorted (the result is a set).
    std::vector<std::string> find(const Value& query) {
        std::optional<BXDatabase::PlugInSet> found = database_->findPlugIns(query);
        EXPECT_TRUE(found);
        std::vector<std::string> identifiers;
        for (const auto& record : found ? *found : BXDatabase::PlugInSet{})
            identifiers.push_back(record->identifier().value_or("?"));
        std::sort(identifiers.begin(), identifiers.end());
        return identifiers;
    }

    Value electionQuery(Value wanted) {
        return dict({{"RZExtensionPointIdentifier", str("com.example.greeting")}, {"RZUserElection", wanted}});
    }

    test::DaemonDirs dir_{"bxdiscovery-test"};
    fs::path root_;
    std::shared_ptr<ScriptedWorkspace> workspace_;
    std::unique_ptr<BXDatabase> database_;
};

using Ids = std::vector<std::string>;

// Guards discovery without a query: every usable plug-in (not one without a bundle, nor one of a placeholder
// application still being installed) from the cheaper installed list rather than the filtered query; the result is
// a set (one registry record listed twice is one plug-in) of the records cached, which the next query hands out.
TEST_F(BXDatabaseDiscoveryTest, EmptyQueryListsEveryUsablePlugInOnceFromTheCache) {
    LXBexilProxy::Fields noUrl;
    noUrl.pluginIdentifier = "com.example.nowhere";
    noUrl.pluginUUID = Uuid::random();
    LXBexilProxy::Fields pendingFields;
    pendingFields.bundleURL = "/Applications/Pending.app/PlugIns/Pending.bxplugin";
    pendingFields.pluginIdentifier = "com.example.pending";
    pendingFields.containingBundle = application(/*placeholder=*/true);
    auto hello = plugIn("hello");
    workspace_->answer = LXProxyList{hello, std::make_shared<LXBexilProxy>(noUrl),
                                     std::make_shared<LXBexilProxy>(pendingFields), plugIn("bonjour"), hello};
    storeElection("com.example.hello", Value::int64(0));

    log::CaptureSink capture;
    EXPECT_EQ(find(Value::emptyDictionary()), (Ids{"com.example.bonjour", "com.example.hello"}));
    // The skips and the cache figures (records cached before / after) are what an operator reads to see why a
    // plug-in is missing or why discovery was slow.
    EXPECT_EQ(capture.count("skipping lx proxy "), 2u);
    EXPECT_TRUE(capture.contains("LX reported 2 plug-ins (cache 0/2)"));
    EXPECT_EQ(find(Value()), (Ids{"com.example.bonjour", "com.example.hello"})) << "no query is an empty one";
    EXPECT_EQ(workspace_->installedCalls, 2);
    EXPECT_EQ(workspace_->filterCalls, 0);

    std::optional<BXDatabase::PlugInSet> first = database_->findPlugIns(Value());
    std::optional<BXDatabase::PlugInSet> second = database_->findPlugIns(electionQuery(str("0")));
    ASSERT_TRUE(first && second);
    ASSERT_EQ(second->size(), 2u);
    for (size_t i = 0; i < 2; ++i) EXPECT_EQ((*first)[i].get(), (*second)[i].get());
}

// Guards the records a registry leaves out because the cache holds them: discovery, paged or not, hands out the
// cached records themselves. One that leaves the cache between the registry's answer and its look-up (its plug-in
// re-registered under the same UUID, announced in between) is neither handed out stale nor left out: the registry
// is asked again, told nothing, and the record is built from what it reads then.
TEST_F(BXDatabaseDiscoveryTest, RecordsLeftOutForTheCacheAreTheCachedOnesAndOneDroppedMeanwhileIsReadAgain) {
    auto hello = plugIn("hello");
    auto bonjour = plugIn("bonjour");
    workspace_->answer = LXProxyList{hello, bonjour};
    std::optional<BXDatabase::PlugInSet> first = database_->findPlugIns(Value());
    ASSERT_TRUE(first);
    ASSERT_EQ(first->size(), 2u);
    EXPECT_EQ(workspace_->leftOut, 0) << "a cold cache holds nothing";

    auto sameRecords = [&](const std::optional<BXDatabase::PlugInSet>& found) {
        ASSERT_TRUE(found);
        ASSERT_EQ(found->size(), 2u);
        for (size_t i = 0; i < 2; ++i) EXPECT_EQ((*found)[i].get(), (*first)[i].get());
    };
    sameRecords(database_->findPlugIns(Value()));
    sameRecords(database_->findPlugIns(dict({{"RZExtensionPointIdentifier", str("com.example.greeting")}})));
    std::optional<BXDatabase::PlugInSlice> page = database_->findPlugInsAfterIdentifier(Value(), std::nullopt, 10);
    ASSERT_TRUE(page);
    EXPECT_TRUE(page->ended);
    // The walk goes by identifier: bonjour first.
    sameRecords(BXDatabase::PlugInSet{page->plugIns.rbegin(), page->plugIns.rend()});
    EXPECT_EQ(workspace_->leftOut, 6);
    // A query that wants an election needs every candidate's entitlements: nothing is left out for it.
    sameRecords(database_->findPlugIns(electionQuery(str("0"))));
    EXPECT_EQ(workspace_->leftOut, 6);
    EXPECT_EQ(workspace_->toldNothing, 0);

    const Value tag = dict({{"com.example.tag", str("again")}});
    auto reregister = [&](int round) {
        auto again = plugIn("hello", tag, hello->pluginUUID());
        workspace_->betweenQueryAndLookUp = [this, hello, again, bonjour, round] {
            workspace_->answer = round == 0 ? LXProxyList{again, bonjour} : LXProxyList{bonjour};
            database_->pluginsWillUninstall({hello});
        };
    };
    reregister(0);
    std::optional<BXDatabase::PlugInSet> raced = database_->findPlugIns(Value());
    EXPECT_EQ(workspace_->toldNothing, 1);
    ASSERT_TRUE(raced);
    ASSERT_EQ(raced->size(), 2u);
    EXPECT_NE((*raced)[0].get(), (*first)[0].get());
    EXPECT_EQ((*raced)[0]->uuid(), hello->pluginUUID());
    EXPECT_TRUE((*raced)[0]->hasEntitlement("com.example.tag")) << "built from the record read again";
    EXPECT_EQ((*raced)[1].get(), (*first)[1].get()) << "what stayed cached is still the cached record";

    // The same in a walk, with the plug-in gone for good: it is not handed out, from the cache or otherwise.
    workspace_->answer = LXProxyList{plugIn("hello", tag, hello->pluginUUID()), bonjour};
    hello = workspace_->answer->front();
    ASSERT_EQ(database_->findPlugIns(Value())->size(), 2u);
    reregister(1);
    page = database_->findPlugInsAfterIdentifier(Value(), std::nullopt, 10);
    EXPECT_EQ(workspace_->toldNothing, 2);
    ASSERT_TRUE(page);
    ASSERT_EQ(page->plugIns.size(), 1u);
    EXPECT_EQ(page->plugIns[0].get(), (*first)[1].get());
    EXPECT_EQ(page->last, "com.example.bonjour");
}

// Guards filtering by election. A wanted election is a string of digits, optionally after "=", or an array of
// them; a stored election counts by its low eight bits; a plug-in never elected counts as 0 and one entitled to
// automatic election as 1. A malformed wanted election switches filtering off rather than hiding everything.
TEST_F(BXDatabaseDiscoveryTest, ElectionOrListOfElectionsKeepsElectedAndAutoElectedPlugIns) {
    workspace_->answer =
        LXProxyList{plugIn("zero"),    plugIn("one"),     plugIn("two"), plugIn("never"), plugIn("auto", autoElect()),
                    plugIn("wrapped"), plugIn("negative")};
    for (auto [name, election] : {std::pair{"zero", 0}, {"one", 1}, {"two", 2}, {"wrapped", 256}, {"negative", -1}})
        storeElection(std::string("com.example.") + name, Value::int64(election));
    const Ids everything = {"com.example.auto", "com.example.negative", "com.example.never", "com.example.one",
                            "com.example.two",  "com.example.wrapped",  "com.example.zero"};
    const std::vector<std::pair<Value, Ids>> cases = {
        {str("1"), {"com.example.auto", "com.example.one"}},
        {str("=2"), {"com.example.two"}},
        {str("0"), {"com.example.never", "com.example.wrapped", "com.example.zero"}},
        {str("255"), {"com.example.negative"}},
        {Value::array({str("0"), str("=1")}),
         {"com.example.auto", "com.example.never", "com.example.one", "com.example.wrapped", "com.example.zero"}},
        {Value::emptyArray(), {}},  // a well-formed list that wants nothing
        {str("-1"), everything},
        {Value::int64(1), everything},
        {Value::array({str("1"), str("")}), everything},
        {dict({}), everything},
    };
    for (const auto& [wanted, expected] : cases)
        EXPECT_EQ(find(electionQuery(wanted)), expected) << wanted.description();
    // Queries that want no election give the registry no filter, so it reads no candidate's entitlements for one;
    // the others are filtered candidate by candidate.
    EXPECT_EQ(workspace_->filterCalls, 6 * 7);
    // The whole query, election included, went to the registry as given.
    EXPECT_EQ(workspace_->lastQuery, electionQuery(dict({})));

    // The registry narrows by what the rule engine says the query pins, and by nothing it was not told.
    EXPECT_EQ(workspace_->lastPreselection.extensionPoints, std::vector<std::string>{"com.example.greeting"});
    EXPECT_FALSE(workspace_->lastPreselection.identifiers);
    find(dict({{"RZExtensionPointIdentifier", str("=com.example.point")},
               {"RZExtensionIdentifier", Value::array({str("com.example.one"), str("com.example.two")})}}));
    EXPECT_EQ(workspace_->lastPreselection.extensionPoints, std::vector<std::string>{"com.example.point"});
    EXPECT_EQ(workspace_->lastPreselection.identifiers,
              (std::vector<std::string>{"com.example.one", "com.example.two"}));
}

// Guards replacement: a replacing plug-in is filtered by the election of the plug-in it took over, not its own.
TEST_F(BXDatabaseDiscoveryTest, ReplacingPlugInIsFilteredByTheElectionItTookOver) {
    Value replaces = dict({{std::string(BXDPlugIn::kReplacePlugInEntitlement), str("com.example.original")}});
    workspace_->answer = LXProxyList{plugIn("replacement", replaces)};
    storeElection("com.example.original", Value::int64(1));
    storeElection("com.example.replacement", Value::int64(0));

    EXPECT_EQ(find(electionQuery(str("1"))), (Ids{"com.example.replacement"}));
    EXPECT_EQ(find(electionQuery(str("0"))), Ids{});
}

// Guards the difference callers see between "the registry failed" (nothing) and "no plug-in matched" (empty).
TEST_F(BXDatabaseDiscoveryTest, RegistryWithoutAnswerGivesNothingRatherThanEmpty) {
    workspace_->answer = std::nullopt;
    EXPECT_FALSE(database_->findPlugIns(Value::emptyDictionary()));
    EXPECT_FALSE(database_->findPlugIns(electionQuery(str("1"))));
    workspace_->answer = LXProxyList{};
    EXPECT_EQ(database_->findPlugIns(electionQuery(str("1"))), BXDatabase::PlugInSet{});
}

}  // namespace
}  // namespace bexil
