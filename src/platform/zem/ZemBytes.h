#pragma once

// ZemBytes is the byte buffer of frames in flight: encoded frames waiting to be sent and payloads being received.
// Growing it leaves the new bytes uninitialised, because they are written over at once (by the encoder, or by a
// read from the socket): zero-filling them first would be one more pass over every byte of a large message.

#include <cstdint>
#include <memory>
#include <new>
#include <type_traits>
#include <utility>
#include <vector>

namespace bexil {

// std::allocator, except that a value-initialising construct (what vector::resize does) default-initialises.
template <class T>
struct DefaultInitAllocator : std::allocator<T> {
    template <class U>
    struct rebind {
        using other = DefaultInitAllocator<U>;
    };

    DefaultInitAllocator() = default;
    template <class U>
    DefaultInitAllocator(const DefaultInitAllocator<U>&) noexcept {}

    template <class U>
    void construct(U* p) noexcept(std::is_nothrow_default_constructible_v<U>) {
        ::new (static_cast<void*>(p)) U;
    }
    template <class U, class... Args>
    void construct(U* p, Args&&... args) {
        ::new (static_cast<void*>(p)) U(std::forward<Args>(args)...);
    }
};

using ZemBytes = std::vector<uint8_t, DefaultInitAllocator<uint8_t>>;

}  // namespace bexil
