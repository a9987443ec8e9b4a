#include "Printable.h"

#include <algorithm>
#include <array>
#include <cstddef>

namespace velmora::mobile::xplat::cellar::tools {

namespace {

struct Range {
  char32_t first;
  char32_t last;
};

// Controls, and what formats without being seen. The joiners U+200C and U+200D are parts of words and of emoji.
constexpr std::array<Range, 14> kEscaped = {{{0x00, 0x1f},
                                             {0x7f, 0x9f},
                                             {0xad, 0xad},          // soft hyphen
                                             {0x61c, 0x61c},        // Arabic letter mark
                                             {0x180e, 0x180e},      // Mongolian vowel separator
                                             {0x200b, 0x200b},      // zero-width space
                                             {0x200e, 0x200f},      // marks of direction
                                             {0x2028, 0x202e},      // separators of lines, embeddings, overrides
                                             {0x2060, 0x206f},      // invisible operators, isolates
                                             {0xfdd0, 0xfdef},      // not characters
                                             {0xfeff, 0xfeff},      // byte order mark
                                             {0xfff9, 0xfffb},      // annotations
                                             {0xfffe, 0xffff},      // not characters
                                             {0xe0000, 0xe0fff}}};  // tags

bool isEscaped(char32_t character) {
  return std::any_of(kEscaped.begin(), kEscaped.end(),
                     [character](const Range& range) { return range.first <= character && character <= range.last; });
}

std::string hexadecimal(char32_t number, int digits) {
  std::string text;
  for (int shift = 4 * (digits - 1); shift >= 0; shift -= 4) text += "0123456789abcdef"[(number >> shift) & 0xfU];
  return text;
}

std::string escaped(char32_t character) {
  if (character < 0x80) return "\\x" + hexadecimal(character, 2);
  return character < 0x10000 ? "\\u" + hexadecimal(character, 4) : "\\U" + hexadecimal(character, 8);
}

// A character and its bytes; of bytes that are not one, the first alone, with a length of 0.
struct Character {
  char32_t value;
  std::size_t length;
};

bool isFollower(unsigned char byte) { return (byte & 0xc0U) == 0x80; }

std::size_t lengthBy(unsigned char first) {
  if (first < 0x80) return 1;
  if (first >= 0xc2 && first < 0xe0) return 2;
  if (first >= 0xe0 && first < 0xf0) return 3;
  return first >= 0xf0 && first < 0xf5 ? 4 : 0;
}

Character characterAt(const std::string& text, std::size_t place) {
  const auto byteAt = [&](std::size_t i) { return static_cast<unsigned char>(text[i]); };
  const unsigned char first = byteAt(place);
  const std::size_t length = lengthBy(first);
  if (length == 1) return {first, 1};
  if (length == 0 || place + length > text.size()) return {first, 0};
  char32_t value = first & (0xffU >> (length + 1));
  for (std::size_t i = 1; i < length; ++i) {
    if (!isFollower(byteAt(place + i))) return {first, 0};
    value = (value << 6U) | (byteAt(place + i) & 0x3fU);
  }
  const bool isTooShort = (length == 3 && value < 0x800) || (length == 4 && value < 0x10000);
  const bool isSurrogate = value >= 0xd800 && value < 0xe000;
  if (isTooShort || isSurrogate || value > 0x10ffff) return {first, 0};
  return {value, length};
}

// With the characters that `isEscaped`, and bytes that are not UTF-8, shown by their numbers.
std::string escapedIf(bool (*isEscaped)(char32_t), const std::string& text) {
  std::string result;
  for (std::size_t place = 0; place < text.size();) {
    const Character character = characterAt(text, place);
    if (character.length == 0) {
      result += "\\x" + hexadecimal(character.value, 2);
    } else if (isEscaped(character.value)) {
      result += escaped(character.value);
    } else {
      result.append(text, place, character.length);
    }
    place += std::max<std::size_t>(1, character.length);
  }
  return result;
}

bool isNever(char32_t /*character*/) { return false; }

// JSON has its own way to show the characters.
void showStrangeBytes(nlohmann::ordered_json& value) {
  if (value.is_string()) {
    value = escapedIf(isNever, value.get_ref<const std::string&>());
  } else if (value.is_structured()) {
    for (auto& part : value) showStrangeBytes(part);
  }
}

}  // namespace

std::string printable(const std::string& text) { return escapedIf(isEscaped, text); }

std::string printable(nlohmann::ordered_json document, int indentation) {
  showStrangeBytes(document);
  return document.dump(indentation, ' ', true, nlohmann::ordered_json::error_handler_t::replace);
}

}  // namespace velmora::mobile::xplat::cellar::tools
