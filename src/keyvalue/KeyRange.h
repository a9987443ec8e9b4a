#pragma once

#include <cstddef>
#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar {

// One key or several of the caller's, not copied.
class KeyRange {
 public:
  explicit KeyRange(const std::string& key) : first_(&key), count_(1) {}
  explicit KeyRange(const std::vector<std::string>& keys) : first_(keys.data()), count_(keys.size()) {}

  const std::string* begin() const { return first_; }
  const std::string* end() const { return first_ + count_; }

 private:
  const std::string* first_;
  std::size_t count_;
};

}  // namespace velmora::mobile::xplat::cellar
