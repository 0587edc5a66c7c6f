#include "JsonText.h"

#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "base/Text.h"

namespace bexil::tool {

namespace {

class Parser {
  public:
    explicit Parser(std::string_view text) : text_(text) {}

    Result<Value> document() {
        Value value;
        if (!parseValue(value, 0)) return failure();
        skipSpace();
        if (pos_ != text_.size()) {
            error_ = "unexpected text after the value";
            return failure();
        }
        return value;
    }

  private:
    Error failure() const {
        size_t line = 1;
        for (size_t i = 0; i < pos_ && i < text_.size(); ++i)
            if (text_[i] == '\n') ++line;
        return BXError(ErrorCode::InvalidRequest, "JSON line " + std::to_string(line) + ": " + error_);
    }

    void skipSpace() {
        while (pos_ < text_.size() &&
               (text_[pos_] == ' ' || text_[pos_] == '\t' || text_[pos_] == '\n' || text_[pos_] == '\r'))
            ++pos_;
    }

    bool literal(std::string_view word) {
        if (text_.substr(pos_, word.size()) != word) return false;
        pos_ += word.size();
        return true;
    }

    bool parseValue(Value& out, int depth) {
        if (depth > kMaxJsonDepth) {
            error_ = "nested too deeply";
            return false;
        }
        skipSpace();
        if (pos_ >= text_.size()) {
            error_ = "unexpected end of text";
            return false;
        }
        char c = text_[pos_];
        if (c == '{') return parseObject(out, depth);
        if (c == '[') return parseArray(out, depth);
        if (c == '"') {
            std::string s;
            if (!parseString(s)) return false;
            out = Value::string(std::move(s));
            return true;
        }
        if (literal("true")) return out = Value::boolean(true), true;
        if (literal("false")) return out = Value::boolean(false), true;
        if (literal("null")) return out = Value::null(), true;
        if (c == '-' || (c >= '0' && c <= '9')) return parseNumber(out);
        error_ = std::string("unexpected character '") + c + "'";
        return false;
    }

    bool parseObject(Value& out, int depth) {
        ++pos_;
        MutableDictionary dictionary;
        skipSpace();
        if (pos_ < text_.size() && text_[pos_] == '}') {
            ++pos_;
            out = dictionary.take();
            return true;
        }
        for (;;) {
            skipSpace();
            std::string key;
            if (pos_ >= text_.size() || text_[pos_] != '"') {
                error_ = "expected a key in double quotes";
                return false;
            }
            if (!parseString(key)) return false;
            skipSpace();
            if (pos_ >= text_.size() || text_[pos_] != ':') {
                error_ = "expected ':' after a key";
                return false;
            }
            ++pos_;
            Value value;
            if (!parseValue(value, depth + 1)) return false;
            if (dictionary.find(key) != nullptr) {
                error_ = "key \"" + key + "\" given twice";
                return false;
            }
            dictionary.set(key, std::move(value));
            skipSpace();
            if (pos_ < text_.size() && text_[pos_] == ',') {
                ++pos_;
                continue;
            }
            if (pos_ < text_.size() && text_[pos_] == '}') {
                ++pos_;
                out = dictionary.take();
                return true;
            }
            error_ = "expected ',' or '}'";
            return false;
        }
    }

    bool parseArray(Value& out, int depth) {
        ++pos_;
        MutableArray array;
        skipSpace();
        if (pos_ < text_.size() && text_[pos_] == ']') {
            ++pos_;
            out = array.take();
            return true;
        }
        for (;;) {
            Value value;
            if (!parseValue(value, depth + 1)) return false;
            array.append(std::move(value));
            skipSpace();
            if (pos_ < text_.size() && text_[pos_] == ',') {
                ++pos_;
                continue;
            }
            if (pos_ < text_.size() && text_[pos_] == ']') {
                ++pos_;
                out = array.take();
                return true;
            }
            error_ = "expected ',' or ']'";
            return false;
        }
    }

    bool hex4(uint32_t& out) {
        if (pos_ + 4 > text_.size()) {
            error_ = "truncated \\u escape";
            return false;
        }
        out = 0;
        for (int i = 0; i < 4; ++i) {
            int digit = hexDigitValue(text_[pos_++]);
            if (digit < 0) {
                error_ = "bad \\u escape";
                return false;
            }
            out = (out << 4) | static_cast<uint32_t>(digit);
        }
        return true;
    }

    bool parseString(std::string& out) {
        const size_t start = ++pos_;
        while (pos_ < text_.size()) {
            char c = text_[pos_++];
            if (c == '"') return wellFormed(start, pos_ - 1);
            if (static_cast<unsigned char>(c) < 0x20) {
                error_ = "control character in a string";
                return false;
            }
            if (c != '\\') {
                out += c;
                continue;
            }
            if (pos_ >= text_.size()) break;
            char e = text_[pos_++];
            switch (e) {
                case '"':
                    out += '"';
                    break;
                case '\\':
                    out += '\\';
                    break;
                case '/':
                    out += '/';
                    break;
                case 'b':
                    out += '\b';
                    break;
                case 'f':
                    out += '\f';
                    break;
                case 'n':
                    out += '\n';
                    break;
                case 'r':
                    out += '\r';
                    break;
                case 't':
                    out += '\t';
                    break;
                case 'u': {
                    uint32_t cp = 0;
                    if (!hex4(cp)) return false;
                    if (cp >= 0xD800 && cp <= 0xDBFF) {
                        uint32_t low = 0;
                        if (!literal("\\u") || !hex4(low) || low < 0xDC00 || low > 0xDFFF) {
                            error_ = "unpaired surrogate in \\u escape";
                            return false;
                        }
                        cp = 0x10000 + ((cp - 0xD800) << 10) + (low - 0xDC00);
                    } else if (cp >= 0xDC00 && cp <= 0xDFFF) {
                        error_ = "unpaired surrogate in \\u escape";
                        return false;
                    }
                    appendUtf8(out, cp);
                    break;
                }
                default:
                    error_ = std::string("bad escape \\") + e;
                    return false;
            }
        }
        error_ = "unterminated string";
        return false;
    }

