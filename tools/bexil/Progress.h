#pragma once

// Progress is the one line on standard error that says how far long work has come (registering many bundles,
// paged discovery), rewritten in place. It says nothing unless standard error is a terminal and the output is not
// JSON, so scripts and logs never see it. Updates may come from any one thread at a time; they are drawn at most
// ten times a second, and the line is cleared when the work ends.

#include <chrono>
#include <string>

namespace bexil::tool {

class Progress {
  public:
    // Shown only when `wanted` (not --json) and standard error is a terminal.
    explicit Progress(bool wanted);
    ~Progress();
    Progress(const Progress&) = delete;
    Progress& operator=(const Progress&) = delete;

    bool shown() const { return shown_; }
    // Replaces the line with `text` (no newline), unless the last drawing was less than a tenth of a second ago.
    void update(const std::string& text);
    // Clears the line; later updates draw again.
    void clear();

  private:
    bool shown_;
    bool drawn_ = false;
    std::chrono::steady_clock::time_point last_{};
};

}  // namespace bexil::tool
