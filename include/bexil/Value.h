#pragma once

// Value is the one data type of the system: the property-list value that records and stores hold, and the typed
// dictionary that travels over the wire. A Value is immutable and shared: copying one bumps a reference count and
// never copies its contents, so any thread may read and copy Values freely. New dictionaries and arrays are made
// with MutableDictionary and MutableArray, which build a fresh Value and never touch the ones they started from.

#include <array>
#include <atomic>
#include <compare>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "bexil/Date.h"
#include "bexil/Uuid.h"

namespace bexil {

enum class ValueKind : uint8_t { Null, Bool, Int64, UInt64, Real, String, Data, Date, Uuid, Array, Dictionary };

// The name of a kind as it appears in error messages ("dictionary", "uint64", ...).
const char* valueKindName(ValueKind kind);

namespace detail {
struct Node;
}

class Value;

// One entry of a dictionary (defined below Value). Keys are UTF-8 strings; entries are kept sorted by key bytes.
struct DictionaryEntry;

class Value {
  public:
    // Longest text description() returns by default; longer values end in a truncation marker.
    static constexpr size_t kDescriptionLimit = 4096;

    Value() noexcept : kind_(ValueKind::Null) { scalar_.u = 0; }
    Value(const Value& other) noexcept;
    Value(Value&& other) noexcept;
    Value& operator=(const Value& other) noexcept;
    Value& operator=(Value&& other) noexcept;
    ~Value();

    static Value null() { return Value(); }
    static Value boolean(bool b);
    static Value int64(int64_t i);
    static Value uint64(uint64_t u);
    static Value real(double d);
    static Value string(std::string_view s);
    static Value string(std::string&& s);
    static Value string(const char* s) { return string(std::string_view(s)); }
    static Value data(std::span<const uint8_t> bytes);
    static Value data(std::vector<uint8_t>&& bytes);
    static Value date(Date d);
    static Value uuid(const Uuid& u);
    static Value array(std::vector<Value> items);
    // Later duplicates of a key replace earlier ones.
    static Value dictionary(std::vector<std::pair<std::string, Value>> entries);
    static Value emptyDictionary();
    static Value emptyArray();

    ValueKind kind() const { return kind_; }
    bool isNull() const { return kind_ == ValueKind::Null; }
    bool isBool() const { return kind_ == ValueKind::Bool; }
    bool isString() const { return kind_ == ValueKind::String; }
    bool isData() const { return kind_ == ValueKind::Data; }
    bool isDate() const { return kind_ == ValueKind::Date; }
    bool isUuid() const { return kind_ == ValueKind::Uuid; }
    bool isArray() const { return kind_ == ValueKind::Array; }
    bool isDictionary() const { return kind_ == ValueKind::Dictionary; }
    // Bool, Int64, UInt64 and Real are the numeric kinds.
    bool isNumber() const;

    // Strict accessors: a value only of exactly that kind, otherwise none / empty.
    std::optional<bool> getBool() const;
    std::optional<int64_t> getInt64() const;
    std::optional<uint64_t> getUInt64() const;
    std::optional<double> getReal() const;
    std::optional<Date> getDate() const;
    const Uuid* getUuid() const;
    const std::string* getString() const;
    // The string's bytes, or an empty view when this is not a string.
    std::string_view stringView() const;
    std::span<const uint8_t> dataBytes() const;

    // Numeric conversions across Bool, Int64, UInt64 and Real; none when not a number or out of range
    // (a real converts to an integer only when it has no fraction).
    std::optional<int64_t> numberAsInt64() const;
    std::optional<uint64_t> numberAsUInt64() const;
    std::optional<double> numberAsDouble() const;

    // Arrays: the items, or an empty span when this is not an array.
    std::span<const Value> items() const;
    // Dictionaries: the entries in key order, or an empty span when this is not a dictionary.
    std::span<const DictionaryEntry> entries() const;
    // Number of items or entries; 0 for scalars.
    size_t count() const;
    // Dictionary look-up in O(log n); null when absent or when this is not a dictionary.
    const Value* find(std::string_view key) const;
    // Like find, but yields a null Value when absent.
    Value get(std::string_view key) const;
    bool contains(std::string_view key) const { return find(key) != nullptr; }

    // Equality: numbers compare by value across kinds (true == 1, 2.0 == 2), never equal to non-numbers;
    // strings, data, dates and UUIDs by content; arrays and dictionaries element by element.
    bool operator==(const Value& other) const;
    // Consistent with ==: values that compare equal hash equally.
    size_t hash() const;
    // True when both share the same storage (or are the same scalar).
    bool identical(const Value& other) const;

    // A readable rendering for logs and probes, at most `limit` bytes plus a short truncation marker.
    std::string description(size_t limit = kDescriptionLimit) const;

  private:
    friend class MutableDictionary;
    friend class MutableArray;

    Value(ValueKind kind, detail::Node* node) noexcept : kind_(kind) { scalar_.node = node; }
    // Dates are stored inline like numbers; every later kind lives in a shared node.
    bool holdsNode() const { return kind_ >= ValueKind::String && kind_ != ValueKind::Date; }
    void retain() const noexcept;
    void release() noexcept;

    ValueKind kind_;
    union {
        bool b;
        int64_t i;
        uint64_t u;
        double r;
        detail::Node* node;
    } scalar_;
};

struct DictionaryEntry {
    std::string key;
    Value value;
};

struct ValueHash {
    size_t operator()(const Value& v) const { return v.hash(); }
};

// Builds a new dictionary Value. Starting from an existing dictionary shares its values (reference counts only).
class MutableDictionary {
  public:
    MutableDictionary() = default;
    // Copies the entries of `dictionary` (a non-dictionary starts empty).
    explicit MutableDictionary(const Value& dictionary);

    void set(std::string_view key, Value value);
    void remove(std::string_view key);
    const Value* find(std::string_view key) const;
    size_t count() const { return entries_.size(); }
    void reserve(size_t n) { entries_.reserve(n); }

    // The dictionary built so far; the builder stays usable.
    Value value() const;
    // The dictionary built so far, leaving the builder empty (no copies).
    Value take();

  private:
    std::vector<DictionaryEntry> entries_;
};

// Builds a new array Value.
class MutableArray {
  public:
    MutableArray() = default;
    explicit MutableArray(const Value& array);

    void append(Value value);
    size_t count() const { return items_.size(); }
    void reserve(size_t n) { items_.reserve(n); }
    Value value() const;
    Value take();

  private:
    std::vector<Value> items_;
};

}  // namespace bexil

template <>
struct std::hash<bexil::Value> {
    size_t operator()(const bexil::Value& v) const { return v.hash(); }
};
template <>
struct std::hash<bexil::Uuid> {
    size_t operator()(const bexil::Uuid& u) const noexcept;
};
