// The shared text helpers: every class of malformed UTF-8 is found at the right offset (the Zem codec and the
// document reader both rely on it to refuse such text), sequences decode to the right code points at every
// length boundary, and file URLs read the same way for the model and the registry.

#include <gtest/gtest.h>

#include <algorithm>
#include <string>
#include <vector>

#include "base/Text.h"

namespace bexil {
namespace {

size_t firstBad(std::vector<uint8_t> bytes) { return firstInvalidUtf8(bytes.data(), bytes.size()); }

TEST(Utf8, EveryClassOfMalformedSequenceIsFoundWhereItStarts) {
    struct Case {
        const char* what;
        std::vector<uint8_t> bytes;
        size_t offset;
    };
    const Case cases[] = {
        {"stray continuation", {'a', 0x80, 'b'}, 1},
        {"byte that never starts a sequence", {0xFF}, 0},
        {"five-byte lead", {0xF8, 0x88, 0x80, 0x80, 0x80}, 0},
        {"two-byte sequence cut by the end", {'a', 'b', 0xC3}, 2},
        {"four-byte sequence cut by the end", {0xF0, 0x9F, 0x98}, 0},
        {"sequence cut by a non-continuation", {0xE2, 0x82, 'x'}, 0},
        {"overlong two-byte slash", {0xC0, 0xAF}, 0},
        {"overlong two-byte, largest", {0xC1, 0xBF}, 0},
        {"overlong three-byte", {0xE0, 0x9F, 0xBF}, 0},
        {"overlong four-byte", {0xF0, 0x8F, 0xBF, 0xBF}, 0},
        {"first surrogate", {0xED, 0xA0, 0x80}, 0},
        {"last surrogate", {0xED, 0xBF, 0xBF}, 0},
        {"above U+10FFFF", {0xF4, 0x90, 0x80, 0x80}, 0},
        {"largest lead byte", {0xF7, 0xBF, 0xBF, 0xBF}, 0},
        // The ASCII fast path reads eight bytes at a time: a fault right after such a run must still be found.
        {"after eight ASCII bytes", {'0', '1', '2', '3', '4', '5', '6', '7', 0x80}, 8},
        {"inside a second word", {'0', '1', '2', '3', '4', '5', '6', '7', '8', 0xC3, 0x28, 'a', 'b', 'c', 'd', 'e'}, 9},
    };
    for (const Case& c : cases) {
        EXPECT_EQ(firstBad(c.bytes), c.offset) << c.what;
        EXPECT_FALSE(decodeUtf8(c.bytes.data() + c.offset, c.bytes.size() - c.offset)) << c.what;
    }
}

TEST(Utf8, BoundaryCodePointsDecodeAndRoundTrip) {
    for (uint32_t codePoint :
         {0x0u, 0x7Fu, 0x80u, 0x7FFu, 0x800u, 0xD7FFu, 0xE000u, 0xFFFDu, 0xFFFFu, 0x10000u, 0x10FFFFu}) {
        std::string text;
        appendUtf8(text, codePoint);
        const auto* bytes = reinterpret_cast<const uint8_t*>(text.data());
        std::optional<Utf8Sequence> sequence = decodeUtf8(bytes, text.size());
        ASSERT_TRUE(sequence) << std::hex << codePoint;
        EXPECT_EQ(sequence->codePoint, codePoint);
        EXPECT_EQ(sequence->length, text.size());
        EXPECT_EQ(firstInvalidUtf8(text), kWellFormedUtf8);
    }
    EXPECT_EQ(firstInvalidUtf8(std::string_view("\0a\xC3\xA9\xE2\x82\xAC\xF0\x9F\x98\x80", 11)), kWellFormedUtf8);
    EXPECT_EQ(firstInvalidUtf8(std::string_view()), kWellFormedUtf8);
}

// Messages and logs expect valid text on one line: whatever the bytes, the quoted form is well-formed UTF-8 with no
// control characters, and it is cut without splitting a character.
TEST(QuotedForMessage, AnyBytesBecomeOneLineOfValidText) {
    EXPECT_EQ(quotedForMessage("plain"), "\"plain\"");
    EXPECT_EQ(quotedForMessage(std::string_view("a\0b\n\"\\\x7f", 7)), "\"a\\x00b\\x0a\\x22\\x5c\\x7f\"");
    EXPECT_EQ(quotedForMessage("caf\xC3\xA9 \xC3"), "\"caf\xC3\xA9 \\xc3\"")
        << "valid UTF-8 kept, a broken byte escaped";
    EXPECT_EQ(quotedForMessage("\xED\xA0\x80"), "\"\\xed\\xa0\\x80\"") << "a surrogate is not text";
    EXPECT_EQ(quotedForMessage("abcdef", 3), "\"abc...\"");
    EXPECT_EQ(quotedForMessage("ab\xE2\x82\xAC", 4), "\"ab...\"") << "never half a character";
    EXPECT_EQ(quotedForMessage("abc", 3), "\"abc\"");
    std::string all;
    for (int c = 0; c < 256; ++c) all += static_cast<char>(c);
    std::string quoted = quotedForMessage(all);
    EXPECT_EQ(firstInvalidUtf8(quoted), kWellFormedUtf8);
    EXPECT_EQ(std::count_if(quoted.begin(), quoted.end(), [](char c) { return static_cast<unsigned char>(c) < 0x20; }),
              0);
}

TEST(FileURL, LocalURLsGiveTheirDecodedPathAndNothingElseIsOne) {
    EXPECT_EQ(pathOfFileURL("file:///a%20b/c"), "/a b/c");
    EXPECT_EQ(pathOfFileURL("file://localhost/x"), "/x");
    EXPECT_EQ(pathOfFileURL("file:///x%2fy"), "/x/y");
    EXPECT_EQ(pathOfFileURL("file:///100%"), "/100%") << "a % without two digits stays";
    EXPECT_EQ(pathOfFileURL("file:///%4"), "/%4");
    EXPECT_EQ(pathOfFileURL("file:///%zz"), "/%zz");
    EXPECT_EQ(pathOfFileURL("file:///a%00b"), std::string("/a\0b", 4)) << "callers refuse the NUL";
    EXPECT_FALSE(pathOfFileURL("/plain/path"));
    EXPECT_FALSE(pathOfFileURL("file://otherhost/x"));
    EXPECT_FALSE(pathOfFileURL("file://"));
    EXPECT_FALSE(pathOfFileURL("file:relative"));
    EXPECT_FALSE(pathOfFileURL("http:///x"));
}

TEST(Base64, EveryLengthRoundTripsAndPaddingIsStrict) {
    std::vector<uint8_t> bytes;
    for (uint8_t next : {0x00, 0xFF, 0x10, 0x80, 0x7F, 0xFE, 0x01}) {
        std::string text = base64(bytes);
        EXPECT_EQ(text.size() % 4, 0u);
        auto decoded = decodeBase64(text);
        ASSERT_TRUE(std::holds_alternative<std::vector<uint8_t>>(decoded)) << text;
        EXPECT_EQ(std::get<std::vector<uint8_t>>(decoded), bytes) << text;
        bytes.push_back(next);
    }
    EXPECT_EQ(base64(std::vector<uint8_t>{'h', 'i'}), "aGk=");
    EXPECT_EQ(std::get<std::vector<uint8_t>>(decodeBase64(" aG\nk=\r\n")), (std::vector<uint8_t>{'h', 'i'}));

    using Kind = Base64Fault::Kind;
    const std::pair<const char*, Kind> faults[] = {
        {"=AAA", Kind::MisplacedPadding}, {"A===", Kind::MisplacedPadding}, {"aGk=aGk=", Kind::TextAfterPadding},
        {"aG=k", Kind::TextAfterPadding}, {"aGk", Kind::IncompleteGroup},   {"aG=", Kind::IncompleteGroup},
        {"aG-k", Kind::NotBase64},        {"aGk*", Kind::NotBase64},
    };
    for (const auto& [text, kind] : faults) {
        auto decoded = decodeBase64(text);
        ASSERT_TRUE(std::holds_alternative<Base64Fault>(decoded)) << text;
        EXPECT_EQ(std::get<Base64Fault>(decoded).kind, kind) << text;
    }
    EXPECT_EQ(std::get<Base64Fault>(decodeBase64("aG-k")).character, '-');
}

TEST(Hex, DigitsOfEitherCaseAndNothingElse) {
    std::string digits = "0123456789abcdefABCDEF";
    for (size_t i = 0; i < digits.size(); ++i) EXPECT_EQ(hexDigitValue(digits[i]), i < 16 ? int(i) : int(i) - 6);
    for (char c : std::string("gG/:@`\x80 ")) EXPECT_EQ(hexDigitValue(c), -1) << c;
}

}  // namespace
}  // namespace bexil
