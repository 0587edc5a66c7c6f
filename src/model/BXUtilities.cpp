#include "model/BXUtilities.h"

namespace bexil {

Value arrayWithValuesInBlock(const Value& values, const std::function<std::optional<Value>(const Value&)>& block) {
    MutableArray out;
    out.reserve(values.count());
    for (const Value& item : values.items()) {
        if (std::optional<Value> mapped = block(item)) out.append(std::move(*mapped));
    }
    return out.take();
}

std::optional<Value> dictionaryChangingTo(const std::optional<Value>& receiver, std::string_view key,
                                          const std::optional<Value>& value) {
    if (!receiver || !receiver->isDictionary()) return std::nullopt;
    MutableDictionary copy(*receiver);
    if (value)
        copy.set(key, *value);
    else
        copy.remove(key);
    return copy.take();
}

namespace {

bool isDigit(char c) { return c >= '0' && c <= '9'; }

// Compares two runs of digits by numeric value without converting them, so that runs longer than any integer type
// still order correctly. Leading zeros are skipped; when the values are equal the shorter run orders first, which
// keeps "01" and "1" distinct and the ordering total.
int compareDigitRuns(std::string_view a, std::string_view b) {
    size_t za = a.find_first_not_of('0');
    size_t zb = b.find_first_not_of('0');
    std::string_view va = za == std::string_view::npos ? std::string_view() : a.substr(za);
    std::string_view vb = zb == std::string_view::npos ? std::string_view() : b.substr(zb);
    if (va.size() != vb.size()) return va.size() < vb.size() ? -1 : 1;
    if (int c = va.compare(vb); c != 0) return c < 0 ? -1 : 1;
    if (a.size() != b.size()) return a.size() < b.size() ? -1 : 1;
    return 0;
}

}  // namespace

ComparisonResult compareVersionString(std::string_view a, std::string_view b) {
    size_t i = 0, j = 0;
    while (i < a.size() && j < b.size()) {
        if (isDigit(a[i]) && isDigit(b[j])) {
            size_t ei = i, ej = j;
            while (ei < a.size() && isDigit(a[ei])) ++ei;
            while (ej < b.size() && isDigit(b[ej])) ++ej;
            if (int c = compareDigitRuns(a.substr(i, ei - i), b.substr(j, ej - j)); c != 0)
                return static_cast<ComparisonResult>(c);
            i = ei;
            j = ej;
            continue;
        }
        unsigned char ca = static_cast<unsigned char>(a[i]), cb = static_cast<unsigned char>(b[j]);
        if (ca != cb) return ca < cb ? ComparisonResult::Ascending : ComparisonResult::Descending;
        ++i;
        ++j;
    }
    bool aLeft = i < a.size(), bLeft = j < b.size();
    if (aLeft == bLeft) return ComparisonResult::Same;
    return aLeft ? ComparisonResult::Descending : ComparisonResult::Ascending;
}

}  // namespace bexil
