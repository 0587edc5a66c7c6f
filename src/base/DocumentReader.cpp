#include "base/Document.h"

// The document reader. It goes through pugixml, which parses without recursion; the conversion of its tree into
// a Value recurses once per container and stops at kMaxDocumentDepth. Before pugixml sees the text, the whole buffer
// is checked to be UTF-8 made of characters XML 1.0 allows, character references included, because pugixml would
// otherwise decode "&#0;" into a silent truncation and out-of-range references into invalid UTF-8.

#include <fcntl.h>
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

#include "base/DocumentSyntax.h"
#include "base/PosixError.h"
#include "base/Text.h"
#include "base/UniqueFd.h"
#include "bexil/Date.h"

namespace bexil {

using namespace document_detail;

namespace {

// "<operation> "<path>": <strerror>", in the POSIX domain.
Error fileError(int err, std::string_view operation, const std::filesystem::path& path) {
    return posixError(err, std::string(operation) + " \"" + path.string() + "\"");
}

class Reader {
  public:
    Reader(std::string_view text, const Document::StringMaker* makeString) : text_(text), makeString_(makeString) {}

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
        if (name == "string") return makeString_ ? (*makeString_)(std::move(*text)) : Value::string(std::move(*text));
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
    const Document::StringMaker* makeString_;
    pugi::xml_document document_;
    std::vector<PathStep> path_;
    std::optional<Error> error_;
};

}  // namespace

Result<Value> Document::read(std::string_view text) { return Reader(text, nullptr).run(); }
Result<Value> Document::read(std::string_view text, const StringMaker& makeString) {
    return Reader(text, &makeString).run();
}

Result<Value> Document::readFile(const std::filesystem::path& path) {
    // Not blocking, so that opening a pipe returns at once; for a regular file the flag changes nothing.
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK));
    if (!fd) return fileError(errno, "open", path);
    return readOpenFile(fd.get(), path);
}

Result<Value> Document::readOpenFile(int fd, const std::filesystem::path& path) {
    std::string text;
    struct stat info {};
    if (::fstat(fd, &info) != 0 || !S_ISREG(info.st_mode))
        return Error(std::string(BXPosixErrorDomain), EINVAL, "read \"" + path.string() + "\": not a regular file");
    if (static_cast<uint64_t>(info.st_size) <= kMaxDocumentBytes) text.reserve(static_cast<size_t>(info.st_size));
    char buffer[65536];
    for (;;) {
        ssize_t n = ::read(fd, buffer, sizeof buffer);
        if (n < 0) {
            if (errno == EINTR) continue;
            return fileError(errno, "read", path);
        }
        if (n == 0) break;
        text.append(buffer, static_cast<size_t>(n));
        if (text.size() > kMaxDocumentBytes)
            return documentError(kDocumentLimitExceeded, path.string() + ": document larger than the limit of " +
                                                             std::to_string(kMaxDocumentBytes) + " bytes");
    }
    Result<Value> value = read(text);
    if (!value.ok()) {
        const Error& e = value.error();
        return Error(e.domain(), e.code(), path.string() + ": " + e.localizedDescription().value_or(""));
    }
    return value;
}

}  // namespace bexil
