#include "bexil/Value.h"

#include <sys/random.h>

#include <algorithm>
#include <bit>
#include <cerrno>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <functional>
#include <new>
#include <stdexcept>
#include <type_traits>

#include "base/Text.h"

namespace bexil {

// Scalars live inline in the Value; everything else lives in a reference-counted node that is never edited after
// it has been built, which is what makes sharing across threads safe without locks.
namespace detail {
// Nodes carry no type of their own: the Value that points at one knows its kind, and that chooses how it is freed.
// Arrays and dictionaries keep their elements in the same allocation as the node, sized exactly: a record caches
// many small dictionaries, and a separate vector (with its spare capacity) would double their allocations.
struct Node {
    std::atomic<uint32_t> refs{1};
    uint32_t count = 0;  // elements of an array or dictionary
};
struct StringNode final : Node {
    explicit StringNode(std::string s) : text(std::move(s)) {}
    std::string text;
};
struct DataNode final : Node {
    explicit DataNode(std::vector<uint8_t> b) : bytes(std::move(b)) {}
    std::vector<uint8_t> bytes;
};
struct UuidNode final : Node {
    explicit UuidNode(const Uuid& u) : uuid(u) {}
    Uuid uuid;
};

// A node followed by `count` elements of type T.
template <typename T>
struct SequenceNode final : Node {
    static_assert(alignof(T) <= alignof(Node) || sizeof(Node) % alignof(T) == 0);
    T* begin() { return reinterpret_cast<T*>(reinterpret_cast<char*>(this) + sizeof(Node)); }
    const T* begin() const { return reinterpret_cast<const T*>(reinterpret_cast<const char*>(this) + sizeof(Node)); }
    std::span<const T> elements() const { return {begin(), count}; }

