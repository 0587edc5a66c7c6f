// Feeds arbitrary bytes to the Zem value decoder. Whatever it accepts must encode again, and decoding that
// encoding must give back the same value in every kind and bit; the encoding itself must be a fixed point
// (canonical), so a second round trip yields the very same bytes.

#include <cstdint>
#include <cstdlib>
#include <span>
#include <vector>

#include "../tests/platform/ZemStrictEqual.h"
#include "platform/zem/ZemCodec.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    using namespace bexil;
    Result<Value> decoded = ZemCodec::decode(std::span<const uint8_t>(data, size));
    if (!decoded) {
        if (decoded.error().domain() != kZemErrorDomain || !decoded.error().localizedDescription()) std::abort();
        return 0;
    }
    std::vector<uint8_t> encoded;
    if (ZemCodec::encode(*decoded, encoded)) std::abort();  // a decoded value is always encodable
    if (encoded.size() > size) std::abort();                // canonical form is never longer than the input
    Result<Value> again = ZemCodec::decode(encoded);
    if (!again || !testing::strictlyEqual(*decoded, *again)) std::abort();
    std::vector<uint8_t> reencoded;
    if (ZemCodec::encode(*again, reencoded) || reencoded != encoded) std::abort();
    return 0;
}
