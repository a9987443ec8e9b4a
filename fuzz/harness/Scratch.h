#pragma once

#include <string>

namespace velmora::mobile::xplat::cellar::fuzz {

// A directory for one input, empty at first and gone at the end; in memory where the machine has such a place. A
// process has one at a time.
class Scratch {
 public:
  Scratch();
  ~Scratch();
  Scratch(const Scratch&) = delete;
  Scratch& operator=(const Scratch&) = delete;

  // Absolute, without a slash at the end.
  const std::string& path() const;

  // The path of an entry, which need not exist.
  std::string file(const std::string& name) const;

  // Creates or replaces a file; its path.
  std::string write(const std::string& name, const std::string& bytes) const;

  std::string read(const std::string& name) const;
  std::string makeDirectory(const std::string& name) const;
};

}  // namespace velmora::mobile::xplat::cellar::fuzz
