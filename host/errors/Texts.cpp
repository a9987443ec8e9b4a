#include "host/errors/Texts.h"

#include <algorithm>
#include <cstddef>

namespace velmora::mobile::xplat::cellar::host {

std::string joined(std::initializer_list<std::string_view> parts) {
  std::string text;
  for (const std::string_view part : parts) text += part;
  return text;
}

std::string textOf(const std::exception_ptr& failure) {
  try {
    std::rethrow_exception(failure);
  } catch (const std::exception& error) {
    return error.what();
  } catch (...) {
    return "not a standard exception";
  }
}

std::string currentText() { return textOf(std::current_exception()); }

std::string shown(std::string_view key) {
  constexpr std::size_t kShownBytes = 80;
  constexpr char kDigits[] = "0123456789abcdef";
  std::size_t end = std::min(key.size(), kShownBytes);
  while (end > 0 && end < key.size() && (static_cast<unsigned char>(key[end]) & 0xc0) == 0x80) --end;  // within UTF-8
  std::string text = "'";
  for (const char character : key.substr(0, end)) {
    const auto byte = static_cast<unsigned char>(character);
    if (byte < 0x20 || byte == 0x7f) {
      text += {'\\', 'x', kDigits[byte / 16], kDigits[byte % 16]};
    } else {
      text += character;
    }
  }
  return text + (end < key.size() ? "...'" : "'");
}

std::string nameOfDirectory(const std::string& path) {
  const std::size_t end = path.find_last_not_of('/') + 1;
  const std::size_t slash = path.substr(0, end).rfind('/');
  const std::size_t begin = slash == std::string::npos ? 0 : slash + 1;
  return path.substr(begin, end - begin);
}

std::string culprit(const std::string& store, const std::string& key, const std::string& path) {
  if (key.empty()) return joined({"Store '", store, "', ", path, ": "});
  return joined({"Store '", store, "', key ", shown(key), ", ", path, ": "});
}

}  // namespace velmora::mobile::xplat::cellar::host
