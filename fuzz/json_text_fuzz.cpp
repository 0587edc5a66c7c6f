// JSON text as arbitrary bytes, as the C interface of libbexil takes it from an application (rules, annotations)
// and the tool from a file. Besides not faulting: what reads is written back as JSON that reads again, and writing
// that a second time gives the same text (non-finite reals, which JSON cannot carry, are written as null the first
// time); what is refused says where, by line and column.

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <string_view>

#include "client/JsonText.h"

namespace {

[[noreturn]] void fail(const std::string& what) {
    std::fprintf(stderr, "json_text_fuzz: %s\n", what.c_str());
    std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    using namespace bexil;
    std::string_view text(reinterpret_cast<const char*>(data), size);
    Result<Value> value = parseJson(text);
    if (!value) {
        const std::string message = value.error().localizedDescription().value_or("");
        if (message.rfind("JSON line ", 0) != 0) fail("a refusal that does not say where: " + message);
        return 0;
    }
    for (JsonLayout layout : {JsonLayout::Pretty, JsonLayout::OneLine}) {
        const std::string written = toJson(*value, layout);
        Result<Value> again = parseJson(written);
        if (!again) fail("written JSON does not read: " + written);
        if (toJson(*again, layout) != written) fail("written twice, the text changes: " + written);
    }
    return 0;
}
