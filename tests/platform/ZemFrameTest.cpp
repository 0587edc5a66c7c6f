#include <gtest/gtest.h>

#include <random>
#include <string>
#include <vector>

#include "ZemStrictEqual.h"
#include "platform/zem/ZemCodec.h"
#include "platform/zem/ZemFrame.h"
#include "platform/zem/ZemFrameReader.h"

namespace bexil {
namespace {

using Bytes = std::vector<uint8_t>;
using testing::strictlyEqual;

Value payload(int i) {
    return Value::dictionary({{"request", Value::string("match")},
                              {"version", Value::uint64(3)},
                              {"n", Value::int64(-i)},
                              {"pad", Value::data(Bytes(static_cast<size_t>(i) * 37 % 300, 0x5A))}});
}

struct Stream {
    Bytes bytes;
    std::vector<ZemFrameHeader> headers;
    std::vector<Value> payloads;
};

// A stream of frames of every kind and of various sizes, with the headers and payloads it holds.
Stream sampleStream(int frames) {
    Stream s;
    for (int i = 1; i <= frames; ++i) {
        auto kind = static_cast<ZemFrameKind>(1 + i % 3);
        uint64_t inReplyTo = kind == ZemFrameKind::Reply ? static_cast<uint64_t>(i - 1) : 0;
        size_t before = s.bytes.size();
        EXPECT_FALSE(ZemFrame::encode(kind, static_cast<uint64_t>(i), inReplyTo, payload(i), s.bytes));
        s.headers.push_back({kind, static_cast<uint64_t>(i), inReplyTo,
                             static_cast<uint32_t>(s.bytes.size() - before - ZemFrame::kHeaderBytes)});
        s.payloads.push_back(payload(i));
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
        EXPECT_TRUE(strictlyEqual(*v, s.payloads[i])) << "frame " << i;
    }
}

Bytes header(uint8_t magic, uint8_t version, uint8_t kind, uint8_t reserved, uint32_t length, uint64_t serial,
             uint64_t inReplyTo) {
    Bytes h = {magic, version, kind, reserved};
    for (int i = 0; i < 4; ++i) h.push_back(static_cast<uint8_t>(length >> (8 * i)));
    for (int i = 0; i < 8; ++i) h.push_back(static_cast<uint8_t>(serial >> (8 * i)));
    for (int i = 0; i < 8; ++i) h.push_back(static_cast<uint8_t>(inReplyTo >> (8 * i)));
    return h;
}

// ---- Header ----

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
    struct Case {
        Bytes bytes;
        ZemErrorCode code;
    };
    const uint8_t m = ZemFrame::kMagic;
    std::vector<Case> cases = {
        {header('Z', 1, 2, 0, 2, 1, 0), ZemErrorCode::BadMagic},
        {header(m, 2, 2, 0, 2, 1, 0), ZemErrorCode::UnsupportedVersion},
        {header(m, 1, 0, 0, 2, 1, 0), ZemErrorCode::UnknownKind},
        {header(m, 1, 4, 0, 2, 1, 0), ZemErrorCode::UnknownKind},
        {header(m, 1, 2, 1, 2, 1, 0), ZemErrorCode::BadHeader},
        {header(m, 1, 2, 0, 2, 0, 0), ZemErrorCode::BadHeader},  // request without serial
        {header(m, 1, 3, 0, 2, 5, 0), ZemErrorCode::BadHeader},  // reply to nothing
        {header(m, 1, 1, 0, 2, 5, 4), ZemErrorCode::BadHeader},  // message claiming to be a reply
        {header(m, 1, 2, 0, ZemFrame::kMaxPayloadBytes + 1, 1, 0), ZemErrorCode::FrameTooLarge},
        {header(m, 1, 2, 0, 0xFFFFFFFF, 1, 0), ZemErrorCode::FrameTooLarge},
    };
    for (const auto& c : cases) {
        Result<ZemFrameHeader> h = ZemFrame::decodeHeader(std::span<const uint8_t, 24>(c.bytes.data(), 24));
        ASSERT_FALSE(h.ok());
        EXPECT_TRUE(isZemError(h.error(), c.code)) << h.error().description();
    }
    // The largest legal payload is accepted, and a message may have serial 0.
    EXPECT_TRUE(ZemFrame::decodeHeader(
                    std::span<const uint8_t, 24>(header(m, 1, 1, 0, ZemFrame::kMaxPayloadBytes, 0, 0).data(), 24))
                    .ok());
}

// ---- Encoding ----

TEST(ZemFrame, EncodeRefusesNonDictionariesBadSerialsAndOversizedPayloads) {
    Bytes out = {7};
    auto error = ZemFrame::encode(ZemFrameKind::Message, 1, 0, Value::array({}), out);
    ASSERT_TRUE(error);
    EXPECT_TRUE(isZemError(*error, ZemErrorCode::NotDictionary));
    error = ZemFrame::encode(ZemFrameKind::Reply, 2, 0, Value::emptyDictionary(), out);
    ASSERT_TRUE(error);
    EXPECT_TRUE(isZemError(*error, ZemErrorCode::BadHeader));

    Value big = Value::dictionary({{"blob", Value::data(Bytes(ZemFrame::kMaxFrameBytes, 0))}});
    error = ZemFrame::encode(ZemFrameKind::Request, 3, 0, big, out);
    ASSERT_TRUE(error);
    EXPECT_TRUE(isZemError(*error, ZemErrorCode::FrameTooLarge));
    EXPECT_NE(error->localizedDescription()->find("exceeds limit kMaxFrameBytes"), std::string::npos);
    EXPECT_EQ(out, Bytes{7});

    // A payload that brings the frame to exactly the limit is fine: dictionary (2) + key (5) + data tag and
    // 4-byte length (5) + the blob.
    size_t blob = ZemFrame::kMaxPayloadBytes - 2 - 5 - 5;
    Value exact = Value::dictionary({{"blob", Value::data(Bytes(blob, 0))}});
    Bytes frame;
    ASSERT_FALSE(ZemFrame::encode(ZemFrameKind::Request, 3, 0, exact, frame));
    EXPECT_EQ(frame.size(), ZemFrame::kMaxFrameBytes);
}

TEST(ZemFrame, PayloadThatIsNotADictionaryIsAProtocolErrorAndDescriptionsNameKindSerialsAndSize) {
    ZemFrame frame({ZemFrameKind::Message, 1, 0, 2}, Bytes{0x0A, 0x00});
    Result<Value> v = frame.decodePayload();
    ASSERT_FALSE(v.ok());
    EXPECT_TRUE(isZemError(v.error(), ZemErrorCode::NotDictionary));
    ZemFrame broken({ZemFrameKind::Message, 1, 0, 1}, Bytes{0x0B});
    EXPECT_TRUE(isZemError(broken.decodePayload().error(), ZemErrorCode::Truncated));

    EXPECT_EQ(ZemFrame({ZemFrameKind::Request, 12, 0, 3}, Bytes(3)).description(), "request #12 (3 bytes)");
    EXPECT_EQ(ZemFrame({ZemFrameKind::Reply, 4, 12, 0}, Bytes{}).description(), "reply #4 to #12 (0 bytes)");
}

// ---- Reader ----

TEST(ZemFrameReader, SameFramesWhateverTheChunking) {
    Stream s = sampleStream(40);
    {
        ZemFrameReader reader;
        ASSERT_FALSE(reader.feed(s.bytes));
        expectStream(s, drain(reader));
        EXPECT_FALSE(reader.hasPartialFrame());
        EXPECT_EQ(reader.bufferedBytes(), 0u);
    }
    {
        ZemFrameReader reader;
        std::vector<ZemFrame> frames;
        for (uint8_t byte : s.bytes) {
            ASSERT_FALSE(reader.feed(std::span<const uint8_t>(&byte, 1)));
            while (auto f = reader.next()) frames.push_back(std::move(*f));  // taken as soon as complete
        }
        expectStream(s, frames);
    }
    std::mt19937 rng(20261123);
    for (int round = 0; round < 20; ++round) {
        ZemFrameReader reader;
        size_t at = 0;
        while (at < s.bytes.size()) {
            size_t n = std::min<size_t>(s.bytes.size() - at, rng() % 97);
            ASSERT_FALSE(reader.feed(std::span<const uint8_t>(s.bytes.data() + at, n)));
            at += n;
        }
        expectStream(s, drain(reader));
    }
}

TEST(ZemFrameReader, HalfAFrameStaysPendingUntilTheRestArrives) {
    Stream s = sampleStream(1);
    size_t half = s.bytes.size() / 2;
    ZemFrameReader reader;
    ASSERT_FALSE(reader.feed(std::span<const uint8_t>(s.bytes.data(), half)));
    EXPECT_FALSE(reader.next());
    EXPECT_TRUE(reader.hasPartialFrame());
    EXPECT_EQ(reader.bufferedBytes(), half - ZemFrame::kHeaderBytes);
    ASSERT_FALSE(reader.feed(std::span<const uint8_t>(s.bytes.data() + half, s.bytes.size() - half)));
    expectStream(s, drain(reader));
    EXPECT_FALSE(reader.hasPartialFrame());

    // Only part of a header counts as pending too: a peer closing now cut a frame short.
    ZemFrameReader early;
    ASSERT_FALSE(early.feed(std::span<const uint8_t>(s.bytes.data(), 5)));
    EXPECT_TRUE(early.hasPartialFrame());
    EXPECT_EQ(early.bufferedBytes(), 5u);
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
    auto again = reader.feed(more.bytes);
    ASSERT_TRUE(again);
    EXPECT_EQ(*again, *error);
    EXPECT_FALSE(reader.next());
}

TEST(ZemFrameReader, EmptyPayloadCompletesWithItsHeader) {
    // The header alone is a complete frame; decoding then tells the empty payload apart from a dictionary.
    Bytes h = header(ZemFrame::kMagic, 1, 1, 0, 0, 1, 0);
    ZemFrameReader reader;
    ASSERT_FALSE(reader.feed(h));
    auto frame = reader.next();
    ASSERT_TRUE(frame);
    EXPECT_TRUE(frame->payload().empty());
    EXPECT_TRUE(isZemError(frame->decodePayload().error(), ZemErrorCode::Truncated));
}

}  // namespace
}  // namespace bexil
