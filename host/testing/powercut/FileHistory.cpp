#include "host/testing/powercut/FileHistory.h"

#include <algorithm>

namespace velmora::mobile::xplat::cellar::test {

namespace {

using Bytes = FileHistory::Bytes;
constexpr std::size_t kSectorSize = FileHistory::kSectorSize;

void extendTo(std::size_t size, Bytes& content) {
  if (content.size() < size) content.resize(size);
}

std::size_t startOfSector(std::size_t position) { return position / kSectorSize * kSectorSize; }

void copyRange(std::size_t begin, std::size_t end, const Bytes& from, Bytes& to) {
  extendTo(end, to);
  const auto offset = static_cast<std::ptrdiff_t>(begin);
  std::copy(from.begin() + offset, from.begin() + static_cast<std::ptrdiff_t>(end), to.begin() + offset);
}

// A medium writes whole sectors, out of a cache that has seen all earlier changes: those to the same sector come along.
void copySector(std::size_t begin, const Bytes& cache, Bytes& disk) {
  copyRange(begin, std::min(begin + kSectorSize, cache.size()), cache, disk);
}

}  // namespace

void FileHistory::write(std::size_t offset, const Bytes& bytes) {
  if (bytes.empty()) return;
  pending_.push_back({false, offset, bytes});
  apply(pending_.back(), current_);
}

void FileHistory::truncate(std::size_t size) {
  if (size == current_.size()) return;
  pending_.push_back({true, size, {}});
  apply(pending_.back(), current_);
}

void FileHistory::sync() {
  if (pending_.empty()) return;
  durable_ = current_;
  pending_.clear();
}

FileHistory::Bytes FileHistory::afterPowerCut(Random& random) const {
  Bytes cache = durable_;
  Bytes disk = durable_;
  const Random::Luck luck = random.luck();
  for (const Change& change : pending_) {
    apply(change, cache);
    const bool comesThrough = random.succeeds(luck);
    if (change.isTruncation) {
      if (comesThrough) apply(change, disk);
    } else if (comesThrough) {
      const std::size_t end = change.position + change.bytes.size();
      for (std::size_t at = startOfSector(change.position); at < end; at += kSectorSize) copySector(at, cache, disk);
    } else if (luck != Random::kNothing) {
      carryPart(change, cache, disk, random);
    }
  }
  return disk;
}

void FileHistory::apply(const Change& change, Bytes& content) {
  if (change.isTruncation) return content.resize(change.position);
  extendTo(change.position + change.bytes.size(), content);
  std::copy(change.bytes.begin(), change.bytes.end(), content.begin() + static_cast<std::ptrdiff_t>(change.position));
}

// A write that has not come through as a whole: nothing, its beginning, some sectors, or the size alone.
void FileHistory::carryPart(const Change& change, const Bytes& cache, Bytes& disk, Random& random) {
  const std::size_t end = change.position + change.bytes.size();
  const std::size_t start = startOfSector(change.position);
  switch (random.below(4)) {
    case 0:
      return copyRange(start, change.position + random.below(change.bytes.size()), cache, disk);
    case 1:
      for (std::size_t at = start; at < end; at += kSectorSize) {
        if (random.below(2) == 0) copySector(at, cache, disk);
      }
      return;
    case 2:
      return extendTo(end, disk);
    default:
      return;
  }
}

}  // namespace velmora::mobile::xplat::cellar::test
