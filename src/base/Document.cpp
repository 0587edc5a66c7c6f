#include "base/Document.h"

// The document codec. Reading goes through pugixml, which parses without recursion; the conversion of its tree into
// a Value recurses once per container and stops at kMaxDocumentDepth. Before pugixml sees the text, the whole buffer
// is checked to be UTF-8 made of characters XML 1.0 allows, character references included, because pugixml would
// otherwise decode "&#0;" into a silent truncation and out-of-range references into invalid UTF-8.
//
// Writing does not use pugixml: it writes a raw carriage return, which XML's end-of-line handling turns into a line
// feed on reading, and it writes control characters as references that XML 1.0 forbids. The writer here escapes
// carriage returns, refuses what XML cannot carry, and checks for every real and date that the text it chose parses
// back to the very same double, so that nothing it writes reads back different.

#include <fcntl.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <bit>
#include <cerrno>
#include <charconv>
#include <cmath>
#include <cstring>
#include <limits>
#include <pugixml.hpp>
#include <unordered_set>
#include <variant>
#include <vector>

#include "base/Text.h"

namespace bexil {

namespace {

constexpr std::string_view kRootName = "vrec";
constexpr std::string_view kFormatVersion = "1";
constexpr size_t kSnippetLength = 40;

Error documentError(int code, std::string message) {
    return Error(std::string(BXDocumentErrorDomain), code, std::move(message));
}

// "<operation> "<path>": <strerror>", in the POSIX domain.
Error fileError(int err, std::string_view operation, const std::filesystem::path& path) {
    return posixError(err, std::string(operation) + " \"" + path.string() + "\"");
}

// A short, printable excerpt of text for an error message.
std::string snippet(std::string_view text) {
    std::string out;
    size_t length = std::min(text.size(), kSnippetLength);
    // Never cut a UTF-8 sequence in half: messages end up in logs that expect valid text.
    while (length > 0 && length < text.size() && (static_cast<unsigned char>(text[length]) & 0xC0) == 0x80) --length;
    for (size_t i = 0; i < length; ++i) {
        unsigned char c = static_cast<unsigned char>(text[i]);
        if (c < 0x20 || c == 0x7F || c == '"' || c == '\\') {
            char buf[8];
            snprintf(buf, sizeof buf, "\\x%02X", c);
            out += buf;
        } else {
            out += static_cast<char>(c);
        }
    }
    if (length < text.size()) out += "...";
    return "\"" + out + "\"";
}

// One step from a container to a value in it, kept cheap while all goes well and spelled out only for errors.
struct PathStep {
    std::string_view key;  // the dictionary key, when index is npos
    size_t index = std::string_view::npos;
};

std::string pathText(const std::vector<PathStep>& steps) {
    std::string out = "root";
    for (const PathStep& step : steps) {
        if (step.index != std::string_view::npos) {
            out += "[" + std::to_string(step.index) + "]";
        } else {
            out += "[" + snippet(step.key) + "]";
        }
    }
    return out;
}

bool isXmlWhitespace(char c) { return c == ' ' || c == '\t' || c == '\n' || c == '\r'; }

std::string_view trimmed(std::string_view s) {
    while (!s.empty() && isXmlWhitespace(s.front())) s.remove_prefix(1);
    while (!s.empty() && isXmlWhitespace(s.back())) s.remove_suffix(1);
    return s;
}

bool isXmlChar(uint32_t c) {
    return c == 0x9 || c == 0xA || c == 0xD || (c >= 0x20 && c <= 0xD7FF) || (c >= 0xE000 && c <= 0xFFFD) ||
           (c >= 0x10000 && c <= 0x10FFFF);
}

// Where text stops being UTF-8 made of XML characters.
struct TextFault {
    size_t offset;
    bool invalidUtf8;
    uint32_t character;  // when the encoding is fine but the character is not allowed

