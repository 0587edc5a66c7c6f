// The Zem wire format: the value encoding and the frames that carry it. The fuzz targets zem_decoder and zem_frame
// add arbitrary input (every decoded value must round-trip canonically; any chunking of a stream must read the same
// frames); these tests pin the exact bytes, the limits and each refusal.

#include <gtest/gtest.h>

#include <array>
#include <fstream>
#include <limits>
#include <sstream>
#include <string>
#include <tuple>
#include <vector>

#include "ZemStrictEqual.h"
#include "platform/zem/ZemCodec.h"
#include "platform/zem/ZemFrame.h"
#include "platform/zem/ZemFrameReader.h"

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

Value sample(int i = 0) {
    return Value::dictionary({
        {"request", Value::string("match")},
        {"version", Value::uint64(3)},
        {"neg", Value::int64(-12345 - i)},
        {"when", Value::date(Date{1.7e9})},
        {"id", Value::uuid(*Uuid::parse("0F1E2D3C-4B5A-6978-8796-A5B4C3D2E1F0"))},
        {"list", Value::array({Value::boolean(true), Value::null(), Value::real(2.5), Value::data(Bytes{1, 2, 3})})},
        {"pad", Value::data(Bytes(static_cast<size_t>(i) * 37 % 300, 0x5A))},
    });
}

// ---- Values ----

// Every kind comes back with its kind and bits (NaN payloads intact, an int64 never as a uint64), in a canonical
// encoding whose size encodedSize() predicts. The kinds and limits the zem_decoder fuzz corpus already round-trips
// (null, booleans, the integer extremes, -0.0, short strings and data, dates, UUIDs, empty containers) are not
// repeated here.
TEST(ZemCodec, EveryKindRoundTripsWithItsKindAndBits) {
    const double nan = std::numeric_limits<double>::quiet_NaN();
    Bytes blob(1 << 20);
    for (size_t i = 0; i < blob.size(); ++i) blob[i] = static_cast<uint8_t>(i * 131 + (i >> 9));
    const Value values[] = {
        Value::int64(std::numeric_limits<int64_t>::max()), Value::real(nan), Value::real(-nan),
        Value::string(""), Value::string(std::string("nul\0inside", 10)),
        Value::string("\xF0\x9F\x98\x80 \xE2\x82\xAC \xC3\xA9 \xF4\x8F\xBF\xBF"), Value::data(Bytes{}),
        Value::date(Date{nan}), Value::dictionary({{"", Value::null()}}), sample(),
        Value::dictionary({{"blob", Value::data(blob)}}),
        nested(ZemCodec::kMaxDepth, Value::string("bottom")),  // exactly at the nesting limit
    };
    for (const Value& v : values) {
        Bytes bytes = encodeOrDie(v);
        ASSERT_EQ(bytes.size(), ZemCodec::encodedSize(v).value());
        Result<Value> back = ZemCodec::decode(bytes);
        ASSERT_TRUE(back.ok()) << v.description() << ": " << back.error().description();
        EXPECT_TRUE(strictlyEqual(v, *back)) << v.description() << " came back as " << back->description();
        EXPECT_EQ(encodeOrDie(*back), bytes) << v.description();
    }
}

TEST(ZemCodec, KnownEncodingsMatchTheDocument) {
    const std::pair<Value, std::string> cases[] = {
        {Value::int64(-1), "03 01"},  // zigzag
        {Value::int64(3), "03 06"},
        {Value::int64(std::numeric_limits<int64_t>::min()), "03 ff ff ff ff ff ff ff ff ff 01"},
        {Value::uint64(std::numeric_limits<uint64_t>::max()), "04 ff ff ff ff ff ff ff ff ff 01"},
        {Value::uint64(300), "04 ac 02"},
        {Value::real(1.5), "05 00 00 00 00 00 00 f8 3f"},
        {Value::emptyArray(), "0a 00"},
        {Value::null(), "00"},
        {Value::boolean(false), "01"},
        {Value::boolean(true), "02"},
    };
    for (const auto& [value, expected] : cases) EXPECT_EQ(encodeOrDie(value), hex(expected)) << value.description();
}