    // Refuses a string whose bytes between `start` and `end` are not UTF-8 here, where the line can be named: the
    // escapes are ASCII and what \u makes is well formed, so the raw bytes decide. Without this the text would
    // reach the encoder and fail there, far from the file that holds it.
    bool wellFormed(size_t start, size_t end) {
        size_t bad = firstInvalidUtf8(text_.substr(start, end - start));
        if (bad == kWellFormedUtf8) return true;
        pos_ = start + bad;
        char byte[8];
        std::snprintf(byte, sizeof byte, "0x%02x", static_cast<unsigned char>(text_[pos_]));
        error_ = std::string("string is not UTF-8 (bad byte ") + byte + ")";
        return false;
    }

    bool parseNumber(Value& out) {
        size_t start = pos_;
        bool real = false;
        if (text_[pos_] == '-') ++pos_;
        while (pos_ < text_.size()) {
            char c = text_[pos_];
            if (c >= '0' && c <= '9') {
                ++pos_;
            } else if (c == '.' || c == 'e' || c == 'E' || c == '+' || c == '-') {
                real = true;
                ++pos_;
            } else {
                break;
            }
        }
        std::string number(text_.substr(start, pos_ - start));
        char* end = nullptr;
        errno = 0;
        if (!real) {
            if (number[0] == '-') {
                long long v = std::strtoll(number.c_str(), &end, 10);
                if (errno == 0 && end && *end == '\0') return out = Value::int64(v), true;
            } else {
                unsigned long long v = std::strtoull(number.c_str(), &end, 10);
                if (errno == 0 && end && *end == '\0') {
                    out = v <= static_cast<unsigned long long>(INT64_MAX) ? Value::int64(static_cast<int64_t>(v))
                                                                          : Value::uint64(v);
                    return true;
                }
            }
            errno = 0;
        }
        double d = std::strtod(number.c_str(), &end);
        if (end == nullptr || *end != '\0' || number == "-" || !std::isfinite(d)) {
            error_ = "malformed number " + number;
            return false;
        }
        out = Value::real(d);
        return true;
    }

    std::string_view text_;
    size_t pos_ = 0;
    std::string error_;
};

void writeString(std::string& out, std::string_view s) {
    out += '"';
    for (unsigned char c : s) {
        switch (c) {
            case '"':
                out += "\\\"";
                break;
            case '\\':
                out += "\\\\";
                break;
            case '\n':
                out += "\\n";
                break;
            case '\r':
                out += "\\r";
                break;
            case '\t':
                out += "\\t";
                break;
            default:
                if (c < 0x20) {
                    char buffer[8];
                    std::snprintf(buffer, sizeof buffer, "\\u%04x", c);
                    out += buffer;
                } else {
                    out += static_cast<char>(c);
                }
        }
    }
    out += '"';
}

void write(std::string& out, const Value& value, JsonLayout layout, int indent) {
    auto newline = [&](int level) {
        if (layout == JsonLayout::OneLine) return;
        out += '\n';
        out.append(static_cast<size_t>(level) * 2, ' ');
    };
    switch (value.kind()) {
        case ValueKind::Null:
            out += "null";
            break;
        case ValueKind::Bool:
            out += *value.getBool() ? "true" : "false";
            break;
        case ValueKind::Int64:
            out += std::to_string(*value.getInt64());
            break;
        case ValueKind::UInt64:
            out += std::to_string(*value.getUInt64());
            break;
        case ValueKind::Real: {
            double d = *value.getReal();
            if (!std::isfinite(d)) {
                out += "null";
            } else {
                char buffer[32];
                std::snprintf(buffer, sizeof buffer, "%.17g", d);
                out += buffer;
            }
            break;
        }
        case ValueKind::String:
            writeString(out, value.stringView());
            break;
        case ValueKind::Data:
            writeString(out, base64(value.dataBytes()));
            break;
        case ValueKind::Date:
            writeString(out, value.getDate()->iso8601());
            break;
        case ValueKind::Uuid:
            writeString(out, value.getUuid()->string());
            break;
        case ValueKind::Array: {
            if (value.count() == 0) {
                out += "[]";
                break;
            }
            out += '[';
            bool first = true;
            for (const Value& item : value.items()) {
                if (!first) out += ',';
                first = false;
                newline(indent + 1);
                write(out, item, layout, indent + 1);
            }
            newline(indent);
            out += ']';
            break;
        }
        case ValueKind::Dictionary: {
            if (value.count() == 0) {
                out += "{}";
                break;
            }
            out += '{';
            bool first = true;
            for (const DictionaryEntry& entry : value.entries()) {
                if (!first) out += ',';
                first = false;
                newline(indent + 1);
                writeString(out, entry.key);
                out += layout == JsonLayout::Pretty ? ": " : ":";
                write(out, entry.value, layout, indent + 1);
            }
            newline(indent);
            out += '}';
            break;
        }
    }
}

}  // namespace

Result<Value> parseJson(std::string_view text) { return Parser(text).document(); }

std::string toJson(const Value& value, JsonLayout layout) {
    std::string out;
    write(out, value, layout, 0);
    return out;
}

}  // namespace bexil::tool
