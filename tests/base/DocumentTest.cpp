#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
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

// The document fuzzer round-trips every value its corpus holds (plain kinds, extremes of numbers and dates, escapes);
// guarded here: a raw CR (which XML reading would turn into LF), the three base64 group endings and a blob past
// 1 MiB, and the short readable text of dates, which the fuzzer cannot judge.
TEST(DocumentRoundTrip, EdgeValuesComeBackWithTheirKindAndDatesUseTheShortReadableForm) {
    std::mt19937 random(7);
    std::vector<uint8_t> blob(1024 * 1024 + 1);
    for (uint8_t& b : blob) b = static_cast<uint8_t>(random());
    const std::vector<Value> values = {
        Value::string("<&>\"' ]]> &amp;"),
        Value::string("line\r\nends\rand\nmore\r"),
        bytes({0xFF, 0xFE, 0x3C}),
        bytes({0}),
        bytes({0, 1}),
        Value::data(std::move(blob)),
    };
    for (const Value& v : values) {
        EXPECT_EQ(roundTrip(v), v) << v.description();
    }
    for (auto [seconds, form] :
         {std::pair{1795428205.0, "2026-11-23T10:03:25Z"}, {1795428205.25, "2026-11-23T10:03:25.25Z"}}) {
        std::string text = Document::write(Value::date(Date{seconds})).value();
        EXPECT_NE(text.find(std::string("<date>") + form + "</date>"), std::string::npos) << text;
    }
}

