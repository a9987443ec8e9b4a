#pragma once

#include <cstdint>
#include <istream>
#include <map>
#include <sstream>
#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::test {

using Bytes = std::vector<unsigned char>;
using Contents = std::map<std::string, std::string>;  // what is under each key

constexpr std::int64_t kSecond = 1'000'000'000;  // in nanoseconds

inline Bytes bytesOf(const std::string& text) { return {text.begin(), text.end()}; }
inline std::string textOf(const Bytes& bytes) { return {bytes.begin(), bytes.end()}; }

inline std::vector<std::string> linesOf(std::istream&& text) {
  std::vector<std::string> lines;
  for (std::string line; std::getline(text, line);) lines.push_back(line);
  return lines;
}
inline std::vector<std::string> linesOf(const std::string& text) { return linesOf(std::istringstream(text)); }

}  // namespace velmora::mobile::xplat::cellar::test
