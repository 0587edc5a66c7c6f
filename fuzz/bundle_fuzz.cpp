// Bundles as they come from disk: the input becomes the files of a plug-in bundle inside an application, which is
// then read by the bundle service, registered with the registry and turned into the daemon's record the way "add"
// does, and unregistered again; and the entitlements document of a program, read by the trusted entitlements
// directory.
//
// The input is up to four documents separated by the line kSeparator: the plug-in's Info.vrec, its
// Entitlements.vrec, the application's Info.vrec and a document of the entitlements directory. A document that is
// empty, or that the input does not reach, is no file at all. In the last one "@tool" stands for the path of a
// trusted executable that the fuzzer made.
//
// Besides not faulting: what the registry records is what the bundle service read, registering the same bundle
// again keeps its UUID, an executable that the bundle names leads back to the bundle, the registry forgets the
// bundle once it is unregistered, and the entitlements directory grants exactly what a well-formed document naming
// the tool says.

#include <stdlib.h>
#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "../tests/platform/ZemStrictEqual.h"
#include "FuzzLog.h"
#include "base/Document.h"
#include "model/BXBundle.h"
#include "platform/bundles/DirectoryBundle.h"
#include "platform/codesign/EntitlementsDirectory.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/ledgerix/LedgerixWorkspace.h"
#include "policy/BXDPlugIn.h"

namespace {

using namespace bexil;
namespace fs = std::filesystem;

constexpr std::string_view kSeparator = "\n%%%%\n";
constexpr std::string_view kToolPlaceholder = "@tool";

[[noreturn]] void fail(const std::string& what) {
    std::fprintf(stderr, "bundle_fuzz: %s\n", what.c_str());
    std::abort();
}

void writeOrRemove(const fs::path& file, const std::optional<std::string_view>& text) {
    std::error_code ignored;
    if (!text) {
        fs::remove(file, ignored);
        return;
    }
    std::ofstream out(file, std::ios::binary | std::ios::trunc);
    out.write(text->data(), static_cast<std::streamsize>(text->size()));
    if (!out) fail("cannot write " + file.string());
}

std::string replaceAll(std::string text, std::string_view from, std::string_view to) {
    for (size_t at = text.find(from); at != std::string::npos; at = text.find(from, at + to.size()))
        text.replace(at, from.size(), to);
    return text;
}

struct World {
    fuzz::LogCheck logCheck;
    fs::path root;
    fs::path application;
    fs::path plugIn;
    fs::path entitlements;
    fs::path tool;
    std::shared_ptr<LedgerixWorkspace> registry;

