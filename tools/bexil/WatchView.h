#pragma once

// What `bexil watch` shows: the result of a watch, kept up to date from its messages. On a terminal it is a table
// (identifier, version, UUID, path) drawn again in place after every change; otherwise it is one line per change,
// for scripts and logs. Owned by the command; fed on the client's reply queue, one event at a time.

#include <cstdint>
#include <cstdio>
#include <map>
#include <string>
#include <vector>

#include "bexil/DaemonClient.h"
#include "bexil/Value.h"

namespace bexil::tool {

class WatchView {
  public:
    enum class Style { Table, Lines, Json };
    WatchView(Style style, std::FILE* out) : style_(style), out_(out) {}

    // The whole result (at the start and after a resync).
    void result(const std::vector<Value>& forms, uint64_t generation);
    void change(const DaemonClient::WatchChange& change);
    void resync(uint64_t generation);

    // The plug-ins shown now, by UUID text.
    const std::map<std::string, Value>& plugIns() const { return plugIns_; }

  private:
    void draw();
    // "ID VERSION UUID PATH" of a form.
    static std::string describe(const Value& form);

    Style style_;
    std::FILE* out_;
    std::map<std::string, Value> plugIns_;
    uint64_t generation_ = 0;
    size_t drawnLines_ = 0;
};

}  // namespace bexil::tool
