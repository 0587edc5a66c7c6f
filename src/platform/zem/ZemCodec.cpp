// The Zem value encoding: a tag byte, then a payload whose shape the tag fixes (docs/protocol.md has the table).
//
// Encoding runs in two passes. The first walks the value, checks what the peer would refuse (strings that are not
// UTF-8, nesting beyond kMaxDepth) and adds up the exact size; the second writes through a raw pointer into a
// buffer grown once. So an encode costs one allocation at most (the output's growth) and a failed encode leaves
// the output untouched.
//
// Decoding trusts nothing. Every length and count is checked against the bytes that remain before anything is
// allocated for it, and containers reserve no more than a small fixed number of slots up front: a nested chain of
// containers that each claim "as many items as there are bytes left" would otherwise reserve the input's size
// once per level. Beyond that, vectors grow only with items actually decoded, so memory stays proportional to
// the input. Recursion depth is bounded by kMaxDepth.

#include "platform/zem/ZemCodec.h"

#include <fmt/format.h>

#include <algorithm>
#include <bit>
#include <cstring>
#include <string>
#include <string_view>
#include <utility>

#include "base/Text.h"

namespace bexil {

namespace {

static_assert(std::endian::native == std::endian::little || std::endian::native == std::endian::big);

// Slots a container reserves before it has seen its items; larger containers grow as items arrive.
constexpr size_t kMaxInitialReserve = 1024;
// Longest piece of a key quoted in an error message.
constexpr size_t kMaxQuotedKey = 64;

// A key as it appears in an error message, cut at a sane length.
std::string quoted(std::string_view key) { return quotedForMessage(key, kMaxQuotedKey); }

constexpr size_t varintSize(uint64_t v) {
    size_t n = 1;
    while (v >= 0x80) {
        v >>= 7;
        ++n;
    }
    return n;
}

constexpr uint64_t zigzag(int64_t v) { return (static_cast<uint64_t>(v) << 1) ^ static_cast<uint64_t>(v >> 63); }
constexpr int64_t unzigzag(uint64_t v) { return static_cast<int64_t>((v >> 1) ^ (~(v & 1) + 1)); }

inline uint8_t* putVarint(uint8_t* p, uint64_t v) {
    while (v >= 0x80) {
        *p++ = static_cast<uint8_t>(v) | 0x80;
        v >>= 7;
    }
    *p++ = static_cast<uint8_t>(v);
    return p;
}

inline uint8_t* putU64(uint8_t* p, uint64_t v) {
    if constexpr (std::endian::native == std::endian::big) v = __builtin_bswap64(v);
    std::memcpy(p, &v, 8);
    return p + 8;
}

inline uint64_t getU64(const uint8_t* p) {
    uint64_t v;
    std::memcpy(&v, p, 8);
    if constexpr (std::endian::native == std::endian::big) v = __builtin_bswap64(v);
    return v;
}

inline uint8_t* putBytes(uint8_t* p, const void* bytes, size_t n) {
    if (n) std::memcpy(p, bytes, n);
    return p + n;
}

inline uint8_t* putTag(uint8_t* p, ZemTag tag) {
    *p = static_cast<uint8_t>(tag);
    return p + 1;
}

// ---- Encoding ----

// First pass: the exact size, or the first thing the peer would refuse. `size` is also the offset in the
// encoding where the value being looked at starts, which makes encoding errors as precise as decoding ones.
class Sizer {
  public:
    std::optional<Error> error;
    size_t size = 0;
    // The deepest level at which a container was entered.
    size_t deepest = 0;

    void visit(const Value& v, size_t depth) {
        switch (v.kind()) {
            case ValueKind::Null:
            case ValueKind::Bool:
                size += 1;
                return;
            case ValueKind::Int64:
                size += 1 + varintSize(zigzag(*v.getInt64()));
                return;
            case ValueKind::UInt64:
                size += 1 + varintSize(*v.getUInt64());
                return;
            case ValueKind::Real:
            case ValueKind::Date:
                size += 9;
                return;
            case ValueKind::Uuid:
                size += 17;
                return;
            case ValueKind::String: {
                std::string_view s = v.stringView();
                text(s, "string");
                size += 1 + varintSize(s.size()) + s.size();
                return;
            }
            case ValueKind::Data: {
                size_t n = v.dataBytes().size();
                size += 1 + varintSize(n) + n;
                return;
            }
            case ValueKind::Array:
                if (!enter(depth)) return;
                size += 1 + varintSize(v.count());
                for (const Value& item : v.items()) {
                    visit(item, depth + 1);
                    if (error) return;
                }
                return;
            case ValueKind::Dictionary:
                if (!enter(depth)) return;
                size += 1 + varintSize(v.count());
                for (const DictionaryEntry& e : v.entries()) {
                    text(e.key, "dictionary key");
                    if (error) return;
                    size += varintSize(e.key.size()) + e.key.size();
                    visit(e.value, depth + 1);
                    if (error) return;
                }
                return;
        }
    }