    World() {
        std::string dir = (fs::temp_directory_path() / "bexil-bundle-fuzz-XXXXXX").string();
        if (::mkdtemp(dir.data()) == nullptr) fail("cannot make a temporary directory");
        root = fs::canonical(dir);
        application = root / "Apps" / "Fuzz.app";
        plugIn = application / "PlugIns" / "Fuzz.bxplugin";
        entitlements = root / "entitlements";
        fs::create_directories(plugIn / "bin");
        fs::create_directories(entitlements);
        fs::create_directories(root / "System");
        // Executables the information documents of the seeds name, and the trusted program of the entitlements.
        for (const fs::path& file : {plugIn / "tool", plugIn / "bin" / "tool", application / "fuzz"}) {
            std::ofstream(file) << "#!/bin/sh\n";
            fs::permissions(file, fs::perms(0755));
        }
        tool = plugIn / "tool";

        LedgerixWorkspace::Options options;
        options.stateDirectory = root / "state";
        options.rootDirectory = root;
        options.durability = LedgerixWorkspace::Durability::Process;
        Result<std::shared_ptr<LedgerixWorkspace>> opened = LedgerixWorkspace::open(options);
        if (!opened) fail("cannot open the registry: " + opened.error().description());
        registry = *opened;
    }
    ~World() {
        registry.reset();
        std::error_code ignored;
        fs::remove_all(root, ignored);
    }
};

World& world() {
    static World instance;
    return instance;
}

// The documents of an input, in order; empty ones and the ones the input does not reach are none.
std::vector<std::optional<std::string_view>> split(std::string_view input, size_t count) {
    std::vector<std::optional<std::string_view>> parts(count);
    for (size_t i = 0; i < count; ++i) {
        size_t end = input.find(kSeparator);
        if (end != 0 && !input.empty()) parts[i] = input.substr(0, end);
        if (end == std::string_view::npos) break;
        input.remove_prefix(end + kSeparator.size());
    }
    return parts;
}

void readBundle(const World& w) {
    std::shared_ptr<BXBundle> bundle = BXBundle::initWithPath(w.plugIn.string());
    (void)bundle->description();
    (void)bundle->bundleIdentifier();
    (void)bundle->plugInsPath();
    std::optional<std::string> executable = bundle->stringProperty(BundleStringProperty::ExecutablePath);
    if (bundle->path() != w.plugIn.string()) fail("the bundle directory is not the bundle's path");
    if (!executable) return;
    // The nearest bundle above the executable that names it is this one: nothing between the two has an
    // information document.
    std::shared_ptr<BXBundle> owner = BXBundle::initWithExecutablePath(*executable);
    if (owner->path() != w.plugIn.string())
        fail("the executable " + *executable + " does not lead back to its bundle but to " + owner->description());
}

void registerBundle(const World& w, const std::optional<std::string_view>& entitlementsText) {
    std::shared_ptr<const DirectoryBundle> bundle = DirectoryBundle::create(w.plugIn, BundleLookup::Directory);
    Result<std::shared_ptr<const LXBexilProxy>> registered = w.registry->registerPlugin(w.plugIn.string());
    if (!registered) {
        if (w.registry->plugInProxyForURL(w.plugIn.string())) fail("a refused bundle is registered");
        return;
    }
    const std::shared_ptr<const LXBexilProxy>& proxy = *registered;
    if (!proxy->pluginUUID() || proxy->bundleURL() != w.plugIn.string()) fail("the record names another bundle");
    if (!bundle->infoDictionary() || !proxy->infoVrec() ||
        !testing::strictlyEqual(*bundle->infoDictionary(), *proxy->infoVrec()))
        fail("the registry records another information dictionary than the bundle's");
    if (entitlementsText) {
        Result<Value> read = Document::read(*entitlementsText);
        if (!read || !read->isDictionary()) fail("a bundle with unusable entitlements was registered");
        if (!proxy->entitlements() || !testing::strictlyEqual(*read, *proxy->entitlements()))
            fail("the registry records other entitlements than the bundle's");
    } else if (proxy->entitlements()) {
        fail("a bundle without entitlements is recorded with some");
    }

    Result<std::shared_ptr<const LXBexilProxy>> again = w.registry->registerPlugin(w.plugIn.string());
    if (!again || (*again)->pluginUUID() != proxy->pluginUUID())
        fail("registering an unchanged bundle again changes its record");
    std::shared_ptr<const LXBexilProxy> found = w.registry->plugInProxyForUUID(*proxy->pluginUUID());
    if (!found || found->bundleURL() != proxy->bundleURL()) fail("the registered plug-in is not found by its UUID");

    if (std::shared_ptr<BXDPlugIn> record = BXDPlugIn::initWithLXData(found)) {
        (void)record->description();
        (void)record->annotationKey();
        (void)record->startableExecutable();
        (void)record->match(Value());
        (void)record->isAppExtension();
        Result<MutableDictionary> form = record->exportForm();
        if (!form) fail("a record that was built cannot export its form: " + form.error().description());
    }

    if (std::optional<Error> error = w.registry->unregisterPlugin(w.plugIn.string()))
        fail("a registered bundle cannot be unregistered: " + error->description());
    if (w.registry->plugInProxyForURL(w.plugIn.string()) || w.registry->plugInProxyForUUID(*proxy->pluginUUID()))
        fail("an unregistered bundle is still found");
}

void readEntitlements(const World& w, const std::optional<std::string_view>& text) {
    std::optional<std::string> document;
    if (text) document = replaceAll(std::string(*text), kToolPlaceholder, w.tool.string());
    fs::path file = w.entitlements / "fuzz.vrec";
    writeOrRemove(file, document);
    if (document) fs::permissions(file, fs::perms(0644));

    // A fresh directory object for every input: its cache must not stand in for a file rewritten within one clock
    // tick.
    EntitlementsDirectory directory(w.entitlements, geteuid());
    Result<Value> granted = directory.entitlementsForExecutable(w.tool.string());
    if (!granted || !granted->isDictionary()) fail("the entitlements directory cannot be read");

    Value expected = Value::emptyDictionary();
    if (document) {
        Result<Value> read = Document::read(*document);
        const Value* executable = read ? read->find(EntitlementsDirectory::kExecutableKey) : nullptr;
        if (executable && executable->getString() && *executable->getString() == w.tool.string() &&
            read->get(EntitlementsDirectory::kEntitlementsKey).isDictionary())
            expected = read->get(EntitlementsDirectory::kEntitlementsKey);
    }
    if (!testing::strictlyEqual(*granted, expected))
        fail("the entitlements directory grants " + granted->description() + " instead of " + expected.description());
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    World& w = world();
    std::vector<std::optional<std::string_view>> parts =
        split(std::string_view(reinterpret_cast<const char*>(data), size), 4);
    writeOrRemove(w.plugIn / DirectoryBundle::kInfoFileName, parts[0]);
    writeOrRemove(w.plugIn / "Entitlements.vrec", parts[1]);
    writeOrRemove(w.application / DirectoryBundle::kInfoFileName, parts[2]);

    readBundle(w);
    registerBundle(w, parts[1]);
    readEntitlements(w, parts[3]);

    // Registration makes a data container per plug-in identifier; the next input starts without them.
    std::error_code ignored;
    fs::remove_all(w.root / "state" / "containers", ignored);
    if (std::optional<std::string> fault = w.logCheck.takeFault()) fail("a fault was logged: " + *fault);
    return 0;
}
