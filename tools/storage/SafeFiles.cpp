#include "storage/SafeFiles.h"

#include <zlib.h>

#include <cstddef>
#include <exception>
#include <utility>

#include "EncodedFileName.h"
#include "storage/UntouchedFiles.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

const std::string kUnfinished = ".part";
constexpr char kCutMark = '~';  // behind the beginning of a key that is too long
constexpr std::size_t kChecksumDigits = 8;
constexpr std::size_t kMostNumberDigits = 19;

// Takes the suffix away; false when there is none.
bool removeSuffix(std::string& name, const std::string& suffix) {
  if (name.size() < suffix.size()) return false;
  const std::size_t rest = name.size() - suffix.size();
  if (name.compare(rest, suffix.size(), suffix) != 0) return false;
  name.resize(rest);
  return true;
}

// Takes the last part away, with the dot before it. Empty when there is none.
std::string removeLastPart(std::string& name) {
  const auto dot = name.rfind('.');
  if (dot == std::string::npos) return "";
  std::string part = name.substr(dot + 1);
  name.resize(dot);
  return part;
}

bool consistsOf(const std::string& text, const char* characters) {
  return text.find_first_not_of(characters) == std::string::npos;
}

std::optional<std::string> decoded(const std::string& name) {
  try {
    return decodeFileName(name);
  } catch (const std::exception&) {
    return std::nullopt;
  }
}

class ValueChecksum {
 public:
  explicit ValueChecksum(const std::string& key) {
    add(reinterpret_cast<const unsigned char*>(key.data()), key.size());
  }

  void add(const unsigned char* bytes, std::size_t count) {
    if (count > 0) value_ = crc32_z(value_, bytes, count);
  }

  std::uint32_t value() const { return static_cast<std::uint32_t>(value_); }

 private:
  uLong value_ = 0;
};

}  // namespace

std::optional<SafeFileName> parseSafeFileName(const std::string& name) {
  SafeFileName result;
  std::string rest = name;
  result.isUnfinished = removeSuffix(rest, kUnfinished);
  const std::string checksum = removeLastPart(rest);
  const std::string number = removeLastPart(rest);
  if (checksum.size() != kChecksumDigits || !consistsOf(checksum, "0123456789abcdef")) return std::nullopt;
  if (number.empty() || number.size() > kMostNumberDigits || !consistsOf(number, "0123456789")) return std::nullopt;
  result.checksum = static_cast<std::uint32_t>(std::stoul(checksum, nullptr, 16));
  result.number = std::stoull(number);
  const bool isCut = removeSuffix(rest, {kCutMark});
  auto key = decoded(rest);
  if (!key) return std::nullopt;
  if (!isCut) result.key = std::move(key);
  return result;
}

std::uint32_t checksumOf(const std::string& key, const std::vector<unsigned char>& value) {
  ValueChecksum checksum(key);
  checksum.add(value.data(), value.size());
  return checksum.value();
}

std::uint32_t checksumOfFile(const std::string& key, const std::string& path) {
  ValueChecksum checksum(key);
  UntouchedFiles().readPieces(path, [&](const unsigned char* bytes, std::size_t count) { checksum.add(bytes, count); });
  return checksum.value();
}

}  // namespace velmora::mobile::xplat::cellar::tools
