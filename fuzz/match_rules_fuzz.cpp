// Builds rule sets from random bytes and evaluates them against a few plug-in records shaped like the example
// bundles (a plain plug-in inside an application, an application extension, one outside any application with
// entitlements). Keys and pattern strings are drawn mostly from the rule language's own vocabulary (special keys,
// operators, conformance prefixes, activation-rule dictionaries) so that the bytes reach every branch instead of
// missing every look-up. Besides not faulting, a rule set must give the same answer as its rules one by one.

#include <stdlib.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "FuzzByteReader.h"
#include "model/BXPlugInCore.h"
#include "policy/BXMatchRules.h"

namespace {

using namespace bexil;

constexpr const char* kKeys[] = {"ENTITLEMENT:com.example.granted",
                                 "ENTITLEMENT:com.example.name",
                                 "ENTITLEMENT:",
                                 "RZExtensionIdentifier",
                                 "com.quorvel.uuid",
                                 "RZUserElection",
                                 "RZExtensionContainingApp",
                                 "Language",
                                 "RZExtensionVersion",
                                 "BDBundleIdentifier",
                                 "BDBundleShortVersionString",
                                 "Languages",
                                 "ActivationRule",
                                 "DocumentType",
                                 "Missing",
                                 "attachments"};
constexpr size_t kKeyCount = sizeof(kKeys) / sizeof(kKeys[0]);

constexpr const char* kPatterns[] = {"?ZQ-CONFORMS:image/png",
                                     "?ZQ-CONFORMS:application/octet-stream",
                                     "?ZQ-CONFORMS:",
                                     "?ZQ-IS:image/x-png",
                                     "?ZQ-IS:text/plain",
                                     "?ZQ-LIKE:en",
                                     "?",
                                     "<>",
                                     "<>en",
                                     "<=1.9",
                                     ">=1.10",
                                     "=",
                                     "==en",
                                     "<",
                                     ">10",
                                     "<2",
                                     "en",
                                     "1.2",
                                     "0",
                                     "-65281",
                                     "/Apps/Greeter.app",
                                     "image/png",
                                     "",
                                     "6F1C2A7E-3B4D-4E5F-8A9B-0C1D2E3F4A5B",
                                     "com.example.greeter.hello"};
constexpr size_t kPatternCount = sizeof(kPatterns) / sizeof(kPatterns[0]);

constexpr int kMaxDepth = 6;
constexpr size_t kMaxEntries = 10;

using bexil::fuzz::ByteReader;

std::string key(ByteReader& in) {
    uint8_t pick = in.byte();
    if (pick < 224) return kKeys[pick % kKeyCount];
    return in.text();
}

Value pattern(ByteReader& in, int depth) {
    uint8_t kind = in.byte();
    if (depth >= kMaxDepth) kind %= 8;  // scalars only
    switch (kind % 11) {
        case 0:
            return Value::boolean(in.byte() & 1);
        case 1:
            return Value::int64(static_cast<int8_t>(in.byte()));
        case 2:
            return Value::real(static_cast<int8_t>(in.byte()) / 4.0);
        case 3:
        case 4:
            return Value::string(kPatterns[in.byte() % kPatternCount]);
        case 5:
            return Value::string(std::string(kPatterns[in.byte() % kPatternCount]) + in.text());
        case 6:
            return Value::string(in.text());
        case 7: {
            // A long string of one character: digit runs far beyond any integer type.
            return Value::string(std::string(size_t{in.byte()} * 256, static_cast<char>('0' + in.byte() % 12)));
        }
        case 8:
        case 9: {
            MutableArray array;
            size_t n = in.byte() % kMaxEntries;
            for (size_t i = 0; i < n && !in.empty(); ++i) array.append(pattern(in, depth + 1));
            return array.take();
        }
        default: {
            MutableDictionary dictionary;
            size_t n = in.byte() % kMaxEntries;
            for (size_t i = 0; i < n && !in.empty(); ++i) {
                std::string k = key(in);
                dictionary.set(k, pattern(in, depth + 1));
            }
            return dictionary.take();
        }
    }
}

class FuzzAnnotations : public BXAnnotationSource {
  public:
    Value annotationForPlugIn(const BXPlugInCore&) const override { return annotation; }
    Value annotation;
};

Value str(const char* s) { return Value::string(s); }

std::shared_ptr<BXPlugInCore> record(const char* identifier, const char* path, Value attributes,
                                     std::optional<std::string> containing, std::optional<Value> entitlements) {
    Value info = Value::dictionary({{"BDBundleIdentifier", str(identifier)},
                                    {"BDBundleShortVersionString", str("1.2")},
                                    {"BDBundleVersion", str("1")},
                                    {"RZExtension", Value::dictionary({{"RZExtensionAttributes", std::move(attributes)},
                                                                       {"RZExtensionProtocol", str("Provider")}})}});
    auto plugIn = BXPlugInCore::initWithNameUrlBundleInfoInfoUuid(identifier, path, info, std::nullopt,
                                                                  Uuid::parse("6F1C2A7E-3B4D-4E5F-"
                                                                              "8A9B-0C1D2E3F4A5B"));
    if (!plugIn) __builtin_trap();
    plugIn->setContainingUrl(std::move(containing));
    plugIn->setEntitlements(std::move(entitlements));
    return plugIn;
}

struct World {
    std::filesystem::path mimeDir;
    std::unique_ptr<TypeRegistry> types;
    std::vector<std::shared_ptr<BXPlugInCore>> plugIns;
    FuzzAnnotations annotations;

