#pragma once

// Turns a fuzzer's input into a stream of small decisions: bytes, 64-bit numbers, short strings and blobs. Reading
// past the end yields zeros, so every input, however short, drives the generators to completion.

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

namespace bexil::fuzz {

class ByteReader {
  public:
    ByteReader(const uint8_t* data, size_t size) : data_(data), size_(size) {}
    bool empty() const { return pos_ >= size_; }
    uint8_t byte() { return empty() ? 0 : data_[pos_++]; }
    uint64_t u64() {
        uint64_t v = 0;
        for (int i = 0; i < 8; ++i) v = (v << 8) | byte();
        return v;
    }
    std::string text() {
        size_t n = byte() % 24;
        std::string s;
        for (size_t i = 0; i < n && !empty(); ++i) s.push_back(static_cast<char>(byte()));
        return s;
    }
    std::vector<uint8_t> bytes() {
        size_t n = byte() % 32;
        std::vector<uint8_t> b;
        for (size_t i = 0; i < n && !empty(); ++i) b.push_back(byte());
        return b;
    }

  private:
    const uint8_t* data_;
    size_t size_;
    size_t pos_ = 0;
};

}  // namespace bexil::fuzz
