#pragma once

// ZemFrame is one unit on a Zem stream: a fixed 24-byte header (kind, serials, payload length) followed by the
// payload, one encoded dictionary (docs/protocol.md). A frame is a plain value that owns its payload bytes; it
// may be moved between queues freely.

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "base/Error.h"
#include "bexil/Value.h"
#include "platform/zem/ZemBytes.h"
#include "platform/zem/ZemCodec.h"
#include "platform/zem/ZemProtocolError.h"

namespace bexil {

enum class ZemFrameKind : uint8_t {
    Message = 1,  // one-way: no reply is expected
    Request = 2,  // the receiver answers with exactly one Reply naming this frame's serial
    Reply = 3,    // the answer to the Request whose serial is in inReplyTo
};

const char* zemFrameKindName(ZemFrameKind kind);

// The decoded fixed part of a frame.
struct ZemFrameHeader {
    ZemFrameKind kind = ZemFrameKind::Message;
    uint64_t serial = 0;
    uint64_t inReplyTo = 0;
    uint32_t payloadLength = 0;
    // File descriptors passed with the frame (sent as SCM_RIGHTS with its first byte).
    uint8_t descriptorCount = 0;

    bool operator==(const ZemFrameHeader&) const = default;
};

class ZemFrame {
  public:
    static constexpr uint8_t kMagic = 0xB7;
    static constexpr uint8_t kVersion = 1;
    static constexpr size_t kHeaderBytes = 24;
    // The largest frame, header included, that either side sends or accepts.
    static constexpr size_t kMaxFrameBytes = 16 * 1024 * 1024;
    static constexpr size_t kMaxPayloadBytes = kMaxFrameBytes - kHeaderBytes;
    // The most file descriptors one frame may carry; a header announcing more is refused.
    static constexpr uint8_t kMaxDescriptorsPerFrame = 4;

    ZemFrame() = default;
    ZemFrame(ZemFrameHeader header, ZemBytes payload) : header_(header), payload_(std::move(payload)) {}

    const ZemFrameHeader& header() const { return header_; }
    ZemFrameKind kind() const { return header_.kind; }
    uint64_t serial() const { return header_.serial; }
    uint64_t inReplyTo() const { return header_.inReplyTo; }
    const ZemBytes& payload() const { return payload_; }
    ZemBytes takePayload() { return std::move(payload_); }

    // The payload as a Value; a payload that decodes to anything but a dictionary is a NotDictionary error.
    Result<Value> decodePayload() const;

    // "request #12 (183 bytes)" / "reply #4 to #12 (40 bytes)", for logs and probes.
    std::string description() const;

    // Writes the 24 header bytes. The header must satisfy the rules checkHeader() enforces.
    static void encodeHeader(const ZemFrameHeader& header, std::span<uint8_t, kHeaderBytes> out);
    // Reads and checks a header: magic, version, kind, the descriptor count against kMaxDescriptorsPerFrame, the
    // serial rules of the kind, and the announced length against kMaxFrameBytes (so an oversized frame is refused
    // before its payload is read).
    static Result<ZemFrameHeader> decodeHeader(std::span<const uint8_t, kHeaderBytes> bytes);
    // Whether a header may go on the wire: a Request needs a non-zero serial, a Reply a non-zero inReplyTo,
    // and only a Reply may carry an inReplyTo.
    static std::optional<Error> checkHeader(const ZemFrameHeader& header);

    // Appends a complete frame (header and encoded `payload`, which must be a dictionary) to `out`, which grows
    // once; the header announces `descriptorCount` descriptors, which the caller sends with the frame's first byte.
    // On any error, `out` is left as it was. `out` is a std::vector<uint8_t> or a ZemBytes (see ZemCodec::encode).
    template <class Bytes>
    static std::optional<Error> encode(ZemFrameKind kind, uint64_t serial, uint64_t inReplyTo, const Value& payload,
                                       Bytes& out, uint8_t descriptorCount = 0);

    // encode() for a sender that gathers: the contents of strings and data of at least `minimum` bytes are not
    // copied into `out` but listed in `references` (ZemCodec::encodeReferencing), and the header counts them. The
    // frame is `out` with each reference's bytes inserted at its offset; they stay valid while `payload` lives.
    static std::optional<Error> encodeReferencing(ZemFrameKind kind, uint64_t serial, uint64_t inReplyTo,
                                                  const Value& payload, ZemBytes& out,
                                                  std::vector<ZemCodec::Reference>& references, size_t minimum);
    // encode() with the payload already encoded (one dictionary, as ZemCodec writes it).
    template <class Bytes>
    static std::optional<Error> encodeEncoded(ZemFrameKind kind, uint64_t serial, uint64_t inReplyTo,
                                              std::span<const uint8_t> payload, Bytes& out,
                                              uint8_t descriptorCount = 0);

    // The header alone of the frame that encodeEncoded() would append, for a sender that writes `payload` from
    // where it is; the same checks, the same errors.
    static std::optional<Error> encodeEncodedHeader(ZemFrameKind kind, uint64_t serial, uint64_t inReplyTo,
                                                    std::span<const uint8_t> payload,
                                                    std::span<uint8_t, kHeaderBytes> out);

  private:
    // The checks and the header around a payload that `encodePayload()` appends to `out`, of which `elsewhere()`
    // bytes are not in `out`.
    template <class Bytes, class EncodePayload, class Elsewhere>
    static std::optional<Error> encodeAround(ZemFrameKind kind, uint64_t serial, uint64_t inReplyTo,
                                             const Value& payload, Bytes& out, uint8_t descriptorCount,
                                             EncodePayload&& encodePayload, Elsewhere&& elsewhere);

    ZemFrameHeader header_;
    ZemBytes payload_;
};

}  // namespace bexil
