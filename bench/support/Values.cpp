#include "support/Values.h"

#include <array>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <random>
#include <stdexcept>

namespace velmora::mobile::xplat::cellar::bench {

namespace {

std::uint64_t mixed(std::uint64_t number) {
  number = (number ^ (number >> 30U)) * 0xbf58476d1ce4e5b9U;
  number = (number ^ (number >> 27U)) * 0x94d049bb133111ebU;
  return number ^ (number >> 31U);
}

}  // namespace

std::string keyOf(std::size_t number) {
  std::array<char, 32> text{};
  std::snprintf(text.data(), text.size(), "%016llx%08llx",
                static_cast<unsigned long long>(mixed(number + 0x9e3779b97f4a7c15U)),
                static_cast<unsigned long long>(number));
  return text.data();
}

Bytes valueOf(std::size_t size) {
  std::mt19937 random(static_cast<std::mt19937::result_type>(size));
  Bytes value(size);
  for (auto& byte : value) byte = static_cast<unsigned char>(random());
  return value;
}

void stamp(Bytes& value, std::size_t number) {
  const std::uint64_t bits = number;
  std::memcpy(value.data(), &bits, sizeof(bits));
}

void throwUnlessStamped(const unsigned char* data, std::size_t found, std::size_t size, std::size_t number) {
  const std::uint64_t bits = number;
  if (found == size && std::memcmp(data, &bits, sizeof(bits)) == 0) return;
  throw std::runtime_error("item " + std::to_string(number) + " did not come back as it was stored");
}

void throwUnlessValue(const Bytes& found, std::size_t size, std::size_t number) {
  static Bytes expected;
  if (expected.size() != size) expected = valueOf(size);
  stamp(expected, number);
  if (found != expected) throw std::runtime_error("item " + std::to_string(number) + " is not what was stored");
}

std::string countName(std::size_t count) {
  std::string text = std::to_string(count);
  for (std::size_t rest = text.size(); rest > 3; rest -= 3) text.insert(rest - 3, ",");
  return text;
}

std::string sizeName(std::size_t size) {
  if (size >= 1U << 20U) return std::to_string(size >> 20U) + " MiB";
  if (size >= 1U << 10U) return std::to_string(size >> 10U) + " KiB";
  return std::to_string(size) + " B";
}

}  // namespace velmora::mobile::xplat::cellar::bench
