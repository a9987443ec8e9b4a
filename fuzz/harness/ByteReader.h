#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::fuzz {

// Takes an input apart from front to back. Past its end every number is 0 and every text empty, so any input is a
// complete one.
class ByteReader {
 public:
  ByteReader(const std::uint8_t* data, std::size_t size) : next_(data), end_(data + size) {}

  bool atEnd() const { return next_ == end_; }

  std::uint8_t byte() { return atEnd() ? std::uint8_t{0} : *next_++; }

  // Little-endian, of as many bytes as the type has.
  template <class Integer> Integer integer() {
    std::uint64_t value = 0;
    for (std::size_t i = 0; i < sizeof(Integer); ++i) value |= static_cast<std::uint64_t>(byte()) << (8 * i);
    return static_cast<Integer>(value);
  }

  // A length of one byte, then so many bytes.
  std::string text() { return take(byte()); }

  // A length of two bytes, then so many bytes.
  std::string longText() { return take(integer<std::uint16_t>()); }

  std::string rest() { return take(static_cast<std::size_t>(end_ - next_)); }

 private:
  std::string take(std::size_t length) {
    length = std::min(length, static_cast<std::size_t>(end_ - next_));
    std::string text(next_, next_ + length);
    next_ += length;
    return text;
  }

  const std::uint8_t* next_;
  const std::uint8_t* end_;
};

inline std::vector<unsigned char> bytesOf(const std::string& text) { return {text.begin(), text.end()}; }

}  // namespace velmora::mobile::xplat::cellar::fuzz
