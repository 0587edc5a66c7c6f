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
