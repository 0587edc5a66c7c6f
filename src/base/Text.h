#pragma once

// Small pieces of text handling that every layer needs and that must agree everywhere: hexadecimal digits, UTF-8
// (reading, checking and writing) and local file URLs. Pure functions; any thread.

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

namespace bexil {

// The value of a hexadecimal digit (either case), or -1 for any other character.
constexpr int hexDigitValue(char c) {
    if (c >= '0' && c <= '9') return c - '0';
    if (c >= 'a' && c <= 'f') return c - 'a' + 10;
    if (c >= 'A' && c <= 'F') return c - 'A' + 10;
    return -1;
}

// One UTF-8 sequence: the code point it encodes and its length in bytes (1 to 4).
struct Utf8Sequence {
    uint32_t codePoint;
    size_t length;
};

// The sequence that starts at `p` (with `n` bytes available, n > 0), or none when the bytes there are not
// well-formed UTF-8: a stray continuation byte or a byte that never starts a sequence, a sequence cut short by the
// end or by a byte that does not continue it, an overlong form, a surrogate (U+D800 to U+DFFF) or a code point
// above U+10FFFF.
std::optional<Utf8Sequence> decodeUtf8(const uint8_t* p, size_t n);

// What firstInvalidUtf8 answers for well-formed text.
inline constexpr size_t kWellFormedUtf8 = SIZE_MAX;
// The offset of the first byte where the text stops being well-formed UTF-8, or kWellFormedUtf8. U+0000 is allowed.
size_t firstInvalidUtf8(const uint8_t* p, size_t n);
size_t firstInvalidUtf8(std::string_view text);

// Appends the UTF-8 form of `codePoint` (which must be at most U+10FFFF and not a surrogate).
void appendUtf8(std::string& out, uint32_t codePoint);

// Text from outside (a key, a path, a document excerpt) made safe for a message or a log line, in double quotes:
// control bytes, DEL, '"', '\\' and bytes that are not well-formed UTF-8 as \xNN (lower-case hexadecimal),
// well-formed UTF-8 as it is. At most `limit` bytes of the text are shown, never cutting a sequence in half, and
// "..." before the closing quote says that it was cut.
std::string quotedForMessage(std::string_view text, size_t limit = SIZE_MAX);

// Appends the base64 form of `bytes` (standard alphabet, "=" padding, no line breaks).
void appendBase64(std::string& out, std::span<const uint8_t> bytes);
std::string base64(std::span<const uint8_t> bytes);

// Why a text is not base64.
struct Base64Fault {
    enum class Kind { MisplacedPadding, NotBase64, TextAfterPadding, IncompleteGroup } kind;
    char character = 0;  // the offending character, for NotBase64
};
// The bytes of base64 text (standard alphabet; spaces, tabs and line breaks anywhere are skipped; every group of
// four complete, "=" padding only at the end of the last), or the first fault.
std::variant<std::vector<uint8_t>, Base64Fault> decodeBase64(std::string_view text);

// The path that a local file URL names: "file://", optionally "localhost", then an absolute path whose %XX escapes
// are decoded ("file:///a%20b" -> "/a b", "file://localhost/x" -> "/x"); a "%" not followed by two hexadecimal
// digits stays as it is. None when `text` is not such a URL (another scheme, another host, a relative path).
std::optional<std::string> pathOfFileURL(std::string_view text);

}  // namespace bexil
