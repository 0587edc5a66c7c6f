#pragma once

// ZemCodec turns a Value into the compact binary encoding of the Zem wire format and back (docs/protocol.md).
// It holds no state: every function may be called from any thread at any time.

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <vector>

#include "base/Error.h"
#include "bexil/Value.h"
#include "platform/zem/ZemBytes.h"
#include "platform/zem/ZemProtocolError.h"

namespace bexil {

// Tag bytes: the first byte of every encoded value.
enum class ZemTag : uint8_t {
    Null = 0x00,
    False = 0x01,
    True = 0x02,
    Int64 = 0x03,
    UInt64 = 0x04,
    Real = 0x05,
    String = 0x06,
    Data = 0x07,
    Date = 0x08,
    Uuid = 0x09,
    Array = 0x0A,
    Dictionary = 0x0B,
};

class ZemCodec {
  public:
    // Arrays and dictionaries nest at most this deep: the outermost container is level 1.
    static constexpr size_t kMaxDepth = 256;

    ZemCodec() = delete;

    // Appends the encoding of `value` to `out`, growing it once. On an error (a string or key that is not
    // UTF-8, containers nested deeper than kMaxDepth, an encoding longer than `maxBytes`) `out` is left as it was.
    // `out` is a std::vector<uint8_t> or a ZemBytes, which is not zero-filled before the encoding is written.
    template <class Bytes>
    static std::optional<Error> encode(const Value& value, Bytes& out, size_t maxBytes = SIZE_MAX);
    static Result<std::vector<uint8_t>> encode(const Value& value);

    // Bytes that an encoding refers to instead of holding them: the contents of a large string or data value,
    // which belong in `out` right before its byte `offset`. They are the value's own, valid while it lives.
    struct Reference {
        size_t offset;
        std::span<const uint8_t> bytes;
    };
    // encode(), except that the contents of every string and data of at least `minimum` bytes are left out of `out`
    // and appended to `references`, in order: the encoding is `out` with each reference's bytes inserted at its
    // offset. A sender that gathers the pieces so copies none of those bytes. On an error neither is touched.
    static std::optional<Error> encodeReferencing(const Value& value, ZemBytes& out, std::vector<Reference>& references,
                                                  size_t minimum, size_t maxBytes = SIZE_MAX);

    // The exact number of bytes encode() would append, or the error it would return.
    static Result<size_t> encodedSize(const Value& value);

    // Decodes exactly one value that fills all of `bytes`. The error names what was wrong and its byte offset.
    static Result<Value> decode(std::span<const uint8_t> bytes);
};

}  // namespace bexil
