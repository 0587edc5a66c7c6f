#include "client/JsonText.h"

#include <algorithm>
#include <cstddef>
#include <cstdio>
#include <iterator>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <vector>

#include "base/Text.h"

namespace bexil {

namespace {

using nlohmann::json;
using nlohmann::ordered_json;

// "line L, column C" of the byte at `offset` (both counted from 1, columns in bytes).
std::string where(std::string_view text, size_t offset) {
    offset = std::min(offset, text.size());
    size_t line = 1, lineStart = 0;
    for (size_t i = 0; i < offset; ++i) {
        if (text[i] == '\n') {
            ++line;
            lineStart = i + 1;
        }
    }
    return "line " + std::to_string(line) + ", column " + std::to_string(offset - lineStart + 1);
}

Error malformed(std::string_view text, size_t offset, const std::string& what) {
    return BXError(ErrorCode::InvalidRequest, "JSON " + where(text, offset) + ": " + what);
}

// The library's message without its own prefix and position (ours replace them) and without the text it had
// read, which can be long, and can end inside a UTF-8 sequence.
std::string describe(const json::exception& error) {
    std::string what = error.what();
    if (size_t end = what.find("] "); end != std::string::npos) what.erase(0, end + 2);
    if (what.starts_with("parse error")) {
        if (size_t colon = what.find(": "); colon != std::string::npos) what.erase(0, colon + 2);
    }
    if (what.starts_with("syntax error")) {
        if (size_t dash = what.find(" - "); dash != std::string::npos) what.erase(0, dash + 3);
    }
    if (size_t read = what.find("; last read: '"); read != std::string::npos) {
        size_t expected = what.rfind("'; expected ");
        what.erase(read, expected != std::string::npos && expected > read ? expected + 1 - read : std::string::npos);
    }
    return what;
}

// Hands the parser one byte at a time and remembers how far it has read, so that what the builder refuses (a key
// given twice, nesting too deep) is placed like the parser's own errors.
class Cursor {
  public:
    using iterator_category = std::input_iterator_tag;
    using value_type = char;
    using difference_type = std::ptrdiff_t;
    using pointer = const char*;
    using reference = const char&;

    Cursor(const char* at, const char** read) : at_(at), read_(read) {}
    reference operator*() const { return *at_; }
    Cursor& operator++() {
        *read_ = ++at_;
        return *this;
    }
    bool operator==(const Cursor& other) const { return at_ == other.at_; }

  private:
    const char* at_;
    const char** read_;
};

// Builds the Value as the parser reports what it reads, on a stack of its own rather than by recursion.
class Builder {
  public:
    Builder(std::string_view text, const char** read) : text_(text), read_(read) {}

    bool null() { return add(Value::null()); }
    bool boolean(bool b) { return add(Value::boolean(b)); }
    bool number_integer(json::number_integer_t i) { return add(Value::int64(i)); }
    bool number_unsigned(json::number_unsigned_t u) {
        return add(u <= static_cast<uint64_t>(INT64_MAX) ? Value::int64(static_cast<int64_t>(u)) : Value::uint64(u));
    }
    bool number_float(json::number_float_t d, const json::string_t&) { return add(Value::real(d)); }
    bool string(json::string_t& s) { return add(Value::string(std::move(s))); }
    // JSON text has no binary values: the parser never reports one.
    bool binary(json::binary_t&) { return false; }

    bool start_object(size_t) { return open(true); }
    bool key(json::string_t& key) {
        Frame& frame = stack_.back();
        if (frame.dictionary.find(key) != nullptr) return refuse("key \"" + key + "\" given twice");
        frame.key = std::move(key);
        return true;
    }
    bool end_object() {
        Value dictionary = stack_.back().dictionary.take();
        stack_.pop_back();
        return add(std::move(dictionary));
    }
    bool start_array(size_t) { return open(false); }
    bool end_array() {
        Value array = stack_.back().array.take();
        stack_.pop_back();
        return add(std::move(array));
    }

