#include <gtest/gtest.h>

#include <climits>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/Error.h"
#include "base/Format.h"
#include "base/Value.h"

namespace bexil {
namespace {

// The compile-time check accepts what the system's own texts need; these must keep compiling.
static_assert(sizeof(FormatString<int, int>("unsupported protocol version %d (current %d)")) > 0);
static_assert(sizeof(FormatString<int, const char*>("client %d requested %{public}s")) > 0);
static_assert(sizeof(FormatString<Value>("removal complete for %@")) > 0);
static_assert(sizeof(FormatString<unsigned long>("bulk options 0x%lx not supported")) > 0);
static_assert(sizeof(FormatString<uint64_t>("failed to get storage container: error=%llu")) > 0);
static_assert(sizeof(FormatString<const void*, Value, int, std::string>("<BXDZemClient %p con=%@ pid=%d path=%@>")) >
              0);
static_assert(sizeof(FormatString<std::optional<std::string>>("%{private}s")) > 0);
static_assert(sizeof(FormatString<int, const char*>("%-*s")) > 0);
static_assert(sizeof(FormatString<>(nullptr)) > 0);

struct Described {
    std::string description() const { return "<described>"; }
};

TEST(FormatTest, SystemTextsRenderWithTheirArguments) {
    EXPECT_EQ(formatPrintf("unsupported protocol version %d (current %d)", 4, 3),
              "unsupported protocol version 4 (current 3)");
    EXPECT_EQ(formatPrintf("client %d requested %{public}s", 1234, "match"), "client 1234 requested match");
    EXPECT_EQ(formatPrintf("unable to create lumen for category %s", std::string("traffic")),
              "unable to create lumen for category traffic");
    EXPECT_EQ(formatPrintf("absolute path required: %s", std::string_view("rel/x.plugin")),
              "absolute path required: rel/x.plugin");
    EXPECT_EQ(formatPrintf("bulk options 0x%lx not supported", 0xbeefUL), "bulk options 0xbeef not supported");
    EXPECT_EQ(formatPrintf("LX reported %u plug-ins (cache %u/%u)", 3u, 10u, 12u),
              "LX reported 3 plug-ins (cache 10/12)");
    EXPECT_EQ(formatPrintf("failed to get storage container: error=%llu", uint64_t{18446744073709551615ull}),
              "failed to get storage container: error=18446744073709551615");
    EXPECT_EQ(formatPrintf("100%% done"), "100% done");
}

TEST(FormatTest, ObjectConversionDescribesValuesErrorsAndObjects) {
    Value list = Value::array({Value::string("a"), Value::int64(2)});
    EXPECT_EQ(formatPrintf("removal complete for %@", list), "removal complete for " + list.description());
    // A string renders as itself, not quoted, whether it arrives as a Value or as plain text.
    EXPECT_EQ(formatPrintf("invalid plugin path: %@", Value::string("/x/y.plugin")),
              "invalid plugin path: /x/y.plugin");
    EXPECT_EQ(formatPrintf("no plugin at %{public}@", std::string("/a")), "no plugin at /a");
    EXPECT_EQ(formatPrintf("%@", BXError(9, "bad path")), "Error Domain=Bexil Code=9 \"bad path\"");
    EXPECT_EQ(formatPrintf("[%@]", Described{}), "[<described>]");
    auto shared = std::make_shared<Described>();
    EXPECT_EQ(formatPrintf("%@", shared), "<described>");
    Uuid uuid = *Uuid::parse("00112233-4455-6677-8899-aabbccddeeff");
    EXPECT_EQ(formatPrintf("%{public}@", uuid), "00112233-4455-6677-8899-AABBCCDDEEFF");
    std::vector<Described> items(2);
    EXPECT_EQ(formatPrintf("%@", items), "[<described>, <described>]");
}

TEST(FormatTest, NothingRendersAsNull) {
    const char* none = nullptr;
    const Described* noObject = nullptr;
    std::shared_ptr<Described> noShared;
    std::optional<std::string> noText;
    EXPECT_EQ(formatPrintf("%s|%@|%@|%{private}s|%@", none, noObject, noShared, noText, nullptr),
              "(null)|(null)|(null)|(null)|(null)");
    EXPECT_EQ(formatPrintf("%@", Value()), "(null)");
    EXPECT_EQ(formatPrintf("%p", nullptr), "0x0");
}

TEST(FormatTest, FlagsWidthAndPrecision) {
    EXPECT_EQ(formatPrintf("[%5d|%-5d|%05d|%+d]", 42, 42, 42, 42), "[   42|42   |00042|+42]");
    EXPECT_EQ(formatPrintf("[%8s|%-8s|%.3s]", "abc", "abc", "abcdef"), "[     abc|abc     |abc]");
    EXPECT_EQ(formatPrintf("[%*d|%-*s|%.*s]", 4, 7, 3, "x", 2, "xyz"), "[   7|x  |xy]");
    EXPECT_EQ(formatPrintf("%.2f %e", 3.14159, 1500.0), "3.14 1.500000e+03");
    EXPECT_EQ(formatPrintf("%#x %X %o %c", 255, 255u, 8, 'Q'), "0xff FF 10 Q");
    // A negative width from "*" means left alignment, as in printf.
    EXPECT_EQ(formatPrintf("[%*d]", -4, 1), "[1   ]");
    // Precision never splits a UTF-8 sequence.
    EXPECT_EQ(formatPrintf("%.2s", "\xC3\xA9t\xC3\xA9"), "\xC3\xA9");
}

TEST(FormatTest, IntegersAreNeverNarrowed) {
    // The unsigned rendering of a negative value follows the wider of the argument and the length modifier.
    EXPECT_EQ(formatPrintf("%u", -1), "4294967295");
    EXPECT_EQ(formatPrintf("%lu", -1), "18446744073709551615");
    // A 64-bit value is shown whole even under a plain %d or %u.
    EXPECT_EQ(formatPrintf("%d", int64_t{1} << 40), "1099511627776");
    EXPECT_EQ(formatPrintf("%u", uint64_t{1} << 40), "1099511627776");
    EXPECT_EQ(formatPrintf("%d %d", INT_MIN, true), "-2147483648 1");
    // The low 32 bits of a version read as a signed number: what the version check hands to its message.
    uint64_t version = 0xFFFFFFFF00000003ull;
    EXPECT_EQ(formatPrintf("version %d", static_cast<int32_t>(version)), "version 3");
    enum class Code : int { Busy = 14 };
    EXPECT_EQ(formatPrintf("code %d", Code::Busy), "code 14");
}

TEST(FormatTest, ErrorWithFormatBuildsItsMessage) {
    Error e = BXErrorWithFormat(7, "unsupported protocol version %d (current %d)", 1, 3);
    EXPECT_EQ(e.localizedDescription(), "unsupported protocol version 1 (current 3)");
    Error none = BXErrorWithFormat(4, nullptr);
    EXPECT_EQ(none.code(), 4);
    EXPECT_FALSE(none.localizedDescription().has_value());
}

TEST(FormatTest, RuntimeFormatsMarkMistakesVisibly) {
    std::string name = "match";
    const FormatArg wrongKind[] = {FormatArg(name), FormatArg(12)};
    EXPECT_EQ(formatPrintfRuntime("client %d requested %s", wrongKind),
              "client <%d: string?> requested <%s: integer?>");
    const FormatArg one[] = {FormatArg(7)};
    EXPECT_EQ(formatPrintfRuntime("a %d b %{public}@", one), "a 7 b <%{public}@: missing>");
    EXPECT_EQ(formatPrintfRuntime("x %d", {}), "x <%d: missing>");
    const FormatArg two[] = {FormatArg(1), FormatArg(2)};
    EXPECT_EQ(formatPrintfRuntime("only %d", two), "only 1 <unused arguments: 1>");
    // Conversions we do not take (including ones that would write through a pointer) are shown, never executed.
    EXPECT_EQ(formatPrintfRuntime("%n and %k and %ls", {}),
              "<bad conversion %n> and <bad conversion %k> and <bad conversion %ls>");
    EXPECT_EQ(formatPrintfRuntime("trailing %", {}), "trailing <bad conversion %>");
    EXPECT_EQ(formatPrintfRuntime("%{public unterminated", {}), "<bad conversion %{public unterminated>");
    const FormatArg badStar[] = {FormatArg("w"), FormatArg(3)};
    EXPECT_EQ(formatPrintfRuntime("%*d", badStar), "<%*d: bad width?>");
    EXPECT_EQ(formatPrintfRuntime("100%%", {}), "100%");
}

TEST(FormatTest, HugeWidthsAreBoundedAndFormatted) {
    std::string wide = formatPrintf("%99999d", 1);
    EXPECT_EQ(wide.size(), 4096u);
    EXPECT_EQ(wide.back(), '1');
    std::string longText(1000, 'z');
    EXPECT_EQ(formatPrintf("<%s>", longText), "<" + longText + ">");
    EXPECT_EQ(formatPrintf("%300.250f", 1.0).size(), 300u);
}

}  // namespace
}  // namespace bexil
