#include "platform/log/CaptureSink.h"

#include "platform/log/LogDispatcher.h"

namespace bexil::log {

CaptureSink::CaptureSink(Level minimum) : minimum_(minimum) { LogDispatcher::shared().install(this); }

CaptureSink::~CaptureSink() { LogDispatcher::shared().remove(this); }

std::vector<CaptureSink::Entry> CaptureSink::entries() const {
    std::lock_guard lock(mutex_);
    return entries_;
}

std::vector<CaptureSink::Entry> CaptureSink::matching(std::string_view text) const {
    std::lock_guard lock(mutex_);
    std::vector<Entry> out;
    for (const Entry& e : entries_) {
        if (e.message.find(text) != std::string::npos) out.push_back(e);
    }
    return out;
}

std::optional<CaptureSink::Entry> CaptureSink::find(std::string_view text) const {
    std::lock_guard lock(mutex_);
    for (const Entry& e : entries_) {
        if (e.message.find(text) != std::string::npos) return e;
    }
    return std::nullopt;
}

void CaptureSink::clear() {
    std::lock_guard lock(mutex_);
    entries_.clear();
}

void CaptureSink::write(const LogRecord& record) {
    std::lock_guard lock(mutex_);
    entries_.push_back(
        Entry{record.level, std::string(record.subsystem), std::string(record.category), std::string(record.message)});
}

}  // namespace bexil::log
