// The one ISO 8601 reader and writer: documents must get back exactly the date they stored, so the edges are where
// it can break: second 60, leap days, the first and last writable seconds, fractions that are not exact in binary,
// and any text that is not exactly the one form.

#include <gtest/gtest.h>

#include <bit>
#include <cmath>
#include <cstdint>
#include <limits>

#include "bexil/Date.h"

namespace bexil {
namespace {

double secondsOf(const char* text) {
    std::optional<Date> date = Date::fromIso8601(text);
    EXPECT_TRUE(date) << text;
    return date ? date->secondsSince1970 : std::nan("");
}

TEST(Date, ReadsOnlyRealCalendarTimesInTheOneForm) {
    EXPECT_EQ(secondsOf("1970-01-01T00:00:00Z"), 0);
    EXPECT_EQ(secondsOf("2000-02-29T00:00:00Z"), 951782400);
    EXPECT_EQ(secondsOf("1969-12-31T23:59:59.5Z"), -0.5);
    EXPECT_EQ(secondsOf("0000-01-01T00:00:00Z"), -62167219200);
    EXPECT_EQ(secondsOf("9999-12-31T23:59:59Z"), 253402300799);
    for (const char* bad : {"2026-06-30T23:59:60Z",  // no leap seconds: refused, not folded into the next minute
                            "2026-02-29T00:00:00Z",  // not a leap year
                            "1900-02-29T00:00:00Z",  // century, not a leap year
                            "2026-13-01T00:00:00Z", "2026-00-10T00:00:00Z", "2026-04-31T00:00:00Z",
                            "2026-01-01T24:00:00Z", "2026-01-01T00:60:00Z",
                            "2026-01-01T00:00:00",        // no zone
                            "2026-01-01T00:00:00+01:00",  // only UTC
                            "2026-01-01 00:00:00Z", "2026-01-01T00:00:00.Z", "2026-01-01T00:00:00.5.5Z",
                            "2026-1-01T00:00:00Z", " 2026-01-01T00:00:00Z", ""})
        EXPECT_FALSE(Date::fromIso8601(bad)) << bad;
}

TEST(Date, ExactTextReadsBackToTheSameBits) {
    for (double seconds : {0.0, 0.1, 1795000000.000001, 1795000000.123456789, -86400.5, 1e-9, 253402300799.5,
                           -62167219200.0, std::nextafter(1.0, 2.0)}) {
        std::optional<std::string> text = Date{seconds}.exactIso8601();
        ASSERT_TRUE(text) << seconds;
        std::optional<Date> back = Date::fromIso8601(*text);
        ASSERT_TRUE(back) << *text;
        EXPECT_EQ(std::bit_cast<uint64_t>(back->secondsSince1970), std::bit_cast<uint64_t>(seconds)) << *text;
    }
    EXPECT_EQ(Date{0.25}.exactIso8601(), "1970-01-01T00:00:00.25Z") << "the shortest fraction that reads back";
    for (double outside : {-62167219201.0, 253402300800.0, std::numeric_limits<double>::infinity(), std::nan("")})
        EXPECT_FALSE(Date{outside}.exactIso8601()) << outside;
}

TEST(Date, TextForPeopleStopsAtTheMicrosecond) {
    EXPECT_EQ(Date{1795000000}.iso8601(), "2026-11-18T11:06:40Z");
    EXPECT_EQ(Date{0.5}.iso8601(), "1970-01-01T00:00:00.5Z");
    EXPECT_EQ(Date{0.0000004}.iso8601(), "1970-01-01T00:00:00Z");
    EXPECT_EQ(Date{0.9999999}.iso8601(), "1970-01-01T00:00:00.999999Z") << "never rounds into the next second";
    EXPECT_EQ(Date{-0.9999999}.iso8601(), "1969-12-31T23:59:59Z");
    EXPECT_EQ(Date{std::nan("")}.iso8601(), "invalid-date");
}

}  // namespace
}  // namespace bexil