    // Moves the elements of `from` into a new node.
    static SequenceNode* make(std::vector<T>&& from) {
        if (from.size() > UINT32_MAX) throw std::length_error("Value: too many elements");
        void* memory = ::operator new(sizeof(Node) + from.size() * sizeof(T));
        auto* node = new (memory) SequenceNode();
        T* out = node->begin();
        static_assert(std::is_nothrow_move_constructible_v<T>);
        for (T& element : from) {
            new (out + node->count) T(std::move(element));
            ++node->count;
        }
        return node;
    }
    static SequenceNode* copy(std::span<const T> from) {
        if (from.size() > UINT32_MAX) throw std::length_error("Value: too many elements");
        void* memory = ::operator new(sizeof(Node) + from.size() * sizeof(T));
        auto* node = new (memory) SequenceNode();
        T* out = node->begin();
        try {
            for (const T& element : from) {
                new (out + node->count) T(element);
                ++node->count;
            }
        } catch (...) {
            destroy(node);
            throw;
        }
        return node;
    }
    static void destroy(SequenceNode* node) {
        T* elements = node->begin();
        for (uint32_t i = node->count; i > 0; --i) elements[i - 1].~T();
        node->~SequenceNode();
        ::operator delete(node);
    }
};
using ArrayNode = SequenceNode<Value>;
using DictionaryNode = SequenceNode<DictionaryEntry>;
}  // namespace detail

using detail::ArrayNode;
using detail::DataNode;
using detail::DictionaryNode;
using detail::StringNode;
using detail::UuidNode;

const char* valueKindName(ValueKind kind) {
    switch (kind) {
        case ValueKind::Null:
            return "null";
        case ValueKind::Bool:
            return "bool";
        case ValueKind::Int64:
            return "int64";
        case ValueKind::UInt64:
            return "uint64";
        case ValueKind::Real:
            return "real";
        case ValueKind::String:
            return "string";
        case ValueKind::Data:
            return "data";
        case ValueKind::Date:
            return "date";
        case ValueKind::Uuid:
            return "uuid";
        case ValueKind::Array:
            return "array";
        case ValueKind::Dictionary:
            return "dictionary";
    }
    return "unknown";
}

// ---- Value: lifetime ----

static void destroyNode(ValueKind kind, detail::Node* node) noexcept {
    switch (kind) {
        case ValueKind::String:
            delete static_cast<StringNode*>(node);
            return;
        case ValueKind::Data:
            delete static_cast<DataNode*>(node);
            return;
        case ValueKind::Uuid:
            delete static_cast<UuidNode*>(node);
            return;
        case ValueKind::Array:
            ArrayNode::destroy(static_cast<ArrayNode*>(node));
            return;
        case ValueKind::Dictionary:
            DictionaryNode::destroy(static_cast<DictionaryNode*>(node));
            return;
        default:
            return;
    }
}

Value::Value(const Value& other) noexcept : kind_(other.kind_), scalar_(other.scalar_) { retain(); }

Value::Value(Value&& other) noexcept : kind_(other.kind_), scalar_(other.scalar_) {
    other.kind_ = ValueKind::Null;
    other.scalar_.u = 0;
}

Value& Value::operator=(const Value& other) noexcept {
    if (this != &other) {
        other.retain();
        release();
        kind_ = other.kind_;
        scalar_ = other.scalar_;
    }
    return *this;
}

Value& Value::operator=(Value&& other) noexcept {
    if (this != &other) {
        release();
        kind_ = other.kind_;
        scalar_ = other.scalar_;
        other.kind_ = ValueKind::Null;
        other.scalar_.u = 0;
    }
    return *this;
}

Value::~Value() { release(); }

void Value::retain() const noexcept {
    if (holdsNode()) scalar_.node->refs.fetch_add(1, std::memory_order_relaxed);
}

void Value::release() noexcept {
    if (holdsNode()) {
        if (scalar_.node->refs.fetch_sub(1, std::memory_order_acq_rel) == 1) destroyNode(kind_, scalar_.node);
        kind_ = ValueKind::Null;
        scalar_.u = 0;
    }
}

// ---- Value: construction ----

Value Value::boolean(bool b) {
    Value v;
    v.kind_ = ValueKind::Bool;
    v.scalar_.u = 0;
    v.scalar_.b = b;
    return v;
}
Value Value::int64(int64_t i) {
    Value v;
    v.kind_ = ValueKind::Int64;
    v.scalar_.i = i;
    return v;
}
Value Value::uint64(uint64_t u) {
    Value v;
    v.kind_ = ValueKind::UInt64;
    v.scalar_.u = u;
    return v;
}
Value Value::real(double d) {
    Value v;
    v.kind_ = ValueKind::Real;
    v.scalar_.r = d;
    return v;
}
Value Value::date(Date d) {
    Value v;
    v.kind_ = ValueKind::Date;
    v.scalar_.r = d.secondsSince1970;
    return v;
}
Value Value::string(std::string_view s) { return Value(ValueKind::String, new StringNode(std::string(s))); }
Value Value::string(std::string&& s) { return Value(ValueKind::String, new StringNode(std::move(s))); }
Value Value::data(std::span<const uint8_t> bytes) {
    return Value(ValueKind::Data, new DataNode(std::vector<uint8_t>(bytes.begin(), bytes.end())));
}
Value Value::data(std::vector<uint8_t>&& bytes) { return Value(ValueKind::Data, new DataNode(std::move(bytes))); }
Value Value::uuid(const Uuid& u) { return Value(ValueKind::Uuid, new UuidNode(u)); }
Value Value::array(std::vector<Value> items) { return Value(ValueKind::Array, ArrayNode::make(std::move(items))); }

static bool entryLess(const DictionaryEntry& a, const DictionaryEntry& b) { return a.key < b.key; }

Value Value::dictionary(std::vector<std::pair<std::string, Value>> pairs) {
    std::vector<DictionaryEntry> entries;
    entries.reserve(pairs.size());
    for (auto& [k, v] : pairs) entries.push_back(DictionaryEntry{std::move(k), std::move(v)});
    // A stable sort keeps equal keys in their given order, so the last one can win below.
    std::stable_sort(entries.begin(), entries.end(), entryLess);
    std::vector<DictionaryEntry> unique;
    unique.reserve(entries.size());
    for (auto& e : entries) {
        if (!unique.empty() && unique.back().key == e.key)
            unique.back().value = std::move(e.value);
        else
            unique.push_back(std::move(e));
    }
    return Value(ValueKind::Dictionary, DictionaryNode::make(std::move(unique)));
}

Value Value::emptyDictionary() { return Value(ValueKind::Dictionary, DictionaryNode::make({})); }
Value Value::emptyArray() { return Value(ValueKind::Array, ArrayNode::make({})); }

// ---- Value: access ----

bool Value::isNumber() const {
    return kind_ == ValueKind::Bool || kind_ == ValueKind::Int64 || kind_ == ValueKind::UInt64 ||
           kind_ == ValueKind::Real;
}

std::optional<bool> Value::getBool() const {
    return kind_ == ValueKind::Bool ? std::optional<bool>(scalar_.b) : std::nullopt;
}
std::optional<int64_t> Value::getInt64() const {
    return kind_ == ValueKind::Int64 ? std::optional<int64_t>(scalar_.i) : std::nullopt;
}
std::optional<uint64_t> Value::getUInt64() const {
    return kind_ == ValueKind::UInt64 ? std::optional<uint64_t>(scalar_.u) : std::nullopt;
}
std::optional<double> Value::getReal() const {
    return kind_ == ValueKind::Real ? std::optional<double>(scalar_.r) : std::nullopt;
}
std::optional<Date> Value::getDate() const {
    return kind_ == ValueKind::Date ? std::optional<Date>(Date{scalar_.r}) : std::nullopt;
}
const Uuid* Value::getUuid() const {
    return kind_ == ValueKind::Uuid ? &static_cast<const UuidNode*>(scalar_.node)->uuid : nullptr;
}
const std::string* Value::getString() const {
    return kind_ == ValueKind::String ? &static_cast<const StringNode*>(scalar_.node)->text : nullptr;
}
std::string_view Value::stringView() const {
    const std::string* s = getString();
    return s ? std::string_view(*s) : std::string_view();
}
std::span<const uint8_t> Value::dataBytes() const {
    if (kind_ != ValueKind::Data) return {};
    return static_cast<const DataNode*>(scalar_.node)->bytes;
}

// Exact conversions between doubles and 64-bit integers: 2^63 and 2^64 are exact doubles, so the range tests are.
static constexpr double kTwo63 = 9223372036854775808.0;
static constexpr double kTwo64 = 18446744073709551616.0;

static std::optional<int64_t> doubleToInt64(double d) {
    if (!(d >= -kTwo63 && d < kTwo63) || std::trunc(d) != d) return std::nullopt;
    return static_cast<int64_t>(d);
}
static std::optional<uint64_t> doubleToUInt64(double d) {
    if (!(d >= 0 && d < kTwo64) || std::trunc(d) != d) return std::nullopt;
    return static_cast<uint64_t>(d);
}

std::optional<int64_t> Value::numberAsInt64() const {
    switch (kind_) {
        case ValueKind::Bool:
            return scalar_.b ? 1 : 0;
        case ValueKind::Int64:
            return scalar_.i;
        case ValueKind::UInt64:
            if (scalar_.u > static_cast<uint64_t>(INT64_MAX)) return std::nullopt;
            return static_cast<int64_t>(scalar_.u);
        case ValueKind::Real:
            return doubleToInt64(scalar_.r);
        default:
            return std::nullopt;
    }
}

std::optional<uint64_t> Value::numberAsUInt64() const {
    switch (kind_) {
        case ValueKind::Bool:
            return scalar_.b ? 1 : 0;
        case ValueKind::Int64:
            if (scalar_.i < 0) return std::nullopt;
            return static_cast<uint64_t>(scalar_.i);
        case ValueKind::UInt64:
            return scalar_.u;
        case ValueKind::Real:
            return doubleToUInt64(scalar_.r);
        default:
            return std::nullopt;
    }
}

std::optional<double> Value::numberAsDouble() const {
    switch (kind_) {
        case ValueKind::Bool:
            return scalar_.b ? 1.0 : 0.0;
        case ValueKind::Int64:
            return static_cast<double>(scalar_.i);
        case ValueKind::UInt64:
            return static_cast<double>(scalar_.u);
        case ValueKind::Real:
            return scalar_.r;
        default:
            return std::nullopt;
    }
}

std::span<const Value> Value::items() const {
    if (kind_ != ValueKind::Array) return {};
    return static_cast<const ArrayNode*>(scalar_.node)->elements();
}

std::span<const DictionaryEntry> Value::entries() const {
    if (kind_ != ValueKind::Dictionary) return {};
    return static_cast<const DictionaryNode*>(scalar_.node)->elements();
}

size_t Value::count() const {
    if (kind_ == ValueKind::Array) return items().size();
    if (kind_ == ValueKind::Dictionary) return entries().size();
    return 0;
}

static const DictionaryEntry* findEntry(std::span<const DictionaryEntry> entries, std::string_view key) {
    auto it = std::lower_bound(entries.begin(), entries.end(), key,
                               [](const DictionaryEntry& e, std::string_view k) { return e.key < k; });
    if (it != entries.end() && it->key == key) return &*it;
    return nullptr;
}

const Value* Value::find(std::string_view key) const {
    if (kind_ != ValueKind::Dictionary) return nullptr;
    const DictionaryEntry* e = findEntry(entries(), key);
    return e ? &e->value : nullptr;
}

Value Value::get(std::string_view key) const {
    const Value* v = find(key);
    return v ? *v : Value();
}

// ---- Value: equality and hashing ----

// Compares two numeric values by their mathematical value.
static bool numbersEqual(const Value& a, const Value& b) {
    auto isIntegerKind = [](ValueKind k) { return k != ValueKind::Real; };
    if (isIntegerKind(a.kind()) && isIntegerKind(b.kind())) {
        // Bool and Int64 fit int64; UInt64 may not: compare through the signed/unsigned split.
        auto ai = a.numberAsInt64(), bi = b.numberAsInt64();
        if (ai && bi) return *ai == *bi;
        auto au = a.numberAsUInt64(), bu = b.numberAsUInt64();
        return au && bu && *au == *bu;
    }
    if (a.kind() == ValueKind::Real && b.kind() == ValueKind::Real) return *a.getReal() == *b.getReal();
    const Value& real = a.kind() == ValueKind::Real ? a : b;
    const Value& integer = a.kind() == ValueKind::Real ? b : a;
    if (auto i = integer.numberAsInt64()) {
        auto r = real.numberAsInt64();
        return r && *r == *i;
    }
    auto u = integer.numberAsUInt64();
    auto r = real.numberAsUInt64();
    return u && r && *u == *r;
}

bool Value::operator==(const Value& other) const {
    if (isNumber() || other.isNumber()) return isNumber() && other.isNumber() && numbersEqual(*this, other);
    if (kind_ != other.kind_) return false;
    if (holdsNode() && scalar_.node == other.scalar_.node) return true;
    switch (kind_) {
        case ValueKind::Null:
            return true;
        case ValueKind::Date:
            return scalar_.r == other.scalar_.r;
        case ValueKind::String:
            return *getString() == *other.getString();
        case ValueKind::Data: {
            auto a = dataBytes(), b = other.dataBytes();
            return a.size() == b.size() && std::equal(a.begin(), a.end(), b.begin());
        }
        case ValueKind::Uuid:
            return *getUuid() == *other.getUuid();
        case ValueKind::Array: {
            auto a = items(), b = other.items();
            return a.size() == b.size() && std::equal(a.begin(), a.end(), b.begin());
        }
        case ValueKind::Dictionary: {
            auto a = entries(), b = other.entries();
            if (a.size() != b.size()) return false;
            for (size_t i = 0; i < a.size(); ++i)
                if (a[i].key != b[i].key || !(a[i].value == b[i].value)) return false;
            return true;
        }
        default:
            return false;
    }
}

static size_t mix(size_t seed, size_t h) { return seed ^ (h + 0x9e3779b97f4a7c15ULL + (seed << 6) + (seed >> 2)); }

size_t Value::hash() const {
    if (isNumber()) {
        // Equal numbers of different kinds must hash alike: integral values hash as integers.
        if (auto i = numberAsInt64()) return std::hash<int64_t>{}(*i);
        if (auto u = numberAsUInt64()) return mix(1, std::hash<uint64_t>{}(*u));
        double d = scalar_.r;
        return std::hash<uint64_t>{}(std::bit_cast<uint64_t>(d));
    }
    size_t seed = static_cast<size_t>(kind_) * 0x100000001b3ULL;
    switch (kind_) {
        case ValueKind::Null:
            return seed;
        case ValueKind::Date:
            return mix(seed, std::hash<double>{}(scalar_.r));
        case ValueKind::String:
            return mix(seed, std::hash<std::string>{}(*getString()));
        case ValueKind::Data: {
            auto b = dataBytes();
            return mix(seed, std::hash<std::string_view>{}(
                                 std::string_view(reinterpret_cast<const char*>(b.data()), b.size())));
        }
        case ValueKind::Uuid:
            return mix(seed, std::hash<Uuid>{}(*getUuid()));
        case ValueKind::Array:
            for (const Value& v : items()) seed = mix(seed, v.hash());
            return seed;
        case ValueKind::Dictionary:
            for (const DictionaryEntry& e : entries())
                seed = mix(mix(seed, std::hash<std::string>{}(e.key)), e.value.hash());
            return seed;
        default:
            return seed;
    }
}

bool Value::identical(const Value& other) const {
    if (kind_ != other.kind_) return false;
    if (holdsNode()) return scalar_.node == other.scalar_.node;
    return scalar_.u == other.scalar_.u;
}

// ---- Value: description ----

namespace {
// Appends to `out` until the budget is spent; once spent, every further append is dropped.
class Describer {
  public:
    explicit Describer(size_t limit) : limit_(limit) {}
    bool full() const { return out_.size() >= limit_; }
    void put(std::string_view s) {
        if (full()) return;
        out_.append(s.substr(0, limit_ - out_.size()));
    }
    void value(const Value& v) {
        if (full()) return;
        char buf[64];
        switch (v.kind()) {
            case ValueKind::Null:
                put("null");
                break;
            case ValueKind::Bool:
                put(*v.getBool() ? "true" : "false");
                break;
            case ValueKind::Int64:
                snprintf(buf, sizeof buf, "%lld", static_cast<long long>(*v.getInt64()));
                put(buf);
                break;
            case ValueKind::UInt64:
                snprintf(buf, sizeof buf, "%llu", static_cast<unsigned long long>(*v.getUInt64()));
                put(buf);
                break;
            case ValueKind::Real:
                snprintf(buf, sizeof buf, "%.17g", *v.getReal());
                put(buf);
                break;
            case ValueKind::Date:
                put(v.getDate()->iso8601());
                break;
            case ValueKind::Uuid:
                put(v.getUuid()->string());
                break;
            case ValueKind::String:
                quoted(v.stringView());
                break;
            case ValueKind::Data:
                data(v.dataBytes());
                break;
            case ValueKind::Array: {
                put("[");
                bool first = true;
                for (const Value& item : v.items()) {
                    if (full()) break;
                    if (!first) put(", ");
                    first = false;
                    value(item);
                }
                put("]");
                break;
            }
            case ValueKind::Dictionary: {
                put("{");
                bool first = true;
                for (const DictionaryEntry& e : v.entries()) {
                    if (full()) break;
                    if (!first) put(", ");
                    first = false;
                    quoted(e.key);
                    put(": ");
                    value(e.value);
                }
                put("}");
                break;
            }
        }
    }
    std::string finish(bool truncatedMarker) {
        if (truncatedMarker && full()) out_ += "... (truncated)";
        return std::move(out_);
    }

