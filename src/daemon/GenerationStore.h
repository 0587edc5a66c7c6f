#pragma once

// The durable side of the change generations: a high-water mark in a small file of the state directory
// (docs/generations.md) that is always at least every generation handed out. Marks are reserved in blocks, and a
// new mark is on disk before any generation past the old one is handed out, so a crash can skip numbers but never
// repeat one. A run starts above both the stored mark and a floor taken from the wall clock (microseconds since
// 1970), so a state directory restored from an old backup, or a lost file, still never makes generations go back
// as long as fewer than a million changes a second are made on average. Owned by the change feed; used on one queue.

#include <cstdint>
#include <filesystem>
#include <functional>
#include <optional>
#include <string>

#include "base/AtomicFile.h"

namespace bexil {

class GenerationStore {
  public:
    // How many generations one write of the mark reserves.
    static constexpr uint64_t kReserveBlock = 4096;
    // The file's name in the state directory.
    static constexpr const char* kFileName = "generation";

    // Microseconds since 1970 by default; tests set their own clock.
    using Clock = std::function<uint64_t()>;
    static uint64_t wallClockMicroseconds();

    // A store whose mark lives at `path` (none: nothing is stored, the clock floor alone keeps generations going
    // forward). The file system calls go through `fileSystem` (tests make them fail).
    explicit GenerationStore(std::optional<std::filesystem::path> path, Clock clock = wallClockMicroseconds,
                             FileSystem& fileSystem = posixFileSystem(), uint64_t block = kReserveBlock);

    // <state dir>/generation, or none when there is no state directory.
    static std::optional<std::filesystem::path> defaultPath();

    // The generation a run starts at: one past the larger of the stored mark and the clock floor, reserved before
    // it is returned. A missing, corrupt or unreadable file is logged and only the floor counts. Called once.
    uint64_t start();
    // Makes sure the stored mark is at least `generation`, writing a new mark a block ahead when it is not. A write
    // that fails is logged and tried again at the next call; the generation is handed out all the same (the
    // clock floor then covers a restart).
    void reserveThrough(uint64_t generation);

    // The mark as stored last (or as it would have been, when writes fail); for tests and diagnostics.
    uint64_t mark() const { return mark_; }
    // Whether the last write of the mark failed.
    bool failing() const { return failing_; }

    // Parses the file's text; none when it is not exactly the documented format.
    static std::optional<uint64_t> parse(std::string_view text);
    static std::string format(uint64_t mark);

  private:
    // The stored mark, or none (logged) when the file is missing or not usable.
    std::optional<uint64_t> read() const;
    void write(uint64_t mark);

    std::optional<std::filesystem::path> path_;
    Clock clock_;
    FileSystem& fileSystem_;
    uint64_t block_;
    // The mark that is known to be on disk (or wanted there, when failing_).
    uint64_t mark_ = 0;
    uint64_t durable_ = 0;
    bool failing_ = false;
};

}  // namespace bexil
