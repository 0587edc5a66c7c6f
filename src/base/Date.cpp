#include "bexil/Date.h"

#include <array>
#include <bit>
#include <charconv>
#include <chrono>
#include <cmath>
#include <cstdint>
#include <cstdio>

namespace bexil {

namespace {

constexpr int64_t kSecondsPerDay = 86400;
// 0000-01-01T00:00:00Z and 9999-12-31T23:59:59Z: the years that four digits can spell.
constexpr int64_t kFirstWritableSecond = -62167219200;
constexpr int64_t kLastWritableSecond = 253402300799;

int64_t daysFromCivil(int64_t y, unsigned m, unsigned d) {
    y -= m <= 2;
    int64_t era = (y >= 0 ? y : y - 399) / 400;
    auto yoe = static_cast<unsigned>(y - era * 400);
    unsigned doy = (153 * (m + (m > 2 ? -3 : 9)) + 2) / 5 + d - 1;
    unsigned doe = yoe * 365 + yoe / 4 - yoe / 100 + doy;
    return era * 146097 + static_cast<int64_t>(doe) - 719468;
}

void civilFromDays(int64_t z, int64_t& y, unsigned& m, unsigned& d) {
    z += 719468;
    int64_t era = (z >= 0 ? z : z - 146096) / 146097;
    auto doe = static_cast<unsigned>(z - era * 146097);
    unsigned yoe = (doe - doe / 1460 + doe / 36524 - doe / 146096) / 365;
    y = static_cast<int64_t>(yoe) + era * 400;
    unsigned doy = doe - (365 * yoe + yoe / 4 - yoe / 100);
    unsigned mp = (5 * doy + 2) / 153;
    d = doy - (153 * mp + 2) / 5 + 1;
    m = mp < 10 ? mp + 3 : mp - 9;
    y += m <= 2;
}

bool readFixedDigits(std::string_view s, size_t pos, size_t count, unsigned& out) {
    unsigned v = 0;
    for (size_t i = pos; i < pos + count; ++i) {
        if (s[i] < '0' || s[i] > '9') return false;
        v = v * 10 + static_cast<unsigned>(s[i] - '0');
    }
    out = v;
    return true;
}

// "YYYY-MM-DDTHH:MM:SS[.digits]Z": the whole seconds plus the fraction read as one decimal number, so the writer
// can predict exactly which double a text gives.
std::optional<double> parseSeconds(std::string_view s) {
    unsigned year, month, day, hour, minute, second;
    if (s.size() < 20 || !readFixedDigits(s, 0, 4, year) || s[4] != '-' || !readFixedDigits(s, 5, 2, month) ||
        s[7] != '-' || !readFixedDigits(s, 8, 2, day) || s[10] != 'T' || !readFixedDigits(s, 11, 2, hour) ||
        s[13] != ':' || !readFixedDigits(s, 14, 2, minute) || s[16] != ':' || !readFixedDigits(s, 17, 2, second))
        return std::nullopt;
    if (s.back() != 'Z') return std::nullopt;
    if (month < 1 || month > 12 || day < 1 || hour > 23 || minute > 59 || second > 59) return std::nullopt;
    static constexpr unsigned kDaysInMonth[] = {31, 28, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31};
    bool leap = (year % 4 == 0 && year % 100 != 0) || year % 400 == 0;
    if (day > kDaysInMonth[month - 1] + (month == 2 && leap ? 1 : 0)) return std::nullopt;
    int64_t whole = daysFromCivil(year, month, day) * kSecondsPerDay + hour * 3600 + minute * 60 + second;
    std::string_view rest = s.substr(19, s.size() - 20);
    double fraction = 0;
    if (!rest.empty()) {
        if (rest.size() < 2 || rest[0] != '.') return std::nullopt;
        for (char c : rest.substr(1))
            if (c < '0' || c > '9') return std::nullopt;
        std::string number = "0";
        number += rest;
        auto [end, ec] = std::from_chars(number.data(), number.data() + number.size(), fraction);
        if (ec != std::errc() || end != number.data() + number.size()) return std::nullopt;
    }
    return static_cast<double>(whole) + fraction;
}

// The date and time of day of the whole second `w` (which must be within the writable years).
std::string wholeSecondText(int64_t w) {
    int64_t days = w >= 0 ? w / kSecondsPerDay : -((-w + kSecondsPerDay - 1) / kSecondsPerDay);
    int64_t secondOfDay = w - days * kSecondsPerDay;
    int64_t year;
    unsigned month, day;
    civilFromDays(days, year, month, day);
    char buf[32];
    snprintf(buf, sizeof buf, "%04d-%02u-%02uT%02d:%02d:%02d", static_cast<int>(year), month, day,
             static_cast<int>(secondOfDay / 3600), static_cast<int>(secondOfDay / 60 % 60),
             static_cast<int>(secondOfDay % 60));
    return buf;
}

// The text of a date that parseSeconds reads back as exactly `seconds`, or none when there is no such text.
std::optional<std::string> formatSeconds(double seconds) {
    if (!std::isfinite(seconds)) return std::nullopt;
    double whole = std::floor(seconds);
    if (whole < static_cast<double>(kFirstWritableSecond) || whole > static_cast<double>(kLastWritableSecond))
        return std::nullopt;
    std::string base = wholeSecondText(static_cast<int64_t>(whole));
    double fraction = seconds - whole;
    if (fraction == 0) return base + "Z";
    // Prefer the short forms people write (milliseconds, microseconds); fall back to the exact decimal expansion.
    auto attempt = [&](std::string_view digits) -> std::optional<std::string> {
        // digits is "0.xxx" from to_chars
        if (digits.size() < 3 || digits[0] != '0') return std::nullopt;
        while (digits.size() > 3 && digits.back() == '0') digits.remove_suffix(1);
        std::string text = base + std::string(digits.substr(1)) + "Z";
        auto back = parseSeconds(text);
        if (back && std::bit_cast<uint64_t>(*back) == std::bit_cast<uint64_t>(seconds)) return text;
        return std::nullopt;
    };
    std::array<char, 1200> chars;
    for (int precision = 1; precision <= 9; ++precision) {
        auto r =
            std::to_chars(chars.data(), chars.data() + chars.size(), fraction, std::chars_format::fixed, precision);
        if (r.ec != std::errc()) break;
        if (auto text = attempt(std::string_view(chars.data(), r.ptr))) return text;
    }
    auto r = std::to_chars(chars.data(), chars.data() + chars.size(), fraction, std::chars_format::fixed);
    if (r.ec == std::errc()) return attempt(std::string_view(chars.data(), r.ptr));
    return std::nullopt;
}

}  // namespace

Date Date::now() {
    auto since = std::chrono::system_clock::now().time_since_epoch();
    return Date{std::chrono::duration<double>(since).count()};
}

std::optional<Date> Date::fromIso8601(std::string_view text) {
    std::optional<double> seconds = parseSeconds(text);
    if (!seconds) return std::nullopt;
    return Date{*seconds};
}

std::optional<std::string> Date::exactIso8601() const { return formatSeconds(secondsSince1970); }

std::string Date::iso8601() const {
    if (!std::isfinite(secondsSince1970)) return "invalid-date";
    double whole = std::floor(secondsSince1970);
    if (whole < static_cast<double>(kFirstWritableSecond) || whole > static_cast<double>(kLastWritableSecond))
        return "invalid-date";
    std::string out = wholeSecondText(static_cast<int64_t>(whole));
    double fraction = secondsSince1970 - whole;
    if (fraction > 0) {
        // Microseconds are the finest step people read; trailing zeros are dropped.
        long micros = std::lround(fraction * 1e6);
        if (micros >= 1000000) micros = 999999;
        if (micros > 0) {
            char digits[16];
            snprintf(digits, sizeof digits, ".%06ld", micros);
            std::string text(digits);
            while (text.back() == '0') text.pop_back();
            out += text;
        }
    }
    out += 'Z';
    return out;
}

}  // namespace bexil
