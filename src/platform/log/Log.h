#pragma once

// The daemon's log: bexil::log::ops().info("client %d requested %{public}s", pid, name). The four channels of the
// subsystem "com.quorvel.Bexil" and the system's default log, all from the process-wide LogRegistry; any thread
// may log. See docs/logging.md for levels, BXD_LOG_LEVEL and where messages go.

#include "platform/log/Channel.h"
#include "platform/log/LogRegistry.h"
#include "platform/log/LogSink.h"

namespace bexil::log {

inline Channel& ops() { return LogRegistry::shared().ops(); }
inline Channel& traffic() { return LogRegistry::shared().traffic(); }
inline Channel& extension() { return LogRegistry::shared().extension(); }
inline Channel& lx() { return LogRegistry::shared().lx(); }
inline Channel& defaultLog() { return LogRegistry::shared().defaultLog(); }

}  // namespace bexil::log
