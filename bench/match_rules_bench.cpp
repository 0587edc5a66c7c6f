// Cost of evaluating one rule set against one candidate plug-in, for the rule shapes discovery and exclusions use:
// nothing, an identifier, an attribute with a comparison operator, a list of alternatives, the user's election, a
// type-conformance test (against the installed MIME database), an activation rule, and a typical three-key set.
// Discovery pays this once per candidate and rule set, so it multiplies by the number of installed plug-ins.

#include <benchmark/benchmark.h>

#include <memory>
#include <string>

#include "model/BXPlugInCore.h"
#include "policy/BXMatchRules.h"

namespace {

using namespace bexil;

Value str(const char* s) { return Value::string(s); }

class Annotations : public BXAnnotationSource {
  public:
    Value annotationForPlugIn(const BXPlugInCore&) const override { return annotation; }
    Value annotation = Value::dictionary({{"election", Value::int64(1)}});
};

struct Fixture {
    std::shared_ptr<BXPlugInCore> plugIn;
    TypeRegistry types{TypeRegistry::defaultDataDirs()};
    Annotations annotations;
    BXMatchContext context;

    Fixture() {
        Value attributes = Value::dictionary(
            {{"Language", str("en")},
             {"RZExtensionVersion", str("1.10")},
             {"DocumentType", str("image/svg+xml")},
             {"ActivationRule", Value::dictionary({{"image/png", Value::int64(4)}, {"text/plain", Value::int64(1)}})}});
        Value info = Value::dictionary(
            {{"BDBundleIdentifier", str("com.example.greeter.hello")},
             {"RZExtension", Value::dictionary({{"RZExtensionAttributes", attributes},
                                                {"RZExtensionPointIdentifier", str("com.example.greeting")},
                                                {"RZExtensionProtocol", str("GreetingProvider")}})}});
        plugIn = BXPlugInCore::initWithNameUrlBundleInfoInfoUuid("com.example.greeter.hello",
                                                                 "/Apps/Greeter.app/PlugIns/Hello.bxplugin", info,
                                                                 std::nullopt, Uuid::random());
        plugIn->setContainingUrl("/Apps/Greeter.app");
        context.annotations = &annotations;
        context.types = &types;
    }
};

Fixture& fixture() {
    static Fixture f;
    return f;
}

void run(benchmark::State& state, const Value& rules) {
    Fixture& f = fixture();
    bool expected = BXMatchRules::match(rules, *f.plugIn, f.context);
    for (auto _ : state) {
        bool matched = BXMatchRules::match(rules, *f.plugIn, f.context);
        if (matched != expected) state.SkipWithError("answer changed");
        benchmark::DoNotOptimize(matched);
    }
    state.SetLabel(expected ? "match" : "no match");
}

void BM_EmptyRuleSet(benchmark::State& state) { run(state, Value::emptyDictionary()); }
void BM_Identifier(benchmark::State& state) {
    run(state, Value::dictionary({{"RZExtensionIdentifier", str("com.example.greeter.hello")}}));
}
void BM_AttributeComparison(benchmark::State& state) {
    run(state, Value::dictionary({{"RZExtensionVersion", str(">=1.9")}}));
}
void BM_InformationKeyFallback(benchmark::State& state) {
    run(state, Value::dictionary({{"BDBundleIdentifier", str("com.example.greeter.hello")}}));
}
void BM_FiveAlternatives(benchmark::State& state) {
    run(state,
        Value::dictionary({{"Language", Value::array({str("de"), str("fr"), str("it"), str("es"), str("en")})}}));
}
void BM_Presence(benchmark::State& state) { run(state, Value::dictionary({{"Language", Value::boolean(true)}})); }
void BM_UserElection(benchmark::State& state) { run(state, Value::dictionary({{"RZUserElection", str("1")}})); }
void BM_Conforms(benchmark::State& state) {
    run(state, Value::dictionary({{"DocumentType", str("?ZQ-CONFORMS:text/plain")}}));
}
void BM_ConformsNoMatch(benchmark::State& state) {
    run(state, Value::dictionary({{"DocumentType", str("?ZQ-CONFORMS:image/png")}}));
}
void BM_ActivationRule(benchmark::State& state) {
    run(state, Value::dictionary({{"ActivationRule",
                                   Value::dictionary({{"attachments", Value::array({str("image/png"), str("image/png"),
                                                                                    str("text/plain")})}})}}));
}
void BM_TypicalThreeKeys(benchmark::State& state) {
    run(state, Value::dictionary({{"Language", str("en")},
                                  {"RZExtensionContainingApp", Value::boolean(true)},
                                  {"RZUserElection", str("<>0")}}));
}

BENCHMARK(BM_EmptyRuleSet);
BENCHMARK(BM_Identifier);
BENCHMARK(BM_AttributeComparison);
BENCHMARK(BM_InformationKeyFallback);
BENCHMARK(BM_FiveAlternatives);
BENCHMARK(BM_Presence);
BENCHMARK(BM_UserElection);
BENCHMARK(BM_Conforms);
BENCHMARK(BM_ConformsNoMatch);
BENCHMARK(BM_ActivationRule);
BENCHMARK(BM_TypicalThreeKeys);

}  // namespace

BENCHMARK_MAIN();
