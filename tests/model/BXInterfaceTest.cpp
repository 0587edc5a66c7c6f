// Protocols, compound protocols, interface descriptions and the spec strings that refine them. The registries are
// process-wide and keep what they are given, so every test names its protocols and classes after itself.

#include <gtest/gtest.h>

#include <string>
#include <thread>

#include "base/Error.h"
#include "bexil/Interface.h"
#include "platform/log/CaptureSink.h"

namespace bexil {
namespace {

std::shared_ptr<const BXProtocol> makeProtocol(const std::string& name, const std::string& selector = "run",
                                               std::vector<std::string> request = {"{BXString}"},
                                               std::vector<std::string> reply = {}) {
    auto builder = BXProtocolRegistry::shared().createProtocol(name);
    if (!builder) return BXProtocolRegistry::shared().lookup(name);
    builder->addMethod(selector, std::move(request), std::move(reply));
    auto made = builder->registerProtocol();
    return made ? *made : nullptr;
}

std::vector<std::string> classNames(const BXInterface::Slot* slot) {
    std::vector<std::string> names;
    if (slot)
        for (const auto& c : slot->classes) names.push_back(c->name());
    return names;
}

void expectSpecError(const std::optional<Error>& error, const std::string& message) {
    ASSERT_TRUE(error) << "expected a failure naming " << message;
    EXPECT_EQ(error->domain(), "Bexil");
    EXPECT_EQ(error->code(), 6);
    EXPECT_EQ(error->localizedDescription(), message);
}

TEST(InterfaceSpec, SetsClassesAndNestedInterfacesPerArgumentAndDirection) {
    auto p = makeProtocol("SpecSetsP", "call", {"{BXString}", "{BXString}", "{BXString}"}, {"{BXData}"});
    ASSERT_TRUE(makeProtocol("SpecSetsNested"));
    auto interface = BXInterface::interfaceWithProtocol(p);
    ASSERT_FALSE(applyInterfaceSpec(*interface, "call", "request:0:{BXInteger+BXReal},reply:2:SpecSetsNested"));
    EXPECT_EQ(classNames(interface->slot("call", 0, MessageDirection::Request)),
              (std::vector<std::string>{"BXInteger", "BXReal"}));
    const auto* nested = interface->slot("call", 2, MessageDirection::Reply);
    ASSERT_TRUE(nested && nested->nested);
    EXPECT_EQ(nested->nested->protocol()->name(), "SpecSetsNested");
    // The request's argument 2 keeps its declared type: the directions are separate.
    EXPECT_EQ(classNames(interface->slot("call", 2, MessageDirection::Request)),
              (std::vector<std::string>{"BXString"}));
    // Index text that is not a number reads as 0.
    ASSERT_FALSE(applyInterfaceSpec(*interface, "call", "request:first:{BXBool}"));
    EXPECT_EQ(classNames(interface->slot("call", 0, MessageDirection::Request)), (std::vector<std::string>{"BXBool"}));
}

TEST(InterfaceSpec, MalformedEntriesFailWithCodeSixAndTheirText) {
    auto interface = BXInterface::interfaceWithProtocol(makeProtocol("SpecMalformedP"));
    log::CaptureSink capture;
    expectSpecError(applyInterfaceSpec(*interface, "run", ""), "");
    expectSpecError(applyInterfaceSpec(*interface, "run", "request:{BXString}"), "request:{BXString}");
    expectSpecError(applyInterfaceSpec(*interface, "run", "reply:0:{BXString}:x"), "reply:0:{BXString}:x");
    expectSpecError(applyInterfaceSpec(*interface, "run", "answer:0:{BXString}"), "answer");
    expectSpecError(applyInterfaceSpec(*interface, "run", "request:0:{BXString+BXData"), "{BXString+BXData");
    expectSpecError(applyInterfaceSpec(*interface, "run", "request:0:{}"), "");
    expectSpecError(applyInterfaceSpec(*interface, "run", "request:0:{BXString+NoSuchClass}"), "NoSuchClass");
    expectSpecError(applyInterfaceSpec(*interface, "run", "request:0:"), "");
    expectSpecError(applyInterfaceSpec(*interface, "run", "request:0:NoSuchProtocol"), "NoSuchProtocol");
    auto line = capture.find("NoSuchProtocol");
    ASSERT_TRUE(line);
    EXPECT_EQ(line->level, log::Level::Default);
    EXPECT_EQ(line->message,
              "unable to locate protocol \"NoSuchProtocol\" - check that it is defined and not inadvertently "
              "optimized away");
}

TEST(InterfaceSpec, EntriesBeforeAFailureStayApplied) {
    auto interface = BXInterface::interfaceWithProtocol(makeProtocol("SpecPartialP"));
    expectSpecError(applyInterfaceSpec(*interface, "run", "request:0:{BXUuid},request:1:{Nope},reply:0:{BXData}"),
                    "Nope");
    EXPECT_EQ(classNames(interface->slot("run", 0, MessageDirection::Request)), (std::vector<std::string>{"BXUuid"}));
    EXPECT_EQ(interface->slot("run", 0, MessageDirection::Reply), nullptr);
}

// Spec strings come from bundles: a megabyte of any shape is an answer, never a crash or a hang.
TEST(InterfaceSpec, MegabyteSpecsAreAnswered) {
    auto interface = BXInterface::interfaceWithProtocol(makeProtocol("SpecHugeP"));
    const size_t mb = 1 << 20;
    std::string manyEntries;
    while (manyEntries.size() < mb) manyEntries += "request:0:{BXString+BXData},";
    manyEntries += "reply:0:{BXDate}";
    EXPECT_FALSE(applyInterfaceSpec(*interface, "run", manyEntries));
    EXPECT_EQ(classNames(interface->slot("run", 0, MessageDirection::Reply)), (std::vector<std::string>{"BXDate"}));
    expectSpecError(applyInterfaceSpec(*interface, "run", std::string(mb, ':')), std::string(mb, ':'));
    std::string classes = "request:99999999999999999999999:{" + std::string(mb, '+') + "}";
    expectSpecError(applyInterfaceSpec(*interface, "run", classes), "");
    // A megabyte protocol name: the error carries it whole, its log line only the start (no cut character).
    log::CaptureSink capture;
    const std::string name = "\xC3\xA9" + std::string(mb, 'P');
    expectSpecError(applyInterfaceSpec(*interface, "run", "reply:0:" + name), name);
    auto line = capture.find("unable to locate protocol");
    ASSERT_TRUE(line);
    EXPECT_LT(line->message.size(), 512u);
    EXPECT_NE(line->message.find("\"\xC3\xA9PP"), std::string::npos);
    EXPECT_NE(line->message.find("(1048578 bytes, shortened in this line)"), std::string::npos) << line->message;
}

TEST(CompoundProtocol, NamesMembersInOrderAndRegistersOnce) {
    auto p = makeProtocol("CompoundP", "first");
    auto q = makeProtocol("CompoundQ", "second");
    Value members = Value::array({Value::string("CompoundP"), Value::string("CompoundQ")});
    auto compound = compoundProtocol(members);
    ASSERT_TRUE(compound);
    EXPECT_EQ(compound->name(), "__XX_COMPOUND__CompoundP__CompoundQ");
    EXPECT_EQ(compoundProtocol(members), compound);
    EXPECT_EQ(BXProtocolRegistry::shared().lookup(compound->name()), compound);
    EXPECT_TRUE(compound->conformsTo(*p) && compound->conformsTo(*q));
    auto interface = BXInterface::interfaceWithProtocol(compound);
    EXPECT_TRUE(interface->respondsToSelector("first") && interface->respondsToSelector("second"));

    // One member is a compound of one; a string is the protocol itself; other values are nothing, without error.
    EXPECT_EQ(compoundProtocol(Value::array({Value::string("CompoundP")}))->name(), "__XX_COMPOUND__CompoundP");
    EXPECT_EQ(compoundProtocol(Value::string("CompoundQ")), q);
    auto twice = compoundProtocol(Value::array({Value::string("CompoundQ"), Value::string("CompoundQ")}));
    ASSERT_TRUE(twice);
    EXPECT_EQ(twice->name(), "__XX_COMPOUND__CompoundQ__CompoundQ");
    EXPECT_TRUE(BXInterface::interfaceWithProtocol(twice)->respondsToSelector("second"));
    Error untouched = BXError(1, "untouched");
    EXPECT_EQ(compoundProtocol(Value::int64(3), &untouched), nullptr);
    EXPECT_EQ(untouched.code(), 1);
}

// Threads that make the same compound at once all get the one protocol the registry kept.
TEST(CompoundProtocol, ConcurrentMakersShareOneProtocol) {
    ASSERT_TRUE(makeProtocol("RaceA") && makeProtocol("RaceB"));
    Value members = Value::array({Value::string("RaceA"), Value::string("RaceB")});
    std::vector<std::shared_ptr<const BXProtocol>> made(8);
    std::vector<std::thread> threads;
    for (auto& slot : made) threads.emplace_back([&slot, &members] { slot = compoundProtocol(members); });
    for (auto& thread : threads) thread.join();
    for (const auto& protocol : made) EXPECT_EQ(protocol, BXProtocolRegistry::shared().lookup(made[0]->name()));
}

TEST(CompoundProtocol, UnknownMemberYieldsNothingAndRegistersNothing) {
    ASSERT_TRUE(makeProtocol("CompoundKnown"));
    Error error = BXError(1, "untouched");
    EXPECT_EQ(compoundProtocol(Value::array({Value::string("CompoundKnown"), Value::string("CompoundGhost")}), &error),
              nullptr);
    EXPECT_EQ(error.code(), 12);
    EXPECT_EQ(error.localizedDescription(),
              "unable to locate protocol \"CompoundGhost\" - check that it is defined and not inadvertently "
              "optimized away");
    EXPECT_FALSE(BXProtocolRegistry::shared().lookup("__XX_COMPOUND__CompoundKnown__CompoundGhost"));
    EXPECT_EQ(protocolNamed("CompoundGhost"), nullptr);
}

TEST(BXInterface, ChecksArgumentsAgainstClassesAndNestedMessages) {
    ASSERT_TRUE(makeProtocol("CheckInner", "ping", {"{BXInteger}"}));
    auto outer = makeProtocol("CheckOuter", "wrap", {"CheckInner", "{BXString+BXData}"}, {"{BXBool}"});
    ASSERT_TRUE(outer);
    auto interface = BXInterface::interfaceWithProtocol(outer);
    auto inner = [](Value argument) {
        return Value::dictionary({{"selector", Value::string("ping")}, {"arguments", Value::array({argument})}});
    };
    auto request = [&](Value a, Value b) {
        return interface->checkArguments("wrap", MessageDirection::Request, Value::array({a, b}));
    };
    EXPECT_FALSE(request(inner(Value::uint64(3)), Value::string("x")));
    EXPECT_FALSE(request(inner(Value::int64(-3)), Value::data(std::vector<uint8_t>{1})));
    EXPECT_TRUE(request(inner(Value::string("3")), Value::string("x")));
    EXPECT_TRUE(request(Value::string("not a message"), Value::string("x")));
    EXPECT_TRUE(request(inner(Value::uint64(3)), Value::real(1.5)));
    auto refused = interface->checkArguments("wrap", MessageDirection::Request, Value::array({Value::string("x")}));
    ASSERT_TRUE(refused);
    EXPECT_EQ(refused->code(), 4);
    EXPECT_TRUE(interface->checkArguments("unwrap", MessageDirection::Request, Value::emptyArray()));
    EXPECT_FALSE(interface->checkArguments("wrap", MessageDirection::Reply, Value::array({Value::boolean(true)})));

    // A class of the program's own: a predicate over the value.
    ASSERT_FALSE(BXClassRegistry::shared().registerClass(
        "CheckShortText", [](const Value& v) { return v.isString() && v.stringView().size() <= 3; }));
    EXPECT_TRUE(BXClassRegistry::shared().registerClass("CheckShortText", nullptr));
    ASSERT_FALSE(applyInterfaceSpec(*interface, "wrap", "request:1:{CheckShortText}"));
    EXPECT_FALSE(request(inner(Value::uint64(3)), Value::string("abc")));
    EXPECT_TRUE(request(inner(Value::uint64(3)), Value::string("abcd")));
}

}  // namespace
}  // namespace bexil
