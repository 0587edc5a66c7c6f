#pragma once

// Interfaces of the messages that a host and its plug-in exchange. A protocol (BXProtocol) names a set of methods;
// for each method and each argument of its request and of its reply it says what the argument may hold: one of a set
// of message classes (BXMessageClass, a named test over a Value), or a nested message that itself speaks another
// protocol. A protocol may adopt other protocols, whose methods it then offers too. Protocols and classes live in
// two process-wide registries (BXProtocolRegistry, BXClassRegistry), looked up by exact name; both are safe to use
// from any thread, and what they hold is immutable once registered and is never removed.
//
// An interface description (BXInterface) is built from a protocol for one connection and may then be refined per
// method, argument and direction, by hand or with an interface spec string (applyInterfaceSpec):
//
//     request:0:{BXString+BXData},reply:1:Greeting
//
// allows a string or data as argument 0 of the request and makes argument 1 of the reply a nested message of the
// protocol Greeting. docs/interfaces.md describes the spec strings, the built-in classes and the message form.
//
// Declaring a protocol takes a few lines; an argument's type is written as in a spec string:
//
//     auto greeting = bexil::BXProtocolRegistry::shared().createProtocol("GreetingProvider");
//     greeting->addMethod("greet", {"{BXString}"}, {"{BXString}"});  // request (name), reply (greeting)
//     greeting->addMethod("languages", {}, {"{BXArray}"});
//     auto registered = greeting->registerProtocol();  // the protocol, or the error naming the bad type
//
// Errors are bexil::Error in the domain "Bexil": code 6 for a malformed spec or type, code 12 for a protocol that
// cannot be found or made.

#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "bexil/Error.h"
#include "bexil/Value.h"

namespace bexil {

enum class MessageDirection : uint8_t { Request, Reply };

// "request" or "reply".
const char* messageDirectionName(MessageDirection direction);

// A named kind of argument: a test that a Value passes or not. Immutable; shared by every interface that allows it.
class BXMessageClass {
  public:
    using Predicate = std::function<bool(const Value&)>;

    BXMessageClass(std::string name, Predicate accepts) : name_(std::move(name)), accepts_(std::move(accepts)) {}

    const std::string& name() const { return name_; }
    bool accepts(const Value& value) const { return accepts_ && accepts_(value); }

  private:
    std::string name_;
    Predicate accepts_;
};

// The process-wide table of message classes by name. It starts with one class per kind of Value: BXString,
// BXInteger (signed or unsigned 64-bit), BXReal, BXBool, BXData, BXDate, BXUuid, BXArray, BXDictionary. Nothing is
// ever removed, so a class once found stays valid.
class BXClassRegistry {
  public:
    static BXClassRegistry& shared();

    // Registers a class; an error (code 12) when the name is empty or already taken.
    std::optional<Error> registerClass(std::string name, BXMessageClass::Predicate accepts);
    // The class of exactly that name, or none.
    std::shared_ptr<const BXMessageClass> classNamed(std::string_view name) const;

  private:
    BXClassRegistry();
    struct State;
    std::shared_ptr<State> state_;
};

class BXProtocol;

// What one argument may hold: any of `classes`, or (when `nested` is set) a nested message of that protocol.
struct BXArgumentType {
    std::vector<std::shared_ptr<const BXMessageClass>> classes;
    std::shared_ptr<const BXProtocol> nested;
};

// A registered protocol: its name, the protocols it adopts and its own methods. Immutable.
class BXProtocol {
  public:
    struct Method {
        std::vector<BXArgumentType> request;
        std::vector<BXArgumentType> reply;
    };

    BXProtocol(std::string name, std::vector<std::shared_ptr<const BXProtocol>> adopted,
               std::map<std::string, Method, std::less<>> methods)
        : name_(std::move(name)), adopted_(std::move(adopted)), methods_(std::move(methods)) {}

    const std::string& name() const { return name_; }
    const std::vector<std::shared_ptr<const BXProtocol>>& adoptedProtocols() const { return adopted_; }
    // The methods this protocol declares itself.
    const std::map<std::string, Method, std::less<>>& ownMethods() const { return methods_; }
    // The method of that selector, its own or (in adoption order, depth first) an adopted protocol's; none if neither.
    const Method* methodNamed(std::string_view selector) const;
    // Whether it is `other` or adopts it, directly or through adopted protocols.
    bool conformsTo(const BXProtocol& other) const;

  private:
    std::string name_;
    std::vector<std::shared_ptr<const BXProtocol>> adopted_;
    std::map<std::string, Method, std::less<>> methods_;
};

// A protocol being made: created under a name that was free, filled in, then registered (or dropped, which
// registers nothing). Used by one thread.
class BXProtocolBuilder {
  public:
    explicit BXProtocolBuilder(std::string name) : name_(std::move(name)) {}