    std::string describe() const {
        if (invalidUtf8) return "invalid UTF-8";
        char buf[48];
        snprintf(buf, sizeof buf, "character U+%04X, which XML 1.0 cannot carry,", character);
        return buf;
    }
};

std::optional<TextFault> findTextFault(std::string_view s) {
    const auto* p = reinterpret_cast<const unsigned char*>(s.data());
    size_t n = s.size();
    size_t i = 0;
    while (i < n) {
        std::optional<Utf8Sequence> sequence = decodeUtf8(p + i, n - i);
        if (!sequence) return TextFault{i, true, 0};
        if (!isXmlChar(sequence->codePoint)) return TextFault{i, false, sequence->codePoint};
        i += sequence->length;
    }
    return std::nullopt;
}

// Character references decode to what they name; each must name an XML character. This mirrors which references
// pugixml decodes ("&#" decimal ";" and "&#x" hex ";"); anything else it leaves as literal text.
std::optional<Error> checkCharacterReferences(std::string_view text) {
    for (size_t at = text.find("&#"); at != std::string_view::npos; at = text.find("&#", at + 2)) {
        size_t i = at + 2;
        bool hex = i < text.size() && text[i] == 'x';
        if (hex) ++i;
        uint64_t code = 0;
        size_t digits = 0;
        for (; i < text.size(); ++i) {
            char c = text[i];
            int d = hex ? hexDigitValue(c) : (c >= '0' && c <= '9' ? c - '0' : -1);
            if (d < 0) break;
            code = code * (hex ? 16 : 10) + static_cast<uint64_t>(d);
            if (code > 0x10FFFF) code = 0x110000;  // saturate: only "too large" matters
            ++digits;
        }
        if (digits == 0 || i >= text.size() || text[i] != ';') continue;  // literal text, not a reference
        if (!isXmlChar(static_cast<uint32_t>(code))) {
            return documentError(kDocumentMalformed, "character reference " + snippet(text.substr(at, i + 1 - at)) +
                                                         " names a character XML 1.0 cannot carry (byte " +
                                                         std::to_string(at) + ")");
        }
    }
    return std::nullopt;
}

// The base64 text of a <data> element, or the reason it is not base64.
std::variant<std::vector<uint8_t>, std::string> decodeDataText(std::string_view text) {
    auto decoded = decodeBase64(text);
    if (auto* bytes = std::get_if<std::vector<uint8_t>>(&decoded)) return std::move(*bytes);
    const Base64Fault& fault = std::get<Base64Fault>(decoded);
    switch (fault.kind) {
        case Base64Fault::Kind::MisplacedPadding:
            return std::string("misplaced '=' padding");
        case Base64Fault::Kind::NotBase64:
            return "character " + snippet(std::string_view(&fault.character, 1)) + " is not base64";
        case Base64Fault::Kind::TextAfterPadding:
            return std::string("text after '=' padding");
        case Base64Fault::Kind::IncompleteGroup:
            break;
    }
    return std::string("length is not a multiple of four (missing '=' padding?)");
}

// ---- reals and integers ----

std::optional<double> parseReal(std::string_view s) {
    if (s == "inf") return std::numeric_limits<double>::infinity();
    if (s == "-inf") return -std::numeric_limits<double>::infinity();
    if (s == "nan") return std::numeric_limits<double>::quiet_NaN();
    // from_chars also takes "infinity" and "nan(...)"; the document form spells those only one way.
    if (s.empty() || !std::all_of(s.begin(), s.end(), [](char c) {
            return (c >= '0' && c <= '9') || c == '.' || c == '-' || c == '+' || c == 'e' || c == 'E';
        }))
        return std::nullopt;
    double d;
    auto [end, ec] = std::from_chars(s.data(), s.data() + s.size(), d);
    if (ec != std::errc() || end != s.data() + s.size()) return std::nullopt;
    return d;
}

void appendReal(std::string& out, double d) {
    if (std::isnan(d)) {
        out += "nan";
    } else if (std::isinf(d)) {
        out += d < 0 ? "-inf" : "inf";
    } else {
        char buf[64];
        auto r = std::to_chars(buf, buf + sizeof buf, d);
        out.append(buf, r.ptr);
    }
}

// ---- reading ----

class Reader {
  public:
    explicit Reader(std::string_view text) : text_(text) {}