  private:
    bool enter(size_t depth) {
        deepest = std::max(deepest, depth);
        if (depth < ZemCodec::kMaxDepth) return true;
        error = zemError(
            ZemErrorCode::TooDeep,
            fmt::format("container at offset {} nests deeper than the limit of {} levels", size, ZemCodec::kMaxDepth));
        return false;
    }

  public:
    void text(std::string_view s, const char* what) {
        size_t bad = firstInvalidUtf8(s);
        if (bad == kWellFormedUtf8) return;
        error = zemError(ZemErrorCode::InvalidUtf8,
                         fmt::format("{} at offset {} is not UTF-8 (bad byte 0x{:02x} at index {})", what, size,
                                     static_cast<uint8_t>(s[bad]), bad));
    }
};

// Second pass: writes what the first pass measured and validated. Given `references`, it leaves the contents of
// strings and data of at least `minimum` bytes out and lists them there.
struct Writer {
    const uint8_t* base = nullptr;
    std::vector<ZemCodec::Reference>* references = nullptr;
    size_t minimum = SIZE_MAX;

    uint8_t* write(uint8_t* p, const Value& v);

    uint8_t* putContents(uint8_t* p, const void* bytes, size_t n) {
        if (n < minimum) return putBytes(p, bytes, n);
        references->push_back({static_cast<size_t>(p - base), std::span(static_cast<const uint8_t*>(bytes), n)});
        return p;
    }
};

uint8_t* Writer::write(uint8_t* p, const Value& v) {
    switch (v.kind()) {
        case ValueKind::Null:
            return putTag(p, ZemTag::Null);
        case ValueKind::Bool:
            return putTag(p, *v.getBool() ? ZemTag::True : ZemTag::False);
        case ValueKind::Int64:
            return putVarint(putTag(p, ZemTag::Int64), zigzag(*v.getInt64()));
        case ValueKind::UInt64:
            return putVarint(putTag(p, ZemTag::UInt64), *v.getUInt64());
        case ValueKind::Real:
            return putU64(putTag(p, ZemTag::Real), std::bit_cast<uint64_t>(*v.getReal()));
        case ValueKind::Date:
            return putU64(putTag(p, ZemTag::Date), std::bit_cast<uint64_t>(v.getDate()->secondsSince1970));
        case ValueKind::Uuid:
            return putBytes(putTag(p, ZemTag::Uuid), v.getUuid()->bytes().data(), 16);
        case ValueKind::String: {
            std::string_view s = v.stringView();
            return putContents(putVarint(putTag(p, ZemTag::String), s.size()), s.data(), s.size());
        }
        case ValueKind::Data: {
            auto bytes = v.dataBytes();
            return putContents(putVarint(putTag(p, ZemTag::Data), bytes.size()), bytes.data(), bytes.size());
        }
        case ValueKind::Array:
            p = putVarint(putTag(p, ZemTag::Array), v.count());
            for (const Value& item : v.items()) p = write(p, item);
            return p;
        case ValueKind::Dictionary:
            // Entries are held sorted by key bytes, so the encoding is canonical: equal dictionaries encode alike.
            p = putVarint(putTag(p, ZemTag::Dictionary), v.count());
            for (const DictionaryEntry& e : v.entries()) {
                p = putBytes(putVarint(p, e.key.size()), e.key.data(), e.key.size());
                p = write(p, e.value);
            }
            return p;
    }
    return p;
}

// ---- Decoding ----

class Decoder {
  public:
    Decoder(const uint8_t* bytes, size_t size) : base_(bytes), size_(size) {}

    std::optional<Error> error;

