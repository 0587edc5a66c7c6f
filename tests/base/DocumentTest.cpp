#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cmath>
#include <filesystem>
#include <fstream>
#include <limits>
#include <random>

#include "TestSupport.h"
#include "base/Document.h"

namespace bexil {
namespace {

using test::dict;

Value bytes(std::initializer_list<uint8_t> list) { return Value::data(std::vector<uint8_t>(list)); }

// Writes, reads back and returns what was read; fails the test when either step fails.
Value roundTrip(const Value& value) {
    Result<std::string> text = Document::write(value);
    EXPECT_TRUE(text.ok()) << text.error().description();
    if (!text.ok()) return Value();
    Result<Value> back = Document::read(*text);
    EXPECT_TRUE(back.ok()) << back.error().description() << "\n" << *text;
    return back.ok() ? *back : Value();
}

std::string message(const Error& error) { return error.localizedDescription().value_or(""); }

std::string wrap(std::string_view inner) { return "<vrec>" + std::string(inner) + "</vrec>"; }

Value nestedArrays(size_t depth) {
    Value v = Value::string("bottom");
    for (size_t i = 0; i < depth; ++i) v = Value::array({v});
    return v;
}

// ---- round trips ----

TEST(DocumentRoundTrip, ScalarsOfEveryKind) {
    std::vector<Value> values = {
        Value::null(),
        Value::boolean(true),
        Value::boolean(false),
        Value::int64(0),
        Value::int64(-1),
        Value::int64(std::numeric_limits<int64_t>::min()),
        Value::int64(std::numeric_limits<int64_t>::max()),
        Value::uint64(std::numeric_limits<uint64_t>::max()),
        Value::uint64(uint64_t(1) << 63),
        Value::real(0.1),
        Value::real(-2.5e-300),
        Value::real(std::numeric_limits<double>::max()),
        Value::real(std::numeric_limits<double>::denorm_min()),
        Value::real(std::numeric_limits<double>::infinity()),
        Value::real(-std::numeric_limits<double>::infinity()),
        Value::string(""),
        Value::string("plain"),
        Value::string("  \n\t  "),
        Value::string("  padded  "),
        Value::string("<&>\"' ]]> &amp; <!-- no comment -->"),
        Value::string("line\r\nends\rand\nmore\r"),
        Value::string("h\xC3\xA9llo \xF0\x9F\x98\x80 \xE2\x80\xA8"),
        bytes({}),
        bytes({0}),
        bytes({0, 1}),
        bytes({0, 1, 2}),
        bytes({0xFF, 0xFE, 0x00, 0x3C, 0x26}),
    };
    for (const Value& v : values) {
        Value back = roundTrip(v);
        EXPECT_EQ(back, v) << v.description();
        EXPECT_EQ(back.kind(), v.kind() == ValueKind::UInt64 && v.numberAsInt64() ? ValueKind::Int64 : v.kind())
            << v.description();
    }
}

TEST(DocumentRoundTrip, RealsKeepSignOfZeroAndNaN) {
    Value negativeZero = roundTrip(Value::real(-0.0));
    EXPECT_TRUE(std::signbit(*negativeZero.getReal()));
    Value nan = roundTrip(Value::real(std::nan("")));
    ASSERT_TRUE(nan.getReal());
    EXPECT_TRUE(std::isnan(*nan.getReal()));
}

TEST(DocumentRoundTrip, DatesComeBackAsTheSameDoubleAndUseTheShortReadableForm) {
    const double dates[] = {
        0,
        1795428205,  // 2026-11-23T10:03:25Z
        1795428205.5,
        1795428205.123456,      // microseconds
        1795428205.1234567891,  // finer than microseconds: the fraction is written out exactly
        -1.5,
        -86400.25,
        -62167219200,      // 0000-01-01T00:00:00Z
        253402300799.999,  // the last writable millisecond
        951782400,         // 2000-02-29, a leap day
    };
    for (double d : dates) {
        Value back = roundTrip(Value::date(Date{d}));
        ASSERT_TRUE(back.getDate()) << d;
        EXPECT_EQ(std::bit_cast<uint64_t>(back.getDate()->secondsSince1970), std::bit_cast<uint64_t>(d)) << d;
    }
    for (auto [seconds, form] : {std::pair{1795428205.0, "2026-11-23T10:03:25Z"},
                                 {1795428205.25, "2026-11-23T10:03:25.25Z"},
                                 {1795428205.123456, "2026-11-23T10:03:25.123456Z"}}) {
        std::string text = Document::write(Value::date(Date{seconds})).value();
        EXPECT_NE(text.find(std::string("<date>") + form + "</date>"), std::string::npos) << text;
    }
}

TEST(DocumentRoundTrip, NestedContainersOfMixedKindsBigDataAndManyEntries) {
    Value extension = dict({{"added", Value::date(Date{1795428205.5})},
                            {"blob", bytes({0, 1, 2, 255})},
                            {"empty-array", Value::emptyArray()},
                            {"empty-dict", Value::emptyDictionary()},
                            {"", Value::string("empty key")},
                            {"list", Value::array({Value::boolean(true), Value::real(0.25), Value::null(),
                                                   Value::array({Value::array({Value::int64(-7)})}),
                                                   dict({{"k<&>", Value::string("v")}})})}});
    std::mt19937 random(7);
    std::vector<uint8_t> blob(1024 * 1024 + 1);
    for (uint8_t& b : blob) b = static_cast<uint8_t>(random());
    MutableDictionary map;
    map.set("com.example.plugin", dict({{"election", Value::int64(1)}, {"extension", extension}}));
    for (int i = 0; i < 10000; ++i) {
        map.set("com.example.plugin-" + std::to_string(i),
                dict({{"election", Value::int64(i % 3)}, {"extension", dict({{"n", Value::int64(i)}})}}));
    }
    Value document =
        dict({{"version", Value::int64(16)}, {"blob", Value::data(std::move(blob))}, {"data", map.take()}});
    EXPECT_EQ(roundTrip(document), document);
}

TEST(DocumentRoundTrip, WritesTheDocumentedLayout) {
    Value v =
        dict({{"b", Value::array({Value::boolean(false), Value::string("x & y")})}, {"a", Value::emptyDictionary()}});
    auto text = Document::write(v);
    ASSERT_TRUE(text.ok());
    EXPECT_EQ(*text,
              "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
              "<vrec version=\"1\">\n"
              "<dict>\n"
              "\t<key>a</key>\n"
              "\t<dict/>\n"
              "\t<key>b</key>\n"
              "\t<array>\n"
              "\t\t<false/>\n"
              "\t\t<string>x &amp; y</string>\n"
              "\t</array>\n"
              "</dict>\n"
              "</vrec>\n");
}

// ---- reading what others may write ----

TEST(DocumentRead, AcceptsTheLatitudeXmlAllows) {
    std::string text =
        "\xEF\xBB\xBF<?xml version=\"1.0\" encoding=\"UTF-8\"?>\r\n"
        "<!DOCTYPE vrec>\r\n"
        "<!-- written by hand -->\r\n"
        "<vrec version=\"1\"><dict>\r\n"
        "  <key>n</key> <integer> -0 </integer>\r\n"
        "  <key>u</key><integer>18446744073709551615</integer>\r\n"
        "  <key>s</key><string>a<!-- split -->b<![CDATA[<c&d>]]>&#x41;&#66;&#13;</string>\r\n"
        "  <key>d</key><data>\r\n  AAEC\r\n  /w==\r\n</data>\r\n"
        "  <key>t</key><date> 2026-11-23T10:03:25.000Z </date>\r\n"
        "  <key>r</key><real>\t2.5E+2 </real>\r\n"
        "  <key>e</key><string>&foo;</string>\r\n"
        "</dict></vrec>\r\n<!-- trailing comment -->\r\n";
    Result<Value> v = Document::read(text);
    ASSERT_TRUE(v.ok()) << v.error().description();
    EXPECT_EQ(v->get("n"), Value::int64(0));
    EXPECT_EQ(v->get("u").kind(), ValueKind::UInt64);
    EXPECT_EQ(v->get("u"), Value::uint64(std::numeric_limits<uint64_t>::max()));
    EXPECT_EQ(v->get("s"), Value::string("ab<c&d>AB\r"));
    EXPECT_EQ(v->get("d"), bytes({0, 1, 2, 255}));
    EXPECT_EQ(v->get("t"), Value::date(Date{1795428205}));
    EXPECT_EQ(v->get("r").kind(), ValueKind::Real);
    EXPECT_EQ(v->get("r"), Value::real(250));
    // No DTD is processed: an unknown entity is plain text and comes back as written.
    EXPECT_EQ(v->get("e"), Value::string("&foo;"));
    EXPECT_EQ(roundTrip(*v), *v);
}

struct MalformedCase {
    const char* name;
    std::string text;
    int code;
    std::string expected;  // part of the message
};

TEST(DocumentRead, MalformedInputIsAnErrorNamingWhatAndWhere) {
    const std::vector<MalformedCase> cases = {
        {"empty", "", 1, "no root element"},
        {"not xml", "<vrec><dict></vrec>", 1, "malformed XML: Start-end tags mismatch (byte"},
        {"unknown root", "<plist><dict/></plist>", 1, "unknown root element <plist>"},
        {"second root", "<vrec><null/></vrec><vrec/>", 1, "a second element <vrec> after the root"},
        {"trailing garbage", "<vrec><null/></vrec>junk", 1, "text \"junk\" outside the root element (byte 20)"},
        {"root version", "<vrec version=\"2\"><null/></vrec>", 1, "unsupported document version \"2\""},
        {"root attribute", "<vrec lang=\"en\"><null/></vrec>", 1, "unknown attribute \"lang\" on <vrec>"},
        {"no value", "<vrec>  </vrec>", 1, "<vrec> holds no value"},
        {"two values", wrap("<null/><null/>"), 1, "more than one value in <vrec>"},
        {"text in root", wrap("<null/>x"), 1, "text \"x\" in <vrec>"},
        {"unknown element", wrap("<dict><key>a</key><uuid>x</uuid></dict>"), 1,
         "unknown element <uuid> at root[\"a\"] (byte 24)"},
        {"key without value at end", wrap("<dict><key>a</key></dict>"), 1, "key \"a\" without a value"},
        {"key without value before key", wrap("<dict><key>a</key><key>b</key><true/></dict>"), 1,
         "key \"a\" without a value"},
        {"value without key", wrap("<dict><string>x</string></dict>"), 1, "a value without a key in <dict>"},
        {"two values for one key", wrap("<dict><key>a</key><true/><false/></dict>"), 1, "two values for key \"a\""},
        {"duplicate key", wrap("<dict><key>a</key><true/><key>b</key><true/><key>a</key><false/></dict>"), 1,
         "duplicate key \"a\""},
        {"key outside dict", wrap("<array><key>a</key></array>"), 1, "a <key> outside a <dict> at root[0]"},
        {"text in dict", wrap("<dict>oops<key>a</key><true/></dict>"), 1, "text \"oops\" inside <dict>"},
        {"element in string", wrap("<string>a<b/>c</string>"), 1, "element <b> inside <string>"},
        {"attribute on value", wrap("<string xml:space=\"preserve\">a</string>"), 1,
         "unexpected attribute \"xml:space\" on <string>"},
        {"content in true", wrap("<true>yes</true>"), 1, "<true> must be empty"},
        {"integer too large", wrap("<integer>18446744073709551616</integer>"), 1,
         "integer out of range \"18446744073709551616\""},
        {"integer too small", wrap("<integer>-9223372036854775809</integer>"), 1, "integer out of range"},
        {"integer with plus", wrap("<integer>+5</integer>"), 1, "bad integer \"+5\""},
        {"integer with letters", wrap("<array><integer>1</integer><integer>12a</integer></array>"), 1,
         "bad integer \"12a\" at root[1] (byte 33)"},
        {"empty integer", wrap("<integer/>"), 1, "bad integer \"\""},
        {"lone minus", wrap("<integer>-</integer>"), 1, "bad integer \"-\""},
        {"real twice pointed", wrap("<real>1.2.3</real>"), 1, "bad real \"1.2.3\""},
        {"real spelled long", wrap("<real>infinity</real>"), 1, "bad real \"infinity\""},
        {"real overflow", wrap("<real>1e999</real>"), 1, "bad real \"1e999\""},
        {"base64 length", wrap("<data>AAE</data>"), 1, "bad base64 data: length is not a multiple of four"},
        {"base64 inner padding", wrap("<data>AA==AAAA</data>"), 1, "bad base64 data: text after '=' padding"},
        {"base64 early padding", wrap("<data>A===</data>"), 1, "misplaced '=' padding"},
        {"base64 alphabet", wrap("<data>AA*A</data>"), 1, "character \"*\" is not base64"},
        {"date month", wrap("<date>2026-13-01T00:00:00Z</date>"), 1, "bad date \"2026-13-01T00:00:00Z\""},
        {"date not leap", wrap("<date>2026-02-29T00:00:00Z</date>"), 1, "bad date"},
        {"date leap second", wrap("<date>2026-12-31T23:59:60Z</date>"), 1, "bad date"},
        {"date no zone", wrap("<date>2026-11-23T10:03:25</date>"), 1, "bad date"},
        {"date empty fraction", wrap("<date>2026-11-23T10:03:25.Z</date>"), 1, "bad date"},
        {"date rounding past 9999", wrap("<date>9999-12-31T23:59:59.999999999Z</date>"), 1,
         "date \"9999-12-31T23:59:59.999999999Z\" out of range"},
        {"date space", wrap("<date>2026-11-23 10:03:25Z</date>"), 1, "bad date"},
        {"nul reference", wrap("<string>a&#0;b</string>"), 1, "character reference \"&#0;\" names a character"},
        {"control reference", wrap("<string>&#x1;</string>"), 1, "character reference \"&#x1;\""},
        {"huge reference", wrap("<string>&#99999999999;</string>"), 1, "character reference"},
        {"surrogate reference", wrap("<string>&#xD800;</string>"), 1, "character reference"},
        {"raw control character", wrap("<string>a\x01</string>"), 1, "character U+0001, which XML 1.0 cannot carry"},
        {"raw nul", std::string("<vrec><string>a\0b</string></vrec>", 29), 1, "character U+0000"},
        {"invalid utf-8", wrap("<string>\xC3</string>"), 1, "invalid UTF-8 in the text (byte 14)"},
        {"overlong utf-8", wrap("<string>\xC0\xBC</string>"), 1, "invalid UTF-8"},
        {"utf-8 surrogate", wrap("<string>\xED\xA0\x80</string>"), 1, "invalid UTF-8"},
        {"noncharacter", wrap("<string>\xEF\xBF\xBF</string>"), 1, "U+FFFF"},
    };
    for (const MalformedCase& c : cases) {
        Result<Value> v = Document::read(c.text);
        ASSERT_FALSE(v.ok()) << c.name << ": read as " << v->description();
        EXPECT_EQ(v.error().domain(), "BexilDocument") << c.name;
        EXPECT_EQ(v.error().code(), c.code) << c.name;
        EXPECT_NE(message(v.error()).find(c.expected), std::string::npos)
            << c.name << ": " << message(v.error()) << "\n  expected to contain: " << c.expected;
    }
}

TEST(DocumentRead, ErrorsDeepInsideNameThePath) {
    std::string text = wrap(
        "<dict><key>data</key><dict><key>com.example.a</key><dict><key>extension</key>"
        "<array><true/><date>yesterday</date></array></dict></dict></dict>");
    Result<Value> v = Document::read(text);
    ASSERT_FALSE(v.ok());
    EXPECT_EQ(message(v.error()).rfind("bad date \"yesterday\"", 0), 0u) << message(v.error());
    EXPECT_NE(message(v.error()).find(" at root[\"data\"][\"com.example.a\"][\"extension\"][1]"), std::string::npos)
        << message(v.error());
    size_t offset = text.find("<date>");
    EXPECT_NE(message(v.error()).find("(byte " + std::to_string(offset) + ")"), std::string::npos)
        << message(v.error());
}

TEST(DocumentRead, LongTextInMessagesIsCutAtACharacterBoundary) {
    std::string key(39, 'k');
    key += "\xC3\xA9tail";  // the 40-byte cut would fall inside the two-byte character
    Result<Value> v = Document::read(wrap("<dict><key>" + key + "</key><integer>x</integer></dict>"));
    ASSERT_FALSE(v.ok());
    EXPECT_NE(message(v.error()).find("at root[\"" + std::string(39, 'k') + "...\"]"), std::string::npos)
        << message(v.error());
}

// ---- depth and size limits ----

std::string nestedText(size_t depth, bool closed) {
    std::string text = "<vrec>";
    for (size_t i = 0; i < depth; ++i) text += "<array>";
    if (closed)
        for (size_t i = 0; i < depth; ++i) text += "</array>";
    return text + (closed ? "</vrec>" : "");
}

TEST(DocumentLimits, NestingUpToTheLimitRoundTripsAndDeeperIsRefusedReadingAndWriting) {
    Value deepest = nestedArrays(kMaxDocumentDepth);
    EXPECT_EQ(roundTrip(deepest), deepest);
    EXPECT_TRUE(Document::read(nestedText(kMaxDocumentDepth, true)).ok());

    Result<std::string> written = Document::write(dict({{"x", deepest}}));
    ASSERT_FALSE(written.ok());
    EXPECT_EQ(written.error().code(), kDocumentLimitExceeded);
    EXPECT_NE(message(written.error()).find("nested deeper than 512 at root[\"x\"][0]"), std::string::npos)
        << message(written.error());

    Result<Value> read = Document::read(nestedText(kMaxDocumentDepth + 1, true));
    ASSERT_FALSE(read.ok());
    EXPECT_EQ(read.error().code(), kDocumentLimitExceeded);
    EXPECT_NE(message(read.error()).find("nested deeper than 512"), std::string::npos);

    // Hostile nesting never exhausts the stack, closed or not.
    for (bool closed : {true, false}) {
        Result<Value> hostile = Document::read(nestedText(200000, closed));
        ASSERT_FALSE(hostile.ok());
        EXPECT_EQ(hostile.error().code(), closed ? kDocumentLimitExceeded : kDocumentMalformed);
    }
}

TEST(DocumentLimits, OversizedDocumentsAreRefused) {
    std::string huge(kMaxDocumentBytes + 1, ' ');
    Result<Value> read = Document::read(huge);
    ASSERT_FALSE(read.ok());
    EXPECT_EQ(read.error().code(), kDocumentLimitExceeded);

    Result<std::string> written = Document::write(Value::data(std::vector<uint8_t>(kMaxDocumentBytes / 4 * 3)));
    ASSERT_FALSE(written.ok());
    EXPECT_EQ(written.error().code(), kDocumentLimitExceeded);
}

// ---- values that cannot be written ----

TEST(DocumentWrite, UnrepresentableValuesAreErrorsNamingWhere) {
    Uuid uuid = *Uuid::parse("01234567-89AB-CDEF-0123-456789ABCDEF");
    struct Case {
        const char* name;
        Value value;
        std::string expected;
    };
    const std::vector<Case> cases = {
        {"uuid deep inside",
         dict({{"data", dict({{"p", dict({{"extension", Value::array({Value::int64(1), Value::uuid(uuid)})}})}})}}),
         "a uuid (01234567-89AB-CDEF-0123-456789ABCDEF), which a document cannot represent, at "
         "root[\"data\"][\"p\"][\"extension\"][1]"},
        {"uuid at the root", Value::uuid(uuid), "which a document cannot represent, at root"},
        {"control character", Value::array({Value::string("ok"), Value::string("bell\x07")}),
         "a string with character U+0007, which XML 1.0 cannot carry, at byte 4 of \"bell\\x07\" at root[1]"},
        {"nul in a key", dict({{std::string("a\0b", 3), Value::null()}}), "a key with character U+0000"},
        {"invalid utf-8", dict({{"k", Value::string("\xFF")}}), "a string with invalid UTF-8 at byte 0"},
        {"date too late", Value::date(Date{253402300800.0}), "a date outside the years 0000-9999"},
        {"date too early", Value::date(Date{-62167219201.0}), "a date outside the years 0000-9999"},
        {"date not finite", Value::date(Date{std::numeric_limits<double>::infinity()}), "a date outside"},
    };
    for (const Case& c : cases) {
        Result<std::string> text = Document::write(c.value);
        ASSERT_FALSE(text.ok()) << c.name << " was written as " << *text;
        EXPECT_EQ(text.error().domain(), "BexilDocument") << c.name;
        EXPECT_EQ(text.error().code(), kDocumentUnrepresentable) << c.name;
        EXPECT_NE(message(text.error()).find(c.expected), std::string::npos)
            << c.name << ": " << message(text.error()) << "\n  expected to contain: " << c.expected;
    }
}

// ---- files ----

class DocumentFileTest : public ::testing::Test {
  protected:
    test::TempDir tmp_{"bexil-document"};
    std::filesystem::path directory_ = tmp_.path();
    std::filesystem::path path_ = directory_ / "Annotations.vrec";