    Result<Value> run() {
        if (text_.size() > kMaxDocumentBytes) {
            return documentError(kDocumentLimitExceeded, "document of " + std::to_string(text_.size()) +
                                                             " bytes is larger than the limit of " +
                                                             std::to_string(kMaxDocumentBytes));
        }
        std::string_view body = text_;
        if (body.substr(0, 3) == "\xEF\xBB\xBF") body.remove_prefix(3);
        if (auto fault = findTextFault(body)) {
            size_t offset = fault->offset + (text_.size() - body.size());
            return documentError(kDocumentMalformed,
                                 fault->describe() + " in the text (byte " + std::to_string(offset) + ")");
        }
        if (auto error = checkCharacterReferences(text_)) return *error;

        // Fragment mode keeps text outside the root element, so that trailing garbage can be seen and refused.
        unsigned options = pugi::parse_default | pugi::parse_ws_pcdata | pugi::parse_fragment;
        pugi::xml_parse_result parsed = document_.load_buffer(text_.data(), text_.size(), options, pugi::encoding_utf8);
        if (!parsed) {
            return documentError(kDocumentMalformed, std::string("malformed XML: ") + parsed.description() + " (byte " +
                                                         std::to_string(parsed.offset) + ")");
        }

        pugi::xml_node root;
        for (pugi::xml_node node : document_.children()) {
            if (node.type() == pugi::node_element) {
                if (root) return fail(node, "a second element <" + std::string(node.name()) + "> after the root");
                root = node;
            } else if (isText(node) && !trimmed(node.value()).empty()) {
                return fail(node, "text " + snippet(trimmed(node.value())) + " outside the root element");
            }
        }
        if (!root) return documentError(kDocumentMalformed, "no root element");
        if (root.name() != kRootName) {
            return fail(root, "unknown root element <" + std::string(root.name()) + ">, expected <vrec>");
        }
        for (pugi::xml_attribute attribute : root.attributes()) {
            if (std::string_view(attribute.name()) != "version")
                return fail(root, "unknown attribute \"" + std::string(attribute.name()) + "\" on <vrec>");
            if (attribute.value() != kFormatVersion)
                return fail(root, "unsupported document version " + snippet(attribute.value()));
        }
        if (std::distance(root.attributes_begin(), root.attributes_end()) > 1)
            return fail(root, "more than one version attribute on <vrec>");

        pugi::xml_node valueNode;
        for (pugi::xml_node node : root.children()) {
            if (node.type() == pugi::node_element) {
                if (valueNode) return fail(node, "more than one value in <vrec>");
                valueNode = node;
            } else if (isText(node) && !trimmed(node.value()).empty()) {
                return fail(node, "text " + snippet(trimmed(node.value())) + " in <vrec>");
            }
        }
        if (!valueNode) return fail(root, "<vrec> holds no value");
        std::optional<Value> value = readValue(valueNode, 0);
        if (!value) return *error_;
        return std::move(*value);
    }

  private:
    static bool isText(pugi::xml_node node) {
        return node.type() == pugi::node_pcdata || node.type() == pugi::node_cdata;
    }

    Error fail(pugi::xml_node node, const std::string& what) {
        std::string message = what;
        if (!path_.empty()) message += " at " + pathText(path_);
        ptrdiff_t offset = node.offset_debug();
        // pugixml points at an element's name; the message points at its '<'.
        if (node.type() == pugi::node_element && offset > 0) --offset;
        if (offset >= 0) message += " (byte " + std::to_string(offset) + ")";
        return documentError(kDocumentMalformed, message);
    }

    std::nullopt_t failValue(pugi::xml_node node, const std::string& what, int code = kDocumentMalformed) {
        Error e = fail(node, what);
        error_ = Error(e.domain(), code, e.localizedDescription());
        return std::nullopt;
    }

    // The character data of a scalar element; any child element is an error.
    std::optional<std::string> textOf(pugi::xml_node node) {
        std::string out;
        for (pugi::xml_node child : node.children()) {
            if (child.type() == pugi::node_element) {
                failValue(child, "element <" + std::string(child.name()) + "> inside <" + node.name() + ">");
                return std::nullopt;
            }
            if (isText(child)) out += child.value();
        }
        if (auto fault = findTextFault(out)) {
            failValue(node, fault->describe() + " in <" + std::string(node.name()) + ">");
            return std::nullopt;
        }
        return out;
    }

    // The element children of a container; non-blank text between them is an error.
    bool elementsOf(pugi::xml_node node, std::vector<pugi::xml_node>& out) {
        for (pugi::xml_node child : node.children()) {
            if (child.type() == pugi::node_element) {
                out.push_back(child);
            } else if (isText(child) && !trimmed(child.value()).empty()) {
                failValue(child, "text " + snippet(trimmed(child.value())) + " inside <" + node.name() + ">");
                return false;
            }
        }
        return true;
    }

