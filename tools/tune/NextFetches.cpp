#include "tune/NextFetches.h"

#include <algorithm>

#include "tune/SimulatedCache.h"
#include "tune/Trace.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr std::size_t kBlock = 4096;
constexpr std::uint64_t kNever = SimulatedCache::kNever;

}  // namespace

NextFetches::NextFetches(const Trace& trace) : count_(trace.accesses()) {
  std::vector<std::uint64_t> fetches(static_cast<std::size_t>(trace.keys()), kNever);  // by key
  std::uint64_t cleared = kNever;                                                      // the earliest so far
  std::vector<std::uint64_t> block(kBlock);
  trace.replayBackwards([&](std::uint64_t number, const Access& access) {
    const std::size_t place = number % kBlock;
    block[place] = kNever;
    if (access.kind == AccessKind::Clear) {
      cleared = number;
    } else {
      std::uint64_t& fetch = fetches[access.key];
      if (fetch < cleared) block[place] = fetch;
      fetch = access.kind == AccessKind::Fetch ? number : kNever;
    }
    const std::uint64_t first = number - place;
    if (place != 0) return;
    const auto size = static_cast<std::size_t>(std::min<std::uint64_t>(kBlock, count_ - first));
    file_.writeAt(first * sizeof(std::uint64_t), block.data(), size * sizeof(std::uint64_t));
  });
}

std::uint64_t NextFetches::Reader::next() {
  if (used_ == block_.size()) {
    block_.resize(static_cast<std::size_t>(std::min<std::uint64_t>(kBlock, from_.count_ - read_)));
    from_.file_.readAt(read_ * sizeof(std::uint64_t), block_.data(), block_.size() * sizeof(std::uint64_t));
    read_ += block_.size();
    used_ = 0;
  }
  return block_[used_++];
}

}  // namespace velmora::mobile::xplat::cellar::tools
