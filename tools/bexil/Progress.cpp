#include "Progress.h"

#include <unistd.h>

#include <cstdio>

namespace bexil::tool {

namespace {
constexpr std::chrono::milliseconds kRedrawInterval{100};
}  // namespace

Progress::Progress(bool wanted) : shown_(wanted && ::isatty(STDERR_FILENO) == 1) {}

Progress::~Progress() { clear(); }

void Progress::update(const std::string& text) {
    if (!shown_) return;
    auto now = std::chrono::steady_clock::now();
    if (drawn_ && now - last_ < kRedrawInterval) return;
    last_ = now;
    drawn_ = true;
    // Carriage return, the text, then erase whatever a longer earlier text left to its right.
    std::fprintf(stderr, "\r%s\033[K", text.c_str());
    std::fflush(stderr);
}

void Progress::clear() {
    if (!shown_ || !drawn_) return;
    drawn_ = false;
    std::fprintf(stderr, "\r\033[K");
    std::fflush(stderr);
}

}  // namespace bexil::tool