    // `depth` counts the containers that enclose this node.
    std::optional<Value> readValue(pugi::xml_node node, size_t depth) {
        if (node.first_attribute())
            return failValue(node, "unexpected attribute \"" + std::string(node.first_attribute().name()) + "\" on <" +
                                       node.name() + ">");
        std::string_view name = node.name();
        if (name == "dict" || name == "array") {
            if (depth + 1 > kMaxDocumentDepth)
                return failValue(node, "containers nested deeper than " + std::to_string(kMaxDocumentDepth),
                                 kDocumentLimitExceeded);
            return name == "dict" ? readDictionary(node, depth + 1) : readArray(node, depth + 1);
        }
        if (name == "true" || name == "false" || name == "null") {
            auto text = textOf(node);
            if (!text) return std::nullopt;
            if (!trimmed(*text).empty()) return failValue(node, "<" + std::string(name) + "> must be empty");
            if (name == "null") return Value::null();
            return Value::boolean(name == "true");
        }
        if (name == "key") return failValue(node, "a <key> outside a <dict>");
        if (name != "string" && name != "integer" && name != "real" && name != "date" && name != "data")
            return failValue(node, "unknown element <" + std::string(name) + ">");

        auto text = textOf(node);
        if (!text) return std::nullopt;
        if (name == "string") return Value::string(std::move(*text));
        if (name == "data") {
            auto bytes = decodeDataText(*text);
            if (auto* problem = std::get_if<std::string>(&bytes))
                return failValue(node, "bad base64 data: " + *problem);
            return Value::data(std::move(std::get<std::vector<uint8_t>>(bytes)));
        }
        std::string_view s = trimmed(*text);
        if (name == "integer") return readInteger(node, s);
        if (name == "real") {
            auto d = parseReal(s);
            if (!d) return failValue(node, "bad real " + snippet(s));
            return Value::real(*d);
        }
        auto date = Date::fromIso8601(s);
        if (!date) return failValue(node, "bad date " + snippet(s) + ", expected YYYY-MM-DDTHH:MM:SS[.fraction]Z");
        // A fraction can round a date past 9999-12-31T23:59:59Z; only dates that can be written again are read.
        if (!date->exactIso8601()) return failValue(node, "date " + snippet(s) + " out of range");
        return Value::date(*date);
    }

    std::optional<Value> readInteger(pugi::xml_node node, std::string_view s) {
        const char* first = s.data();
        const char* last = s.data() + s.size();
        bool digitsOnly = !s.empty() && std::all_of(s[0] == '-' ? first + 1 : first, last,
                                                    [](char c) { return c >= '0' && c <= '9'; });
        if (!digitsOnly || s == "-") return failValue(node, "bad integer " + snippet(s));
        if (s[0] == '-') {
            int64_t i;
            auto [end, ec] = std::from_chars(first, last, i);
            if (ec == std::errc::result_out_of_range) return failValue(node, "integer out of range " + snippet(s));
            if (ec != std::errc() || end != last) return failValue(node, "bad integer " + snippet(s));
            return Value::int64(i);
        }
        uint64_t u;
        auto [end, ec] = std::from_chars(first, last, u);
        if (ec == std::errc::result_out_of_range) return failValue(node, "integer out of range " + snippet(s));
        if (ec != std::errc() || end != last) return failValue(node, "bad integer " + snippet(s));
        if (u <= static_cast<uint64_t>(std::numeric_limits<int64_t>::max()))
            return Value::int64(static_cast<int64_t>(u));
        return Value::uint64(u);
    }

    std::optional<Value> readArray(pugi::xml_node node, size_t depth) {
        std::vector<pugi::xml_node> children;
        if (!elementsOf(node, children)) return std::nullopt;
        std::vector<Value> items;
        items.reserve(children.size());
        for (size_t i = 0; i < children.size(); ++i) {
            path_.push_back(PathStep{{}, i});
            std::optional<Value> item = readValue(children[i], depth);
            path_.pop_back();
            if (!item) return std::nullopt;
            items.push_back(std::move(*item));
        }
        return Value::array(std::move(items));
    }

