// Feeds arbitrary bytes to the document reader. Whatever it accepts must write and read back identically: the
// comparison here is stricter than Value's == (kinds must match, and reals and dates must have the same bits, so
// NaN and -0 count), because the writer promises to lose nothing of what the reader produced.

#include <bit>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string_view>

#include "base/Document.h"

namespace {

bool same(const bexil::Value& a, const bexil::Value& b) {
    using bexil::ValueKind;
    if (a.kind() != b.kind()) return false;
    switch (a.kind()) {
        case ValueKind::Real:
            return std::bit_cast<uint64_t>(*a.getReal()) == std::bit_cast<uint64_t>(*b.getReal());
        case ValueKind::Date:
            return std::bit_cast<uint64_t>(a.getDate()->secondsSince1970) ==
                   std::bit_cast<uint64_t>(b.getDate()->secondsSince1970);
        case ValueKind::Array: {
            auto x = a.items(), y = b.items();
            if (x.size() != y.size()) return false;
            for (size_t i = 0; i < x.size(); ++i)
                if (!same(x[i], y[i])) return false;
            return true;
        }
        case ValueKind::Dictionary: {
            auto x = a.entries(), y = b.entries();
            if (x.size() != y.size()) return false;
            for (size_t i = 0; i < x.size(); ++i)
                if (x[i].key != y[i].key || !same(x[i].value, y[i].value)) return false;
            return true;
        }
        default:
            return a == b;
    }
}

[[noreturn]] void fail(const char* what, const std::string& detail) {
    std::fprintf(stderr, "document_fuzz: %s\n%s\n", what, detail.c_str());
    std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string_view text(reinterpret_cast<const char*>(data), size);
    bexil::Result<bexil::Value> first = bexil::Document::read(text);
    if (!first.ok()) {
        if (first.error().domain() != bexil::BXDocumentErrorDomain || !first.error().localizedDescription())
            fail("read failed without a document error", first.error().description());
        return 0;
    }
    bexil::Result<std::string> written = bexil::Document::write(*first);
    if (!written.ok()) fail("a value that was read cannot be written", written.error().description());
    bexil::Result<bexil::Value> second = bexil::Document::read(*written);
    if (!second.ok()) fail("what was written cannot be read", second.error().description() + "\n" + *written);
    if (!same(*first, *second)) fail("what was written reads back different", *written);
    bexil::Result<std::string> again = bexil::Document::write(*second);
    if (!again.ok() || *again != *written) fail("writing is not stable", *written);
    return 0;
}
