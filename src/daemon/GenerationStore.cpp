#include "daemon/GenerationStore.h"

#include <cerrno>
#include <chrono>
#include <cstring>
#include <fstream>
#include <sstream>

#include "base/StandardPaths.h"
#include "platform/log/Log.h"

namespace bexil {

namespace {

constexpr std::string_view kHeader = "bexil generation mark 1\n";
// A file longer than this is not ours.
constexpr size_t kMaxFileBytes = 256;

}  // namespace

uint64_t GenerationStore::wallClockMicroseconds() {
    auto now = std::chrono::system_clock::now().time_since_epoch();
    auto micros = std::chrono::duration_cast<std::chrono::microseconds>(now).count();
    return micros > 0 ? static_cast<uint64_t>(micros) : 0;
}

GenerationStore::GenerationStore(std::optional<std::filesystem::path> path, Clock clock, FileSystem& fileSystem,
                                 uint64_t block)
    : path_(std::move(path)), clock_(std::move(clock)), fileSystem_(fileSystem), block_(block > 0 ? block : 1) {}

std::optional<std::filesystem::path> GenerationStore::defaultPath() {
    std::optional<std::filesystem::path> directory = stateDirectory();
    if (!directory) return std::nullopt;
    return *directory / kFileName;
}

std::optional<uint64_t> GenerationStore::parse(std::string_view text) {
    if (text.substr(0, kHeader.size()) != kHeader) return std::nullopt;
    std::string_view number = text.substr(kHeader.size());
    if (number.size() < 2 || number.back() != '\n') return std::nullopt;
    number.remove_suffix(1);
    if (number.size() > 20 || (number.size() > 1 && number.front() == '0')) return std::nullopt;
    uint64_t value = 0;
    for (char c : number) {
        if (c < '0' || c > '9') return std::nullopt;
        uint64_t digit = static_cast<uint64_t>(c - '0');
        if (value > (UINT64_MAX - digit) / 10) return std::nullopt;
        value = value * 10 + digit;
    }
    return value;
}

std::string GenerationStore::format(uint64_t mark) { return std::string(kHeader) + std::to_string(mark) + "\n"; }

std::optional<uint64_t> GenerationStore::read() const {
    if (!path_) return std::nullopt;
    std::ifstream file(*path_, std::ios::binary);
    if (!file) {
        if (errno != ENOENT)
            log::ops().error("cannot read the generation mark %s: %s; generations start from the clock", path_->c_str(),
                             std::strerror(errno));
        return std::nullopt;
    }
    std::string text(kMaxFileBytes + 1, '\0');
    file.read(text.data(), static_cast<std::streamsize>(text.size()));
    text.resize(static_cast<size_t>(file.gcount()));
    std::optional<uint64_t> mark = text.size() <= kMaxFileBytes ? parse(text) : std::nullopt;
    if (!mark)
        log::ops().error(
            "the generation mark %s is corrupt; generations start from the clock and the file is "
            "rewritten",
            path_->c_str());
    return mark;
}

void GenerationStore::write(uint64_t mark) {
    mark_ = mark;
    if (!path_) return;
    if (std::optional<Error> error =
            replaceFileAtomically(*path_, format(mark), 0644, Durability::Synced, fileSystem_)) {
        // Said once per failing spell: a full disk would otherwise log at every change.
        if (!failing_)
            log::ops().error(
                "cannot store the generation mark %llu in %s: %@; generations go on and a restart "
                "starts them from the clock",
                static_cast<unsigned long long>(mark), path_->c_str(), *error);
        failing_ = true;
        return;
    }
    if (failing_) log::ops().notice("the generation mark is stored again in %s", path_->c_str());
    failing_ = false;
    durable_ = mark;
}

uint64_t GenerationStore::start() {
    const uint64_t floor = clock_();
    const uint64_t stored = read().value_or(0);
    // Saturates rather than wrapping: a mark at the top of the range is corrupt in all but name, and wrapping would
    // be the one way to go back.
    const uint64_t base = std::max(stored, floor);
    const uint64_t first = base < UINT64_MAX ? base + 1 : base;
    log::ops().info("generations start at %llu (stored mark %llu, clock floor %llu)",
                    static_cast<unsigned long long>(first), static_cast<unsigned long long>(stored),
                    static_cast<unsigned long long>(floor));
    reserveThrough(first);
    return first;
}

void GenerationStore::reserveThrough(uint64_t generation) {
    if (generation <= durable_) return;
    const uint64_t ahead = generation <= UINT64_MAX - (block_ - 1) ? generation + (block_ - 1) : UINT64_MAX;
    write(ahead);
}

}  // namespace bexil