// Another implementation may write keys in any order; the decoder must not assume ours.
TEST(ZemCodec, DictionaryKeysInAnyOrderAreAccepted) {
    Result<Value> v = ZemCodec::decode(hex("0b 02 01 62 04 01 01 61 04 02"));  // {"b": 1, "a": 2}
    ASSERT_TRUE(v.ok()) << v.error().description();
    EXPECT_EQ(v->get("a").getUInt64(), 2u);
    EXPECT_EQ(v->get("b").getUInt64(), 1u);
    // Order broken after a sorted run: "a", "c", "b"; the entries decoded before the break must be kept.
    Result<Value> w = ZemCodec::decode(hex("0b 03 01 61 04 01 01 63 04 03 01 62 04 02"));
    ASSERT_TRUE(w.ok()) << w.error().description();
    EXPECT_EQ(w->get("a").getUInt64(), 1u);
    EXPECT_EQ(w->get("c").getUInt64(), 3u);
}

// The encoder appends after what is in the buffer, and refuses (leaving the buffer as it was) what a peer would
// reject, or what would exceed the size limit it is given.
TEST(ZemCodec, EncoderAppendsOrRefusesWhatAPeerWouldRejectLeavingTheBufferAlone) {
    Bytes out = {0xAA, 0xBB};
    ASSERT_FALSE(ZemCodec::encode(sample(), out));
    Bytes expected = {0xAA, 0xBB};
    Bytes alone = encodeOrDie(sample());
    expected.insert(expected.end(), alone.begin(), alone.end());
    EXPECT_EQ(out, expected);

    const std::tuple<Value, size_t, ZemErrorCode> cases[] = {
        {Value::array({Value::string("ok"), Value::string("\xC0\x80")}), SIZE_MAX, ZemErrorCode::InvalidUtf8},
        {Value::dictionary({{"\xED\xA0\x80", Value::null()}}), SIZE_MAX, ZemErrorCode::InvalidUtf8},
        {nested(ZemCodec::kMaxDepth + 1, Value::null()), SIZE_MAX, ZemErrorCode::TooDeep},
        {Value::string("twelve bytes"), 10, ZemErrorCode::FrameTooLarge},
    };
    for (const auto& [value, limit, code] : cases) {
        Bytes buffer = {1, 2, 3};
        std::optional<Error> error = ZemCodec::encode(value, buffer, limit);
        ASSERT_TRUE(error);
        EXPECT_TRUE(isZemError(*error, code)) << error->description();
        EXPECT_EQ(buffer, (Bytes{1, 2, 3}));
    }
}

TEST(ZemCodec, EveryTruncationOfAValidEncodingIsRefused) {
    Bytes full = encodeOrDie(sample());
    for (size_t cut = 0; cut < full.size(); ++cut) {
        Result<Value> v = ZemCodec::decode(Bytes(full.begin(), full.begin() + static_cast<ptrdiff_t>(cut)));
        ASSERT_FALSE(v.ok()) << "prefix of " << cut << " bytes decoded";
        int64_t code = v.error().code();
        EXPECT_TRUE(code == static_cast<int64_t>(ZemErrorCode::Truncated) ||
                    code == static_cast<int64_t>(ZemErrorCode::CountExceedsInput))
            << "cut at " << cut << ": " << v.error().description();
    }
    Bytes bytes = full;
    bytes.push_back(0x00);
    std::string message = expectError(bytes, ZemErrorCode::TrailingBytes);
    EXPECT_NE(message.find(std::to_string(bytes.size() - 1)), std::string::npos) << message;
}

TEST(ZemCodec, UnknownTagsAndMalformedVarintsAreRefused) {
    for (int tag = 0x0C; tag <= 0xFF; ++tag) expectError(Bytes{static_cast<uint8_t>(tag)}, ZemErrorCode::BadTag);
    std::string message = expectError(hex("0a 02 00 7f"), ZemErrorCode::BadTag);
    EXPECT_NE(message.find("0x7f at offset 3"), std::string::npos) << message;

    expectError(hex("04 80 00"), ZemErrorCode::BadVarint);                          // overlong zero
    expectError(hex("04 ff ff ff ff ff ff ff ff ff 02"), ZemErrorCode::BadVarint);  // 65 bits
    expectError(hex("04 ff ff ff ff ff ff ff ff ff 81 01"), ZemErrorCode::BadVarint);
    expectError(hex("04 ff ff"), ZemErrorCode::Truncated);
}

