#pragma once

// ZemCodec turns a Value into the compact binary encoding of the Zem wire format and back (docs/protocol.md).
// It holds no state: every function may be called from any thread at any time.

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string_view>
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

    // Encoded dictionary entries kept for merging into dictionaries later, so that what many messages repeat is
    // checked and encoded once: each entry is its key's length and bytes followed by its encoded value, in
    // ascending key order; `starts` holds where each entry begins.
    struct Entries {
        std::vector<uint8_t> bytes;
        std::vector<uint32_t> starts;
        // How many container levels the deepest value nests below the dictionary the entries are merged into
        // (0 when no value is a container).
        uint32_t levels = 0;

        size_t count() const { return starts.size(); }
        // The key of entry `index`.
        std::string_view key(size_t index) const;
        // The encoded entry `index`: its key, then its value.
        std::span<const uint8_t> entry(size_t index) const;
    };
    // The entries of `dictionary` (a non-dictionary has none), checked as encode() checks them.
    static Result<Entries> encodeEntries(const Value& dictionary);
    // Appends one entry: `key` and then `encodedValue`, an encoding made by this codec that nests `levels` container
    // levels below the entry's dictionary. Entries must come in ascending key order.
    static std::optional<Error> appendEntry(Entries& entries, std::string_view key,
                                            std::span<const uint8_t> encodedValue, uint32_t levels);
    // The same in two steps, for a value encoded straight into the entries: appends `key` as the start of a new
    // entry, and the caller then appends the value's encoding to `bytes` before anything else is appended.
    static std::optional<Error> beginEntry(Entries& entries, std::string_view key, uint32_t levels);
    // Appends the encoding of one dictionary made of `entries` and the entries of `extra` (a dictionary; anything
    // else counts as none), keys in ascending order as encode() writes them; an entry of `extra` takes the place of
    // a kept one with the same key. `depth` is the level of the dictionary within the value being encoded (0 when it
    // is the whole value). Errors as encode()'s; `out` is then left as it was.
    static std::optional<Error> encodeMerged(const Entries& entries, const Value& extra, std::vector<uint8_t>& out,
                                             size_t depth = 0);
    // The bytes encodeMerged would append.
    static Result<size_t> mergedSize(const Entries& entries, const Value& extra, size_t depth = 0);
    // Appends the start of an array of `count` items; the caller appends the items' encodings after it.
    static void appendArrayHeader(size_t count, std::vector<uint8_t>& out);
    // The same for a dictionary of `count` entries, which the caller appends in ascending key order.
    static void appendDictionaryHeader(size_t count, std::vector<uint8_t>& out);
};

}  // namespace bexil
