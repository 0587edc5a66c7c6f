#pragma once

// Strict structural identity of two Values, for the wire tests and fuzz targets: the same kind at every level
// (an int64 never matches a uint64 of the same value), reals and dates compared bit for bit (NaN matches the same
// NaN, -0.0 does not match 0.0). Value's own == is numeric and would hide a codec that changes kinds.

#include <algorithm>
#include <bit>
#include <cstdint>

#include "bexil/Value.h"

namespace bexil::testing {

inline bool strictlyEqual(const Value& a, const Value& b) {
    if (a.kind() != b.kind()) return false;
    switch (a.kind()) {
        case ValueKind::Null:
            return true;
        case ValueKind::Bool:
            return *a.getBool() == *b.getBool();
        case ValueKind::Int64:
            return *a.getInt64() == *b.getInt64();
        case ValueKind::UInt64:
            return *a.getUInt64() == *b.getUInt64();
        case ValueKind::Real:
            return std::bit_cast<uint64_t>(*a.getReal()) == std::bit_cast<uint64_t>(*b.getReal());
        case ValueKind::Date:
            return std::bit_cast<uint64_t>(a.getDate()->secondsSince1970) ==
                   std::bit_cast<uint64_t>(b.getDate()->secondsSince1970);
        case ValueKind::String:
            return a.stringView() == b.stringView();
        case ValueKind::Data: {
            auto x = a.dataBytes(), y = b.dataBytes();
            return x.size() == y.size() && std::equal(x.begin(), x.end(), y.begin());
        }
        case ValueKind::Uuid:
            return *a.getUuid() == *b.getUuid();
        case ValueKind::Array: {
            auto x = a.items(), y = b.items();
            if (x.size() != y.size()) return false;
            for (size_t i = 0; i < x.size(); ++i)
                if (!strictlyEqual(x[i], y[i])) return false;
            return true;
        }
        case ValueKind::Dictionary: {
            auto x = a.entries(), y = b.entries();
            if (x.size() != y.size()) return false;
            for (size_t i = 0; i < x.size(); ++i)
                if (x[i].key != y[i].key || !strictlyEqual(x[i].value, y[i].value)) return false;
            return true;
        }
    }
    return false;
}

}  // namespace bexil::testing
