#include <gtest/gtest.h>

#include <climits>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "base/Error.h"
#include "base/Format.h"
#include "bexil/Value.h"

namespace bexil {
namespace {

// Every literal format below passes the compile-time check; this one has no runtime case of its own.
static_assert(sizeof(FormatString<const void*, Value, int, std::string>("<BXDZemClient %p con=%@ pid=%d path=%@>")) >
              0);

struct Described {
    std::string description() const { return "<described>"; }
};

// Guards %@ and %{public}: values, errors and objects render by their description, strings as themselves.
TEST(FormatTest, ObjectConversionDescribesValuesErrorsAndObjects) {
    Value list = Value::array({Value::string("a"), Value::int64(2)});
    EXPECT_EQ(formatPrintf("removal complete for %@", list), "removal complete for " + list.description());
    // A string renders as itself, not quoted, whether it arrives as a Value or as plain text.
    EXPECT_EQ(formatPrintf("invalid plugin path: %@", Value::string("/x/y.plugin")),
              "invalid plugin path: /x/y.plugin");
    EXPECT_EQ(formatPrintf("%@", BXError(9, "bad path")), "Error Domain=Bexil Code=9 \"bad path\"");
    auto shared = std::make_shared<Described>();
    EXPECT_EQ(formatPrintf("%@", shared), "<described>");
}

// Guards against crashes on absent arguments: every kind of nothing renders as "(null)".
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

// Guards the printf options the texts use, and that precision never splits a UTF-8 sequence.
TEST(FormatTest, FlagsWidthAndPrecision) {
    EXPECT_EQ(formatPrintf("[%5d|%-5d|%05d|%+d]", 42, 42, 42, 42), "[   42|42   |00042|+42]");
    EXPECT_EQ(formatPrintf("[%*d|%.*s]", -4, 7, 2, "xyz"), "[7   |xy]");
    EXPECT_EQ(formatPrintf("%.2f %#x", 3.14159, 255), "3.14 0xff");
    EXPECT_EQ(formatPrintf("%.2s", "\xC3\xA9t\xC3\xA9"), "\xC3\xA9");
}

// Guards numbers in messages: never narrowed to the conversion's nominal width.
TEST(FormatTest, IntegersAreNeverNarrowed) {
    // The unsigned rendering of a negative value follows the wider of the argument and the length modifier.
    EXPECT_EQ(formatPrintf("%u", -1), "4294967295");
    EXPECT_EQ(formatPrintf("%lu", -1), "18446744073709551615");
    // A 64-bit value is shown whole even under a plain %d or %u.
    EXPECT_EQ(formatPrintf("%u", uint64_t{1} << 40), "1099511627776");
    EXPECT_EQ(formatPrintf("%d %d", INT_MIN, true), "-2147483648 1");
    enum class Code : int { Busy = 14 };
    EXPECT_EQ(formatPrintf("code %d", Code::Busy), "code 14");
}

// Guards formats that arrive at run time (texts made elsewhere that a channel writes): mistakes are shown in the
// text, and %n is never executed.
TEST(FormatTest, RuntimeFormatsMarkMistakesVisibly) {
    std::string name = "match";
    const FormatArg wrongKind[] = {FormatArg(name), FormatArg(12)};
    EXPECT_EQ(formatPrintfRuntime("client %d requested %s", wrongKind),
              "client <%d: string?> requested <%s: integer?>");
    EXPECT_EQ(formatPrintfRuntime("x %d", {}), "x <%d: missing>");
    // Conversions we do not take (including ones that would write through a pointer) are shown, never executed.
    EXPECT_EQ(formatPrintfRuntime("%n and %k and %ls", {}),
              "<bad conversion %n> and <bad conversion %k> and <bad conversion %ls>");
    EXPECT_EQ(formatPrintfRuntime("trailing %", {}), "trailing <bad conversion %>");
}

// Guards the width bound: no format can make a message explode, even the most negative "*".
TEST(FormatTest, HugeWidthsAreBoundedAndFormatted) {
    std::string wide = formatPrintf("%99999d", 1);
    EXPECT_EQ(wide.size(), 4096u);
    EXPECT_EQ(wide.back(), '1');
    EXPECT_EQ(formatPrintf("%300.250f", 1.0).size(), 300u);
    // The most negative width from "*" is bounded too, and still means left alignment.
    std::string left = formatPrintf("[%*d]", INT64_MIN, 5);
    EXPECT_EQ(left.size(), 4098u);
    EXPECT_EQ(left.substr(0, 3), "[5 ");
}

}  // namespace
}  // namespace bexil
