// The protocol and class registries, interface descriptions and interface spec strings (bexil/Interface.h).
//
// Both registries are maps behind a mutex that hand out shared pointers to immutable objects and never remove an
// entry, so whatever a caller found stays valid without holding the lock. A protocol is complete before it enters
// the table (a builder collects it outside), so nobody ever sees one half made; making a compound protocol twice at
// once is settled by the table, which keeps the first and hands it to both callers.
//
// Spec strings come from plug-in bundles and so are untrusted: they are cut with string views (a 1 MB spec costs one
// pass and no copies beyond the error message), and nothing in them can make anything but an error.

#include <algorithm>
#include <mutex>
#include <unordered_map>
#include <utility>

#include "base/Error.h"
#include "bexil/Interface.h"
#include "platform/log/Log.h"

namespace bexil {

namespace {

// Nested messages inside nested messages are refused below this depth; the wire format nests no deeper anyway.
constexpr size_t kMaxNestedDepth = 64;

constexpr std::string_view kSelectorKey = "selector";
constexpr std::string_view kArgumentsKey = "arguments";

struct StringHash {
    using is_transparent = void;
    size_t operator()(std::string_view text) const { return std::hash<std::string_view>{}(text); }
};

std::vector<std::string_view> split(std::string_view text, char separator) {
    std::vector<std::string_view> parts;
    size_t start = 0;
    for (;;) {
        size_t at = text.find(separator, start);
        if (at == std::string_view::npos) {
            parts.push_back(text.substr(start));
            return parts;
        }
        parts.push_back(text.substr(start, at - start));
        start = at + 1;
    }
}

// Decimal digits after optional blanks and sign; text that is not a number reads as 0, as does a negative index
// (no argument has one). Values past the largest index saturate rather than wrap around to a small one.
size_t readIndex(std::string_view text) {
    size_t at = 0;
    while (at < text.size() && (text[at] == ' ' || text[at] == '\t')) ++at;
    bool negative = false;
    if (at < text.size() && (text[at] == '+' || text[at] == '-')) negative = text[at++] == '-';
    size_t value = 0;
    for (; at < text.size() && text[at] >= '0' && text[at] <= '9'; ++at) {
        size_t digit = static_cast<size_t>(text[at] - '0');
        value = value > (SIZE_MAX - digit) / 10 ? SIZE_MAX : value * 10 + digit;
    }
    return negative ? 0 : value;
}

Error specError(std::string_view message) { return BXError(ErrorCode::BadInterfaceSpec, message); }

// A type written as in a spec string: "{A+B}" for classes, anything else a protocol name (an unknown one is logged
// by protocolNamed). The error carries the text that did not resolve: the type, or the one unknown class name.
Result<BXArgumentType> resolveType(std::string_view type) {
    BXArgumentType resolved;
    if (!type.starts_with('{')) {
        resolved.nested = protocolNamed(type);
        if (!resolved.nested) return specError(type);
        return resolved;
    }
    if (type.size() < 2 || !type.ends_with('}')) return specError(type);
    for (std::string_view name : split(type.substr(1, type.size() - 2), '+')) {
        auto messageClass = BXClassRegistry::shared().classNamed(name);
        if (!messageClass) return specError(name);
        resolved.classes.push_back(std::move(messageClass));
    }
    return resolved;
}

std::string classSetText(const std::vector<std::shared_ptr<const BXMessageClass>>& classes) {
    std::string text = "{";
    for (size_t i = 0; i < classes.size(); ++i) {
        if (i > 0) text += "+";
        text += classes[i]->name();
    }
    return text + "}";
}

}  // namespace

const char* messageDirectionName(MessageDirection direction) {
    return direction == MessageDirection::Request ? "request" : "reply";
}

// ---- Classes ----

struct BXClassRegistry::State {
    mutable std::mutex mutex;
    std::unordered_map<std::string, std::shared_ptr<const BXMessageClass>, StringHash, std::equal_to<>> classes;
};

BXClassRegistry::BXClassRegistry() : state_(std::make_shared<State>()) {
    auto kind = [this](const char* name, auto test) {
        state_->classes.emplace(name, std::make_shared<const BXMessageClass>(name, test));
    };
    kind("BXString", [](const Value& v) { return v.isString(); });
    kind("BXInteger", [](const Value& v) { return v.kind() == ValueKind::Int64 || v.kind() == ValueKind::UInt64; });
    kind("BXReal", [](const Value& v) { return v.kind() == ValueKind::Real; });
    kind("BXBool", [](const Value& v) { return v.isBool(); });
    kind("BXData", [](const Value& v) { return v.isData(); });
    kind("BXDate", [](const Value& v) { return v.isDate(); });
    kind("BXUuid", [](const Value& v) { return v.isUuid(); });
    kind("BXArray", [](const Value& v) { return v.isArray(); });
    kind("BXDictionary", [](const Value& v) { return v.isDictionary(); });
}

BXClassRegistry& BXClassRegistry::shared() {
    static BXClassRegistry* registry = new BXClassRegistry();  // never destroyed: classes outlive static teardown
    return *registry;
}

std::optional<Error> BXClassRegistry::registerClass(std::string name, BXMessageClass::Predicate accepts) {
    if (name.empty()) return BXError(ErrorCode::InvalidConfiguration, "a message class needs a name");
    auto made = std::make_shared<const BXMessageClass>(name, std::move(accepts));
    std::lock_guard lock(state_->mutex);
    if (!state_->classes.emplace(name, std::move(made)).second)
        return BXErrorWithFormat(ErrorCode::InvalidConfiguration, "message class \"%s\" is already registered", name);
    return std::nullopt;
}

std::shared_ptr<const BXMessageClass> BXClassRegistry::classNamed(std::string_view name) const {
    std::lock_guard lock(state_->mutex);
    auto found = state_->classes.find(name);
    return found == state_->classes.end() ? nullptr : found->second;
}

// ---- Protocols ----

const BXProtocol::Method* BXProtocol::methodNamed(std::string_view selector) const {
    if (auto own = methods_.find(selector); own != methods_.end()) return &own->second;
    for (const auto& adopted : adopted_)
        if (const Method* method = adopted->methodNamed(selector)) return method;
    return nullptr;
}

bool BXProtocol::conformsTo(const BXProtocol& other) const {
    if (this == &other) return true;
    return std::any_of(adopted_.begin(), adopted_.end(), [&](const auto& p) { return p->conformsTo(other); });
}

void BXProtocolBuilder::adopt(std::shared_ptr<const BXProtocol> protocol) {
    if (protocol) adopted_.push_back(std::move(protocol));
}

void BXProtocolBuilder::addMethod(std::string selector, std::vector<std::string> requestTypes,
                                  std::vector<std::string> replyTypes) {
    declared_[std::move(selector)] = Declared{std::move(requestTypes), std::move(replyTypes)};
}

Result<std::shared_ptr<const BXProtocol>> BXProtocolBuilder::registerProtocol() {
    std::map<std::string, BXProtocol::Method, std::less<>> methods;
    for (const auto& [selector, declared] : declared_) {
        BXProtocol::Method& method = methods[selector];
        for (const std::string& type : declared.request) {
            auto resolved = resolveType(type);
            if (!resolved) return resolved.error();
            method.request.push_back(std::move(*resolved));
        }
        for (const std::string& type : declared.reply) {
            auto resolved = resolveType(type);
            if (!resolved) return resolved.error();
            method.reply.push_back(std::move(*resolved));
        }
    }
    auto protocol = std::make_shared<const BXProtocol>(name_, adopted_, std::move(methods));
    if (!BXProtocolRegistry::shared().registerProtocol(protocol))
        return BXErrorWithFormat(ErrorCode::InvalidConfiguration, "protocol \"%s\" is already registered", name_);
    return std::shared_ptr<const BXProtocol>(std::move(protocol));
}

struct BXProtocolRegistry::State {
    mutable std::mutex mutex;
    std::unordered_map<std::string, std::shared_ptr<const BXProtocol>, StringHash, std::equal_to<>> protocols;
};

BXProtocolRegistry::BXProtocolRegistry() : state_(std::make_shared<State>()) {}

BXProtocolRegistry& BXProtocolRegistry::shared() {
    static BXProtocolRegistry* registry = new BXProtocolRegistry();  // never destroyed, like the class registry
    return *registry;
}

std::optional<BXProtocolBuilder> BXProtocolRegistry::createProtocol(std::string name) const {
    if (name.empty() || lookup(name)) return std::nullopt;
    return BXProtocolBuilder(std::move(name));
}

std::shared_ptr<const BXProtocol> BXProtocolRegistry::lookup(std::string_view name) const {
    std::lock_guard lock(state_->mutex);
    auto found = state_->protocols.find(name);
    return found == state_->protocols.end() ? nullptr : found->second;
}

bool BXProtocolRegistry::registerProtocol(std::shared_ptr<const BXProtocol> protocol) {
    if (!protocol || protocol->name().empty()) return false;
    std::lock_guard lock(state_->mutex);
    return state_->protocols.emplace(protocol->name(), protocol).second;
}

// Longest protocol name a log line carries in full: a name comes from a spec string, which may be of any length,
// and one bad spec must not put a megabyte into the journal. The error keeps the whole name.
constexpr size_t kMaxLoggedProtocolName = 256;

std::shared_ptr<const BXProtocol> protocolNamed(std::string_view name, Error* error) {
    if (auto protocol = BXProtocolRegistry::shared().lookup(name)) return protocol;
    constexpr const char* kMissing =
        "unable to locate protocol \"%s\" - check that it is defined and not inadvertently optimized away";
    std::string message = formatPrintf(kMissing, name);
    if (name.size() <= kMaxLoggedProtocolName) {
        log::ops().notice("%s", message);
    } else {
        size_t cut = kMaxLoggedProtocolName;
        while (cut > 0 && (static_cast<unsigned char>(name[cut]) & 0xC0) == 0x80) --cut;  // not inside a character
        log::ops().notice(kMissing, std::string(name.substr(0, cut)) + "... (" + std::to_string(name.size()) +
                                        " bytes, shortened in this line)");
    }
    if (error) *error = BXError(ErrorCode::InvalidConfiguration, message);
    return nullptr;
}

std::shared_ptr<const BXProtocol> compoundProtocol(const Value& spec, Error* error) {
    if (spec.isString()) return protocolNamed(spec.stringView(), error);
    if (!spec.isArray()) return nullptr;
    std::string name = "__XX_COMPOUND";
    for (const Value& member : spec.items()) name += formatPrintf("__%@", member);
    auto& registry = BXProtocolRegistry::shared();
    if (std::optional<BXProtocolBuilder> builder = registry.createProtocol(name)) {
        std::vector<std::shared_ptr<const BXProtocol>> members;
        for (const Value& member : spec.items()) {
            // A member that is not text is looked up by its description, which no registered name matches.
            auto protocol = protocolNamed(member.isString() ? member.stringView() : member.description(), error);
            if (!protocol) return nullptr;
            members.push_back(std::move(protocol));
        }
        auto compound = std::make_shared<const BXProtocol>(name, std::move(members),
                                                           std::map<std::string, BXProtocol::Method, std::less<>>{});
        // Another thread may have made the same compound meanwhile: the table keeps one, and that is the answer.
        if (registry.registerProtocol(compound)) return compound;
    }
    if (auto existing = registry.lookup(name)) return existing;
    if (error) *error = BXError(ErrorCode::InvalidConfiguration, "unable to create compound protocol");
    return nullptr;
}

// ---- Interfaces ----

std::shared_ptr<BXInterface> BXInterface::interfaceWithProtocol(std::shared_ptr<const BXProtocol> protocol) {
    if (!protocol) return nullptr;
    std::shared_ptr<BXInterface> interface(new BXInterface(protocol));
    // Adopted protocols first, so that a method the protocol declares itself describes its arguments last and wins.
    std::function<void(const BXProtocol&)> take = [&](const BXProtocol& p) {
        for (auto adopted = p.adoptedProtocols().rbegin(); adopted != p.adoptedProtocols().rend(); ++adopted)
            take(**adopted);
        for (const auto& [selector, method] : p.ownMethods()) {
            for (MessageDirection direction : {MessageDirection::Request, MessageDirection::Reply}) {
                const auto& arguments = direction == MessageDirection::Request ? method.request : method.reply;
                for (size_t index = 0; index < arguments.size(); ++index) {
                    if (arguments[index].nested)
                        interface->setInterfaceForSelectorArgumentIndexDirection(
                            interfaceWithProtocol(arguments[index].nested), selector, index, direction);
                    else
                        interface->setClassesForSelectorArgumentIndexDirection(arguments[index].classes, selector,
                                                                               index, direction);
                }
            }
        }
    };
    take(*protocol);
    return interface;
}

bool BXInterface::respondsToSelector(std::string_view selector) const {
    return protocol_->methodNamed(selector) != nullptr;
}

std::optional<size_t> BXInterface::argumentCount(std::string_view selector, MessageDirection direction) const {
    const BXProtocol::Method* method = protocol_->methodNamed(selector);
    if (!method) return std::nullopt;
    return direction == MessageDirection::Request ? method->request.size() : method->reply.size();
}

const BXInterface::Slot* BXInterface::slot(std::string_view selector, size_t index, MessageDirection direction) const {
    auto found = slots_.find(Key{std::string(selector), direction, index});
    return found == slots_.end() ? nullptr : &found->second;
}

void BXInterface::setInterfaceForSelectorArgumentIndexDirection(std::shared_ptr<BXInterface> nested,
                                                                std::string_view selector, size_t index,
                                                                MessageDirection direction) {
    slots_[Key{std::string(selector), direction, index}] = Slot{{}, std::move(nested)};
}

void BXInterface::setClassesForSelectorArgumentIndexDirection(
    std::vector<std::shared_ptr<const BXMessageClass>> classes, std::string_view selector, size_t index,
    MessageDirection direction) {
    slots_[Key{std::string(selector), direction, index}] = Slot{std::move(classes), nullptr};
}

std::optional<Error> BXInterface::checkArguments(std::string_view selector, MessageDirection direction,
                                                 const Value& arguments) const {
    return checkArgumentsAtDepth(selector, direction, arguments, 0);
}

std::optional<Error> BXInterface::checkArgumentsAtDepth(std::string_view selector, MessageDirection direction,
                                                        const Value& arguments, size_t depth) const {
    const char* way = messageDirectionName(direction);
    std::optional<size_t> count = argumentCount(selector, direction);
    if (!count)
        return BXErrorWithFormat(ErrorCode::InvalidRequest, "protocol \"%s\" has no method \"%s\"", protocol_->name(),
                                 selector);
    if (!arguments.isArray())
        return BXErrorWithFormat(ErrorCode::InvalidRequest, "the %s arguments of \"%s\" are a %s, not an array", way,
                                 selector, valueKindName(arguments.kind()));
    if (arguments.count() != *count)
        return BXErrorWithFormat(ErrorCode::InvalidRequest, "the %s of \"%s\" takes %zu arguments, not %zu", way,
                                 selector, *count, arguments.count());
    for (size_t index = 0; index < *count; ++index) {
        const Value& argument = arguments.items()[index];
        const Slot* described = slot(selector, index, direction);
        // Every declared argument is described (a protocol cannot declare one without a type); were one not, nothing
        // would restrict it.
        if (!described) continue;
        if (described->nested) {
            const Value& nestedSelector = argument.get(kSelectorKey);
            if (!argument.isDictionary() || !nestedSelector.isString() || depth >= kMaxNestedDepth)
                return BXErrorWithFormat(ErrorCode::InvalidRequest,
                                         "argument %zu of the %s of \"%s\" is not a message of protocol \"%s\"", index,
                                         way, selector, described->nested->protocol()->name());
            if (auto refused = described->nested->checkArgumentsAtDepth(
                    nestedSelector.stringView(), MessageDirection::Request, argument.get(kArgumentsKey), depth + 1))
                return BXErrorWithFormat(ErrorCode::InvalidRequest, "argument %zu of the %s of \"%s\": %s", index, way,
                                         selector, refused->localizedDescription().value_or(""));
            continue;
        }
        const auto& classes = described->classes;
        if (std::none_of(classes.begin(), classes.end(), [&](const auto& c) { return c->accepts(argument); }))
            return BXErrorWithFormat(ErrorCode::InvalidRequest,
                                     "argument %zu of the %s of \"%s\" is a %s, not one of %s", index, way, selector,
                                     valueKindName(argument.kind()), classSetText(classes));
    }
    return std::nullopt;
}

// ---- Spec strings ----

std::optional<Error> applyInterfaceSpec(BXInterface& interface, std::string_view selector, std::string_view spec) {
    for (std::string_view entry : split(spec, ',')) {
        std::vector<std::string_view> fields = split(entry, ':');
        if (fields.size() != 3) return specError(spec);
        MessageDirection direction;
        if (fields[0] == "request")
            direction = MessageDirection::Request;
        else if (fields[0] == "reply")
            direction = MessageDirection::Reply;
        else
            return specError(fields[0]);
        const size_t index = readIndex(fields[1]);
        std::string_view type = fields[2];
        // An empty type names neither a protocol nor a class set; it fails like an unknown protocol, with its text.
        if (!type.starts_with('{')) {
            auto protocol = protocolNamed(type);
            if (!protocol) return specError(type);
            interface.setInterfaceForSelectorArgumentIndexDirection(BXInterface::interfaceWithProtocol(protocol),
                                                                    selector, index, direction);
            continue;
        }
        auto resolved = resolveType(type);
        if (!resolved) return resolved.error();
        interface.setClassesForSelectorArgumentIndexDirection(std::move(resolved->classes), selector, index, direction);
    }
    return std::nullopt;
}

}  // namespace bexil
