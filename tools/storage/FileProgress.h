#pragma once

#include <cstdint>
#include <memory>
#include <string>

namespace velmora::mobile::xplat::cellar::tools {

class Console;
class Progress;

// A bar over the files of a tree while they are looked at, on a terminal. Elsewhere nothing is counted or printed.
class FileProgress {
 public:
  FileProgress(Console& console, const std::string& root);
  ~FileProgress();
  FileProgress(const FileProgress&) = delete;
  FileProgress& operator=(const FileProgress&) = delete;

  void advance(std::uint64_t bytes);  // by one file

 private:
  std::unique_ptr<Progress> progress_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