    bool parse_error(size_t position, const std::string&, const json::exception& error) {
        // `position` counts the byte the parser stopped at.
        error_ = malformed(text_, position > 0 ? position - 1 : 0, describe(error));
        return false;
    }

    Result<Value> result() {
        if (error_) return *error_;
        return std::move(root_);
    }

  private:
    struct Frame {
        bool isDictionary;
        MutableDictionary dictionary;
        MutableArray array;
        std::string key;
    };

    bool open(bool isDictionary) {
        if (stack_.size() >= static_cast<size_t>(kMaxJsonDepth))
            return refuse("nested more than " + std::to_string(kMaxJsonDepth) + " deep");
        stack_.push_back(Frame{isDictionary, {}, {}, {}});
        return true;
    }

    bool add(Value value) {
        if (stack_.empty()) {
            root_ = std::move(value);
        } else if (stack_.back().isDictionary) {
            stack_.back().dictionary.set(stack_.back().key, std::move(value));
        } else {
            stack_.back().array.append(std::move(value));
        }
        return true;
    }

    // Stops the parse at the last byte read, which ended the key or opened the container refused.
    bool refuse(const std::string& what) {
        size_t read = static_cast<size_t>(*read_ - text_.data());
        error_ = malformed(text_, read > 0 ? read - 1 : 0, what);
        return false;
    }

    std::string_view text_;
    const char** read_;
    std::vector<Frame> stack_;
    Value root_;
    std::optional<Error> error_;
};

ordered_json toLibrary(const Value& value) {
    switch (value.kind()) {
        case ValueKind::Null:
            return nullptr;
        case ValueKind::Bool:
            return *value.getBool();
        case ValueKind::Int64:
            return *value.getInt64();
        case ValueKind::UInt64:
            return *value.getUInt64();
        case ValueKind::Real:
            return *value.getReal();  // written as null when not finite
        case ValueKind::String:
            return value.stringView();
        case ValueKind::Data:
            return base64(value.dataBytes());
        case ValueKind::Date:
            return value.getDate()->iso8601();
        case ValueKind::Uuid:
            return value.getUuid()->string();
        case ValueKind::Array: {
            ordered_json array = ordered_json::array();
            auto& items = array.get_ref<ordered_json::array_t&>();
            items.reserve(value.count());
            for (const Value& item : value.items()) items.push_back(toLibrary(item));
            return array;
        }
        case ValueKind::Dictionary: {
            // Appended as they come: the entries are the Value's, unique and in its order.
            ordered_json dictionary = ordered_json::object();
            auto& members = dictionary.get_ref<ordered_json::object_t&>();
            members.reserve(value.count());
            for (const DictionaryEntry& entry : value.entries())
                members.emplace_back(entry.key, toLibrary(entry.value));
            return dictionary;
        }
    }
    return nullptr;
}

}  // namespace

Result<Value> parseJson(std::string_view text) {
    // Checked over the whole text first, so that the error names the byte; the library would refuse it too, but
    // quoting the raw text around it.
    if (size_t bad = firstInvalidUtf8(text); bad != kWellFormedUtf8) {
        char byte[8];
        std::snprintf(byte, sizeof byte, "0x%02x", static_cast<unsigned char>(text[bad]));
        return malformed(text, bad, std::string("text is not UTF-8 (bad byte ") + byte + ")");
    }
    const char* read = text.data();
    Builder builder(text, &read);
    json::sax_parse(Cursor(text.data(), &read), Cursor(text.data() + text.size(), &read), &builder);
    return builder.result();
}

std::string toJson(const Value& value, JsonLayout layout) {
    // Text that is not UTF-8 cannot be JSON; it is written with U+FFFD in place of the bad bytes.
    return toLibrary(value).dump(layout == JsonLayout::Pretty ? 2 : -1, ' ', false,
                                 ordered_json::error_handler_t::replace);
}

}  // namespace bexil