    std::string contents() const { return test::readText(path_); }
    std::vector<std::string> names() const {
        std::vector<std::string> out;
        for (const auto& entry : std::filesystem::directory_iterator(directory_))
            out.push_back(entry.path().filename().string());
        std::sort(out.begin(), out.end());
        return out;
    }
};

TEST_F(DocumentFileTest, WriteThenReadGivesTheValueBack) {
    Value first = dict({{"version", Value::int64(16)}, {"data", Value::emptyDictionary()}});
    ASSERT_FALSE(Document::writeFileAtomically(path_, first));
    Value second = dict({{"version", Value::int64(16)}, {"data", dict({{"a", Value::int64(1)}})}});
    ASSERT_FALSE(Document::writeFileAtomically(path_, second));
    Result<Value> back = Document::readFile(path_);
    ASSERT_TRUE(back.ok()) << back.error().description();
    EXPECT_EQ(*back, second);
    EXPECT_EQ(names(), std::vector<std::string>{"Annotations.vrec"});
}

TEST_F(DocumentFileTest, ReadErrorsNameTheFile) {
    Result<Value> missing = Document::readFile(path_);
    ASSERT_FALSE(missing.ok());
    EXPECT_EQ(missing.error().domain(), "POSIX");
    EXPECT_EQ(missing.error().code(), ENOENT);
    EXPECT_NE(message(missing.error()).find(path_.string()), std::string::npos);
    EXPECT_NE(message(missing.error()).find(strerror(ENOENT)), std::string::npos);

    Result<Value> directory = Document::readFile(directory_);
    ASSERT_FALSE(directory.ok());
    EXPECT_EQ(directory.error().code(), EISDIR);

    std::ofstream(path_) << "<vrec><integer>x</integer></vrec>";
    Result<Value> malformed = Document::readFile(path_);
    ASSERT_FALSE(malformed.ok());
    EXPECT_EQ(malformed.error().domain(), "BexilDocument");
    EXPECT_EQ(message(malformed.error()), path_.string() + ": bad integer \"x\" (byte 6)");
}

using test::FailingFileSystem;

TEST_F(DocumentFileTest, FailureBeforeTheRenameLeavesTheOldFileAndNoTemporary) {
    Value old = dict({{"version", Value::int64(16)}, {"data", dict({{"old", Value::boolean(true)}})}});
    ASSERT_FALSE(Document::writeFileAtomically(path_, old));
    const std::string oldText = contents();
    MutableDictionary big;
    for (int i = 0; i < 2000; ++i) big.set("entry-" + std::to_string(i), Value::int64(i));
    Value replacement = dict({{"version", Value::int64(16)}, {"data", big.take()}});

    struct Case {
        const char* call;
        int error;
        int afterCalls;
        const char* operation;
    };
    for (const Case& c :
         {Case{"open", EACCES, 0, "create"}, Case{"write", ENOSPC, 3, "write"}, Case{"fsync", EIO, 0, "fsync"},
          Case{"close", EIO, 0, "close"}, Case{"rename", EXDEV, 0, "rename over"}}) {
        FailingFileSystem fs(c.call, c.error, c.afterCalls);
        std::optional<Error> error = Document::writeFileAtomically(path_, replacement, fs);
        ASSERT_TRUE(error) << c.call;
        EXPECT_EQ(error->domain(), "POSIX") << c.call;
        EXPECT_EQ(error->code(), c.error) << c.call;
        EXPECT_EQ(message(*error).rfind(c.operation, 0), 0u) << c.call << ": " << message(*error);
        EXPECT_EQ(contents(), oldText) << c.call;
        EXPECT_EQ(names(), std::vector<std::string>{"Annotations.vrec"}) << c.call;
    }
    EXPECT_EQ(*Document::readFile(path_), old);
}

TEST_F(DocumentFileTest,
       DirectorySyncFailureIsReportedWithTheNewDocumentInPlaceAndAnUnrepresentableValueTouchesNoFile) {
    ASSERT_FALSE(Document::writeFileAtomically(path_, Value::int64(1)));
    FailingFileSystem fs("fsync", EIO, 1);  // the file's fsync succeeds, the directory's fails
    std::optional<Error> error = Document::writeFileAtomically(path_, Value::int64(2), fs);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->code(), EIO);
    EXPECT_NE(message(*error).find("fsync directory"), std::string::npos) << message(*error);
    EXPECT_EQ(*Document::readFile(path_), Value::int64(2));
    EXPECT_EQ(names(), std::vector<std::string>{"Annotations.vrec"});

    ASSERT_FALSE(Document::writeFileAtomically(path_, Value::string("kept")));
    error = Document::writeFileAtomically(path_, dict({{"id", Value::uuid(Uuid::random())}}));
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain(), "BexilDocument");
    EXPECT_EQ(error->code(), kDocumentUnrepresentable);
    EXPECT_EQ(*Document::readFile(path_), Value::string("kept"));
    EXPECT_EQ(names(), std::vector<std::string>{"Annotations.vrec"});
}

TEST_F(DocumentFileTest, NewFilesFollowTheUmask) {
    mode_t previous = ::umask(027);
    std::optional<Error> error = Document::writeFileAtomically(path_, Value::null());
    ::umask(previous);
    ASSERT_FALSE(error);
    EXPECT_EQ(std::filesystem::status(path_).permissions(), std::filesystem::perms::owner_read |
                                                                std::filesystem::perms::owner_write |
                                                                std::filesystem::perms::group_read);
}

}  // namespace
}  // namespace bexil
