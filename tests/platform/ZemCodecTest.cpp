#include <gtest/gtest.h>

#include <cmath>
#include <fstream>
#include <limits>
#include <map>
#include <sstream>
#include <string>
#include <vector>

#include "ZemStrictEqual.h"
#include "platform/zem/ZemCodec.h"
#include "platform/zem/ZemFrame.h"

namespace bexil {
namespace {

using Bytes = std::vector<uint8_t>;
using testing::strictlyEqual;

Bytes encodeOrDie(const Value& v) {
    Result<Bytes> bytes = ZemCodec::encode(v);
    EXPECT_TRUE(bytes.ok()) << (bytes.ok() ? "" : bytes.error().description());
    return bytes.ok() ? bytes.value() : Bytes{};
}

Bytes hex(std::string_view text) {
    Bytes out;
    std::istringstream in{std::string(text)};
    std::string byte;
    while (in >> byte) out.push_back(static_cast<uint8_t>(std::stoul(byte, nullptr, 16)));
    return out;
}

// Decodes and asserts failure with the given code; returns the message for further checks.
std::string expectError(const Bytes& bytes, ZemErrorCode code) {
    Result<Value> v = ZemCodec::decode(bytes);
    EXPECT_FALSE(v.ok()) << "decoded " << (v.ok() ? v->description() : "");
    if (v.ok()) return {};
    EXPECT_EQ(v.error().domain(), kZemErrorDomain);
    EXPECT_EQ(v.error().code(), static_cast<int64_t>(code)) << v.error().description();
    return v.error().localizedDescription().value_or("");
}

Value nested(size_t levels, Value innermost) {
    Value v = std::move(innermost);
    for (size_t i = 0; i < levels; ++i) v = (i % 2) ? Value::array({v}) : Value::dictionary({{"k", v}});
    return v;
}

Value sample() {
    return Value::dictionary({
        {"request", Value::string("match")},
        {"version", Value::uint64(3)},
        {"neg", Value::int64(-12345)},
        {"when", Value::date(Date{1.7e9})},
        {"id", Value::uuid(*Uuid::parse("0F1E2D3C-4B5A-6978-8796-A5B4C3D2E1F0"))},
        {"list", Value::array({Value::boolean(true), Value::null(), Value::real(2.5), Value::data(Bytes{1, 2, 3})})},
        {"rules", Value::dictionary({{"RZExtensionPointIdentifier", Value::string("com.example.greeting")}})},
    });
}

// ---- Round trips ----

TEST(ZemCodec, EveryKindRoundTripsWithItsKindAndBits) {
    const double nan = std::numeric_limits<double>::quiet_NaN();
    Bytes blob(1 << 20);
    for (size_t i = 0; i < blob.size(); ++i) blob[i] = static_cast<uint8_t>(i * 131 + (i >> 9));
    std::vector<Value> values = {
        Value::null(),
        Value::boolean(false),
        Value::boolean(true),
        Value::int64(0),
        Value::int64(-1),
        Value::int64(std::numeric_limits<int64_t>::min()),
        Value::int64(std::numeric_limits<int64_t>::max()),
        Value::uint64(0),
        Value::uint64(3),
        Value::uint64(std::numeric_limits<uint64_t>::max()),
        Value::real(nan),
        Value::real(-nan),
        Value::real(-0.0),
        Value::real(std::numeric_limits<double>::infinity()),
        Value::real(std::numeric_limits<double>::denorm_min()),
        Value::string(""),
        Value::string(std::string("nul\0inside", 10)),
        Value::string("\xF0\x9F\x98\x80 \xE2\x82\xAC \xC3\xA9 \xF4\x8F\xBF\xBF"),
        Value::data(Bytes{}),
        Value::date(Date{-1.5}),
        Value::date(Date{nan}),
        Value::uuid(Uuid()),
        Value::uuid(Uuid::random()),
        Value::emptyArray(),
        Value::emptyDictionary(),
        Value::dictionary({{"", Value::null()}}),
        sample(),
        Value::dictionary({{"blob", Value::data(blob)}}),
        nested(ZemCodec::kMaxDepth, Value::string("bottom")),  // exactly at the nesting limit
    };
    for (const Value& v : values) {
        Bytes bytes = encodeOrDie(v);
        ASSERT_EQ(bytes.size(), ZemCodec::encodedSize(v).value());
        Result<Value> back = ZemCodec::decode(bytes);
        ASSERT_TRUE(back.ok()) << v.description() << ": " << back.error().description();
        EXPECT_TRUE(strictlyEqual(v, *back)) << v.description() << " came back as " << back->description();
        // The encoding is canonical: what comes back encodes to the same bytes.
        EXPECT_EQ(encodeOrDie(*back), bytes) << v.description();
    }
}

TEST(ZemCodec, KnownEncodingsMatchTheDocument) {
    std::vector<std::pair<Value, std::string>> cases = {
        {Value::int64(-1), "03 01"},
        {Value::int64(3), "03 06"},
        {Value::uint64(3), "04 03"},
        {Value::int64(std::numeric_limits<int64_t>::min()), "03 ff ff ff ff ff ff ff ff ff 01"},
        {Value::uint64(std::numeric_limits<uint64_t>::max()), "04 ff ff ff ff ff ff ff ff ff 01"},
        {Value::uint64(300), "04 ac 02"},
        {Value::real(1.5), "05 00 00 00 00 00 00 f8 3f"},
        {Value::string(""), "06 00"},
        {Value::emptyArray(), "0a 00"},
        {Value::emptyDictionary(), "0b 00"},
        {Value::null(), "00"},
        {Value::boolean(false), "01"},
        {Value::boolean(true), "02"},
    };
    for (const auto& [value, expected] : cases) EXPECT_EQ(encodeOrDie(value), hex(expected)) << value.description();
}

TEST(ZemCodec, DictionaryKeysInAnyOrderAreAccepted) {
    // {"b": 1, "a": 2} written in descending order, as another implementation might.
    Result<Value> v = ZemCodec::decode(hex("0b 02 01 62 04 01 01 61 04 02"));
    ASSERT_TRUE(v.ok()) << v.error().description();
    EXPECT_EQ(v->get("a").getUInt64(), 2u);
    EXPECT_EQ(v->get("b").getUInt64(), 1u);
    // Order broken after a sorted run: "a", "c", "b".
    Result<Value> w = ZemCodec::decode(hex("0b 03 01 61 04 01 01 63 04 03 01 62 04 02"));
    ASSERT_TRUE(w.ok()) << w.error().description();
    ASSERT_EQ(w->count(), 3u);
    EXPECT_EQ(w->entries()[1].key, "b");
    EXPECT_EQ(w->get("c").getUInt64(), 3u);
}

// ---- Encoding into a buffer ----

TEST(ZemCodec, EncodeAppendsAfterExistingBytes) {
    Bytes out = {0xAA, 0xBB};
    ASSERT_FALSE(ZemCodec::encode(sample(), out));
    EXPECT_EQ(out[0], 0xAA);
    EXPECT_EQ(out[1], 0xBB);
    Bytes alone = encodeOrDie(sample());
    EXPECT_TRUE(std::equal(out.begin() + 2, out.end(), alone.begin(), alone.end()));
}

TEST(ZemCodec, EncoderRefusesWhatAPeerWouldRejectAndLeavesTheBufferAlone) {
    struct Case {
        Value value;
        ZemErrorCode code;
    };
    std::vector<Case> cases = {
        {Value::array({Value::string("ok"), Value::string("\xC0\x80")}), ZemErrorCode::InvalidUtf8},
        {Value::dictionary({{"\xED\xA0\x80", Value::null()}}), ZemErrorCode::InvalidUtf8},
        {nested(ZemCodec::kMaxDepth + 1, Value::null()), ZemErrorCode::TooDeep},
    };
    for (const auto& c : cases) {
        Bytes out = {1, 2, 3};
        std::optional<Error> error = ZemCodec::encode(c.value, out);
        ASSERT_TRUE(error);
        EXPECT_TRUE(isZemError(*error, c.code)) << error->description();
        EXPECT_EQ(out, (Bytes{1, 2, 3}));
    }
    Bytes out = {9};
    std::optional<Error> error = ZemCodec::encode(Value::string("twelve bytes"), out, 10);
    ASSERT_TRUE(error);
    EXPECT_TRUE(isZemError(*error, ZemErrorCode::FrameTooLarge));
    EXPECT_EQ(out, Bytes{9});
}

// ---- Rejection of bad input ----

TEST(ZemCodec, EveryTruncationOfAValidEncodingIsRefused) {
    Bytes full = encodeOrDie(sample());
    for (size_t cut = 0; cut < full.size(); ++cut) {
        Bytes prefix(full.begin(), full.begin() + static_cast<ptrdiff_t>(cut));
        Result<Value> v = ZemCodec::decode(prefix);
        ASSERT_FALSE(v.ok()) << "prefix of " << cut << " bytes decoded";
        int64_t code = v.error().code();
        EXPECT_TRUE(code == static_cast<int64_t>(ZemErrorCode::Truncated) ||
                    code == static_cast<int64_t>(ZemErrorCode::CountExceedsInput))
            << "cut at " << cut << ": " << v.error().description();
    }
}

TEST(ZemCodec, UnknownTagsAreRefusedWithTheirOffset) {
    for (int tag = 0x0C; tag <= 0xFF; ++tag) expectError(Bytes{static_cast<uint8_t>(tag)}, ZemErrorCode::BadTag);
    std::string message = expectError(hex("0a 02 00 7f"), ZemErrorCode::BadTag);
    EXPECT_NE(message.find("0x7f at offset 3"), std::string::npos) << message;
}

TEST(ZemCodec, MalformedUtf8IsRefusedInStringsAndKeys) {
    std::vector<std::string> bad = {
        "\x80",              // lone continuation byte
        "\xC0\x80",          // overlong NUL
        "\xE0\x80\xAF",      // overlong '/'
        "\xED\xA0\x80",      // surrogate U+D800
        "\xF4\x90\x80\x80",  // above U+10FFFF
        "\xE2\x82",          // sequence cut short
        "\xF8\x88\x80\x80\x80",
        "abcdefgh\xFF",  // after an all-ASCII word
    };
    for (const std::string& text : bad) {
        Bytes asString = {0x06, static_cast<uint8_t>(text.size())};
        asString.insert(asString.end(), text.begin(), text.end());
        expectError(asString, ZemErrorCode::InvalidUtf8);
        Bytes asKey = {0x0B, 0x01, static_cast<uint8_t>(text.size())};
        asKey.insert(asKey.end(), text.begin(), text.end());
        asKey.push_back(0x00);
        expectError(asKey, ZemErrorCode::InvalidUtf8);
    }
}

TEST(ZemCodec, DuplicateKeysAreRefusedWhereverTheyStand) {
    // Adjacent, as in sorted input.
    std::string message = expectError(hex("0b 02 01 61 00 01 61 01"), ZemErrorCode::DuplicateKey);
    EXPECT_NE(message.find("\"a\" at offset 5"), std::string::npos) << message;
    // Apart, in unsorted input: "b", "a", "b"; and "a", "c", "a", where order breaks after a sorted run.
    expectError(hex("0b 03 01 62 00 01 61 00 01 62 00"), ZemErrorCode::DuplicateKey);
    expectError(hex("0b 03 01 61 00 01 63 00 01 61 00"), ZemErrorCode::DuplicateKey);
    // Inside a nested dictionary.
    expectError(hex("0a 01 0b 02 00 00 00 00"), ZemErrorCode::DuplicateKey);
}

TEST(ZemCodec, NestingBeyondTheLimitIsRefused) {
    Bytes deep;
    for (size_t i = 0; i <= ZemCodec::kMaxDepth; ++i) deep.insert(deep.end(), {0x0A, 0x01});
    deep.push_back(0x00);
    expectError(deep, ZemErrorCode::TooDeep);
    // One level less is fine.
    Bytes ok(deep.begin() + 2, deep.end());
    EXPECT_TRUE(ZemCodec::decode(ok).ok());
}

TEST(ZemCodec, CountsAndLengthsBeyondTheInputFailBeforeAllocating) {
    // 2^32 items in a 7-byte input.
    expectError(hex("0a 80 80 80 80 10 00"), ZemErrorCode::CountExceedsInput);
    // A dictionary needs two bytes per entry: 3 entries cannot fit in 5 bytes.
    expectError(hex("0b 03 00 00 00 00 00"), ZemErrorCode::CountExceedsInput);
    // Strings and data claiming 2^63 bytes.
    expectError(hex("06 80 80 80 80 80 80 80 80 80 01"), ZemErrorCode::Truncated);
    expectError(hex("07 ff ff ff ff ff ff ff ff 7f 41"), ZemErrorCode::Truncated);
    // A chain of arrays each claiming nearly as many items as bytes remain: every count passes its check, so
    // reserving by the claim would take 200 x 16 MB before the input runs out.
    Bytes chain;
    for (int level = 0; level < 200; ++level) chain.insert(chain.end(), {0x0A, 0xD8, 0xFC, 0x3C});  // 999000 items
    chain.resize(chain.size() + 999000, 0x00);
    expectError(chain, ZemErrorCode::Truncated);
}

TEST(ZemCodec, MalformedVarintsAreRefused) {
    expectError(hex("04 80 00"), ZemErrorCode::BadVarint);                          // overlong zero
    expectError(hex("04 ff ff ff ff ff ff ff ff ff 02"), ZemErrorCode::BadVarint);  // 65 bits
    expectError(hex("04 ff ff ff ff ff ff ff ff ff 81 01"), ZemErrorCode::BadVarint);
    expectError(hex("04 ff ff"), ZemErrorCode::Truncated);
}

TEST(ZemCodec, TrailingBytesAfterTheValueAreRefused) {
    Bytes bytes = encodeOrDie(sample());
    bytes.push_back(0x00);
    std::string message = expectError(bytes, ZemErrorCode::TrailingBytes);
    EXPECT_NE(message.find(std::to_string(bytes.size() - 1)), std::string::npos) << message;
    expectError(Bytes{}, ZemErrorCode::Truncated);
}

// ---- The worked example of docs/protocol.md ----

// The bytes of a "```hex NAME" block of the document; annotations after '#' are ignored.
Bytes documentedBytes(const std::string& name) {
    std::ifstream in(std::string(BEXIL_SOURCE_DIR) + "/docs/protocol.md");
    std::string line, text;
    bool inside = false;
    while (std::getline(in, line)) {
        if (!inside) {
            inside = line == "```hex " + name;
            continue;
        }
        if (line.starts_with("```")) break;
        text += line.substr(0, line.find('#')) + " ";
    }
    return hex(text);
}

TEST(ZemCodec, DocumentedExampleMatchesEncoder) {
    Value request = Value::dictionary({
        {"request", Value::string("match")},
        {"version", Value::uint64(3)},
        {"flags", Value::uint64(0)},
        {"rules", Value::dictionary({{"RZExtensionPointIdentifier", Value::string("com.example.greeting")}})},
    });
    Value reply = Value::dictionary({
        {"errorcode", Value::uint64(7)},
        {"error", Value::string("unsupported protocol version 4 (current 3)")},
    });
    Bytes requestFrame, replyFrame;
    ASSERT_FALSE(ZemFrame::encode(ZemFrameKind::Request, 1, 0, request, requestFrame));
    ASSERT_FALSE(ZemFrame::encode(ZemFrameKind::Reply, 1, 1, reply, replyFrame));
    EXPECT_EQ(documentedBytes("request-frame"), requestFrame);
    EXPECT_EQ(documentedBytes("reply-frame"), replyFrame);
}

}  // namespace
}  // namespace bexil
