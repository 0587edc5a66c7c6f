// Dictionary entries kept encoded and merged into dictionaries later: what a merge writes must be exactly what
// encoding the merged dictionary writes, since peers read it with the same decoder and replies are compared byte
// for byte by clients that cache them.

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "platform/zem/ZemCodec.h"
#include "platform/zem/ZemFrame.h"

namespace bexil {
namespace {

using Bytes = std::vector<uint8_t>;

Bytes encoded(const Value& v) {
    Result<Bytes> bytes = ZemCodec::encode(v);
    EXPECT_TRUE(bytes.ok()) << (bytes.ok() ? "" : bytes.error().description());
    return bytes.ok() ? *bytes : Bytes{};
}

ZemCodec::Entries kept(const Value& dictionary) {
    Result<ZemCodec::Entries> entries = ZemCodec::encodeEntries(dictionary);
    EXPECT_TRUE(entries.ok()) << (entries.ok() ? "" : entries.error().description());
    return entries.ok() ? *entries : ZemCodec::Entries{};
}

Value nested(size_t levels) {
    Value v = Value::null();
    for (size_t i = 0; i < levels; ++i) v = Value::array({v});
    return v;
}

Value withEntries(const Value& dictionary, const Value& extra) {
    MutableDictionary merged(dictionary);
    for (const DictionaryEntry& e : extra.entries()) merged.set(e.key, e.value);
    return merged.take();
}

// Extra entries that sort before, between and after the kept ones, that replace one, or none at all: the merge is
// byte for byte the encoding of the merged dictionary, its size is predicted, and it appends to what the buffer
// held. Keys compare as bytes, so a key with a byte above 0x7F sorts after every ASCII one.
TEST(ZemKeptEntries, MergeWritesWhatEncodingTheMergedDictionaryWrites) {
    const Value base = Value::dictionary({
        {"bundleInfo", Value::dictionary({{"name", Value::string("Ölpreis")}, {"n", Value::uint64(300)}})},
        {"identifier", Value::string("com.example.one")},
        {"lastmodified", Value::int64(-7)},
        {"path", Value::string("/Applications/A.app/PlugIns/P.bxplugin")},
        {"uuid", Value::string("0F1E2D3C-4B5A-6978-8796-A5B4C3D2E1F0")},
    });
    const Value extras[] = {
        Value::emptyDictionary(),
        Value::dictionary({{"annotations", Value::dictionary({{"elected", Value::int64(1)}})}}),
        Value::dictionary({{"extensions", Value::dictionary({{".", Value::string("token")}})},
                           {"localizedDisplayName", Value::string("Eins")},
                           {"overrider", Value::string("AB")},
                           {"zzz", Value::null()},
                           {"\xC3\xA9t\xC3\xA9", Value::boolean(true)}}),
        Value::dictionary({{"identifier", Value::string("replaced")}, {"a", Value::real(0.5)}}),
    };
    const ZemCodec::Entries entries = kept(base);
    ASSERT_EQ(entries.count(), base.count());
    EXPECT_EQ(entries.key(0), "bundleInfo");
    EXPECT_EQ(entries.key(4), "uuid");
    for (const Value& extra : extras) {
        Bytes out = {0xEE};
        ASSERT_FALSE(ZemCodec::encodeMerged(entries, extra, out));
        Bytes expected = {0xEE};
        Bytes whole = encoded(withEntries(base, extra));
        expected.insert(expected.end(), whole.begin(), whole.end());
        EXPECT_EQ(out, expected) << extra.description();
        Result<size_t> size = ZemCodec::mergedSize(entries, extra);
        ASSERT_TRUE(size.ok());
        EXPECT_EQ(*size, whole.size());
    }
    // Nothing kept: the merge is the encoding of the extra entries alone.
    Bytes alone;
    ASSERT_FALSE(ZemCodec::encodeMerged(ZemCodec::Entries{}, extras[2], alone));
    EXPECT_EQ(alone, encoded(extras[2]));
}

// Entries appended one by one (as a reply's pre-encoded matches are) merge like those of a dictionary; a frame
// around an encoded payload is the frame around the value.
TEST(ZemKeptEntries, AppendedEntriesHeadersAndEncodedFramesMatchTheValuePath) {
    const Value list = Value::array({Value::string("x"), Value::dictionary({{"k", Value::uint64(1)}})});
    ZemCodec::Entries entries;
    ASSERT_FALSE(ZemCodec::appendEntry(entries, "list", encoded(list), 2));
    ASSERT_FALSE(ZemCodec::appendEntry(entries, "name", encoded(Value::string("n")), 0));
    const Value extra = Value::dictionary({{"generation", Value::uint64(9)}, {"more", Value::null()}});
    Bytes merged;
    ASSERT_FALSE(ZemCodec::encodeMerged(entries, extra, merged));
    const Value whole = Value::dictionary(
        {{"generation", Value::uint64(9)}, {"list", list}, {"more", Value::null()}, {"name", Value::string("n")}});
    EXPECT_EQ(merged, encoded(whole));
    Result<Value> decoded = ZemCodec::decode(merged);
    ASSERT_TRUE(decoded.ok());
    EXPECT_EQ(*decoded, whole);

    Bytes fromValue = {7};
    Bytes fromBytes = {7};
    ASSERT_FALSE(ZemFrame::encode(ZemFrameKind::Reply, 5, 4, whole, fromValue));
    ASSERT_FALSE(ZemFrame::encodeEncoded(ZemFrameKind::Reply, 5, 4, merged, fromBytes));
    EXPECT_EQ(fromBytes, fromValue);
    // The same dictionary written by hand, as a reply too large to copy once more is written: its header, then
    // entries in key order, one of them an array whose header and items are appended separately.
    Bytes byHand;
    ZemCodec::appendDictionaryHeader(4, byHand);
    const ZemCodec::Entries others = kept(extra);
    byHand.insert(byHand.end(), others.entry(0).begin(), others.entry(0).end());
    ZemCodec::Entries listKey;
    ASSERT_FALSE(ZemCodec::beginEntry(listKey, "list", 2));
    byHand.insert(byHand.end(), listKey.bytes.begin(), listKey.bytes.end());
    ZemCodec::appendArrayHeader(2, byHand);
    for (const Value& item : list.items()) {
        Bytes one = encoded(item);
        byHand.insert(byHand.end(), one.begin(), one.end());
    }
    byHand.insert(byHand.end(), others.entry(1).begin(), others.entry(1).end());
    byHand.insert(byHand.end(), entries.entry(1).begin(), entries.entry(1).end());
    EXPECT_EQ(byHand, encoded(whole));

    // Only a dictionary is a payload.
    Bytes refused = {7};
    std::optional<Error> error = ZemFrame::encodeEncoded(ZemFrameKind::Reply, 5, 4, encoded(list), refused);
    ASSERT_TRUE(error);
    EXPECT_TRUE(isZemError(*error, ZemErrorCode::NotDictionary));
    EXPECT_EQ(refused, Bytes{7});
}

// What the encoder refuses is refused here too, and the buffer is left as it was: text that is not UTF-8 in kept or
// extra entries, and nesting that passes the limit only once the kept entries sit deeper in the message than the
// dictionary they came from.
TEST(ZemKeptEntries, RefusesWhatThePeerWouldRejectLeavingTheBufferAlone) {
    EXPECT_FALSE(ZemCodec::encodeEntries(Value::dictionary({{"k", Value::string("\xC0\x80")}})).ok());
    EXPECT_FALSE(ZemCodec::encodeEntries(Value::dictionary({{"\xFF", Value::null()}})).ok());
    ZemCodec::Entries entries;
    std::optional<Error> badKey = ZemCodec::appendEntry(entries, "\xED\xA0\x80", encoded(Value::null()), 0);
    ASSERT_TRUE(badKey);
    EXPECT_TRUE(isZemError(*badKey, ZemErrorCode::InvalidUtf8));
    EXPECT_EQ(entries.count(), 0u);

    const ZemCodec::Entries plain = kept(Value::dictionary({{"k", Value::string("v")}}));
    Bytes out = {1, 2};
    std::optional<Error> error =
        ZemCodec::encodeMerged(plain, Value::dictionary({{"x", Value::string("\xF8\x88\x80\x80\x80")}}), out);
    ASSERT_TRUE(error);
    EXPECT_TRUE(isZemError(*error, ZemErrorCode::InvalidUtf8));
    EXPECT_EQ(out, (Bytes{1, 2}));

    // A value nesting as deep as a top-level dictionary allows is kept, but cannot go one level deeper.
    const ZemCodec::Entries deep = kept(Value::dictionary({{"d", nested(ZemCodec::kMaxDepth - 1)}}));
    Bytes atTop;
    EXPECT_FALSE(ZemCodec::encodeMerged(deep, Value::emptyDictionary(), atTop));
    EXPECT_TRUE(ZemCodec::decode(atTop).ok());
    error = ZemCodec::encodeMerged(deep, Value::emptyDictionary(), out, 1);
    ASSERT_TRUE(error);
    EXPECT_TRUE(isZemError(*error, ZemErrorCode::TooDeep));
    EXPECT_FALSE(ZemCodec::mergedSize(deep, Value::emptyDictionary(), 1).ok());
    // The extra entries are checked at the level they land on.
    error = ZemCodec::encodeMerged(plain, Value::dictionary({{"d", nested(ZemCodec::kMaxDepth - 1)}}), out, 1);
    ASSERT_TRUE(error);
    EXPECT_TRUE(isZemError(*error, ZemErrorCode::TooDeep));
    EXPECT_EQ(out, (Bytes{1, 2}));
}

}  // namespace
}  // namespace bexil