    bool value(Value& out, size_t depth) {
        size_t start = pos_;
        if (pos_ >= size_)
            return fail(ZemErrorCode::Truncated,
                        fmt::format("input ends at offset {} where a value should start", pos_));
        auto tag = static_cast<ZemTag>(base_[pos_++]);
        switch (tag) {
            case ZemTag::Null:
                out = Value();
                return true;
            case ZemTag::False:
                out = Value::boolean(false);
                return true;
            case ZemTag::True:
                out = Value::boolean(true);
                return true;
            case ZemTag::Int64: {
                uint64_t u;
                if (!varint(u, "int64")) return false;
                out = Value::int64(unzigzag(u));
                return true;
            }
            case ZemTag::UInt64: {
                uint64_t u;
                if (!varint(u, "uint64")) return false;
                out = Value::uint64(u);
                return true;
            }
            case ZemTag::Real:
            case ZemTag::Date: {
                const char* what = tag == ZemTag::Real ? "real" : "date";
                if (!need(8, what, start)) return false;
                double d = std::bit_cast<double>(getU64(base_ + pos_));
                pos_ += 8;
                out = tag == ZemTag::Real ? Value::real(d) : Value::date(Date{d});
                return true;
            }
            case ZemTag::Uuid: {
                if (!need(16, "uuid", start)) return false;
                std::array<uint8_t, 16> bytes;
                std::memcpy(bytes.data(), base_ + pos_, 16);
                pos_ += 16;
                out = Value::uuid(Uuid(bytes));
                return true;
            }
            case ZemTag::String: {
                std::string_view s;
                if (!text(s, "string", start)) return false;
                out = Value::string(s);
                return true;
            }
            case ZemTag::Data: {
                uint64_t n;
                if (!varint(n, "data length") || !need(n, "data", start)) return false;
                out = Value::data(std::span<const uint8_t>(base_ + pos_, n));
                pos_ += n;
                return true;
            }
            case ZemTag::Array:
                return array(out, depth, start);
            case ZemTag::Dictionary:
                return dictionary(out, depth, start);
        }
        return fail(ZemErrorCode::BadTag,
                    fmt::format("unknown tag 0x{:02x} at offset {}", static_cast<uint8_t>(tag), start));
    }

    size_t position() const { return pos_; }

  private:
    const uint8_t* base_;
    size_t size_;
    size_t pos_ = 0;

    size_t remaining() const { return size_ - pos_; }

    bool fail(ZemErrorCode code, std::string message) {
        error = zemError(code, std::move(message));
        return false;
    }

    bool need(uint64_t n, const char* what, size_t start) {
        if (n <= remaining()) return true;
        return fail(ZemErrorCode::Truncated,
                    fmt::format("{} at offset {} needs {} bytes but only {} remain", what, start, n, remaining()));
    }

    // Unsigned LEB128 in its shortest form, at most ten bytes.
    bool varint(uint64_t& out, const char* what) {
        size_t start = pos_;
        uint64_t result = 0;
        for (unsigned shift = 0;; shift += 7) {
            if (pos_ >= size_)
                return fail(ZemErrorCode::Truncated,
                            fmt::format("input ends inside the {} varint at offset {}", what, start));
            uint8_t byte = base_[pos_++];
            if (shift == 63 && byte > 1)
                return fail(ZemErrorCode::BadVarint,
                            fmt::format("{} varint at offset {} exceeds 64 bits", what, start));
            result |= static_cast<uint64_t>(byte & 0x7F) << shift;
            if (!(byte & 0x80)) {
                if (byte == 0 && shift > 0)
                    return fail(ZemErrorCode::BadVarint,
                                fmt::format("{} varint at offset {} is not in its shortest form", what, start));
                out = result;
                return true;
            }
        }
    }

    // A length-prefixed UTF-8 text (a string's payload or a dictionary key); the view points into the input.
    bool text(std::string_view& out, const char* what, size_t start) {
        uint64_t n;
        if (!varint(n, what) || !need(n, what, start)) return false;
        size_t bad = firstInvalidUtf8(base_ + pos_, n);
        if (bad != kWellFormedUtf8)
            return fail(ZemErrorCode::InvalidUtf8,
                        fmt::format("{} at offset {} is not UTF-8 (bad byte 0x{:02x} at offset {})", what, start,
                                    base_[pos_ + bad], pos_ + bad));
        out = std::string_view(reinterpret_cast<const char*>(base_ + pos_), n);
        pos_ += n;
        return true;
    }

    bool enter(size_t depth, size_t start) {
        if (depth < ZemCodec::kMaxDepth) return true;
        return fail(
            ZemErrorCode::TooDeep,
            fmt::format("container at offset {} nests deeper than the limit of {} levels", start, ZemCodec::kMaxDepth));
    }

