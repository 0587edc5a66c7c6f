// Feeds arbitrary bytes to the Zem frame reader, once whole, once in chunks whose sizes come from the input itself
// (the first byte seeds the chunk sizes, the rest is the stream), and once so in chunks but with the bulk of large
// payloads written straight into the room the reader offers, as a connection reads. All readings must yield the
// same frames and the same error; every frame whose payload decodes must encode back into a frame with the same header
// that decodes to the same value.

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <optional>
#include <span>
#include <vector>

#include "../tests/platform/ZemStrictEqual.h"
#include "platform/zem/ZemFrame.h"
#include "platform/zem/ZemFrameReader.h"

namespace {

using namespace bexil;

struct Outcome {
    std::vector<ZemFrame> frames;
    std::optional<Error> error;
};

// Reads `bytes` whole or in chunks; `inPlace` writes each chunk straight into the payload whenever the reader
// offers room for it, as a connection's reads do.
Outcome readAll(std::span<const uint8_t> bytes, size_t chunkSeed, bool inPlace = false) {
    ZemFrameReader reader;
    Outcome outcome;
    size_t at = 0;
    while (at < bytes.size() && !outcome.error) {
        size_t n = chunkSeed == 0 ? bytes.size() : 1 + (chunkSeed * (at + 7)) % 61;
        n = std::min(n, bytes.size() - at);
        std::span<uint8_t> room = inPlace ? reader.payloadRoom() : std::span<uint8_t>();
        if (!room.empty()) {
            // A read into the payload takes what has come, up to the room: all of it, or (odd seeds) pieces.
            n = std::min({room.size(), bytes.size() - at, chunkSeed % 2 == 1 ? n * 1024 : SIZE_MAX});
            std::copy_n(bytes.begin() + static_cast<std::ptrdiff_t>(at), n, room.begin());
            reader.receivedInPlace(n);
        } else {
            outcome.error = reader.feed(bytes.subspan(at, n));
        }
        at += n;
        while (auto frame = reader.next()) outcome.frames.push_back(std::move(*frame));
    }
    if (!outcome.error && !reader.hasPartialFrame() && reader.bufferedBytes() != 0) std::abort();
    return outcome;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size == 0) return 0;
    std::span<const uint8_t> bytes(data + 1, size - 1);
    Outcome whole = readAll(bytes, 0);
    Outcome chunked = readAll(bytes, 1 + data[0]);
    Outcome placed = readAll(bytes, 1 + data[0], true);
    if (whole.error != chunked.error || whole.frames.size() != chunked.frames.size()) std::abort();
    if (whole.error != placed.error || whole.frames.size() != placed.frames.size()) std::abort();
    for (size_t i = 0; i < whole.frames.size(); ++i) {
        const ZemFrame& frame = whole.frames[i];
        if (frame.header() != chunked.frames[i].header() || frame.payload() != chunked.frames[i].payload())
            std::abort();
        if (frame.header() != placed.frames[i].header() || frame.payload() != placed.frames[i].payload()) std::abort();
        if (frame.payload().size() != frame.header().payloadLength) std::abort();
        Result<Value> value = frame.decodePayload();
        if (!value) continue;
        std::vector<uint8_t> out;
        if (ZemFrame::encode(frame.kind(), frame.serial(), frame.inReplyTo(), *value, out)) std::abort();
        ZemFrameReader reader;
        if (reader.feed(out)) std::abort();
        auto back = reader.next();
        if (!back || back->serial() != frame.serial() || back->kind() != frame.kind() ||
            back->inReplyTo() != frame.inReplyTo())
            std::abort();
        Result<Value> again = back->decodePayload();
        if (!again || !bexil::testing::strictlyEqual(*value, *again)) std::abort();
    }
    return 0;
}
