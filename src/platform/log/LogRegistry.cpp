#include "platform/log/LogRegistry.h"

#include <cstdlib>
#include <new>
#include <string>

namespace bexil::log {

LogRegistry::ChannelFactory LogRegistry::defaultFactory() {
    return [](const std::atomic<int>& threshold, std::string_view subsystem,
              std::string_view category) -> std::unique_ptr<Channel> {
        // The journal needs no per-category handle, so the only refusal left is running out of memory.
        return std::unique_ptr<Channel>(new (std::nothrow)
                                            Channel(threshold, std::string(subsystem), std::string(category)));
    };
}

LogRegistry::LogRegistry(const char* levelSetting, ChannelFactory factory)
    : threshold_(static_cast<int>(kDefaultThreshold)), default_(threshold_, "", ""), factory_(std::move(factory)) {
    if (levelSetting == nullptr || *levelSetting == '\0') return;
    if (std::optional<Level> level = parseLevel(levelSetting)) {
        setThreshold(*level);
    } else {
        default_.error("unknown BXD_LOG_LEVEL value \"%s\" (expected debug, info, default, error or fault); using info",
                       levelSetting);
    }
}

LogRegistry& LogRegistry::shared() {
    static LogRegistry* registry = new LogRegistry(std::getenv("BXD_LOG_LEVEL"));
    return *registry;
}

Channel& LogRegistry::ops() { return channel(kOps); }
Channel& LogRegistry::traffic() { return channel(kTraffic); }
Channel& LogRegistry::extension() { return channel(kExtension); }
Channel& LogRegistry::lx() { return channel(kLx); }

Channel& LogRegistry::channel(Slot slot) {
    std::call_once(once_, [this] { createChannels(); });
    return *channels_[slot];
}

void LogRegistry::createChannels() {
    for (int slot = 0; slot < kSlotCount; ++slot) {
        std::string_view category = kCategories[static_cast<size_t>(slot)];
        owned_[static_cast<size_t>(slot)] = factory_ ? factory_(threshold_, kSubsystem, category) : nullptr;
        if (owned_[static_cast<size_t>(slot)]) {
            channels_[static_cast<size_t>(slot)] = owned_[static_cast<size_t>(slot)].get();
        } else {
            // Losing a category must not lose its messages: they go to the default log instead.
            channels_[static_cast<size_t>(slot)] = &default_;
            default_.error("unable to create lumen for category %s", category);
        }
    }
}

}  // namespace bexil::log
