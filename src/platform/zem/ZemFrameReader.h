#pragma once

// ZemFrameReader cuts a Zem byte stream into frames. The connection layer feeds it whatever chunks the socket
// delivers and takes complete frames out; it refuses a bad header (magic, version, kind, reserved bits, serial
// rules) and an oversized announced length as soon as the header is complete, before any payload is buffered.
// One reader belongs to one connection and is used from that connection's queue only.

#include <array>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <optional>
#include <span>
#include <vector>

#include "base/Error.h"
#include "platform/zem/ZemFrame.h"

namespace bexil {

class ZemFrameReader {
  public:
    ZemFrameReader() = default;

    // Takes the next bytes of the stream. Returns the protocol error that the stream has broken, if any; the
    // error is sticky (later calls return it and ignore their bytes, the stream cannot be resynchronised), but
    // frames completed before the offending header can still be taken with next().
    std::optional<Error> feed(std::span<const uint8_t> bytes);

    // Where the next bytes of the stream may be read to directly, so that a large payload is not copied once more
    // out of a read buffer: the part of the current frame's payload that has room now, when at least
    // kInPlaceMinimum bytes of that payload are missing (empty otherwise, or once the stream has broken). It never
    // reaches past the frame, so a read into it cannot take bytes of the next one. Room grows as feed()'s does.
    std::span<uint8_t> payloadRoom();
    // Takes the `bytes` just written to the start of the last payloadRoom(), as feed() would have taken them.
    void receivedInPlace(size_t bytes);

    // The oldest complete frame not yet taken, in stream order.
    std::optional<ZemFrame> next();

    const std::optional<Error>& error() const { return error_; }
    // True while part of a frame (some header bytes, or a header and part of its payload) has arrived. A peer
    // that closes the stream in this state cut a frame short.
    bool hasPartialFrame() const { return headerFill_ > 0 || inPayload_; }
    // Bytes held for the partial frame (header bytes, or payload bytes so far) and for frames not yet taken.
    size_t bufferedBytes() const { return bufferedBytes_ + (inPayload_ ? payloadFill_ : headerFill_); }

    // Payload buffers start this small and grow with the bytes that actually arrive, so a header that merely
    // announces a large frame does not make the reader allocate it.
    static constexpr size_t kInitialPayloadReserve = 64 * 1024;
    // The fewest missing payload bytes that payloadRoom() offers: for less, one read into a buffer that may also
    // take the frames behind costs less than the extra read that stopping at the frame's end would take.
    static constexpr size_t kInPlaceMinimum = 16 * 1024;

  private:
    // Makes room in payload_ for `bytes` more payload bytes, following the growth rule of kInitialPayloadReserve.
    void makeRoom(size_t bytes);
    void completeFrame();

    std::array<uint8_t, ZemFrame::kHeaderBytes> header_{};
    size_t headerFill_ = 0;
    bool inPayload_ = false;
    ZemFrameHeader current_;
    // Room for the current payload; its first payloadFill_ bytes have arrived, the rest is uninitialised.
    ZemBytes payload_;
    size_t payloadFill_ = 0;
    std::deque<ZemFrame> ready_;
    size_t bufferedBytes_ = 0;
    std::optional<Error> error_;
};

}  // namespace bexil
