#pragma once

// Owns the daemon's log channels under one subsystem: "ops", "traffic", "extension" and "lx", all made together
// the first time any of them is asked for, plus the system's default log. The process-wide registry reads its
// threshold from BXD_LOG_LEVEL; tests build their own registries to watch creation and its failure. Thread-safe.

#include <array>
#include <atomic>
#include <functional>
#include <memory>
#include <mutex>
#include <string_view>

#include "platform/log/Channel.h"
#include "platform/log/LogSink.h"

namespace bexil::log {

class LogRegistry {
  public:
    static constexpr std::string_view kSubsystem = "com.quorvel.Bexil";
    static constexpr Level kDefaultThreshold = Level::Info;

    // Makes the handle for one category, or returns none when the log refuses it; the channel must read its
    // threshold from `threshold`.
    using ChannelFactory = std::function<std::unique_ptr<Channel>(
        const std::atomic<int>& threshold, std::string_view subsystem, std::string_view category)>;
    static ChannelFactory defaultFactory();

    // `levelSetting` is the text of BXD_LOG_LEVEL (null when unset). An unknown text means info and is reported,
    // once, on the default log.
    explicit LogRegistry(const char* levelSetting, ChannelFactory factory = defaultFactory());
    LogRegistry(const LogRegistry&) = delete;
    LogRegistry& operator=(const LogRegistry&) = delete;

    // The process's registry, made on first use from the environment; never destroyed.
    static LogRegistry& shared();

    Channel& ops();
    Channel& traffic();
    Channel& extension();
    Channel& lx();
    Channel& defaultLog() { return default_; }

    Level threshold() const { return static_cast<Level>(threshold_.load(std::memory_order_relaxed)); }
    void setThreshold(Level level) { threshold_.store(static_cast<int>(level), std::memory_order_relaxed); }

  private:
    enum Slot { kOps, kTraffic, kExtension, kLx, kSlotCount };
    static constexpr std::array<std::string_view, kSlotCount> kCategories = {"ops", "traffic", "extension", "lx"};

    Channel& channel(Slot slot);
    void createChannels();

    std::atomic<int> threshold_;
    Channel default_;
    ChannelFactory factory_;
    std::once_flag once_;
    std::array<std::unique_ptr<Channel>, kSlotCount> owned_;
    std::array<Channel*, kSlotCount> channels_{};
};

}  // namespace bexil::log
