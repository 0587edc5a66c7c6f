#include "platform/zem/ZemFrame.h"

#include <fmt/format.h>

#include <cstring>

#include "platform/zem/ZemCodec.h"

namespace bexil {

namespace {

// Header layout: magic, version, kind, descriptor count, payload length u32, serial u64, inReplyTo u64;
// little-endian.
constexpr size_t kMagicOffset = 0;
constexpr size_t kVersionOffset = 1;
constexpr size_t kKindOffset = 2;
constexpr size_t kDescriptorsOffset = 3;
constexpr size_t kLengthOffset = 4;
constexpr size_t kSerialOffset = 8;
constexpr size_t kInReplyToOffset = 16;

void putLittleEndian(uint8_t* p, uint64_t v, size_t bytes) {
    for (size_t i = 0; i < bytes; ++i) p[i] = static_cast<uint8_t>(v >> (8 * i));
}

uint64_t getLittleEndian(const uint8_t* p, size_t bytes) {
    uint64_t v = 0;
    for (size_t i = 0; i < bytes; ++i) v |= static_cast<uint64_t>(p[i]) << (8 * i);
    return v;
}

}  // namespace

const char* zemFrameKindName(ZemFrameKind kind) {
    switch (kind) {
        case ZemFrameKind::Message:
            return "message";
        case ZemFrameKind::Request:
            return "request";
        case ZemFrameKind::Reply:
            return "reply";
    }
    return "unknown";
}

Result<Value> ZemFrame::decodePayload() const {
    Result<Value> value = ZemCodec::decode(payload_);
    if (value && !value->isDictionary())
        return zemError(ZemErrorCode::NotDictionary,
                        fmt::format("{} #{} carries a {} where a dictionary is required",
                                    zemFrameKindName(header_.kind), header_.serial, valueKindName(value->kind())));
    return value;
}

std::string ZemFrame::description() const {
    if (header_.kind == ZemFrameKind::Reply)
        return fmt::format("reply #{} to #{} ({} bytes)", header_.serial, header_.inReplyTo, payload_.size());
    return fmt::format("{} #{} ({} bytes)", zemFrameKindName(header_.kind), header_.serial, payload_.size());
}

void ZemFrame::encodeHeader(const ZemFrameHeader& header, std::span<uint8_t, kHeaderBytes> out) {
    uint8_t* p = out.data();
    p[kMagicOffset] = kMagic;
    p[kVersionOffset] = kVersion;
    p[kKindOffset] = static_cast<uint8_t>(header.kind);
    p[kDescriptorsOffset] = header.descriptorCount;
    putLittleEndian(p + kLengthOffset, header.payloadLength, 4);
    putLittleEndian(p + kSerialOffset, header.serial, 8);
    putLittleEndian(p + kInReplyToOffset, header.inReplyTo, 8);
}

std::optional<Error> ZemFrame::checkHeader(const ZemFrameHeader& h) {
    if (h.kind == ZemFrameKind::Request && h.serial == 0)
        return zemError(ZemErrorCode::BadHeader, "request with serial 0");
    if (h.kind == ZemFrameKind::Reply && h.inReplyTo == 0)
        return zemError(ZemErrorCode::BadHeader, fmt::format("reply #{} answers serial 0", h.serial));
    if (h.kind != ZemFrameKind::Reply && h.inReplyTo != 0)
        return zemError(ZemErrorCode::BadHeader,
                        fmt::format("{} #{} carries in-reply-to #{}", zemFrameKindName(h.kind), h.serial, h.inReplyTo));
    if (kHeaderBytes + uint64_t{h.payloadLength} > kMaxFrameBytes)
        return zemError(ZemErrorCode::FrameTooLarge,
                        fmt::format("frame of {} bytes exceeds limit kMaxFrameBytes ({})",
                                    kHeaderBytes + uint64_t{h.payloadLength}, kMaxFrameBytes));
    return std::nullopt;
}

Result<ZemFrameHeader> ZemFrame::decodeHeader(std::span<const uint8_t, kHeaderBytes> bytes) {
    const uint8_t* p = bytes.data();
    if (p[kMagicOffset] != kMagic)
        return zemError(ZemErrorCode::BadMagic, fmt::format("frame starts with 0x{:02x}, not the magic byte 0x{:02x}",
                                                            p[kMagicOffset], kMagic));
    if (p[kVersionOffset] != kVersion)
        return zemError(ZemErrorCode::UnsupportedVersion,
                        fmt::format("frame format version {} (this side speaks {})", p[kVersionOffset], kVersion));
    uint8_t kind = p[kKindOffset];
    if (kind < static_cast<uint8_t>(ZemFrameKind::Message) || kind > static_cast<uint8_t>(ZemFrameKind::Reply))
        return zemError(ZemErrorCode::UnknownKind, fmt::format("unknown frame kind {}", kind));
    if (p[kDescriptorsOffset] > kMaxDescriptorsPerFrame)
        return zemError(ZemErrorCode::BadHeader, fmt::format("frame announces {} descriptors, more than {}",
                                                             p[kDescriptorsOffset], kMaxDescriptorsPerFrame));
    ZemFrameHeader header;
    header.kind = static_cast<ZemFrameKind>(kind);
    header.descriptorCount = p[kDescriptorsOffset];
    header.payloadLength = static_cast<uint32_t>(getLittleEndian(p + kLengthOffset, 4));
    header.serial = getLittleEndian(p + kSerialOffset, 8);
    header.inReplyTo = getLittleEndian(p + kInReplyToOffset, 8);
    if (auto error = checkHeader(header)) return *error;
    return header;
}

template <class Bytes, class EncodePayload, class Elsewhere>
std::optional<Error> ZemFrame::encodeAround(ZemFrameKind kind, uint64_t serial, uint64_t inReplyTo,
                                            const Value& payload, Bytes& out, uint8_t descriptorCount,
                                            EncodePayload&& encodePayload, Elsewhere&& elsewhere) {
    if (!payload.isDictionary())
        return zemError(ZemErrorCode::NotDictionary,
                        fmt::format("a {} cannot carry a {}; payloads are dictionaries", zemFrameKindName(kind),
                                    valueKindName(payload.kind())));
    ZemFrameHeader header{kind, serial, inReplyTo, 0, descriptorCount};
    if (descriptorCount > kMaxDescriptorsPerFrame)
        return zemError(ZemErrorCode::BadHeader, fmt::format("a frame carries at most {} descriptors, not {}",
                                                             kMaxDescriptorsPerFrame, descriptorCount));
    if (auto error = checkHeader(header)) return error;
    size_t start = out.size();
    out.resize(start + kHeaderBytes);
    if (auto error = encodePayload()) {
        out.resize(start);
        if (isZemError(*error, ZemErrorCode::FrameTooLarge)) {
            size_t size = kHeaderBytes + ZemCodec::encodedSize(payload).value();
            return zemError(ZemErrorCode::FrameTooLarge,
                            fmt::format("frame of {} bytes exceeds limit kMaxFrameBytes ({})", size, kMaxFrameBytes));
        }
        return error;
    }
    header.payloadLength = static_cast<uint32_t>(out.size() - start - kHeaderBytes + elsewhere());
    encodeHeader(header, std::span<uint8_t, kHeaderBytes>(out.data() + start, kHeaderBytes));
    return std::nullopt;
}

template <class Bytes>
std::optional<Error> ZemFrame::encode(ZemFrameKind kind, uint64_t serial, uint64_t inReplyTo, const Value& payload,
                                      Bytes& out, uint8_t descriptorCount) {
    return encodeAround(
        kind, serial, inReplyTo, payload, out, descriptorCount,
        [&] { return ZemCodec::encode(payload, out, kMaxPayloadBytes); }, [] { return size_t{0}; });
}

template std::optional<Error> ZemFrame::encode(ZemFrameKind, uint64_t, uint64_t, const Value&, std::vector<uint8_t>&,
                                               uint8_t);
template std::optional<Error> ZemFrame::encode(ZemFrameKind, uint64_t, uint64_t, const Value&, ZemBytes&, uint8_t);

std::optional<Error> ZemFrame::encodeReferencing(ZemFrameKind kind, uint64_t serial, uint64_t inReplyTo,
                                                 const Value& payload, ZemBytes& out,
                                                 std::vector<ZemCodec::Reference>& references, size_t minimum) {
    const size_t listed = references.size();
    return encodeAround(
        kind, serial, inReplyTo, payload, out, 0,
        [&] { return ZemCodec::encodeReferencing(payload, out, references, minimum, kMaxPayloadBytes); },
        [&] {
            size_t referenced = 0;
            for (size_t i = listed; i < references.size(); ++i) referenced += references[i].bytes.size();
            return referenced;
        });
}

namespace {

// The header of a frame around an encoded payload, or why there can be none.
Result<ZemFrameHeader> headerForEncoded(ZemFrameKind kind, uint64_t serial, uint64_t inReplyTo,
                                        std::span<const uint8_t> payload, uint8_t descriptorCount) {
    if (payload.empty() || payload[0] != static_cast<uint8_t>(ZemTag::Dictionary))
        return zemError(
            ZemErrorCode::NotDictionary,
            fmt::format("a {} carries a dictionary; this payload is something else", zemFrameKindName(kind)));
    ZemFrameHeader header{kind, serial, inReplyTo, 0, descriptorCount};
    if (descriptorCount > ZemFrame::kMaxDescriptorsPerFrame)
        return zemError(ZemErrorCode::BadHeader, fmt::format("a frame carries at most {} descriptors, not {}",
                                                             ZemFrame::kMaxDescriptorsPerFrame, descriptorCount));
    if (auto error = ZemFrame::checkHeader(header)) return *error;
    if (payload.size() > ZemFrame::kMaxPayloadBytes)
        return zemError(ZemErrorCode::FrameTooLarge,
                        fmt::format("frame of {} bytes exceeds limit kMaxFrameBytes ({})",
                                    ZemFrame::kHeaderBytes + payload.size(), ZemFrame::kMaxFrameBytes));
    header.payloadLength = static_cast<uint32_t>(payload.size());
    return header;
}

}  // namespace

std::optional<Error> ZemFrame::encodeEncodedHeader(ZemFrameKind kind, uint64_t serial, uint64_t inReplyTo,
                                                   std::span<const uint8_t> payload,
                                                   std::span<uint8_t, kHeaderBytes> out) {
    Result<ZemFrameHeader> header = headerForEncoded(kind, serial, inReplyTo, payload, 0);
    if (!header) return header.error();
    encodeHeader(*header, out);
    return std::nullopt;
}

template <class Bytes>
std::optional<Error> ZemFrame::encodeEncoded(ZemFrameKind kind, uint64_t serial, uint64_t inReplyTo,
                                             std::span<const uint8_t> payload, Bytes& out, uint8_t descriptorCount) {
    Result<ZemFrameHeader> header = headerForEncoded(kind, serial, inReplyTo, payload, descriptorCount);
    if (!header) return header.error();
    size_t start = out.size();
    out.resize(start + kHeaderBytes + payload.size());
    encodeHeader(*header, std::span<uint8_t, kHeaderBytes>(out.data() + start, kHeaderBytes));
    std::memcpy(out.data() + start + kHeaderBytes, payload.data(), payload.size());
    return std::nullopt;
}

template std::optional<Error> ZemFrame::encodeEncoded(ZemFrameKind, uint64_t, uint64_t, std::span<const uint8_t>,
                                                      std::vector<uint8_t>&, uint8_t);
template std::optional<Error> ZemFrame::encodeEncoded(ZemFrameKind, uint64_t, uint64_t, std::span<const uint8_t>,
                                                      ZemBytes&, uint8_t);

}  // namespace bexil
