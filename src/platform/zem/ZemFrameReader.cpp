#include "platform/zem/ZemFrameReader.h"

#include <algorithm>
#include <cstring>

namespace bexil {

std::optional<Error> ZemFrameReader::feed(std::span<const uint8_t> bytes) {
    if (error_) return error_;
    while (!bytes.empty()) {
        if (!inPayload_) {
            size_t take = std::min(ZemFrame::kHeaderBytes - headerFill_, bytes.size());
            std::memcpy(header_.data() + headerFill_, bytes.data(), take);
            headerFill_ += take;
            bytes = bytes.subspan(take);
            if (headerFill_ < ZemFrame::kHeaderBytes) break;
            Result<ZemFrameHeader> header = ZemFrame::decodeHeader(header_);
            if (!header) {
                error_ = header.error();
                return error_;
            }
            current_ = *header;
            headerFill_ = 0;
            inPayload_ = true;
            payload_.clear();
            payloadFill_ = 0;
            makeRoom(std::min<size_t>(current_.payloadLength, kInitialPayloadReserve));
        } else {
            size_t take = std::min(current_.payloadLength - payloadFill_, bytes.size());
            makeRoom(take);
            std::memcpy(payload_.data() + payloadFill_, bytes.data(), take);
            payloadFill_ += take;
            bytes = bytes.subspan(take);
        }
        if (inPayload_ && payloadFill_ == current_.payloadLength) completeFrame();
    }
    return std::nullopt;
}

void ZemFrameReader::makeRoom(size_t bytes) {
    if (payload_.size() - payloadFill_ >= bytes) return;
    // A peer that has sent kInitialPayloadReserve bytes of a frame gets room for the rest at once, so a large
    // frame is copied once more at most; before that, growth follows the bytes that arrive.
    size_t want = payloadFill_ >= kInitialPayloadReserve ? current_.payloadLength
                                                         : std::max(payload_.size() * 2, payloadFill_ + bytes);
    ZemBytes grown(std::min<size_t>(want, current_.payloadLength));
    if (payloadFill_ > 0) std::memcpy(grown.data(), payload_.data(), payloadFill_);
    payload_.swap(grown);
}

std::span<uint8_t> ZemFrameReader::payloadRoom() {
    if (error_ || !inPayload_) return {};
    size_t missing = current_.payloadLength - payloadFill_;
    if (missing < kInPlaceMinimum) return {};
    makeRoom(1);
    return std::span<uint8_t>(payload_.data() + payloadFill_, std::min(payload_.size() - payloadFill_, missing));
}

void ZemFrameReader::receivedInPlace(size_t bytes) {
    payloadFill_ += bytes;
    if (payloadFill_ == current_.payloadLength) completeFrame();
}

void ZemFrameReader::completeFrame() {
    payload_.resize(payloadFill_);
    bufferedBytes_ += payloadFill_;
    ready_.emplace_back(current_, std::move(payload_));
    payload_ = {};
    payloadFill_ = 0;
    inPayload_ = false;
}

std::optional<ZemFrame> ZemFrameReader::next() {
    if (ready_.empty()) return std::nullopt;
    ZemFrame frame = std::move(ready_.front());
    ready_.pop_front();
    bufferedBytes_ -= frame.payload().size();
    return frame;
}

}  // namespace bexil
