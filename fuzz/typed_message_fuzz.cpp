// Reads arbitrary bytes as the payload of a typed call and of a typed reply, the way a typed connection reads what
// its peer sends, against a protocol with class-typed and nested-message arguments. Besides not faulting: a call that
// reads must pass the interface's check when checked again, and every refusal is a code 4 error in the Bexil domain
// with a message (the error reply the receiver sends back).

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <span>

#include "FuzzLog.h"
#include "bexil/Interface.h"
#include "client/TypedMessage.h"

namespace {

using namespace bexil;

struct World {
    World() {
        auto note = BXProtocolRegistry::shared().createProtocol("FuzzNote");
        note->addMethod("note", {"{BXString+BXData}"}, {});
        auto call = BXProtocolRegistry::shared().createProtocol("FuzzCall");
        call->addMethod("greet", {"{BXString}"}, {"{BXString}", "{BXInteger}"});
        call->addMethod("pass", {"FuzzNote", "{BXArray+BXDictionary}"}, {"FuzzNote"});
        if (!note->registerProtocol() || !call->registerProtocol()) std::abort();
        interface = BXInterface::interfaceWithProtocol(protocolNamed("FuzzCall"));
    }
    fuzz::LogCheck logCheck;
    std::shared_ptr<BXInterface> interface;
};

void fail(const char* why) {
    std::fprintf(stderr, "typed_message_fuzz: %s\n", why);
    std::abort();
}

void expectRefusal(const Error& error) {
    if (error.domain() != "Bexil" || error.code() != 4 || !error.localizedDescription()) fail("an odd refusal");
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static World world;
    std::span<const uint8_t> payload(data, size);
    Result<typed::Call> call = typed::readCall(payload, *world.interface);
    if (call.ok()) {
        if (world.interface->checkArguments(call->selector, MessageDirection::Request, call->arguments))
            fail("a call that was read fails its check");
    } else {
        expectRefusal(call.error());
    }
    for (const char* selector : {"greet", "pass"}) {
        Result<Value> reply = typed::readReply(payload, *world.interface, selector);
        if (reply.ok() && world.interface->checkArguments(selector, MessageDirection::Reply, *reply))
            fail("a reply that was read fails its check");
    }
    if (world.logCheck.takeFault()) fail("a fault was logged");
    return 0;
}
