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
            payload_.reserve(std::min<size_t>(current_.payloadLength, kInitialPayloadReserve));
        } else {
            size_t missing = current_.payloadLength - payload_.size();
            size_t take = std::min(missing, bytes.size());
            if (payload_.capacity() < payload_.size() + take) {
                // A peer that has sent kInitialPayloadReserve bytes of a frame gets room for the rest at once, so a
                // large frame is copied once more at most; before that, growth follows the bytes that arrive.
                size_t want = payload_.size() >= kInitialPayloadReserve
                                  ? current_.payloadLength
                                  : std::max(payload_.capacity() * 2, payload_.size() + take);
                payload_.reserve(std::min<size_t>(want, current_.payloadLength));
            }
            payload_.insert(payload_.end(), bytes.begin(), bytes.begin() + static_cast<ptrdiff_t>(take));
            bytes = bytes.subspan(take);
        }
        if (inPayload_ && payload_.size() == current_.payloadLength) completeFrame();
    }
    return std::nullopt;
}

void ZemFrameReader::completeFrame() {
    bufferedBytes_ += payload_.size();
    ready_.emplace_back(current_, std::move(payload_));
    payload_ = {};
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
