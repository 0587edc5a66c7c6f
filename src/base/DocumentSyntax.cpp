#include "base/DocumentSyntax.h"

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

#include "base/Document.h"
#include "base/DocumentSyntax.h"
#include "base/PosixError.h"
#include "base/Text.h"
#include "bexil/Date.h"

namespace bexil::document_detail {

Error documentError(int code, std::string message) {
    return Error(std::string(BXDocumentErrorDomain), code, std::move(message));
}

std::string snippet(std::string_view text) { return quotedForMessage(text, kSnippetLength); }

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

std::string TextFault::describe() const {
    if (invalidUtf8) return "invalid UTF-8";
    char buf[48];
    snprintf(buf, sizeof buf, "character U+%04X, which XML 1.0 cannot carry,", character);
    return buf;
}

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

}  // namespace bexil::document_detail
