#pragma once

// Date is a point in time held by value, and the one place that reads and writes dates as ISO 8601 text. Pure
// functions of the value (no time-zone state); any thread.

#include <compare>
#include <optional>
#include <string>
#include <string_view>

namespace bexil {

// A point in time as seconds since 1970-01-01T00:00:00Z (fractions allowed, negative before 1970).
struct Date {
    double secondsSince1970 = 0;

    static Date now();

    // The one reading of ISO 8601 text: exactly "YYYY-MM-DDTHH:MM:SS[.digits]Z", a real calendar date, seconds 0 to
    // 59 (time here has no leap seconds, so a second 60 is refused rather than folded into the next minute), the
    // whole seconds plus the fraction read as one decimal number. None for anything else.
    static std::optional<Date> fromIso8601(std::string_view text);
    // Text that fromIso8601 reads back as exactly this date (the shortest fraction that does), for documents that
    // must not lose a bit. None when there is none: not finite, or outside the years 0000 to 9999.
    std::optional<std::string> exactIso8601() const;
    // For people and logs: "2026-11-23T10:03:25Z", with a fraction (to the microsecond, trailing zeros dropped) only
    // when there is one; "invalid-date" when the date cannot be written.
    std::string iso8601() const;

    auto operator<=>(const Date&) const = default;
};

}  // namespace bexil