TEST(ZemCodec, MalformedUtf8IsRefusedInStringsAndKeys) {
    const std::string bad[] = {
        "\x80",              // not a lead byte
        "\xC0\x80",          // overlong NUL
        "\xE2\x28\xA1",      // lead byte without its continuation
        "\xED\xA0\x80",      // surrogate U+D800
        "\xF4\x90\x80\x80",  // above U+10FFFF
        "\xE2\x82",          // sequence cut short by the end of the text
        "abcdefgh\xFF",      // after an all-ASCII word
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

TEST(ZemCodec, DuplicateKeysAreRefusedInSortedAndUnsortedInput) {
    std::string message = expectError(hex("0b 02 01 61 00 01 61 01"), ZemErrorCode::DuplicateKey);
    EXPECT_NE(message.find("\"a\" at offset 5"), std::string::npos) << message;
    // "a", "c", "a": the order breaks after a sorted run, and the duplicate is of a key from that run.
    expectError(hex("0b 03 01 61 00 01 63 00 01 61 00"), ZemErrorCode::DuplicateKey);
}

// Hostile counts and lengths must fail before anything is allocated for them.
TEST(ZemCodec, NestingCountsAndLengthsBeyondTheInputFailBeforeAllocating) {
    Bytes deep;
    for (size_t i = 0; i <= ZemCodec::kMaxDepth; ++i) deep.insert(deep.end(), {0x0A, 0x01});
    deep.push_back(0x00);
    expectError(deep, ZemErrorCode::TooDeep);

    expectError(hex("0a 80 80 80 80 10 00"), ZemErrorCode::CountExceedsInput);  // 2^32 items in 7 bytes
    expectError(hex("0b 03 00 00 00 00 00"), ZemErrorCode::CountExceedsInput);  // 3 entries need 6 bytes
    expectError(hex("06 80 80 80 80 80 80 80 80 80 01"), ZemErrorCode::Truncated);  // 2^63 bytes of string
    expectError(hex("07 ff ff ff ff ff ff ff ff 7f 41"), ZemErrorCode::Truncated);
    // A chain of arrays each claiming nearly as many items as bytes remain: every count passes its check, so
    // reserving by the claim would take 200 x 16 MB before the input runs out.
    Bytes chain;
    for (int level = 0; level < 200; ++level) chain.insert(chain.end(), {0x0A, 0xD8, 0xFC, 0x3C});  // 999000 items
    chain.resize(chain.size() + 999000, 0x00);
    expectError(chain, ZemErrorCode::Truncated);
}

// The bytes of a "```hex NAME" block of docs/protocol.md; annotations after '#' are ignored.
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

// ---- Frames ----

Bytes header(uint8_t magic, uint8_t version, uint8_t kind, uint8_t reserved, uint32_t length, uint64_t serial,
             uint64_t inReplyTo) {
    Bytes h = {magic, version, kind, reserved};
    for (int i = 0; i < 4; ++i) h.push_back(static_cast<uint8_t>(length >> (8 * i)));
    for (int i = 0; i < 8; ++i) h.push_back(static_cast<uint8_t>(serial >> (8 * i)));
    for (int i = 0; i < 8; ++i) h.push_back(static_cast<uint8_t>(inReplyTo >> (8 * i)));
    return h;
}

Result<ZemFrameHeader> decodeHeader(const Bytes& bytes) {
    return ZemFrame::decodeHeader(std::span<const uint8_t, ZemFrame::kHeaderBytes>(bytes.data(), 24));
}

struct Stream {
    Bytes bytes;
    std::vector<ZemFrameHeader> headers;
};

// A stream of frames of every kind and of various sizes, with the headers it holds; frame i carries sample(i).
Stream sampleStream(int frames) {
    Stream s;
    for (int i = 1; i <= frames; ++i) {
        auto kind = static_cast<ZemFrameKind>(1 + i % 3);
        uint64_t inReplyTo = kind == ZemFrameKind::Reply ? static_cast<uint64_t>(i - 1) : 0;
        size_t before = s.bytes.size();
        EXPECT_FALSE(ZemFrame::encode(kind, static_cast<uint64_t>(i), inReplyTo, sample(i), s.bytes));
        s.headers.push_back({kind, static_cast<uint64_t>(i), inReplyTo,
                             static_cast<uint32_t>(s.bytes.size() - before - ZemFrame::kHeaderBytes)});
    }
    return s;
}

std::vector<ZemFrame> drain(ZemFrameReader& reader) {
    std::vector<ZemFrame> frames;
    while (auto f = reader.next()) frames.push_back(std::move(*f));
    return frames;
}

void expectStream(const Stream& s, const std::vector<ZemFrame>& frames) {
    ASSERT_EQ(frames.size(), s.headers.size());
    for (size_t i = 0; i < frames.size(); ++i) {
        EXPECT_EQ(frames[i].header(), s.headers[i]) << "frame " << i;
        Result<Value> v = frames[i].decodePayload();
        ASSERT_TRUE(v.ok()) << v.error().description();
        EXPECT_TRUE(strictlyEqual(*v, sample(static_cast<int>(i) + 1))) << "frame " << i;
    }
}

TEST(ZemFrame, HeaderRoundTripsWithLittleEndianFields) {
    ZemFrameHeader h{ZemFrameKind::Reply, 0x0102030405060708ULL, 0x1112131415161718ULL, 0x00A0B0C0};
    std::array<uint8_t, ZemFrame::kHeaderBytes> bytes;
    ZemFrame::encodeHeader(h, bytes);
    EXPECT_EQ(Bytes(bytes.begin(), bytes.end()),
              header(ZemFrame::kMagic, 1, 3, 0, 0x00A0B0C0, 0x0102030405060708ULL, 0x1112131415161718ULL));
    Result<ZemFrameHeader> back = ZemFrame::decodeHeader(bytes);
    ASSERT_TRUE(back.ok());
    EXPECT_EQ(*back, h);
}

TEST(ZemFrame, BadHeadersAreRefusedWithTheirOwnCode) {
    const uint8_t m = ZemFrame::kMagic;
    const std::pair<Bytes, ZemErrorCode> cases[] = {
        {header('Z', 1, 2, 0, 2, 1, 0), ZemErrorCode::BadMagic},
        {header(m, 2, 2, 0, 2, 1, 0), ZemErrorCode::UnsupportedVersion},
        {header(m, 1, 0, 0, 2, 1, 0), ZemErrorCode::UnknownKind},
        {header(m, 1, 4, 0, 2, 1, 0), ZemErrorCode::UnknownKind},
        {header(m, 1, 2, 1, 2, 1, 0), ZemErrorCode::BadHeader},  // reserved bits set
        {header(m, 1, 2, 0, 2, 0, 0), ZemErrorCode::BadHeader},  // request without serial
        {header(m, 1, 3, 0, 2, 5, 0), ZemErrorCode::BadHeader},  // reply to nothing
        {header(m, 1, 1, 0, 2, 5, 4), ZemErrorCode::BadHeader},  // message claiming to be a reply
        {header(m, 1, 2, 0, ZemFrame::kMaxPayloadBytes + 1, 1, 0), ZemErrorCode::FrameTooLarge},
        {header(m, 1, 2, 0, 0xFFFFFFFF, 1, 0), ZemErrorCode::FrameTooLarge},
    };
    for (const auto& [bytes, code] : cases) {
        Result<ZemFrameHeader> h = decodeHeader(bytes);
        ASSERT_FALSE(h.ok());
        EXPECT_TRUE(isZemError(h.error(), code)) << h.error().description();
    }
    // The largest legal payload is accepted, and a message may have serial 0.
    EXPECT_TRUE(decodeHeader(header(m, 1, 1, 0, ZemFrame::kMaxPayloadBytes, 0, 0)).ok());
}

TEST(ZemFrame, EncodeRefusesNonDictionariesBadSerialsAndOversizedPayloads) {
    Bytes out = {7};
    auto error = ZemFrame::encode(ZemFrameKind::Message, 1, 0, Value::array({}), out);
    EXPECT_TRUE(error && isZemError(*error, ZemErrorCode::NotDictionary));
    error = ZemFrame::encode(ZemFrameKind::Reply, 2, 0, Value::emptyDictionary(), out);
    EXPECT_TRUE(error && isZemError(*error, ZemErrorCode::BadHeader));
    Value big = Value::dictionary({{"blob", Value::data(Bytes(ZemFrame::kMaxFrameBytes, 0))}});
    error = ZemFrame::encode(ZemFrameKind::Request, 3, 0, big, out);
    EXPECT_TRUE(error && isZemError(*error, ZemErrorCode::FrameTooLarge));
    EXPECT_EQ(out, Bytes{7});

    // A payload that brings the frame to exactly the limit is fine: dictionary (2) + key (5) + data tag and
    // 4-byte length (5) + the blob.
    Value exact = Value::dictionary({{"blob", Value::data(Bytes(ZemFrame::kMaxPayloadBytes - 2 - 5 - 5, 0))}});
    Bytes frame;
    ASSERT_FALSE(ZemFrame::encode(ZemFrameKind::Request, 3, 0, exact, frame));
    EXPECT_EQ(frame.size(), ZemFrame::kMaxFrameBytes);
}

// A payload must be one dictionary: anything else is a protocol error, an empty one (a complete frame with its
// header alone) included. Descriptions name kind, serials and size for the logs.
TEST(ZemFrame, PayloadThatIsNotADictionaryIsAProtocolErrorAndDescriptionsNameKindSerialsAndSize) {
    EXPECT_TRUE(isZemError(ZemFrame({ZemFrameKind::Message, 1, 0, 2}, Bytes{0x0A, 0x00}).decodePayload().error(),
                           ZemErrorCode::NotDictionary));
    ZemFrameReader reader;
    ASSERT_FALSE(reader.feed(header(ZemFrame::kMagic, 1, 1, 0, 0, 1, 0)));
    auto empty = reader.next();
    ASSERT_TRUE(empty);
    EXPECT_TRUE(empty->payload().empty());
    EXPECT_TRUE(isZemError(empty->decodePayload().error(), ZemErrorCode::Truncated));

    EXPECT_EQ(ZemFrame({ZemFrameKind::Request, 12, 0, 3}, Bytes(3)).description(), "request #12 (3 bytes)");
    EXPECT_EQ(ZemFrame({ZemFrameKind::Reply, 4, 12, 0}, Bytes{}).description(), "reply #4 to #12 (0 bytes)");
}

// Whole or a byte at a time (each frame taken as soon as it is complete), the reader yields the same frames.
// Other chunkings are the zem_frame fuzz target's.
TEST(ZemFrameReader, SameFramesWholeOrAByteAtATime) {
    Stream s = sampleStream(40);
    ZemFrameReader whole;
    ASSERT_FALSE(whole.feed(s.bytes));
    expectStream(s, drain(whole));
    EXPECT_FALSE(whole.hasPartialFrame());
    EXPECT_EQ(whole.bufferedBytes(), 0u);

    ZemFrameReader bytewise;
    std::vector<ZemFrame> frames;
    for (uint8_t byte : s.bytes) {
        ASSERT_FALSE(bytewise.feed(std::span<const uint8_t>(&byte, 1)));
        while (auto f = bytewise.next()) frames.push_back(std::move(*f));
    }
    expectStream(s, frames);
}

// Part of a frame, even part of a header, is pending: a peer closing now cut a frame short.
TEST(ZemFrameReader, PartOfAFrameStaysPendingUntilTheRestArrives) {
    Stream s = sampleStream(1);
    size_t half = s.bytes.size() / 2;
    ZemFrameReader reader;
    ASSERT_FALSE(reader.feed(std::span<const uint8_t>(s.bytes.data(), 5)));
    EXPECT_TRUE(reader.hasPartialFrame());
    EXPECT_EQ(reader.bufferedBytes(), 5u);
    ASSERT_FALSE(reader.feed(std::span<const uint8_t>(s.bytes.data() + 5, half - 5)));
    EXPECT_FALSE(reader.next());
    EXPECT_EQ(reader.bufferedBytes(), half - ZemFrame::kHeaderBytes);
    ASSERT_FALSE(reader.feed(std::span<const uint8_t>(s.bytes.data() + half, s.bytes.size() - half)));
    expectStream(s, drain(reader));
    EXPECT_FALSE(reader.hasPartialFrame());
}

TEST(ZemFrameReader, OversizedFrameIsRefusedFromItsHeaderAlone) {
    ZemFrameReader reader;
    Bytes h = header(ZemFrame::kMagic, 1, 2, 0, ZemFrame::kMaxPayloadBytes + 1, 9, 0);
    ASSERT_FALSE(reader.feed(std::span<const uint8_t>(h.data(), 23)));
    auto error = reader.feed(std::span<const uint8_t>(h.data() + 23, 1));
    ASSERT_TRUE(error);
    EXPECT_TRUE(isZemError(*error, ZemErrorCode::FrameTooLarge));
    EXPECT_EQ(*error->localizedDescription(), "frame of 16777217 bytes exceeds limit kMaxFrameBytes (16777216)");
}

TEST(ZemFrameReader, FramesBeforeABadHeaderSurviveAndTheErrorSticks) {
    Stream s = sampleStream(3);
    Bytes bytes = s.bytes;
    Bytes bad = header(0x00, 1, 2, 0, 2, 1, 0);
    bytes.insert(bytes.end(), bad.begin(), bad.end());
    Stream more = sampleStream(2);
    bytes.insert(bytes.end(), more.bytes.begin(), more.bytes.end());

    ZemFrameReader reader;
    auto error = reader.feed(bytes);
    ASSERT_TRUE(error);
    EXPECT_TRUE(isZemError(*error, ZemErrorCode::BadMagic));
    expectStream(s, drain(reader));
    // Nothing after the bad header is trusted, now or later.
    EXPECT_EQ(reader.feed(more.bytes), error);
    EXPECT_FALSE(reader.next());
}

}  // namespace
}  // namespace bexil