    std::optional<Value> readDictionary(pugi::xml_node node, size_t depth) {
        std::vector<pugi::xml_node> children;
        if (!elementsOf(node, children)) return std::nullopt;
        std::vector<std::pair<std::string, Value>> entries;
        std::vector<pugi::xml_node> keyNodes;
        entries.reserve(children.size() / 2);
        keyNodes.reserve(children.size() / 2);
        for (size_t i = 0; i < children.size(); i += 2) {
            pugi::xml_node child = children[i];
            if (std::string_view(child.name()) != "key") {
                // Keys and values are taken in pairs, so a value here follows a complete pair or opens the dict.
                if (i == 0) return failValue(child, "a value without a key in <dict>");
                return failValue(child, "two values for key " + snippet(entries.back().first));
            }
            if (child.first_attribute())
                return failValue(
                    child, "unexpected attribute \"" + std::string(child.first_attribute().name()) + "\" on <key>");
            auto key = textOf(child);
            if (!key) return std::nullopt;
            if (i + 1 >= children.size() || std::string_view(children[i + 1].name()) == "key")
                return failValue(child, "key " + snippet(*key) + " without a value");
            path_.push_back(PathStep{*key, std::string_view::npos});
            std::optional<Value> value = readValue(children[i + 1], depth);
            path_.pop_back();
            if (!value) return std::nullopt;
            entries.emplace_back(std::move(*key), std::move(*value));
            keyNodes.push_back(child);
        }
        size_t given = entries.size();
        Value dictionary = Value::dictionary(std::move(entries));
        if (dictionary.count() != given) {
            std::unordered_set<std::string> seen;
            for (pugi::xml_node keyNode : keyNodes) {
                std::string key = *textOf(keyNode);
                if (!seen.insert(key).second) return failValue(keyNode, "duplicate key " + snippet(key));
            }
        }
        return dictionary;
    }

    std::string_view text_;
    pugi::xml_document document_;
    std::vector<PathStep> path_;
    std::optional<Error> error_;
};

// ---- writing ----

class Writer {
  public:
    Result<std::string> run(const Value& value) {
        out_ = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<vrec version=\"1\">\n";
        if (!writeValue(value, 0)) return *error_;
        out_ += "</vrec>\n";
        if (out_.size() > kMaxDocumentBytes) return tooLarge();
        return std::move(out_);
    }

  private:
    bool fail(int code, const std::string& what) {
        std::string message = what;
        message += " at " + pathText(path_);
        error_ = documentError(code, message);
        return false;
    }

    Error tooLarge() {
        return documentError(kDocumentLimitExceeded,
                             "document larger than the limit of " + std::to_string(kMaxDocumentBytes) + " bytes");
    }

    void indent(size_t depth) { out_.append(depth, '\t'); }

    bool appendEscaped(std::string_view s, const char* what) {
        if (auto fault = findTextFault(s)) {
            return fail(kDocumentUnrepresentable, std::string(what) + " with " + fault->describe() + " at byte " +
                                                      std::to_string(fault->offset) + " of " + snippet(s));
        }
        size_t start = 0;
        for (size_t i = 0; i < s.size(); ++i) {
            const char* replacement;
            switch (s[i]) {
                case '&':
                    replacement = "&amp;";
                    break;
                case '<':
                    replacement = "&lt;";
                    break;
                case '>':
                    replacement = "&gt;";
                    break;
                case '\r':
                    replacement = "&#13;";
                    break;
                default:
                    continue;
            }
            out_.append(s.substr(start, i - start));
            out_ += replacement;
            start = i + 1;
        }
        out_.append(s.substr(start));
        return true;
    }

    void element(const char* name, std::string_view content) {
        out_ += '<';
        out_ += name;
        out_ += '>';
        out_ += content;
        out_ += "</";
        out_ += name;
        out_ += ">\n";
    }

