#include "base/Document.h"

// The document writer. It does not use pugixml, which would write a raw carriage return (that XML's end-of-line
// handling turns into a line feed on reading) and control characters as references that XML 1.0 forbids. This one
// escapes carriage returns, refuses what XML cannot carry, and checks for every real and date that the text it
// chose parses back to the very same double, so that nothing it writes reads back different.

#include <algorithm>
#include <array>
#include <bit>
#include <cerrno>
#include <charconv>
#include <cmath>
#include <cstring>
#include <limits>
#include <unordered_set>
#include <variant>
#include <vector>

#include "base/DocumentSyntax.h"
#include "base/PosixError.h"
#include "base/Text.h"
#include "bexil/Date.h"

namespace bexil {

using namespace document_detail;

namespace {

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
        return writeContainer(value, depth);
    }

    // An array or a dictionary, its opening tag already indented.
    bool writeContainer(const Value& value, size_t depth) {
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

Result<std::string> Document::write(const Value& value) { return Writer().run(value); }

std::optional<Error> Document::writeFileAtomically(const std::filesystem::path& path, const Value& value,
                                                   FileSystem& fs) {
    Result<std::string> text = write(value);
    if (!text.ok()) return text.error();

    return replaceFileAtomically(path, *text, 0666, Durability::Synced, fs);
}

}  // namespace bexil
