#pragma once

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <memory>

namespace velmora::mobile::xplat::cellar::tools {

// A file without a name, which is removed with the object. Throws `InputError` when the disk is full or fails.
class TemporaryFile {
 public:
  TemporaryFile();
  TemporaryFile(const TemporaryFile&) = delete;
  TemporaryFile& operator=(const TemporaryFile&) = delete;
  ~TemporaryFile();

  void append(const void* data, std::size_t size);
  void writeAt(std::uint64_t offset, const void* data, std::size_t size);

  // What has been written before. Several threads at once may call this, when none writes.
  void readAt(std::uint64_t offset, void* data, std::size_t size) const;

 private:
  struct CloseFile {
    void operator()(std::FILE* file) const;
  };

  std::unique_ptr<std::FILE, CloseFile> file_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