    bool writeValue(const Value& value, size_t depth) {
        if (out_.size() > kMaxDocumentBytes) {
            error_ = tooLarge();
            return false;
        }
        indent(depth);
        switch (value.kind()) {
            case ValueKind::Null:
                out_ += "<null/>\n";
                return true;
            case ValueKind::Bool:
                out_ += *value.getBool() ? "<true/>\n" : "<false/>\n";
                return true;
            case ValueKind::Int64:
                element("integer", std::to_string(*value.getInt64()));
                return true;
            case ValueKind::UInt64:
                element("integer", std::to_string(*value.getUInt64()));
                return true;
            case ValueKind::Real: {
                std::string text;
                appendReal(text, *value.getReal());
                element("real", text);
                return true;
            }
            case ValueKind::String:
                out_ += "<string>";
                if (!appendEscaped(value.stringView(), "a string")) return false;
                out_ += "</string>\n";
                return true;
            case ValueKind::Data: {
                // Known before encoding: a blob that cannot fit is refused without building its text.
                if (out_.size() + (value.dataBytes().size() + 2) / 3 * 4 > kMaxDocumentBytes) {
                    error_ = tooLarge();
                    return false;
                }
                out_ += "<data>";
                appendBase64(out_, value.dataBytes());
                out_ += "</data>\n";
                return true;
            }
            case ValueKind::Date: {
                auto text = value.getDate()->exactIso8601();
                if (!text) {
                    return fail(kDocumentUnrepresentable, "a date outside the years 0000-9999 (" +
                                                              std::to_string(value.getDate()->secondsSince1970) +
                                                              " seconds since 1970)");
                }
                element("date", *text);
                return true;
            }
            case ValueKind::Uuid:
                return fail(kDocumentUnrepresentable,
                            "a uuid (" + value.getUuid()->string() + "), which a document cannot represent,");
            case ValueKind::Array:
            case ValueKind::Dictionary:
                break;
        }
        const char* name = value.isArray() ? "array" : "dict";
        if (depth + 1 > kMaxDocumentDepth)
            return fail(kDocumentLimitExceeded, "containers nested deeper than " + std::to_string(kMaxDocumentDepth));
        if (value.count() == 0) {
            out_ += '<';
            out_ += name;
            out_ += "/>\n";
            return true;
        }
        out_ += '<';
        out_ += name;
        out_ += ">\n";
        if (value.isArray()) {
            size_t index = 0;
            for (const Value& item : value.items()) {
                path_.push_back(PathStep{{}, index++});
                bool ok = writeValue(item, depth + 1);
                path_.pop_back();
                if (!ok) return false;
            }
        } else {
            for (const DictionaryEntry& entry : value.entries()) {
                path_.push_back(PathStep{entry.key, std::string_view::npos});
                indent(depth + 1);
                out_ += "<key>";
                bool ok = appendEscaped(entry.key, "a key");
                if (ok) {
                    out_ += "</key>\n";
                    ok = writeValue(entry.value, depth + 1);
                }
                path_.pop_back();
                if (!ok) return false;
            }
        }
        indent(depth);
        out_ += "</";
        out_ += name;
        out_ += ">\n";
        return true;
    }

    std::string out_;
    std::vector<PathStep> path_;
    std::optional<Error> error_;
};

}  // namespace

// ---- Document ----

Result<Value> Document::read(std::string_view text) { return Reader(text).run(); }

Result<std::string> Document::write(const Value& value) { return Writer().run(value); }

Result<Value> Document::readFile(const std::filesystem::path& path) {
    int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return fileError(errno, "open", path);
    std::string text;
    struct stat info {};
    if (::fstat(fd, &info) == 0 && S_ISREG(info.st_mode) && static_cast<uint64_t>(info.st_size) <= kMaxDocumentBytes)
        text.reserve(static_cast<size_t>(info.st_size));
    char buffer[65536];
    for (;;) {
        ssize_t n = ::read(fd, buffer, sizeof buffer);
        if (n < 0) {
            if (errno == EINTR) continue;
            int err = errno;
            ::close(fd);
            return fileError(err, "read", path);
        }
        if (n == 0) break;
        text.append(buffer, static_cast<size_t>(n));
        if (text.size() > kMaxDocumentBytes) {
            ::close(fd);
            return documentError(kDocumentLimitExceeded, path.string() + ": document larger than the limit of " +
                                                             std::to_string(kMaxDocumentBytes) + " bytes");
        }
    }
    ::close(fd);
    Result<Value> value = read(text);
    if (!value.ok()) {
        const Error& e = value.error();
        return Error(e.domain(), e.code(), path.string() + ": " + e.localizedDescription().value_or(""));
    }
    return value;
}

std::optional<Error> Document::writeFileAtomically(const std::filesystem::path& path, const Value& value,
                                                   FileSystem& fs) {
    Result<std::string> text = write(value);
    if (!text.ok()) return text.error();

    return replaceFileAtomically(path, *text, 0666, Durability::Synced, fs);
}

}  // namespace bexil