    World() {
        char dir[] = "/tmp/bexil-match-fuzz-XXXXXX";
        if (::mkdtemp(dir) == nullptr) __builtin_trap();
        mimeDir = dir;
        std::filesystem::create_directories(mimeDir / "mime");
        std::ofstream(mimeDir / "mime" / "subclasses") << "image/png image/x-raster\na/one a/two\na/two a/one\n";
        std::ofstream(mimeDir / "mime" / "aliases") << "image/x-png image/png\n";
        types = std::make_unique<TypeRegistry>(std::vector<std::filesystem::path>{mimeDir});
        // Hello.bxplugin in Greeter.app.
        plugIns.push_back(record("com.example.greeter.hello", "/Apps/Greeter.app/PlugIns/Hello.bxplugin",
                                 Value::dictionary({{"Language", str("en")},
                                                    {"RZExtensionVersion", str("1.2")},
                                                    {"Languages", Value::array({str("en"), Value::int64(3)})}}),
                                 "/Apps/Greeter.app", std::nullopt));
        // Clipper.wexa in Notes.app, with an activation rule.
        plugIns.push_back(
            record("com.example.notes.clipper", "/Apps/Notes.app/PlugIns/Clipper.wexa",
                   Value::dictionary({{"RZExtensionVersion", str("1.0")},
                                      {"DocumentType", str("image/png")},
                                      {"ActivationRule", Value::dictionary({{"image/x-raster", Value::int64(2)},
                                                                            {"text/plain", Value::int64(1)}})}}),
                   "/Apps/Notes.app", std::nullopt));
        // A system plug-in outside any application, with entitlements.
        plugIns.push_back(record(
            "com.example.clock", "/System/Library/PlugIns/Clock.bxplugin",
            Value::dictionary({{"RZExtensionVersion", str("10")}}), std::nullopt,
            Value::dictionary({{"com.example.granted", Value::boolean(true)}, {"com.example.name", str("clock")}})));
    }
    ~World() { std::filesystem::remove_all(mimeDir); }
};

World& world() {
    static World instance;
    return instance;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    World& w = world();
    ByteReader in(data, size);
    uint8_t mode = in.byte();
    w.annotations.annotation =
        (mode & 1) ? Value::dictionary({{"election", Value::int64(static_cast<int32_t>(in.u64()))}}) : Value();
    BXMatchContext context;
    context.annotations = (mode & 2) ? &w.annotations : nullptr;
    context.types = w.types.get();

    Value rules = (mode & 4) ? pattern(in, 0) : [&] {
        MutableDictionary dictionary;
        size_t n = in.byte() % kMaxEntries;
        for (size_t i = 0; i < n && !in.empty(); ++i) {
            std::string k = key(in);
            dictionary.set(k, pattern(in, 1));
        }
        return dictionary.take();
    }();

    for (const auto& plugIn : w.plugIns) {
        bool all = BXMatchRules::match(rules, *plugIn, context);
        if (rules.isDictionary()) {
            bool each = true;
            for (const auto& entry : rules.entries())
                each = each && BXMatchRules::matchKeyPattern(entry.key, entry.value, *plugIn, context);
            if (all != each) __builtin_trap();
        } else if (all != rules.isNull()) {
            __builtin_trap();
        }
    }
    return 0;
}
