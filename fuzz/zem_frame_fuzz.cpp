// Feeds arbitrary bytes to the Zem frame reader, once whole and once in chunks whose sizes come from the input
// itself: the first byte seeds the chunk sizes, the rest is the stream. Both readings must yield the same frames
// and the same error; every frame whose payload decodes must encode back into a frame with the same header that
// decodes to the same value.

#include <algorithm>
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

Outcome readAll(std::span<const uint8_t> bytes, size_t chunkSeed) {
    ZemFrameReader reader;
    Outcome outcome;
    size_t at = 0;
    while (at < bytes.size() && !outcome.error) {
        size_t n = chunkSeed == 0 ? bytes.size() : 1 + (chunkSeed * (at + 7)) % 61;
        n = std::min(n, bytes.size() - at);
        outcome.error = reader.feed(bytes.subspan(at, n));
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
    if (whole.error != chunked.error || whole.frames.size() != chunked.frames.size()) std::abort();
    for (size_t i = 0; i < whole.frames.size(); ++i) {
        const ZemFrame& frame = whole.frames[i];
        if (frame.header() != chunked.frames[i].header() || frame.payload() != chunked.frames[i].payload())
            std::abort();
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
