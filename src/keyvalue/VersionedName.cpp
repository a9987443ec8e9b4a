#include "keyvalue/VersionedName.h"

#include <algorithm>
#include <array>
#include <cstddef>
#include <cstdio>
#include <stdexcept>

#include "EncodedFileName.h"

namespace velmora::mobile::xplat::cellar {

namespace {

constexpr std::size_t kLongestKeyPart = 200;  // bytes; the name then has at most 230
constexpr std::size_t kCutKey = 60;           // bytes of a longer key; each is encoded as three at most
constexpr char kCutMark = '~';                // which no encoded key contains
constexpr std::size_t kChecksumDigits = 8;
constexpr std::size_t kMostNumberDigits = 16;  // a store that writes all the time has centuries

std::string keyPartOf(const std::string& key) {
  try {
    std::string encoded = encodeFileName(key.size() <= kLongestKeyPart ? key : "");
    if (encoded.size() <= kLongestKeyPart && key.size() <= kLongestKeyPart) return encoded;
  } catch (const std::length_error&) {  // for a file name at all
  }
  return encodeFileName(key.substr(0, kCutKey)) + kCutMark;
}

// Empty for what `keyPartOf` cannot return.
std::optional<std::string> decoded(const std::string& keyPart) {
  try {
    return decodeFileName(keyPart);
  } catch (const std::invalid_argument&) {
    return std::nullopt;
  }
}

// Of digits of that base alone; empty otherwise.
std::optional<std::uint64_t> numberIn(const std::string& digits, std::size_t most, int base) {
  const auto isDigit = [&](char character) {
    const bool isLetter = base == 16 && character >= 'a' && character <= 'f';
    return isLetter || (character >= '0' && character <= '9');
  };
  if (digits.empty() || digits.size() > most) return std::nullopt;
  if (!std::all_of(digits.begin(), digits.end(), isDigit)) return std::nullopt;
  return std::stoull(digits, nullptr, base);
}

}  // namespace

std::string VersionedName::format(const std::string& key, std::uint64_t number, std::uint32_t checksum) {
  std::array<char, kChecksumDigits + 1> digits{};
  (void)std::snprintf(digits.data(), digits.size(), "%08x", checksum);
  return keyPartOf(key) + '.' + std::to_string(number) + '.' + digits.data();
}

std::optional<VersionedName> VersionedName::parse(const std::string& name) {
  const auto beforeChecksum = name.rfind('.');
  if (beforeChecksum == std::string::npos || beforeChecksum == 0) return std::nullopt;
  const auto beforeNumber = name.rfind('.', beforeChecksum - 1);
  if (beforeNumber == std::string::npos) return std::nullopt;
  std::string keyPart = name.substr(0, beforeNumber);
  const auto number = numberIn(name.substr(beforeNumber + 1, beforeChecksum - beforeNumber - 1), kMostNumberDigits, 10);
  const auto checksum = numberIn(name.substr(beforeChecksum + 1), kChecksumDigits, 16);
  if (!number || !checksum || keyPart.empty()) return std::nullopt;
  VersionedName result{std::nullopt, *number, static_cast<std::uint32_t>(*checksum)};
  const bool isCut = keyPart.back() == kCutMark;
  if (isCut) keyPart.pop_back();
  auto key = decoded(keyPart);
  if (!key || (isCut && key->size() != kCutKey)) return std::nullopt;
  const std::string wholeKey = isCut ? *key + std::string(kLongestKeyPart, 'x') : *key;
  if (format(wholeKey, *number, result.checksum) != name) return std::nullopt;
  if (!isCut) result.key = std::move(key);
  return result;
}

}  // namespace velmora::mobile::xplat::cellar