  private:
    void quoted(std::string_view s) {
        put("\"");
        for (char c : s) {
            if (full()) return;
            switch (c) {
                case '"':
                    put("\\\"");
                    break;
                case '\\':
                    put("\\\\");
                    break;
                case '\n':
                    put("\\n");
                    break;
                case '\t':
                    put("\\t");
                    break;
                case '\r':
                    put("\\r");
                    break;
                default:
                    if (static_cast<unsigned char>(c) < 0x20) {
                        char buf[8];
                        snprintf(buf, sizeof buf, "\\u%04x", static_cast<unsigned char>(c));
                        put(buf);
                    } else {
                        char one[1] = {c};
                        put(std::string_view(one, 1));
                    }
            }
        }
        put("\"");
    }
    void data(std::span<const uint8_t> bytes) {
        static constexpr char kHex[] = "0123456789abcdef";
        put("<");
        for (uint8_t b : bytes) {
            if (full()) return;
            char two[2] = {kHex[b >> 4], kHex[b & 0xF]};
            put(std::string_view(two, 2));
        }
        put(">");
    }

    size_t limit_;
    std::string out_;
};
}  // namespace

std::string Value::description(size_t limit) const {
    Describer d(limit);
    d.value(*this);
    return d.finish(true);
}

// ---- Builders ----

MutableDictionary::MutableDictionary(const Value& dictionary) {
    auto e = dictionary.entries();
    entries_.assign(e.begin(), e.end());
}

void MutableDictionary::set(std::string_view key, Value value) {
    // Keys that come in ascending order (a decoder reading its input, a builder fed from sorted data) go straight to
    // the end, with one comparison instead of a search.
    if (entries_.empty() || std::string_view(entries_.back().key) < key) {
        entries_.push_back(DictionaryEntry{std::string(key), std::move(value)});
        return;
    }
    auto it = std::lower_bound(entries_.begin(), entries_.end(), key,
                               [](const DictionaryEntry& e, std::string_view k) { return e.key < k; });
    if (it != entries_.end() && it->key == key)
        it->value = std::move(value);
    else
        entries_.insert(it, DictionaryEntry{std::string(key), std::move(value)});
}

void MutableDictionary::remove(std::string_view key) {
    auto it = std::lower_bound(entries_.begin(), entries_.end(), key,
                               [](const DictionaryEntry& e, std::string_view k) { return e.key < k; });
    if (it != entries_.end() && it->key == key) entries_.erase(it);
}

const Value* MutableDictionary::find(std::string_view key) const {
    const DictionaryEntry* e = findEntry(entries_, key);
    return e ? &e->value : nullptr;
}

Value MutableDictionary::value() const { return Value(ValueKind::Dictionary, DictionaryNode::copy(entries_)); }
Value MutableDictionary::take() {
    Value v(ValueKind::Dictionary, DictionaryNode::make(std::move(entries_)));
    entries_.clear();
    return v;
}

MutableArray::MutableArray(const Value& array) {
    auto i = array.items();
    items_.assign(i.begin(), i.end());
}
void MutableArray::append(Value value) { items_.push_back(std::move(value)); }
Value MutableArray::value() const { return Value(ValueKind::Array, ArrayNode::copy(items_)); }
Value MutableArray::take() {
    Value v(ValueKind::Array, ArrayNode::make(std::move(items_)));
    items_.clear();
    return v;
}

}  // namespace bexil

size_t std::hash<bexil::Uuid>::operator()(const bexil::Uuid& u) const noexcept {
    uint64_t a, b;
    std::memcpy(&a, u.bytes().data(), 8);
    std::memcpy(&b, u.bytes().data() + 8, 8);
    return std::hash<uint64_t>{}(a ^ (b * 0x9e3779b97f4a7c15ULL));
}