    const std::string& name() const { return name_; }
    void adopt(std::shared_ptr<const BXProtocol> protocol);
    // Declares a method; each type is a protocol name or a class set "{A+B}", as in a spec string. Types are
    // resolved when the protocol is registered. A later declaration of the same selector replaces the earlier one.
    void addMethod(std::string selector, std::vector<std::string> requestTypes, std::vector<std::string> replyTypes);
    // Resolves the types and registers the protocol. Fails (code 6, the type text as message) on a type that does
    // not resolve, and (code 12) when the name was taken since the builder was created.
    Result<std::shared_ptr<const BXProtocol>> registerProtocol();

  private:
    struct Declared {
        std::vector<std::string> request;
        std::vector<std::string> reply;
    };
    std::string name_;
    std::vector<std::shared_ptr<const BXProtocol>> adopted_;
    std::map<std::string, Declared, std::less<>> declared_;
};

// The process-wide table of protocols by name. Nothing is ever removed.
class BXProtocolRegistry {
  public:
    static BXProtocolRegistry& shared();

    // A builder for a new protocol of that name, or none when the name is empty or taken.
    std::optional<BXProtocolBuilder> createProtocol(std::string name) const;
    // The protocol of exactly that name, or none. Logs nothing (protocolNamed does).
    std::shared_ptr<const BXProtocol> lookup(std::string_view name) const;
    // Adds a complete protocol; false (and nothing changes) when its name is taken.
    bool registerProtocol(std::shared_ptr<const BXProtocol> protocol);

  private:
    BXProtocolRegistry();
    struct State;
    std::shared_ptr<State> state_;
};

// The interface of one connection: per method, argument index and direction, the allowed classes or a nested
// interface. Built from a protocol (taking the types its methods declare), then refined; refine it before a
// connection uses it, after which it is only read (any thread may then read it).
class BXInterface {
  public:
    struct Slot {
        std::vector<std::shared_ptr<const BXMessageClass>> classes;
        std::shared_ptr<BXInterface> nested;
    };

    // The interface of `protocol` with the types its methods (and those of the protocols it adopts) declare.
    static std::shared_ptr<BXInterface> interfaceWithProtocol(std::shared_ptr<const BXProtocol> protocol);

    const std::shared_ptr<const BXProtocol>& protocol() const { return protocol_; }
    bool respondsToSelector(std::string_view selector) const;
    // The number of arguments the protocol declares for the method in that direction (refinements of indexes
    // beyond it are kept but never match an argument); none for an unknown selector.
    std::optional<size_t> argumentCount(std::string_view selector, MessageDirection direction) const;
    // The description of one argument, or none when nothing describes it.
    const Slot* slot(std::string_view selector, size_t index, MessageDirection direction) const;

    // The two refinements: the argument becomes a nested interface, or holds one of `classes`. Either replaces
    // what was described for that argument before.
    void setInterfaceForSelectorArgumentIndexDirection(std::shared_ptr<BXInterface> nested, std::string_view selector,
                                                       size_t index, MessageDirection direction);
    void setClassesForSelectorArgumentIndexDirection(std::vector<std::shared_ptr<const BXMessageClass>> classes,
                                                     std::string_view selector, size_t index,
                                                     MessageDirection direction);

    // Whether `arguments` (an array) may travel as the request or reply of `selector`: the method is known, the
    // count is the declared one, and every argument passes its description (a nested message is a dictionary with
    // "selector" and "arguments" that passes the nested interface as a request). The error (code 4) says which
    // argument failed and why.
    std::optional<Error> checkArguments(std::string_view selector, MessageDirection direction,
                                        const Value& arguments) const;

  private:
    explicit BXInterface(std::shared_ptr<const BXProtocol> protocol) : protocol_(std::move(protocol)) {}
    std::optional<Error> checkArgumentsAtDepth(std::string_view selector, MessageDirection direction,
                                               const Value& arguments, size_t depth) const;

    struct Key {
        std::string selector;
        MessageDirection direction;
        size_t index;
        auto operator<=>(const Key&) const = default;
    };
    std::shared_ptr<const BXProtocol> protocol_;
    std::map<Key, Slot> slots_;
};

// The protocol of that name. A missing one is logged at default level and, when `error` is given, stored there
// (code 12, "unable to locate protocol ...").
std::shared_ptr<const BXProtocol> protocolNamed(std::string_view name, Error* error = nullptr);

// The protocol a plug-in's protocol spec names: a string names one protocol; an array names the members of a
// compound protocol "__XX_COMPOUND__<member>__<member>...", made and registered on first use, adopting each member.
// Nothing for any other value (and no error), or when a member is missing (`error` as protocolNamed sets it; the
// compound is then not registered).
std::shared_ptr<const BXProtocol> compoundProtocol(const Value& spec, Error* error = nullptr);

// Refines `interface` for `selector` with a spec string. Entries apply in order; the first bad one stops with its
// error (code 6) and the entries before it stay applied.
std::optional<Error> applyInterfaceSpec(BXInterface& interface, std::string_view selector, std::string_view spec);

}  // namespace bexil
