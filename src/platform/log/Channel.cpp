#include "platform/log/Channel.h"

#include <chrono>

namespace bexil::log {

Channel::Channel(const std::atomic<int>& threshold, std::string subsystem, std::string category)
    : threshold_(threshold), subsystem_(std::move(subsystem)), category_(std::move(category)) {}

void Channel::write(Level level, std::string_view message) const {
    bool toSystem = static_cast<int>(level) >= threshold_.load(std::memory_order_relaxed);
    if (!toSystem && !LogDispatcher::shared().captureWants(level)) return;
    LogRecord record{level, subsystem_, category_, message, std::chrono::system_clock::now()};
    LogDispatcher::shared().dispatch(record, toSystem);
}

}  // namespace bexil::log
