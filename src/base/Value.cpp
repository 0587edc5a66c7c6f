#include "base/Value.h"

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
#include <stdexcept>

#include "base/Text.h"

namespace bexil {

// Scalars live inline in the Value; everything else lives in a reference-counted node that is never edited after
// it has been built, which is what makes sharing across threads safe without locks.
namespace detail {
struct Node {
    std::atomic<uint32_t> refs{1};
    virtual ~Node() = default;
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
struct ArrayNode final : Node {
    explicit ArrayNode(std::vector<Value> v) : items(std::move(v)) {}
    std::vector<Value> items;
};
struct DictionaryNode final : Node {
    explicit DictionaryNode(std::vector<DictionaryEntry> e) : entries(std::move(e)) {}
    std::vector<DictionaryEntry> entries;
};
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

// ---- Uuid ----

Uuid Uuid::random() {
    std::array<uint8_t, 16> b{};
    size_t got = 0;
    while (got < b.size()) {
        ssize_t n = getrandom(b.data() + got, b.size() - got, 0);
        if (n < 0) {
            if (errno == EINTR) continue;
            throw std::runtime_error("getrandom failed");
        }
        got += static_cast<size_t>(n);
    }
    b[6] = static_cast<uint8_t>((b[6] & 0x0F) | 0x40);  // version 4
    b[8] = static_cast<uint8_t>((b[8] & 0x3F) | 0x80);  // RFC 4122 variant
    return Uuid(b);
}

std::optional<Uuid> Uuid::parse(std::string_view text) {
    if (text.size() != kTextLength) return std::nullopt;
    std::array<uint8_t, 16> b{};
    size_t byte = 0;
    for (size_t i = 0; i < text.size();) {
        if (i == 8 || i == 13 || i == 18 || i == 23) {
            if (text[i] != '-') return std::nullopt;
            ++i;
            continue;
        }
        int hi = hexDigitValue(text[i]);
        int lo = hexDigitValue(text[i + 1]);
        if (hi < 0 || lo < 0) return std::nullopt;
        b[byte++] = static_cast<uint8_t>(hi << 4 | lo);
        i += 2;
    }
    return Uuid(b);
}

std::string Uuid::string() const {
    static constexpr char kHex[] = "0123456789ABCDEF";
    std::string out;
    out.reserve(kTextLength);
    for (size_t i = 0; i < bytes_.size(); ++i) {
        if (i == 4 || i == 6 || i == 8 || i == 10) out.push_back('-');
        out.push_back(kHex[bytes_[i] >> 4]);
        out.push_back(kHex[bytes_[i] & 0xF]);
    }
    return out;
}

bool Uuid::isNil() const {
    return std::all_of(bytes_.begin(), bytes_.end(), [](uint8_t b) { return b == 0; });
}

// ---- Date ----

Date Date::now() {
    auto since = std::chrono::system_clock::now().time_since_epoch();
    return Date{std::chrono::duration<double>(since).count()};
}

std::string Date::iso8601() const {
    double whole = std::floor(secondsSince1970);
    double fraction = secondsSince1970 - whole;
    time_t t = static_cast<time_t>(whole);
    struct tm tm {};
    char buf[64];
    if (!std::isfinite(secondsSince1970) || gmtime_r(&t, &tm) == nullptr) return "invalid-date";
    size_t n = strftime(buf, sizeof buf, "%Y-%m-%dT%H:%M:%S", &tm);
    std::string out(buf, n);
    if (fraction > 0) {
        // Microseconds are the finest step the text keeps; trailing zeros are dropped.
        long micros = std::lround(fraction * 1e6);
        if (micros >= 1000000) micros = 999999;
        if (micros > 0) {
            char f[16];
            snprintf(f, sizeof f, ".%06ld", micros);
            std::string fs(f);
            while (fs.back() == '0') fs.pop_back();
            out += fs;
        }
    }
    out += 'Z';
    return out;
}

static bool readDigits(std::string_view s, size_t pos, size_t count, int& out) {
    if (pos + count > s.size()) return false;
    int v = 0;
    for (size_t i = pos; i < pos + count; ++i) {
        if (s[i] < '0' || s[i] > '9') return false;
        v = v * 10 + (s[i] - '0');
    }
    out = v;
    return true;
}

std::optional<Date> Date::parseIso8601(std::string_view s) {
    // YYYY-MM-DDTHH:MM:SS[.f+]Z
    int year, month, day, hour, minute, second;
    if (s.size() < 20) return std::nullopt;
    if (!readDigits(s, 0, 4, year) || s[4] != '-' || !readDigits(s, 5, 2, month) || s[7] != '-' ||
        !readDigits(s, 8, 2, day) || s[10] != 'T' || !readDigits(s, 11, 2, hour) || s[13] != ':' ||
        !readDigits(s, 14, 2, minute) || s[16] != ':' || !readDigits(s, 17, 2, second))
        return std::nullopt;
    size_t pos = 19;
    double fraction = 0;
    if (s[pos] == '.') {
        ++pos;
        double scale = 0.1;
        size_t start = pos;
        while (pos < s.size() && s[pos] >= '0' && s[pos] <= '9') {
            fraction += (s[pos] - '0') * scale;
            scale /= 10;
            ++pos;
        }
        if (pos == start) return std::nullopt;
    }
    if (pos != s.size() - 1 || s[pos] != 'Z') return std::nullopt;
    if (month < 1 || month > 12 || day < 1 || hour > 23 || minute > 59 || second > 60) return std::nullopt;
    static constexpr int kDaysInMonth[] = {31, 28, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31};
    bool leap = (year % 4 == 0 && year % 100 != 0) || year % 400 == 0;
    int maxDay = kDaysInMonth[month - 1] + (month == 2 && leap ? 1 : 0);
    if (day > maxDay) return std::nullopt;
    // Days from civil (proleptic Gregorian), so no time-zone state is involved.
    int y = year - (month <= 2 ? 1 : 0);
    int era = (y >= 0 ? y : y - 399) / 400;
    int yoe = y - era * 400;
    int mp = (month + 9) % 12;
    int doy = (153 * mp + 2) / 5 + day - 1;
    int doe = yoe * 365 + yoe / 4 - yoe / 100 + doy;
    int64_t days = static_cast<int64_t>(era) * 146097 + doe - 719468;
    double secs = static_cast<double>(days * 86400 + hour * 3600 + minute * 60 + second) + fraction;
    return Date{secs};
}

// ---- Value: lifetime ----

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
        if (scalar_.node->refs.fetch_sub(1, std::memory_order_acq_rel) == 1) delete scalar_.node;
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
Value Value::array(std::vector<Value> items) { return Value(ValueKind::Array, new ArrayNode(std::move(items))); }

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
    return Value(ValueKind::Dictionary, new DictionaryNode(std::move(unique)));
}

Value Value::emptyDictionary() { return Value(ValueKind::Dictionary, new DictionaryNode({})); }
Value Value::emptyArray() { return Value(ValueKind::Array, new ArrayNode({})); }

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
    return static_cast<const ArrayNode*>(scalar_.node)->items;
}

std::span<const DictionaryEntry> Value::entries() const {
    if (kind_ != ValueKind::Dictionary) return {};
    return static_cast<const DictionaryNode*>(scalar_.node)->entries;
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

Value MutableDictionary::value() const { return Value(ValueKind::Dictionary, new DictionaryNode(entries_)); }
Value MutableDictionary::take() {
    Value v(ValueKind::Dictionary, new DictionaryNode(std::move(entries_)));
    entries_.clear();
    return v;
}

MutableArray::MutableArray(const Value& array) {
    auto i = array.items();
    items_.assign(i.begin(), i.end());
}
void MutableArray::append(Value value) { items_.push_back(std::move(value)); }
Value MutableArray::value() const { return Value(ValueKind::Array, new ArrayNode(items_)); }
Value MutableArray::take() {
    Value v(ValueKind::Array, new ArrayNode(std::move(items_)));
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