    // Checks a count against the input before anything is allocated for it: every item takes at least
    // `minimumItemBytes` bytes.
    bool count(uint64_t& n, uint64_t minimumItemBytes, const char* what, size_t start) {
        if (!varint(n, what)) return false;
        if (n <= remaining() / minimumItemBytes) return true;
        return fail(
            ZemErrorCode::CountExceedsInput,
            fmt::format("{} at offset {} claims {} items but only {} bytes remain", what, start, n, remaining()));
    }

    bool array(Value& out, size_t depth, size_t start) {
        uint64_t n;
        if (!enter(depth, start) || !count(n, 1, "array", start)) return false;
        std::vector<Value> items;
        items.reserve(std::min<uint64_t>(n, kMaxInitialReserve));
        for (uint64_t i = 0; i < n; ++i) {
            items.emplace_back();
            if (!value(items.back(), depth + 1)) return false;
        }
        out = Value::array(std::move(items));
        return true;
    }

    bool dictionary(Value& out, size_t depth, size_t start) {
        uint64_t n;
        // An entry is at least a key length byte and a value tag.
        if (!enter(depth, start) || !count(n, 2, "dictionary", start)) return false;
        // Our own encoder writes keys in ascending byte order: such entries go straight into the dictionary
        // being built, and a duplicate shows up as a key equal to the one before. The first key out of order
        // moves everything to a list that is checked for duplicates once complete, so any order is accepted
        // without quadratic insertion.
        MutableDictionary sorted;
        sorted.reserve(std::min<uint64_t>(n, kMaxInitialReserve));
        std::vector<std::pair<std::string, Value>> entries;
        std::string_view previous;
        bool ascending = true;
        for (uint64_t i = 0; i < n; ++i) {
            size_t keyStart = pos_;
            std::string_view key;
            if (!text(key, "dictionary key", keyStart)) return false;
            if (ascending && i > 0 && !(previous < key)) {
                if (key == previous)
                    return fail(ZemErrorCode::DuplicateKey,
                                fmt::format("duplicate key {} at offset {} in the dictionary at offset {}", quoted(key),
                                            keyStart, start));
                ascending = false;
                Value partial = sorted.take();
                entries.reserve(std::min<uint64_t>(n, kMaxInitialReserve));
                for (const DictionaryEntry& e : partial.entries()) entries.emplace_back(e.key, e.value);
            }
            previous = key;
            if (ascending) {
                Value item;
                if (!value(item, depth + 1)) return false;
                sorted.set(key, std::move(item));
            } else {
                entries.emplace_back(std::string(key), Value());
                if (!value(entries.back().second, depth + 1)) return false;
            }
        }
        if (ascending) {
            out = sorted.take();
            return true;
        }
        std::vector<std::string_view> keys;
        keys.reserve(entries.size());
        for (const auto& e : entries) keys.emplace_back(e.first);
        std::sort(keys.begin(), keys.end());
        auto dup = std::adjacent_find(keys.begin(), keys.end());
        if (dup != keys.end())
            return fail(ZemErrorCode::DuplicateKey,
                        fmt::format("duplicate key {} in the dictionary at offset {}", quoted(*dup), start));
        out = Value::dictionary(std::move(entries));
        return true;
    }
};

// ---- Merging kept entries ----

std::optional<Error> tooDeep(size_t depth) {
    return zemError(ZemErrorCode::TooDeep, fmt::format("dictionary entries kept at level {} nest deeper than the "
                                                       "limit of {} levels",
                                                       depth, ZemCodec::kMaxDepth));
}

size_t entrySize(const ZemCodec::Entries& entries, size_t index) {
    size_t end = index + 1 < entries.count() ? entries.starts[index + 1] : entries.bytes.size();
    return end - entries.starts[index];
}

// What a merge writes: the number of entries and the exact size, once the extra entries are checked.
struct MergePlan {
    std::optional<Error> error;
    size_t count = 0;
    size_t size = 0;
};

MergePlan planMerge(const ZemCodec::Entries& entries, std::span<const DictionaryEntry> extra, size_t depth) {
    MergePlan plan;
    if (depth >= ZemCodec::kMaxDepth || (entries.levels > 0 && depth + entries.levels >= ZemCodec::kMaxDepth)) {
        plan.error = tooDeep(depth);
        return plan;
    }
    Sizer sizer;
    size_t replaced = 0;
    size_t kept = 0;
    for (const DictionaryEntry& e : extra) {
        sizer.text(e.key, "dictionary key");
        if (sizer.error) break;
        sizer.size += varintSize(e.key.size()) + e.key.size();
        sizer.visit(e.value, depth + 1);
        if (sizer.error) break;
    }
    if (sizer.error) {
        plan.error = std::move(sizer.error);
        return plan;
    }
    // Both lists are in ascending key order: a walk of both finds the kept entries that the extra ones replace.
    for (size_t i = 0, j = 0; i < entries.count(); ++i) {
        std::string_view key = entries.key(i);
        while (j < extra.size() && std::string_view(extra[j].key) < key) ++j;
        if (j < extra.size() && extra[j].key == key) {
            ++replaced;
            continue;
        }
        kept += entrySize(entries, i);
    }
    plan.count = entries.count() - replaced + extra.size();
    plan.size = 1 + varintSize(plan.count) + kept + sizer.size;
    return plan;
}

}  // namespace

Result<size_t> ZemCodec::encodedSize(const Value& value) {
    Sizer sizer;
    sizer.visit(value, 0);
    if (sizer.error) return *sizer.error;
    return sizer.size;
}

namespace {

// The size of `value`'s encoding, once the first pass found it encodable and no larger than `maxBytes`.
Result<size_t> measuredWithin(const Value& value, size_t maxBytes) {
    Sizer sizer;
    sizer.visit(value, 0);
    if (sizer.error) return *sizer.error;
    if (sizer.size > maxBytes)
        return zemError(ZemErrorCode::FrameTooLarge,
                        fmt::format("encoding of {} bytes exceeds the limit of {} bytes", sizer.size, maxBytes));
    return sizer.size;
}

}  // namespace

template <class Bytes>
std::optional<Error> ZemCodec::encode(const Value& value, Bytes& out, size_t maxBytes) {
    Result<size_t> size = measuredWithin(value, maxBytes);
    if (!size) return size.error();
    size_t start = out.size();
    out.resize(start + *size);
    uint8_t* end = Writer{}.write(out.data() + start, value);
    if (end != out.data() + out.size())
        throw InternalInconsistency("Zem encoder wrote a different number of bytes than it measured");
    return std::nullopt;
}

template std::optional<Error> ZemCodec::encode(const Value&, std::vector<uint8_t>&, size_t);
template std::optional<Error> ZemCodec::encode(const Value&, ZemBytes&, size_t);

std::optional<Error> ZemCodec::encodeReferencing(const Value& value, ZemBytes& out, std::vector<Reference>& references,
                                                 size_t minimum, size_t maxBytes) {
    Result<size_t> size = measuredWithin(value, maxBytes);
    if (!size) return size.error();
    // Room for the whole encoding, of which the referenced bytes are then given back (nothing is written there).
    const size_t start = out.size();
    const size_t listed = references.size();
    out.resize(start + *size);
    Writer writer{out.data(), &references, minimum};
    uint8_t* end = writer.write(out.data() + start, value);
    size_t referenced = 0;
    for (size_t i = listed; i < references.size(); ++i) referenced += references[i].bytes.size();
    if (static_cast<size_t>(end - out.data()) + referenced != out.size())
        throw InternalInconsistency("Zem encoder wrote a different number of bytes than it measured");
    out.resize(static_cast<size_t>(end - out.data()));
    return std::nullopt;
}

Result<std::vector<uint8_t>> ZemCodec::encode(const Value& value) {
    std::vector<uint8_t> out;
    if (auto error = encode(value, out)) return *error;
    return out;
}

Result<Value> ZemCodec::decode(std::span<const uint8_t> bytes) {
    Decoder decoder(bytes.data(), bytes.size());
    Value result;
    if (!decoder.value(result, 0)) return *decoder.error;
    if (decoder.position() != bytes.size())
        return zemError(ZemErrorCode::TrailingBytes,
                        fmt::format("{} bytes follow the value that ends at offset {}",
                                    bytes.size() - decoder.position(), decoder.position()));
    return result;
}

std::string_view ZemCodec::Entries::key(size_t index) const {
    const uint8_t* p = bytes.data() + starts[index];
    uint64_t length = 0;
    for (unsigned shift = 0;; shift += 7) {
        uint8_t byte = *p++;
        length |= static_cast<uint64_t>(byte & 0x7F) << shift;
        if (!(byte & 0x80)) break;
    }
    return std::string_view(reinterpret_cast<const char*>(p), length);
}

std::span<const uint8_t> ZemCodec::Entries::entry(size_t index) const {
    return std::span<const uint8_t>(bytes.data() + starts[index], entrySize(*this, index));
}

Result<ZemCodec::Entries> ZemCodec::encodeEntries(const Value& dictionary) {
    Entries entries;
    std::vector<uint8_t> value;
    for (const DictionaryEntry& e : dictionary.entries()) {
        Sizer sizer;
        sizer.visit(e.value, 1);
        if (sizer.error) return *sizer.error;
        value.resize(sizer.size);
        if (Writer{}.write(value.data(), e.value) != value.data() + value.size())
            throw InternalInconsistency("Zem encoder wrote a different number of bytes than it measured");
        if (auto error = appendEntry(entries, e.key, value, static_cast<uint32_t>(sizer.deepest))) return *error;
    }
    entries.bytes.shrink_to_fit();
    entries.starts.shrink_to_fit();
    return entries;
}

std::optional<Error> ZemCodec::beginEntry(Entries& entries, std::string_view key, uint32_t levels) {
    Sizer sizer;
    sizer.text(key, "dictionary key");
    if (sizer.error) return sizer.error;
    if (entries.count() > 0 && !(entries.key(entries.count() - 1) < key))
        throw InternalInconsistency("dictionary entries kept out of key order");
    if (entries.bytes.size() > UINT32_MAX - 10 - key.size())
        return zemError(ZemErrorCode::FrameTooLarge, "dictionary entries kept exceed 4 GiB");
    size_t start = entries.bytes.size();
    entries.starts.push_back(static_cast<uint32_t>(start));
    entries.bytes.resize(start + varintSize(key.size()) + key.size());
    putBytes(putVarint(entries.bytes.data() + start, key.size()), key.data(), key.size());
    entries.levels = std::max(entries.levels, levels);
    return std::nullopt;
}

std::optional<Error> ZemCodec::appendEntry(Entries& entries, std::string_view key,
                                           std::span<const uint8_t> encodedValue, uint32_t levels) {
    if (entries.bytes.size() + encodedValue.size() > UINT32_MAX - 10 - key.size())
        return zemError(ZemErrorCode::FrameTooLarge, "dictionary entries kept exceed 4 GiB");
    if (std::optional<Error> error = beginEntry(entries, key, levels)) return error;
    entries.bytes.insert(entries.bytes.end(), encodedValue.begin(), encodedValue.end());
    return std::nullopt;
}

Result<size_t> ZemCodec::mergedSize(const Entries& entries, const Value& extra, size_t depth) {
    MergePlan plan = planMerge(entries, extra.entries(), depth);
    if (plan.error) return *plan.error;
    return plan.size;
}

std::optional<Error> ZemCodec::encodeMerged(const Entries& entries, const Value& extra, std::vector<uint8_t>& out,
                                            size_t depth) {
    std::span<const DictionaryEntry> more = extra.entries();
    MergePlan plan = planMerge(entries, more, depth);
    if (plan.error) return plan.error;
    size_t start = out.size();
    out.resize(start + plan.size);
    uint8_t* p = putVarint(putTag(out.data() + start, ZemTag::Dictionary), plan.count);
    auto writeExtra = [&p](const DictionaryEntry& e) {
        p = Writer{}.write(putBytes(putVarint(p, e.key.size()), e.key.data(), e.key.size()), e.value);
    };
    size_t j = 0;
    for (size_t i = 0; i < entries.count(); ++i) {
        std::string_view key = entries.key(i);
        while (j < more.size() && std::string_view(more[j].key) < key) writeExtra(more[j++]);
        if (j < more.size() && more[j].key == key) {
            writeExtra(more[j++]);
            continue;
        }
        p = putBytes(p, entries.bytes.data() + entries.starts[i], entrySize(entries, i));
    }
    while (j < more.size()) writeExtra(more[j++]);
    if (p != out.data() + out.size())
        throw InternalInconsistency("Zem encoder wrote a different number of bytes than it measured");
    return std::nullopt;
}

void ZemCodec::appendArrayHeader(size_t count, std::vector<uint8_t>& out) {
    size_t start = out.size();
    out.resize(start + 1 + varintSize(count));
    putVarint(putTag(out.data() + start, ZemTag::Array), count);
}

void ZemCodec::appendDictionaryHeader(size_t count, std::vector<uint8_t>& out) {
    size_t start = out.size();
    out.resize(start + 1 + varintSize(count));
    putVarint(putTag(out.data() + start, ZemTag::Dictionary), count);
}

}  // namespace bexil
