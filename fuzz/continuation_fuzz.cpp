// Feeds arbitrary bytes to the reader of paged discovery's continuations, which bxd takes from any client. A
// reader must never crash or read out of bounds, and what it accepts under the fixed key must be exactly what
// issuing its position makes again: there is one encoding of each position, and no other bytes pass.

#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>
#include <variant>

#include "daemon/DiscoveryContinuation.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    using namespace bexil;
    // The seeds in corpus/continuation are made with this key (all zero), run number 1..8 and binding.
    static const DiscoveryContinuation continuations(std::array<uint8_t, DiscoveryContinuation::kKeyBytes>{},
                                                     {1, 2, 3, 4, 5, 6, 7, 8});
    static const DiscoveryContinuation::Binding binding{
        .connection = 1, .uid = 1000, .pid = 4242, .flags = 0, .rules = std::string()};
    std::string_view bytes(reinterpret_cast<const char*>(data), size);
    auto read = continuations.read(bytes, binding);
    if (const auto* position = std::get_if<std::string>(&read)) {
        if (continuations.issue(*position, binding) != bytes) std::abort();
    }
    return 0;
}
