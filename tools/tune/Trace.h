#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>
#include <unordered_map>
#include <vector>

#include "tune/Access.h"
#include "tune/KeySample.h"
#include "tune/TemporaryFile.h"

namespace velmora::mobile::xplat::cellar::tools {

// The accesses to one cache, in order. They are kept in a temporary file, which has no name and is removed with the
// trace, so that memory is needed for the keys only; with a sample, for those in it only.
class Trace {
 public:
  explicit Trace(const KeySample& sample = KeySample()) : sample_(sample) {}

  // Appends an access; its `key` is filled in here. One of a key that is not in the sample is counted, but not kept.
  // Throws `InputError` when there is no room for it.
  void append(const std::string& key, Access access);

  // Appends that all items are removed.
  void appendClear(std::int64_t date);

  // For a key that was found without a size: if none of its accesses has a size, it is 0.
  void mayBeEmpty(const std::string& key);

  // Bytes of an item of which no access has a size; without it, the mean of all others.
  void assumeSize(std::int64_t bytes) { assumedSize_ = bytes; }

  // Calls `visit` with each access, every size filled in: if it is not known, from the last access of the key before
  // it, or else from the first one after it. Throws `InputError` when the file cannot be read again, or the sizes add
  // up to more than can be counted. Several threads at once may call this, when none appends.
  void replay(const std::function<void(const Access&)>& visit) const;

  // From the last to the first, with their numbers, from 0. Sizes are as they were appended.
  void replayBackwards(const std::function<void(std::uint64_t, const Access&)>& visit) const;

  // The keys of a sample in groups by hash, each of which is a smaller sample: how far these differ says how sure a
  // figure is. In each group, keys are numbered from 0. Without a sample there are no groups.
  struct GroupedKey {
    std::size_t group = 0;
    std::uint32_t number = 0;
  };
  static constexpr std::size_t kGroups = 10;
  GroupedKey groupedKey(std::uint32_t key) const { return {groups_[key], numbersInGroup_[key]}; }

  bool isEmpty() const { return !hasDate_; }  // nothing was appended, not even of another key
  const KeySample& sample() const { return sample_; }
  std::uint64_t requests() const { return requests_; }  // fetches, of all keys

  // Of what is kept.
  std::uint64_t accesses() const { return accesses_; }
  std::uint64_t keys() const { return firstSizes_.size(); }
  std::uint64_t keysOfUnknownSize() const;
  std::int64_t assumedSize() const;  // bytes
  std::int64_t seconds() const;      // between the first and the last date
  bool hasMetadata() const { return hasMetadata_; }

 private:
  std::uint32_t numberOf(const std::string& key);
  void putIntoGroup(const std::string& key);
  void noteDate(std::int64_t date);
  std::vector<std::int64_t> startingSizes() const;
  void keep(const Access& access);
  std::size_t readBlock(std::uint64_t first, std::vector<Access>& block) const;

  const KeySample sample_;
  TemporaryFile file_;
  std::unordered_map<std::string, std::uint32_t> numbers_;
  std::vector<std::int64_t> firstSizes_;       // by key; the first known one
  std::vector<bool> mayBeEmpty_;               // by key
  std::vector<std::uint8_t> groups_;           // by key
  std::vector<std::uint32_t> numbersInGroup_;  // by key
  std::array<std::uint32_t, kGroups> keysOfGroup_ = {};
  std::uint64_t requests_ = 0;
  std::uint64_t accesses_ = 0;
  std::int64_t bytes_ = 0;
  std::int64_t assumedSize_ = Access::kUnknownSize;
  bool hasDate_ = false;
  std::int64_t firstDate_ = 0;
  std::int64_t lastDate_ = 0;
  bool hasMetadata_ = false;
};

}  // namespace velmora::mobile::xplat::cellar::tools
