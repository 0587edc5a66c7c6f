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

#include "ProtocolDocument.h"
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

Bytes hex(std::string_view text) { return test::hexBytes(text); }

// Decodes and expects failure with the given code.
void expectError(const Bytes& bytes, ZemErrorCode code) {
    Result<Value> v = ZemCodec::decode(bytes);
    ASSERT_FALSE(v.ok()) << "decoded " << v->description();
    EXPECT_TRUE(isZemError(v.error(), code)) << v.error().description();
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

// Values the encoder is most likely to get wrong come back with their kind and bits (NaN payloads intact, NUL
// inside text, a length that needs a long varint, nesting exactly at the limit), in a canonical encoding whose
// size encodedSize() predicts. Round trips of the plain kinds are the zem_decoder fuzz corpus's.
TEST(ZemCodec, EdgeValuesRoundTripWithTheirKindAndBits) {
    const double nan = std::numeric_limits<double>::quiet_NaN();
    const Value values[] = {
        Value::real(-nan),
        Value::string(std::string("nul\0inside", 10)),
        Value::string("\xF0\x9F\x98\x80 \xF4\x8F\xBF\xBF"),
        sample(),
        Value::dictionary({{"blob", Value::data(Bytes(1 << 20, 0x5A))}}),
        nested(ZemCodec::kMaxDepth, Value::string("bottom")),
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

// Another implementation must be able to write what we read: the integer and real encodings the documented frame
// example does not show (zigzag signed integers, extremes, little-endian reals).
TEST(ZemCodec, KnownEncodingsMatchTheDocument) {
    const std::pair<Value, std::string> cases[] = {
        {Value::int64(-1), "03 01"},
        {Value::int64(std::numeric_limits<int64_t>::min()), "03 ff ff ff ff ff ff ff ff ff 01"},
        {Value::uint64(std::numeric_limits<uint64_t>::max()), "04 ff ff ff ff ff ff ff ff ff 01"},
        {Value::real(1.5), "05 00 00 00 00 00 00 f8 3f"},
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

// An encoding with the referenced bytes put back where they belong.
template <class Buffer>
Bytes withReferences(const Buffer& out, const std::vector<ZemCodec::Reference>& references) {
    Bytes whole;
    size_t from = 0;
    for (const ZemCodec::Reference& reference : references) {
        whole.insert(whole.end(), out.begin() + static_cast<ptrdiff_t>(from),
                     out.begin() + static_cast<ptrdiff_t>(reference.offset));
        whole.insert(whole.end(), reference.bytes.begin(), reference.bytes.end());
        from = reference.offset;
    }
    whole.insert(whole.end(), out.begin() + static_cast<ptrdiff_t>(from), out.end());
    return whole;
}

// Guards the encoding that a gathering send takes: strings and data from the minimum size on (and only those) are
// left out and referenced in place, in order, wherever they are nested, and putting them back gives exactly what
// encode() writes; a frame's header counts them. What encode() refuses, it refuses too, touching nothing.
TEST(ZemCodec, ReferencingEncodingLeavesOutLargeContentsAndIsEncodeWithThemPutBack) {
    const size_t minimum = 100;
    std::string text(minimum, 'x');
    Bytes blob(minimum + 1, 0x5A), small(minimum - 1, 0x33);
    Value value =
        Value::dictionary({{"a", Value::string(text)},
                           {"b", Value::array({Value::data(small), Value::data(blob), Value::string(text.substr(1))})},
                           {"c", Value::dictionary({{"d", Value::data(blob)}, {"e", Value::uint64(300)}})},
                           {"f", sample()}});
    ZemBytes out = {0xAA};
    std::vector<ZemCodec::Reference> references;
    ASSERT_FALSE(ZemCodec::encodeReferencing(value, out, references, minimum));
    ASSERT_EQ(references.size(), 3u);
    EXPECT_EQ(references[0].bytes.data(), reinterpret_cast<const uint8_t*>(value.get("a").stringView().data()));
    EXPECT_EQ(references[1].bytes.data(), value.get("b").items()[1].dataBytes().data());
    EXPECT_EQ(references[2].bytes.data(), value.get("c").get("d").dataBytes().data());
    Bytes expected = {0xAA};
    Bytes alone = encodeOrDie(value);
    expected.insert(expected.end(), alone.begin(), alone.end());
    EXPECT_EQ(withReferences(out, references), expected);
    EXPECT_EQ(out.size() + 2 * blob.size() + text.size(), expected.size());

    ZemBytes frame;
    std::vector<ZemCodec::Reference> inFrame;
    ASSERT_FALSE(ZemFrame::encodeReferencing(ZemFrameKind::Request, 4, 0, value, frame, inFrame, minimum));
    Bytes plain;
    ASSERT_FALSE(ZemFrame::encode(ZemFrameKind::Request, 4, 0, value, plain));
    EXPECT_EQ(withReferences(frame, inFrame), plain);

    const std::pair<Value, size_t> refused[] = {
        {Value::dictionary({{"a", Value::string(text)}, {"b", Value::string("\xff")}}), SIZE_MAX},
        {Value::dictionary({{"a", Value::string(text)}}), 50},
    };
    for (const auto& [bad, limit] : refused) {
        ZemBytes untouched = {1, 2};
        std::vector<ZemCodec::Reference> none;
        EXPECT_TRUE(ZemCodec::encodeReferencing(bad, untouched, none, minimum, limit));
        EXPECT_EQ(untouched, (ZemBytes{1, 2}));
        EXPECT_TRUE(none.empty());
    }
}

// Guards the decoder's bounds checks: every prefix of an encoding fails cleanly, and so does one byte too many.
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
    full.push_back(0x00);
    expectError(full, ZemErrorCode::TrailingBytes);
}

// A varint may not be overlong (two encodings of one value) nor exceed 64 bits.
TEST(ZemCodec, UnknownTagsAndMalformedVarintsAreRefused) {
    for (int tag = 0x0C; tag <= 0xFF; ++tag) expectError(Bytes{static_cast<uint8_t>(tag)}, ZemErrorCode::BadTag);
    expectError(hex("0a 02 00 7f"), ZemErrorCode::BadTag);
    expectError(hex("04 80 00"), ZemErrorCode::BadVarint);
    expectError(hex("04 ff ff ff ff ff ff ff ff ff 02"), ZemErrorCode::BadVarint);
}

// Text on the wire must be valid UTF-8 wherever it appears; the rows are the faults a validator most often misses.
TEST(ZemCodec, MalformedUtf8IsRefusedInStringsAndKeys) {
    const std::string bad[] = {
        "\xC0\x80",          // overlong NUL
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

// A duplicate key would make the two ends disagree on a value.
TEST(ZemCodec, DuplicateKeysAreRefusedInSortedAndUnsortedInput) {
    expectError(hex("0b 02 01 61 00 01 61 01"), ZemErrorCode::DuplicateKey);
    // "a", "c", "a": the order breaks after a sorted run, and the duplicate is of a key from that run.
    expectError(hex("0b 03 01 61 00 01 63 00 01 61 00"), ZemErrorCode::DuplicateKey);
}

// Hostile counts and lengths must fail before anything is allocated for them.
TEST(ZemCodec, NestingCountsAndLengthsBeyondTheInputFailBeforeAllocating) {
    Bytes deep;
    for (size_t i = 0; i <= ZemCodec::kMaxDepth; ++i) deep.insert(deep.end(), {0x0A, 0x01});
    deep.push_back(0x00);
    expectError(deep, ZemErrorCode::TooDeep);

    expectError(hex("0a 80 80 80 80 10 00"), ZemErrorCode::CountExceedsInput);      // 2^32 items in 7 bytes
    expectError(hex("0b 03 00 00 00 00 00"), ZemErrorCode::CountExceedsInput);      // 3 entries need 6 bytes
    expectError(hex("06 80 80 80 80 80 80 80 80 80 01"), ZemErrorCode::Truncated);  // 2^63 bytes of string
    // A chain of arrays each claiming nearly as many items as bytes remain: every count passes its check, so
    // reserving by the claim would take 200 x 16 MB before the input runs out.
    Bytes chain;
    for (int level = 0; level < 200; ++level) chain.insert(chain.end(), {0x0A, 0xD8, 0xFC, 0x3C});  // 999000 items
    chain.resize(chain.size() + 999000, 0x00);
    expectError(chain, ZemErrorCode::Truncated);
}

// The frames in docs/protocol.md are what other implementations are written against.
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
    EXPECT_EQ(test::documentedBytes("request-frame"), requestFrame);
    EXPECT_EQ(test::documentedBytes("reply-frame"), replyFrame);
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

// `count` request frames with serials 1, 2, ...; frame i carries sample(i).
Bytes sampleFrames(int count) {
    Bytes bytes;
    for (int i = 1; i <= count; ++i)
        EXPECT_FALSE(ZemFrame::encode(ZemFrameKind::Request, static_cast<uint64_t>(i), 0, sample(i), bytes));
    return bytes;
}

// Takes every complete frame from `reader`, checking that frame i is request #i carrying sample(i).
size_t drainAndCheck(ZemFrameReader& reader) {
    size_t taken = 0;
    while (auto frame = reader.next()) {
        ++taken;
        EXPECT_EQ(frame->header().serial, taken);
        Result<Value> v = frame->decodePayload();
        EXPECT_TRUE(v.ok() && strictlyEqual(*v, sample(static_cast<int>(taken)))) << "frame " << taken;
    }
    return taken;
}

// A bad header is refused with the code that says what is wrong, the size limit at its boundary.
TEST(ZemFrame, BadHeadersAreRefusedWithTheirOwnCode) {
    const uint8_t m = ZemFrame::kMagic;
    const std::pair<Bytes, ZemErrorCode> cases[] = {
        {header('Z', 1, 2, 0, 2, 1, 0), ZemErrorCode::BadMagic},
        {header(m, 2, 2, 0, 2, 1, 0), ZemErrorCode::UnsupportedVersion},
        {header(m, 1, 4, 0, 2, 1, 0), ZemErrorCode::UnknownKind},
        {header(m, 1, 2, 5, 2, 1, 0), ZemErrorCode::BadHeader},  // more descriptors than a frame may carry
        {header(m, 1, 2, 0, 2, 0, 0), ZemErrorCode::BadHeader},  // request without serial
        {header(m, 1, 3, 0, 2, 5, 0), ZemErrorCode::BadHeader},  // reply to nothing
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

// The sender refuses what the receiver would, leaving its buffer alone; a frame of exactly the limit is sent.
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

// Part of a frame, even part of a header, is pending: a peer closing now cut a frame short.
TEST(ZemFrameReader, PartOfAFrameStaysPendingUntilTheRestArrives) {
    Bytes bytes = sampleFrames(1);
    size_t half = bytes.size() / 2;
    ZemFrameReader reader;
    ASSERT_FALSE(reader.feed(std::span<const uint8_t>(bytes.data(), 5)));
    EXPECT_TRUE(reader.hasPartialFrame());
    ASSERT_FALSE(reader.feed(std::span<const uint8_t>(bytes.data() + 5, half - 5)));
    EXPECT_FALSE(reader.next());
    ASSERT_FALSE(reader.feed(std::span<const uint8_t>(bytes.data() + half, bytes.size() - half)));
    EXPECT_EQ(drainAndCheck(reader), 1u);
    EXPECT_FALSE(reader.hasPartialFrame());
}

// A peer announcing a huge frame is refused as soon as its header is complete, before anything is buffered for it.
TEST(ZemFrameReader, OversizedFrameIsRefusedFromItsHeaderAlone) {
    ZemFrameReader reader;
    Bytes h = header(ZemFrame::kMagic, 1, 2, 0, ZemFrame::kMaxPayloadBytes + 1, 9, 0);
    ASSERT_FALSE(reader.feed(std::span<const uint8_t>(h.data(), 23)));
    auto error = reader.feed(std::span<const uint8_t>(h.data() + 23, 1));
    ASSERT_TRUE(error);
    EXPECT_TRUE(isZemError(*error, ZemErrorCode::FrameTooLarge));
    EXPECT_EQ(*error->localizedDescription(), "frame of 16777217 bytes exceeds limit kMaxFrameBytes (16777216)");
}

// A stream is trusted up to its first bad header and never after it.
TEST(ZemFrameReader, FramesBeforeABadHeaderSurviveAndTheErrorSticks) {
    Bytes bytes = sampleFrames(3);
    Bytes bad = header(0x00, 1, 2, 0, 2, 1, 0);
    bytes.insert(bytes.end(), bad.begin(), bad.end());
    Bytes more = sampleFrames(2);
    bytes.insert(bytes.end(), more.begin(), more.end());

    ZemFrameReader reader;
    auto error = reader.feed(bytes);
    ASSERT_TRUE(error);
    EXPECT_TRUE(isZemError(*error, ZemErrorCode::BadMagic));
    EXPECT_EQ(drainAndCheck(reader), 3u);
    // Nothing after the bad header is trusted, now or later.
    EXPECT_EQ(reader.feed(more), error);
    EXPECT_FALSE(reader.next());
}

// The payload of frame `serial` in framesOfLengths: bytes that tell frames and offsets apart.
Bytes payloadOf(uint64_t serial, size_t length) {
    Bytes payload(length);
    for (size_t i = 0; i < length; ++i) payload[i] = static_cast<uint8_t>((i * 7 + serial * 13) ^ (i >> 8));
    return payload;
}

// A stream of message frames with these payload lengths; frame i (from 1) has serial i and payloadOf(i, length).
Bytes framesOfLengths(const std::vector<size_t>& lengths) {
    Bytes stream;
    uint64_t serial = 0;
    for (size_t length : lengths) {
        std::array<uint8_t, ZemFrame::kHeaderBytes> h{};
        ZemFrame::encodeHeader({ZemFrameKind::Message, ++serial, 0, static_cast<uint32_t>(length), 0}, h);
        stream.insert(stream.end(), h.begin(), h.end());
        Bytes payload = payloadOf(serial, length);
        stream.insert(stream.end(), payload.begin(), payload.end());
    }
    return stream;
}

// Guards the reader's buffer management at each of its boundaries: payloads just under, at and over the size below
// which nothing is read in place, the first reservation, the point where the rest is reserved at once, and a large
// frame. Each stream is read in several read sizes, once all through feed() and once as the connection reads it,
// straight into payloadRoom() whenever that offers room: every frame must come out whole, in order, with nothing
// of its neighbours, and the in-place reads must carry the bulk of the large payloads.
TEST(ZemFrameReader, FramesAtEveryBufferBoundaryComeOutWholeWhetherFedOrReadInPlace) {
    const size_t first = ZemFrameReader::kInitialPayloadReserve;
    const size_t inPlace = ZemFrameReader::kInPlaceMinimum;
    const std::vector<size_t> lengths = {
        0,         1, inPlace - 1,     inPlace,       inPlace + 1,     first - 1, first,
        first + 1, 3, first + inPlace, 2 * first + 3, size_t{1} << 20, 0,         (size_t{1} << 20) + 13};
    const Bytes stream = framesOfLengths(lengths);
    for (size_t readSize : {size_t{7}, size_t{4096}, inPlace + 5, size_t{65536}, stream.size()}) {
        for (bool useRoom : {false, true}) {
            SCOPED_TRACE(::testing::Message() << "reads of " << readSize << (useRoom ? " in place" : " fed"));
            ZemFrameReader reader;
            size_t at = 0, taken = 0, placed = 0;
            while (at < stream.size()) {
                size_t n = std::min(readSize, stream.size() - at);
                std::span<uint8_t> room = useRoom ? reader.payloadRoom() : std::span<uint8_t>();
                if (!room.empty()) {
                    n = std::min(n, room.size());
                    std::copy_n(stream.begin() + static_cast<ptrdiff_t>(at), n, room.begin());
                    reader.receivedInPlace(n);
                    placed += n;
                } else {
                    ASSERT_FALSE(reader.feed(std::span<const uint8_t>(stream.data() + at, n)));
                }
                at += n;
                while (std::optional<ZemFrame> frame = reader.next()) {
                    ASSERT_LT(taken, lengths.size());
                    ++taken;
                    EXPECT_EQ(frame->serial(), taken);
                    Bytes expected = payloadOf(taken, lengths[taken - 1]);
                    EXPECT_TRUE(
                        std::equal(frame->payload().begin(), frame->payload().end(), expected.begin(), expected.end()))
                        << "frame " << taken;
                }
            }
            EXPECT_EQ(taken, lengths.size());
            EXPECT_FALSE(reader.hasPartialFrame());
            EXPECT_EQ(reader.bufferedBytes(), 0u);
            if (useRoom && readSize >= 4096 && readSize < stream.size()) {
                EXPECT_GT(placed, size_t{1} << 20) << "the large payloads went through feed";
            } else if (!useRoom) {
                EXPECT_EQ(placed, 0u);
            }
        }
    }
}

// Guards what a peer can make the reader allocate: a header announcing a large frame gets room for the first
// reservation only, the rest once that much has arrived, and never more than the frame announced. A payload with
// less than kInPlaceMinimum bytes missing is not offered for reading in place, nor one of a broken stream.
TEST(ZemFrameReader, RoomForAPayloadFollowsTheBytesThatArrive) {
    const size_t first = ZemFrameReader::kInitialPayloadReserve;
    const size_t large = size_t{1} << 20;
    Bytes stream = framesOfLengths({large});
    ZemFrameReader reader;
    EXPECT_TRUE(reader.payloadRoom().empty()) << "no header yet";
    ASSERT_FALSE(reader.feed(std::span<const uint8_t>(stream.data(), ZemFrame::kHeaderBytes + 10)));
    std::span<uint8_t> room = reader.payloadRoom();
    EXPECT_EQ(room.size(), first - 10);
    std::copy_n(stream.begin() + ZemFrame::kHeaderBytes + 10, room.size(), room.begin());
    reader.receivedInPlace(room.size());
    EXPECT_EQ(reader.bufferedBytes(), first);
    EXPECT_TRUE(reader.hasPartialFrame());
    room = reader.payloadRoom();
    EXPECT_EQ(room.size(), large - first) << "the rest at once, and not a byte more";
    const size_t upTo = large - ZemFrameReader::kInPlaceMinimum + 1;
    std::copy_n(stream.begin() + static_cast<ptrdiff_t>(ZemFrame::kHeaderBytes + first), upTo - first, room.begin());
    reader.receivedInPlace(upTo - first);
    EXPECT_TRUE(reader.payloadRoom().empty()) << "the last bytes go through feed()";
    ASSERT_FALSE(reader.feed(std::span<const uint8_t>(stream.data() + ZemFrame::kHeaderBytes + upTo, large - upTo)));
    std::optional<ZemFrame> frame = reader.next();
    ASSERT_TRUE(frame);
    EXPECT_TRUE(std::equal(frame->payload().begin(), frame->payload().end(), stream.begin() + ZemFrame::kHeaderBytes));

    Bytes broken = framesOfLengths({large});
    broken[0] = 0;
    ZemFrameReader refused;
    EXPECT_TRUE(refused.feed(broken));
    EXPECT_TRUE(refused.payloadRoom().empty());
}

}  // namespace
}  // namespace bexil
