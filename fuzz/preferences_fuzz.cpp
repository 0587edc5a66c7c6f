// The daemon's preferences file as arbitrary bytes: read by the preferences store through its synchronisation step,
// by the daemon's user preferences (the global exclusions, whose rule sets are matched against two plug-in records
// as discovery does), and by a writer that changes one key.
//
// Besides not faulting: the synchronised domain holds exactly what reading the whole file gives, or nothing when
// the file cannot be used; the exclusions are the stored value and only its dictionaries become rule sets; and a
// writer either refuses a file it cannot understand, leaving it as it was, or keeps every other key when it sets
// its own.

#include <stdlib.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "../tests/platform/ZemStrictEqual.h"
#include "FuzzLog.h"
#include "database/BXDUserPrefs.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/prefs/PreferencesStore.h"
#include "policy/BXDPlugIn.h"

namespace {

using namespace bexil;
namespace fs = std::filesystem;

// The key the writer sets; the seeds leave it out, so that setting it always adds an entry.
constexpr std::string_view kWrittenKey = "com.example.fuzz.written";

[[noreturn]] void fail(const std::string& what) {
    std::fprintf(stderr, "preferences_fuzz: %s\n", what.c_str());
    std::abort();
}

std::string readText(const fs::path& file) {
    std::ifstream in(file, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(in), {});
}

std::shared_ptr<BXDPlugIn> record(const std::string& identifier, const std::string& path, bool system,
                                  Value attributes) {
    LXBexilProxy::Fields fields;
    fields.bundleURL = path;
    fields.isOnSystemPartition = system;
    fields.pluginIdentifier = identifier;
    fields.bundleIdentifier = identifier;
    fields.pluginUUID = Uuid::random();
    fields.infoVrec = Value::dictionary(
        {{"BDBundleIdentifier", Value::string(identifier)},
         {"BDBundleShortVersionString", Value::string("1.2")},
         {"RZExtension", Value::dictionary({{"RZExtensionProtocol", Value::string("#Data")},
                                            {"RZExtensionPointIdentifier", Value::string("com.example.greeting")},
                                            {"RZExtensionAttributes", std::move(attributes)}})}});
    std::shared_ptr<BXDPlugIn> plugIn = BXDPlugIn::initWithLXData(std::make_shared<LXBexilProxy>(std::move(fields)));
    if (!plugIn) fail("cannot build the plug-in record of " + identifier);
    return plugIn;
}

struct World {
    fuzz::LogCheck logCheck;
    fs::path root;
    std::vector<std::shared_ptr<BXDPlugIn>> plugIns;

    World() {
        std::string dir = (fs::temp_directory_path() / "bexil-preferences-fuzz-XXXXXX").string();
        if (::mkdtemp(dir.data()) == nullptr) fail("cannot make a temporary directory");
        root = dir;
        plugIns.push_back(record(
            "com.example.greeter.hello", "/System/Library/PlugIns/Hello.bxplugin", true,
            Value::dictionary({{"Language", Value::string("en")}, {"RZExtensionVersion", Value::string("1.2")}})));
        plugIns.push_back(record("com.example.clock", "/System/Library/PlugIns/Clock.bxplugin", true,
                                 Value::dictionary({{"RZExtensionVersion", Value::string("10")}})));
    }
    ~World() {
        std::error_code ignored;
        fs::remove_all(root, ignored);
    }
};

World& world() {
    static World instance;
    return instance;
}

void exercise(const World& w, const uint8_t* data, size_t size) {
    // A fresh store for every input: its cache must not stand in for a file rewritten within one clock tick.
    PreferencesStore store(w.root, "fuzz");
    const std::string domain = BXDUserPrefs::kDomain;
    const fs::path file = store.fileForDomain(domain);
    const std::string bytes(reinterpret_cast<const char*>(data), size);
    {
        std::ofstream out(file, std::ios::binary | std::ios::trunc);
        out.write(bytes.data(), static_cast<std::streamsize>(bytes.size()));
        if (!out) fail("cannot write " + file.string());
    }

    Result<Value> whole = store.readDomain(domain);
    if (whole && !whole->isDictionary()) fail("a domain was read that is not a dictionary");
    const Value stored = whole ? *whole : Value::emptyDictionary();

    store.synchronize(domain);
    for (const DictionaryEntry& entry : stored.entries())
        if (!testing::strictlyEqual(store.copyValue(domain, entry.key), entry.value))
            fail("the synchronised domain differs from the file at key " + entry.key);
    if (!stored.contains(kWrittenKey) && !store.copyValue(domain, kWrittenKey).isNull())
        fail("the synchronised domain has a key the file lacks");

    BXDUserPrefs prefs(store);
    Value exclusions = prefs.exclusions();
    if (!testing::strictlyEqual(exclusions, stored.get(BXDUserPrefs::kExclusionsKey)))
        fail("the exclusions are not the stored value");
    std::vector<Value> ruleSets = BXDUserPrefs::exclusionRuleSets(exclusions);
    size_t dictionaries = 0;
    if (exclusions.isArray())
        for (const Value& element : exclusions.items()) dictionaries += element.isDictionary() ? 1 : 0;
    if (ruleSets.size() != dictionaries) fail("the rule sets are not the dictionaries of the exclusions");
    for (const Value& ruleSet : ruleSets)
        for (const std::shared_ptr<BXDPlugIn>& plugIn : w.plugIns) (void)plugIn->match(ruleSet);

    // The writer: a file it cannot read is left alone, otherwise every other key survives its change.
    std::optional<Error> written = store.setValue(domain, kWrittenKey, Value::int64(static_cast<int64_t>(size)));
    if (!whole) {
        if (!written) fail("a file the store cannot read was overwritten");
        if (readText(file) != bytes) fail("a file the writer refused was changed");
        return;
    }
    if (written) {
        // Setting one key may only fail when the document grows past the size limit.
        if (bytes.size() < PreferencesStore::kMaxPreferencesFileBytes / 2)
            fail("a readable domain cannot be written: " + written->description());
        return;
    }
    Result<Value> after = store.readDomain(domain);
    if (!after) fail("what the writer wrote cannot be read: " + after.error().description());
    if (after->count() != stored.count() + (stored.contains(kWrittenKey) ? 0 : 1))
        fail("the writer changed the number of keys");
    for (const DictionaryEntry& entry : stored.entries())
        if (entry.key != kWrittenKey && !testing::strictlyEqual(after->get(entry.key), entry.value))
            fail("the writer changed the key " + entry.key);
    if (!testing::strictlyEqual(store.copyValueAfterSync(domain, kWrittenKey),
                                Value::int64(static_cast<int64_t>(size))))
        fail("the synchronised domain does not show the written key");
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    World& w = world();
    exercise(w, data, size);
    if (std::optional<std::string> fault = w.logCheck.takeFault()) fail("a fault was logged: " + *fault);
    return 0;
}