// Guards the on-disk form other tools read: sorted keys, tab indentation, escapes, empty containers.
TEST(DocumentRoundTrip, WritesTheDocumentedLayout) {
    Value v =
        dict({{"b", Value::array({Value::boolean(false), Value::string("x & y")})}, {"a", Value::emptyDictionary()}});
    EXPECT_EQ(Document::write(v).value(),
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

// Guards reading hand-edited documents: BOM, CRLF, DOCTYPE, comments, CDATA, character references, whitespace.
TEST(DocumentRead, AcceptsTheLatitudeXmlAllows) {
    std::string text =
        "\xEF\xBB\xBF<?xml version=\"1.0\" encoding=\"UTF-8\"?>\r\n"
        "<!DOCTYPE vrec>\r\n"
        "<vrec version=\"1\"><dict>\r\n"
        "  <key>n</key> <integer> -0 </integer>\r\n"
        "  <key>s</key><string>a<!-- split -->b<![CDATA[<c&d>]]>&#x41;&#66;&#13;</string>\r\n"
        "  <key>t</key><date> 2026-11-23T10:03:25.000Z </date>\r\n"
        "  <key>e</key><string>&foo;</string>\r\n"
        "</dict></vrec>\r\n<!-- trailing comment -->\r\n";
    Result<Value> v = Document::read(text);
    ASSERT_TRUE(v.ok()) << v.error().description();
    EXPECT_EQ(v->get("n"), Value::int64(0));
    EXPECT_EQ(v->get("s"), Value::string("ab<c&d>AB\r"));
    EXPECT_EQ(v->get("t"), Value::date(Date{1795428205}));
    // No DTD is processed: an unknown entity is plain text and comes back as written.
    EXPECT_EQ(v->get("e"), Value::string("&foo;"));
    EXPECT_EQ(roundTrip(*v), *v);
}

// Guards the reader's refusals: every malformed input is the one malformed-document error (never a crash nor a
// half-read value), naming what and where; rows with a path and byte offset prove that also several levels down.
// The fuzzer holds the rest of the refusals in its corpus.
// Guards reading with a maker of strings: every string of the document, wherever it sits, is what the maker made
// of exactly its text (a string that only resembles another, a prefix or in other case, is its own), and nothing
// that is not a string in the document goes through the maker.
TEST(DocumentRead, StringsAreWhatTheMakerMakesOfTheirText) {
    const std::string longText = "com.example.known.identifier-longer-than-a-short-string";
    Value original = dict({{"exact", Value::string(longText)},
                           {"nested", Value::array({Value::array({Value::string(longText)}), Value::string("7")})},
                           {"prefix", Value::string(longText.substr(0, 20))},
                           {"upper", Value::string("ONE")},
                           {"empty", Value::string("")},
                           {"number", Value::int64(7)},
                           {"data", Value::data(std::vector<uint8_t>{'o', 'n', 'e'})}});
    const Value known[] = {Value::string(longText), Value::string("one"), Value::string("")};
    std::vector<std::string> asked;
    auto maker = [&](std::string&& text) {
        asked.push_back(text);
        for (const Value& candidate : known)
            if (candidate.stringView() == text) return candidate;
        return Value::string(std::move(text));
    };
    Result<Value> read = Document::read(Document::write(original).value(), maker);
    ASSERT_TRUE(read.ok()) << read.error().description();
    EXPECT_EQ(*read, original);
    EXPECT_EQ(asked.size(), 6u);
    EXPECT_TRUE(read->get("exact").identical(known[0]));
    EXPECT_TRUE(read->get("nested").items()[0].items()[0].identical(known[0]));
    EXPECT_TRUE(read->get("empty").identical(known[2]));
    EXPECT_FALSE(read->get("prefix").identical(known[0]));
    EXPECT_FALSE(read->get("upper").identical(known[1]));
    EXPECT_EQ(read->get("number").kind(), ValueKind::Int64);
    // Without a maker nothing is shared.
    EXPECT_FALSE(Document::read(Document::write(original).value())->get("exact").identical(known[0]));
}

TEST(DocumentRead, MalformedInputIsAnErrorNamingWhatAndWhere) {
    const std::vector<std::pair<std::string, std::string>> cases = {
        {"", "no root element"},
        {"<vrec><dict></vrec>", "malformed XML: Start-end tags mismatch (byte"},
        {"<vrec><null/></vrec>junk", "text \"junk\" outside the root element (byte 20)"},
        {wrap("<dict><key>a</key><array><true/><uuid>x</uuid></array></dict>"),
         "unknown element <uuid> at root[\"a\"][1] (byte 38)"},
        {wrap("<dict><key>a</key><true/><key>b</key><true/><key>a</key><false/></dict>"), "duplicate key \"a\""},
        // An integer just past what the kinds hold, and a shape from_chars would half-accept.
        {wrap("<integer>18446744073709551616</integer>"), "integer out of range \"18446744073709551616\""},
        {wrap("<integer>12a</integer>"), "bad integer \"12a\""},
        {wrap("<data>AA==AAAA</data>"), "bad base64 data: text after '=' padding"},
        {wrap("<date>2026-02-29T00:00:00Z</date>"), "bad date \"2026-02-29T00:00:00Z\""},
        {wrap("<date>9999-12-31T23:59:59.999999999Z</date>"), "date \"9999-12-31T23:59:59.999999999Z\" out of range"},
        // Characters XML cannot carry, as a reference and raw, and broken UTF-8.
        {std::string("<vrec><string>a\0b</string></vrec>", 29), "character U+0000"},
        {wrap("<string>\xC3</string>"), "invalid UTF-8 in the text (byte 14)"},
    };
    for (const auto& [text, expected] : cases) {
        Result<Value> v = Document::read(text);
        ASSERT_FALSE(v.ok()) << text << ": read as " << v->description();
        EXPECT_EQ(v.error().domain(), "BexilDocument") << text;
        EXPECT_EQ(v.error().code(), kDocumentMalformed) << text;
        EXPECT_NE(message(v.error()).find(expected), std::string::npos)
            << text << ": " << message(v.error()) << "\n  expected to contain: " << expected;
    }
}

// ---- depth and size limits ----

std::string nestedText(size_t depth, bool closed) {
    std::string text = "<vrec>";
    for (size_t i = 0; i < depth; ++i) text += "<array>";
    if (closed)
        for (size_t i = 0; i < depth; ++i) text += "</array>";
    return text + (closed ? "</vrec>" : "");
}

// The code of the error a result holds, or 0 when it succeeded.
template <typename T>
int failureCode(const Result<T>& result) {
    return result.ok() ? 0 : result.error().code();
}

// Guards the depth and size limits at their boundary, and the stack against hostile nesting.
TEST(DocumentLimits, DepthAndSizeAtTheLimitPassAndJustPastItAreRefusedReadingAndWriting) {
    Value deepest = nestedArrays(kMaxDocumentDepth);
    EXPECT_EQ(roundTrip(deepest), deepest);
    Result<std::string> written = Document::write(dict({{"x", deepest}}));
    ASSERT_EQ(failureCode(written), kDocumentLimitExceeded);
    EXPECT_NE(message(written.error()).find("nested deeper than 512 at root[\"x\"][0]"), std::string::npos)
        << message(written.error());
    EXPECT_EQ(failureCode(Document::read(nestedText(kMaxDocumentDepth + 1, true))), kDocumentLimitExceeded);
    // Hostile nesting never exhausts the stack, closed or not.
    EXPECT_EQ(failureCode(Document::read(nestedText(200000, true))), kDocumentLimitExceeded);
    EXPECT_EQ(failureCode(Document::read(nestedText(200000, false))), kDocumentMalformed);

    EXPECT_EQ(failureCode(Document::read(std::string(kMaxDocumentBytes + 1, ' '))), kDocumentLimitExceeded);
    EXPECT_EQ(failureCode(Document::write(Value::data(std::vector<uint8_t>(kMaxDocumentBytes / 4 * 3)))),
              kDocumentLimitExceeded);
}

// ---- values that cannot be written ----

// Guards the writer: what a document cannot hold is refused naming where, never written in a form that reads back
// differently.
TEST(DocumentWrite, UnrepresentableValuesAreErrorsNamingWhere) {
    Uuid uuid = *Uuid::parse("01234567-89AB-CDEF-0123-456789ABCDEF");
    const std::vector<std::pair<Value, std::string>> cases = {
        {dict({{"data", dict({{"p", Value::array({Value::int64(1), Value::uuid(uuid)})}})}}),
         "a uuid (01234567-89AB-CDEF-0123-456789ABCDEF), which a document cannot represent, at "
         "root[\"data\"][\"p\"][1]"},
        {Value::array({Value::string("ok"), Value::string("bell\x07")}),
         "a string with character U+0007, which XML 1.0 cannot carry, at byte 4 of \"bell\\x07\" at root[1]"},
        // One past the last year a date can be written in.
        {Value::date(Date{253402300800.0}), "a date outside the years 0000-9999"},
    };
    for (const auto& [value, expected] : cases) {
        Result<std::string> text = Document::write(value);
        ASSERT_FALSE(text.ok()) << expected << " was written as " << *text;
        EXPECT_EQ(text.error().domain(), "BexilDocument");
        EXPECT_EQ(text.error().code(), kDocumentUnrepresentable);
        EXPECT_NE(message(text.error()).find(expected), std::string::npos)
            << message(text.error()) << "\n  expected to contain: " << expected;
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

// Guards the messages an operator sees about a document file: they name the file.
TEST_F(DocumentFileTest, ReadErrorsNameTheFile) {
    Result<Value> missing = Document::readFile(path_);
    ASSERT_FALSE(missing.ok());
    EXPECT_EQ(missing.error().code(), ENOENT);
    EXPECT_NE(message(missing.error()).find(path_.string()), std::string::npos);

    std::ofstream(path_) << "<vrec><integer>x</integer></vrec>";
    Result<Value> malformed = Document::readFile(path_);
    ASSERT_FALSE(malformed.ok());
    EXPECT_EQ(malformed.error().domain(), "BexilDocument");
    EXPECT_EQ(message(malformed.error()), path_.string() + ": bad integer \"x\" (byte 6)");

    // A pipe or a device in place of the document is refused at once rather than waited on or read for ever.
    std::filesystem::remove(path_);
    ASSERT_EQ(mkfifo(path_.c_str(), 0600), 0);
    for (const std::filesystem::path& notAFile : {path_, std::filesystem::path("/dev/zero")}) {
        Result<Value> refused = Document::readFile(notAFile);
        ASSERT_FALSE(refused.ok());
        EXPECT_EQ(refused.error().code(), EINVAL);
        EXPECT_EQ(message(refused.error()), "read \"" + notAFile.string() + "\": not a regular file");
    }
}

using test::FailingFileSystem;

// Each step of the atomic replace can fail; before the rename nothing of the attempt may show.
TEST_F(DocumentFileTest, FailureBeforeTheRenameLeavesTheOldFileAndNoTemporaryAfterItTheNewOne) {
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
    // After the rename only the directory's fsync is left: its failure is reported with the new document in place.
    FailingFileSystem directorySync("fsync", EIO, 1);
    std::optional<Error> error = Document::writeFileAtomically(path_, replacement, directorySync);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->code(), EIO);
    EXPECT_NE(message(*error).find("fsync directory"), std::string::npos) << message(*error);
    EXPECT_EQ(*Document::readFile(path_), replacement);
}

// Guards the permissions of a new document: the umask applies, nothing wider is forced.
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
