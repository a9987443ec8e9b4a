#pragma once

#include <cstddef>
#include <vector>

#include <cellar/host/testing/powercut/Random.h>

namespace velmora::mobile::xplat::cellar::test {

// What a file contains, what of it is durable, and all that has happened to it since it was last synced. Not
// thread-safe.
class FileHistory {
 public:
  using Bytes = std::vector<unsigned char>;

  static constexpr std::size_t kSectorSize = 512;

  // Where the file ends before `offset`, the bytes between are zeros.
  void write(std::size_t offset, const Bytes& bytes);

  // Cuts the file, or extends it with zeros.
  void truncate(std::size_t size);

  // Makes the present content durable.
  void sync();

  const Bytes& current() const { return current_; }

  // What the file may contain after a power cut: of each change since the last sync, all, a part or nothing has come
  // through, whatever has become of the others.
  Bytes afterPowerCut(Random& random) const;

 private:
  // A write of `bytes` at `position`, or a truncation to `position` bytes.
  struct Change {
    bool isTruncation;
    std::size_t position;
    Bytes bytes;
  };

  static void apply(const Change& change, Bytes& content);
  static void carryPart(const Change& change, const Bytes& cache, Bytes& disk, Random& random);

  Bytes current_;
  Bytes durable_;
  std::vector<Change> pending_;
};

}  // namespace velmora::mobile::xplat::cellar::test
