#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

#include "demo/SourceFiles.h"
#include "demo/Trees.h"

namespace velmora::mobile::xplat::cellar::tools {

class Progress;

// Writes files into directories as an application would: with the standard library, past the library that is shown.
// What cannot be written throws `std::runtime_error` with the path and the reason.
class FileWriter {
 public:
  // `progress` is told of every file.
  explicit FileWriter(Progress& progress);

  // Copies one file under its name into `directory`. A source that has become unreadable or shorter since it was
  // listed counts as far as it could be read.
  TreeSize copy(const SourceFiles::File& file, const std::string& directory);

  // Writes a picture of `bytes` bytes, made by repeating the content of `file`, blank when it is empty.
  TreeSize render(const SourceFiles::File& file, std::size_t bytes, const std::string& path);

 private:
  TreeSize noted(std::uint64_t bytes);

  Progress& progress_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
