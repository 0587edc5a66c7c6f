#include "base/Text.h"

#include <cstring>

namespace bexil {

std::optional<Utf8Sequence> decodeUtf8(const uint8_t* p, size_t n) {
    uint8_t c = p[0];
    if (c < 0x80) return Utf8Sequence{c, 1};
    size_t length;
    uint32_t codePoint, smallest;
    if ((c & 0xE0) == 0xC0) {
        length = 2, codePoint = c & 0x1F, smallest = 0x80;
    } else if ((c & 0xF0) == 0xE0) {
        length = 3, codePoint = c & 0x0F, smallest = 0x800;
    } else if ((c & 0xF8) == 0xF0) {
        length = 4, codePoint = c & 0x07, smallest = 0x10000;
    } else {
        return std::nullopt;
    }
    if (n < length) return std::nullopt;
    for (size_t k = 1; k < length; ++k) {
        if ((p[k] & 0xC0) != 0x80) return std::nullopt;
        codePoint = (codePoint << 6) | (p[k] & 0x3F);
    }
    if (codePoint < smallest || codePoint > 0x10FFFF || (codePoint >= 0xD800 && codePoint <= 0xDFFF))
        return std::nullopt;
    return Utf8Sequence{codePoint, length};
}

size_t firstInvalidUtf8(const uint8_t* p, size_t n) {
    size_t i = 0;
    while (i < n) {
        // Most text is ASCII: eight bytes at a time while none has its high bit set.
        if (n - i >= 8) {
            uint64_t word;
            std::memcpy(&word, p + i, 8);
            if ((word & 0x8080808080808080ULL) == 0) {
                i += 8;
                continue;
            }
        }
        if (p[i] < 0x80) {
            ++i;
            continue;
        }
        std::optional<Utf8Sequence> sequence = decodeUtf8(p + i, n - i);
        if (!sequence) return i;
        i += sequence->length;
    }
    return kWellFormedUtf8;
}

size_t firstInvalidUtf8(std::string_view text) {
    return firstInvalidUtf8(reinterpret_cast<const uint8_t*>(text.data()), text.size());
}

std::string quotedForMessage(std::string_view text, size_t limit) {
    static constexpr char kHex[] = "0123456789abcdef";
    const auto* bytes = reinterpret_cast<const uint8_t*>(text.data());
    std::string out = "\"";
    size_t i = 0;
    while (i < text.size()) {
        uint8_t c = bytes[i];
        std::optional<Utf8Sequence> sequence = c >= 0x80 ? decodeUtf8(bytes + i, text.size() - i) : std::nullopt;
        size_t length = sequence ? sequence->length : 1;
        if (i + length > limit) break;
        if (sequence) {
            out.append(text.substr(i, length));
        } else if (c < 0x20 || c >= 0x7F || c == '"' || c == '\\') {
            out += "\\x";
            out += kHex[c >> 4];
            out += kHex[c & 0xF];
        } else {
            out += static_cast<char>(c);
        }
        i += length;
    }
    if (i < text.size()) out += "...";
    out += '"';
    return out;
}

void appendUtf8(std::string& out, uint32_t codePoint) {
    if (codePoint < 0x80) {
        out += static_cast<char>(codePoint);
    } else if (codePoint < 0x800) {
        out += static_cast<char>(0xC0 | (codePoint >> 6));
        out += static_cast<char>(0x80 | (codePoint & 0x3F));
    } else if (codePoint < 0x10000) {
        out += static_cast<char>(0xE0 | (codePoint >> 12));
        out += static_cast<char>(0x80 | ((codePoint >> 6) & 0x3F));
        out += static_cast<char>(0x80 | (codePoint & 0x3F));
    } else {
        out += static_cast<char>(0xF0 | (codePoint >> 18));
        out += static_cast<char>(0x80 | ((codePoint >> 12) & 0x3F));
        out += static_cast<char>(0x80 | ((codePoint >> 6) & 0x3F));
        out += static_cast<char>(0x80 | (codePoint & 0x3F));
    }
}

namespace {

constexpr char kBase64Alphabet[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

int base64Digit(char c) {
    if (c >= 'A' && c <= 'Z') return c - 'A';
    if (c >= 'a' && c <= 'z') return c - 'a' + 26;
    if (c >= '0' && c <= '9') return c - '0' + 52;
    if (c == '+') return 62;
    if (c == '/') return 63;
    return -1;
}

bool isSpace(char c) { return c == ' ' || c == '\t' || c == '\n' || c == '\r'; }

}  // namespace

void appendBase64(std::string& out, std::span<const uint8_t> bytes) {
    size_t i = 0;
    for (; i + 3 <= bytes.size(); i += 3) {
        uint32_t v = uint32_t(bytes[i]) << 16 | uint32_t(bytes[i + 1]) << 8 | bytes[i + 2];
        out += kBase64Alphabet[v >> 18];
        out += kBase64Alphabet[(v >> 12) & 63];
        out += kBase64Alphabet[(v >> 6) & 63];
        out += kBase64Alphabet[v & 63];
    }
    size_t rest = bytes.size() - i;
    if (rest > 0) {
        uint32_t v = uint32_t(bytes[i]) << 16 | (rest == 2 ? uint32_t(bytes[i + 1]) << 8 : 0);
        out += kBase64Alphabet[v >> 18];
        out += kBase64Alphabet[(v >> 12) & 63];
        out += rest == 2 ? kBase64Alphabet[(v >> 6) & 63] : '=';
        out += '=';
    }
}

std::string base64(std::span<const uint8_t> bytes) {
    std::string out;
    out.reserve((bytes.size() + 2) / 3 * 4);
    appendBase64(out, bytes);
    return out;
}

std::variant<std::vector<uint8_t>, Base64Fault> decodeBase64(std::string_view text) {
    using Kind = Base64Fault::Kind;
    std::vector<uint8_t> out;
    out.reserve(text.size() / 4 * 3);
    uint32_t quad = 0;
    int count = 0;    // digits in the current group of four
    int padding = 0;  // '=' seen so far; only more '=' and white space may follow
    for (char c : text) {
        if (isSpace(c)) continue;
        if (c == '=') {
            if (count < 2) return Base64Fault{Kind::MisplacedPadding};
            ++padding;
            ++count;
            if (count == 4) {
                if (padding == 2) {
                    out.push_back(static_cast<uint8_t>(quad >> 4));
                } else {
                    out.push_back(static_cast<uint8_t>(quad >> 10));
                    out.push_back(static_cast<uint8_t>(quad >> 2));
                }
                count = 0;
            }
            continue;
        }
        int d = base64Digit(c);
        if (d < 0) return Base64Fault{Kind::NotBase64, c};
        if (padding > 0) return Base64Fault{Kind::TextAfterPadding};
        quad = (quad << 6) | static_cast<uint32_t>(d);
        if (++count == 4) {
            out.push_back(static_cast<uint8_t>(quad >> 16));
            out.push_back(static_cast<uint8_t>(quad >> 8));
            out.push_back(static_cast<uint8_t>(quad));
            quad = 0;
            count = 0;
        }
    }
    if (count != 0) return Base64Fault{Kind::IncompleteGroup};
    return out;
}

std::optional<std::string> pathOfFileURL(std::string_view text) {
    constexpr std::string_view kScheme = "file://", kLocalHost = "localhost";
    if (!text.starts_with(kScheme)) return std::nullopt;
    std::string_view rest = text.substr(kScheme.size());
    if (rest.starts_with(kLocalHost)) rest.remove_prefix(kLocalHost.size());
    if (rest.empty() || rest.front() != '/') return std::nullopt;
    std::string path;
    path.reserve(rest.size());
    for (size_t i = 0; i < rest.size(); ++i) {
        int high = -1, low = -1;
        if (rest[i] == '%' && i + 2 < rest.size() && (high = hexDigitValue(rest[i + 1])) >= 0 &&
            (low = hexDigitValue(rest[i + 2])) >= 0) {
            path.push_back(static_cast<char>(high * 16 + low));
            i += 2;
        } else {
            path.push_back(rest[i]);
        }
    }
    return path;
}

}  // namespace bexil
