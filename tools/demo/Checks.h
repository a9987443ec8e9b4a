#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

namespace velmora::mobile::xplat::cellar::tools {

class Console;

// Compares what should be with what is, counts the answers, and prints the failures with both.
class Checks {
 public:
  explicit Checks(Console& console);

  void equal(const std::string& what, std::uint64_t expected, std::uint64_t seen);
  void equal(const std::string& what, const std::string& expected, const std::string& seen);
  void isTrue(const std::string& what, bool seen);

  std::size_t passed() const;
  std::size_t failed() const;

 private:
  void pass();
  void fail(const std::string& what, const std::string& expected, const std::string& seen);

  Console& console_;
  std::size_t passed_ = 0;
  std::size_t failed_ = 0;
};

}  // namespace velmora::mobile::xplat::cellar::tools
