// Applies arbitrary bytes as an interface spec string to a fresh interface of a small protocol, for two selectors
// (the bytes before the first newline, if any, name a third). Besides not faulting, a failure must be a code 6 error
// in the Bexil domain whose message is text taken from the input string (all of it, a field, a type or a class
// name), an empty string must fail, and checking messages against whatever was applied must answer without faulting.

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <string>
#include <string_view>

#include "FuzzLog.h"
#include "bexil/Interface.h"

namespace {

using namespace bexil;

struct World {
    World() {
        for (const char* name : {"FuzzInner", "FuzzOuter"}) {
            auto builder = BXProtocolRegistry::shared().createProtocol(name);
            builder->addMethod("call", {"{BXString}", "{BXInteger+BXReal}"}, {"{BXData}"});
            if (std::string_view(name) == "FuzzOuter") builder->addMethod("wrap", {"FuzzInner"}, {"{BXBool}"});
            if (!builder->registerProtocol()) std::abort();
        }
        BXClassRegistry::shared().registerClass("FuzzShort", [](const Value& v) { return v.count() < 3; });
        outer = BXProtocolRegistry::shared().lookup("FuzzOuter");
    }
    fuzz::LogCheck logCheck;
    std::shared_ptr<const BXProtocol> outer;
};

void fail(const char* why) {
    std::fprintf(stderr, "interface_spec_fuzz: %s\n", why);
    std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static World world;
    std::string_view spec(reinterpret_cast<const char*>(data), size);
    std::string selector = "wrap";
    if (size_t newline = spec.find('\n'); newline != std::string_view::npos) {
        selector = std::string(spec.substr(0, newline));
        spec.remove_prefix(newline + 1);
    }
    auto interface = BXInterface::interfaceWithProtocol(world.outer);
    if (std::optional<Error> error = applyInterfaceSpec(*interface, selector, spec)) {
        if (error->domain() != "Bexil" || error->code() != 6) fail("a failure that is not code 6 in Bexil");
        if (!error->localizedDescription()) fail("a failure without a message");
        if (spec.find(*error->localizedDescription()) == std::string_view::npos)
            fail("a message not taken from the input");
    } else if (spec.empty()) {
        fail("an empty spec string succeeded");
    }
    // Whatever was applied, checking a message against the result answers without faulting.
    Value arguments = Value::array({Value::dictionary({{"selector", Value::string("call")}}), Value::int64(1)});
    (void)interface->checkArguments(selector, MessageDirection::Request, arguments);
    (void)interface->checkArguments("call", MessageDirection::Reply,
                                    Value::array({Value::data(std::vector<uint8_t>{})}));
    if (world.logCheck.takeFault()) fail("a fault was logged");
    return 0;
}
