#pragma once

// Uuid is a 128-bit universally unique identifier held by value: plug-ins and holds are named by one. Immutable
// once made; copy and pass it between queues freely.

#include <array>
#include <compare>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace bexil {

// A 128-bit universally unique identifier. The nil UUID (all zero) is the default.
class Uuid {
  public:
    static constexpr size_t kTextLength = 36;

    Uuid() = default;
    explicit Uuid(const std::array<uint8_t, 16>& bytes) : bytes_(bytes) {}

    // A fresh random (version 4) UUID from the kernel's random source.
    static Uuid random();
    // Accepts exactly the canonical 8-4-4-4-12 hexadecimal form, in either letter case; anything else is none.
    static std::optional<Uuid> parse(std::string_view text);

    // The canonical upper-case text of 36 characters.
    std::string string() const;
    const std::array<uint8_t, 16>& bytes() const { return bytes_; }
    bool isNil() const;

    auto operator<=>(const Uuid&) const = default;
    bool operator==(const Uuid&) const = default;

  private:
    std::array<uint8_t, 16> bytes_{};
};

}  // namespace bexil
