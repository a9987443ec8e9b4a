#include "tune/Trace.h"

#include <algorithm>
#include <limits>

#include "InputError.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

// So that no sum of sizes exceeds 64 bits, nor an estimate from the sums of a sample of that rate.
void addUp(std::int64_t& sum, std::int64_t size, double rate) {
  const auto most = static_cast<std::int64_t>(0x1p60 * rate);
  if (size > most - sum) throw InputError("the sizes add up to more than can be counted");
  sum += size;
}

constexpr std::size_t kBlock = 4096;  // accesses that are read together

std::vector<Access> blockFor(std::uint64_t accesses) {
  return std::vector<Access>(static_cast<std::size_t>(std::min<std::uint64_t>(kBlock, accesses)));
}

}  // namespace

void Trace::append(const std::string& key, Access access) {
  noteDate(access.date);
  if (access.kind == AccessKind::Fetch) ++requests_;
  if (!sample_.has(key)) return;
  access.key = numberOf(key);
  if (access.size != Access::kUnknownSize) {
    addUp(bytes_, access.size, sample_.rate());
    if (firstSizes_[access.key] == Access::kUnknownSize) firstSizes_[access.key] = access.size;
  }
  hasMetadata_ = hasMetadata_ || access.itemType != Access::kNoMetadata;
  keep(access);
}

void Trace::appendClear(std::int64_t date) {
  Access access;
  access.kind = AccessKind::Clear;
  access.key = Access::kNoKey;
  access.date = date;
  access.size = 0;
  noteDate(date);
  keep(access);
}

void Trace::mayBeEmpty(const std::string& key) {
  if (sample_.has(key)) mayBeEmpty_[numberOf(key)] = true;
}

void Trace::replay(const std::function<void(const Access&)>& visit) const {
  std::vector<std::int64_t> sizes = startingSizes();
  std::vector<Access> block = blockFor(accesses_);
  std::int64_t bytes = 0;
  for (std::uint64_t first = 0; first < accesses_; first += kBlock) {
    const std::size_t count = readBlock(first, block);
    for (std::size_t i = 0; i < count; ++i) {
      Access& access = block[i];
      if (access.kind != AccessKind::Clear) {
        if (access.size == Access::kUnknownSize) access.size = sizes[access.key];
        sizes[access.key] = access.size;
        addUp(bytes, access.size, sample_.rate());
      }
      visit(access);
    }
  }
}

void Trace::replayBackwards(const std::function<void(std::uint64_t, const Access&)>& visit) const {
  std::vector<Access> block(kBlock);
  for (std::uint64_t first = (accesses_ + kBlock - 1) / kBlock * kBlock; first > 0;) {
    first -= kBlock;
    for (std::size_t i = readBlock(first, block); i-- > 0;) visit(first + i, block[i]);
  }
}

std::uint64_t Trace::keysOfUnknownSize() const {
  std::uint64_t count = 0;
  for (std::size_t key = 0; key < firstSizes_.size(); ++key) {
    if (firstSizes_[key] == Access::kUnknownSize && !mayBeEmpty_[key]) ++count;
  }
  return count;
}

std::int64_t Trace::assumedSize() const {
  if (assumedSize_ != Access::kUnknownSize) return assumedSize_;
  std::int64_t sum = 0;
  std::int64_t count = 0;
  for (const std::int64_t size : firstSizes_) {
    if (size == Access::kUnknownSize) continue;
    sum += size;
    ++count;
  }
  return count == 0 ? 0 : sum / count;
}

std::int64_t Trace::seconds() const { return std::max<std::int64_t>(0, lastDate_ - firstDate_); }

std::uint32_t Trace::numberOf(const std::string& key) {
  const auto [found, isNew] = numbers_.emplace(key, static_cast<std::uint32_t>(firstSizes_.size()));
  if (isNew) {
    constexpr std::size_t mostKeys = std::numeric_limits<std::uint32_t>::max() / 4;
    if (firstSizes_.size() >= mostKeys) throw InputError("there are too many keys");
    firstSizes_.push_back(Access::kUnknownSize);
    mayBeEmpty_.push_back(false);
    if (!sample_.isWhole()) putIntoGroup(key);
  }
  return found->second;
}

void Trace::putIntoGroup(const std::string& key) {
  const std::size_t group = KeySample::hashOf(key) % kGroups;
  groups_.push_back(static_cast<std::uint8_t>(group));
  numbersInGroup_.push_back(keysOfGroup_[group]++);
}

void Trace::noteDate(std::int64_t date) {
  if (!hasDate_) firstDate_ = date;
  hasDate_ = true;
  lastDate_ = date;
}

std::vector<std::int64_t> Trace::startingSizes() const {
  std::vector<std::int64_t> sizes = firstSizes_;
  const std::int64_t assumed = assumedSize();
  for (std::size_t key = 0; key < sizes.size(); ++key) {
    if (sizes[key] == Access::kUnknownSize) sizes[key] = mayBeEmpty_[key] ? 0 : assumed;
  }
  return sizes;
}

void Trace::keep(const Access& access) {
  file_.append(&access, sizeof access);
  ++accesses_;
}

// How many there are.
std::size_t Trace::readBlock(std::uint64_t first, std::vector<Access>& block) const {
  const auto count = static_cast<std::size_t>(std::min<std::uint64_t>(block.size(), accesses_ - first));
  file_.readAt(first * sizeof(Access), block.data(), count * sizeof(Access));
  return count;
}

}  // namespace velmora::mobile::xplat::cellar::tools
